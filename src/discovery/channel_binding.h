// Binding a channel record to its drive record.
#pragma once

#include "discovery/drive_record.h"
#include "platform/win32.h"
#include "transport/channel_record.h"

// Index of the drive record the channel belongs to, or -1. recordCopy (may be
// null) receives a copy of that record; allowCreate 1 lets the channel make a
// record of its own. Mutex held.
LONG BindChannelToDrive(ChannelRecord* channel, DriveRecord* recordCopy, BYTE allowCreate);
