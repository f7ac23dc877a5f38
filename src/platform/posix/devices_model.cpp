// The installed device model, the OS version and the drive-letter calls.
#include <atomic>
#include <mutex>

#include "platform/posix/device_model.h"
#include "platform/win32.h"

// The storage and HID codes, checked against their definitions.
static_assert(IOCTL_SCSI_PASS_THROUGH_DIRECT == CTL_CODE(FILE_DEVICE_CONTROLLER, 0x405,
                                                         METHOD_BUFFERED,
                                                         FILE_READ_ACCESS | FILE_WRITE_ACCESS));
static_assert(IOCTL_STORAGE_GET_DEVICE_NUMBER ==
              CTL_CODE(FILE_DEVICE_MASS_STORAGE, 0x420, METHOD_BUFFERED, FILE_ANY_ACCESS));
static_assert(IOCTL_STORAGE_CHECK_VERIFY ==
              CTL_CODE(FILE_DEVICE_MASS_STORAGE, 0x200, METHOD_BUFFERED, FILE_READ_ACCESS));
static_assert(FSCTL_LOCK_VOLUME ==
              CTL_CODE(FILE_DEVICE_FILE_SYSTEM, 6, METHOD_BUFFERED, FILE_ANY_ACCESS));
static_assert(FSCTL_UNLOCK_VOLUME ==
              CTL_CODE(FILE_DEVICE_FILE_SYSTEM, 7, METHOD_BUFFERED, FILE_ANY_ACCESS));
static_assert(FSCTL_DISMOUNT_VOLUME ==
              CTL_CODE(FILE_DEVICE_FILE_SYSTEM, 8, METHOD_BUFFERED, FILE_ANY_ACCESS));
static_assert(emu::kHidIoctlGetSerialNumberString == IOCTL_HID_GET_SERIALNUMBER_STRING &&
              emu::kHidIoctlGetSerialNumberString ==
                  CTL_CODE(FILE_DEVICE_KEYBOARD, 112, METHOD_OUT_DIRECT, FILE_ANY_ACCESS));
static_assert(emu::kHidIoctlGetInputReport == IOCTL_HID_GET_INPUT_REPORT &&
              emu::kHidIoctlGetInputReport ==
                  CTL_CODE(FILE_DEVICE_KEYBOARD, 104, METHOD_OUT_DIRECT, FILE_ANY_ACCESS));

namespace emu {
namespace {

std::atomic<DeviceModel*> installedModel{nullptr};
std::atomic<DeviceModelFactory> defaultFactory{nullptr};
std::mutex installMutex;

// Upper-case drive letter of a path that starts with "X:", or 0.
WCHAR DriveLetterOf(LPCWSTR path) {
  if (path == nullptr) return 0;
  WCHAR c = path[0];
  if (c >= u'a' && c <= u'z') c = static_cast<WCHAR>(c - u'a' + u'A');
  if (c < u'A' || c > u'Z' || path[1] != u':') return 0;
  return c;
}

}  // namespace

void SetDeviceModel(DeviceModel* model) {
  std::lock_guard<std::mutex> lock(installMutex);
  installedModel.store(model);
  SetDeviceProvider(model);
}

DeviceModel* ActiveDeviceModel() {
  DeviceModel* model = installedModel.load();
  if (model != nullptr) return model;
  DeviceModelFactory factory = defaultFactory.load();
  if (factory == nullptr) return nullptr;
  std::lock_guard<std::mutex> lock(installMutex);
  model = installedModel.load();
  if (model == nullptr) {
    model = factory();
    installedModel.store(model);
    SetDeviceProvider(model);
  }
  return model;
}

DeviceModel* ActiveDeviceModelIfAny() {
  return installedModel.load();
}

void SetDefaultDeviceModelFactory(DeviceModelFactory factory) {
  defaultFactory.store(factory);
}

}  // namespace emu

// ---- OS version --------------------------------------------------------------

namespace {
emu::OsVersion CurrentVersion() {
  emu::DeviceModel* model = emu::ActiveDeviceModel();
  return model != nullptr ? model->Version() : emu::OsVersion{};
}
}  // namespace

DWORD GetVersion() {
  emu::OsVersion v = CurrentVersion();
  DWORD result = (v.major & 0xFF) | ((v.minor & 0xFF) << 8);
  if (v.platformId == VER_PLATFORM_WIN32_NT) {
    result |= (v.build & 0x7FFF) << 16;
  } else {
    result |= 0x80000000u;
  }
  return result;
}

BOOL GetVersionExW(LPOSVERSIONINFOW info) {
  if (info == nullptr) {
    SetLastError(ERROR_NOACCESS);
    return FALSE;
  }
  if (info->dwOSVersionInfoSize < sizeof(OSVERSIONINFOW)) {
    SetLastError(ERROR_INSUFFICIENT_BUFFER);
    return FALSE;
  }
  emu::OsVersion v = CurrentVersion();
  info->dwMajorVersion = v.major;
  info->dwMinorVersion = v.minor;
  info->dwBuildNumber = v.platformId == VER_PLATFORM_WIN32_NT ? v.build : (v.build & 0xFFFF);
  info->dwPlatformId = v.platformId;
  std::size_t i = 0;
  for (; i + 1 < 128 && i < v.servicePack.size(); ++i) info->szCSDVersion[i] = v.servicePack[i];
  info->szCSDVersion[i] = 0;
  return TRUE;
}

// ---- Drive letters -------------------------------------------------------------

DWORD GetLogicalDrives() {
  emu::DeviceModel* model = emu::ActiveDeviceModel();
  DWORD mask = model != nullptr ? model->LogicalDrives() : 0;
  SetLastError(ERROR_SUCCESS);
  return mask;
}

UINT GetDriveTypeW(LPCWSTR rootPathName) {
  WCHAR letter = emu::DriveLetterOf(rootPathName);
  if (letter == 0) return DRIVE_NO_ROOT_DIR;
  // Only a root ("X:\" or "X:") names a drive; a deeper path is not a root.
  if (rootPathName[2] != 0 && !(rootPathName[2] == u'\\' && rootPathName[3] == 0)) {
    return DRIVE_NO_ROOT_DIR;
  }
  emu::DeviceModel* model = emu::ActiveDeviceModel();
  if (model == nullptr) return DRIVE_NO_ROOT_DIR;
  return model->DriveType(letter);
}

BOOL GetDiskFreeSpaceExW(LPCWSTR directoryName, PULARGE_INTEGER freeBytesAvailableToCaller,
                         PULARGE_INTEGER totalNumberOfBytes,
                         PULARGE_INTEGER totalNumberOfFreeBytes) {
  WCHAR letter = emu::DriveLetterOf(directoryName);
  emu::DeviceModel* model = emu::ActiveDeviceModel();
  if (letter == 0 || model == nullptr) {
    SetLastError(ERROR_PATH_NOT_FOUND);
    return FALSE;
  }
  ULONGLONG available = 0;
  ULONGLONG total = 0;
  ULONGLONG totalFree = 0;
  DWORD error = ERROR_SUCCESS;
  if (!model->FreeSpace(letter, &available, &total, &totalFree, &error)) {
    SetLastError(error);
    return FALSE;
  }
  if (freeBytesAvailableToCaller != nullptr) freeBytesAvailableToCaller->QuadPart = available;
  if (totalNumberOfBytes != nullptr) totalNumberOfBytes->QuadPart = total;
  if (totalNumberOfFreeBytes != nullptr) totalNumberOfFreeBytes->QuadPart = totalFree;
  SetLastError(ERROR_SUCCESS);
  return TRUE;
}
