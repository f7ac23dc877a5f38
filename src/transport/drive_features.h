// Capacity gauge and drive-gone commands.
#pragma once

#include "discovery/drive_record.h"
#include "platform/win32.h"
#include "transport/channel_record.h"

void UpdateCapacityGauge(DriveRecord* drive, ChannelRecord* channel, HANDLE abortEvent);
// For the channel with that index, when linked, updates its drive's gauge.
void RefreshChannelGauge(int channelIndex, HANDLE abortEvent);
// 0 when nothing was sent (null record or already sent), else the sender's result.
DWORD SendDriveGone(ChannelRecord* channel);
// channel null: the drive's own channelIndex selects it. Always 1.
DWORD SendDriveGoneFor(DriveRecord* drive, ChannelRecord* channel);
