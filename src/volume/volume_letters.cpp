// Ties each mounted fixed or removable volume to the drive record whose disk
// carries it, by the storage stack's device number.
#include "volume/volume_letters.h"

#include "discovery/disk_number.h"
#include "monitor/monitor_state.h"

namespace {

// The record of the disk with this device number, or null.
DriveRecord* DriveOfDisk(StateBlock* block, DWORD diskNumber) {
  for (LONG i = 0; i < block->driveCount && i < kMaxDrives; ++i) {
    // A record whose number was never read matches no volume, whatever the
    // volume reports.
    if (DiskNumberRead(i) && block->drives[i].diskNumber == diskNumber) return &block->drives[i];
  }
  return nullptr;
}

}  // namespace

void AssignVolumeLetters() {
  StateBlock* block = monitorState.stateBlock;
  if (block == nullptr) return;
  const DWORD mask = GetLogicalDrives();
  for (int bit = 2; bit <= 25; ++bit) {
    if ((mask & (1u << bit)) == 0) continue;
    const WCHAR letter = static_cast<WCHAR>(WSTR('A') + bit);
    const WCHAR root[] = {letter, WSTR(':'), WSTR('\\'), 0};
    const UINT type = GetDriveTypeW(root);
    if (type != DRIVE_FIXED && type != DRIVE_REMOVABLE) continue;
    const WCHAR device[] = {WSTR('\\'), WSTR('\\'), WSTR('.'), WSTR('\\'), letter, WSTR(':'), 0};
    const HANDLE volume =
        CreateFileW(device, GENERIC_READ | GENERIC_WRITE, FILE_SHARE_READ | FILE_SHARE_WRITE,
                    nullptr, OPEN_EXISTING, 0, nullptr);
    if (volume == INVALID_HANDLE_VALUE) continue;
    STORAGE_DEVICE_NUMBER number{};
    DWORD bytes = 0;
    if (DeviceIoControl(volume, IOCTL_STORAGE_GET_DEVICE_NUMBER, nullptr, 0, &number,
                        sizeof(number), &bytes, nullptr)) {
      DriveRecord* drive = DriveOfDisk(block, number.DeviceNumber);
      // At most 24 letters exist (C to Z), so the 26-unit field stays terminated.
      if (drive != nullptr && drive->volumeCount < 25) {
        drive->volumeLetters[drive->volumeCount] = letter;
        drive->volumeCount += 1;
        drive->volumeDriveType = type;
      }
    }
    CloseHandle(volume);
  }
}
