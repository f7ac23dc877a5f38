#include "volume/dismount.h"

#include "monitor/monitor_state.h"
#include "platform/wide.h"
#include "service/service_host.h"
#include "transport/pass_through.h"

namespace {

constexpr DWORD kErrorNoMediaInDrive = 1112;  // ERROR_NO_MEDIA_IN_DRIVE

// A control without buffers on the overlapped volume handle, given up when
// the volume does not answer within the device time-out or the service stops:
// the callers hold the state mutex.
bool PlainControl(HANDLE volume, DWORD code) {
  return IoControlWait(volume, code, nullptr, 0, nullptr, 0, nullptr, monitorState.stopEvent);
}

}  // namespace

int DismountDriveVolumes(const DriveRecord* drive) {
  const std::size_t count = WideLength(drive->volumeLetters, 26);
  for (std::size_t i = 0; i < count; ++i) {
    if (DismountVolume(drive->volumeLetters[i]) == 0) return 0;
  }
  return 1;
}

int DismountVolume(WCHAR letter) {
  if ((GetVersion() & 0x80000000u) != 0) return 0;
  const WCHAR root[] = {letter, WSTR(':'), WSTR('\\'), 0};
  const UINT type = GetDriveTypeW(root);
  if (type != DRIVE_REMOVABLE && type != DRIVE_FIXED) {
    ConsolePrint(WSTR("Cannot eject.  Drive type is incorrect.\r\n"));
    return 0;
  }
  const WCHAR device[] = {WSTR('\\'), WSTR('\\'), WSTR('.'), WSTR('\\'), letter, WSTR(':'), 0};
  const HANDLE volume =
      CreateFileW(device, GENERIC_READ | GENERIC_WRITE, FILE_SHARE_READ | FILE_SHARE_WRITE, nullptr,
                  OPEN_EXISTING, FILE_FLAG_OVERLAPPED, nullptr);
  if (volume == INVALID_HANDLE_VALUE) return 0;
  const int dismounted = LockAndDismount(volume);
  if (!CloseHandle(volume)) return 0;
  return dismounted != 0 ? 1 : 0;
}

int LockAndDismount(HANDLE volume) {
  if (!PlainControl(volume, IOCTL_STORAGE_CHECK_VERIFY)) {
    const DWORD error = GetLastError();
    if (error != ERROR_NOT_READY && error != kErrorNoMediaInDrive) {
      // Anything but a missing medium may leave the volume mounted.
      return 0;
    }
    // No medium to take offline: done, but the drive list no longer holds.
    monitorState.driveListStale = 1;
    return 1;
  }
  if (!PlainControl(volume, FSCTL_LOCK_VOLUME)) {
    Sleep(kDismountRetryPauseMs);
    return 0;
  }
  const bool dismounted = PlainControl(volume, FSCTL_DISMOUNT_VOLUME);
  PlainControl(volume, FSCTL_UNLOCK_VOLUME);
  if (dismounted) return 1;
  Sleep(kDismountRetryPauseMs);
  return 0;
}
