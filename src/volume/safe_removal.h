// Safe removal of a drive: volumes offline, device node ejected, drive-gone
// command, channel unlinked.
#pragma once

#include "discovery/drive_record.h"
#include "transport/channel_record.h"

// 1 when the drive was removed, 0 when not. drive is a private copy; mutex
// held. The channel is bound to its drive afresh first: a copy taken before
// the drive list was read again is replaced by the channel's drive, and a
// channel without a listed drive, or a drive without a device ID, removes
// nothing.
int SafeRemoveDrive(DriveRecord* drive, ChannelRecord* channel);
