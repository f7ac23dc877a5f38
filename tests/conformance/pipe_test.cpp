// Message-mode named pipes and overlapped I/O on them, as the service's pipe
// server uses them (its own tests cover instance limits and disconnection).
#include <gtest/gtest.h>

#include <string>
#include <string_view>
#include <vector>

#include "support/test_support.h"

namespace {

using skytest::Handle;
using skytest::kGuardMs;
using skytest::NewEvent;
using skytest::Overlapped;
using skytest::Thread;

constexpr DWORD kPipeBufferBytes = 10920;

WideString PipeName() {
  return skytest::UniqueName("\\\\.\\pipe\\", "pipe");
}

// One server instance as the service creates it.
Handle CreateServer(const WideString& name, SECURITY_ATTRIBUTES* attributes = nullptr) {
  return Handle(CreateNamedPipeW(name.c_str(), PIPE_ACCESS_DUPLEX | FILE_FLAG_OVERLAPPED,
                                 PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_WAIT, 16,
                                 kPipeBufferBytes, kPipeBufferBytes, 5000, attributes));
}

Handle OpenClient(const WideString& name) {
  return Handle(CreateFileW(name.c_str(), GENERIC_READ | GENERIC_WRITE, 0, nullptr, OPEN_EXISTING,
                            0, nullptr));
}

bool WriteMessage(HANDLE pipe, std::string_view text) {
  DWORD written = 0;
  return WriteFile(pipe, text.data(), static_cast<DWORD>(text.size()), &written, nullptr) &&
         written == text.size();
}

// The error an overlapped connect left (0 on success).
DWORD ConnectOverlapped(HANDLE server, Overlapped& overlapped) {
  SetLastError(0);
  return ConnectNamedPipe(server, overlapped.Get()) ? 0 : GetLastError();
}

// Starts an overlapped read of `buffer`; the error it left (0 when done).
DWORD StartRead(HANDLE pipe, Overlapped& read, char* buffer, DWORD capacity) {
  DWORD bytes = 0;
  SetLastError(0);
  return ReadFile(pipe, buffer, capacity, &bytes, read.Get()) ? 0 : GetLastError();
}

// Reads one message (or what fits) from the server end: the read's error.
DWORD ReadServer(HANDLE server, std::string& text, DWORD capacity = 256) {
  Overlapped read;
  std::vector<char> buffer(capacity);
  DWORD bytes = 0;
  DWORD error = StartRead(server, read, buffer.data(), capacity);
  // A read that ended with ERROR_MORE_DATA reports its count here too.
  if (error == ERROR_IO_PENDING || error == ERROR_MORE_DATA || error == 0) {
    error = GetOverlappedResult(server, read.Get(), &bytes, TRUE) ? 0 : GetLastError();
  }
  text.assign(buffer.data(), bytes);
  return error;
}

// A server instance whose synchronous client came first (ERROR_PIPE_CONNECTED).
struct Connection {
  Handle server;
  Handle client;
  explicit Connection(const WideString& name = PipeName())
      : server(CreateServer(name)), client(OpenClient(name)) {
    Overlapped connect;
    EXPECT_TRUE(server && client);
    EXPECT_EQ(ConnectOverlapped(server.Get(), connect), ERROR_PIPE_CONNECTED);
  }
};

TEST(Pipe, ConnectPendsUntilAClientOpensAndAnEarlierClientIsAlreadyConnected) {
  WideString name = PipeName();
  SetLastError(0);
  EXPECT_FALSE(WaitNamedPipeW(name.c_str(), 1));
  EXPECT_EQ(GetLastError(), ERROR_FILE_NOT_FOUND);
  SetLastError(0);
  EXPECT_FALSE(OpenClient(name));
  EXPECT_EQ(GetLastError(), ERROR_FILE_NOT_FOUND);

  // The service creates its instances with a null DACL so any account may open them.
  SECURITY_DESCRIPTOR descriptor{};
  ASSERT_TRUE(InitializeSecurityDescriptor(&descriptor, SECURITY_DESCRIPTOR_REVISION));
  ASSERT_TRUE(SetSecurityDescriptorDacl(&descriptor, TRUE, nullptr, FALSE));
  SECURITY_ATTRIBUTES attributes{sizeof(attributes), &descriptor, FALSE};
  Handle server = CreateServer(name, &attributes);
  ASSERT_TRUE(server);
  Overlapped connect;
  ASSERT_EQ(ConnectOverlapped(server.Get(), connect), ERROR_IO_PENDING);
  EXPECT_FALSE(connect.Signalled());
  DWORD bytes = 0;
  EXPECT_FALSE(GetOverlappedResult(server.Get(), connect.Get(), &bytes, FALSE));
  EXPECT_EQ(GetLastError(), ERROR_IO_INCOMPLETE);
  EXPECT_TRUE(WaitNamedPipeW(name.c_str(), kGuardMs));
  Handle client = OpenClient(name);
  ASSERT_TRUE(client);
  ASSERT_EQ(WaitForSingleObject(connect.event.Get(), kGuardMs), WAIT_OBJECT_0);
  EXPECT_TRUE(GetOverlappedResult(server.Get(), connect.Get(), &bytes, FALSE));
  ASSERT_TRUE(WriteMessage(client.Get(), "ping"));
  std::string text;
  ASSERT_EQ(ReadServer(server.Get(), text), 0u);
  EXPECT_EQ(text, "ping");
}

TEST(Overlapped, ReadPendsUntilDataAndDataWaitingCompletesAtOnce) {
  Connection pipe;
  Overlapped read;
  char buffer[64] = {};
  DWORD bytes = 12345;
  ASSERT_EQ(StartRead(pipe.server.Get(), read, buffer, sizeof(buffer)), ERROR_IO_PENDING);
  EXPECT_EQ(read.record.Internal, STATUS_PENDING);
  EXPECT_FALSE(read.Signalled());
  SetLastError(0);
  EXPECT_FALSE(GetOverlappedResult(pipe.server.Get(), read.Get(), &bytes, FALSE));
  EXPECT_EQ(GetLastError(), ERROR_IO_INCOMPLETE);
  ASSERT_TRUE(WriteMessage(pipe.client.Get(), "hello"));
  ASSERT_EQ(WaitForSingleObject(read.event.Get(), kGuardMs), WAIT_OBJECT_0);
  bytes = 0;
  ASSERT_TRUE(GetOverlappedResult(pipe.server.Get(), read.Get(), &bytes, FALSE));
  EXPECT_EQ(bytes, 5u);
  EXPECT_EQ(read.record.InternalHigh, 5u);
  EXPECT_EQ(std::string(buffer, bytes), "hello");

  // Data already waiting: done at once, and the event is signalled as well.
  ASSERT_TRUE(WriteMessage(pipe.client.Get(), "ready"));
  Overlapped ready;
  ASSERT_EQ(StartRead(pipe.server.Get(), ready, buffer, sizeof(buffer)), 0u);
  EXPECT_TRUE(ready.Signalled());
  ASSERT_TRUE(GetOverlappedResult(pipe.server.Get(), ready.Get(), &bytes, FALSE));
  EXPECT_EQ(std::string(buffer, bytes), "ready");

  // Asked to wait, GetOverlappedResult returns only with the completion.
  Handle go = NewEvent(true, false);
  Thread writer([&]() -> DWORD {
    if (WaitForSingleObject(go.Get(), kGuardMs) != WAIT_OBJECT_0) return 1;
    return WriteMessage(pipe.client.Get(), "late data") ? 0 : 2;
  });
  Overlapped late;
  ASSERT_EQ(StartRead(pipe.server.Get(), late, buffer, sizeof(buffer)), ERROR_IO_PENDING);
  ASSERT_TRUE(SetEvent(go.Get()));
  ASSERT_TRUE(GetOverlappedResult(pipe.server.Get(), late.Get(), &bytes, TRUE));
  EXPECT_EQ(std::string(buffer, bytes), "late data");
  EXPECT_EQ(writer.Join(), 0u);
}

TEST(Overlapped, CancelIoAbortsOnlyTheCallingThreadsRequests) {
  Connection pipe;
  EXPECT_TRUE(CancelIo(pipe.server.Get()));  // nothing pending: still success
  Handle issued = NewEvent(true, false);
  Overlapped other;
  char otherBuffer[64] = {};
  // The thread stays alive until its request is done.
  Thread thread([&]() -> DWORD {
    DWORD error = StartRead(pipe.server.Get(), other, otherBuffer, sizeof(otherBuffer));
    if (error != ERROR_IO_PENDING) return 0xF000 + error;
    SetEvent(issued.Get());
    DWORD bytes = 0;
    return GetOverlappedResult(pipe.server.Get(), other.Get(), &bytes, TRUE)
               ? bytes
               : 0xE000 + GetLastError();
  });
  ASSERT_EQ(WaitForSingleObject(issued.Get(), kGuardMs), WAIT_OBJECT_0);

  Overlapped mine;
  char buffer[64] = {};
  DWORD bytes = 77;
  ASSERT_EQ(StartRead(pipe.server.Get(), mine, buffer, sizeof(buffer)), ERROR_IO_PENDING);
  ASSERT_TRUE(CancelIo(pipe.server.Get()));
  ASSERT_EQ(WaitForSingleObject(mine.event.Get(), kGuardMs), WAIT_OBJECT_0);
  SetLastError(0);
  EXPECT_FALSE(GetOverlappedResult(pipe.server.Get(), mine.Get(), &bytes, TRUE));
  EXPECT_EQ(GetLastError(), ERROR_OPERATION_ABORTED);
  EXPECT_EQ(bytes, 0u);
  EXPECT_NE(mine.record.Internal, STATUS_PENDING);

  EXPECT_FALSE(other.Signalled());
  EXPECT_EQ(other.record.Internal, STATUS_PENDING);
  ASSERT_TRUE(WriteMessage(pipe.client.Get(), "for the other"));
  EXPECT_EQ(thread.Join(), 13u);
  EXPECT_EQ(std::string(otherBuffer, 13), "for the other");

  ASSERT_TRUE(WriteMessage(pipe.client.Get(), "after"));
  std::string text;
  ASSERT_EQ(ReadServer(pipe.server.Get(), text), 0u);
  EXPECT_EQ(text, "after");
}

TEST(Pipe, MessageLongerThanTheReadGivesMoreDataThenTheRest) {
  Connection pipe;
  std::string message(100, 'x');
  for (size_t i = 0; i < message.size(); ++i) message[i] = static_cast<char>('a' + i % 26);
  // Data already waiting: the read returns at once with ERROR_MORE_DATA.
  ASSERT_TRUE(WriteMessage(pipe.client.Get(), message));
  std::string part;
  EXPECT_EQ(ReadServer(pipe.server.Get(), part, 40), ERROR_MORE_DATA);
  EXPECT_EQ(part, message.substr(0, 40));
  EXPECT_EQ(ReadServer(pipe.server.Get(), part, 256), 0u);  // the rest of the same message
  EXPECT_EQ(part, message.substr(40));

  // Read pending first: its completion reports ERROR_MORE_DATA the same way.
  Overlapped read;
  char buffer[40] = {};
  DWORD bytes = 0;
  ASSERT_EQ(StartRead(pipe.server.Get(), read, buffer, sizeof(buffer)), ERROR_IO_PENDING);
  ASSERT_TRUE(WriteMessage(pipe.client.Get(), message));
  ASSERT_EQ(WaitForSingleObject(read.event.Get(), kGuardMs), WAIT_OBJECT_0);
  SetLastError(0);
  EXPECT_FALSE(GetOverlappedResult(pipe.server.Get(), read.Get(), &bytes, FALSE));
  EXPECT_EQ(GetLastError(), ERROR_MORE_DATA);
  EXPECT_EQ(bytes, 40u);
  EXPECT_EQ(std::string(buffer, 40), message.substr(0, 40));
  EXPECT_EQ(ReadServer(pipe.server.Get(), part, 256), 0u);
}

}  // namespace
