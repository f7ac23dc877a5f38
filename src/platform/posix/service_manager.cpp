// The emulated manager session: StartServiceCtrlDispatcherW,
// RegisterServiceCtrlHandlerExW and SetServiceStatus, and the test API that
// drives them (emu_scm.h).
//
// One session at a time, in this process. The dispatcher runs the first
// service of its table on a thread made with CreateThread (so it counts as a
// live thread and gets the thread semantics of the emulation) and then serves
// the control queue on its own thread until the service is done.
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>

#include "platform/posix/emu_scm.h"
#include "platform/posix/registry_store.h"
#include "platform/posix/service_session.h"
#include "platform/posix/win32_sync.h"

namespace emu::scm {
namespace {

struct PendingControl {
  DWORD control = 0;
  DWORD eventType = 0;
  void* eventData = nullptr;
  bool started = false;
  bool finished = false;
  ControlResult result;
};

struct Session {
  std::mutex lock;
  std::condition_variable changed;

  bool active = false;
  std::uint64_t generation = 0;

  bool dispatcherRunning = false;
  bool dispatcherReturned = false;
  DWORD dispatcherThreadId = 0;
  DWORD mainThreadId = 0;
  std::u16string serviceName;

  bool handlerRegistered = false;
  bool handlerEverRegistered = false;
  LPHANDLER_FUNCTION_EX handler = nullptr;
  void* context = nullptr;
  bool mainReturned = false;
  bool stoppedReported = false;

  std::deque<std::shared_ptr<PendingControl>> queue;
  std::vector<SERVICE_STATUS> reports;
  DWORD setStatusCalls = 0;

  DWORD failRegisterError = 0;
  DWORD failStatusFirst = 0;
  DWORD failStatusCount = 0;
  DWORD failStatusError = 0;
};

// Never destroyed: a dispatcher thread may outlive static destruction.
Session& S() {
  static Session* session = new Session();
  return *session;
}

// The status handle of a session: an opaque value that is not a kernel
// handle (as on Windows, it is never closed).
SERVICE_STATUS_HANDLE StatusHandleFor(std::uint64_t generation) {
  return reinterpret_cast<SERVICE_STATUS_HANDLE>(
      static_cast<std::uintptr_t>(0x5C0000000000ULL + (generation << 4)));
}

bool Wait(std::unique_lock<std::mutex>& guard, DWORD timeoutMs, const auto& ready) {
  return S().changed.wait_for(guard, std::chrono::milliseconds(timeoutMs), ready);
}

struct MainStart {
  LPSERVICE_MAIN_FUNCTIONW proc;
  std::u16string name;
  std::uint64_t generation;
};

DWORD WINAPI ServiceMainThread(LPVOID parameter) {
  std::unique_ptr<MainStart> start(static_cast<MainStart*>(parameter));
  {
    std::lock_guard<std::mutex> guard(S().lock);
    if (S().generation == start->generation) S().mainThreadId = GetCurrentThreadId();
  }
  // As on Windows, the service main gets its name as the only argument.
  LPWSTR arguments[2] = {start->name.data(), nullptr};
  start->proc(1, arguments);
  std::lock_guard<std::mutex> guard(S().lock);
  if (S().generation == start->generation) S().mainReturned = true;
  S().changed.notify_all();
  return 0;
}

// Whether the dispatcher of `generation` is done serving.
bool DispatcherDone(const Session& s, std::uint64_t generation) {
  if (!s.mainReturned) return false;
  if (!s.active || s.generation != generation) return true;
  return s.stoppedReported || !s.handlerEverRegistered;
}

bool Running(const Session& s) {
  return s.active && s.dispatcherRunning && s.handlerRegistered && !s.stoppedReported;
}

ControlResult Deliver(DWORD control, DWORD eventType, void* eventData, DWORD timeoutMs) {
  ControlResult none;
  Session& s = S();
  std::unique_lock<std::mutex> guard(s.lock);
  if (!Running(s) || s.dispatcherThreadId == GetCurrentThreadId()) return none;
  auto pending = std::make_shared<PendingControl>();
  pending->control = control;
  pending->eventType = eventType;
  pending->eventData = eventData;
  s.queue.push_back(pending);
  s.changed.notify_all();
  if (!Wait(guard, timeoutMs, [&] { return pending->started || pending->finished; })) {
    // Never picked up: withdraw it so the handler cannot see the caller's
    // data after this returns.
    for (auto it = s.queue.begin(); it != s.queue.end(); ++it) {
      if (*it == pending) {
        s.queue.erase(it);
        break;
      }
    }
    return none;
  }
  // Once the handler runs it may use eventData: wait for it to return.
  s.changed.wait(guard, [&] { return pending->finished; });
  return pending->result;
}

}  // namespace

bool IsLiveStatusHandle(SERVICE_STATUS_HANDLE handle) {
  std::lock_guard<std::mutex> guard(S().lock);
  return Running(S()) && handle == StatusHandleFor(S().generation);
}

ControlResult DeliverToService(SERVICE_STATUS_HANDLE recipient, DWORD control, DWORD eventType,
                               void* eventData) {
  {
    std::lock_guard<std::mutex> guard(S().lock);
    if (recipient != StatusHandleFor(S().generation)) return ControlResult{};
  }
  return Deliver(control, eventType, eventData, kScmWaitMs);
}

RunningService FindRunningService(std::u16string_view name) {
  RunningService found;
  std::lock_guard<std::mutex> guard(S().lock);
  const Session& s = S();
  if (Running(s) && registry::EqualNoCase(s.serviceName, name)) {
    found.running = true;
    if (!s.reports.empty()) found.status = s.reports.back();
  }
  return found;
}

ControlResult ControlRunningService(std::u16string_view name, DWORD control) {
  if (!FindRunningService(name).running) return ControlResult{};
  return Deliver(control, 0, nullptr, kScmWaitMs);
}

}  // namespace emu::scm

using emu::scm::S;

BOOL StartServiceCtrlDispatcherW(const SERVICE_TABLE_ENTRYW* serviceTable) {
  if (serviceTable == nullptr || serviceTable[0].lpServiceName == nullptr ||
      serviceTable[0].lpServiceProc == nullptr) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return FALSE;
  }
  emu::scm::Session& s = S();
  std::unique_lock<std::mutex> guard(s.lock);
  if (!s.active) {
    SetLastError(ERROR_FAILED_SERVICE_CONTROLLER_CONNECT);
    return FALSE;
  }
  if (s.dispatcherRunning || s.dispatcherReturned) {
    SetLastError(ERROR_SERVICE_ALREADY_RUNNING);
    return FALSE;
  }
  const std::uint64_t generation = s.generation;
  s.dispatcherRunning = true;
  s.dispatcherThreadId = GetCurrentThreadId();
  s.serviceName = serviceTable[0].lpServiceName;
  auto* start = new emu::scm::MainStart{serviceTable[0].lpServiceProc, s.serviceName, generation};
  guard.unlock();

  HANDLE mainThread = CreateThread(nullptr, 0, emu::scm::ServiceMainThread, start, 0, nullptr);
  if (mainThread == nullptr) {
    delete start;
    guard.lock();
    s.dispatcherRunning = false;
    s.dispatcherReturned = true;
    s.changed.notify_all();
    SetLastError(ERROR_SERVICE_NO_THREAD);
    return FALSE;
  }

  guard.lock();
  for (;;) {
    s.changed.wait(guard,
                   [&] { return !s.queue.empty() || emu::scm::DispatcherDone(s, generation); });
    if (s.queue.empty()) break;
    std::shared_ptr<emu::scm::PendingControl> pending = s.queue.front();
    s.queue.pop_front();
    pending->started = true;
    LPHANDLER_FUNCTION_EX handler = s.handler;
    void* context = s.context;
    s.changed.notify_all();
    guard.unlock();
    DWORD result = handler(pending->control, pending->eventType, pending->eventData, context);
    guard.lock();
    pending->result = emu::ControlResult{true, result, GetCurrentThreadId()};
    pending->finished = true;
    s.changed.notify_all();
  }
  guard.unlock();

  WaitForSingleObject(mainThread, INFINITE);
  CloseHandle(mainThread);

  guard.lock();
  if (s.generation == generation) {
    s.dispatcherRunning = false;
    s.dispatcherReturned = true;
    s.handlerRegistered = false;
  }
  s.changed.notify_all();
  return TRUE;
}

SERVICE_STATUS_HANDLE RegisterServiceCtrlHandlerExW(LPCWSTR serviceName,
                                                    LPHANDLER_FUNCTION_EX handler, LPVOID context) {
  if (serviceName == nullptr || handler == nullptr) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return nullptr;
  }
  emu::scm::Session& s = S();
  std::lock_guard<std::mutex> guard(s.lock);
  // An own-process service is found whatever name it gives, as on Windows.
  if (!s.active || !s.dispatcherRunning) {
    SetLastError(ERROR_SERVICE_DOES_NOT_EXIST);
    return nullptr;
  }
  if (s.failRegisterError != 0) {
    SetLastError(s.failRegisterError);
    return nullptr;
  }
  s.handler = handler;
  s.context = context;
  s.handlerRegistered = true;
  s.handlerEverRegistered = true;
  s.changed.notify_all();
  return emu::scm::StatusHandleFor(s.generation);
}

BOOL SetServiceStatus(SERVICE_STATUS_HANDLE statusHandle, LPSERVICE_STATUS status) {
  emu::scm::Session& s = S();
  std::lock_guard<std::mutex> guard(s.lock);
  bool valid =
      s.active && s.handlerRegistered && statusHandle == emu::scm::StatusHandleFor(s.generation);
  if (!valid) {
    SetLastError(ERROR_INVALID_HANDLE);
    return FALSE;
  }
  DWORD call = ++s.setStatusCalls;
  if (s.failStatusCount != 0 && call >= s.failStatusFirst &&
      call - s.failStatusFirst < s.failStatusCount) {
    SetLastError(s.failStatusError);
    return FALSE;
  }
  if (status == nullptr) {
    SetLastError(ERROR_INVALID_ADDRESS);
    return FALSE;
  }
  if (status->dwCurrentState < SERVICE_STOPPED || status->dwCurrentState > SERVICE_PAUSED) {
    SetLastError(ERROR_INVALID_DATA);
    return FALSE;
  }
  s.reports.push_back(*status);
  if (status->dwCurrentState == SERVICE_STOPPED) s.stoppedReported = true;
  s.changed.notify_all();
  return TRUE;
}

namespace emu {

void BeginServiceSession() {
  scm::Session& s = S();
  std::lock_guard<std::mutex> guard(s.lock);
  ++s.generation;
  s.active = true;
  s.dispatcherRunning = false;
  s.dispatcherReturned = false;
  s.dispatcherThreadId = 0;
  s.mainThreadId = 0;
  s.serviceName.clear();
  s.handlerRegistered = false;
  s.handlerEverRegistered = false;
  s.handler = nullptr;
  s.context = nullptr;
  s.mainReturned = false;
  s.stoppedReported = false;
  s.queue.clear();
  s.reports.clear();
  s.setStatusCalls = 0;
  s.failRegisterError = 0;
  s.failStatusFirst = 0;
  s.failStatusCount = 0;
  s.failStatusError = 0;
  s.changed.notify_all();
}

void EndServiceSession() {
  scm::Session& s = S();
  std::lock_guard<std::mutex> guard(s.lock);
  s.active = false;
  s.handlerRegistered = false;
  // Controls not yet picked up are dropped.
  for (auto& pending : s.queue) pending->finished = true;
  s.queue.clear();
  s.changed.notify_all();
}

bool ServiceSessionActive() {
  std::lock_guard<std::mutex> guard(S().lock);
  return S().active;
}

ServiceSessionState ServiceSessionSnapshot() {
  const scm::Session& s = S();
  std::lock_guard<std::mutex> guard(S().lock);
  ServiceSessionState state;
  state.dispatcherRunning = s.dispatcherRunning;
  state.dispatcherReturned = s.dispatcherReturned;
  state.handlerRegistered = s.handlerRegistered;
  state.mainReturned = s.mainReturned;
  state.dispatcherThreadId = s.dispatcherThreadId;
  state.mainThreadId = s.mainThreadId;
  state.serviceName = s.serviceName;
  state.setStatusCalls = s.setStatusCalls;
  return state;
}

bool WaitForServiceHandler(DWORD timeoutMs) {
  std::unique_lock<std::mutex> guard(S().lock);
  return scm::Wait(guard, timeoutMs, [] { return S().handlerRegistered; });
}

bool WaitForDispatcherReturn(DWORD timeoutMs) {
  std::unique_lock<std::mutex> guard(S().lock);
  return scm::Wait(guard, timeoutMs, [] { return S().dispatcherReturned; });
}

ControlResult SendServiceControl(DWORD control, DWORD eventType, void* eventData, DWORD timeoutMs) {
  return scm::Deliver(control, eventType, eventData, timeoutMs);
}

std::vector<SERVICE_STATUS> ServiceStatusReports() {
  std::lock_guard<std::mutex> guard(S().lock);
  return S().reports;
}

bool WaitForServiceState(DWORD state, std::size_t fromIndex, DWORD timeoutMs) {
  std::unique_lock<std::mutex> guard(S().lock);
  return scm::Wait(guard, timeoutMs, [&] {
    const auto& reports = S().reports;
    for (std::size_t i = fromIndex; i < reports.size(); ++i) {
      if (reports[i].dwCurrentState == state) return true;
    }
    return false;
  });
}

bool WaitForServiceReportCount(std::size_t count, DWORD timeoutMs) {
  std::unique_lock<std::mutex> guard(S().lock);
  return scm::Wait(guard, timeoutMs, [&] { return S().reports.size() >= count; });
}

void FailRegisterServiceCtrlHandler(DWORD error) {
  std::lock_guard<std::mutex> guard(S().lock);
  S().failRegisterError = error;
}

void FailSetServiceStatus(DWORD first, DWORD count, DWORD error) {
  std::lock_guard<std::mutex> guard(S().lock);
  S().failStatusFirst = first;
  S().failStatusCount = count;
  S().failStatusError = error;
}

}  // namespace emu
