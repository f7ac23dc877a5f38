// The registry as the service's registry command uses it.
#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "support/test_support.h"

namespace {

using Key = skytest::RegKey;

struct Queried {
  LONG status;
  DWORD type;
  DWORD size;
  std::vector<BYTE> data;
};

Queried Query(HKEY key, const WCHAR* name) {
  Queried result{0, 0, 256, std::vector<BYTE>(256)};
  result.status =
      RegQueryValueExW(key, name, nullptr, &result.type, result.data.data(), &result.size);
  if (result.status == ERROR_SUCCESS) result.data.resize(result.size);
  return result;
}

LONG SetValue(HKEY key, const WCHAR* name, DWORD type, const void* data, DWORD size) {
  return RegSetValueExW(key, name, 0, type, static_cast<const BYTE*>(data), size);
}

TEST(Registry, KeysAndTypedValuesAreCreatedReplacedAndDeleted) {
  // A key of this process and case, under a parent shared with other runs.
  const std::string parent = "Software\\" + skytest::UniqueStem("reg");
  auto path = [&](const char* subkey) { return Utf8ToWide(parent + "\\" + subkey); };
  auto create = [&](const char* subkey, Key& key, DWORD* disposition) {
    return RegCreateKeyExW(HKEY_CURRENT_USER, path(subkey).c_str(), 0, nullptr,
                           REG_OPTION_NON_VOLATILE, KEY_ALL_ACCESS, nullptr, key.Out(),
                           disposition);
  };
  auto open = [&](const char* subkey, Key& key) {
    return RegOpenKeyExW(HKEY_CURRENT_USER, path(subkey).c_str(), 0, KEY_ALL_ACCESS, key.Out());
  };
  Key created;
  DWORD disposition = 0;
  ASSERT_EQ(create("Settings", created, &disposition), ERROR_SUCCESS);
  EXPECT_EQ(disposition, static_cast<DWORD>(REG_CREATED_NEW_KEY));
  Key reopened;
  ASSERT_EQ(create("Settings", reopened, &disposition), ERROR_SUCCESS);
  EXPECT_EQ(disposition, static_cast<DWORD>(REG_OPENED_EXISTING_KEY));

  const DWORD number = 0x12345678;
  const WCHAR text[] = WSTR("Skyvane");  // the size counts the terminator
  const BYTE blob[5] = {1, 2, 0, 4, 5};
  const struct {
    const WCHAR* name;
    DWORD type;
    const void* data;
    DWORD size;
  } values[] = {{WSTR("Count"), REG_DWORD, &number, sizeof(number)},
                {WSTR("Name"), REG_SZ, text, sizeof(text)},
                {WSTR("Blob"), REG_BINARY, blob, sizeof(blob)}};
  for (const auto& value : values) {
    ASSERT_EQ(SetValue(created.Get(), value.name, value.type, value.data, value.size),
              ERROR_SUCCESS);
  }
  Key key;                                          // read back through a separately opened handle
  ASSERT_EQ(open("SETTINGS", key), ERROR_SUCCESS);  // names without case
  for (const auto& value : values) {
    Queried got = Query(key.Get(), value.name);
    ASSERT_EQ(got.status, ERROR_SUCCESS);
    EXPECT_EQ(got.type, value.type);
    ASSERT_EQ(got.size, value.size);
    EXPECT_EQ(std::memcmp(got.data.data(), value.data, value.size), 0);
  }
  EXPECT_EQ(Query(key.Get(), WSTR("cOUNT")).size, sizeof(number));

  // Setting a value again replaces its type and data; deleting removes it.
  ASSERT_EQ(SetValue(created.Get(), WSTR("Count"), REG_BINARY, blob, 3), ERROR_SUCCESS);
  Queried replaced = Query(key.Get(), WSTR("Count"));
  EXPECT_EQ(replaced.type, static_cast<DWORD>(REG_BINARY));
  EXPECT_EQ(replaced.size, 3u);
  ASSERT_EQ(RegDeleteValueW(key.Get(), WSTR("Name")), ERROR_SUCCESS);
  EXPECT_EQ(Query(key.Get(), WSTR("Name")).status, ERROR_FILE_NOT_FOUND);
  EXPECT_EQ(RegDeleteValueW(key.Get(), WSTR("Name")), ERROR_FILE_NOT_FOUND);

  ASSERT_EQ(RegDeleteKeyW(HKEY_CURRENT_USER, path("Settings").c_str()), ERROR_SUCCESS);
  EXPECT_EQ(RegDeleteKeyW(HKEY_CURRENT_USER, path("Settings").c_str()), ERROR_FILE_NOT_FOUND);
  for (const char* missing : {"Settings", "Settings\\deeper"}) {
    Key gone;
    EXPECT_EQ(open(missing, gone), ERROR_FILE_NOT_FOUND) << missing;
    EXPECT_EQ(gone.Get(), nullptr);
  }
  EXPECT_EQ(RegDeleteKeyW(HKEY_CURRENT_USER, Utf8ToWide(parent).c_str()), ERROR_SUCCESS);
}

}  // namespace
