// The emulated manager session: a small service of the test's own is run by
// StartServiceCtrlDispatcherW as Windows runs one, and driven through the
// session API, ControlService and device events.
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
// running, waits for a stop, reports stopped. Hooks let cases vary it.
struct FakeService {
  std::mutex lock;
  std::condition_variable changed;
  SERVICE_STATUS_HANDLE handle = nullptr;
  SERVICE_STATUS status{};
  bool stopRequested = false;
  bool mayRun = true;  // cleared to hold the service in start-pending
  DWORD acceptWhenRunning = SERVICE_ACCEPT_STOP;
  DWORD registerError = 0;
  BOOL firstReport = TRUE;
  DWORD firstReportError = 0;
  DWORD mainThreadId = 0;
  WideString argument0;
  DWORD argumentCount = 0;
  DWORD queryRemoveAnswer = NO_ERROR;
  std::vector<SeenControl> seen;
  std::function<void()> beforeRunning;  // runs on the main thread before the running report
  std::function<void()> beforeStopped;

  void Reset() {
    std::lock_guard<std::mutex> guard(lock);
    handle = nullptr;
    status = SERVICE_STATUS{};
    stopRequested = false;
    mayRun = true;
    acceptWhenRunning = SERVICE_ACCEPT_STOP;
    registerError = 0;
    firstReport = TRUE;
    firstReportError = 0;
    mainThreadId = 0;
    argument0.clear();
    argumentCount = 0;
    queryRemoveAnswer = NO_ERROR;
    seen.clear();
    beforeRunning = nullptr;
    beforeStopped = nullptr;
  }
  BOOL Report(DWORD state, DWORD accepted, DWORD checkPoint) {
    status.dwServiceType = SERVICE_WIN32_OWN_PROCESS;
    status.dwCurrentState = state;
    status.dwControlsAccepted = accepted;
    status.dwCheckPoint = checkPoint;
    status.dwWaitHint = state == SERVICE_START_PENDING ? 3000 : 0;
    return SetServiceStatus(handle, &status);
  }
};

FakeService g_service;

DWORD WINAPI FakeHandler(DWORD control, DWORD eventType, LPVOID eventData, LPVOID context) {
  EXPECT_EQ(context, &g_service);
  SeenControl seen{control, eventType, GetCurrentThreadId(), {}, {}};
  if (control == SERVICE_CONTROL_DEVICEEVENT && eventData != nullptr) {
    auto* record = static_cast<DEV_BROADCAST_DEVICEINTERFACE_W*>(eventData);
    seen.classGuid = record->dbcc_classguid;
    seen.name = record->dbcc_name;
  }
  std::lock_guard<std::mutex> guard(g_service.lock);
  g_service.seen.push_back(seen);
  if (control == SERVICE_CONTROL_STOP) {
    g_service.Report(SERVICE_STOP_PENDING, SERVICE_ACCEPT_STOP, 5);
    g_service.stopRequested = true;
    g_service.changed.notify_all();
  } else if (control == SERVICE_CONTROL_INTERROGATE) {
    g_service.Report(g_service.status.dwCurrentState, g_service.status.dwControlsAccepted, 0);
  } else if (control == SERVICE_CONTROL_DEVICEEVENT && eventType == DBT_DEVICEQUERYREMOVE) {
    return g_service.queryRemoveAnswer;
  }
  return NO_ERROR;
}

void FakeMain(DWORD argumentCount, LPWSTR* arguments) {
  FakeService& s = g_service;
  {
    std::lock_guard<std::mutex> guard(s.lock);
    s.mainThreadId = GetCurrentThreadId();
    s.argumentCount = argumentCount;
    s.argument0 = arguments[0];
  }
  SERVICE_STATUS_HANDLE handle = RegisterServiceCtrlHandlerExW(u"EmuTestSvc", FakeHandler, &s);
  std::unique_lock<std::mutex> guard(s.lock);
  if (handle == nullptr) {
    s.registerError = GetLastError();
    return;
  }
  s.handle = handle;
  s.firstReport = s.Report(SERVICE_START_PENDING, 0, 1);
  if (!s.firstReport) {
    s.firstReportError = GetLastError();
  } else {
    s.changed.wait(guard, [&] { return s.mayRun; });
    auto hook = s.beforeRunning;
    guard.unlock();
    if (hook) hook();
    guard.lock();
    s.Report(SERVICE_RUNNING, s.acceptWhenRunning, 0);
    s.changed.wait(guard, [&] { return s.stopRequested; });
  }
  auto hook = s.beforeStopped;
  guard.unlock();
  if (hook) hook();
  guard.lock();
  s.Report(SERVICE_STOPPED, 0, 0);
}

SERVICE_TABLE_ENTRYW g_table[] = {{const_cast<LPWSTR>(u"EmuTestSvc"), FakeMain},
                                  {nullptr, nullptr}};

// Runs the dispatcher on a thread of the test, as the service's entry does.
class Dispatcher {
 public:
  Dispatcher() {
    thread_ = std::thread([this] {
      threadId_ = GetCurrentThreadId();
      result_ = StartServiceCtrlDispatcherW(g_table);
      error_ = GetLastError();
    });
  }
  ~Dispatcher() { Join(); }
  void Join() {
    if (thread_.joinable()) thread_.join();
  }
  BOOL Result() const { return result_; }
  DWORD Error() const { return error_; }
  DWORD ThreadId() const { return threadId_; }

 private:
  std::thread thread_;
  BOOL result_ = FALSE;
  DWORD error_ = 0;
  DWORD threadId_ = 0;
};

class ServiceSession : public ::testing::Test {
 protected:
  void SetUp() override {
    g_service.Reset();
    emu::BeginServiceSession();
  }
  void TearDown() override { emu::EndServiceSession(); }

  static std::vector<DWORD> States() {
    std::vector<DWORD> states;
    for (const SERVICE_STATUS& status : emu::ServiceStatusReports())
      states.push_back(status.dwCurrentState);
    return states;
  }
  static void SetMayRun(bool value) {
    std::lock_guard<std::mutex> guard(g_service.lock);
    g_service.mayRun = value;
    g_service.changed.notify_all();
  }
};

TEST(ServiceDispatcher, FailsWithoutAManagerSession) {
  SetLastError(0);
  EXPECT_FALSE(StartServiceCtrlDispatcherW(g_table));
  EXPECT_EQ(GetLastError(), ERROR_FAILED_SERVICE_CONTROLLER_CONNECT);
  emu::BeginServiceSession();
  emu::EndServiceSession();
  SetLastError(0);
  EXPECT_FALSE(StartServiceCtrlDispatcherW(g_table));
  EXPECT_EQ(GetLastError(), ERROR_FAILED_SERVICE_CONTROLLER_CONNECT);
  // Outside a dispatcher no handler can be registered.
  EXPECT_EQ(RegisterServiceCtrlHandlerExW(u"EmuTestSvc", FakeHandler, nullptr), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_SERVICE_DOES_NOT_EXIST);
}

TEST_F(ServiceSession, RunsTheServiceAndItsControlsOnTheRightThreads) {
  Dispatcher dispatcher;
  ASSERT_TRUE(emu::WaitForServiceState(SERVICE_RUNNING));
  emu::ControlResult interrogate = emu::SendServiceControl(SERVICE_CONTROL_INTERROGATE);
  ASSERT_TRUE(interrogate.delivered);
  EXPECT_EQ(interrogate.handlerResult, static_cast<DWORD>(NO_ERROR));
  emu::ControlResult stop = emu::SendServiceControl(SERVICE_CONTROL_STOP);
  ASSERT_TRUE(stop.delivered);
  ASSERT_TRUE(emu::WaitForDispatcherReturn());
  dispatcher.Join();
  EXPECT_TRUE(dispatcher.Result());

  emu::ServiceSessionState state = emu::ServiceSessionSnapshot();
  EXPECT_TRUE(state.mainReturned);
  EXPECT_EQ(state.serviceName, u"EmuTestSvc");
  // Handlers run on the dispatcher's thread; the main function on another.
  EXPECT_EQ(state.dispatcherThreadId, dispatcher.ThreadId());
  EXPECT_EQ(interrogate.threadId, dispatcher.ThreadId());
  EXPECT_EQ(stop.threadId, dispatcher.ThreadId());
  EXPECT_EQ(state.mainThreadId, g_service.mainThreadId);
  EXPECT_NE(g_service.mainThreadId, dispatcher.ThreadId());
  EXPECT_NE(g_service.mainThreadId, GetCurrentThreadId());
  EXPECT_EQ(g_service.argumentCount, 1u);
  EXPECT_EQ(g_service.argument0, u"EmuTestSvc");

  // Every report, complete and in order.
  std::vector<SERVICE_STATUS> reports = emu::ServiceStatusReports();
  ASSERT_EQ(States(), (std::vector<DWORD>{SERVICE_START_PENDING, SERVICE_RUNNING, SERVICE_RUNNING,
                                          SERVICE_STOP_PENDING, SERVICE_STOPPED}));
  EXPECT_EQ(reports[0].dwCheckPoint, 1u);
  EXPECT_EQ(reports[0].dwWaitHint, 3000u);
  EXPECT_EQ(reports[0].dwControlsAccepted, 0u);
  EXPECT_EQ(reports[1].dwControlsAccepted, static_cast<DWORD>(SERVICE_ACCEPT_STOP));
  EXPECT_EQ(reports[3].dwCheckPoint, 5u);
  EXPECT_EQ(reports[4].dwServiceType, SERVICE_WIN32_OWN_PROCESS);

  // A stopped service takes no more controls.
  EXPECT_FALSE(emu::SendServiceControl(SERVICE_CONTROL_INTERROGATE).delivered);
}

TEST_F(ServiceSession, FailedHandlerRegistrationEndsTheDispatcher) {
  emu::FailRegisterServiceCtrlHandler(ERROR_NOT_ENOUGH_MEMORY);
  Dispatcher dispatcher;
  ASSERT_TRUE(emu::WaitForDispatcherReturn());
  dispatcher.Join();
  EXPECT_TRUE(dispatcher.Result());
  EXPECT_EQ(g_service.registerError, ERROR_NOT_ENOUGH_MEMORY);
  EXPECT_TRUE(emu::ServiceStatusReports().empty());
  EXPECT_FALSE(emu::SendServiceControl(SERVICE_CONTROL_STOP).delivered);
}

TEST_F(ServiceSession, FailedStatusReportsAreNotRecorded) {
  emu::FailSetServiceStatus(1, 1, ERROR_INVALID_DATA);
  Dispatcher dispatcher;
  ASSERT_TRUE(emu::WaitForDispatcherReturn());
  dispatcher.Join();
  EXPECT_FALSE(g_service.firstReport);
  EXPECT_EQ(g_service.firstReportError, ERROR_INVALID_DATA);
  EXPECT_EQ(States(), (std::vector<DWORD>{SERVICE_STOPPED}));
  EXPECT_EQ(emu::ServiceSessionSnapshot().setStatusCalls, 2u);
}

TEST_F(ServiceSession, StatusReportsAreValidated) {
  g_service.beforeRunning = [] {
    SERVICE_STATUS bad{SERVICE_WIN32_OWN_PROCESS, 99, 0, 0, 0, 0, 0};
    EXPECT_FALSE(SetServiceStatus(g_service.handle, &bad));
    EXPECT_EQ(GetLastError(), ERROR_INVALID_DATA);
    SERVICE_STATUS good{SERVICE_WIN32_OWN_PROCESS, SERVICE_RUNNING, 0, 0, 0, 0, 0};
    EXPECT_FALSE(SetServiceStatus(reinterpret_cast<SERVICE_STATUS_HANDLE>(0x1234), &good));
    EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
  };
  Dispatcher dispatcher;
  ASSERT_TRUE(emu::WaitForServiceState(SERVICE_RUNNING));
  ASSERT_TRUE(emu::SendServiceControl(SERVICE_CONTROL_STOP).delivered);
  ASSERT_TRUE(emu::WaitForDispatcherReturn());
  EXPECT_EQ(States(), (std::vector<DWORD>{SERVICE_START_PENDING, SERVICE_RUNNING,
                                          SERVICE_STOP_PENDING, SERVICE_STOPPED}));
}

// The installed-service calls reach the service running in the session.
TEST_F(ServiceSession, ControlServiceFollowsTheServiceState) {
  SC_HANDLE manager = OpenSCManagerW(nullptr, nullptr, SC_MANAGER_ALL_ACCESS);
  ASSERT_NE(manager, nullptr);
  SC_HANDLE service =
      CreateServiceW(manager, u"EmuTestSvc", u"Emu Test Service", SERVICE_ALL_ACCESS,
                     SERVICE_WIN32_OWN_PROCESS, SERVICE_DEMAND_START, SERVICE_ERROR_NORMAL,
                     u"/bin/true", nullptr, nullptr, nullptr, nullptr, nullptr);
  ASSERT_NE(service, nullptr);

  SetMayRun(false);
  g_service.acceptWhenRunning = 0;
  Dispatcher dispatcher;
  ASSERT_TRUE(emu::WaitForServiceState(SERVICE_START_PENDING));
  SERVICE_STATUS status{};
  EXPECT_FALSE(ControlService(service, SERVICE_CONTROL_STOP, &status));
  EXPECT_EQ(GetLastError(), ERROR_SERVICE_CANNOT_ACCEPT_CTRL);
  EXPECT_EQ(status.dwCurrentState, SERVICE_START_PENDING);
  ASSERT_TRUE(QueryServiceStatus(service, &status));
  EXPECT_EQ(status.dwCurrentState, SERVICE_START_PENDING);
  EXPECT_FALSE(StartServiceW(service, 0, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_SERVICE_ALREADY_RUNNING);

  SetMayRun(true);
  ASSERT_TRUE(emu::WaitForServiceState(SERVICE_RUNNING));
  // Running, but not accepting stop.
  EXPECT_FALSE(ControlService(service, SERVICE_CONTROL_STOP, &status));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_SERVICE_CONTROL);
  ASSERT_TRUE(ControlService(service, SERVICE_CONTROL_INTERROGATE, &status));
  EXPECT_EQ(status.dwCurrentState, SERVICE_RUNNING);
  // Device events are the system's to send.
  EXPECT_FALSE(ControlService(service, SERVICE_CONTROL_DEVICEEVENT, &status));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_PARAMETER);

  ASSERT_TRUE(emu::SendServiceControl(SERVICE_CONTROL_STOP).delivered);
  ASSERT_TRUE(emu::WaitForDispatcherReturn());
  EXPECT_FALSE(ControlService(service, SERVICE_CONTROL_STOP, &status));
  EXPECT_EQ(GetLastError(), ERROR_SERVICE_NOT_ACTIVE);
  EXPECT_EQ(status.dwCurrentState, SERVICE_STOPPED);

  EXPECT_TRUE(DeleteService(service));
  EXPECT_TRUE(CloseServiceHandle(service));
  EXPECT_TRUE(CloseServiceHandle(manager));
}

TEST_F(ServiceSession, StopThroughControlServiceReturnsTheNewStatus) {
  SC_HANDLE manager = OpenSCManagerW(nullptr, nullptr, SC_MANAGER_ALL_ACCESS);
  SC_HANDLE service =
      CreateServiceW(manager, u"EmuTestSvc", nullptr, SERVICE_ALL_ACCESS, SERVICE_WIN32_OWN_PROCESS,
                     SERVICE_DEMAND_START, SERVICE_ERROR_NORMAL, u"/bin/true", nullptr, nullptr,
                     nullptr, nullptr, nullptr);
  ASSERT_NE(service, nullptr);
  // Holding the main before its stopped report keeps the state stop-pending.
  std::mutex holdLock;
  std::condition_variable holdChanged;
  bool release = false;
  g_service.beforeStopped = [&] {
    std::unique_lock<std::mutex> guard(holdLock);
    holdChanged.wait(guard, [&] { return release; });
  };
  Dispatcher dispatcher;
  ASSERT_TRUE(emu::WaitForServiceState(SERVICE_RUNNING));
  SERVICE_STATUS status{};
  ASSERT_TRUE(ControlService(service, SERVICE_CONTROL_STOP, &status));
  EXPECT_EQ(status.dwCurrentState, SERVICE_STOP_PENDING);
  ASSERT_TRUE(QueryServiceStatus(service, &status));
  EXPECT_EQ(status.dwCurrentState, SERVICE_STOP_PENDING);
  {
    std::lock_guard<std::mutex> guard(holdLock);
    release = true;
    holdChanged.notify_all();
  }
  ASSERT_TRUE(emu::WaitForDispatcherReturn());
  ASSERT_TRUE(QueryServiceStatus(service, &status));
  EXPECT_EQ(status.dwCurrentState, SERVICE_STOPPED);
  EXPECT_TRUE(DeleteService(service));
  CloseServiceHandle(service);
  CloseServiceHandle(manager);
}

std::vector<BYTE> InterfaceRecord(const GUID& classGuid, const char16_t* name) {
  std::size_t units = WideLength(name) + 1;
  std::vector<BYTE> bytes(offsetof(DEV_BROADCAST_DEVICEINTERFACE_W, dbcc_name) +
                          units * sizeof(WCHAR));
  DEV_BROADCAST_DEVICEINTERFACE_W header{};
  header.dbcc_size = static_cast<DWORD>(bytes.size());
  header.dbcc_devicetype = DBT_DEVTYP_DEVICEINTERFACE;
  header.dbcc_classguid = classGuid;
  std::memcpy(bytes.data(), &header, offsetof(DEV_BROADCAST_DEVICEINTERFACE_W, dbcc_name));
  std::memcpy(bytes.data() + offsetof(DEV_BROADCAST_DEVICEINTERFACE_W, dbcc_name), name,
              units * sizeof(WCHAR));
  return bytes;
}

HDEVNOTIFY Register(const GUID& classGuid) {
  DEV_BROADCAST_DEVICEINTERFACE_W filter{};
  filter.dbcc_size = sizeof filter;
  filter.dbcc_devicetype = DBT_DEVTYP_DEVICEINTERFACE;
  filter.dbcc_classguid = classGuid;
  return RegisterDeviceNotificationW(g_service.handle, &filter, DEVICE_NOTIFY_SERVICE_HANDLE);
}

TEST_F(ServiceSession, DeviceEventsReachTheRegistrationsForTheirClass) {
  std::vector<HDEVNOTIFY> registrations;
  DWORD failedError = 0;
  g_service.beforeRunning = [&] {
    registrations.push_back(Register(kClassA));
    registrations.push_back(Register(kClassA));
    registrations.push_back(Register(kClassB));
    emu::FailDeviceNotificationRegistration(1, ERROR_NOT_ENOUGH_MEMORY);
    if (Register(kClassC) == nullptr) failedError = GetLastError();
    emu::FailDeviceNotificationRegistration(0);
  };
  g_service.beforeStopped = [&] {
    for (HDEVNOTIFY registration : registrations)
      EXPECT_TRUE(UnregisterDeviceNotification(registration));
  };
  Dispatcher dispatcher;
  ASSERT_TRUE(emu::WaitForServiceState(SERVICE_RUNNING));
  ASSERT_EQ(emu::LiveDeviceNotificationCount(), 3u);
  for (HDEVNOTIFY registration : registrations) ASSERT_NE(registration, nullptr);
  EXPECT_EQ(failedError, ERROR_NOT_ENOUGH_MEMORY);

  std::vector<BYTE> arrivalA = InterfaceRecord(kClassA, u"\\\\?\\HID#VID_1234#A");
  emu::DeviceEventOutcome outcome = emu::DeliverDeviceEvent(DBT_DEVICEARRIVAL, arrivalA.data());
  EXPECT_EQ(outcome.recipients, 2);
  std::vector<BYTE> removalB = InterfaceRecord(kClassB, u"B-path");
  EXPECT_EQ(emu::DeliverDeviceEvent(DBT_DEVICEREMOVECOMPLETE, removalB.data()).recipients, 1);
  std::vector<BYTE> other = InterfaceRecord(kClassC, u"C-path");
  EXPECT_EQ(emu::DeliverDeviceEvent(DBT_DEVICEARRIVAL, other.data()).recipients, 0);
  // Volume broadcasts go to windows, not to services.
  DEV_BROADCAST_VOLUME volume{sizeof(DEV_BROADCAST_VOLUME), DBT_DEVTYP_VOLUME, 0, 1u << 4, 0};
  EXPECT_EQ(emu::DeliverDeviceEvent(DBT_DEVICEARRIVAL, &volume).recipients, 0);
  // A handler may deny a query-remove.
  g_service.queryRemoveAnswer = BROADCAST_QUERY_DENY;
  EXPECT_TRUE(emu::DeliverDeviceEvent(DBT_DEVICEQUERYREMOVE, removalB.data()).denied);
  g_service.queryRemoveAnswer = NO_ERROR;
  EXPECT_FALSE(emu::DeliverDeviceEvent(DBT_DEVICEQUERYREMOVE, removalB.data()).denied);

  ASSERT_TRUE(emu::SendServiceControl(SERVICE_CONTROL_STOP).delivered);
  ASSERT_TRUE(emu::WaitForDispatcherReturn());
  dispatcher.Join();
  EXPECT_EQ(emu::LiveDeviceNotificationCount(), 0u);
  EXPECT_FALSE(UnregisterDeviceNotification(registrations[0]));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);

  std::vector<SeenControl> events;
  for (const SeenControl& seen : g_service.seen) {
    if (seen.control == SERVICE_CONTROL_DEVICEEVENT) events.push_back(seen);
  }
  ASSERT_EQ(events.size(), 5u);
  for (const SeenControl& seen : events) EXPECT_EQ(seen.threadId, dispatcher.ThreadId());
  EXPECT_EQ(events[0].eventType, DBT_DEVICEARRIVAL);
  EXPECT_TRUE(events[0].classGuid == kClassA);
  EXPECT_EQ(events[0].name, u"\\\\?\\HID#VID_1234#A");
  EXPECT_TRUE(events[2].classGuid == kClassB);
  EXPECT_EQ(events[2].eventType, DBT_DEVICEREMOVECOMPLETE);
  EXPECT_EQ(events[2].name, u"B-path");
}

TEST(DeviceNotifications, RegistrationChecksItsArguments) {
  DEV_BROADCAST_DEVICEINTERFACE_W filter{};
  filter.dbcc_size = sizeof filter;
  filter.dbcc_devicetype = DBT_DEVTYP_DEVICEINTERFACE;
  // No running service behind this recipient.
  EXPECT_EQ(RegisterDeviceNotificationW(reinterpret_cast<HANDLE>(0x40), &filter,
                                        DEVICE_NOTIFY_SERVICE_HANDLE),
            nullptr);
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
  filter.dbcc_devicetype = DBT_DEVTYP_VOLUME;
  EXPECT_EQ(RegisterDeviceNotificationW(reinterpret_cast<HANDLE>(0x40), &filter,
                                        DEVICE_NOTIFY_WINDOW_HANDLE),
            nullptr);
  EXPECT_EQ(GetLastError(), ERROR_INVALID_DATA);
  EXPECT_EQ(RegisterDeviceNotificationW(reinterpret_cast<HANDLE>(0x40), nullptr,
                                        DEVICE_NOTIFY_WINDOW_HANDLE),
            nullptr);
  EXPECT_EQ(GetLastError(), ERROR_INVALID_PARAMETER);
  // A window recipient is accepted; it counts and is removed like any other.
  filter.dbcc_devicetype = DBT_DEVTYP_DEVICEINTERFACE;
  HDEVNOTIFY window = RegisterDeviceNotificationW(reinterpret_cast<HANDLE>(0x40), &filter,
                                                  DEVICE_NOTIFY_WINDOW_HANDLE);
  ASSERT_NE(window, nullptr);
  EXPECT_EQ(emu::LiveDeviceNotificationCount(), 1u);
  EXPECT_FALSE(CloseHandle(window));
  EXPECT_TRUE(UnregisterDeviceNotification(window));
  EXPECT_EQ(emu::LiveDeviceNotificationCount(), 0u);
}

}  // namespace
