// The emulated registry beyond the conformance suite: checks the registry
// command can reach, access rights, read-only keys and the store file.
#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>
#include <vector>

#include "platform/posix/emu_scm.h"
#include "platform/posix/registry_store.h"
#include "platform/wide.h"
#include "platform/win32.h"
#include "support/child_process.h"
#include "support/test_support.h"

namespace {

using Key = skytest::RegKey;

LSTATUS SetDword(HKEY key, const WCHAR* name, DWORD value) {
  return RegSetValueExW(key, name, 0, REG_DWORD, reinterpret_cast<const BYTE*>(&value),
                        sizeof value);
}

// The DWORD value, or 0xBAD when it cannot be read.
DWORD GetDword(HKEY key, const WCHAR* name) {
  DWORD value = 0;
  DWORD size = sizeof value;
  return RegQueryValueExW(key, name, nullptr, nullptr, reinterpret_cast<BYTE*>(&value), &size) ==
                 ERROR_SUCCESS
             ? value
             : 0xBAD;
}

std::string ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

// Each case works below a key of its own.
class Registry : public ::testing::Test {
 protected:
  void SetUp() override {
    base_ = u"Software\\SkyvaneEmuTest\\" +
            Utf8ToWide(::testing::UnitTest::GetInstance()->current_test_info()->name());
  }
  WideString Path(const WideString& sub) const { return sub.empty() ? base_ : base_ + u"\\" + sub; }
  LSTATUS Create(const WideString& sub, Key& key) {
    return RegCreateKeyExW(HKEY_CURRENT_USER, Path(sub).c_str(), 0, nullptr,
                           REG_OPTION_NON_VOLATILE, KEY_ALL_ACCESS, nullptr, key.Out(), nullptr);
  }
  LSTATUS Open(const WideString& sub, REGSAM access, Key& key) {
    return RegOpenKeyExW(HKEY_CURRENT_USER, Path(sub).c_str(), 0, access, key.Out());
  }

  WideString base_;
};

// Arguments the registry command passes on from its request.
TEST_F(Registry, ValuesKeepTheirBytesAndBadArgumentsAreRefused) {
  Key key;
  ASSERT_EQ(Create(u"", key), ERROR_SUCCESS);
  // A REG_SZ keeps exactly the bytes given, terminator or not; the default
  // value answers to a null and to an empty name.
  const char16_t text[] = {u'a', u'b', u'c'};
  ASSERT_EQ(RegSetValueExW(key.Get(), nullptr, 0, REG_SZ, reinterpret_cast<const BYTE*>(text), 6),
            ERROR_SUCCESS);
  BYTE data[16];
  std::memset(data, 0xEE, sizeof data);
  DWORD type = 0;
  DWORD size = 4;
  EXPECT_EQ(RegQueryValueExW(key.Get(), u"", nullptr, &type, data, &size), ERROR_MORE_DATA);
  EXPECT_EQ(data[0], 0xEE);  // a short buffer is left untouched
  size = sizeof data;
  ASSERT_EQ(RegQueryValueExW(key.Get(), u"", nullptr, &type, data, &size), ERROR_SUCCESS);
  EXPECT_EQ(type, REG_SZ);
  ASSERT_EQ(size, 6u);
  EXPECT_EQ(std::memcmp(data, text, 6), 0);
  EXPECT_EQ(RegQueryValueExW(key.Get(), nullptr, nullptr, nullptr, nullptr, nullptr),
            ERROR_SUCCESS);  // existence check

  Key missing;
  const struct {
    const char* call;
    LSTATUS got;
    LSTATUS expected;
  } rows[] = {
      {"leading backslash",
       RegOpenKeyExW(HKEY_CURRENT_USER, u"\\Software", 0, KEY_READ, missing.Out()),
       ERROR_BAD_PATHNAME},
      {"performance root", RegOpenKeyExW(HKEY_PERFORMANCE_DATA, u"x", 0, KEY_READ, missing.Out()),
       ERROR_INVALID_HANDLE},
  };
  for (const auto& row : rows) EXPECT_EQ(row.got, row.expected) << row.call;
  EXPECT_EQ(missing.Get(), nullptr);
}

TEST_F(Registry, AccessRightsAndReadOnlyKeys) {
  {
    Key key;
    ASSERT_EQ(Create(u"Locked\\Child", key), ERROR_SUCCESS);
    ASSERT_EQ(SetDword(key.Get(), u"V", 7), ERROR_SUCCESS);
  }
  {
    Key reader;  // a handle opened for reading cannot write or create
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
  WideString locked = Path(u"Locked\\Child");
  ASSERT_EQ(emu::SetRegistryKeyReadOnly(HKEY_CURRENT_USER, locked.c_str(), true), ERROR_SUCCESS);
  Key key;
  EXPECT_EQ(Open(u"Locked\\Child", KEY_ALL_ACCESS, key), ERROR_ACCESS_DENIED);
  EXPECT_EQ(Create(u"Locked\\Child", key), ERROR_ACCESS_DENIED);
  EXPECT_EQ(Create(u"Locked\\Child\\Below", key), ERROR_ACCESS_DENIED);
  ASSERT_EQ(Open(u"Locked\\Child", KEY_READ, key), ERROR_SUCCESS);
  EXPECT_EQ(GetDword(key.Get(), u"V"), 7u);
  Key parent;
  ASSERT_EQ(Open(u"Locked", KEY_ALL_ACCESS, parent), ERROR_SUCCESS);
  EXPECT_EQ(RegDeleteKeyW(parent.Get(), u"Child"), ERROR_ACCESS_DENIED);
  ASSERT_EQ(emu::SetRegistryKeyReadOnly(HKEY_CURRENT_USER, locked.c_str(), false), ERROR_SUCCESS);
  EXPECT_EQ(RegDeleteKeyW(parent.Get(), u"Child"), ERROR_SUCCESS);
  EXPECT_EQ(emu::SetRegistryKeyReadOnly(HKEY_CURRENT_USER, locked.c_str(), true),
            ERROR_FILE_NOT_FOUND);
}

// Two processes writing at once lose nothing (each call rewrites under a lock).
TEST_F(Registry, ProcessesShareTheStoreWithoutLostWrites) {
  {
    Key key;
    ASSERT_EQ(Create(u"Shared", key), ERROR_SUCCESS);
  }
  WideString path = Path(u"Shared");
  constexpr int kPerChild = 40;
  auto name = [](int c, int i) {
    return Utf8ToWide("c" + std::to_string(c) + "-" + std::to_string(i));
  };
  const char* const roles[] = {"writer0", "writer1"};
  for (int c = 0; c < 2; ++c) {
    skytest::RunAsChild(roles[c], [&, c] {
      HKEY key = nullptr;
      if (RegOpenKeyExW(HKEY_CURRENT_USER, path.c_str(), 0, KEY_SET_VALUE, &key) != ERROR_SUCCESS)
        return 10;
      for (int i = 0; i < kPerChild; ++i) {
        if (SetDword(key, name(c, i).c_str(), static_cast<DWORD>(c * 1000 + i)) != ERROR_SUCCESS)
          return 11;
      }
      return RegCloseKey(key) == ERROR_SUCCESS ? 0 : 12;
    });
  }
  skytest::ChildProcess children[2];
  for (int c = 0; c < 2; ++c) ASSERT_TRUE(children[c].Start(roles[c]));
  for (auto& child : children) EXPECT_EQ(child.Wait(skytest::kProcessGuardMs), 0);
  Key key;
  ASSERT_EQ(Open(u"Shared", KEY_READ, key), ERROR_SUCCESS);
  for (int c = 0; c < 2; ++c) {
    for (int i = 0; i < kPerChild; ++i) {
      EXPECT_EQ(GetDword(key.Get(), name(c, i).c_str()), static_cast<DWORD>(c * 1000 + i));
    }
  }
}

// A damaged store reads as empty; the next write replaces it with a good one.
TEST_F(Registry, DamagedStoreReadsAsEmpty) {
  {
    Key key;
    ASSERT_EQ(Create(u"Kept", key), ERROR_SUCCESS);
    ASSERT_EQ(SetDword(key.Get(), u"V", 5), ERROR_SUCCESS);
  }
  std::string path = emu::RegistryStorePath();
  std::string good = ReadFile(path);
  ASSERT_FALSE(good.empty());
  const std::string damaged[] = {
      good.substr(0, good.size() - 5),                                           // torn at the end
      "garbage\n",                                                               // foreign file
      std::string("SKYVANE-REGISTRY 1\nK 0 HKEY_CURRENT_USER\nV x y z\nEND\n"),  // bad value line
      std::string(good).replace(good.find("HKEY_CURRENT_USER"), 4, "%ZZZ"),      // bad escape
  };
  for (const std::string& text : damaged) {
    std::ofstream(path, std::ios::binary | std::ios::trunc) << text;
    Key key;
    EXPECT_EQ(Open(u"Kept", KEY_READ, key), ERROR_FILE_NOT_FOUND) << text;
  }
  Key key;
  ASSERT_EQ(Create(u"Fresh", key), ERROR_SUCCESS);
  emu::registry::Store reread;
  EXPECT_TRUE(emu::registry::Parse(ReadFile(path), reread));
  EXPECT_NE(reread.Find(u"HKEY_CURRENT_USER\\" + Path(u"Fresh")), nullptr);
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

}  // namespace
