// Taking a drive's volumes offline before it is ejected. All three run with
// the state mutex held by their callers.
#pragma once

#include "discovery/drive_record.h"
#include "platform/win32.h"

constexpr DWORD kDismountRetryPauseMs = 1000;

// 1 when every volume of the drive was taken offline (or it has none), 0 at
// the first volume that stays online.
int DismountDriveVolumes(const DriveRecord* drive);
// 1 when the volume of the letter was taken offline or holds no medium (the
// drive list is then marked stale), else 0.
int DismountVolume(WCHAR letter);
// Medium check, lock, dismount, unlock on a volume opened for overlapped
// I/O (each control is given up at the device time-out or a stop); nonzero on
// success or when the medium check finds no medium (not ready, no media);
// any other failure of the check fails. A failed lock or dismount costs a
// pause of 1000 ms.
int LockAndDismount(HANDLE volume);
