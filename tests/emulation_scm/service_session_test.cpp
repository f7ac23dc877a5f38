// The emulated manager session, with a small service of the test's own run
// by StartServiceCtrlDispatcherW as Windows runs one: handlers on the
// dispatcher's thread, the main function on its own, every status report
// recorded and checked, ControlService and QueryServiceStatus following the
// service's state, and device events reaching the registrations of their
// interface class. (The service's own tests run the real service this way.)
#include <gtest/gtest.h>

#include <condition_variable>
#include <cstring>
#include <functional>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/posix/emu_scm.h"
#include "platform/wide.h"
#include "platform/win32.h"

namespace {

constexpr GUID kClassA = {
    0x6B1E0C27, 0x5A94, 0x4D3B, {0x9F, 0x10, 0x2C, 0x7E, 0x8A, 0x41, 0xD5, 0xB3}};
constexpr GUID kClassB = {
    0xA37F52D9, 0x0E6C, 0x4B81, {0x8D, 0x24, 0xF9, 0x1B, 0x6C, 0x3E, 0x7A, 0x05}};
constexpr GUID kClassC = {
    0x1D9C4E6A, 0x73B2, 0x4F05, {0xA6, 0xE8, 0x5B, 0x20, 0xC9, 0xD4, 0x1F, 0x7E}};

struct SeenControl {
  DWORD control;
  DWORD eventType;
  DWORD threadId;
  GUID classGuid;
  WideString name;
};

// The test's service: registers its handler, reports start-pending and
// running, waits for a stop, reports stopped. Hooks let cases vary it; the
// object is made anew for every case.
struct FakeService {
  std::mutex lock;
  std::condition_variable changed;
  SERVICE_STATUS_HANDLE handle = nullptr;
  SERVICE_STATUS status{};
  bool stopRequested = false;
  bool mayRun = true;  // cleared to hold the service in start-pending
  DWORD acceptWhenRunning = SERVICE_ACCEPT_STOP;
  DWORD mainThreadId = 0;
  DWORD queryRemoveAnswer = NO_ERROR;
  std::vector<SeenControl> seen;
  std::function<void()> beforeRunning;  // run on the main thread before the running report
  std::function<void()> beforeStopped;

  BOOL Report(DWORD state, DWORD accepted, DWORD checkPoint) {
    status.dwServiceType = SERVICE_WIN32_OWN_PROCESS;
    status.dwCurrentState = state;
    status.dwControlsAccepted = accepted;
    status.dwCheckPoint = checkPoint;
    status.dwWaitHint = state == SERVICE_START_PENDING ? 3000 : 0;
    return SetServiceStatus(handle, &status);
  }
};

FakeService* g_service = nullptr;

DWORD WINAPI FakeHandler(DWORD control, DWORD eventType, LPVOID eventData, LPVOID context) {
  FakeService& s = *static_cast<FakeService*>(context);
  SeenControl seen{control, eventType, GetCurrentThreadId(), {}, {}};
  if (control == SERVICE_CONTROL_DEVICEEVENT && eventData != nullptr) {
    auto* record = static_cast<DEV_BROADCAST_DEVICEINTERFACE_W*>(eventData);
    seen.classGuid = record->dbcc_classguid;
    seen.name = record->dbcc_name;
  }
  std::lock_guard<std::mutex> guard(s.lock);
  s.seen.push_back(seen);
  if (control == SERVICE_CONTROL_STOP) {
    s.Report(SERVICE_STOP_PENDING, SERVICE_ACCEPT_STOP, 5);
    s.stopRequested = true;
    s.changed.notify_all();
  } else if (control == SERVICE_CONTROL_INTERROGATE) {
    s.Report(s.status.dwCurrentState, s.status.dwControlsAccepted, 0);
  } else if (control == SERVICE_CONTROL_DEVICEEVENT && eventType == DBT_DEVICEQUERYREMOVE) {
    return s.queryRemoveAnswer;
  }
  return NO_ERROR;
}

void FakeMain(DWORD argumentCount, LPWSTR* arguments) {
  FakeService& s = *g_service;
  std::unique_lock<std::mutex> guard(s.lock);
  s.mainThreadId = GetCurrentThreadId();
  EXPECT_TRUE(argumentCount == 1 && WideEqual(arguments[0], u"EmuTestSvc"));
  guard.unlock();
  SERVICE_STATUS_HANDLE handle = RegisterServiceCtrlHandlerExW(u"EmuTestSvc", FakeHandler, &s);
  guard.lock();
  if (handle == nullptr) return;
  s.handle = handle;
  s.Report(SERVICE_START_PENDING, 0, 1);
  s.changed.wait(guard, [&] { return s.mayRun; });
  auto hook = s.beforeRunning;
  guard.unlock();
  if (hook) hook();
  guard.lock();
  s.Report(SERVICE_RUNNING, s.acceptWhenRunning, 0);
  s.changed.wait(guard, [&] { return s.stopRequested; });
  hook = s.beforeStopped;
  guard.unlock();
  if (hook) hook();
  guard.lock();
  s.Report(SERVICE_STOPPED, 0, 0);
}

SERVICE_TABLE_ENTRYW g_table[] = {{const_cast<LPWSTR>(u"EmuTestSvc"), FakeMain},
                                  {nullptr, nullptr}};

class ServiceSession : public ::testing::Test {
 protected:
  void SetUp() override {
    g_service = &service;
    emu::BeginServiceSession();
  }
  void TearDown() override {
    if (dispatcher.joinable()) dispatcher.join();
    emu::EndServiceSession();
    g_service = nullptr;
  }
  // Runs the dispatcher on a thread of the test, as the service's entry does.
  void StartDispatcher() {
    dispatcher = std::thread([this] {
      dispatcherThreadId = GetCurrentThreadId();
      dispatcherResult = StartServiceCtrlDispatcherW(g_table);
    });
  }
  static std::vector<DWORD> States() {
    std::vector<DWORD> states;
    for (const SERVICE_STATUS& status : emu::ServiceStatusReports())
      states.push_back(status.dwCurrentState);
    return states;
  }
  void SetMayRun(bool value) {
    std::lock_guard<std::mutex> guard(service.lock);
    service.mayRun = value;
    service.changed.notify_all();
  }

  FakeService service;
  std::thread dispatcher;
  DWORD dispatcherThreadId = 0;
  BOOL dispatcherResult = FALSE;
};

TEST_F(ServiceSession, RunsTheServiceAndItsControlsOnTheRightThreadsAndChecksReports) {
  service.beforeRunning = [this] {
    SERVICE_STATUS bad{SERVICE_WIN32_OWN_PROCESS, 99, 0, 0, 0, 0, 0};
    EXPECT_FALSE(SetServiceStatus(service.handle, &bad));
    EXPECT_EQ(GetLastError(), ERROR_INVALID_DATA);
    SERVICE_STATUS good{SERVICE_WIN32_OWN_PROCESS, SERVICE_RUNNING, 0, 0, 0, 0, 0};
    EXPECT_FALSE(SetServiceStatus(reinterpret_cast<SERVICE_STATUS_HANDLE>(0x1234), &good));
    EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
  };
  StartDispatcher();
  ASSERT_TRUE(emu::WaitForServiceState(SERVICE_RUNNING));
  emu::ControlResult interrogate = emu::SendServiceControl(SERVICE_CONTROL_INTERROGATE);
  ASSERT_TRUE(interrogate.delivered);
  EXPECT_EQ(interrogate.handlerResult, static_cast<DWORD>(NO_ERROR));
  emu::ControlResult stop = emu::SendServiceControl(SERVICE_CONTROL_STOP);
  ASSERT_TRUE(stop.delivered);
  ASSERT_TRUE(emu::WaitForDispatcherReturn());
  dispatcher.join();
  EXPECT_TRUE(dispatcherResult);

  emu::ServiceSessionState state = emu::ServiceSessionSnapshot();
  EXPECT_TRUE(state.mainReturned);
  EXPECT_EQ(state.serviceName, u"EmuTestSvc");
  // Handlers run on the dispatcher's thread; the main function on another.
  EXPECT_EQ(state.dispatcherThreadId, dispatcherThreadId);
  EXPECT_EQ(interrogate.threadId, dispatcherThreadId);
  EXPECT_EQ(stop.threadId, dispatcherThreadId);
  EXPECT_EQ(state.mainThreadId, service.mainThreadId);
  EXPECT_NE(service.mainThreadId, dispatcherThreadId);
  EXPECT_NE(service.mainThreadId, GetCurrentThreadId());

  // Every valid report, complete and in order; the refused ones are not kept.
  std::vector<SERVICE_STATUS> reports = emu::ServiceStatusReports();
  ASSERT_EQ(States(), (std::vector<DWORD>{SERVICE_START_PENDING, SERVICE_RUNNING, SERVICE_RUNNING,
                                          SERVICE_STOP_PENDING, SERVICE_STOPPED}));
  EXPECT_EQ(reports[0].dwCheckPoint, 1u);
  EXPECT_EQ(reports[0].dwWaitHint, 3000u);
  EXPECT_EQ(reports[0].dwControlsAccepted, 0u);
  EXPECT_EQ(reports[1].dwControlsAccepted, static_cast<DWORD>(SERVICE_ACCEPT_STOP));
  EXPECT_EQ(reports[3].dwCheckPoint, 5u);
  // A stopped service takes no more controls.
  EXPECT_FALSE(emu::SendServiceControl(SERVICE_CONTROL_INTERROGATE).delivered);
}

// The installed-service calls reach the service running in the session and
// refuse what its state does not accept. (The remove verb's stop of a running
// service is proven by the service's own tests.)
TEST_F(ServiceSession, ControlServiceRefusesWhatTheStateDoesNotAccept) {
  SC_HANDLE manager = OpenSCManagerW(nullptr, nullptr, SC_MANAGER_ALL_ACCESS);
  SC_HANDLE installed =
      CreateServiceW(manager, u"EmuTestSvc", nullptr, SERVICE_ALL_ACCESS, SERVICE_WIN32_OWN_PROCESS,
                     SERVICE_DEMAND_START, SERVICE_ERROR_NORMAL, u"/bin/true", nullptr, nullptr,
                     nullptr, nullptr, nullptr);
  ASSERT_NE(installed, nullptr);
  SetMayRun(false);
  service.acceptWhenRunning = 0;
  StartDispatcher();
  SERVICE_STATUS status{};
  auto refused = [&](DWORD control, DWORD state) {
    SetLastError(0);
    BOOL done = ControlService(installed, control, &status);
    EXPECT_EQ(status.dwCurrentState, state);
    return done ? 0 : GetLastError();
  };
  ASSERT_TRUE(emu::WaitForServiceState(SERVICE_START_PENDING));
  EXPECT_EQ(refused(SERVICE_CONTROL_STOP, SERVICE_START_PENDING), ERROR_SERVICE_CANNOT_ACCEPT_CTRL);
  EXPECT_FALSE(StartServiceW(installed, 0, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_SERVICE_ALREADY_RUNNING);
  SetMayRun(true);
  ASSERT_TRUE(emu::WaitForServiceState(SERVICE_RUNNING));
  EXPECT_EQ(refused(SERVICE_CONTROL_STOP, SERVICE_RUNNING), ERROR_INVALID_SERVICE_CONTROL);
  EXPECT_EQ(refused(SERVICE_CONTROL_INTERROGATE, SERVICE_RUNNING), 0u);
  // Device events are the system's to send.
  EXPECT_EQ(refused(SERVICE_CONTROL_DEVICEEVENT, SERVICE_RUNNING), ERROR_INVALID_PARAMETER);
  ASSERT_TRUE(emu::SendServiceControl(SERVICE_CONTROL_STOP).delivered);
  ASSERT_TRUE(emu::WaitForDispatcherReturn());
  EXPECT_EQ(refused(SERVICE_CONTROL_STOP, SERVICE_STOPPED), ERROR_SERVICE_NOT_ACTIVE);
  EXPECT_TRUE(DeleteService(installed));
  EXPECT_TRUE(CloseServiceHandle(installed));
  EXPECT_TRUE(CloseServiceHandle(manager));
}

std::vector<BYTE> InterfaceRecord(const GUID& classGuid, const char16_t* name) {
  const std::size_t head = offsetof(DEV_BROADCAST_DEVICEINTERFACE_W, dbcc_name);
  const std::size_t units = WideLength(name) + 1;
  std::vector<BYTE> bytes(head + units * sizeof(WCHAR));
  DEV_BROADCAST_DEVICEINTERFACE_W header{};
  header.dbcc_size = static_cast<DWORD>(bytes.size());
  header.dbcc_devicetype = DBT_DEVTYP_DEVICEINTERFACE;
  header.dbcc_classguid = classGuid;
  std::memcpy(bytes.data(), &header, head);
  std::memcpy(bytes.data() + head, name, units * sizeof(WCHAR));
  return bytes;
}

HDEVNOTIFY Register(HANDLE recipient, const GUID& classGuid) {
  DEV_BROADCAST_DEVICEINTERFACE_W filter{};
  filter.dbcc_size = sizeof filter;
  filter.dbcc_devicetype = DBT_DEVTYP_DEVICEINTERFACE;
  filter.dbcc_classguid = classGuid;
  return RegisterDeviceNotificationW(recipient, &filter, DEVICE_NOTIFY_SERVICE_HANDLE);
}

TEST_F(ServiceSession, DeviceEventsReachTheRegistrationsForTheirClass) {
  std::vector<HDEVNOTIFY> registrations;
  DWORD failedError = 0;
  service.beforeRunning = [&] {
    for (const GUID* guid : {&kClassA, &kClassA, &kClassB})
      registrations.push_back(Register(service.handle, *guid));
    emu::FailDeviceNotificationRegistration(1, ERROR_NOT_ENOUGH_MEMORY);
    if (Register(service.handle, kClassC) == nullptr) failedError = GetLastError();
    emu::FailDeviceNotificationRegistration(0);
  };
  service.beforeStopped = [&] {
    for (HDEVNOTIFY registration : registrations)
      EXPECT_TRUE(UnregisterDeviceNotification(registration));
  };
  StartDispatcher();
  ASSERT_TRUE(emu::WaitForServiceState(SERVICE_RUNNING));
  ASSERT_EQ(emu::LiveDeviceNotificationCount(), 3u);
  for (HDEVNOTIFY registration : registrations) ASSERT_NE(registration, nullptr);
  EXPECT_EQ(failedError, ERROR_NOT_ENOUGH_MEMORY);

  std::vector<BYTE> arrivalA = InterfaceRecord(kClassA, u"\\\\?\\HID#VID_1234#A");
  std::vector<BYTE> removalB = InterfaceRecord(kClassB, u"B-path");
  std::vector<BYTE> other = InterfaceRecord(kClassC, u"C-path");
  EXPECT_EQ(emu::DeliverDeviceEvent(DBT_DEVICEARRIVAL, arrivalA.data()).recipients, 2);
  EXPECT_EQ(emu::DeliverDeviceEvent(DBT_DEVICEREMOVECOMPLETE, removalB.data()).recipients, 1);
  EXPECT_EQ(emu::DeliverDeviceEvent(DBT_DEVICEARRIVAL, other.data()).recipients, 0);
  // Volume broadcasts go to windows, not to services.
  DEV_BROADCAST_VOLUME volume{sizeof(DEV_BROADCAST_VOLUME), DBT_DEVTYP_VOLUME, 0, 1u << 4, 0};
  EXPECT_EQ(emu::DeliverDeviceEvent(DBT_DEVICEARRIVAL, &volume).recipients, 0);
  // A handler may deny a query-remove.
  service.queryRemoveAnswer = BROADCAST_QUERY_DENY;
  EXPECT_TRUE(emu::DeliverDeviceEvent(DBT_DEVICEQUERYREMOVE, removalB.data()).denied);
  service.queryRemoveAnswer = NO_ERROR;
  EXPECT_FALSE(emu::DeliverDeviceEvent(DBT_DEVICEQUERYREMOVE, removalB.data()).denied);

  ASSERT_TRUE(emu::SendServiceControl(SERVICE_CONTROL_STOP).delivered);
  ASSERT_TRUE(emu::WaitForDispatcherReturn());
  dispatcher.join();
  EXPECT_EQ(emu::LiveDeviceNotificationCount(), 0u);
  EXPECT_FALSE(UnregisterDeviceNotification(registrations[0]));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);

  // Each delivery ran the handler once, on the dispatcher's thread, with the record.
  std::vector<SeenControl> events;
  for (const SeenControl& seen : service.seen) {
    if (seen.control == SERVICE_CONTROL_DEVICEEVENT) events.push_back(seen);
  }
  ASSERT_EQ(events.size(), 5u);
  for (const SeenControl& seen : events) EXPECT_EQ(seen.threadId, dispatcherThreadId);
  EXPECT_TRUE(events[2].classGuid == kClassB);
  EXPECT_EQ(events[2].eventType, DBT_DEVICEREMOVECOMPLETE);
  EXPECT_EQ(events[2].name, u"B-path");
}

}  // namespace
