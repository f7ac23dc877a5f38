// The one command entry for every drive command, whatever the channel's
// transport, and the control codes of the maker's button filter driver.
#pragma once

#include "platform/win32.h"
#include "transport/channel_record.h"

constexpr DWORD CTL_SET_GAUGE = 0x222040;
constexpr DWORD CTL_WAIT_GAUGE_EVENT = 0x222048;
constexpr DWORD CTL_QUIESCE = 0x222050;
constexpr DWORD CTL_CLEAR_GAUGE_EVENT = 0x222054;
constexpr DWORD CTL_WAIT_EVENT = 0x223C04;
constexpr DWORD CTL_SET_STATE_B = 0x223C08;
constexpr DWORD CTL_SET_STATE = 0x223C0C;
constexpr DWORD CTL_GET_IDENTITY = 0x223C10;
constexpr DWORD CTL_EJECT_NOTICE = 0x223C14;
constexpr DWORD CTL_NOTICE_2 = 0x223C18;
constexpr DWORD CTL_CLEAR_EVENT = 0x223C1C;
constexpr DWORD CTL_EVENT_REPLY = 0x223C20;
constexpr DWORD CTL_WORKER_START = 0x223C24;
constexpr DWORD CTL_NOTICE_8 = 0x223C28;

// How long a HID write or driver control may stay pending before it is
// cancelled and reported as failed.
constexpr DWORD kCommandCompletionMs = 100;

// Sends one command with a 16-bit value over the channel's transport: a
// driver control, a HID output report or an enclosure diagnostic page.
// 1 on success, 0 on failure (the cause is the thread's last error).
// abortEvent (may be null) cuts enclosure transfers short.
DWORD SendDriveCommand(ChannelRecord* channel, DWORD controlCode, WORD value, HANDLE abortEvent);
// The dispatcher: sending codes take their value from buffer (byte codes the
// first byte, word codes the first two, little-endian; 0 without data), the
// event-wait codes store the event byte in buffer[0] and return 1, the
// identity code reads the identity into buffer. 0 for a null channel and for
// codes it does not accept (CTL_NOTICE_2 among them).
DWORD DriveCommand(ChannelRecord* channel, DWORD controlCode, BYTE* buffer, DWORD length,
                   HANDLE abortEvent);
// The value a HID channel in gauge mode sends for a command value.
WORD TranslateHidCommandValue(WORD value);
