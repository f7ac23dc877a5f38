// The registry as the service's registry command uses it: keys opened with
// KEY_ALL_ACCESS, typed values, the real error codes (2 for a missing key or
// value, 234 with the needed size for a short buffer), and one store shared by
// every process. Each case works under
// HKEY_CURRENT_USER\Software\SkyvaneTest\<pid>\<case> and removes it.
#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "support/child_process.h"
#include "support/test_support.h"

namespace {

using skytest::ChildRole;

// An open registry key, closed at the end of its scope.
class Key {
 public:
  Key() = default;
  Key(const Key&) = delete;
  Key& operator=(const Key&) = delete;
  ~Key() {
    if (key_ != nullptr) RegCloseKey(key_);
  }
  HKEY* Out() { return &key_; }
  HKEY Get() const { return key_; }

 private:
  HKEY key_ = nullptr;
};

class Registry : public ::testing::Test {
 protected:
  void SetUp() override {
    pidKey_ = "Software\\SkyvaneTest\\" + std::to_string(skytest::OwnerProcessId());
    caseKey_ = pidKey_ + "\\" + skytest::CurrentTestName();
    if (ChildRole() == nullptr) {
      Key key;
      ASSERT_EQ(Create("", key), ERROR_SUCCESS);
    }
  }

  void TearDown() override {
    if (ChildRole() != nullptr) return;  // the parent cleans up
    for (auto it = created_.rbegin(); it != created_.rend(); ++it) {
      EXPECT_EQ(RegDeleteKeyW(HKEY_CURRENT_USER, Path(*it).c_str()), ERROR_SUCCESS);
    }
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
    LONG result =
        RegCreateKeyExW(HKEY_CURRENT_USER, Path(subkey).c_str(), 0, nullptr,
                        REG_OPTION_NON_VOLATILE, KEY_ALL_ACCESS, nullptr, key.Out(), disposition);
    if (result == ERROR_SUCCESS && !subkey.empty() && !Tracked(subkey)) created_.push_back(subkey);
    return result;
  }

  LONG Open(const std::string& subkey, Key& key) const {
    return RegOpenKeyExW(HKEY_CURRENT_USER, Path(subkey).c_str(), 0, KEY_ALL_ACCESS, key.Out());
  }

  void Forget(const std::string& subkey) { std::erase(created_, subkey); }

 private:
  bool Tracked(const std::string& subkey) const {
    for (const std::string& known : created_) {
      if (known == subkey) return true;
    }
    return false;
  }

  std::string pidKey_;
  std::string caseKey_;
  std::vector<std::string> created_;
};

LONG SetDword(HKEY key, const WCHAR* name, DWORD value) {
  return RegSetValueExW(key, name, 0, REG_DWORD, reinterpret_cast<const BYTE*>(&value),
                        sizeof(value));
}

LONG SetBytes(HKEY key, const WCHAR* name, DWORD type, const void* data, DWORD size) {
  return RegSetValueExW(key, name, 0, type, static_cast<const BYTE*>(data), size);
}

TEST_F(Registry, MissingKeyOrValueIsFileNotFound) {
  Key missing;
  EXPECT_EQ(Open("missing", missing), ERROR_FILE_NOT_FOUND);
  EXPECT_EQ(missing.Get(), nullptr);
  Key deeper;
  EXPECT_EQ(Open("missing\\deeper", deeper), ERROR_FILE_NOT_FOUND);

  Key key;
  ASSERT_EQ(Open("", key), ERROR_SUCCESS);
  DWORD type = 0;
  BYTE data[8] = {};
  DWORD size = sizeof(data);
  EXPECT_EQ(RegQueryValueExW(key.Get(), WSTR("NoSuchValue"), nullptr, &type, data, &size),
            ERROR_FILE_NOT_FOUND);
  EXPECT_EQ(RegDeleteValueW(key.Get(), WSTR("NoSuchValue")), ERROR_FILE_NOT_FOUND);
  EXPECT_EQ(RegDeleteKeyW(HKEY_CURRENT_USER, Path("missing").c_str()), ERROR_FILE_NOT_FOUND);
}

TEST_F(Registry, CreateSetQueryAndDeleteRoundTrip) {
  Key created;
  DWORD disposition = 0;
  ASSERT_EQ(Create("Settings", created, &disposition), ERROR_SUCCESS);
  EXPECT_EQ(disposition, static_cast<DWORD>(REG_CREATED_NEW_KEY));
  Key reopened;
  ASSERT_EQ(Create("Settings", reopened, &disposition), ERROR_SUCCESS);
  EXPECT_EQ(disposition, static_cast<DWORD>(REG_OPENED_EXISTING_KEY));

  const BYTE blob[5] = {1, 2, 0, 4, 5};
  const WCHAR text[] = WSTR("Skyvane");
  ASSERT_EQ(SetDword(created.Get(), WSTR("Count"), 0x12345678), ERROR_SUCCESS);
  ASSERT_EQ(SetBytes(created.Get(), WSTR("Name"), REG_SZ, text, sizeof(text)), ERROR_SUCCESS);
  ASSERT_EQ(SetBytes(created.Get(), WSTR("Blob"), REG_BINARY, blob, sizeof(blob)), ERROR_SUCCESS);

  // Read back through a separately opened handle.
  Key key;
  ASSERT_EQ(Open("Settings", key), ERROR_SUCCESS);
  DWORD type = 0;
  DWORD number = 0;
  DWORD size = sizeof(number);
  ASSERT_EQ(RegQueryValueExW(key.Get(), WSTR("Count"), nullptr, &type,
                             reinterpret_cast<BYTE*>(&number), &size),
            ERROR_SUCCESS);
  EXPECT_EQ(type, static_cast<DWORD>(REG_DWORD));
  EXPECT_EQ(size, 4u);
  EXPECT_EQ(number, 0x12345678u);

  WCHAR readText[32] = {};
  size = sizeof(readText);
  ASSERT_EQ(RegQueryValueExW(key.Get(), WSTR("Name"), nullptr, &type,
                             reinterpret_cast<BYTE*>(readText), &size),
            ERROR_SUCCESS);
  EXPECT_EQ(type, static_cast<DWORD>(REG_SZ));
  EXPECT_EQ(size, sizeof(text));  // the terminator included
  EXPECT_TRUE(WideEqual(readText, text));

  BYTE readBlob[16] = {};
  size = sizeof(readBlob);
  ASSERT_EQ(RegQueryValueExW(key.Get(), WSTR("Blob"), nullptr, &type, readBlob, &size),
            ERROR_SUCCESS);
  EXPECT_EQ(type, static_cast<DWORD>(REG_BINARY));
  ASSERT_EQ(size, sizeof(blob));
  EXPECT_EQ(std::memcmp(readBlob, blob, sizeof(blob)), 0);

  // Setting a value again replaces its type and data.
  ASSERT_EQ(SetBytes(created.Get(), WSTR("Count"), REG_BINARY, blob, 3), ERROR_SUCCESS);
  size = sizeof(readBlob);
  ASSERT_EQ(RegQueryValueExW(key.Get(), WSTR("Count"), nullptr, &type, readBlob, &size),
            ERROR_SUCCESS);
  EXPECT_EQ(type, static_cast<DWORD>(REG_BINARY));
  EXPECT_EQ(size, 3u);

  ASSERT_EQ(RegDeleteValueW(key.Get(), WSTR("Name")), ERROR_SUCCESS);
  size = sizeof(readText);
  EXPECT_EQ(RegQueryValueExW(key.Get(), WSTR("Name"), nullptr, &type,
                             reinterpret_cast<BYTE*>(readText), &size),
            ERROR_FILE_NOT_FOUND);

  ASSERT_EQ(RegDeleteKeyW(HKEY_CURRENT_USER, Path("Settings").c_str()), ERROR_SUCCESS);
  Forget("Settings");
  Key gone;
  EXPECT_EQ(Open("Settings", gone), ERROR_FILE_NOT_FOUND);
}

TEST_F(Registry, ShortBufferGivesMoreDataAndTheSizeNeeded) {
  Key key;
  ASSERT_EQ(Open("", key), ERROR_SUCCESS);
  BYTE blob[100];
  for (int i = 0; i < 100; ++i) blob[i] = static_cast<BYTE>(i);
  ASSERT_EQ(SetBytes(key.Get(), WSTR("Big"), REG_BINARY, blob, sizeof(blob)), ERROR_SUCCESS);

  BYTE small[10] = {};
  DWORD type = 0;
  DWORD size = sizeof(small);
  EXPECT_EQ(RegQueryValueExW(key.Get(), WSTR("Big"), nullptr, &type, small, &size),
            ERROR_MORE_DATA);
  EXPECT_EQ(size, 100u);
  EXPECT_EQ(type, static_cast<DWORD>(REG_BINARY));

  // No buffer at all: success with the size.
  size = 0;
  EXPECT_EQ(RegQueryValueExW(key.Get(), WSTR("Big"), nullptr, &type, nullptr, &size),
            ERROR_SUCCESS);
  EXPECT_EQ(size, 100u);

  BYTE exact[100] = {};
  size = sizeof(exact);
  ASSERT_EQ(RegQueryValueExW(key.Get(), WSTR("Big"), nullptr, &type, exact, &size), ERROR_SUCCESS);
  EXPECT_EQ(std::memcmp(exact, blob, sizeof(blob)), 0);

  const WCHAR text[] = WSTR("a longer text value");
  ASSERT_EQ(SetBytes(key.Get(), WSTR("Text"), REG_SZ, text, sizeof(text)), ERROR_SUCCESS);
  WCHAR shortText[4] = {};
  size = sizeof(shortText);
  EXPECT_EQ(RegQueryValueExW(key.Get(), WSTR("Text"), nullptr, &type,
                             reinterpret_cast<BYTE*>(shortText), &size),
            ERROR_MORE_DATA);
  EXPECT_EQ(size, sizeof(text));
}

TEST_F(Registry, NamesAreCaseInsensitive) {
  Key created;
  ASSERT_EQ(Create("MixedCase", created), ERROR_SUCCESS);
  ASSERT_EQ(SetDword(created.Get(), WSTR("LevelValue"), 3), ERROR_SUCCESS);
  Key key;
  ASSERT_EQ(Open("MIXEDCASE", key), ERROR_SUCCESS);
  DWORD value = 0;
  DWORD size = sizeof(value);
  EXPECT_EQ(RegQueryValueExW(key.Get(), WSTR("levelvalue"), nullptr, nullptr,
                             reinterpret_cast<BYTE*>(&value), &size),
            ERROR_SUCCESS);
  EXPECT_EQ(value, 3u);
}

TEST_F(Registry, ValuesAreSharedWithAnotherProcess) {
  if (ChildRole() != nullptr) {
    // The child reads the parent's value and writes one back.
    Key key;
    ASSERT_EQ(Open("", key), ERROR_SUCCESS);
    DWORD value = 0;
    DWORD size = sizeof(value);
    ASSERT_EQ(RegQueryValueExW(key.Get(), WSTR("FromParent"), nullptr, nullptr,
                               reinterpret_cast<BYTE*>(&value), &size),
              ERROR_SUCCESS);
    EXPECT_EQ(value, 1111u);
    ASSERT_EQ(SetDword(key.Get(), WSTR("FromChild"), value + 1), ERROR_SUCCESS);
    return;
  }
  {
    Key key;
    ASSERT_EQ(Open("", key), ERROR_SUCCESS);
    ASSERT_EQ(SetDword(key.Get(), WSTR("FromParent"), 1111), ERROR_SUCCESS);
  }
  ASSERT_EQ(skytest::RunChildSelf("reader", skytest::kProcessGuardMs), 0);
  Key key;
  ASSERT_EQ(Open("", key), ERROR_SUCCESS);
  DWORD value = 0;
  DWORD size = sizeof(value);
  ASSERT_EQ(RegQueryValueExW(key.Get(), WSTR("FromChild"), nullptr, nullptr,
                             reinterpret_cast<BYTE*>(&value), &size),
            ERROR_SUCCESS);
  EXPECT_EQ(value, 1112u);
}

}  // namespace
