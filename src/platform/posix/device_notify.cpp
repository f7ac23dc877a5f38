// Device notifications: registrations for device-interface classes, and the
// delivery of Plug and Play device events to the services that registered
// (emu::DeliverDeviceEvent, called by the simulated computer and tests).
// A registration is a checked handle that CloseHandle cannot close.
#include <algorithm>
#include <cstdint>
#include <cstring>
#include <memory>
#include <mutex>
#include <vector>

#include "platform/posix/emu_scm.h"
#include "platform/posix/handle_table.h"
#include "platform/posix/service_session.h"
#include "platform/posix/win32_service.h"

namespace emu::notify {
namespace {

class Registration : public KernelObject {
 public:
  Registration(HANDLE to, DWORD how, GUID cls) : recipient(to), flags(how), classGuid(cls) {}
  bool ClosableByCloseHandle() const override { return false; }
  void HandleClosed() override;
  const HANDLE recipient;
  const DWORD flags;
  const GUID classGuid;
};

struct Registry {
  std::mutex lock;
  std::vector<std::shared_ptr<Registration>> live;  // in registration order
  DWORD failAt = 0;                                 // 1-based attempt that fails, 0 = never
  DWORD attempts = 0;
  DWORD failError = 0;
};

Registry& R() {
  static Registry* registry = new Registry();
  return *registry;
}

void Registration::HandleClosed() {
  std::lock_guard<std::mutex> guard(R().lock);
  auto& live = R().live;
  live.erase(
      std::remove_if(live.begin(), live.end(), [this](const auto& r) { return r.get() == this; }),
      live.end());
}

bool IsQueryEvent(DWORD eventType) {
  return eventType == DBT_DEVICEQUERYREMOVE || eventType == DBT_QUERYCHANGECONFIG;
}

}  // namespace
}  // namespace emu::notify

using emu::notify::R;

HDEVNOTIFY RegisterDeviceNotificationW(HANDLE recipient, LPVOID filter, DWORD flags) {
  if (recipient == nullptr || filter == nullptr) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return nullptr;
  }
  DEV_BROADCAST_HDR header;
  std::memcpy(&header, filter, sizeof header);
  if (header.dbch_size < sizeof header || header.dbch_devicetype != DBT_DEVTYP_DEVICEINTERFACE ||
      header.dbch_size < offsetof(DEV_BROADCAST_DEVICEINTERFACE_W, dbcc_name)) {
    SetLastError(ERROR_INVALID_DATA);
    return nullptr;
  }
  DWORD kind = flags & ~DEVICE_NOTIFY_ALL_INTERFACE_CLASSES;
  if (kind != DEVICE_NOTIFY_WINDOW_HANDLE && kind != DEVICE_NOTIFY_SERVICE_HANDLE) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return nullptr;
  }
  if (kind == DEVICE_NOTIFY_SERVICE_HANDLE &&
      !emu::scm::IsLiveStatusHandle(static_cast<SERVICE_STATUS_HANDLE>(recipient))) {
    SetLastError(ERROR_INVALID_HANDLE);
    return nullptr;
  }
  GUID classGuid;
  std::memcpy(
      &classGuid,
      static_cast<const BYTE*>(filter) + offsetof(DEV_BROADCAST_DEVICEINTERFACE_W, dbcc_classguid),
      sizeof classGuid);
  {
    std::lock_guard<std::mutex> guard(R().lock);
    DWORD attempt = ++R().attempts;
    if (R().failAt != 0 && attempt == R().failAt) {
      SetLastError(R().failError);
      return nullptr;
    }
  }
  auto registration = std::make_shared<emu::notify::Registration>(recipient, flags, classGuid);
  HANDLE handle = emu::AllocateHandle(registration);
  std::lock_guard<std::mutex> guard(R().lock);
  R().live.push_back(registration);
  return handle;
}

BOOL UnregisterDeviceNotification(HDEVNOTIFY notification) {
  if (emu::LookupHandleAs<emu::notify::Registration>(notification) == nullptr ||
      !emu::ReleaseHandle(notification)) {
    SetLastError(ERROR_INVALID_HANDLE);
    return FALSE;
  }
  return TRUE;
}

namespace emu {

std::size_t LiveDeviceNotificationCount() {
  std::lock_guard<std::mutex> guard(R().lock);
  return R().live.size();
}

void FailDeviceNotificationRegistration(DWORD nth, DWORD error) {
  std::lock_guard<std::mutex> guard(R().lock);
  R().attempts = 0;
  R().failAt = nth;
  R().failError = error;
}

DeviceEventOutcome DeliverDeviceEvent(DWORD eventType, const void* record) {
  DeviceEventOutcome outcome;
  if (record == nullptr) return outcome;
  DEV_BROADCAST_HDR header;
  std::memcpy(&header, record, sizeof header);
  if (header.dbch_devicetype != DBT_DEVTYP_DEVICEINTERFACE ||
      header.dbch_size < offsetof(DEV_BROADCAST_DEVICEINTERFACE_W, dbcc_name)) {
    return outcome;
  }
  // The handlers read the copy, so the caller's record may go at once; the
  // 8-byte units keep it aligned as the system's buffer is.
  std::vector<std::uint64_t> copy((header.dbch_size + 7) / 8 + 1, 0);
  std::memcpy(copy.data(), record, header.dbch_size);
  GUID classGuid;
  std::memcpy(&classGuid,
              reinterpret_cast<const BYTE*>(copy.data()) +
                  offsetof(DEV_BROADCAST_DEVICEINTERFACE_W, dbcc_classguid),
              sizeof classGuid);

  std::vector<std::shared_ptr<notify::Registration>> targets;
  {
    std::lock_guard<std::mutex> guard(R().lock);
    for (const auto& registration : R().live) {
      bool serviceRecipient = (registration->flags & ~DEVICE_NOTIFY_ALL_INTERFACE_CLASSES) ==
                              DEVICE_NOTIFY_SERVICE_HANDLE;
      bool classMatches = (registration->flags & DEVICE_NOTIFY_ALL_INTERFACE_CLASSES) != 0 ||
                          registration->classGuid == classGuid;
      if (serviceRecipient && classMatches) targets.push_back(registration);
    }
  }
  for (const auto& target : targets) {
    ControlResult result =
        scm::DeliverToService(static_cast<SERVICE_STATUS_HANDLE>(target->recipient),
                              SERVICE_CONTROL_DEVICEEVENT, eventType, copy.data());
    if (!result.delivered) continue;
    ++outcome.recipients;
    if (notify::IsQueryEvent(eventType) && result.handlerResult != NO_ERROR) outcome.denied = true;
  }
  return outcome;
}

}  // namespace emu
