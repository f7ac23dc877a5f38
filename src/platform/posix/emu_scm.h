// Test-facing control of the emulated service control manager, device
// notifications, event log, console control and registry (host build only).
//
// A test opens a manager session, then lets the code under test call
// StartServiceCtrlDispatcherW (typically on a thread of the test). As on
// Windows, the dispatcher runs the service main function on a new thread and
// every control handler call on the dispatcher's own thread. The test sends
// controls and device events and waits until they have been handled, reads
// every status report in order, and can make the calls of the service fail.
//
// Waits below take a real-time bound in milliseconds (not scaled): it only
// guards against a hang; they return as soon as the condition holds.
#pragma once

#include <cstddef>
#include <string>
#include <vector>

#include "platform/posix/win32_base.h"
#include "platform/posix/win32_registry.h"
#include "platform/posix/win32_service.h"

namespace emu {

constexpr DWORD kScmWaitMs = 30000;

// ---- Manager session ---------------------------------------------------------
// Opens a session: StartServiceCtrlDispatcherW connects from now on. Clears
// the reports and every failure set before. Only one session at a time.
void BeginServiceSession();
// Closes the session: a dispatcher still waiting returns (TRUE, as when the
// manager gives up on a service that never reports stopped) once its service
// main has returned, and later dispatcher calls fail with 1063 again.
// Controls no longer reach the handler.
void EndServiceSession();
bool ServiceSessionActive();

// The dispatcher returns TRUE when the service has reported SERVICE_STOPPED
// and its main function has returned, or when the main function returned
// without ever registering a control handler (the manager sees the start
// fail), or after EndServiceSession.

struct ServiceSessionState {
  bool dispatcherRunning = false;   // StartServiceCtrlDispatcherW has connected
  bool dispatcherReturned = false;  // ... and returned
  bool handlerRegistered = false;
  bool mainReturned = false;
  DWORD dispatcherThreadId = 0;  // GetCurrentThreadId() of the dispatcher
  DWORD mainThreadId = 0;        // ... of the service main function's thread
  std::u16string serviceName;    // first entry of the dispatch table
  DWORD setStatusCalls = 0;      // SetServiceStatus calls, failed ones included
};
ServiceSessionState ServiceSessionSnapshot();

// Waits until the service's control handler is registered.
bool WaitForServiceHandler(DWORD timeoutMs = kScmWaitMs);
// Waits until StartServiceCtrlDispatcherW has returned.
bool WaitForDispatcherReturn(DWORD timeoutMs = kScmWaitMs);

// Result of a control sent by the test.
struct ControlResult {
  bool delivered = false;   // false: no handler registered, or session/dispatcher gone
  DWORD handlerResult = 0;  // the handler's return value
  DWORD threadId = 0;       // thread that ran the handler
};
// Runs the handler with (control, eventType, eventData) on the dispatcher
// thread and waits until it has returned. Must not be called from the
// dispatcher thread itself (delivered stays false).
ControlResult SendServiceControl(DWORD control, DWORD eventType = 0, void* eventData = nullptr,
                                 DWORD timeoutMs = kScmWaitMs);

// Every status report the manager accepted, in order (full copies).
std::vector<SERVICE_STATUS> ServiceStatusReports();
// Waits until a report at index >= fromIndex has dwCurrentState == state.
bool WaitForServiceState(DWORD state, std::size_t fromIndex = 0, DWORD timeoutMs = kScmWaitMs);
// Waits until at least `count` reports have been accepted.
bool WaitForServiceReportCount(std::size_t count, DWORD timeoutMs = kScmWaitMs);

// Failures on demand (cleared by BeginServiceSession).
// RegisterServiceCtrlHandlerExW fails with `error` while it is not 0.
void FailRegisterServiceCtrlHandler(DWORD error);
// SetServiceStatus calls number `first` .. `first + count - 1` of the
// session (counted from 1) fail with `error`; count 0 turns this off.
void FailSetServiceStatus(DWORD first, DWORD count, DWORD error);

// ---- Device notifications ----------------------------------------------------
// Registrations alive now (RegisterDeviceNotificationW not yet undone).
std::size_t LiveDeviceNotificationCount();
// The `nth` registration from now (1 = the next one) returns null with
// `error`; 0 turns this off.
void FailDeviceNotificationRegistration(DWORD nth, DWORD error = ERROR_NOT_ENOUGH_MEMORY);

struct DeviceEventOutcome {
  int recipients = 0;   // registrations the event was delivered to
  bool denied = false;  // some handler returned BROADCAST_QUERY_DENY (for query events)
};
// Delivers a device event, as Plug and Play does, to every service that
// registered for it: a DEV_BROADCAST_DEVICEINTERFACE_W record goes to the
// registrations for its interface class (or for all classes). Other record
// kinds reach only windows on Windows, so no service receives them here.
// The record is copied (dbch_size bytes); each handler runs on its
// dispatcher thread with SERVICE_CONTROL_DEVICEEVENT, and this call waits
// until all have returned. Call it without holding locks the handler needs.
DeviceEventOutcome DeliverDeviceEvent(DWORD eventType, const void* record);

// ---- Event log ---------------------------------------------------------------
struct EventLogEntry {
  std::u16string source;
  WORD type = 0;
  WORD category = 0;
  DWORD eventId = 0;
  std::vector<std::u16string> strings;
  std::vector<BYTE> data;
};
// Entries reported by this process since the last clear, in order. (With
// env SKYVANE_EVENTLOG set they are also appended to that file as lines.)
std::vector<EventLogEntry> EventLogEntries();
void ClearEventLog();
// RegisterEventSourceW fails with `error` while it is not 0.
void FailRegisterEventSource(DWORD error);

// ---- Console control -----------------------------------------------------------
// Raises a console control event as the terminal would (the same path as
// SIGINT / SIGQUIT / SIGHUP): the handlers run on the console thread. Waits
// until they have run and returns whether one of them handled it; when none
// did, the default action ends the process, as on Windows.
bool RaiseConsoleControl(DWORD controlType);

// ---- Registry ------------------------------------------------------------------
// Makes an existing key readable but not writable (opening it for writing,
// setting or deleting values, creating sub-keys below it and deleting it
// give ERROR_ACCESS_DENIED), or writable again. Returns a registry error.
LSTATUS SetRegistryKeyReadOnly(HKEY root, const WCHAR* subKey, bool readOnly);
// The file the registry store lives in.
std::string RegistryStorePath();

}  // namespace emu
