// Minimal form: no drive is reached yet, so every drive answers as one that
// gave no answer (status 0, sleep state 3, control write not opened).
#include "transport/status_pages.h"

#include <cstring>

DWORD ReadDriveStatus(const DriveRecord*, BYTE* page) {
  std::memset(page, 0, 8);
  return 0;
}

DWORD ReadSleepState(const DriveRecord*, BYTE* page) {
  std::memset(page, 0, 5);
  return 3;
}

DWORD WriteDriveControl(const DriveRecord*, const BYTE*) {
  return 0xFFFFFFFF;
}
