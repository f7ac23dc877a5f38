// Named pipes in message mode as the service's pipe server uses them:
// overlapped connects, message boundaries, ERROR_MORE_DATA, the instance
// limit, disconnection in both directions, reconnection, first-instance
// creation, WaitNamedPipeW and TransactNamedPipe.
#include <gtest/gtest.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "pipe_helpers.h"
#include "support/child_process.h"

namespace {

using conformance::ConnectOverlapped;
using conformance::CreateServer;
using conformance::Handle;
using conformance::kGuardMs;
using conformance::OpenClient;
using conformance::Overlapped;
using conformance::PipeName;
using conformance::WriteMessage;
using conformance::WriteOverlapped;

constexpr DWORD kErrorSemTimeout = 121;  // WaitNamedPipeW's time-out

// Reads one message (or what fits) from the overlapped server end, waiting
// for it; returns the read's error (0 on success) and the text in `text`.
DWORD ReadServer(HANDLE server, std::string& text, DWORD capacity = 256) {
  Overlapped read;
  std::vector<char> buffer(capacity);
  DWORD bytes = 0;
  SetLastError(0);
  BOOL done = ReadFile(server, buffer.data(), capacity, &bytes, read.Get());
  DWORD error = done ? 0 : GetLastError();
  // The count of a read that ended with ERROR_MORE_DATA is reported, as for a
  // pending one, by GetOverlappedResult.
  if (error == ERROR_IO_PENDING || error == ERROR_MORE_DATA) {
    done = GetOverlappedResult(server, read.Get(), &bytes, TRUE);
    error = done ? 0 : GetLastError();
  }
  text.assign(buffer.data(), bytes);
  return error;
}

TEST(Pipe, OverlappedConnectPendsUntilAClientOpens) {
  WideString name = PipeName();
  // The service creates its instances with a null DACL so any account may open them.
  SECURITY_DESCRIPTOR descriptor{};
  ASSERT_TRUE(InitializeSecurityDescriptor(&descriptor, SECURITY_DESCRIPTOR_REVISION));
  ASSERT_TRUE(SetSecurityDescriptorDacl(&descriptor, TRUE, nullptr, FALSE));
  SECURITY_ATTRIBUTES attributes{sizeof(attributes), &descriptor, FALSE};
  Handle server(CreateNamedPipeW(name.c_str(), PIPE_ACCESS_DUPLEX | FILE_FLAG_OVERLAPPED,
                                 PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_WAIT, 16,
                                 conformance::kPipeBufferBytes, conformance::kPipeBufferBytes, 5000,
                                 &attributes));
  ASSERT_TRUE(server);
  Overlapped connect;
  ASSERT_EQ(ConnectOverlapped(server.Get(), connect), ERROR_IO_PENDING);
  EXPECT_FALSE(connect.Signalled());
  DWORD bytes = 0;
  EXPECT_FALSE(GetOverlappedResult(server.Get(), connect.Get(), &bytes, FALSE));
  EXPECT_EQ(GetLastError(), ERROR_IO_INCOMPLETE);

  Handle client = OpenClient(name);
  ASSERT_TRUE(client);
  ASSERT_EQ(WaitForSingleObject(connect.event.Get(), kGuardMs), WAIT_OBJECT_0);
  EXPECT_TRUE(GetOverlappedResult(server.Get(), connect.Get(), &bytes, FALSE));

  ASSERT_TRUE(WriteMessage(client.Get(), "ping"));
  std::string text;
  ASSERT_EQ(ReadServer(server.Get(), text), 0u);
  EXPECT_EQ(text, "ping");
}

TEST(Pipe, ClientThatCameFirstGivesPipeConnected) {
  WideString name = PipeName();
  Handle server = CreateServer(name);
  ASSERT_TRUE(server);
  Handle client = OpenClient(name);
  ASSERT_TRUE(client);
  Overlapped connect;
  EXPECT_EQ(ConnectOverlapped(server.Get(), connect), ERROR_PIPE_CONNECTED);
  ASSERT_TRUE(WriteMessage(client.Get(), "first"));
  std::string text;
  ASSERT_EQ(ReadServer(server.Get(), text), 0u);
  EXPECT_EQ(text, "first");
}

TEST(Pipe, OpeningAMissingPipeGivesFileNotFound) {
  WideString name = PipeName("absent");
  SetLastError(0);
  Handle client = OpenClient(name);
  EXPECT_FALSE(client);
  EXPECT_EQ(GetLastError(), ERROR_FILE_NOT_FOUND);
}

TEST(Pipe, MessagesKeepTheirBoundariesBothWays) {
  WideString name = PipeName();
  Handle server = CreateServer(name);
  ASSERT_TRUE(server);
  Handle client = OpenClient(name);
  ASSERT_TRUE(client);
  ASSERT_TRUE(WriteMessage(client.Get(), "abc"));
  ASSERT_TRUE(WriteMessage(client.Get(), "defgh"));
  std::string text;
  ASSERT_EQ(ReadServer(server.Get(), text), 0u);
  EXPECT_EQ(text, "abc");
  ASSERT_EQ(ReadServer(server.Get(), text), 0u);
  EXPECT_EQ(text, "defgh");

  // Replies: the client switched to message read mode sees them one by one.
  DWORD mode = PIPE_READMODE_MESSAGE;
  ASSERT_TRUE(SetNamedPipeHandleState(client.Get(), &mode, nullptr, nullptr));
  ASSERT_TRUE(WriteOverlapped(server.Get(), "one"));
  ASSERT_TRUE(WriteOverlapped(server.Get(), "three"));
  char buffer[64] = {};
  DWORD bytes = 0;
  ASSERT_TRUE(ReadFile(client.Get(), buffer, sizeof(buffer), &bytes, nullptr));
  EXPECT_EQ(std::string(buffer, bytes), "one");
  ASSERT_TRUE(ReadFile(client.Get(), buffer, sizeof(buffer), &bytes, nullptr));
  EXPECT_EQ(std::string(buffer, bytes), "three");
}

TEST(Pipe, ZeroLengthMessageReadsAsZeroBytes) {
  WideString name = PipeName();
  Handle server = CreateServer(name);
  ASSERT_TRUE(server);
  Handle client = OpenClient(name);
  ASSERT_TRUE(client);
  DWORD written = 99;
  ASSERT_TRUE(WriteFile(client.Get(), "", 0, &written, nullptr));
  EXPECT_EQ(written, 0u);
  ASSERT_TRUE(WriteMessage(client.Get(), "next"));
  std::string text = "unchanged";
  ASSERT_EQ(ReadServer(server.Get(), text), 0u);
  EXPECT_EQ(text, "");
  ASSERT_EQ(ReadServer(server.Get(), text), 0u);
  EXPECT_EQ(text, "next");
}

TEST(Pipe, MessageLongerThanTheBufferGivesMoreData) {
  WideString name = PipeName();
  Handle server = CreateServer(name);
  ASSERT_TRUE(server);
  Handle client = OpenClient(name);
  ASSERT_TRUE(client);
  std::string message(100, 'x');
  for (size_t i = 0; i < message.size(); ++i) message[i] = static_cast<char>('a' + i % 26);

  // Data already waiting: the read returns at once with ERROR_MORE_DATA.
  ASSERT_TRUE(WriteMessage(client.Get(), message));
  std::string part;
  EXPECT_EQ(ReadServer(server.Get(), part, 40), ERROR_MORE_DATA);
  EXPECT_EQ(part, message.substr(0, 40));
  EXPECT_EQ(ReadServer(server.Get(), part, 256), 0u);  // the rest of the same message
  EXPECT_EQ(part, message.substr(40));

  // Read pending first: its completion reports ERROR_MORE_DATA the same way.
  Overlapped read;
  char buffer[40] = {};
  DWORD bytes = 0;
  ASSERT_FALSE(ReadFile(server.Get(), buffer, sizeof(buffer), &bytes, read.Get()));
  ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
  ASSERT_TRUE(WriteMessage(client.Get(), message));
  ASSERT_EQ(WaitForSingleObject(read.event.Get(), kGuardMs), WAIT_OBJECT_0);
  SetLastError(0);
  EXPECT_FALSE(GetOverlappedResult(server.Get(), read.Get(), &bytes, FALSE));
  EXPECT_EQ(GetLastError(), ERROR_MORE_DATA);
  EXPECT_EQ(bytes, 40u);
  EXPECT_EQ(std::string(buffer, 40), message.substr(0, 40));
}

TEST(Pipe, SixteenthClientOfFifteenInstancesIsBusy) {
  WideString name = PipeName();
  constexpr int kInstances = 15;
  std::vector<Handle> servers;
  std::vector<Handle> clients;
  for (int i = 0; i < kInstances; ++i) {
    servers.push_back(CreateServer(name));
    ASSERT_TRUE(servers.back()) << "instance " << i;
    Overlapped connect;
    ASSERT_EQ(ConnectOverlapped(servers.back().Get(), connect), ERROR_IO_PENDING);
    clients.push_back(OpenClient(name));
    ASSERT_TRUE(clients.back()) << "client " << i;
  }
  SetLastError(0);
  Handle sixteenth = OpenClient(name);
  EXPECT_FALSE(sixteenth);
  EXPECT_EQ(GetLastError(), ERROR_PIPE_BUSY);
  EXPECT_FALSE(WaitNamedPipeW(name.c_str(), 1));
  EXPECT_EQ(GetLastError(), kErrorSemTimeout);

  // One connection ends and its instance listens again: the next client gets in.
  clients[3].Reset();
  ASSERT_TRUE(DisconnectNamedPipe(servers[3].Get()));
  Overlapped connect;
  ASSERT_EQ(ConnectOverlapped(servers[3].Get(), connect), ERROR_IO_PENDING);
  EXPECT_TRUE(WaitNamedPipeW(name.c_str(), kGuardMs));
  sixteenth = OpenClient(name);
  ASSERT_TRUE(sixteenth);
  ASSERT_EQ(WaitForSingleObject(connect.event.Get(), kGuardMs), WAIT_OBJECT_0);
  ASSERT_TRUE(WriteMessage(sixteenth.Get(), "late"));
  std::string text;
  ASSERT_EQ(ReadServer(servers[3].Get(), text), 0u);
  EXPECT_EQ(text, "late");
}

TEST(Pipe, InstanceLimitRefusesAnotherInstance) {
  WideString name = PipeName();
  Handle first = CreateServer(name, 2);
  Handle second = CreateServer(name, 2);
  ASSERT_TRUE(first && second);
  SetLastError(0);
  Handle third = CreateServer(name, 2);
  EXPECT_FALSE(third);
  EXPECT_EQ(GetLastError(), ERROR_PIPE_BUSY);
}

TEST(Pipe, FirstPipeInstanceFlagRefusesAnExistingName) {
  SKIP_ON_WINE("Wine 8 ignores FILE_FLAG_FIRST_PIPE_INSTANCE and creates the second instance");
  WideString name = PipeName();
  Handle first = CreateServer(name, 16, FILE_FLAG_FIRST_PIPE_INSTANCE);
  ASSERT_TRUE(first);
  SetLastError(0);
  Handle again = CreateServer(name, 16, FILE_FLAG_FIRST_PIPE_INSTANCE);
  EXPECT_FALSE(again);
  EXPECT_EQ(GetLastError(), ERROR_ACCESS_DENIED);
  Handle plain = CreateServer(name);
  EXPECT_TRUE(plain);
}

TEST(Pipe, ClientClosingBreaksTheServersReads) {
  WideString name = PipeName();
  Handle server = CreateServer(name);
  ASSERT_TRUE(server);
  Handle client = OpenClient(name);
  ASSERT_TRUE(client);

  Overlapped read;
  char buffer[64] = {};
  DWORD bytes = 0;
  ASSERT_FALSE(ReadFile(server.Get(), buffer, sizeof(buffer), &bytes, read.Get()));
  ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
  client.Reset();
  ASSERT_EQ(WaitForSingleObject(read.event.Get(), kGuardMs), WAIT_OBJECT_0);
  SetLastError(0);
  EXPECT_FALSE(GetOverlappedResult(server.Get(), read.Get(), &bytes, FALSE));
  EXPECT_EQ(GetLastError(), ERROR_BROKEN_PIPE);

  // Later reads fail at once the same way.
  std::string text;
  EXPECT_EQ(ReadServer(server.Get(), text), ERROR_BROKEN_PIPE);
}

// A client process that ends without closing its handle: the system closes
// it, what it wrote is still read, a pending read breaks and a write finds
// the pipe closing.
TEST(Pipe, ClientProcessEndingClosesItsEnd) {
  WideString name = PipeName();
  if (skytest::ChildRole() != nullptr) {
    Handle client = OpenClient(name);
    ASSERT_TRUE(client);
    ASSERT_TRUE(WriteMessage(client.Get(), "last words"));
    static_cast<void>(client.Release());
    std::_Exit(0);
  }
  Handle server = CreateServer(name);
  ASSERT_TRUE(server);
  Overlapped connect;
  ASSERT_FALSE(ConnectNamedPipe(server.Get(), connect.Get()));
  ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
  skytest::ChildProcess child;
  ASSERT_TRUE(child.Start("client"));
  DWORD bytes = 0;
  ASSERT_TRUE(GetOverlappedResult(server.Get(), connect.Get(), &bytes, TRUE));
  std::string text;
  EXPECT_EQ(ReadServer(server.Get(), text), 0u);
  EXPECT_EQ(text, "last words");

  Overlapped read;
  char buffer[64] = {};
  SetLastError(0);
  EXPECT_FALSE(ReadFile(server.Get(), buffer, sizeof(buffer), &bytes, read.Get()));
  DWORD error = GetLastError();
  ASSERT_EQ(child.Wait(skytest::kProcessGuardMs), 0);
  if (error == ERROR_IO_PENDING) {
    EXPECT_FALSE(GetOverlappedResult(server.Get(), read.Get(), &bytes, TRUE));
    error = GetLastError();
  }
  EXPECT_EQ(error, ERROR_BROKEN_PIPE);
  EXPECT_EQ(ReadServer(server.Get(), text), ERROR_BROKEN_PIPE);
  Overlapped write;
  SetLastError(0);
  EXPECT_FALSE(WriteFile(server.Get(), "late", 4, &bytes, write.Get()));
  EXPECT_EQ(GetLastError(), ERROR_NO_DATA);
}

TEST(Pipe, ServerDisconnectEndsTheClientAndTheInstanceServesTheNext) {
  WideString name = PipeName();
  Handle server = CreateServer(name);
  ASSERT_TRUE(server);
  Handle first = OpenClient(name);
  ASSERT_TRUE(first);
  ASSERT_TRUE(WriteMessage(first.Get(), "one"));
  ASSERT_TRUE(DisconnectNamedPipe(server.Get()));

  // The disconnected client can neither read nor write any more.
  char buffer[16] = {};
  DWORD bytes = 0;
  SetLastError(0);
  EXPECT_FALSE(ReadFile(first.Get(), buffer, sizeof(buffer), &bytes, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_PIPE_NOT_CONNECTED);
  SetLastError(0);
  EXPECT_FALSE(WriteMessage(first.Get(), "more"));
  EXPECT_EQ(GetLastError(), ERROR_PIPE_NOT_CONNECTED);

  // The instance listens again and serves a new client; the first client's
  // unread message went with its connection.
  Overlapped connect;
  ASSERT_EQ(ConnectOverlapped(server.Get(), connect), ERROR_IO_PENDING);
  Handle second = OpenClient(name);
  ASSERT_TRUE(second);
  ASSERT_EQ(WaitForSingleObject(connect.event.Get(), kGuardMs), WAIT_OBJECT_0);
  ASSERT_TRUE(WriteMessage(second.Get(), "two"));
  std::string text;
  ASSERT_EQ(ReadServer(server.Get(), text), 0u);
  EXPECT_EQ(text, "two");
}

TEST(Pipe, WaitNamedPipeSeesAListeningInstance) {
  WideString name = PipeName();
  SetLastError(0);
  EXPECT_FALSE(WaitNamedPipeW(name.c_str(), 1));
  EXPECT_EQ(GetLastError(), ERROR_FILE_NOT_FOUND);

  Handle server = CreateServer(name);
  ASSERT_TRUE(server);
  Overlapped connect;
  ASSERT_EQ(ConnectOverlapped(server.Get(), connect), ERROR_IO_PENDING);
  EXPECT_TRUE(WaitNamedPipeW(name.c_str(), kGuardMs));
  Handle client = OpenClient(name);
  EXPECT_TRUE(client);
}

// Answers one request: reads it and writes back "re:" + request.
struct Echo {
  HANDLE server = nullptr;
  std::string reply;
};

DWORD WINAPI EchoOnce(LPVOID parameter) {
  auto* echo = static_cast<Echo*>(parameter);
  std::string request;
  if (ReadServer(echo->server, request) != 0) return 1;
  std::string reply = echo->reply.empty() ? "re:" + request : echo->reply;
  return WriteOverlapped(echo->server, reply) ? 0 : 2;
}

TEST(Pipe, TransactNamedPipeWritesTheRequestAndReadsTheReply) {
  WideString name = PipeName();
  Handle server = CreateServer(name);
  ASSERT_TRUE(server);
  Handle client = OpenClient(name);
  ASSERT_TRUE(client);
  DWORD mode = PIPE_READMODE_MESSAGE;
  ASSERT_TRUE(SetNamedPipeHandleState(client.Get(), &mode, nullptr, nullptr));

  for (const char* forcedReply : {"", "ABCDEFGHIJKLMNOPQRSTUVWX"}) {
    Echo echo{server.Get(), forcedReply};
    Handle thread(CreateThread(nullptr, 0, EchoOnce, &echo, 0, nullptr));
    ASSERT_TRUE(thread);
    char reply[16] = {};
    DWORD bytes = 0;
    SetLastError(0);
    BOOL done = TransactNamedPipe(client.Get(), const_cast<char*>("status?"), 7, reply,
                                  sizeof(reply), &bytes, nullptr);
    if (echo.reply.empty()) {
      ASSERT_TRUE(done) << GetLastError();
      EXPECT_EQ(std::string(reply, bytes), "re:status?");
    } else {
      // A reply longer than the buffer: the start of it and ERROR_MORE_DATA.
      EXPECT_FALSE(done);
      EXPECT_EQ(GetLastError(), ERROR_MORE_DATA);
      EXPECT_EQ(bytes, sizeof(reply));
      EXPECT_EQ(std::string(reply, bytes), echo.reply.substr(0, sizeof(reply)));
      ASSERT_TRUE(ReadFile(client.Get(), reply, sizeof(reply), &bytes, nullptr));
      EXPECT_EQ(std::string(reply, bytes), echo.reply.substr(sizeof(reply)));
    }
    ASSERT_EQ(WaitForSingleObject(thread.Get(), kGuardMs), WAIT_OBJECT_0);
    DWORD code = 99;
    ASSERT_TRUE(GetExitCodeThread(thread.Get(), &code));
    EXPECT_EQ(code, 0u);
  }
}

}  // namespace
