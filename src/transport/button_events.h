// The button-event wait of the channel workers and the drive identity query.
#pragma once

#include "platform/win32.h"
#include "transport/channel_record.h"

// Button event byte: 0xFF and 0 carry no event.
constexpr BYTE kNoButtonEvent = 0xFF;
constexpr BYTE kButtonPanelEvent1 = 0x01;
constexpr BYTE kButtonPanelEvent2 = 0x02;
constexpr BYTE kButtonRemovalRequest = 0x04;

// Waits on the channel's device handle for the next button event (HID input
// report, driver event wait, or one poll of an enclosure's event page).
// Returns the event byte, 0xFF on failure or when the workers are told to
// stop; the thread's last error is the one the wait ended with (6, 1167 and
// 55 mean the device is gone). Called without the state mutex.
BYTE ReadButtonEvent(ChannelRecord* channel);
// HID channels: the serial-number string into buffer (128 UTF-16 units,
// whatever length says) and into the record's identity text; 1 when read.
// Driver channels: the 64-bit identity as 16 hexadecimal digits into at most
// length / 2 units of buffer (nothing below 2 bytes); 0. Others: 0.
DWORD ReadDriveIdentity(ChannelRecord* channel, BYTE* buffer, DWORD length);
