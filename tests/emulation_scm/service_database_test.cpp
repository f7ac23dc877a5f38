// The emulated service database, kept in the registry and so seen by every
// process.
#include <gtest/gtest.h>
#include <unistd.h>

#include <climits>
#include <string>

#include "platform/wide.h"
#include "platform/win32.h"
#include "support/child_process.h"
#include "support/test_support.h"

namespace {

constexpr const WCHAR* kKey = u"SYSTEM\\CurrentControlSet\\Services\\EmuDbSvc";

// A value of the service's key as text, "<no key>" when the key is missing.
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

TEST(ServiceDatabase, InstallQueryAndRemove) {
  skytest::RunAsChild("installer", [] {
    SC_HANDLE manager = OpenSCManagerW(nullptr, nullptr, SC_MANAGER_ALL_ACCESS);
    return manager != nullptr && Install(manager) != nullptr ? 0 : 1;
  });
  ASSERT_EQ(skytest::RunChildSelf("installer", skytest::kProcessGuardMs), 0);

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
  SERVICE_STATUS status{};
  ASSERT_TRUE(QueryServiceStatus(service, &status));
  EXPECT_EQ(status.dwCurrentState, SERVICE_STOPPED);
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

// The install verb records the executable's path as the image path.
TEST(ServiceDatabase, ModuleFileNameIsTheExecutable) {
  char exe[PATH_MAX];
  const ssize_t length = readlink("/proc/self/exe", exe, sizeof exe - 1);
  ASSERT_GT(length, 0);
  WCHAR buffer[PATH_MAX];
  EXPECT_EQ(GetModuleFileNameW(nullptr, buffer, PATH_MAX), static_cast<DWORD>(length));
  EXPECT_EQ(WideToUtf8(buffer), std::string(exe, static_cast<std::size_t>(length)));
}

}  // namespace
