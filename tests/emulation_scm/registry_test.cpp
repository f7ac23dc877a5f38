// The emulated registry: key and value semantics with the real error codes,
// handles, access, and the store file shared between processes.
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>
#include <vector>

#include "platform/diagnostics.h"
#include "platform/posix/emu_scm.h"
#include "platform/posix/registry_store.h"
#include "platform/wide.h"
#include "platform/win32.h"

namespace {

// Closes an HKEY at scope end.
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

// Each case works below a key of its own, removed before and after.
class Registry : public ::testing::Test {
 protected:
  void SetUp() override {
    base_ = u"Software\\SkyvaneEmuTest\\" +
            Utf8ToWide(::testing::UnitTest::GetInstance()->current_test_info()->name());
    Erase();
  }
  void TearDown() override { Erase(); }
  void Erase() {
    WideString full = u"HKEY_CURRENT_USER\\" + base_;
    emu::registry::Transact([&](emu::registry::Store& store) {
      store.EraseTree(full);
      return true;
    });
  }
  LSTATUS Create(const WideString& sub, Key& key, DWORD* disposition = nullptr) {
    WideString path = sub.empty() ? base_ : base_ + u"\\" + sub;
    return RegCreateKeyExW(HKEY_CURRENT_USER, path.c_str(), 0, nullptr, REG_OPTION_NON_VOLATILE,
                           KEY_ALL_ACCESS, nullptr, key.Out(), disposition);
  }
  LSTATUS Open(const WideString& sub, REGSAM access, Key& key) {
    WideString path = sub.empty() ? base_ : base_ + u"\\" + sub;
    return RegOpenKeyExW(HKEY_CURRENT_USER, path.c_str(), 0, access, key.Out());
  }
  static LSTATUS SetDword(HKEY key, const WCHAR* name, DWORD value) {
    return RegSetValueExW(key, name, 0, REG_DWORD, reinterpret_cast<const BYTE*>(&value),
                          sizeof value);
  }

  WideString base_;
};

TEST_F(Registry, CreateSetQueryRoundTripWithCaseInsensitivePaths) {
  Key created;
  DWORD disposition = 0;
  ASSERT_EQ(Create(u"Outer\\Inner", created, &disposition), ERROR_SUCCESS);
  EXPECT_EQ(disposition, REG_CREATED_NEW_KEY);
  {
    Key again;
    ASSERT_EQ(Create(u"OUTER\\inner", again, &disposition), ERROR_SUCCESS);
    EXPECT_EQ(disposition, REG_OPENED_EXISTING_KEY);
  }
  // A REG_SZ keeps exactly the bytes given, terminator or not.
  const char16_t text[] = {u'a', u'b', u'c'};
  ASSERT_EQ(
      RegSetValueExW(created.Get(), u"Text", 0, REG_SZ, reinterpret_cast<const BYTE*>(text), 6),
      ERROR_SUCCESS);
  ASSERT_EQ(SetDword(created.Get(), u"Number", 0xA1B2C3D4), ERROR_SUCCESS);
  const BYTE blob[] = {0, 1, 0, 255};
  ASSERT_EQ(RegSetValueExW(created.Get(), nullptr, 0, REG_BINARY, blob, sizeof blob),
            ERROR_SUCCESS);

  Key reopened;
  WideString upper = base_ + u"\\outer\\INNER";
  WideToUpper(upper.data());
  ASSERT_EQ(RegOpenKeyExW(HKEY_CURRENT_USER, upper.c_str(), 0, KEY_READ, reopened.Out()),
            ERROR_SUCCESS);

  DWORD type = 0;
  BYTE data[16] = {};
  DWORD size = sizeof data;
  ASSERT_EQ(RegQueryValueExW(reopened.Get(), u"TEXT", nullptr, &type, data, &size), ERROR_SUCCESS);
  EXPECT_EQ(type, REG_SZ);
  ASSERT_EQ(size, 6u);
  EXPECT_EQ(std::memcmp(data, text, 6), 0);

  // The default value answers to a null and to an empty name.
  size = sizeof data;
  ASSERT_EQ(RegQueryValueExW(reopened.Get(), u"", nullptr, &type, data, &size), ERROR_SUCCESS);
  EXPECT_EQ(type, REG_BINARY);
  ASSERT_EQ(size, sizeof blob);
  EXPECT_EQ(std::memcmp(data, blob, sizeof blob), 0);

  // Overwriting changes type and size.
  ASSERT_EQ(RegSetValueExW(created.Get(), u"Number", 0, REG_NONE, nullptr, 0), ERROR_SUCCESS);
  size = sizeof data;
  ASSERT_EQ(RegQueryValueExW(reopened.Get(), u"Number", nullptr, &type, data, &size),
            ERROR_SUCCESS);
  EXPECT_EQ(type, REG_NONE);
  EXPECT_EQ(size, 0u);
}

TEST_F(Registry, QuerySizeProtocolAndMissingNames) {
  Key key;
  ASSERT_EQ(Create(u"", key), ERROR_SUCCESS);
  std::vector<BYTE> value(40);
  for (std::size_t i = 0; i < value.size(); ++i) value[i] = static_cast<BYTE>(i + 1);
  ASSERT_EQ(RegSetValueExW(key.Get(), u"Big", 0, REG_BINARY, value.data(), 40), ERROR_SUCCESS);

  // No buffer: the size needed, and success.
  DWORD type = 0;
  DWORD size = 0;
  EXPECT_EQ(RegQueryValueExW(key.Get(), u"Big", nullptr, &type, nullptr, &size), ERROR_SUCCESS);
  EXPECT_EQ(size, 40u);
  EXPECT_EQ(type, REG_BINARY);
  // Existence check with neither.
  EXPECT_EQ(RegQueryValueExW(key.Get(), u"Big", nullptr, nullptr, nullptr, nullptr), ERROR_SUCCESS);

  // Too small: ERROR_MORE_DATA, the size needed, the type, the buffer untouched.
  BYTE small[8];
  std::memset(small, 0xEE, sizeof small);
  size = sizeof small;
  type = 0;
  EXPECT_EQ(RegQueryValueExW(key.Get(), u"Big", nullptr, &type, small, &size), ERROR_MORE_DATA);
  EXPECT_EQ(size, 40u);
  EXPECT_EQ(type, REG_BINARY);
  for (BYTE b : small) EXPECT_EQ(b, 0xEE);

  std::vector<BYTE> exact(40);

  // Bad arguments and missing names.
  EXPECT_EQ(RegQueryValueExW(key.Get(), u"Big", nullptr, nullptr, exact.data(), nullptr),
            ERROR_INVALID_PARAMETER);
  DWORD reserved = 0;
  size = 40;
  EXPECT_EQ(RegQueryValueExW(key.Get(), u"Big", &reserved, nullptr, exact.data(), &size),
            ERROR_INVALID_PARAMETER);
  size = 40;
  type = 77;
  EXPECT_EQ(RegQueryValueExW(key.Get(), u"Missing", nullptr, &type, exact.data(), &size),
            ERROR_FILE_NOT_FOUND);
  EXPECT_EQ(type, 77u);
  EXPECT_EQ(RegDeleteValueW(key.Get(), u"Missing"), ERROR_FILE_NOT_FOUND);
  EXPECT_EQ(RegSetValueExW(key.Get(), u"Bad", 0, REG_BINARY, nullptr, 4), ERROR_NOACCESS);

  Key missing;
  EXPECT_EQ(Open(u"Nope\\Deeper", KEY_READ, missing), ERROR_FILE_NOT_FOUND);
  EXPECT_EQ(missing.Get(), nullptr);
  EXPECT_EQ(RegOpenKeyExW(HKEY_CURRENT_USER, u"\\Software", 0, KEY_READ, missing.Out()),
            ERROR_BAD_PATHNAME);

  ASSERT_EQ(RegDeleteValueW(key.Get(), u"BIG"), ERROR_SUCCESS);
  EXPECT_EQ(RegQueryValueExW(key.Get(), u"Big", nullptr, nullptr, nullptr, &size),
            ERROR_FILE_NOT_FOUND);
}

TEST_F(Registry, KeyHandlesAreCheckedAndCounted) {
  long before = platform::LiveHandleCount();
  HKEY key = nullptr;
  ASSERT_EQ(RegCreateKeyExW(HKEY_CURRENT_USER, base_.c_str(), 0, nullptr, 0, KEY_ALL_ACCESS,
                            nullptr, &key, nullptr),
            ERROR_SUCCESS);
  EXPECT_EQ(platform::LiveHandleCount(), before + 1);
  // Not a kernel handle: CloseHandle refuses it, RegCloseKey closes it once.
  EXPECT_FALSE(CloseHandle(key));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
  EXPECT_EQ(RegCloseKey(key), ERROR_SUCCESS);
  EXPECT_EQ(platform::LiveHandleCount(), before);
  EXPECT_EQ(RegCloseKey(key), ERROR_INVALID_HANDLE);
  DWORD size = 0;
  EXPECT_EQ(RegQueryValueExW(key, u"x", nullptr, nullptr, nullptr, &size), ERROR_INVALID_HANDLE);
  EXPECT_EQ(SetDword(key, u"x", 1), ERROR_INVALID_HANDLE);
  HKEY sub = nullptr;
  EXPECT_EQ(RegOpenKeyExW(key, u"x", 0, KEY_READ, &sub), ERROR_INVALID_HANDLE);
  // Predefined roots are always open and closing them is harmless.
  EXPECT_EQ(RegCloseKey(HKEY_LOCAL_MACHINE), ERROR_SUCCESS);
  EXPECT_EQ(reinterpret_cast<ULONG_PTR>(HKEY_LOCAL_MACHINE), 0xFFFFFFFF80000002ULL);
  EXPECT_EQ(reinterpret_cast<ULONG_PTR>(HKEY_CURRENT_CONFIG), 0xFFFFFFFF80000005ULL);
  EXPECT_EQ(RegOpenKeyExW(HKEY_PERFORMANCE_DATA, u"x", 0, KEY_READ, &sub), ERROR_INVALID_HANDLE);
}

TEST_F(Registry, AccessRightsAndReadOnlyKeys) {
  {
    Key key;
    ASSERT_EQ(Create(u"Locked\\Child", key), ERROR_SUCCESS);
    ASSERT_EQ(SetDword(key.Get(), u"V", 7), ERROR_SUCCESS);
  }
  // A handle opened for reading cannot write.
  {
    Key reader;
    ASSERT_EQ(Open(u"Locked", KEY_READ, reader), ERROR_SUCCESS);
    EXPECT_EQ(SetDword(reader.Get(), u"W", 1), ERROR_ACCESS_DENIED);
    Key created;
    EXPECT_EQ(RegCreateKeyExW(reader.Get(), u"New", 0, nullptr, 0, KEY_ALL_ACCESS, nullptr,
                              created.Out(), nullptr),
              ERROR_ACCESS_DENIED);
    // Opening an existing key below it does not need create rights.
    EXPECT_EQ(RegCreateKeyExW(reader.Get(), u"Child", 0, nullptr, 0, KEY_READ, nullptr,
                              created.Out(), nullptr),
              ERROR_SUCCESS);
  }

  WideString locked = base_ + u"\\Locked\\Child";
  ASSERT_EQ(emu::SetRegistryKeyReadOnly(HKEY_CURRENT_USER, locked.c_str(), true), ERROR_SUCCESS);
  Key key;
  EXPECT_EQ(Open(u"Locked\\Child", KEY_ALL_ACCESS, key), ERROR_ACCESS_DENIED);
  EXPECT_EQ(Create(u"Locked\\Child", key), ERROR_ACCESS_DENIED);
  EXPECT_EQ(Create(u"Locked\\Child\\Below", key), ERROR_ACCESS_DENIED);
  ASSERT_EQ(Open(u"Locked\\Child", KEY_READ, key), ERROR_SUCCESS);
  DWORD value = 0;
  DWORD size = sizeof value;
  EXPECT_EQ(
      RegQueryValueExW(key.Get(), u"V", nullptr, nullptr, reinterpret_cast<BYTE*>(&value), &size),
      ERROR_SUCCESS);
  EXPECT_EQ(value, 7u);
  WideString parent = base_ + u"\\Locked";
  HKEY parentKey = nullptr;
  ASSERT_EQ(RegOpenKeyExW(HKEY_CURRENT_USER, parent.c_str(), 0, KEY_ALL_ACCESS, &parentKey),
            ERROR_SUCCESS);
  EXPECT_EQ(RegDeleteKeyW(parentKey, u"Child"), ERROR_ACCESS_DENIED);
  ASSERT_EQ(emu::SetRegistryKeyReadOnly(HKEY_CURRENT_USER, locked.c_str(), false), ERROR_SUCCESS);
  EXPECT_EQ(RegDeleteKeyW(parentKey, u"Child"), ERROR_SUCCESS);
  EXPECT_EQ(RegCloseKey(parentKey), ERROR_SUCCESS);
  EXPECT_EQ(emu::SetRegistryKeyReadOnly(HKEY_CURRENT_USER, locked.c_str(), true),
            ERROR_FILE_NOT_FOUND);
}

TEST_F(Registry, DeletingKeys) {
  Key parent;
  ASSERT_EQ(Create(u"Tree", parent), ERROR_SUCCESS);
  Key child;
  ASSERT_EQ(Create(u"Tree\\Leaf", child), ERROR_SUCCESS);
  // A key with sub-keys is not deleted; a missing one is not found.
  Key top;
  ASSERT_EQ(Create(u"", top), ERROR_SUCCESS);
  EXPECT_EQ(RegDeleteKeyW(top.Get(), u"Tree"), ERROR_ACCESS_DENIED);
  EXPECT_EQ(RegDeleteKeyW(top.Get(), u"Absent"), ERROR_FILE_NOT_FOUND);
  ASSERT_EQ(RegDeleteKeyW(parent.Get(), u"LEAF"), ERROR_SUCCESS);
  // The handle still open on the deleted key now fails.
  DWORD size = 0;
  EXPECT_EQ(RegQueryValueExW(child.Get(), u"x", nullptr, nullptr, nullptr, &size),
            ERROR_KEY_DELETED);
  EXPECT_EQ(SetDword(child.Get(), u"x", 1), ERROR_KEY_DELETED);
  EXPECT_EQ(RegDeleteKeyW(top.Get(), u"Tree"), ERROR_SUCCESS);
  Key gone;
  EXPECT_EQ(Open(u"Tree", KEY_READ, gone), ERROR_FILE_NOT_FOUND);
}

TEST_F(Registry, EnumerationOrder) {
  Key key;
  ASSERT_EQ(Create(u"", key), ERROR_SUCCESS);
  for (const WCHAR* name : {u"beta", u"Alpha", u"gamma"}) {
    Key sub;
    ASSERT_EQ(RegCreateKeyExW(key.Get(), name, 0, nullptr, 0, KEY_ALL_ACCESS, nullptr, sub.Out(),
                              nullptr),
              ERROR_SUCCESS);
  }
  Key grandchild;
  ASSERT_EQ(Create(u"beta\\deep", grandchild), ERROR_SUCCESS);
  std::vector<std::string> keys;
  WCHAR name[64];
  for (DWORD i = 0;; ++i) {
    DWORD length = 64;
    LSTATUS status = RegEnumKeyExW(key.Get(), i, name, &length, nullptr, nullptr, nullptr, nullptr);
    if (status == ERROR_NO_MORE_ITEMS) break;
    ASSERT_EQ(status, ERROR_SUCCESS);
    EXPECT_EQ(length, WideLength(name));
    keys.push_back(WideToUtf8(name));
  }
  EXPECT_EQ(keys, (std::vector<std::string>{"Alpha", "beta", "gamma"}));
  DWORD tooShort = 4;
  EXPECT_EQ(RegEnumKeyExW(key.Get(), 0, name, &tooShort, nullptr, nullptr, nullptr, nullptr),
            ERROR_MORE_DATA);

  // Values come in creation order, with their data.
  ASSERT_EQ(SetDword(key.Get(), u"z", 1), ERROR_SUCCESS);
  ASSERT_EQ(SetDword(key.Get(), u"a", 2), ERROR_SUCCESS);
  std::vector<std::string> values;
  for (DWORD i = 0;; ++i) {
    DWORD length = 64;
    DWORD type = 0;
    DWORD data = 0;
    DWORD size = sizeof data;
    LSTATUS status = RegEnumValueW(key.Get(), i, name, &length, nullptr, &type,
                                   reinterpret_cast<BYTE*>(&data), &size);
    if (status == ERROR_NO_MORE_ITEMS) break;
    ASSERT_EQ(status, ERROR_SUCCESS);
    EXPECT_EQ(type, REG_DWORD);
    values.push_back(WideToUtf8(name) + "=" + std::to_string(data));
  }
  EXPECT_EQ(values, (std::vector<std::string>{"z=1", "a=2"}));
}

// Two processes writing at the same time lose nothing: every operation
// re-reads and rewrites the store under the file lock.
TEST_F(Registry, ProcessesShareTheStoreWithoutLostWrites) {
  {
    Key key;
    ASSERT_EQ(Create(u"Shared", key), ERROR_SUCCESS);
  }
  WideString path = base_ + u"\\Shared";
  constexpr int kPerChild = 40;
  pid_t children[2];
  for (int c = 0; c < 2; ++c) {
    pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
      HKEY key = nullptr;
      if (RegOpenKeyExW(HKEY_CURRENT_USER, path.c_str(), 0, KEY_SET_VALUE, &key) != ERROR_SUCCESS)
        _exit(10);
      for (int i = 0; i < kPerChild; ++i) {
        WideString name = Utf8ToWide("c" + std::to_string(c) + "-" + std::to_string(i));
        DWORD value = static_cast<DWORD>(c * 1000 + i);
        if (SetDword(key, name.c_str(), value) != ERROR_SUCCESS) _exit(11);
      }
      RegCloseKey(key);
      _exit(0);
    }
    children[c] = pid;
  }
  for (pid_t pid : children) {
    int status = 0;
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(WEXITSTATUS(status), 0);
  }
  Key key;
  ASSERT_EQ(Open(u"Shared", KEY_READ, key), ERROR_SUCCESS);
  for (int c = 0; c < 2; ++c) {
    for (int i = 0; i < kPerChild; ++i) {
      WideString name = Utf8ToWide("c" + std::to_string(c) + "-" + std::to_string(i));
      DWORD value = 0;
      DWORD size = sizeof value;
      ASSERT_EQ(RegQueryValueExW(key.Get(), name.c_str(), nullptr, nullptr,
                                 reinterpret_cast<BYTE*>(&value), &size),
                ERROR_SUCCESS)
          << WideToUtf8(name);
      EXPECT_EQ(value, static_cast<DWORD>(c * 1000 + i));
    }
  }
}

// A store file that is damaged in any way reads as an empty registry, and the
// next write replaces it with a good one.
TEST_F(Registry, DamagedStoreReadsAsEmpty) {
  {
    Key key;
    ASSERT_EQ(Create(u"Kept", key), ERROR_SUCCESS);
    ASSERT_EQ(SetDword(key.Get(), u"V", 5), ERROR_SUCCESS);
  }
  std::string path = emu::RegistryStorePath();
  std::string good;
  {
    std::ifstream in(path, std::ios::binary);
    good.assign(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
  }
  ASSERT_FALSE(good.empty());
  const std::string damaged[] = {
      good.substr(0, good.size() - 5),                                           // torn at the end
      "garbage\n",                                                               // foreign file
      std::string("SKYVANE-REGISTRY 1\nK 0 HKEY_CURRENT_USER\nV x y z\nEND\n"),  // bad value line
      std::string(good).replace(good.find("HKEY_CURRENT_USER"), 4, "%ZZZ"),      // bad escape
  };
  for (const std::string& text : damaged) {
    {
      std::ofstream out(path, std::ios::binary | std::ios::trunc);
      out << text;
    }
    Key key;
    EXPECT_EQ(Open(u"Kept", KEY_READ, key), ERROR_FILE_NOT_FOUND);
  }
  Key key;
  ASSERT_EQ(Create(u"Fresh", key), ERROR_SUCCESS);
  emu::registry::Store reread;
  std::ifstream in(path, std::ios::binary);
  std::string now((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  EXPECT_TRUE(emu::registry::Parse(now, reread));
  EXPECT_NE(reread.Find(u"HKEY_CURRENT_USER\\" + base_ + u"\\Fresh"), nullptr);
}

TEST(RegistryStoreFile, RoundTripsAnyNamesAndData) {
  emu::registry::Store store;
  emu::registry::Parse("", store);  // an empty store with its roots
  WideString odd = u"HKEY_LOCAL_MACHINE\\with space\\100%@home\\\u00e9t\u00e9\\tab\there";
  emu::registry::Key& key = store.Create(odd);
  key.readOnly = true;
  key.values.push_back({u"", REG_BINARY, {0, 0, 255, 10, 13}});
  key.values.push_back({u"name with %, @ and \\", REG_SZ, {}});
  key.values.push_back({WideString(1, u'\xd800'), 0xFFFFFFFF, {1}});
  std::string text = emu::registry::Serialize(store);
  emu::registry::Store parsed;
  ASSERT_TRUE(emu::registry::Parse(text, parsed));
  EXPECT_EQ(emu::registry::Serialize(parsed), text);
  emu::registry::Key* found = parsed.Find(odd);
  ASSERT_NE(found, nullptr);
  EXPECT_TRUE(found->readOnly);
  ASSERT_EQ(found->values.size(), 3u);
  EXPECT_EQ(found->values[0].data, (std::vector<BYTE>{0, 0, 255, 10, 13}));
  EXPECT_EQ(found->values[1].name, u"name with %, @ and \\");
  EXPECT_EQ(found->values[2].type, 0xFFFFFFFFu);
  // Intermediate keys exist, and a key whose parent is missing is refused.
  EXPECT_NE(parsed.Find(u"hkey_local_machine\\WITH SPACE"), nullptr);
  emu::registry::Store orphan;
  EXPECT_FALSE(emu::registry::Parse("SKYVANE-REGISTRY 1\nK 0 HKEY_USERS\\a\\b\nEND\n", orphan));
  EXPECT_EQ(orphan.Find(u"HKEY_USERS\\a\\b"), nullptr);
  EXPECT_NE(orphan.Find(u"HKEY_USERS"), nullptr);
}

TEST(RegistryStoreFile, MissingDirectoriesAreCreated) {
  std::string saved = emu::RegistryStorePath();
  char pattern[] = "/tmp/skyvane-emuscm-XXXXXX";
  ASSERT_NE(mkdtemp(pattern), nullptr);
  std::string nested = std::string(pattern) + "/a/b/registry.dat";
  setenv("SKYVANE_REGISTRY", nested.c_str(), 1);
  HKEY key = nullptr;
  LSTATUS status = RegCreateKeyExW(HKEY_LOCAL_MACHINE, u"SOFTWARE\\X", 0, nullptr, 0,
                                   KEY_ALL_ACCESS, nullptr, &key, nullptr);
  if (key != nullptr) RegCloseKey(key);
  setenv("SKYVANE_REGISTRY", saved.c_str(), 1);
  EXPECT_EQ(status, ERROR_SUCCESS);
  EXPECT_EQ(access(nested.c_str(), R_OK), 0);
  std::string cleanup = std::string("rm -rf ") + pattern;
  EXPECT_EQ(std::system(cleanup.c_str()), 0);
}

}  // namespace
