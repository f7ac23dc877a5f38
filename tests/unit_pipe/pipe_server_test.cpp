#include "pipe/pipe_server.h"

#include <gtest/gtest.h>

#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "monitor/null_dacl.h"
#include "pipe/command_message.h"
#include "pipe/pipe_client.h"
#include "pipe/pipe_instance.h"
#include "pipe_fixture.h"
#include "platform/wide.h"
#ifndef _WIN32
#include "platform/posix/emu_scm.h"
#endif
#include "support/test_support.h"

namespace {

using pipetest::Exchange;
using pipetest::Handle;
using pipetest::NewCommand;
using pipetest::Send;

class PipeServerTest : public pipetest::ServerFixture {
 protected:
  DWORD PublishedStatus() { return MappedCopy()->statusWord; }
  DWORD PublishedSequence() { return MappedCopy()->sequence; }
  // Under the mutex, as the monitor reads and writes them.
  template <typename F>
  DWORD Locked(F f) {
    WaitForSingleObject(monitorState.stateMutex, INFINITE);
    const DWORD value = f();
    ReleaseMutex(monitorState.stateMutex);
    return value;
  }
};

// A request whose declared length is `declared`, `sent` bytes of it sent.
Exchange SendDeclared(HANDLE client, DWORD command, DWORD arg1, std::uint64_t declared,
                      DWORD sent) {
  std::vector<BYTE> request(sent > kCommandMaxLength ? sent : kCommandMaxLength, 0);
  auto message = NewCommand(command, arg1, 2, 3);
  message->length = declared;
  std::memcpy(request.data(), message.get(), sizeof(CommandMessage));
  return Send(client, request.data(), sent);
}

// A length outside the range gets an empty reply, changes nothing and keeps
// the connection; codes outside the table answer -777 and still publish.
TEST_F(PipeServerTest, RequestsAreServedAtTheirDeclaredLengthOrNotAtAll) {
  Handle client = Connect();
  ASSERT_TRUE(client);
  constexpr DWORD kMin = kCommandMinLength;
  constexpr DWORD kMax = kCommandMaxLength;
  const struct {
    std::uint64_t declared;
    DWORD sent;
    DWORD command;
    DWORD arg;
    bool served;
  } cases[] = {
      {kMin, kMin, kCommandSetStatus, 41, true},
      {kMax, kMax, kCommandSetStatus, 500, true},
      {kMin - 1, kMin - 1, kCommandSetStatus, 99, false},
      {kMax + 1, kMax, kCommandSetStatus, 99, false},
      {0, kMax, kCommandSetStatus, 99, false},
      {0x100000000ull + kMin, kMax, kCommandSetStatus, 99, false},
      {kMin, kMin, kCommandSetStatus, 0, true},
      {kMax, kMax, kCommandSetStatus, 0xFFFFFFFFu, true},
      {kMax, kMax, 0, 1, true},
      {kMax, kMax, 4, 1, true},
      {kMax, kMax, 5, 1, true},
      {kMax, kMax, 14, 1, true},
      {kMax, kMax, 0xFFFFFFFFu, 1, true},
  };
  DWORD status = 0;
  for (const auto& c : cases) {
    SCOPED_TRACE(testing::Message() << c.declared << " " << c.command << " " << c.arg);
    const DWORD before = PublishedSequence();
    Exchange reply = SendDeclared(client.Get(), c.command, c.arg, c.declared, c.sent);
    ASSERT_TRUE(reply.ok) << reply.error;
    EXPECT_EQ(reply.reply.size(), c.served ? c.declared : 0u);
    if (c.served && c.command == kCommandSetStatus) {
      status = c.arg;
      EXPECT_EQ(reply.Result(), 1u);
      EXPECT_EQ(reply.Detail(), 0u);
    } else if (c.served) {
      EXPECT_EQ(reply.Result(), kCommandUnknownResult);
      EXPECT_EQ(reply.Detail(), kCommandUnknownResult);
    }
    EXPECT_EQ(PublishedStatus(), status);
    EXPECT_EQ(PublishedSequence(), before + (c.served ? 1 : 0));
  }
}

#ifndef _WIN32
// Six full replies overfill the emulation's 64 KB pipe: the server waits for a
// client that reads late. (Windows' quota would block this client's writes.)
TEST_F(PipeServerTest, RepliesWaitForAClientThatReadsLate) {
  Handle client = Connect();
  ASSERT_TRUE(client);
  std::vector<BYTE> message(kCommandMaxLength, 0);
  auto command = NewCommand(kCommandSetStatus, 7);
  command->length = kCommandMaxLength;
  std::memcpy(message.data(), command.get(), sizeof(CommandMessage));
  DWORD bytes = 0;
  for (int i = 0; i < 6; ++i) {
    const DWORD before = PublishedSequence();
    ASSERT_TRUE(WriteFile(client.Get(), message.data(), kCommandMaxLength, &bytes, nullptr)) << i;
    for (int wait = 0; wait < 1000 && PublishedSequence() == before; ++wait) Sleep(10);
  }
  Sleep(100);  // lets the sixth reply find the pipe full; either way this must pass
  for (int i = 0; i < 6; ++i) {
    ASSERT_TRUE(ReadFile(client.Get(), message.data(), kCommandMaxLength, &bytes, nullptr)) << i;
    EXPECT_EQ(bytes, kCommandMaxLength);
  }
}
#endif

TEST_F(PipeServerTest, EmptyOrOverlongMessageDisconnectsThatClientOnly) {
  Handle bystander = Connect();
  ASSERT_TRUE(bystander);
  for (DWORD sent : {kCommandMaxLength + 1, 0u}) {
    Handle client = Connect();
    ASSERT_TRUE(client);
    EXPECT_FALSE(SendDeclared(client.Get(), kCommandSetStatus, 11, kCommandMaxLength, sent).ok)
        << sent;
  }
  // The bystander's request publishes the working copy.
  Exchange reply = Send(bystander.Get(), *NewCommand(4));
  EXPECT_TRUE(reply.ok);
  EXPECT_EQ(reply.Result(), kCommandUnknownResult);
  EXPECT_NE(PublishedStatus(), 11u);
}

// Early leavers free their instances; there are fifteen, and no room for
// someone else's instance, which would receive the service's clients.
TEST_F(PipeServerTest, FifteenInstancesServeAgainAfterClientsLeftEarly) {
  std::vector<Handle> clients;
  clients.push_back(Connect());
  ASSERT_TRUE(clients[0]);
  for (int round = 0; round < 3; ++round) {
    Handle leaves = Connect();
    ASSERT_TRUE(leaves);
    auto request = NewCommand(kCommandSetStatus, 1234);
    DWORD written = 0;
    ASSERT_TRUE(WriteFile(leaves.Get(), request.get(), sizeof(CommandMessage), &written, nullptr));
    leaves.Reset();
    EXPECT_EQ(Send(clients[0].Get(), *NewCommand(kCommandSetStatus, 77)).Result(), 1u);
  }
  for (int i = 1; i < kPipeInstanceCount; ++i) {
    clients.push_back(Connect());
    ASSERT_TRUE(clients.back());
    EXPECT_EQ(Send(clients.back().Get(), *NewCommand(kCommandSetStatus, 100u + DWORD(i))).Result(),
              1u);
  }
  EXPECT_FALSE(Handle(
      CreateFileW(kPipeName, GENERIC_READ | GENERIC_WRITE, 0, nullptr, OPEN_EXISTING, 0, nullptr)));
  EXPECT_EQ(GetLastError(), static_cast<DWORD>(ERROR_PIPE_BUSY));
  EXPECT_FALSE(Handle(CreateNamedPipeW(kPipeName, PIPE_ACCESS_DUPLEX,
                                       PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_WAIT,
                                       kPipeInstanceCount, 4096, 4096, 0, nullptr)));

  clients[7].Reset();
  Handle late(OpenCommandPipe(skytest::kGuardMs));
  ASSERT_TRUE(late) << GetLastError();
  EXPECT_EQ(Send(late.Get(), *NewCommand(kCommandSetStatus, 16)).Result(), 1u);
  for (std::size_t i = 0; i < clients.size(); ++i) {
    if (i == 7) continue;
    EXPECT_TRUE(Send(clients[i].Get(), *NewCommand(kCommandResume)).ok) << i;
  }
}

// Any account may keep the mutex; the stop must still end the thread.
TEST_F(PipeServerTest, StopEndsTheThreadWithClientsConnectedAndTheMutexHeld) {
  Handle idle = Connect();
  Handle served = Connect();
  Handle waiting = Connect();
  ASSERT_TRUE(idle && served && waiting);
  ASSERT_TRUE(Send(served.Get(), *NewCommand(kCommandResume)).ok);
  ASSERT_EQ(WaitForSingleObject(monitorState.stateMutex, skytest::kGuardMs), WAIT_OBJECT_0);
  auto request = NewCommand(kCommandSetStatus, 9);
  DWORD written = 0;
  ASSERT_TRUE(WriteFile(waiting.Get(), request.get(), sizeof(CommandMessage), &written, nullptr));
  // Only whether the case meets the server's wait for the mutex depends on it.
  Sleep(50);
  EXPECT_TRUE(StopServer());
  ReleaseMutex(monitorState.stateMutex);
  EXPECT_NE(MappedCopy()->statusWord, 9u) << "the request ran after the stop";
  std::vector<BYTE> buffer(kCommandMaxLength);
  DWORD read = 0;
  EXPECT_FALSE(ReadFile(idle.Get(), buffer.data(), kCommandMaxLength, &read, nullptr));
  EXPECT_FALSE(Handle(
      CreateFileW(kPipeName, GENERIC_READ | GENERIC_WRITE, 0, nullptr, OPEN_EXISTING, 0, nullptr)));
}

class PipeNameTakenTest : public pipetest::ServerFixture {
  void SetUp() override { MonitorFixture::SetUp(); }
};

TEST_F(PipeNameTakenTest, ServerLogsAHeldNameAndServesOnceItIsFree) {
  SKIP_ON_WINE("Wine 8 ignores FILE_FLAG_FIRST_PIPE_INSTANCE and creates the second instance");
  // Spare instances allowed: only the first-instance flag keeps the service out.
  Handle squatter(CreateNamedPipeW(kPipeName, PIPE_ACCESS_DUPLEX,
                                   PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_WAIT,
                                   PIPE_UNLIMITED_INSTANCES, 4096, 4096, 0, nullptr));
  ASSERT_TRUE(squatter) << GetLastError();
#ifndef _WIN32
  emu::ClearEventLog();
#endif
  const ULONGLONG start = GetTickCount64();
  StartServer();
  EXPECT_EQ(WaitForSingleObject(thread_.Get(), 100), static_cast<DWORD>(WAIT_TIMEOUT));
  squatter.Reset();
  Handle client;
  for (int attempt = 0; attempt < 100 && !client; ++attempt) {
    client.Reset(OpenCommandPipe(skytest::kGuardMs));
    if (!client) Sleep(100);
  }
  ASSERT_TRUE(client);
  EXPECT_GE(GetTickCount64() - start, 500u) << "a set-aside instance is retried after 500 ms";
  EXPECT_EQ(Send(client.Get(), *NewCommand(kCommandSetStatus, 42)).Result(), 1u);
#ifndef _WIN32
  std::size_t reports = 0;
  for (const emu::EventLogEntry& entry : emu::EventLogEntries()) {
    for (const std::u16string& text : entry.strings) {
      if (text.find(u"pipe") != std::u16string::npos) ++reports;
    }
  }
  EXPECT_EQ(reports, 1u) << "a held name is logged once";
#endif
  EXPECT_TRUE(StopServer());
}

TEST_F(PipeServerTest, PauseRefusesSafeRemovalAndDriveCommandsWithoutADriveFail) {
  Handle client = Connect();
  ASSERT_TRUE(client);
  Locked([] { return monitorState.pauseTicks = 17; });
  Exchange pause = Send(client.Get(), *NewCommand(kCommandPause));
  EXPECT_EQ(pause.Result(), 0u);
  EXPECT_EQ(pause.Detail(), 0u);
  EXPECT_EQ(Locked([] { return monitorState.paused; }), 1u);
  EXPECT_EQ(Locked([] { return monitorState.pauseTicks; }), 0u);
  Exchange refused = Send(client.Get(), *NewCommand(kCommandSafeRemove, 0));
  EXPECT_EQ(refused.Result(), 0u);
  EXPECT_EQ(refused.Detail(), 1u);
  EXPECT_EQ(PublishedStatus(), 0u) << "a removal was attempted while paused";

  Locked([] { return monitorState.pauseTicks = 9; });
  EXPECT_EQ(Send(client.Get(), *NewCommand(kCommandResume)).Result(), 0u);
  EXPECT_EQ(Locked([] { return monitorState.paused; }), 0u);
  EXPECT_EQ(Locked([] { return monitorState.pauseTicks; }), 9u) << "resume clears only the pause";
  EXPECT_EQ(Send(client.Get(), *NewCommand(kCommandSafeRemove, 3)).Result(), 0u);
  EXPECT_EQ(PublishedStatus(), 603u);
  EXPECT_EQ(Send(client.Get(), *NewCommand(kCommandReleaseDrive, 0)).Result(), 0u);
  EXPECT_EQ(PublishedStatus(), 102u);

  // The block's one drive has a key that is only a prefix of the one named.
  Locked([this] {
    Block().driveCount = 1;
    return static_cast<DWORD>(WideCopy(Block().drives[0].firmwareSerial, 64, WSTR("NO-SUCH")));
  });
  auto read = NewCommand(kCommandReadStatus);
  const WCHAR serial[] = WSTR("NO-SUCH-DRIVE");
  std::memcpy(read->driveImage + kDriveKeyOffsetInImage, serial, sizeof(serial));
  EXPECT_EQ(Send(client.Get(), *read).Result(), static_cast<DWORD>(ERROR_INVALID_PARAMETER));
  read->command = kCommandWriteControl;
  EXPECT_EQ(Send(client.Get(), *read).Result(), static_cast<DWORD>(ERROR_INVALID_PARAMETER));
}

// Before version 6 the DACL denies network logons, then allows everyone; from
// 6 on it is null and the mode refuses remote clients.
TEST(PipeSecurityTest, NetworkDeniedBeforeVersionSixRemoteFlagFromSix) {
  PSID network = nullptr;
  PSID everyone = nullptr;
  SID_IDENTIFIER_AUTHORITY nt = SECURITY_NT_AUTHORITY;
  SID_IDENTIFIER_AUTHORITY world = SECURITY_WORLD_SID_AUTHORITY;
  ASSERT_TRUE(
      AllocateAndInitializeSid(&nt, 1, SECURITY_NETWORK_RID, 0, 0, 0, 0, 0, 0, 0, &network));
  ASSERT_TRUE(
      AllocateAndInitializeSid(&world, 1, SECURITY_WORLD_RID, 0, 0, 0, 0, 0, 0, 0, &everyone));
  const struct {
    BYTE type;
    PSID sid;
  } expected[] = {{ACCESS_DENIED_ACE_TYPE, network}, {ACCESS_ALLOWED_ACE_TYPE, everyone}};
  const WCHAR* name = WSTR("\\\\.\\pipe\\SkyvanePipeSecurityTest");
  for (DWORD major : {4u, 5u, 6u, 10u}) {
    SCOPED_TRACE(major);
    PipeSecurity security;
    ASSERT_TRUE(InitPipeSecurity(&security, major));
    BOOL present = FALSE;
    BOOL defaulted = TRUE;
    PACL dacl = nullptr;
    ASSERT_TRUE(GetSecurityDescriptorDacl(security.attributes.lpSecurityDescriptor, &present, &dacl,
                                          &defaulted));
    EXPECT_TRUE(present);
    EXPECT_FALSE(defaulted);
    if (major >= 6) {
      EXPECT_EQ(dacl, nullptr);
      EXPECT_EQ(security.pipeModeFlags, static_cast<DWORD>(PIPE_REJECT_REMOTE_CLIENTS));
    } else {
      EXPECT_EQ(security.pipeModeFlags, 0u);
      ASSERT_NE(dacl, nullptr);
      ASSERT_EQ(dacl->AceCount, 2u);
      for (DWORD i = 0; i < 2; ++i) {
        LPVOID ace = nullptr;
        ASSERT_TRUE(GetAce(dacl, i, &ace));
        auto* entry = static_cast<ACCESS_ALLOWED_ACE*>(ace);
        EXPECT_EQ(entry->Header.AceType, expected[i].type) << i;
        EXPECT_EQ(entry->Mask, static_cast<ACCESS_MASK>(GENERIC_ALL)) << i;
        EXPECT_TRUE(EqualSid(&entry->SidStart, expected[i].sid)) << i;
      }
    }
    Handle server(
        CreateNamedPipeW(name, PIPE_ACCESS_DUPLEX,
                         PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | security.pipeModeFlags, 1, 64,
                         64, 0, &security.attributes));
    ASSERT_TRUE(server) << GetLastError();
    Handle client(
        CreateFileW(name, GENERIC_READ | GENERIC_WRITE, 0, nullptr, OPEN_EXISTING, 0, nullptr));
    EXPECT_TRUE(client) << GetLastError();
  }
  FreeSid(network);
  FreeSid(everyone);
}

}  // namespace
