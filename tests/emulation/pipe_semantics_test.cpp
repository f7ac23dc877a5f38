// Quick checks of named-pipe details beyond the conformance suite: errors
// after the other end closed, byte-mode reads of message pipes, peeking,
// waits for an instance, and writes that wait for room in the pipe.
#include <gtest/gtest.h>

#include <cstring>
#include <vector>

#include "platform/diagnostics.h"
#include "platform/win32.h"

namespace {

constexpr const char16_t* kName = u"\\\\.\\pipe\\EmuSemantics";

HANDLE Server(DWORD flags = FILE_FLAG_OVERLAPPED, DWORD instances = 1) {
  return CreateNamedPipeW(kName, PIPE_ACCESS_DUPLEX | flags,
                          PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_WAIT, instances, 10920,
                          10920, 100, nullptr);
}

HANDLE Client(DWORD flags = 0) {
  return CreateFileW(kName, GENERIC_READ | GENERIC_WRITE, 0, nullptr, OPEN_EXISTING, flags,
                     nullptr);
}

TEST(PipeSemantics, ErrorsAfterTheOtherEndClosed) {
  HANDLE server = Server(0);
  HANDLE client = Client();
  DWORD bytes = 0;
  ASSERT_TRUE(WriteFile(server, "reply", 5, &bytes, nullptr));
  ASSERT_TRUE(WriteFile(server, "", 0, &bytes, nullptr));
  CloseHandle(server);
  // What was sent stays readable (byte read mode: an empty message is a
  // read of zero bytes), then the pipe is broken; writes find it closing.
  char buffer[16];
  DWORD total = 99;
  EXPECT_TRUE(PeekNamedPipe(client, nullptr, 0, nullptr, &total, nullptr));
  EXPECT_EQ(total, 5u);
  EXPECT_TRUE(ReadFile(client, buffer, sizeof(buffer), &bytes, nullptr));
  EXPECT_EQ(bytes, 5u);
  EXPECT_TRUE(ReadFile(client, buffer, sizeof(buffer), &bytes, nullptr));
  EXPECT_EQ(bytes, 0u);
  EXPECT_FALSE(ReadFile(client, buffer, sizeof(buffer), &bytes, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_BROKEN_PIPE);
  total = 99;
  EXPECT_FALSE(PeekNamedPipe(client, nullptr, 0, nullptr, &total, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_BROKEN_PIPE);
  EXPECT_EQ(total, 99u);
  EXPECT_FALSE(WriteFile(client, "x", 1, &bytes, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_NO_DATA);
  CloseHandle(client);

  // The same from the server's side, then disconnect and serve again.
  server = Server(0);
  client = Client();
  CloseHandle(client);
  EXPECT_FALSE(WriteFile(server, "x", 1, &bytes, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_NO_DATA);
  EXPECT_FALSE(ConnectNamedPipe(server, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_NO_DATA);
  EXPECT_TRUE(DisconnectNamedPipe(server));
  EXPECT_FALSE(DisconnectNamedPipe(server));
  EXPECT_EQ(GetLastError(), ERROR_PIPE_NOT_CONNECTED);
  // Not listening until ConnectNamedPipe: a client finds it busy.
  EXPECT_EQ(Client(), INVALID_HANDLE_VALUE);
  EXPECT_EQ(GetLastError(), ERROR_PIPE_BUSY);
  CloseHandle(server);
  EXPECT_EQ(Client(), INVALID_HANDLE_VALUE);
  EXPECT_EQ(GetLastError(), ERROR_FILE_NOT_FOUND);
  EXPECT_EQ(platform::LiveHandleCount(), 0);
}

TEST(PipeSemantics, ByteReadModeJoinsMessagesAndMessageModeKeepsThem) {
  HANDLE server = Server(0);
  HANDLE client = Client();
  DWORD bytes = 0;
  WriteFile(server, "abc", 3, &bytes, nullptr);
  WriteFile(server, "defg", 4, &bytes, nullptr);
  char buffer[16] = {};
  DWORD total = 0;
  DWORD left = 0;
  EXPECT_TRUE(PeekNamedPipe(client, buffer, 2, &bytes, &total, &left));
  EXPECT_EQ(bytes, 2u);
  EXPECT_EQ(total, 7u);
  EXPECT_EQ(left, 3u);
  EXPECT_TRUE(ReadFile(client, buffer, 5, &bytes, nullptr));  // byte mode
  EXPECT_EQ(bytes, 5u);
  EXPECT_EQ(std::memcmp(buffer, "abcde", 5), 0);
  DWORD mode = PIPE_READMODE_MESSAGE;
  EXPECT_TRUE(SetNamedPipeHandleState(client, &mode, nullptr, nullptr));
  EXPECT_FALSE(ReadFile(client, buffer, 1, &bytes, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_MORE_DATA);
  EXPECT_EQ(bytes, 1u);
  EXPECT_EQ(buffer[0], 'f');
  EXPECT_TRUE(ReadFile(client, buffer, 8, &bytes, nullptr));
  EXPECT_EQ(bytes, 1u);
  EXPECT_EQ(buffer[0], 'g');
  // Collection settings are for remote clients only.
  DWORD count = 1;
  EXPECT_FALSE(SetNamedPipeHandleState(client, &mode, &count, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_PARAMETER);
  CloseHandle(client);
  CloseHandle(server);
}

TEST(PipeSemantics, WaitNamedPipeTimesOutWhileEveryInstanceIsTaken) {
  SetLastError(0);
  EXPECT_FALSE(WaitNamedPipeW(kName, 10));
  EXPECT_EQ(GetLastError(), ERROR_FILE_NOT_FOUND);
  HANDLE server = Server();
  HANDLE client = Client();
  ASSERT_NE(client, INVALID_HANDLE_VALUE);
  EXPECT_FALSE(WaitNamedPipeW(kName, 20));
  EXPECT_EQ(GetLastError(), ERROR_SEM_TIMEOUT);
  EXPECT_FALSE(WaitNamedPipeW(kName, NMPWAIT_USE_DEFAULT_WAIT));
  EXPECT_EQ(GetLastError(), ERROR_SEM_TIMEOUT);
  CloseHandle(client);
  DisconnectNamedPipe(server);
  OVERLAPPED ov{};
  ov.hEvent = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  EXPECT_FALSE(ConnectNamedPipe(server, &ov));
  EXPECT_EQ(GetLastError(), ERROR_IO_PENDING);
  EXPECT_TRUE(WaitNamedPipeW(kName, NMPWAIT_WAIT_FOREVER));
  // Closing the server cancels its pending connect.
  CloseHandle(server);
  EXPECT_EQ(WaitForSingleObject(ov.hEvent, 10000), WAIT_OBJECT_0);
  EXPECT_EQ(ov.Internal, 0xC0000120u);  // STATUS_CANCELLED
  CloseHandle(ov.hEvent);
}

TEST(PipeSemantics, SynchronousConnectBlocksUntilAClientOpens) {
  HANDLE server = Server(0);
  HANDLE thread = CreateThread(
      nullptr, 0,
      [](LPVOID p) -> DWORD { return ConnectNamedPipe(static_cast<HANDLE>(p), nullptr) ? 0 : 1; },
      server, 0, nullptr);
  EXPECT_EQ(WaitForSingleObject(thread, 20), WAIT_TIMEOUT);
  HANDLE client = Client();
  ASSERT_NE(client, INVALID_HANDLE_VALUE);
  EXPECT_EQ(WaitForSingleObject(thread, 10000), WAIT_OBJECT_0);
  DWORD code = 9;
  GetExitCodeThread(thread, &code);
  EXPECT_EQ(code, 0u);
  for (HANDLE h : {thread, client, server}) CloseHandle(h);
}

TEST(PipeSemantics, WriteWaitsForRoomAndOversizedMessagesAreRefused) {
  HANDLE server = Server();
  HANDLE client = Client(FILE_FLAG_OVERLAPPED);
  std::vector<char> big(30000, 'b');
  DWORD bytes = 0;
  OVERLAPPED ov{};
  ov.hEvent = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  // Two fit in the pipe; the third waits until the server reads one.
  EXPECT_TRUE(WriteFile(client, big.data(), 30000, &bytes, &ov));
  EXPECT_TRUE(WriteFile(client, big.data(), 30000, &bytes, &ov));
  EXPECT_FALSE(WriteFile(client, big.data(), 30000, &bytes, &ov));
  ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
  EXPECT_FALSE(GetOverlappedResult(client, &ov, &bytes, FALSE));
  EXPECT_EQ(GetLastError(), ERROR_IO_INCOMPLETE);
  std::vector<char> in(40000);
  OVERLAPPED rov{};
  rov.hEvent = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  EXPECT_TRUE(ReadFile(server, in.data(), 40000, &bytes, &rov));
  EXPECT_EQ(bytes, 30000u);
  EXPECT_TRUE(GetOverlappedResult(client, &ov, &bytes, TRUE));
  EXPECT_EQ(bytes, 30000u);
  // A message larger than the whole pipe buffer cannot be sent here.
  std::vector<char> huge(70000, 'h');
  EXPECT_FALSE(WriteFile(client, huge.data(), 70000, &bytes, &ov));
  EXPECT_EQ(GetLastError(), ERROR_NOT_ENOUGH_QUOTA);
  for (HANDLE h : {client, server, ov.hEvent, rov.hEvent}) CloseHandle(h);
}

// The request keeps its event object alive after the caller closed the
// handle; finishing it then drops the last reference inside the emulation.
TEST(PipeSemantics, EventClosedWhileAReadPends) {
  HANDLE server = Server();
  HANDLE client = Client();
  OVERLAPPED ov{};
  ov.hEvent = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  char buffer[8];
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
