// The emulated service database (install and remove) and the event log.
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

WideString QueryText(const WCHAR* path, const WCHAR* name, DWORD* type) {
  HKEY key = nullptr;
  if (RegOpenKeyExW(HKEY_LOCAL_MACHINE, path, 0, KEY_READ, &key) != ERROR_SUCCESS)
    return u"<no key>";
  WCHAR text[256] = {};
  DWORD size = sizeof text - sizeof(WCHAR);
  LSTATUS status = RegQueryValueExW(key, name, nullptr, type, reinterpret_cast<BYTE*>(text), &size);
  RegCloseKey(key);
  return status == ERROR_SUCCESS ? WideString(text) : u"<no value>";
}

DWORD QueryDword(const WCHAR* path, const WCHAR* name) {
  HKEY key = nullptr;
  if (RegOpenKeyExW(HKEY_LOCAL_MACHINE, path, 0, KEY_READ, &key) != ERROR_SUCCESS) return 0xDEAD;
  DWORD value = 0xDEAD;
  DWORD size = sizeof value;
  RegQueryValueExW(key, name, nullptr, nullptr, reinterpret_cast<BYTE*>(&value), &size);
  RegCloseKey(key);
  return value;
}

constexpr const WCHAR* kKey = u"SYSTEM\\CurrentControlSet\\Services\\EmuDbSvc";

SC_HANDLE Install(SC_HANDLE manager) {
  return CreateServiceW(manager, u"EmuDbSvc", u"Emu Db Service", SERVICE_ALL_ACCESS,
                        SERVICE_WIN32_OWN_PROCESS, SERVICE_AUTO_START, SERVICE_ERROR_NORMAL,
                        u"/opt/emu db/svc", nullptr, nullptr, u"\0", nullptr, nullptr);
}

TEST(ServiceDatabase, InstallQueryAndRemove) {
  SC_HANDLE manager =
      OpenSCManagerW(nullptr, nullptr, SC_MANAGER_CONNECT | SC_MANAGER_CREATE_SERVICE);
  ASSERT_NE(manager, nullptr);
  SC_HANDLE service = Install(manager);
  ASSERT_NE(service, nullptr);

  // Kept where Windows keeps it.
  DWORD type = 0;
  EXPECT_EQ(QueryText(kKey, u"ImagePath", &type), u"/opt/emu db/svc");
  EXPECT_EQ(type, REG_EXPAND_SZ);
  EXPECT_EQ(QueryText(kKey, u"DisplayName", &type), u"Emu Db Service");
  EXPECT_EQ(QueryText(kKey, u"ObjectName", &type), u"LocalSystem");
  EXPECT_EQ(QueryDword(kKey, u"Type"), SERVICE_WIN32_OWN_PROCESS);
  EXPECT_EQ(QueryDword(kKey, u"Start"), SERVICE_AUTO_START);
  EXPECT_EQ(QueryDword(kKey, u"ErrorControl"), SERVICE_ERROR_NORMAL);

  SERVICE_DESCRIPTIONW description{const_cast<LPWSTR>(u"Describes it.")};
  EXPECT_TRUE(ChangeServiceConfig2W(service, SERVICE_CONFIG_DESCRIPTION, &description));
  EXPECT_EQ(QueryText(kKey, u"Description", &type), u"Describes it.");

  // Installing twice fails; the names compare without case.
  SetLastError(0);
  EXPECT_EQ(CreateServiceW(manager, u"EMUDBSVC", nullptr, SERVICE_ALL_ACCESS,
                           SERVICE_WIN32_OWN_PROCESS, SERVICE_AUTO_START, SERVICE_ERROR_NORMAL,
                           u"/x", nullptr, nullptr, nullptr, nullptr, nullptr),
            nullptr);
  EXPECT_EQ(GetLastError(), ERROR_SERVICE_EXISTS);

  // Not running: no control, stopped status, and it cannot be started here.
  SERVICE_STATUS status{};
  EXPECT_FALSE(ControlService(service, SERVICE_CONTROL_STOP, &status));
  EXPECT_EQ(GetLastError(), ERROR_SERVICE_NOT_ACTIVE);
  ASSERT_TRUE(QueryServiceStatus(service, &status));
  EXPECT_EQ(status.dwCurrentState, SERVICE_STOPPED);
  EXPECT_EQ(status.dwServiceType, SERVICE_WIN32_OWN_PROCESS);
  EXPECT_FALSE(StartServiceW(service, 0, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_NOT_SUPPORTED);
  EXPECT_TRUE(CloseServiceHandle(service));

  // Removal as the remove verb does it: delete, stop and query rights only.
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
  EXPECT_EQ(QueryText(kKey, u"ImagePath", &type), u"<no key>");
  EXPECT_EQ(OpenServiceW(manager, u"EmuDbSvc", SERVICE_ALL_ACCESS), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_SERVICE_DOES_NOT_EXIST);
  EXPECT_TRUE(CloseServiceHandle(manager));
}

TEST(ServiceDatabase, RightsAndArgumentsAreChecked) {
  SC_HANDLE connectOnly = OpenSCManagerW(nullptr, nullptr, SC_MANAGER_CONNECT);
  ASSERT_NE(connectOnly, nullptr);
  EXPECT_EQ(Install(connectOnly), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_ACCESS_DENIED);
  SC_HANDLE manager = OpenSCManagerW(nullptr, SERVICES_ACTIVE_DATABASEW, SC_MANAGER_ALL_ACCESS);
  ASSERT_NE(manager, nullptr);
  EXPECT_EQ(CreateServiceW(manager, u"bad\\name", nullptr, SERVICE_ALL_ACCESS,
                           SERVICE_WIN32_OWN_PROCESS, SERVICE_AUTO_START, SERVICE_ERROR_NORMAL,
                           u"/x", nullptr, nullptr, nullptr, nullptr, nullptr),
            nullptr);
  EXPECT_EQ(GetLastError(), ERROR_INVALID_NAME);
  // A manager handle is not a service handle, and neither is a kernel handle.
  SERVICE_STATUS status{};
  EXPECT_FALSE(QueryServiceStatus(manager, &status));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
  EXPECT_FALSE(CloseHandle(manager));
  EXPECT_TRUE(CloseServiceHandle(connectOnly));
  EXPECT_TRUE(CloseServiceHandle(manager));
}

// What one process installs, another finds.
TEST(ServiceDatabase, InstallIsSeenByAnotherProcess) {
  pid_t pid = fork();
  ASSERT_GE(pid, 0);
  if (pid == 0) {
    SC_HANDLE manager = OpenSCManagerW(nullptr, nullptr, SC_MANAGER_ALL_ACCESS);
    SC_HANDLE service = manager != nullptr ? Install(manager) : nullptr;
    _exit(service != nullptr ? 0 : 1);
  }
  int exitStatus = 0;
  ASSERT_EQ(waitpid(pid, &exitStatus, 0), pid);
  ASSERT_TRUE(WIFEXITED(exitStatus));
  ASSERT_EQ(WEXITSTATUS(exitStatus), 0);
  SC_HANDLE manager = OpenSCManagerW(nullptr, nullptr, SC_MANAGER_ALL_ACCESS);
  SC_HANDLE service = OpenServiceW(manager, u"EmuDbSvc", SERVICE_ALL_ACCESS);
  ASSERT_NE(service, nullptr);
  EXPECT_TRUE(DeleteService(service));
  CloseServiceHandle(service);
  CloseServiceHandle(manager);
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
  EXPECT_FALSE(DeregisterEventSource(source));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
  EXPECT_FALSE(ReportEventW(source, EVENTLOG_ERROR_TYPE, 0, 0, nullptr, 0, 0, nullptr, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);

  emu::FailRegisterEventSource(ERROR_ACCESS_DENIED);
  EXPECT_EQ(RegisterEventSourceW(nullptr, u"EmuSource"), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_ACCESS_DENIED);
  emu::FailRegisterEventSource(0);
  unsetenv("SKYVANE_EVENTLOG");

  std::vector<emu::EventLogEntry> entries = emu::EventLogEntries();
  ASSERT_EQ(entries.size(), 2u);
  EXPECT_EQ(entries[0].source, u"EmuSource");
  EXPECT_EQ(entries[0].type, EVENTLOG_ERROR_TYPE);
  ASSERT_EQ(entries[0].strings.size(), 2u);
  EXPECT_EQ(entries[0].strings[0], u"EmuSource error: 5");
  EXPECT_EQ(entries[0].strings[1], u"Two\tfields\r\n");
  EXPECT_EQ(entries[1].category, 3);
  EXPECT_EQ(entries[1].eventId, 1001u);
  EXPECT_EQ(entries[1].data, (std::vector<BYTE>{1, 2, 3}));

  std::ifstream in(file);
  std::string first;
  std::string second;
  ASSERT_TRUE(std::getline(in, first));
  ASSERT_TRUE(std::getline(in, second));
  std::string tail1 = "\t" + std::to_string(getpid()) +
                      "\tEmuSource\tERROR\t0\t0\tEmuSource error: 5\tTwo\\tfields\\r\\n";
  EXPECT_EQ(first.substr(first.size() - tail1.size()), tail1) << first;
  EXPECT_NE(second.find("\tEmuSource\tWARNING\t3\t1001"), std::string::npos) << second;
  std::string cleanup = std::string("rm -rf ") + directory;
  EXPECT_EQ(std::system(cleanup.c_str()), 0);
  emu::ClearEventLog();
}

}  // namespace
