// The emulated service database (install and remove, kept in the registry
// where Windows keeps it and so seen by every process) and the event log.
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <string>

#include "platform/posix/emu_scm.h"
#include "platform/wide.h"
#include "platform/win32.h"

namespace {

constexpr const WCHAR* kKey = u"SYSTEM\\CurrentControlSet\\Services\\EmuDbSvc";

// A value of the service's key as text ("<no key>" when the key is missing)
// or, for a DWORD, its number.
std::string Stored(const WCHAR* name) {
  HKEY key = nullptr;
  if (RegOpenKeyExW(HKEY_LOCAL_MACHINE, kKey, 0, KEY_READ, &key) != ERROR_SUCCESS) {
    return "<no key>";
  }
  WCHAR data[256] = {};
  DWORD type = 0;
  DWORD size = sizeof data - sizeof(WCHAR);
  LSTATUS status =
      RegQueryValueExW(key, name, nullptr, &type, reinterpret_cast<BYTE*>(data), &size);
  RegCloseKey(key);
  if (status != ERROR_SUCCESS) return "<no value>";
  if (type == REG_DWORD) return std::to_string(*reinterpret_cast<DWORD*>(data));
  return std::to_string(type) + ":" + WideToUtf8(data);
}

SC_HANDLE Install(SC_HANDLE manager, const WCHAR* name = u"EmuDbSvc",
                  const WCHAR* displayName = u"Emu Db Service") {
  return CreateServiceW(manager, name, displayName, SERVICE_ALL_ACCESS, SERVICE_WIN32_OWN_PROCESS,
                        SERVICE_AUTO_START, SERVICE_ERROR_NORMAL, u"/opt/emu db/svc", nullptr,
                        nullptr, u"\0", nullptr, nullptr);
}

// Installed by another process, found, described, refused twice, removed as
// the remove verb does it.
TEST(ServiceDatabase, InstallQueryAndRemove) {
  pid_t pid = fork();
  ASSERT_GE(pid, 0);
  if (pid == 0) {
    SC_HANDLE manager = OpenSCManagerW(nullptr, nullptr, SC_MANAGER_ALL_ACCESS);
    _exit(manager != nullptr && Install(manager) != nullptr ? 0 : 1);
  }
  int exitStatus = 0;
  ASSERT_EQ(waitpid(pid, &exitStatus, 0), pid);
  ASSERT_TRUE(WIFEXITED(exitStatus) && WEXITSTATUS(exitStatus) == 0);

  EXPECT_EQ(Stored(u"ImagePath"), "2:/opt/emu db/svc");  // REG_EXPAND_SZ
  EXPECT_EQ(Stored(u"DisplayName"), "1:Emu Db Service");
  EXPECT_EQ(Stored(u"ObjectName"), "1:LocalSystem");
  EXPECT_EQ(Stored(u"Type"), std::to_string(SERVICE_WIN32_OWN_PROCESS));
  EXPECT_EQ(Stored(u"Start"), std::to_string(SERVICE_AUTO_START));
  EXPECT_EQ(Stored(u"ErrorControl"), std::to_string(SERVICE_ERROR_NORMAL));

  SC_HANDLE connectOnly = OpenSCManagerW(nullptr, nullptr, SC_MANAGER_CONNECT);
  ASSERT_NE(connectOnly, nullptr);
  EXPECT_EQ(Install(connectOnly, u"Other"), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_ACCESS_DENIED);
  EXPECT_TRUE(CloseServiceHandle(connectOnly));
  SC_HANDLE manager = OpenSCManagerW(nullptr, SERVICES_ACTIVE_DATABASEW, SC_MANAGER_ALL_ACCESS);
  ASSERT_NE(manager, nullptr);
  EXPECT_EQ(Install(manager, u"EMUDBSVC", nullptr), nullptr);  // names compare without case
  EXPECT_EQ(GetLastError(), ERROR_SERVICE_EXISTS);
  EXPECT_EQ(Install(manager, u"bad\\name", nullptr), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_INVALID_NAME);

  SC_HANDLE service = OpenServiceW(manager, u"EmuDbSvc", SERVICE_ALL_ACCESS);
  ASSERT_NE(service, nullptr);
  SERVICE_DESCRIPTIONW description{const_cast<LPWSTR>(u"Describes it.")};
  EXPECT_TRUE(ChangeServiceConfig2W(service, SERVICE_CONFIG_DESCRIPTION, &description));
  EXPECT_EQ(Stored(u"Description"), "1:Describes it.");
  // Not running: no control, stopped status, and it cannot be started here.
  SERVICE_STATUS status{};
  EXPECT_FALSE(ControlService(service, SERVICE_CONTROL_STOP, &status));
  EXPECT_EQ(GetLastError(), ERROR_SERVICE_NOT_ACTIVE);
  ASSERT_TRUE(QueryServiceStatus(service, &status));
  EXPECT_EQ(status.dwCurrentState, SERVICE_STOPPED);
  EXPECT_FALSE(StartServiceW(service, 0, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_NOT_SUPPORTED);
  EXPECT_TRUE(CloseServiceHandle(service));
  // A manager handle is not a service handle, and neither is a kernel handle.
  EXPECT_FALSE(QueryServiceStatus(manager, &status));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
  EXPECT_FALSE(CloseHandle(manager));

  // Removal with delete, stop and query rights only.
  SC_HANDLE remover =
      OpenServiceW(manager, u"emudbsvc", DELETE | SERVICE_STOP | SERVICE_QUERY_STATUS);
  ASSERT_NE(remover, nullptr);
  EXPECT_FALSE(ChangeServiceConfig2W(remover, SERVICE_CONFIG_DESCRIPTION, &description));
  EXPECT_EQ(GetLastError(), ERROR_ACCESS_DENIED);
  EXPECT_TRUE(DeleteService(remover));
  EXPECT_FALSE(DeleteService(remover));
  EXPECT_EQ(GetLastError(), ERROR_SERVICE_MARKED_FOR_DELETE);
  EXPECT_TRUE(CloseServiceHandle(remover));
  EXPECT_FALSE(CloseServiceHandle(remover));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
  EXPECT_EQ(Stored(u"ImagePath"), "<no key>");
  EXPECT_EQ(OpenServiceW(manager, u"EmuDbSvc", SERVICE_ALL_ACCESS), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_SERVICE_DOES_NOT_EXIST);
  EXPECT_TRUE(CloseServiceHandle(manager));
}

TEST(EventLog, EntriesAreRecordedAndWrittenToTheLogFile) {
  char directory[] = "/tmp/skyvane-eventlog-XXXXXX";
  ASSERT_NE(mkdtemp(directory), nullptr);
  std::string file = std::string(directory) + "/events.log";
  setenv("SKYVANE_EVENTLOG", file.c_str(), 1);
  emu::ClearEventLog();
  HANDLE source = RegisterEventSourceW(nullptr, u"EmuSource");
  ASSERT_NE(source, nullptr);
  const WCHAR* strings[2] = {u"EmuSource error: 5", u"Two\tfields\r\n"};
  BYTE raw[3] = {1, 2, 3};
  EXPECT_TRUE(ReportEventW(source, EVENTLOG_ERROR_TYPE, 0, 0, nullptr, 2, 0, strings, nullptr));
  EXPECT_TRUE(
      ReportEventW(source, EVENTLOG_WARNING_TYPE, 3, 1001, nullptr, 0, sizeof raw, nullptr, raw));
  EXPECT_FALSE(ReportEventW(source, 3, 0, 0, nullptr, 0, 0, nullptr, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_PARAMETER);
  EXPECT_TRUE(DeregisterEventSource(source));
  EXPECT_FALSE(ReportEventW(source, EVENTLOG_ERROR_TYPE, 0, 0, nullptr, 0, 0, nullptr, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
  emu::FailRegisterEventSource(ERROR_ACCESS_DENIED);
  EXPECT_EQ(RegisterEventSourceW(nullptr, u"EmuSource"), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_ACCESS_DENIED);
  emu::FailRegisterEventSource(0);
  unsetenv("SKYVANE_EVENTLOG");

  std::vector<emu::EventLogEntry> entries = emu::EventLogEntries();
  ASSERT_EQ(entries.size(), 2u);
  EXPECT_EQ(entries[0].type, EVENTLOG_ERROR_TYPE);
  EXPECT_EQ(entries[0].strings, (std::vector<WideString>{strings[0], strings[1]}));
  EXPECT_EQ(entries[1].category, 3);
  EXPECT_EQ(entries[1].eventId, 1001u);
  EXPECT_EQ(entries[1].data, (std::vector<BYTE>{1, 2, 3}));
  // One line an entry, tab-separated, the controls in the strings escaped.
  std::ifstream in(file);
  std::string first;
  std::string second;
  ASSERT_TRUE(std::getline(in, first) && std::getline(in, second));
  std::string tail = "\t" + std::to_string(getpid()) +
                     "\tEmuSource\tERROR\t0\t0\tEmuSource error: 5\tTwo\\tfields\\r\\n";
  EXPECT_EQ(first.substr(first.size() - tail.size()), tail) << first;
  EXPECT_NE(second.find("\tEmuSource\tWARNING\t3\t1001"), std::string::npos) << second;
  EXPECT_EQ(std::system(("rm -rf " + std::string(directory)).c_str()), 0);
  emu::ClearEventLog();
}

}  // namespace
