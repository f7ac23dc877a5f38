#include <atomic>
#include <chrono>
#include <thread>

#include "monitor/monitor_state.h"
#include "monitor/state_lock.h"
#include "service/device_notifications.h"
#include "service/interface_classes.h"
#include "service/service_main.h"
#include "service_test_support.h"

namespace {

using servicetest::States;

std::atomic<DWORD> rescans{0};

void CountRescans(PassKind) {
  StateLock lock;
  rescans = monitorState.rescanCount;
}

class ServiceLifecycle : public ::testing::Test {
 protected:
  void SetUp() override {
    debugMode = false;
    lastError = 0;
    emu::BeginServiceSession();
    emu::ClearEventLog();
    monitorHooks.afterPass = CountRescans;
    rescans = 0;
  }
  void TearDown() override {
    if (entry_.joinable()) {
      emu::SendServiceControl(SERVICE_CONTROL_STOP);
      entry_.join();
    }
    emu::EndServiceSession();
    monitorHooks.afterPass = nullptr;
  }
  void StartService() {
    entry_ = std::thread([] { servicetest::RunEntry({}); });
  }
  void JoinEntry() {
    ASSERT_TRUE(emu::WaitForDispatcherReturn());
    entry_.join();
  }
  static bool WaitForRescans(DWORD count) {
    // Real time: the emulation's Sleep is scaled.
    for (int i = 0; i < 3000 && rescans < count; ++i) {
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return rescans >= count;
  }
  std::thread entry_;
};

TEST_F(ServiceLifecycle, StartAndStopReportInOrderWithGrowingCheckPoints) {
  StartService();
  ASSERT_TRUE(emu::WaitForServiceState(SERVICE_RUNNING));
  const std::size_t beforeInterrogate = emu::ServiceStatusReports().size();
  ASSERT_TRUE(emu::SendServiceControl(SERVICE_CONTROL_INTERROGATE).delivered);
  ASSERT_TRUE(emu::SendServiceControl(SERVICE_CONTROL_STOP).delivered);
  JoinEntry();

  const std::vector<SERVICE_STATUS> reports = emu::ServiceStatusReports();
  ASSERT_EQ(beforeInterrogate, 3u);
  const std::vector<DWORD> expected = {
      SERVICE_START_PENDING, SERVICE_START_PENDING, SERVICE_RUNNING, SERVICE_RUNNING,
      SERVICE_STOP_PENDING,  SERVICE_STOP_PENDING,  SERVICE_STOPPED};
  ASSERT_EQ(States(reports), expected);
  // Pending states carry growing check points; the others 0 (interrogate too).
  DWORD checkPoint = 0;
  for (const SERVICE_STATUS& r : reports) {
    SCOPED_TRACE(r.dwCurrentState);
    const bool starting = r.dwCurrentState == SERVICE_START_PENDING;
    const bool pending = starting || r.dwCurrentState == SERVICE_STOP_PENDING;
    EXPECT_EQ(r.dwCheckPoint != 0, pending);
    EXPECT_TRUE(!pending || r.dwCheckPoint > checkPoint) << r.dwCheckPoint;
    if (pending) checkPoint = r.dwCheckPoint;
    EXPECT_TRUE(!starting || r.dwWaitHint == 3000) << r.dwWaitHint;
    EXPECT_EQ(r.dwServiceType, static_cast<DWORD>(SERVICE_WIN32_OWN_PROCESS));
    EXPECT_EQ(r.dwControlsAccepted, starting ? 0u : DWORD{SERVICE_ACCEPT_STOP});
    EXPECT_EQ(r.dwWin32ExitCode, 0u);
  }
  EXPECT_EQ(emu::LiveDeviceNotificationCount(), 0u);
  EXPECT_TRUE(emu::EventLogEntries().empty());
}

TEST_F(ServiceLifecycle, NullEighthRegistrationRemovesTheSevenAndSkipsTheMonitor) {
  emu::FailDeviceNotificationRegistration(8);
  StartService();
  JoinEntry();
  const std::vector<SERVICE_STATUS> reports = emu::ServiceStatusReports();
  // Registered once the monitor's state exists: its start report comes first.
  const std::vector<DWORD> expected = {SERVICE_START_PENDING, SERVICE_START_PENDING,
                                       SERVICE_STOPPED};
  EXPECT_EQ(States(reports), expected);
  EXPECT_EQ(rescans, 0u);
  EXPECT_EQ(emu::LiveDeviceNotificationCount(), 0u);
  EXPECT_EQ(notificationTable.count, 0);
  for (HDEVNOTIFY handle : notificationTable.handles) EXPECT_EQ(handle, nullptr);
}

TEST_F(ServiceLifecycle, FailedStartReportIsLoggedAndBecomesTheExitCode) {
  emu::FailSetServiceStatus(1, 1, ERROR_INVALID_DATA);
  StartService();
  JoinEntry();
  const std::vector<SERVICE_STATUS> reports = emu::ServiceStatusReports();
  ASSERT_EQ(States(reports), std::vector<DWORD>{SERVICE_STOPPED});
  EXPECT_EQ(reports[0].dwWin32ExitCode, static_cast<DWORD>(ERROR_INVALID_DATA));
  const std::vector<emu::EventLogEntry> log = emu::EventLogEntries();
  ASSERT_EQ(log.size(), 1u);
  EXPECT_EQ(servicetest::Utf8(log[0].source), "SkyvaneSvc");
  EXPECT_EQ(log[0].type, EVENTLOG_ERROR_TYPE);
  ASSERT_EQ(log[0].strings.size(), 2u);
  EXPECT_EQ(servicetest::Utf8(log[0].strings[0]), "SkyvaneSvc error: 13");
  EXPECT_EQ(servicetest::Utf8(log[0].strings[1]), "SetServiceStatus");
}

TEST_F(ServiceLifecycle, DeviceEventReachesTheMonitorAndReReportsTheState) {
  StartService();
  ASSERT_TRUE(emu::WaitForServiceState(SERVICE_RUNNING));
  ASSERT_TRUE(WaitForRescans(1));
  const DWORD before = rescans;
  const std::size_t reported = emu::ServiceStatusReports().size();
  DEV_BROADCAST_DEVICEINTERFACE_W record = {};
  record.dbcc_size = sizeof(record);
  record.dbcc_devicetype = DBT_DEVTYP_DEVICEINTERFACE;
  record.dbcc_classguid = kDiskInterfaceClass;
  const emu::DeviceEventOutcome outcome = emu::DeliverDeviceEvent(DBT_DEVICEARRIVAL, &record);
  EXPECT_EQ(outcome.recipients, 1);
  EXPECT_TRUE(WaitForRescans(before + 1));
  const std::vector<SERVICE_STATUS> reports = emu::ServiceStatusReports();
  ASSERT_GT(reports.size(), reported);
  EXPECT_EQ(reports[reported].dwCurrentState, static_cast<DWORD>(SERVICE_RUNNING));
  EXPECT_EQ(reports[reported].dwCheckPoint, 0u);
}

}  // namespace
