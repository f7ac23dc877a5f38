// Command 13: a client's offsets, lengths and root key never reach beyond
// what it sent or into the service's own handles.
#include <gtest/gtest.h>

#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "pipe/command_message.h"
#include "pipe/dispatcher.h"
#include "pipe/pipe_client.h"
#include "pipe/registry_access.h"
#include "pipe_fixture.h"
#include "platform/wide.h"
#include "support/test_support.h"

namespace {

using pipetest::NewCommand;

class RegistryRequestTest : public pipetest::MonitorFixture {
 protected:
  RegistryRequestTest() {
    HKEY key = nullptr;
    EXPECT_EQ(RegCreateKeyExW(HKEY_CURRENT_USER, path_.c_str(), 0, nullptr, 0, KEY_ALL_ACCESS,
                              nullptr, &key, nullptr),
              ERROR_SUCCESS);
    if (key != nullptr) RegCloseKey(key);
  }
  ~RegistryRequestTest() override { RegDeleteKeyW(HKEY_CURRENT_USER, path_.c_str()); }

  std::unique_ptr<CommandMessage> Request(const char* name, DWORD operation, DWORD type,
                                          const void* data, DWORD dataLength) {
    auto message = NewCommand(kCommandRegistry);
    EXPECT_TRUE(LayOutRegistryRequest(message.get(), RootKeyValue(HKEY_CURRENT_USER), path_.c_str(),
                                      Utf8ToWide(name).c_str(), operation, type, data, dataLength));
    return message;
  }

  // `available` bytes delivered from the request's start.
  static DWORD Run(CommandMessage* message,
                   std::size_t available = sizeof(CommandMessage) - kRegistryRequestOffset) {
    return RunRegistryRequest(reinterpret_cast<BYTE*>(&message->registry), available);
  }

  // The value's type and data as the registry holds them; type 0xFFFF when absent.
  std::vector<BYTE> ReadValue(const char* name, DWORD* type) {
    std::vector<BYTE> data(2048);
    DWORD size = static_cast<DWORD>(data.size());
    HKEY key = nullptr;
    LSTATUS status = RegOpenKeyExW(HKEY_CURRENT_USER, path_.c_str(), 0, KEY_READ, &key);
    if (status == ERROR_SUCCESS) {
      status = RegQueryValueExW(key, Utf8ToWide(name).c_str(), nullptr, type, data.data(), &size);
      RegCloseKey(key);
    }
    if (status != ERROR_SUCCESS) *type = 0xFFFF;
    data.resize(status == ERROR_SUCCESS ? size : 0);
    return data;
  }

  bool HasValue(const char* name) {
    DWORD type = 0;
    ReadValue(name, &type);
    return type != 0xFFFF;
  }

  const WideString path_ = Utf8ToWide("Software\\" + skytest::UniqueStem("reg"));
};

std::vector<BYTE> Pattern(std::size_t size) {
  std::vector<BYTE> data(size);
  for (std::size_t i = 0; i < size; ++i) data[i] = static_cast<BYTE>(i * 7 + 1);
  return data;
}

TEST_F(RegistryRequestTest, OutcomesOfSetQueryAndOtherOperations) {
  const std::vector<BYTE> data = Pattern(300);
  EXPECT_EQ(Run(Request("Blob", kRegistrySet, REG_BINARY, data.data(), 100).get()), ERROR_SUCCESS);
  DWORD type = 0;
  EXPECT_EQ(ReadValue("Blob", &type), std::vector<BYTE>(data.begin(), data.begin() + 100));
  EXPECT_EQ(type, static_cast<DWORD>(REG_BINARY));

  auto query = Request("Blob", kRegistryQuery, REG_NONE, nullptr, 400);
  query->registry.dataLengthHigh = 0xDEADBEEF;
  EXPECT_EQ(Run(query.get()), ERROR_SUCCESS);
  EXPECT_EQ(query->registry.dataLength, 100u);
  EXPECT_EQ(query->registry.dataLengthHigh, 0u);
  EXPECT_EQ(query->registry.valueType, static_cast<DWORD>(REG_BINARY));
  EXPECT_EQ(std::memcmp(RegistryData(query.get()), data.data(), 100), 0);

  EXPECT_EQ(Run(Request("Big", kRegistrySet, REG_BINARY, data.data(), 300).get()), ERROR_SUCCESS);
  auto small = Request("Big", kRegistryQuery, REG_NONE, nullptr, 10);
  EXPECT_EQ(Run(small.get()), static_cast<DWORD>(ERROR_MORE_DATA));
  EXPECT_EQ(small->registry.dataLength, 300u);

  auto absent = Request("Absent", kRegistryQuery, REG_NONE, nullptr, 64);
  EXPECT_EQ(Run(absent.get()), static_cast<DWORD>(ERROR_FILE_NOT_FOUND));
  EXPECT_EQ(absent->registry.dataLength, 64u) << "the request's own length stays";

  EXPECT_EQ(Run(Request("Untouched", 2, REG_BINARY, data.data(), 8).get()), ERROR_SUCCESS);
  EXPECT_FALSE(HasValue("Untouched"));
}

TEST_F(RegistryRequestTest, RootKeyMustBePredefined) {
  // A number from a client never becomes a handle of the service.
  HKEY own = nullptr;
  ASSERT_EQ(RegOpenKeyExW(HKEY_CURRENT_USER, WSTR("Software"), 0, KEY_ALL_ACCESS, &own),
            ERROR_SUCCESS);
  const std::uint64_t hklm = RootKeyValue(HKEY_LOCAL_MACHINE);
  const std::uint64_t refused[] = {
      0,
      RootKeyValue(own),
      hklm + 2,                           // performance data
      hklm + 4,                           // not a root of this system
      (hklm & 0xFFFFFFFFu) | 1ull << 32,  // a high half neither sign nor zero
      0xFFFFFFFFFFFFFFFFull,
  };
  const std::vector<BYTE> data = Pattern(4);
  for (std::uint64_t root : refused) {
    auto request = Request("Refused", kRegistrySet, REG_BINARY, data.data(), 4);
    request->registry.rootKey = root;
    EXPECT_EQ(Run(request.get()), static_cast<DWORD>(ERROR_INVALID_PARAMETER)) << std::hex << root;
  }
  RegCloseKey(own);
  EXPECT_FALSE(HasValue("Refused"));

  // Each root as 64-bit and 32-bit (zero-extended) clients send it.
  for (HKEY root : {HKEY_CLASSES_ROOT, HKEY_CURRENT_USER, HKEY_LOCAL_MACHINE, HKEY_USERS,
                    HKEY_CURRENT_CONFIG}) {
    for (std::uint64_t value : {RootKeyValue(root), RootKeyValue(root) & 0xFFFFFFFFu}) {
      auto request = NewCommand(kCommandRegistry);
      ASSERT_TRUE(
          LayOutRegistryRequest(request.get(), value, WSTR(""), WSTR(""), 2, REG_NONE, nullptr, 0));
      EXPECT_EQ(Run(request.get()), ERROR_SUCCESS) << std::hex << value;
    }
  }
  auto set = Request("Narrow", kRegistrySet, REG_BINARY, data.data(), 4);
  set->registry.rootKey = RootKeyValue(HKEY_CURRENT_USER) & 0xFFFFFFFFu;
  EXPECT_EQ(Run(set.get()), ERROR_SUCCESS);
  EXPECT_TRUE(HasValue("Narrow")) << "the 32-bit form reached another key";
}

TEST_F(RegistryRequestTest, TextsAndDataMustLieInsideTheBytesDelivered) {
  const std::vector<BYTE> data = Pattern(16);
  auto base = Request("Edge", kRegistrySet, REG_BINARY, data.data(), 16);
  const std::size_t full = sizeof(CommandMessage) - kRegistryRequestOffset;
  const std::size_t pathStart = kRegistryPathOffset;
  const std::uint64_t nameOffset = base->registry.nameOffset;
  const std::uint64_t dataOffset = base->registry.dataOffset;
  const std::size_t dataEnd = pathStart + nameOffset + dataOffset + 16;

  struct Case {
    const char* what;
    std::uint64_t nameOffset;
    std::uint64_t dataOffset;
    DWORD dataLength;
    std::size_t available;
  };
  const Case refused[] = {
      {"nothing after the fixed part", nameOffset, dataOffset, 16, pathStart},
      {"fixed part cut", nameOffset, dataOffset, 16, pathStart - 1},
      {"path cut before its terminator", nameOffset, dataOffset, 16, pathStart + 4},
      {"path terminator half delivered", nameOffset, dataOffset, 16, pathStart + nameOffset - 1},
      {"name cut before its terminator", nameOffset, dataOffset, 16,
       pathStart + nameOffset + dataOffset - 1},
      {"data one byte short", nameOffset, dataOffset, 16, dataEnd - 1},
      {"name offset at the end", full - pathStart, 0, 0, full},
      {"name offset past the end", full - pathStart + 2, 0, 0, full},
      {"name offset huge", 0x8000000000000000ull, dataOffset, 16, full},
      {"name offset wraps", ~0ull - 1, dataOffset, 16, full},
      {"data offset past the end", nameOffset, full, 0, full},
      {"data offset wraps", nameOffset, ~0ull - 7, 16, full},
      {"data length past the end", nameOffset, dataOffset,
       static_cast<DWORD>(full - pathStart - nameOffset - dataOffset + 1), full},
      {"data length huge", nameOffset, dataOffset, 0xFFFFFFFFu, full},
  };
  for (const Case& c : refused) {
    auto request = std::make_unique<CommandMessage>(*base);
    request->registry.nameOffset = c.nameOffset;
    request->registry.dataOffset = c.dataOffset;
    request->registry.dataLength = c.dataLength;
    EXPECT_EQ(Run(request.get(), c.available), static_cast<DWORD>(ERROR_INVALID_PARAMETER))
        << c.what;
  }
  EXPECT_FALSE(HasValue("Edge"));

  EXPECT_EQ(Run(base.get(), dataEnd), ERROR_SUCCESS);
  DWORD type = 0;
  EXPECT_EQ(ReadValue("Edge", &type), data);

  auto tail = Request("Tail", kRegistrySet, REG_BINARY, nullptr, 0);
  const std::size_t room =
      sizeof(tail->registryText) -
      static_cast<std::size_t>(tail->registry.nameOffset + tail->registry.dataOffset);
  std::memset(RegistryData(tail.get()), 0x5A, room);
  tail->registry.dataLength = static_cast<DWORD>(room);
  EXPECT_EQ(Run(tail.get()), ERROR_SUCCESS);
  EXPECT_EQ(ReadValue("Tail", &type), std::vector<BYTE>(room, 0x5A));
}

// Through the dispatcher: the less of what was delivered and declared counts.
using RegistryDispatchTest = RegistryRequestTest;

TEST_F(RegistryDispatchTest, BytesNotDeliveredOrBeyondTheDeclaredLengthAreRefused) {
  const DWORD data = 0x01020304;
  auto message = Request("Cut", kRegistrySet, REG_DWORD, &data, sizeof(data));
  const std::size_t dataEnd = static_cast<std::size_t>(RegistryData(message.get()) -
                                                       reinterpret_cast<BYTE*>(message.get())) +
                              sizeof(data);
  std::vector<BYTE> request(kPipeBufferBytes);
  std::vector<BYTE> reply(kPipeBufferBytes);
  auto dispatch = [&](DWORD received, std::uint64_t declared) {
    std::memcpy(request.data(), message.get(), sizeof(CommandMessage));
    std::memcpy(request.data(), &declared, sizeof(declared));
    const DWORD length = DispatchRequest(request.data(), received, reply.data());
    EXPECT_EQ(length, declared >= kCommandMinLength && declared <= kCommandMaxLength
                          ? static_cast<DWORD>(declared)
                          : 0u);
    DWORD result = 0;
    std::memcpy(&result, reply.data() + offsetof(CommandMessage, result), sizeof(result));
    return result;
  };
  EXPECT_EQ(dispatch(static_cast<DWORD>(dataEnd - 1), kCommandMaxLength),
            static_cast<DWORD>(ERROR_INVALID_PARAMETER));
  EXPECT_FALSE(HasValue("Cut"));
  if (dataEnd > kCommandMinLength) {
    EXPECT_EQ(dispatch(kCommandMaxLength, dataEnd - 1), ERROR_SUCCESS);
    EXPECT_TRUE(HasValue("Cut"));
  }
  EXPECT_EQ(dispatch(static_cast<DWORD>(dataEnd), kCommandMaxLength), ERROR_SUCCESS);
  DWORD type = 0;
  const std::vector<BYTE> stored = ReadValue("Cut", &type);
  ASSERT_EQ(stored.size(), sizeof(data));
  EXPECT_EQ(std::memcmp(stored.data(), &data, sizeof(data)), 0);
}

}  // namespace
