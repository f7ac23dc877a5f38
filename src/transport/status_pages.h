// The drive's status page, sleep state and control block, through the
// drive's control interface (diagnostic pages) or its HID collection (input
// and output reports). All are called with the state mutex held; a drive
// that cannot be opened asks for a full rescan.
#pragma once

#include "discovery/drive_record.h"
#include "platform/win32.h"

// Every transfer is given up when the drive has not answered within the
// device time-out, or at once when abortEvent (may be null) is signalled;
// the event also cuts short the pause after a failed read. Callers pass
// their stop event, so a drive that hangs never keeps the mutex held past a
// stop.
// Status code 0 to 8; page[8] holds the status page (zeroed first).
DWORD ReadDriveStatus(const DriveRecord* drive, BYTE* page, HANDLE abortEvent = nullptr);
// Sleep state 0, 2 or 3; page[5] is zeroed first.
DWORD ReadSleepState(const DriveRecord* drive, BYTE* page, HANDLE abortEvent = nullptr);
// 0 on success, a Win32 error, or 0xFFFFFFFF when the drive did not open.
DWORD WriteDriveControl(const DriveRecord* drive, const BYTE* control, HANDLE abortEvent = nullptr);

// The status code of a status page (0 unless byte 0 is 0x82).
DWORD StatusCodeOfPage(const BYTE* page);
