// Capacity gauge and drive-gone commands.
#pragma once

#include "discovery/drive_record.h"
#include "platform/win32.h"
#include "transport/channel_record.h"

// Gauge patterns sent with CTL_SET_GAUGE: bit 15 marks a pattern, the high
// byte's low six bits are the segments lit from the first. Index 6 holds none.
inline constexpr WORD kGaugePatterns[7] = {0x8100, 0x8300, 0x8700, 0x8F00, 0x9F00, 0xBF00, 0x0000};
// Passes the monitor idles after a drive-gone command.
constexpr DWORD kDriveGoneSkipTicks = 10;

// The used-space percentage of the drive's volumes (0 when none is readable).
DWORD UsedSpacePercent(const DriveRecord* drive);
// The gauge pattern for a used percentage on a gauge of `segments` (0: none).
WORD GaugePattern(DWORD usedPercent, DWORD segments);
// Computes the drive's used space and, when it changed since the last time,
// stores it (channel and working drive record) and sends the pattern to gauge
// and enclosure channels. Mutex held.
void UpdateCapacityGauge(DriveRecord* drive, ChannelRecord* channel, HANDLE abortEvent);
// For the channel with that index, when linked, updates its drive's gauge.
void RefreshChannelGauge(int channelIndex, HANDLE abortEvent);
// 0 when nothing was sent (null record or already sent), else the sender's
// result. Mutex held.
DWORD SendDriveGone(ChannelRecord* channel);
// The channel's shared device handle belongs to the channel's worker while
// one runs: only that thread closes it. Called by the worker, or when no
// worker runs, this closes the handle, if open, and clears the field; from
// any other thread it asks the worker to close it at its next wait and
// returns at once. Mutex held.
void CloseChannelDevice(ChannelRecord* channel);
// The calling thread is the channel's worker and owns its device handle.
void ClaimChannelDevice(ChannelRecord* channel);
// Drops a close asked of the worker (a worker starting afresh, or a removal
// that failed and keeps the channel); true when one was pending. Mutex held.
bool WithdrawChannelClose(ChannelRecord* channel);
// Whether another thread asked the channel's worker to close its handle.
// Read without the mutex, so that a wait can end on it.
bool ChannelCloseRequested(const ChannelRecord* channel);
// channel null: the drive's own channelIndex selects it. Always 1.
DWORD SendDriveGoneFor(DriveRecord* drive, ChannelRecord* channel);
