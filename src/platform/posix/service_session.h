// Internal link between the emulated manager session (service_manager.cpp)
// and the parts that reach a running service: the service database
// (ControlService, QueryServiceStatus) and device notifications.
#pragma once

#include <string_view>

#include "platform/posix/emu_scm.h"
#include "platform/posix/win32_service.h"

namespace emu::scm {

// True when `handle` is the status handle of the session's service and its
// control handler is registered.
bool IsLiveStatusHandle(SERVICE_STATUS_HANDLE handle);

// Runs a control on the handler of the service behind `recipient` (see
// emu::SendServiceControl). Not delivered when the service has stopped.
ControlResult DeliverToService(SERVICE_STATUS_HANDLE recipient, DWORD control, DWORD eventType,
                               void* eventData);

// The service `name` as the session sees it: running means the dispatcher
// runs it, its handler is registered and it has not reported stopped.
struct RunningService {
  bool running = false;
  SERVICE_STATUS status{};  // the last report (zeroed when there is none)
};
RunningService FindRunningService(std::u16string_view name);

// ControlService's delivery to a running service: the same as
// SendServiceControl, addressed by service name.
ControlResult ControlRunningService(std::u16string_view name, DWORD control);

}  // namespace emu::scm
