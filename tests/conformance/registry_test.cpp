// The registry as the service's registry command uses it: keys opened with
// KEY_ALL_ACCESS, typed values, the real error codes (2 for a missing key or
// value, 234 with the needed size for a short buffer), names without case, and
// one store shared by every process. Each case works under
// HKEY_CURRENT_USER\Software\SkyvaneTest\<pid>\<case> and removes it.
#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "support/child_process.h"
#include "support/test_support.h"

namespace {

using skytest::ChildRole;
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

LONG SetDword(HKEY key, const WCHAR* name, DWORD value) {
  return SetValue(key, name, REG_DWORD, &value, sizeof(value));
}

class Registry : public ::testing::Test {
 protected:
  void SetUp() override {
    pidKey_ = "Software\\SkyvaneTest\\" + std::to_string(skytest::OwnerProcessId());
    caseKey_ = pidKey_ + "\\" + skytest::CurrentTestName();
    Key key;
    if (ChildRole() == nullptr) {
      ASSERT_EQ(Create("", key), ERROR_SUCCESS);
    }
  }

  void TearDown() override {
    if (ChildRole() != nullptr) return;  // the parent cleans up
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

TEST_F(Registry, MissingKeyOrValueIsFileNotFound) {
  Key missing;
  EXPECT_EQ(Open("missing", missing), ERROR_FILE_NOT_FOUND);
  EXPECT_EQ(missing.Get(), nullptr);
  Key deeper;
  EXPECT_EQ(Open("missing\\deeper", deeper), ERROR_FILE_NOT_FOUND);
  EXPECT_EQ(RegDeleteKeyW(HKEY_CURRENT_USER, Path("missing").c_str()), ERROR_FILE_NOT_FOUND);
  Key key;
  ASSERT_EQ(Open("", key), ERROR_SUCCESS);
  EXPECT_EQ(Query(key.Get(), WSTR("NoSuchValue")).status, ERROR_FILE_NOT_FOUND);
  EXPECT_EQ(RegDeleteValueW(key.Get(), WSTR("NoSuchValue")), ERROR_FILE_NOT_FOUND);
}

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

  ASSERT_EQ(RegDeleteKeyW(HKEY_CURRENT_USER, Path("Settings").c_str()), ERROR_SUCCESS);
  Key gone;
  EXPECT_EQ(Open("Settings", gone), ERROR_FILE_NOT_FOUND);
}

TEST_F(Registry, ShortBufferGivesMoreDataAndTheSizeNeeded) {
  Key key;
  ASSERT_EQ(Open("", key), ERROR_SUCCESS);
  BYTE blob[100];
  for (int i = 0; i < 100; ++i) blob[i] = static_cast<BYTE>(i);
  ASSERT_EQ(SetValue(key.Get(), WSTR("Big"), REG_BINARY, blob, sizeof(blob)), ERROR_SUCCESS);
  const WCHAR text[] = WSTR("a longer text value");
  ASSERT_EQ(SetValue(key.Get(), WSTR("Text"), REG_SZ, text, sizeof(text)), ERROR_SUCCESS);

  Queried small = Query(key.Get(), WSTR("Big"), 10);
  EXPECT_EQ(small.status, ERROR_MORE_DATA);
  EXPECT_EQ(small.size, 100u);
  EXPECT_EQ(small.type, static_cast<DWORD>(REG_BINARY));
  Queried sizeOnly = Query(key.Get(), WSTR("Big"), 0);  // no buffer: success with the size
  EXPECT_EQ(sizeOnly.status, ERROR_SUCCESS);
  EXPECT_EQ(sizeOnly.size, 100u);
  Queried exact = Query(key.Get(), WSTR("Big"), 100);
  ASSERT_EQ(exact.status, ERROR_SUCCESS);
  EXPECT_EQ(std::memcmp(exact.data.data(), blob, sizeof(blob)), 0);
  Queried shortText = Query(key.Get(), WSTR("Text"), 8);
  EXPECT_EQ(shortText.status, ERROR_MORE_DATA);
  EXPECT_EQ(shortText.size, sizeof(text));
}

TEST_F(Registry, ValuesAreSharedWithAnotherProcess) {
  Key key;
  ASSERT_EQ(Open("", key), ERROR_SUCCESS);
  if (ChildRole() != nullptr) {
    // The child reads the parent's value and writes one back.
    Queried got = Query(key.Get(), WSTR("FromParent"));
    ASSERT_EQ(got.status, ERROR_SUCCESS);
    EXPECT_EQ(got.data, (std::vector<BYTE>{0x57, 0x04, 0, 0}));
    ASSERT_EQ(SetDword(key.Get(), WSTR("FromChild"), 1112), ERROR_SUCCESS);
    return;
  }
  ASSERT_EQ(SetDword(key.Get(), WSTR("FromParent"), 1111), ERROR_SUCCESS);
  ASSERT_EQ(skytest::RunChildSelf("reader", skytest::kProcessGuardMs), 0);
  Queried got = Query(key.Get(), WSTR("FromChild"));
  ASSERT_EQ(got.status, ERROR_SUCCESS);
  EXPECT_EQ(got.data, (std::vector<BYTE>{0x58, 0x04, 0, 0}));
}

}  // namespace
