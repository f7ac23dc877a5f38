#include <thread>

#include "service_test_support.h"

namespace {

using servicetest::EntryOutput;

bool Installed() {
  SC_HANDLE manager = OpenSCManagerW(nullptr, nullptr, SC_MANAGER_CONNECT);
  if (manager == nullptr) return false;
  SC_HANDLE service = OpenServiceW(manager, SKYVANE_SERVICE_NAME, SERVICE_QUERY_STATUS);
  const bool found = service != nullptr;
  if (service != nullptr) CloseServiceHandle(service);
  CloseServiceHandle(manager);
  return found;
}

class VerbCommands : public ::testing::Test {
 protected:
  void SetUp() override {
    debugMode = false;
    emu::ClearEventLog();
  }
  void TearDown() override {
    if (Installed()) EntryOutput({"-remove"});
  }
};

constexpr const char* kUsage =
    "SkyvaneSvc -install          to install the service\n"
    "SkyvaneSvc -remove           to remove the service\n"
    "SkyvaneSvc -debug <params>   to run as a console app for debugging\n"
    "\nStartServiceCtrlDispatcher being called.\n"
    "This may take several seconds.  Please wait.\n";

TEST_F(VerbCommands, NonVerbPrintsUsageAndTriesTheDispatcher) {
  EXPECT_EQ(EntryOutput({"install"}), kUsage);
  const std::vector<emu::EventLogEntry> log = emu::EventLogEntries();
  ASSERT_EQ(log.size(), 1u);
  ASSERT_EQ(log[0].strings.size(), 2u);
  EXPECT_EQ(servicetest::Utf8(log[0].strings[0]), "SkyvaneSvc error: 1063");
  EXPECT_EQ(servicetest::Utf8(log[0].strings[1]), "StartServiceCtrlDispatcher failed.");
  EXPECT_FALSE(Installed());
}

TEST_F(VerbCommands, RemovingWhatIsNotInstalledReportsOpenServiceFailure) {
  const std::string output = EntryOutput({"-remove"});
  EXPECT_EQ(output.rfind("OpenService failed - ", 0), 0u) << output;
  EXPECT_NE(output.find("(0x424)"), std::string::npos) << output;
  // The host manager cannot launch a process, so the start fails silently.
  EXPECT_EQ(EntryOutput({"/INSTALL"}),
            "Skyvane Service installed.\nAdded description for Skyvane Service.\n");
  EXPECT_TRUE(Installed());
  const std::string second = EntryOutput({"-install"});
  EXPECT_EQ(second.rfind("CreateService failed - ", 0), 0u) << second;
  EXPECT_NE(second.find(" (0x431)\n"), std::string::npos) << second;
  EXPECT_GT(second.size(), std::string("CreateService failed -  (0x431)\n").size())
      << "system text missing";
  EXPECT_EQ(EntryOutput({"-remove"}), "Skyvane Service removed.\n");
  EXPECT_FALSE(Installed());
}

TEST_F(VerbCommands, RemoveStopsARunningServiceFirst) {
  EntryOutput({"-install"});
  emu::BeginServiceSession();
  std::thread service([] { servicetest::RunEntry({}); });
  ASSERT_TRUE(emu::WaitForServiceState(SERVICE_RUNNING));
  const std::string output = EntryOutput({"-remove"});
  ASSERT_TRUE(emu::WaitForDispatcherReturn());
  service.join();
  emu::EndServiceSession();
  EXPECT_EQ(output.rfind("Stopping Skyvane Service.", 0), 0u) << output;
  const std::string tail = "\nSkyvane Service stopped.\nSkyvane Service removed.\n";
  ASSERT_GE(output.size(), tail.size());
  EXPECT_EQ(output.substr(output.size() - tail.size()), tail) << output;
  EXPECT_FALSE(Installed());
  EXPECT_EQ(servicetest::States(emu::ServiceStatusReports()).back(),
            static_cast<DWORD>(SERVICE_STOPPED));
}

}  // namespace
