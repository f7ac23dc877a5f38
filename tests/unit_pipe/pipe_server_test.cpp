// The pipe server and dispatcher against real clients: message lengths,
// instance limits, clients that leave early, stopping, and the commands that
// need no drive, as the shared block shows them afterwards.
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
  DWORD PublishedStatus() { return Published()->statusWord; }
  DWORD PublishedSequence() { return Published()->sequence; }
  // The monitor flags, read or written as the monitor does: under the mutex.
  DWORD Paused() {
    return Locked([] { return monitorState.paused; });
  }
  DWORD PauseTicks() {
    return Locked([] { return monitorState.pauseTicks; });
  }
  void SetPauseTicks(DWORD value) {
    Locked([value] { return monitorState.pauseTicks = value; });
  }
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
  auto message = NewCommand(command, arg1);
  message->length = declared;
  std::memcpy(request.data(), message.get(), sizeof(CommandMessage));
  return Send(client, request.data(), sent);
}

TEST_F(PipeServerTest, SetStatusAtEitherLengthBoundIsPublishedBeforeTheReply) {
  Handle client = Connect();
  ASSERT_TRUE(client);
  const struct {
    DWORD length;
    DWORD status;
  } cases[] = {{kCommandMinLength, 41},
               {kCommandMaxLength, 500},
               {kCommandMinLength, 0},
               {kCommandMaxLength, 0xFFFFFFFFu}};
  for (const auto& c : cases) {
    SCOPED_TRACE(testing::Message() << c.length << " " << c.status);
    const DWORD before = PublishedSequence();
    Exchange reply = SendDeclared(client.Get(), kCommandSetStatus, c.status, c.length, c.length);
    ASSERT_TRUE(reply.ok) << reply.error;
    EXPECT_EQ(reply.reply.size(), c.length);
    EXPECT_EQ(reply.Result(), 1u);
    EXPECT_EQ(reply.Detail(), 0u);
    EXPECT_EQ(PublishedStatus(), c.status);
    EXPECT_EQ(PublishedSequence(), before + 1);
  }
}

TEST_F(PipeServerTest, LengthOutsideTheRangeGetsAnEmptyReplyAndChangesNothing) {
  Handle client = Connect();
  ASSERT_TRUE(client);
  ASSERT_TRUE(
      SendDeclared(client.Get(), kCommandSetStatus, 7, kCommandMaxLength, kCommandMaxLength).ok);
  const DWORD sequence = PublishedSequence();
  struct Case {
    std::uint64_t declared;
    DWORD sent;
  };
  const Case cases[] = {{kCommandMinLength - 1, kCommandMinLength - 1},
                        {kCommandMaxLength + 1, kCommandMaxLength},
                        {0, kCommandMaxLength},
                        {0x100000000ull + kCommandMinLength, kCommandMaxLength}};
  for (const Case& c : cases) {
    Exchange reply = SendDeclared(client.Get(), kCommandSetStatus, 99, c.declared, c.sent);
    ASSERT_TRUE(reply.ok) << c.declared << " error " << reply.error;
    EXPECT_TRUE(reply.reply.empty()) << c.declared;
  }
  EXPECT_EQ(PublishedStatus(), 7u);
  EXPECT_EQ(PublishedSequence(), sequence);
  // The connection goes on.
  EXPECT_EQ(SendDeclared(client.Get(), kCommandSetStatus, 8, kCommandMinLength, kCommandMinLength)
                .Result(),
            1u);
}

TEST_F(PipeServerTest, EmptyOrOverlongMessageDisconnectsThatClientOnly) {
  Handle bystander = Connect();
  ASSERT_TRUE(bystander);
  {
    Handle client = Connect();
    ASSERT_TRUE(client);
    EXPECT_FALSE(
        SendDeclared(client.Get(), kCommandSetStatus, 11, kCommandMaxLength, kCommandMaxLength + 1)
            .ok);
  }
  {
    Handle client = Connect();
    ASSERT_TRUE(client);
    EXPECT_FALSE(Send(client.Get(), "", 0).ok);
  }
  // The bystander's connection still works; its request publishes the
  // working copy, which never took the status of the dropped requests.
  Exchange reply = Send(bystander.Get(), *NewCommand(4));
  EXPECT_TRUE(reply.ok);
  EXPECT_EQ(reply.Result(), kCommandUnknownResult);
  EXPECT_NE(PublishedStatus(), 11u);
}

TEST_F(PipeServerTest, ReplyHasTheDeclaredLengthAndNoBytesOfAnEarlierRequest) {
  Handle client = Connect();
  ASSERT_TRUE(client);
  auto full = NewCommand(kCommandResume);
  std::memset(full->reserved, 0xAB, sizeof(full->reserved));
  std::memset(full->driveImage, 0xCD, sizeof(full->driveImage));
  std::memset(full->registryText, 0xEF, sizeof(full->registryText));
  Exchange first = Send(client.Get(), *full);
  ASSERT_TRUE(first.ok);
  ASSERT_EQ(first.reply.size(), sizeof(CommandMessage));
  EXPECT_EQ(first.reply[offsetof(CommandMessage, reserved)], 0xAB);  // carried back unchanged

  // Only the head of the next request is sent; it declares the full length.
  constexpr DWORD kHead = 64;
  Exchange second = SendDeclared(client.Get(), kCommandResume, 0, kCommandMaxLength, kHead);
  ASSERT_TRUE(second.ok);
  ASSERT_EQ(second.reply.size(), kCommandMaxLength);
  std::size_t nonZero = 0;
  for (std::size_t i = kHead; i < second.reply.size(); ++i) nonZero += second.reply[i] != 0;
  EXPECT_EQ(nonZero, 0u);
}

TEST_F(PipeServerTest, FifteenInstancesOnlyAndTheSixteenthClientWaitsForALeaver) {
  std::vector<Handle> clients;
  for (int i = 0; i < kPipeInstanceCount; ++i) {
    clients.push_back(Connect());
    ASSERT_TRUE(clients.back());
    ASSERT_TRUE(Send(clients.back().Get(), *NewCommand(kCommandResume)).ok);
  }
  HANDLE extra =
      CreateFileW(kPipeName, GENERIC_READ | GENERIC_WRITE, 0, nullptr, OPEN_EXISTING, 0, nullptr);
  EXPECT_EQ(extra, INVALID_HANDLE_VALUE);
  EXPECT_EQ(GetLastError(), static_cast<DWORD>(ERROR_PIPE_BUSY));
  if (extra != INVALID_HANDLE_VALUE) CloseHandle(extra);
  // No room for someone else's instance either, which would receive the
  // service's clients.
  HANDLE rogue = CreateNamedPipeW(kPipeName, PIPE_ACCESS_DUPLEX,
                                  PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_WAIT,
                                  kPipeInstanceCount, 4096, 4096, 0, nullptr);
  EXPECT_EQ(rogue, INVALID_HANDLE_VALUE);
  if (rogue != INVALID_HANDLE_VALUE) CloseHandle(rogue);

  clients[7].Reset();
  Handle late(OpenCommandPipe(skytest::kGuardMs));
  ASSERT_TRUE(late) << GetLastError();
  EXPECT_EQ(Send(late.Get(), *NewCommand(kCommandSetStatus, 16)).Result(), 1u);
  for (std::size_t i = 0; i < clients.size(); ++i) {
    if (i == 7) continue;
    EXPECT_TRUE(Send(clients[i].Get(), *NewCommand(kCommandResume)).ok) << i;
  }
}

TEST_F(PipeServerTest, ClientThatLeavesBeforeItsReplyDisturbsNoOtherInstance) {
  Handle stays = Connect();
  ASSERT_TRUE(stays);
  for (int round = 0; round < 3; ++round) {
    Handle leaves = Connect();
    ASSERT_TRUE(leaves);
    auto request = NewCommand(kCommandSetStatus, 1234);
    DWORD written = 0;
    ASSERT_TRUE(WriteFile(leaves.Get(), request.get(), sizeof(CommandMessage), &written, nullptr));
    leaves.Reset();
    EXPECT_EQ(Send(stays.Get(), *NewCommand(kCommandSetStatus, 77)).Result(), 1u);
  }
  // Every instance, the abandoned ones included, serves a client again.
  std::vector<Handle> clients;
  for (int i = 1; i < kPipeInstanceCount; ++i) {
    clients.push_back(Connect());
    ASSERT_TRUE(clients.back());
    EXPECT_EQ(Send(clients.back().Get(), *NewCommand(kCommandSetStatus, 100u + DWORD(i))).Result(),
              1u);
  }
  EXPECT_EQ(Send(stays.Get(), *NewCommand(kCommandSetStatus, 5)).Result(), 1u);
  EXPECT_EQ(PublishedStatus(), 5u);
}

TEST_F(PipeServerTest, StopEventEndsTheThreadWithClientsConnected) {
  Handle idle = Connect();
  Handle served = Connect();
  Handle waiting = Connect();
  ASSERT_TRUE(idle && served && waiting);
  ASSERT_TRUE(Send(served.Get(), *NewCommand(kCommandResume)).ok);
  auto request = NewCommand(kCommandResume);
  DWORD written = 0;
  ASSERT_TRUE(WriteFile(waiting.Get(), request.get(), sizeof(CommandMessage), &written, nullptr));

  EXPECT_TRUE(StopServer());
  // The instances are gone: the connected client's read fails, and the name
  // no longer exists.
  std::vector<BYTE> buffer(kCommandMaxLength);
  DWORD read = 0;
  EXPECT_FALSE(ReadFile(idle.Get(), buffer.data(), kCommandMaxLength, &read, nullptr));
  HANDLE after =
      CreateFileW(kPipeName, GENERIC_READ | GENERIC_WRITE, 0, nullptr, OPEN_EXISTING, 0, nullptr);
  EXPECT_EQ(after, INVALID_HANDLE_VALUE);
  if (after != INVALID_HANDLE_VALUE) CloseHandle(after);
}

TEST_F(PipeServerTest, StopEndsTheThreadWhileSomeoneElseHoldsTheMutex) {
  // Any account may open the mutex and keep it; a request then waits for it.
  Handle client = Connect();
  ASSERT_TRUE(client);
  ASSERT_EQ(WaitForSingleObject(monitorState.stateMutex, skytest::kGuardMs), WAIT_OBJECT_0);
  auto request = NewCommand(kCommandSetStatus, 9);
  DWORD written = 0;
  ASSERT_TRUE(WriteFile(client.Get(), request.get(), sizeof(CommandMessage), &written, nullptr));
  // Lets the server reach its wait for the mutex; the outcome does not depend
  // on it, only whether the case meets that wait.
  Sleep(50);
  EXPECT_TRUE(StopServer());
  ReleaseMutex(monitorState.stateMutex);
  EXPECT_NE(Published()->statusWord, 9u) << "the request ran after the stop";
}

class PipeNameTakenTest : public pipetest::MonitorFixture {};

TEST_F(PipeNameTakenTest, ServerLogsAHeldNameAndServesOnceItIsFree) {
  SKIP_ON_WINE("Wine 8 ignores FILE_FLAG_FIRST_PIPE_INSTANCE and creates the second instance");
  // Someone else created the pipe first (spare instances allowed, so only the
  // first-instance flag can keep the service from joining it).
  Handle squatter(CreateNamedPipeW(kPipeName, PIPE_ACCESS_DUPLEX,
                                   PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_WAIT,
                                   PIPE_UNLIMITED_INSTANCES, 4096, 4096, 0, nullptr));
  ASSERT_TRUE(squatter) << GetLastError();
#ifndef _WIN32
  emu::ClearEventLog();
#endif
  Handle thread(CreateThread(nullptr, 0, PipeServerThread, nullptr, 0, nullptr));
  ASSERT_TRUE(thread);
  // The server neither joins the other pipe nor gives up: once the name is
  // free it creates its instances and serves.
  EXPECT_EQ(WaitForSingleObject(thread.Get(), 100), static_cast<DWORD>(WAIT_TIMEOUT));
  squatter.Reset();
  Handle client;
  for (int attempt = 0; attempt < 100 && !client; ++attempt) {
    client.Reset(OpenCommandPipe(skytest::kGuardMs));
    if (!client) Sleep(100);
  }
  ASSERT_TRUE(client);
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
  SetEvent(monitorState.pipeStopEvent);
  ASSERT_EQ(WaitForSingleObject(thread.Get(), skytest::kGuardMs), WAIT_OBJECT_0);
  DWORD code = 1;
  EXPECT_TRUE(GetExitCodeThread(thread.Get(), &code));
  EXPECT_EQ(code, 0u);
}

TEST_F(PipeServerTest, PauseSetsTheFlagsAndRefusesSafeRemovalUntilResumed) {
  Handle client = Connect();
  ASSERT_TRUE(client);
  SetPauseTicks(17);
  Exchange pause = Send(client.Get(), *NewCommand(kCommandPause));
  EXPECT_EQ(pause.Result(), 0u);
  EXPECT_EQ(pause.Detail(), 0u);
  EXPECT_EQ(Paused(), 1u);
  EXPECT_EQ(PauseTicks(), 0u);
  Exchange refused = Send(client.Get(), *NewCommand(kCommandSafeRemove, 0));
  EXPECT_EQ(refused.Result(), 0u);
  EXPECT_EQ(refused.Detail(), 1u);
  EXPECT_EQ(PublishedStatus(), 0u);  // nothing was attempted

  SetPauseTicks(9);
  EXPECT_EQ(Send(client.Get(), *NewCommand(kCommandResume)).Result(), 0u);
  EXPECT_EQ(Paused(), 0u);
  EXPECT_EQ(PauseTicks(), 9u);  // resume clears only the pause
  // No linked channel: the removal fails, and the status word names index 3.
  Exchange failed = Send(client.Get(), *NewCommand(kCommandSafeRemove, 3));
  EXPECT_EQ(failed.Result(), 0u);
  EXPECT_EQ(PublishedStatus(), 603u);
}

TEST_F(PipeServerTest, CodesOutsideTheTableAnswerMinus777AndStillPublish) {
  Handle client = Connect();
  ASSERT_TRUE(client);
  for (DWORD code : {0u, 4u, 5u, 14u, 0xFFFFFFFFu}) {
    const DWORD before = PublishedSequence();
    Exchange reply = Send(client.Get(), *NewCommand(code, 1, 2, 3));
    ASSERT_EQ(reply.reply.size(), sizeof(CommandMessage));
    EXPECT_EQ(reply.Result(), kCommandUnknownResult) << code;
    EXPECT_EQ(reply.Detail(), kCommandUnknownResult) << code;
    EXPECT_EQ(PublishedSequence(), before + 1) << code;
  }
}

TEST_F(PipeServerTest, DriveCommandsWithoutDrivesAnswerAsNoDrive) {
  Handle client = Connect();
  ASSERT_TRUE(client);
  // Release drive: no linked channel, result 0; status word 102 in any case.
  Exchange release = Send(client.Get(), *NewCommand(kCommandReleaseDrive, 0));
  EXPECT_EQ(release.Result(), 0u);
  EXPECT_EQ(PublishedStatus(), 102u);
  // Status and control blocks name a drive that is not in the block; the one
  // drive there has a key that is only a prefix of the one named.
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
  // Gauge refresh with no channel: result 1.
  EXPECT_EQ(Send(client.Get(), *NewCommand(kCommandRefreshGauges, 'E', 1)).Result(), 1u);
}

TEST_F(PipeServerTest, RegistryThroughThePipeReportsNeededSize) {
  const pipetest::TestKey testKey;
  const WideString& path = testKey.path;
  Handle client = Connect();
  ASSERT_TRUE(client);

  std::vector<BYTE> data(120);
  for (std::size_t i = 0; i < data.size(); ++i) data[i] = static_cast<BYTE>(i);
  auto set = NewCommand(kCommandRegistry);
  ASSERT_TRUE(LayOutRegistryRequest(set.get(), RootKeyValue(HKEY_CURRENT_USER), path.c_str(),
                                    WSTR("Value"), kRegistrySet, REG_BINARY, data.data(),
                                    static_cast<DWORD>(data.size())));
  Exchange stored = Send(client.Get(), *set);
  EXPECT_EQ(stored.Result(), ERROR_SUCCESS);
  EXPECT_EQ(stored.Detail(), 120u);

  auto query = NewCommand(kCommandRegistry);
  ASSERT_TRUE(LayOutRegistryRequest(query.get(), RootKeyValue(HKEY_CURRENT_USER), path.c_str(),
                                    WSTR("Value"), kRegistryQuery, REG_NONE, nullptr, 16));
  Exchange small = Send(client.Get(), *query);
  EXPECT_EQ(small.Result(), static_cast<DWORD>(ERROR_MORE_DATA));
  EXPECT_EQ(small.Detail(), 120u);

  query->registry.dataLength = 200;
  Exchange whole = Send(client.Get(), *query);
  ASSERT_EQ(whole.Result(), ERROR_SUCCESS);
  EXPECT_EQ(whole.Detail(), 120u);
  ASSERT_EQ(whole.reply.size(), sizeof(CommandMessage));
  CommandMessage answer;
  std::memcpy(&answer, whole.reply.data(), sizeof(answer));
  EXPECT_EQ(answer.registry.valueType, static_cast<DWORD>(REG_BINARY));
  EXPECT_EQ(std::memcmp(RegistryData(&answer), data.data(), data.size()), 0);
}

// Before major version 6 the pipe's DACL denies the network logon SID, then
// allows everyone, in that order; from 6 on it is null and the mode refuses
// remote clients. Either way a pipe created with it serves a local client.
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
      // The ACL has room for exactly those two.
      LPVOID beyond = nullptr;
      EXPECT_FALSE(GetAce(dacl, 2, &beyond));
      EXPECT_FALSE(AddAccessAllowedAce(dacl, ACL_REVISION, GENERIC_READ, everyone));
      EXPECT_EQ(GetLastError(), static_cast<DWORD>(ERROR_ALLOTTED_SPACE_EXCEEDED));
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
