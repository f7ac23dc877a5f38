#include "pipe_fixture.h"

#include <chrono>
#include <cstring>

#include "pipe/pipe_server.h"

#if defined(SECURITY_SQOS_PRESENT)
static_assert(kPipeClientSecurityFlags == (SECURITY_SQOS_PRESENT | SECURITY_IDENTIFICATION));
#endif

namespace pipetest {

void MonitorFixture::SetUp() {
  ::MonitorFixture::SetUp();
  monitorState.pipeStopEvent = CreateEventW(nullptr, FALSE, FALSE, nullptr);
  ASSERT_NE(monitorState.pipeStopEvent, nullptr);
}

void MonitorFixture::TearDown() {
  if (monitorState.pipeStopEvent != nullptr) CloseHandle(monitorState.pipeStopEvent);
  ::MonitorFixture::TearDown();
}

void ServerFixture::SetUp() {
  MonitorFixture::SetUp();
  if (!HasFatalFailure()) StartServer();
}

void ServerFixture::StartServer() {
  thread_.Reset(CreateThread(nullptr, 0, PipeServerThread, nullptr, 0, nullptr));
  ASSERT_TRUE(thread_.Valid());
}

void ServerFixture::TearDown() {
  if (thread_.Valid()) {
    EXPECT_TRUE(StopServer());
  }
  MonitorFixture::TearDown();
}

bool ServerFixture::StopServer() {
  if (!thread_.Valid()) return false;
  SetEvent(monitorState.pipeStopEvent);
  const bool ended = WaitForSingleObject(thread_.Get(), kGuardMs) == WAIT_OBJECT_0;
  DWORD code = 1;
  const bool zero = ended && GetExitCodeThread(thread_.Get(), &code) && code == 0;
  if (ended) thread_.Reset();
  return zero;
}

Handle ServerFixture::Connect() {
  // The name exists once the thread created its first instance.
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(kGuardMs);
  for (;;) {
    HANDLE pipe = OpenCommandPipe(kGuardMs);
    if (pipe != INVALID_HANDLE_VALUE) return Handle(pipe);
    const DWORD error = GetLastError();
    if (error != ERROR_FILE_NOT_FOUND || std::chrono::steady_clock::now() > deadline) {
      ADD_FAILURE() << "cannot open the command pipe, error " << error;
      return Handle();
    }
    Sleep(5);
  }
}

DWORD Exchange::Field(std::size_t offset) const {
  DWORD value = 0;
  if (reply.size() >= offset + sizeof(DWORD)) std::memcpy(&value, reply.data() + offset, 4);
  return value;
}

Exchange Send(HANDLE client, const void* request, DWORD sent) {
  Exchange exchange;
  std::vector<BYTE> buffer(2 * kCommandMaxLength);
  DWORD received = 0;
  exchange.ok = ExchangeCommand(client, request, sent, buffer.data(),
                                static_cast<DWORD>(buffer.size()), &received);
  if (!exchange.ok) exchange.error = GetLastError();
  buffer.resize(received);
  exchange.reply = std::move(buffer);
  return exchange;
}

Exchange Send(HANDLE client, const CommandMessage& message) {
  return Send(client, &message, sizeof(message));
}

std::unique_ptr<CommandMessage> NewCommand(DWORD command, DWORD arg1, DWORD arg2, DWORD arg3) {
  auto message = std::make_unique<CommandMessage>();
  InitCommand(message.get(), command, arg1, arg2, arg3);
  return message;
}

}  // namespace pipetest
