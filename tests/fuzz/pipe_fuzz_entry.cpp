#include <cstring>
#include <memory>

#include "fuzz_support.h"
#include "monitor/monitor_state.h"
#include "pipe/command_message.h"
#include "pipe/dispatcher.h"
#include "pipe/pipe_instance.h"
#include "pipe/registry_access.h"

namespace {

using fuzzsupport::Check;

fuzzsupport::RecordingComputer* computer = nullptr;

// On a computer without drives: nothing a request names may ever be opened.
void SetUpOnce() {
  static bool done = false;
  if (done) return;
  done = true;
  fuzzsupport::UsePrivateEmulation("pipefuzz");
  computer = new fuzzsupport::RecordingComputer(std::make_unique<sim::Machine>());
  fuzzsupport::SetUpMonitor(true);
}

void FuzzDispatcher(const std::uint8_t* data, std::size_t size) {
  // A read delivers at most kPipeReadSize bytes; the rest of the buffer holds
  // an earlier request, as on a reused instance.
  static std::unique_ptr<BYTE[]> request(new BYTE[kPipeBufferBytes]);
  static std::unique_ptr<BYTE[]> reply(new BYTE[kPipeBufferBytes]);
  const std::size_t received = size < kPipeReadSize ? size : kPipeReadSize;
  std::memcpy(request.get(), data, received);
  std::memset(reply.get(), 0xA5, kPipeBufferBytes);
  const DWORD length = DispatchRequest(request.get(), static_cast<DWORD>(received), reply.get());
  fuzzsupport::CheckReply(data, received, reply.get(), length, monitorState.paused != 0, true);
  Check(computer->TakeOpened().empty(), "a path named by a request was opened");
}

void FuzzRegistry(const std::uint8_t* data, std::size_t size) {
  // Exactly `size` bytes, so the address sanitizer catches a read beyond.
  std::unique_ptr<BYTE[]> request(new BYTE[size == 0 ? 1 : size]);
  if (size != 0) std::memcpy(request.get(), data, size);
  const DWORD result = RunRegistryRequest(request.get(), size);
  if (result == ERROR_INVALID_PARAMETER) {
    Check(size == 0 || std::memcmp(data, request.get(), size) == 0, "refused request was changed");
  }
}

}  // namespace

int PipeFuzzOneInput(const std::uint8_t* data, std::size_t size) {
  SetUpOnce();
  if (size == 0) return 0;
  if (data[0] % 2 == 0) {
    FuzzDispatcher(data + 1, size - 1);
  } else {
    FuzzRegistry(data + 1, size - 1);
  }
  fuzzsupport::KeepRegistrySmall();
  return 0;
}
