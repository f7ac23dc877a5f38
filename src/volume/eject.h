// Ejecting a drive's device node through the configuration manager.
#pragma once

#include "discovery/drive_record.h"
#include "platform/win32.h"
#include "transport/channel_record.h"

// Drive record busKind values.
constexpr DWORD kBusKindUsb = 2;
constexpr DWORD kBusKindIeee1394 = 3;

constexpr int kEjectAttempts = 4;
constexpr DWORD kEjectRetryPauseMs = 100;
constexpr DWORD kEjectNoticePauseMs = 200;
// The byte sent with CTL_EJECT_NOTICE before a parent node is ejected.
constexpr BYTE kEjectNoticeValue = 0x20;

// Opens the channel's device again (overlapped) after it was closed for a
// removal that then failed; the handle stays null when the open fails. A
// close that was only asked of the channel's worker is withdrawn instead.
void ReopenChannelDevice(ChannelRecord* channel);

// 1 when the Plug and Play manager accepted the removal of the drive's node
// without a veto, else 0 (also, without any call, for an empty device
// ID, which would name the root of the device tree). Mutex held. A channel handle closed on the way
// is opened again when the eject fails.
int EjectDriveDevice(const DriveRecord* drive, ChannelRecord* channel);
