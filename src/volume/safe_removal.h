// Safe removal of a drive: volumes offline, device node ejected, drive-gone
// command, channel unlinked.
#pragma once

#include "discovery/drive_record.h"
#include "transport/channel_record.h"

// 1 when the drive was removed, 0 when not. drive is a private copy; mutex held.
int SafeRemoveDrive(DriveRecord* drive, ChannelRecord* channel);
