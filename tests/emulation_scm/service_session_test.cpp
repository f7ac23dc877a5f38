// The emulated manager session, running a small service of the test's own
// through StartServiceCtrlDispatcherW.
#include <gtest/gtest.h>

#include <condition_variable>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/posix/emu_scm.h"
#include "platform/wide.h"
#include "platform/win32.h"

namespace {

constexpr GUID kClassA = {
    0x6B1E0C27, 0x5A94, 0x4D3B, {0x9F, 0x10, 0x2C, 0x7E, 0x8A, 0x41, 0xD5, 0xB3}};

// Start-pending until it may run, then registered for one device class and
// running accepting no control; a stop unregisters and reports stopped.
struct FakeService {
  std::mutex lock;
  std::condition_variable changed;
  SERVICE_STATUS_HANDLE handle = nullptr;
  SERVICE_STATUS status{};
  bool mayRun = false;
  bool stopRequested = false;
  DWORD mainThreadId = 0;
  HDEVNOTIFY registration = nullptr;
  std::vector<DWORD> handlerThreads;

  BOOL Report(DWORD state, DWORD accepted, DWORD checkPoint) {
    status = {SERVICE_WIN32_OWN_PROCESS, state, accepted, 0, 0, checkPoint, 0};
    return SetServiceStatus(handle, &status);
  }
} g_service;

DWORD WINAPI FakeHandler(DWORD control, DWORD, LPVOID, LPVOID) {
  FakeService& s = g_service;
  std::lock_guard<std::mutex> guard(s.lock);
  s.handlerThreads.push_back(GetCurrentThreadId());
  if (control == SERVICE_CONTROL_STOP) {
    s.Report(SERVICE_STOP_PENDING, 0, 5);
    s.stopRequested = true;
    s.changed.notify_all();
  } else if (control == SERVICE_CONTROL_INTERROGATE) {
    s.Report(s.status.dwCurrentState, s.status.dwControlsAccepted, 0);
  }
  return NO_ERROR;
}

void FakeMain(DWORD argumentCount, LPWSTR* arguments) {
  FakeService& s = g_service;
  EXPECT_TRUE(argumentCount == 1 && WideEqual(arguments[0], u"EmuTestSvc"));
  SERVICE_STATUS_HANDLE handle = RegisterServiceCtrlHandlerExW(u"EmuTestSvc", FakeHandler, &s);
  std::unique_lock<std::mutex> guard(s.lock);
  s.mainThreadId = GetCurrentThreadId();
  if (handle == nullptr) return;
  s.handle = handle;
  s.Report(SERVICE_START_PENDING, 0, 1);
  s.changed.wait(guard, [&] { return s.mayRun; });
  DEV_BROADCAST_DEVICEINTERFACE_W filter{};
  filter.dbcc_size = sizeof filter;
  filter.dbcc_devicetype = DBT_DEVTYP_DEVICEINTERFACE;
  filter.dbcc_classguid = kClassA;
  s.registration = RegisterDeviceNotificationW(handle, &filter, DEVICE_NOTIFY_SERVICE_HANDLE);
  // Refused reports: an unknown state and a handle the manager never gave.
  SERVICE_STATUS bad{SERVICE_WIN32_OWN_PROCESS, 99, 0, 0, 0, 0, 0};
  EXPECT_FALSE(SetServiceStatus(handle, &bad));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_DATA);
  bad.dwCurrentState = SERVICE_RUNNING;
  EXPECT_FALSE(SetServiceStatus(reinterpret_cast<SERVICE_STATUS_HANDLE>(0x1234), &bad));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
  s.Report(SERVICE_RUNNING, 0, 0);
  s.changed.wait(guard, [&] { return s.stopRequested; });
  EXPECT_TRUE(UnregisterDeviceNotification(s.registration));
  s.Report(SERVICE_STOPPED, 0, 0);
}

TEST(ServiceSession, RunsTheServiceOnTheRightThreadsAndDeliversControlsAsItsStateAllows) {
  emu::BeginServiceSession();
  SC_HANDLE manager = OpenSCManagerW(nullptr, nullptr, SC_MANAGER_ALL_ACCESS);
  SC_HANDLE installed =
      CreateServiceW(manager, u"EmuTestSvc", nullptr, SERVICE_ALL_ACCESS, SERVICE_WIN32_OWN_PROCESS,
                     SERVICE_DEMAND_START, SERVICE_ERROR_NORMAL, u"/bin/true", nullptr, nullptr,
                     nullptr, nullptr, nullptr);
  ASSERT_NE(installed, nullptr);
  static SERVICE_TABLE_ENTRYW table[] = {{const_cast<LPWSTR>(u"EmuTestSvc"), FakeMain},
                                         {nullptr, nullptr}};
  DWORD dispatcherThreadId = 0;
  BOOL dispatcherResult = FALSE;
  std::thread dispatcher([&] {
    dispatcherThreadId = GetCurrentThreadId();
    dispatcherResult = StartServiceCtrlDispatcherW(table);
  });
  SERVICE_STATUS status{};
  auto control = [&](DWORD code, DWORD state) {
    SetLastError(0);
    BOOL done = ControlService(installed, code, &status);
    EXPECT_EQ(status.dwCurrentState, state);
    return done ? 0 : GetLastError();
  };
  ASSERT_TRUE(emu::WaitForServiceState(SERVICE_START_PENDING));
  EXPECT_EQ(control(SERVICE_CONTROL_STOP, SERVICE_START_PENDING), ERROR_SERVICE_CANNOT_ACCEPT_CTRL);
  EXPECT_FALSE(StartServiceW(installed, 0, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_SERVICE_ALREADY_RUNNING);
  {
    std::lock_guard<std::mutex> guard(g_service.lock);
    g_service.mayRun = true;
    g_service.changed.notify_all();
  }
  ASSERT_TRUE(emu::WaitForServiceState(SERVICE_RUNNING));
  EXPECT_EQ(control(SERVICE_CONTROL_STOP, SERVICE_RUNNING), ERROR_INVALID_SERVICE_CONTROL);
  EXPECT_EQ(control(SERVICE_CONTROL_INTERROGATE, SERVICE_RUNNING), 0u);
  // Device events are the system's to send.
  EXPECT_EQ(control(SERVICE_CONTROL_DEVICEEVENT, SERVICE_RUNNING), ERROR_INVALID_PARAMETER);

  ASSERT_EQ(emu::LiveDeviceNotificationCount(), 1u);
  DEV_BROADCAST_DEVICEINTERFACE_W record{sizeof record, DBT_DEVTYP_DEVICEINTERFACE, 0, kClassA, {}};
  EXPECT_EQ(emu::DeliverDeviceEvent(DBT_DEVICEARRIVAL, &record).recipients, 1);
  // Volume broadcasts go to windows, not to services.
  DEV_BROADCAST_VOLUME volume{sizeof(DEV_BROADCAST_VOLUME), DBT_DEVTYP_VOLUME, 0, 1u << 4, 0};
  EXPECT_EQ(emu::DeliverDeviceEvent(DBT_DEVICEARRIVAL, &volume).recipients, 0);

  ASSERT_TRUE(emu::SendServiceControl(SERVICE_CONTROL_STOP).delivered);
  ASSERT_TRUE(emu::WaitForDispatcherReturn());
  dispatcher.join();
  EXPECT_TRUE(dispatcherResult);
  EXPECT_EQ(control(SERVICE_CONTROL_STOP, SERVICE_STOPPED), ERROR_SERVICE_NOT_ACTIVE);
  EXPECT_FALSE(emu::SendServiceControl(SERVICE_CONTROL_INTERROGATE).delivered);
  EXPECT_EQ(emu::LiveDeviceNotificationCount(), 0u);
  EXPECT_FALSE(UnregisterDeviceNotification(g_service.registration));

  // Handlers ran on the dispatcher's thread, the main function on another.
  emu::ServiceSessionState state = emu::ServiceSessionSnapshot();
  EXPECT_TRUE(state.mainReturned);
  EXPECT_EQ(state.dispatcherThreadId, dispatcherThreadId);
  EXPECT_EQ(state.mainThreadId, g_service.mainThreadId);
  EXPECT_NE(g_service.mainThreadId, dispatcherThreadId);
  EXPECT_NE(g_service.mainThreadId, GetCurrentThreadId());
  EXPECT_EQ(g_service.handlerThreads.size(), 3u);  // interrogate, event, stop
  for (DWORD thread : g_service.handlerThreads) EXPECT_EQ(thread, dispatcherThreadId);
  // The refused reports were not kept.
  std::vector<DWORD> states;
  for (const SERVICE_STATUS& report : emu::ServiceStatusReports())
    states.push_back(report.dwCurrentState);
  EXPECT_EQ(states, (std::vector<DWORD>{SERVICE_START_PENDING, SERVICE_RUNNING, SERVICE_RUNNING,
                                        SERVICE_STOP_PENDING, SERVICE_STOPPED}));
  EXPECT_TRUE(DeleteService(installed));
  EXPECT_TRUE(CloseServiceHandle(installed));
  EXPECT_TRUE(CloseServiceHandle(manager));
  emu::EndServiceSession();
}

}  // namespace
