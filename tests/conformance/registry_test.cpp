// The registry as the service's registry command uses it: keys opened with
// KEY_ALL_ACCESS, typed values replaced and deleted, names without case, and
// error 2 for a missing key or value. (Short buffers and the service's own
// requests are proven by its registry request tests, which also run under
// Wine.) Each case works under HKEY_CURRENT_USER\Software\SkyvaneTest\<pid>\<case>
// and removes it.
#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "support/test_support.h"

namespace {

using Key = skytest::RegKey;

// What RegQueryValueExW gave for a buffer of `capacity` bytes.
struct Queried {
  LONG status;
  DWORD type;
  DWORD size;
  std::vector<BYTE> data;
};

Queried Query(HKEY key, const WCHAR* name, DWORD capacity = 256) {
  Queried result{0, 0, capacity, std::vector<BYTE>(capacity)};
  result.status = RegQueryValueExW(key, name, nullptr, &result.type,
                                   capacity == 0 ? nullptr : result.data.data(), &result.size);
  if (result.status == ERROR_SUCCESS && capacity != 0) result.data.resize(result.size);
  return result;
}

LONG SetValue(HKEY key, const WCHAR* name, DWORD type, const void* data, DWORD size) {
  return RegSetValueExW(key, name, 0, type, static_cast<const BYTE*>(data), size);
}

class Registry : public ::testing::Test {
 protected:
  void SetUp() override {
    pidKey_ = "Software\\SkyvaneTest\\" + std::to_string(skytest::OwnerProcessId());
    caseKey_ = pidKey_ + "\\" + skytest::CurrentTestName();
    Key key;
    ASSERT_EQ(Create("", key), ERROR_SUCCESS);
  }

  void TearDown() override {
    RegDeleteKeyW(HKEY_CURRENT_USER, Path("Settings").c_str());
    EXPECT_EQ(RegDeleteKeyW(HKEY_CURRENT_USER, Path("").c_str()), ERROR_SUCCESS);
    // Shared parents go only when empty; other processes may still use them.
    RegDeleteKeyW(HKEY_CURRENT_USER, Utf8ToWide(pidKey_).c_str());
    RegDeleteKeyW(HKEY_CURRENT_USER, WSTR("Software\\SkyvaneTest"));
  }

  // Full path of a key below this case's key ("" for the case's key itself).
  WideString Path(const std::string& subkey) const {
    return Utf8ToWide(subkey.empty() ? caseKey_ : caseKey_ + "\\" + subkey);
  }
  LONG Create(const std::string& subkey, Key& key, DWORD* disposition = nullptr) {
    return RegCreateKeyExW(HKEY_CURRENT_USER, Path(subkey).c_str(), 0, nullptr,
                           REG_OPTION_NON_VOLATILE, KEY_ALL_ACCESS, nullptr, key.Out(),
                           disposition);
  }
  LONG Open(const std::string& subkey, Key& key) const {
    return RegOpenKeyExW(HKEY_CURRENT_USER, Path(subkey).c_str(), 0, KEY_ALL_ACCESS, key.Out());
  }

 private:
  std::string pidKey_;
  std::string caseKey_;
};

TEST_F(Registry, TypedValuesRoundTripAndAreReplacedAndDeleted) {
  Key created;
  DWORD disposition = 0;
  ASSERT_EQ(Create("Settings", created, &disposition), ERROR_SUCCESS);
  EXPECT_EQ(disposition, static_cast<DWORD>(REG_CREATED_NEW_KEY));
  Key reopened;
  ASSERT_EQ(Create("Settings", reopened, &disposition), ERROR_SUCCESS);
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
  Key key;  // read back through a separately opened handle
  ASSERT_EQ(Open("Settings", key), ERROR_SUCCESS);
  for (const auto& value : values) {
    Queried got = Query(key.Get(), value.name);
    ASSERT_EQ(got.status, ERROR_SUCCESS);
    EXPECT_EQ(got.type, value.type);
    ASSERT_EQ(got.size, value.size);
    EXPECT_EQ(std::memcmp(got.data.data(), value.data, value.size), 0);
  }

  Key upper;  // names without case
  ASSERT_EQ(Open("SETTINGS", upper), ERROR_SUCCESS);
  EXPECT_EQ(Query(upper.Get(), WSTR("cOUNT")).size, sizeof(number));

  // Setting a value again replaces its type and data; deleting removes it.
  ASSERT_EQ(SetValue(created.Get(), WSTR("Count"), REG_BINARY, blob, 3), ERROR_SUCCESS);
  Queried replaced = Query(key.Get(), WSTR("Count"));
  EXPECT_EQ(replaced.type, static_cast<DWORD>(REG_BINARY));
  EXPECT_EQ(replaced.size, 3u);
  ASSERT_EQ(RegDeleteValueW(key.Get(), WSTR("Name")), ERROR_SUCCESS);
  EXPECT_EQ(Query(key.Get(), WSTR("Name")).status, ERROR_FILE_NOT_FOUND);

  EXPECT_EQ(RegDeleteValueW(key.Get(), WSTR("Name")), ERROR_FILE_NOT_FOUND);

  ASSERT_EQ(RegDeleteKeyW(HKEY_CURRENT_USER, Path("Settings").c_str()), ERROR_SUCCESS);
  EXPECT_EQ(RegDeleteKeyW(HKEY_CURRENT_USER, Path("Settings").c_str()), ERROR_FILE_NOT_FOUND);
  for (const char* missing : {"Settings", "Settings\\deeper"}) {
    Key gone;
    EXPECT_EQ(Open(missing, gone), ERROR_FILE_NOT_FOUND) << missing;
    EXPECT_EQ(gone.Get(), nullptr);
  }
}

}  // namespace
