// The service main function, its status reports and the control handler.
#include "service/service_main.h"

#include "monitor/monitor_state.h"
#include "monitor/stop_request.h"
#include "service/device_notifications.h"
#include "service/process_locks.h"
#include "service/service_host.h"
#include "volume/device_events.h"

SERVICE_STATUS serviceStatus;
SERVICE_STATUS_HANDLE serviceStatusHandle = nullptr;
DWORD nextCheckPoint = 1;

bool ReportServiceStatus(DWORD state, DWORD exitCode, DWORD waitHintMs) {
  if (debugMode) return true;
  InitializeProcessLocks();
  EnterCriticalSection(&serviceStatusLock);
  serviceStatus.dwControlsAccepted = state == SERVICE_START_PENDING ? 0 : SERVICE_ACCEPT_STOP;
  serviceStatus.dwCurrentState = state;
  serviceStatus.dwWin32ExitCode = exitCode;
  serviceStatus.dwWaitHint = waitHintMs;
  if (state == SERVICE_RUNNING || state == SERVICE_STOPPED) {
    serviceStatus.dwCheckPoint = 0;
  } else {
    serviceStatus.dwCheckPoint = nextCheckPoint++;
  }
  const bool sent = SetServiceStatus(serviceStatusHandle, &serviceStatus) != 0;
  if (!sent) LogServiceError(WSTR("SetServiceStatus"));
  LeaveCriticalSection(&serviceStatusLock);
  return sent;
}

namespace {

// Device events reach the monitor only while its state and objects exist;
// guarded by deviceEventLock.
bool deviceEventsAccepted = false;

void AcceptDeviceEvents(bool accepted) {
  EnterCriticalSection(&deviceEventLock);
  deviceEventsAccepted = accepted;
  LeaveCriticalSection(&deviceEventLock);
}

// Registered once the monitor has initialised its state.
bool StartDeviceNotifications() {
  AcceptDeviceEvents(true);
  if (RegisterDeviceInterfaceNotifications(DEVICE_NOTIFY_SERVICE_HANDLE, serviceStatusHandle))
    return true;
  AcceptDeviceEvents(false);
  return false;
}

// Removed before the monitor closes its objects; a handler already running
// finishes first.
void EndDeviceNotifications() {
  UnregisterDeviceInterfaceNotifications();
  AcceptDeviceEvents(false);
}

}  // namespace

VOID WINAPI RunService(DWORD argc, LPWSTR* argv) {
  InitializeProcessLocks();
  // A new run: only a stop that comes from now on counts.
  monitorStopRequested = false;
  serviceStatusHandle =
      RegisterServiceCtrlHandlerExW(SKYVANE_SERVICE_NAME, ServiceControlHandler, nullptr);
  if (serviceStatusHandle == nullptr) return;
  serviceStatus.dwServiceType = SERVICE_WIN32_OWN_PROCESS;
  serviceStatus.dwServiceSpecificExitCode = 0;
  if (ReportServiceStatus(SERVICE_START_PENDING, 0, 3000)) {
    const MonitorSession session{StartDeviceNotifications, EndDeviceNotifications};
    RunMonitor(static_cast<int>(argc), argv, &session);
  }
  ReportServiceStatus(SERVICE_STOPPED, lastError, 0);
}

DWORD WINAPI ServiceControlHandler(DWORD control, DWORD eventType, LPVOID eventData, LPVOID) {
  switch (control) {
    case SERVICE_CONTROL_STOP:
      if (!debugMode) {
        InitializeProcessLocks();
        EnterCriticalSection(&serviceStatusLock);
        serviceStatus.dwCurrentState = SERVICE_STOP_PENDING;
        serviceStatus.dwControlsAccepted = SERVICE_ACCEPT_STOP;
        serviceStatus.dwCheckPoint = nextCheckPoint++;
        serviceStatus.dwWin32ExitCode = 0;
        serviceStatus.dwWaitHint = 0;
        if (!SetServiceStatus(serviceStatusHandle, &serviceStatus)) {
          LogServiceError(WSTR("SetServiceStatus"));
        }
        LeaveCriticalSection(&serviceStatusLock);
      }
      StopMonitor();
      return NO_ERROR;
    case SERVICE_CONTROL_DEVICEEVENT:
      InitializeProcessLocks();
      EnterCriticalSection(&deviceEventLock);
      if (deviceEventsAccepted) HandleDeviceEvent(eventType, eventData, nullptr);
      LeaveCriticalSection(&deviceEventLock);
      break;
    default:
      break;
  }
  // The state is read under the (recursive) lock too: the monitor may be
  // reporting at the same time.
  InitializeProcessLocks();
  EnterCriticalSection(&serviceStatusLock);
  ReportServiceStatus(serviceStatus.dwCurrentState, 0, 0);
  LeaveCriticalSection(&serviceStatusLock);
  return NO_ERROR;
}
