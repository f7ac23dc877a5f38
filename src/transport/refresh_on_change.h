// Refresh requests for conditions of a drive that a rescan may mend (no
// volume letters yet, no way to reach its status page). Each condition asks
// for one refresh when it starts to hold for a drive, not again on every
// pass while it goes on holding, so a drive that stays so cannot keep the
// monitor rescanning.
#pragma once

#include "discovery/drive_record.h"
#include "platform/win32.h"

enum RefreshCondition : DWORD {
  kRefreshNoVolumes = 0x1,     // linked drive without volume letters
  kRefreshNoStatusPath = 0x2,  // neither a control path nor a HID path
  kRefreshOpenFails = 0x4,     // its control or HID path does not open
};

// Records whether `conditions` hold for the drive now and calls
// RequestRefresh() when one of them has just begun to hold. Drives are told
// apart by their disk, channel, HID or control path, else their serial. Takes no lock of the
// caller's; may take the state mutex (RequestRefresh).
void NoteRefreshConditions(const DriveRecord* drive, DWORD conditions, bool hold);

// Forgets every condition seen (a new state block starts afresh anyway).
void ForgetRefreshConditions();
