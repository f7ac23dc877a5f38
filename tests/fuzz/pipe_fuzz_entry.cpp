#include "pipe_fuzz_entry.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "monitor/monitor_state.h"
#include "pipe/command_message.h"
#include "pipe/dispatcher.h"
#include "pipe/pipe_instance.h"
#include "pipe/registry_access.h"
#include "service/process_locks.h"

#if !defined(_WIN32)
#include <unistd.h>
#endif

namespace {

void Check(bool condition, const char* what) {
  if (!condition) {
    std::fprintf(stderr, "pipe fuzz invariant violated: %s\n", what);
    std::abort();
  }
}

std::filesystem::path privateRegistry;

void RemovePrivateRegistry() {
  std::error_code ignored;
  if (!privateRegistry.empty()) std::filesystem::remove_all(privateRegistry, ignored);
}

// The surroundings the monitor gives the dispatcher, made once. The emulation
// gets a namespace and registry store of this process's own, so that random
// registry writes land nowhere else.
void SetUpOnce() {
  static bool done = false;
  if (done) return;
  done = true;
#if !defined(_WIN32)
  const std::string tag = "pipefuzz-" + std::to_string(getpid());
  setenv("SKYVANE_NAMESPACE", tag.c_str(), 1);
  privateRegistry = std::filesystem::temp_directory_path() / tag;
  std::filesystem::create_directories(privateRegistry);
  setenv("SKYVANE_REGISTRY", (privateRegistry / "registry").c_str(), 1);
  std::atexit(RemovePrivateRegistry);
#endif
  InitializeProcessLocks();
  static StateBlock* block = static_cast<StateBlock*>(std::calloc(1, sizeof(StateBlock)));
  monitorState = MonitorState{};
  monitorState.stateBlock = block;
  monitorState.stateMutex = CreateMutexW(nullptr, FALSE, nullptr);
  monitorState.fileMapping = CreateFileMappingW(INVALID_HANDLE_VALUE, nullptr, PAGE_READWRITE, 0,
                                                kStateBlockSize, nullptr);
  monitorState.pipeStopEvent = CreateEventW(nullptr, FALSE, FALSE, nullptr);
  Check(block != nullptr && monitorState.stateMutex != nullptr &&
            monitorState.fileMapping != nullptr && monitorState.pipeStopEvent != nullptr,
        "set-up");
}

void FuzzDispatcher(const std::uint8_t* data, std::size_t size) {
  static std::vector<BYTE> request(kPipeBufferBytes);
  static std::vector<BYTE> reply(kPipeBufferBytes);
  // A read delivers at most kPipeReadSize bytes; longer messages never reach
  // the dispatcher. Earlier bytes stay in the buffer, as on a reused instance.
  const DWORD received = static_cast<DWORD>(size < kPipeReadSize ? size : kPipeReadSize);
  std::memcpy(request.data(), data, received);
  std::uint64_t declared = 0;
  std::memcpy(&declared, request.data(), received < 8 ? received : 8);
  if (received < 8) std::memset(reinterpret_cast<BYTE*>(&declared) + received, 0, 8 - received);
  DWORD command = 0;
  if (received >= 12) std::memcpy(&command, data + 8, 4);

  std::memset(reply.data(), 0xA5, reply.size());
  const DWORD length = DispatchRequest(request.data(), received, reply.data());

  const bool inRange = declared >= kCommandMinLength && declared <= kCommandMaxLength;
  Check(length == (inRange ? static_cast<DWORD>(declared) : 0u), "reply length");
  // Nothing beyond what arrived may show in the reply but the result fields
  // (and the status block that command 11 fills).
  for (std::size_t i = received; i < length; ++i) {
    const bool resultField = i >= offsetof(CommandMessage, result) &&
                             i < offsetof(CommandMessage, detail) + sizeof(DWORD);
    const bool statusBlock = command == kCommandReadStatus &&
                             i >= offsetof(CommandMessage, statusBlock) &&
                             i < offsetof(CommandMessage, statusBlock) + 8;
    if (!resultField && !statusBlock) Check(reply[i] == 0, "stale byte in reply");
  }
  // The reply is the request with its result fields filled in.
  if (length > 0) {
    Check(std::memcmp(reply.data(), request.data(), length) == 0, "reply differs from request");
  }
}

void FuzzRegistry(const std::uint8_t* data, std::size_t size) {
  // Exactly `size` bytes, so that any read beyond them is caught by the
  // address sanitizer. Kept 4-aligned as inside a message.
  std::unique_ptr<std::uint32_t[]> words(new std::uint32_t[(size + 3) / 4 + 1]);
  BYTE* request = reinterpret_cast<BYTE*>(words.get());
  if (size != 0) std::memcpy(request, data, size);
  std::vector<BYTE> before(request, request + size);
  const DWORD result = RunRegistryRequest(request, size);
  if (result == ERROR_INVALID_PARAMETER) {
    Check(std::memcmp(before.data(), request, size) == 0, "refused request was changed");
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
  return 0;
}
