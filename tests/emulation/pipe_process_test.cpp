// Named pipes between processes (this program started again) and pipe
// lifetimes.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstring>
#include <string>

#include "platform/posix/kernel.h"
#include "platform/win32.h"
#include "support/child_process.h"
#include "support/test_support.h"

namespace {

using skytest::RunAsChild;

constexpr const char16_t* kPipe = u"\\\\.\\pipe\\EmuCrossProcessPipe";

HANDLE CreateServer() {
  return CreateNamedPipeW(kPipe, PIPE_ACCESS_DUPLEX | FILE_FLAG_OVERLAPPED,
                          PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_WAIT, 4, 10920, 10920,
                          5000, nullptr);
}

HANDLE OpenClient() {
  return CreateFileW(kPipe, GENERIC_READ | GENERIC_WRITE, 0, nullptr, OPEN_EXISTING, 0, nullptr);
}

// Waits for the overlapped request on `ov` to finish; its result and count.
bool Finish(HANDLE server, OVERLAPPED* ov, BOOL started, DWORD* bytes) {
  if (!started && GetLastError() != ERROR_IO_PENDING) return false;
  if (WaitForSingleObject(ov->hEvent, 10000) != WAIT_OBJECT_0) return false;
  return GetOverlappedResult(server, ov, bytes, FALSE) != FALSE;
}

// The instance connects a new client and carries one request and reply.
void ServeOneExchange(HANDLE server, OVERLAPPED* ov) {
  DWORD bytes = 0;
  BOOL connected = ConnectNamedPipe(server, ov);
  ASSERT_FALSE(connected);
  ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
  skytest::Handle client(OpenClient());
  ASSERT_TRUE(client);
  ASSERT_TRUE(Finish(server, ov, TRUE, &bytes));  // the connect, pending above
  char buffer[16] = {};
  ASSERT_TRUE(WriteFile(client.Get(), "ping", 4, &bytes, nullptr));
  ASSERT_TRUE(Finish(server, ov, ReadFile(server, buffer, sizeof(buffer), &bytes, ov), &bytes));
  EXPECT_EQ(std::string(buffer, bytes), "ping");
  ASSERT_TRUE(Finish(server, ov, WriteFile(server, "pong!", 5, &bytes, ov), &bytes));
  ASSERT_TRUE(ReadFile(client.Get(), buffer, sizeof(buffer), &bytes, nullptr));
  EXPECT_EQ(std::string(buffer, bytes), "pong!");
  client.Reset();
  EXPECT_TRUE(DisconnectNamedPipe(server));
}

// A client killed at any moment (even inside the kernel lock): its pipe end
// closes, its mutex is abandoned, and the instance serves the next client.
enum class KillPoint { kInWrite, kInRead, kInWait, kOwningMutex, kInsideKernelLock };

class KilledClient : public ::testing::TestWithParam<KillPoint> {};

int ClientUntilKilled(KillPoint point) {
  HANDLE pipe = OpenClient();
  HANDLE up = OpenEventW(EVENT_MODIFY_STATE, FALSE, u"Global\\EmuKillUp");
  HANDLE idle = OpenEventW(SYNCHRONIZE | EVENT_MODIFY_STATE, FALSE, u"Global\\EmuKillIdle");
  HANDLE mutex = OpenMutexW(SYNCHRONIZE | MUTEX_MODIFY_STATE, FALSE, u"Global\\EmuKillMutex");
  if (pipe == INVALID_HANDLE_VALUE || up == nullptr || idle == nullptr || mutex == nullptr) {
    return 10;
  }
  if (point == KillPoint::kOwningMutex && WaitForSingleObject(mutex, 0) != WAIT_OBJECT_0) return 11;
  SetEvent(up);
  char buffer[16];
  DWORD bytes = 0;
  switch (point) {
    case KillPoint::kInWrite:
      emu::kernel::SetCrashPoint("pipe-push");
      WriteFile(pipe, "doomed", 6, &bytes, nullptr);
      break;
    case KillPoint::kInRead:
      ReadFile(pipe, buffer, sizeof(buffer), &bytes, nullptr);
      break;
    case KillPoint::kInWait:
      WaitForSingleObject(idle, INFINITE);
      break;
    case KillPoint::kOwningMutex:
      break;
    case KillPoint::kInsideKernelLock:
      emu::kernel::SetCrashPoint("set-event");
      SetEvent(idle);
      break;
  }
  for (;;) pause();
}

TEST_P(KilledClient, ServerProcessGoesOn) {
  const KillPoint point = GetParam();
  RunAsChild("doomed", [point] { return ClientUntilKilled(point); });
  HANDLE server = CreateServer();
  HANDLE up = CreateEventW(nullptr, TRUE, FALSE, u"Global\\EmuKillUp");
  HANDLE idle = CreateEventW(nullptr, TRUE, FALSE, u"Global\\EmuKillIdle");
  HANDLE mutex = CreateMutexW(nullptr, FALSE, u"Global\\EmuKillMutex");
  HANDLE event = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  ASSERT_TRUE(server != INVALID_HANDLE_VALUE && up && idle && mutex && event);
  OVERLAPPED ov{};
  ov.hEvent = event;
  DWORD bytes = 0;
  BOOL connected = ConnectNamedPipe(server, &ov);
  skytest::ChildProcess child;
  ASSERT_TRUE(child.Start("doomed"));
  ASSERT_EQ(WaitForSingleObject(up, 10000), WAIT_OBJECT_0);
  if (!connected && GetLastError() != ERROR_PIPE_CONNECTED) {
    ASSERT_TRUE(Finish(server, &ov, connected, &bytes));
  }
  char buffer[16];
  BOOL read = ReadFile(server, buffer, sizeof(buffer), &bytes, &ov);
  DWORD readError = GetLastError();
  if (point != KillPoint::kInWrite && point != KillPoint::kInsideKernelLock) {
    EXPECT_FALSE(read);
    EXPECT_EQ(readError, ERROR_IO_PENDING);  // the client is alive: nothing to read yet
    child.Kill();
  }
  EXPECT_EQ(child.Wait(skytest::kProcessGuardMs), 128 + 9);
  SetLastError(readError);
  EXPECT_FALSE(Finish(server, &ov, read, &bytes));
  EXPECT_EQ(GetLastError(), ERROR_BROKEN_PIPE);

  EXPECT_EQ(WaitForSingleObject(mutex, 10000),
            point == KillPoint::kOwningMutex ? WAIT_ABANDONED : WAIT_OBJECT_0);
  EXPECT_TRUE(ReleaseMutex(mutex));
  EXPECT_EQ(WaitForSingleObject(idle, 0), WAIT_TIMEOUT);
  EXPECT_TRUE(DisconnectNamedPipe(server));
  ServeOneExchange(server, &ov);
  for (HANDLE h : {event, mutex, idle, up, server}) CloseHandle(h);
}

INSTANTIATE_TEST_SUITE_P(AtEveryMoment, KilledClient,
                         ::testing::Values(KillPoint::kInWrite, KillPoint::kInRead,
                                           KillPoint::kInWait, KillPoint::kOwningMutex,
                                           KillPoint::kInsideKernelLock));

TEST(PipeProcesses, KilledServerBreaksTheClientAndRemovesThePipe) {
  RunAsChild("server", [] {
    HANDLE server = CreateServer();
    HANDLE ready = OpenEventW(EVENT_MODIFY_STATE, FALSE, WSTR("Global\\EmuPipeServerUp"));
    if (server == INVALID_HANDLE_VALUE || ready == nullptr) return 10;
    SetEvent(ready);
    for (;;) pause();
  });
  skytest::Handle up(CreateEventW(nullptr, TRUE, FALSE, WSTR("Global\\EmuPipeServerUp")));
  skytest::ChildProcess child;
  ASSERT_TRUE(child.Start("server"));
  ASSERT_EQ(WaitForSingleObject(up.Get(), 10000), WAIT_OBJECT_0);
  skytest::Handle client(OpenClient());
  ASSERT_TRUE(client);
  child.Kill();
  EXPECT_EQ(child.Wait(skytest::kProcessGuardMs), 128 + 9);
  char buffer[8];
  DWORD bytes = 0;
  EXPECT_FALSE(ReadFile(client.Get(), buffer, sizeof(buffer), &bytes, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_BROKEN_PIPE);
  client.Reset();
  EXPECT_EQ(OpenClient(), INVALID_HANDLE_VALUE);
  EXPECT_EQ(GetLastError(), ERROR_FILE_NOT_FOUND);
}

// Closing a server instance ends its pending connect; a request keeps its
// event alive after the caller closed the handle.
TEST(PipeLifetime, ClosingEndsAPendingConnectAndAPendingReadOutlivesItsEvent) {
  HANDLE server = CreateServer();
  OVERLAPPED ov{};
  ov.hEvent = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  EXPECT_FALSE(ConnectNamedPipe(server, &ov));
  EXPECT_EQ(GetLastError(), ERROR_IO_PENDING);
  CloseHandle(server);
  EXPECT_EQ(WaitForSingleObject(ov.hEvent, 10000), WAIT_OBJECT_0);
  EXPECT_EQ(ov.Internal, 0xC0000120u);  // STATUS_CANCELLED

  server = CreateServer();
  HANDLE client = OpenClient();
  char buffer[8];
  ResetEvent(ov.hEvent);
  EXPECT_FALSE(ReadFile(server, buffer, sizeof(buffer), nullptr, &ov));
  ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
  CloseHandle(ov.hEvent);
  DWORD bytes = 0;
  EXPECT_TRUE(WriteFile(client, "late", 4, &bytes, nullptr));
  ov.hEvent = nullptr;  // wait on the file instead
  EXPECT_TRUE(GetOverlappedResult(server, &ov, &bytes, TRUE));
  EXPECT_EQ(bytes, 4u);
  CloseHandle(client);
  CloseHandle(server);
}

}  // namespace
