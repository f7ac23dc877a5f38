// Overlapped I/O on a named pipe: a read that pends, its completion through
// the OVERLAPPED event, GetOverlappedResult with and without waiting, and
// CancelIo, which cancels only the calling thread's requests.
#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "pipe_helpers.h"

namespace {

using conformance::ConnectOverlapped;
using conformance::CreateServer;
using conformance::Handle;
using conformance::kGuardMs;
using conformance::OpenClient;
using conformance::Overlapped;
using conformance::PipeName;
using conformance::WriteMessage;

// A connected server instance (overlapped) and its synchronous client.
struct Connection {
  Handle server;
  Handle client;
};

void Connect(Connection& connection, const WideString& name) {
  connection.server = CreateServer(name);
  ASSERT_TRUE(connection.server);
  connection.client = OpenClient(name);
  ASSERT_TRUE(connection.client);
  Overlapped connect;
  ASSERT_EQ(ConnectOverlapped(connection.server.Get(), connect), ERROR_PIPE_CONNECTED);
}

TEST(Overlapped, PendingReadCompletesThroughItsEvent) {
  Connection pipe;
  ASSERT_NO_FATAL_FAILURE(Connect(pipe, PipeName()));
  Overlapped read;
  char buffer[64] = {};
  DWORD bytes = 12345;
  SetLastError(0);
  ASSERT_FALSE(ReadFile(pipe.server.Get(), buffer, sizeof(buffer), &bytes, read.Get()));
  ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
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
}

struct DelayedWrite {
  HANDLE go = nullptr;
  HANDLE client = nullptr;
};

DWORD WINAPI WriteAfterGo(LPVOID parameter) {
  auto* write = static_cast<DelayedWrite*>(parameter);
  if (WaitForSingleObject(write->go, kGuardMs) != WAIT_OBJECT_0) return 1;
  return WriteMessage(write->client, "late data") ? 0 : 2;
}

TEST(Overlapped, GetOverlappedResultWaitsForCompletionWhenAsked) {
  Connection pipe;
  ASSERT_NO_FATAL_FAILURE(Connect(pipe, PipeName()));
  Handle go(CreateEventW(nullptr, TRUE, FALSE, nullptr));
  ASSERT_TRUE(go);
  DelayedWrite write{go.Get(), pipe.client.Get()};
  Handle writer(CreateThread(nullptr, 0, WriteAfterGo, &write, 0, nullptr));
  ASSERT_TRUE(writer);

  Overlapped read;
  char buffer[64] = {};
  DWORD bytes = 0;
  ASSERT_FALSE(ReadFile(pipe.server.Get(), buffer, sizeof(buffer), &bytes, read.Get()));
  ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
  ASSERT_TRUE(SetEvent(go.Get()));
  ASSERT_TRUE(GetOverlappedResult(pipe.server.Get(), read.Get(), &bytes, TRUE));
  EXPECT_EQ(std::string(buffer, bytes), "late data");
  ASSERT_EQ(WaitForSingleObject(writer.Get(), kGuardMs), WAIT_OBJECT_0);
  DWORD code = 99;
  ASSERT_TRUE(GetExitCodeThread(writer.Get(), &code));
  EXPECT_EQ(code, 0u);
}

TEST(Overlapped, ReadOfWaitingDataCompletesAtOnceAndSignalsTheEvent) {
  Connection pipe;
  ASSERT_NO_FATAL_FAILURE(Connect(pipe, PipeName()));
  ASSERT_TRUE(WriteMessage(pipe.client.Get(), "ready"));
  Overlapped read;
  char buffer[64] = {};
  DWORD bytes = 0;
  ASSERT_TRUE(ReadFile(pipe.server.Get(), buffer, sizeof(buffer), &bytes, read.Get()));
  EXPECT_EQ(bytes, 5u);
  EXPECT_TRUE(read.Signalled());
  DWORD again = 0;
  ASSERT_TRUE(GetOverlappedResult(pipe.server.Get(), read.Get(), &again, FALSE));
  EXPECT_EQ(again, 5u);
}

DWORD WINAPI ReadReplyOnSynchronousClient(LPVOID parameter) {
  char buffer[64] = {};
  DWORD bytes = 0;
  if (!ReadFile(parameter, buffer, sizeof(buffer), &bytes, nullptr)) return 0xFFFF;
  return bytes;
}

TEST(Overlapped, HandleOpenedWithoutOverlappedCompletesSynchronously) {
  Connection pipe;
  ASSERT_NO_FATAL_FAILURE(Connect(pipe, PipeName()));
  // A blocking read on the synchronous client returns only with the data.
  Handle reader(
      CreateThread(nullptr, 0, ReadReplyOnSynchronousClient, pipe.client.Get(), 0, nullptr));
  ASSERT_TRUE(reader);
  Overlapped write;
  DWORD bytes = 0;
  if (!WriteFile(pipe.server.Get(), "reply!", 6, &bytes, write.Get())) {
    ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
  }
  ASSERT_TRUE(GetOverlappedResult(pipe.server.Get(), write.Get(), &bytes, TRUE));
  EXPECT_EQ(bytes, 6u);
  ASSERT_EQ(WaitForSingleObject(reader.Get(), kGuardMs), WAIT_OBJECT_0);
  DWORD code = 0;
  ASSERT_TRUE(GetExitCodeThread(reader.Get(), &code));
  EXPECT_EQ(code, 6u);

  // With data waiting, an OVERLAPPED record without an event on a synchronous
  // handle is simply filled in as the call returns.
  ASSERT_TRUE(conformance::WriteOverlapped(pipe.server.Get(), "abc"));
  OVERLAPPED plain{};
  char buffer[16] = {};
  bytes = 0;
  ASSERT_TRUE(ReadFile(pipe.client.Get(), buffer, sizeof(buffer), &bytes, &plain));
  EXPECT_EQ(bytes, 3u);
  EXPECT_EQ(std::string(buffer, bytes), "abc");
}

TEST(CancelIo, AbortsTheCallingThreadsPendingRequest) {
  Connection pipe;
  ASSERT_NO_FATAL_FAILURE(Connect(pipe, PipeName()));
  EXPECT_TRUE(CancelIo(pipe.server.Get()));  // nothing pending: still success

  Overlapped read;
  char buffer[64] = {};
  DWORD bytes = 0;
  ASSERT_FALSE(ReadFile(pipe.server.Get(), buffer, sizeof(buffer), &bytes, read.Get()));
  ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
  ASSERT_TRUE(CancelIo(pipe.server.Get()));
  ASSERT_EQ(WaitForSingleObject(read.event.Get(), kGuardMs), WAIT_OBJECT_0);
  bytes = 77;
  SetLastError(0);
  EXPECT_FALSE(GetOverlappedResult(pipe.server.Get(), read.Get(), &bytes, TRUE));
  EXPECT_EQ(GetLastError(), ERROR_OPERATION_ABORTED);
  EXPECT_EQ(bytes, 0u);
  EXPECT_NE(read.record.Internal, STATUS_PENDING);

  // The handle stays usable: the next read gets the next message.
  Overlapped next;
  ASSERT_TRUE(WriteMessage(pipe.client.Get(), "after"));
  ASSERT_TRUE(ReadFile(pipe.server.Get(), buffer, sizeof(buffer), &bytes, next.Get()) ||
              GetLastError() == ERROR_IO_PENDING);
  ASSERT_TRUE(GetOverlappedResult(pipe.server.Get(), next.Get(), &bytes, TRUE));
  EXPECT_EQ(std::string(buffer, bytes), "after");
}

// A second thread's read on the same handle. The thread stays alive until its
// request is done (Windows also cancels a thread's requests when it ends).
struct OtherThreadRead {
  HANDLE server = nullptr;
  HANDLE issued = nullptr;
  Overlapped read;
  char buffer[64] = {};
};

DWORD WINAPI ReadOnOtherThread(LPVOID parameter) {
  auto* other = static_cast<OtherThreadRead*>(parameter);
  DWORD bytes = 0;
  if (ReadFile(other->server, other->buffer, sizeof(other->buffer), &bytes, other->read.Get())) {
    return 0xF000;  // must not complete before any data is sent
  }
  if (GetLastError() != ERROR_IO_PENDING) return 0xF001;
  SetEvent(other->issued);
  if (!GetOverlappedResult(other->server, other->read.Get(), &bytes, TRUE)) {
    return 0xE000 + GetLastError();
  }
  return bytes;
}

TEST(CancelIo, LeavesAnotherThreadsRequestAlone) {
  Connection pipe;
  ASSERT_NO_FATAL_FAILURE(Connect(pipe, PipeName()));
  Handle issued(CreateEventW(nullptr, TRUE, FALSE, nullptr));
  ASSERT_TRUE(issued);
  OtherThreadRead other;
  other.server = pipe.server.Get();
  other.issued = issued.Get();
  Handle thread(CreateThread(nullptr, 0, ReadOnOtherThread, &other, 0, nullptr));
  ASSERT_TRUE(thread);
  ASSERT_EQ(WaitForSingleObject(issued.Get(), kGuardMs), WAIT_OBJECT_0);

  Overlapped mine;
  char buffer[64] = {};
  DWORD bytes = 0;
  ASSERT_FALSE(ReadFile(pipe.server.Get(), buffer, sizeof(buffer), &bytes, mine.Get()));
  ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
  ASSERT_TRUE(CancelIo(pipe.server.Get()));
  ASSERT_EQ(WaitForSingleObject(mine.event.Get(), kGuardMs), WAIT_OBJECT_0);
  EXPECT_FALSE(GetOverlappedResult(pipe.server.Get(), mine.Get(), &bytes, FALSE));
  EXPECT_EQ(GetLastError(), ERROR_OPERATION_ABORTED);

  // The other thread's read is still pending and takes the next message.
  EXPECT_FALSE(other.read.Signalled());
  EXPECT_EQ(other.read.record.Internal, STATUS_PENDING);
  ASSERT_TRUE(WriteMessage(pipe.client.Get(), "for the other"));
  ASSERT_EQ(WaitForSingleObject(thread.Get(), kGuardMs), WAIT_OBJECT_0);
  DWORD code = 0;
  ASSERT_TRUE(GetExitCodeThread(thread.Get(), &code));
  EXPECT_EQ(code, 13u);
  EXPECT_EQ(std::string(other.buffer, 13), "for the other");
}

}  // namespace
