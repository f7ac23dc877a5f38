// The drive's status page, sleep state and control block. All are called
// with the state mutex held.
#pragma once

#include "discovery/drive_record.h"
#include "platform/win32.h"

// Status code 0 to 8; page[8] holds the status page (zeroed first).
DWORD ReadDriveStatus(const DriveRecord* drive, BYTE* page);
// Sleep state 0, 2 or 3; page[5] is zeroed first.
DWORD ReadSleepState(const DriveRecord* drive, BYTE* page);
// 0 on success, a Win32 error, or 0xFFFFFFFF when the drive did not open.
DWORD WriteDriveControl(const DriveRecord* drive, const BYTE* control);
