// Named pipes between processes: the server's overlapped requests finish
// when a client in another process acts (the I/O service thread of the
// server's process completes them), and an end whose process dies counts
// as closed.
#include <gtest/gtest.h>
#include <signal.h>

#include <cstring>

#include "fork_child.h"
#include "platform/win32.h"

namespace {

constexpr const char16_t* kPipe = u"\\\\.\\pipe\\EmuCrossProcessPipe";

HANDLE CreateServer() {
  return CreateNamedPipeW(kPipe, PIPE_ACCESS_DUPLEX | FILE_FLAG_OVERLAPPED,
                          PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_WAIT, 4, 10920, 10920,
                          5000, nullptr);
}

// Synchronous client: one request, one reply, then close.
int ClientExchange() {
  if (!WaitNamedPipeW(kPipe, NMPWAIT_WAIT_FOREVER)) return 20;
  HANDLE pipe =
      CreateFileW(kPipe, GENERIC_READ | GENERIC_WRITE, 0, nullptr, OPEN_EXISTING, 0, nullptr);
  if (pipe == INVALID_HANDLE_VALUE) return 21;
  DWORD mode = PIPE_READMODE_MESSAGE;
  if (!SetNamedPipeHandleState(pipe, &mode, nullptr, nullptr)) return 22;
  char reply[16] = {};
  DWORD bytes = 0;
  if (!TransactNamedPipe(pipe, const_cast<char*>("ping"), 4, reply, sizeof(reply), &bytes,
                         nullptr)) {
    return 23;
  }
  if (bytes != 5 || std::memcmp(reply, "pong!", 5) != 0) return 24;
  return CloseHandle(pipe) ? 0 : 25;
}

TEST(PipeProcesses, OverlappedServerIsCompletedByAClientProcess) {
  HANDLE server = CreateServer();
  ASSERT_NE(server, INVALID_HANDLE_VALUE);
  HANDLE event = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  OVERLAPPED ov{};
  ov.hEvent = event;
  EXPECT_FALSE(ConnectNamedPipe(server, &ov));
  ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);

  pid_t child = Fork(ClientExchange);
  ASSERT_EQ(WaitForSingleObject(event, 10000), WAIT_OBJECT_0);
  DWORD bytes = 0;
  EXPECT_TRUE(GetOverlappedResult(server, &ov, &bytes, FALSE));

  char request[16] = {};
  if (!ReadFile(server, request, sizeof(request), &bytes, &ov)) {
    ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
    ASSERT_EQ(WaitForSingleObject(event, 10000), WAIT_OBJECT_0);
    ASSERT_TRUE(GetOverlappedResult(server, &ov, &bytes, FALSE));
  }
  EXPECT_EQ(bytes, 4u);
  EXPECT_EQ(std::memcmp(request, "ping", 4), 0);
  if (!WriteFile(server, "pong!", 5, &bytes, &ov)) {
    ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
    ASSERT_TRUE(GetOverlappedResult(server, &ov, &bytes, TRUE));
  }
  EXPECT_EQ(bytes, 5u);
  EXPECT_EQ(ExitCodeOf(child), 0);
  // The client has gone: the next read ends with a broken pipe.
  EXPECT_FALSE(ReadFile(server, request, sizeof(request), &bytes, &ov));
  EXPECT_EQ(GetLastError(), ERROR_BROKEN_PIPE);
  EXPECT_TRUE(DisconnectNamedPipe(server));
  CloseHandle(event);
  CloseHandle(server);
}

TEST(PipeProcesses, KilledClientBreaksThePendingServerRead) {
  HANDLE server = CreateServer();
  ASSERT_NE(server, INVALID_HANDLE_VALUE);
  HANDLE connected = CreateEventW(nullptr, TRUE, FALSE, WSTR("Global\\EmuPipeClientUp"));
  pid_t child = Fork([] {
    HANDLE pipe =
        CreateFileW(kPipe, GENERIC_READ | GENERIC_WRITE, 0, nullptr, OPEN_EXISTING, 0, nullptr);
    HANDLE up = OpenEventW(EVENT_MODIFY_STATE, FALSE, WSTR("Global\\EmuPipeClientUp"));
    if (pipe == INVALID_HANDLE_VALUE || up == nullptr) return 10;
    SetEvent(up);
    for (;;) pause();
  });
  ASSERT_EQ(WaitForSingleObject(connected, 10000), WAIT_OBJECT_0);
  HANDLE event = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  OVERLAPPED ov{};
  ov.hEvent = event;
  EXPECT_FALSE(ConnectNamedPipe(server, &ov));
  EXPECT_EQ(GetLastError(), ERROR_PIPE_CONNECTED);
  char buffer[8];
  EXPECT_FALSE(ReadFile(server, buffer, sizeof(buffer), nullptr, &ov));
  ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
  kill(child, SIGKILL);
  EXPECT_EQ(ExitCodeOf(child), 128 + SIGKILL);
  ASSERT_EQ(WaitForSingleObject(event, 10000), WAIT_OBJECT_0);
  DWORD bytes = 0;
  EXPECT_FALSE(GetOverlappedResult(server, &ov, &bytes, FALSE));
  EXPECT_EQ(GetLastError(), ERROR_BROKEN_PIPE);
  // The instance can serve the next client after a disconnect.
  EXPECT_TRUE(DisconnectNamedPipe(server));
  EXPECT_FALSE(ConnectNamedPipe(server, &ov));
  EXPECT_EQ(GetLastError(), ERROR_IO_PENDING);
  HANDLE client =
      CreateFileW(kPipe, GENERIC_READ | GENERIC_WRITE, 0, nullptr, OPEN_EXISTING, 0, nullptr);
  EXPECT_NE(client, INVALID_HANDLE_VALUE);
  EXPECT_TRUE(GetOverlappedResult(server, &ov, &bytes, TRUE));
  for (HANDLE h : {client, event, connected, server}) CloseHandle(h);
}

TEST(PipeProcesses, KilledServerBreaksTheClientAndRemovesThePipe) {
  HANDLE up = CreateEventW(nullptr, TRUE, FALSE, WSTR("Global\\EmuPipeServerUp"));
  pid_t child = Fork([] {
    HANDLE server = CreateServer();
    HANDLE ready = OpenEventW(EVENT_MODIFY_STATE, FALSE, WSTR("Global\\EmuPipeServerUp"));
    if (server == INVALID_HANDLE_VALUE || ready == nullptr) return 10;
    SetEvent(ready);
    for (;;) pause();
  });
  ASSERT_EQ(WaitForSingleObject(up, 10000), WAIT_OBJECT_0);
  HANDLE client =
      CreateFileW(kPipe, GENERIC_READ | GENERIC_WRITE, 0, nullptr, OPEN_EXISTING, 0, nullptr);
  ASSERT_NE(client, INVALID_HANDLE_VALUE);
  kill(child, SIGKILL);
  EXPECT_EQ(ExitCodeOf(child), 128 + SIGKILL);
  char buffer[8];
  DWORD bytes = 0;
  EXPECT_FALSE(ReadFile(client, buffer, sizeof(buffer), &bytes, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_BROKEN_PIPE);
  CloseHandle(client);
  EXPECT_EQ(CreateFileW(kPipe, GENERIC_READ, 0, nullptr, OPEN_EXISTING, 0, nullptr),
            INVALID_HANDLE_VALUE);
  EXPECT_EQ(GetLastError(), ERROR_FILE_NOT_FOUND);
  CloseHandle(up);
}

}  // namespace
