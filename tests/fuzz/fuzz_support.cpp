#include "fuzz_support.h"

#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>

#include "monitor/monitor_state.h"
#include "pipe/command_message.h"
#include "service/process_locks.h"

namespace fuzzsupport {

namespace {

std::filesystem::path privateRegistry;

void RemovePrivateRegistry() {
  std::error_code ignored;
  if (!privateRegistry.empty()) std::filesystem::remove_all(privateRegistry, ignored);
}

std::uint64_t ReadAt(const std::uint8_t* bytes, std::size_t size, std::size_t offset,
                     std::size_t width) {
  std::uint64_t value = 0;
  for (std::size_t i = 0; i < width; ++i) {
    if (offset + i < size) value |= static_cast<std::uint64_t>(bytes[offset + i]) << (8 * i);
  }
  return value;
}

// The command's result and detail against its row of the command table.
void CheckCodes(std::uint32_t command, std::uint32_t result, std::uint32_t detail,
                std::uint32_t registryLength, bool paused, bool noDrives) {
  switch (command) {
    case kCommandSafeRemove:
      if (paused) {
        Check(result == 0 && detail == 1, "command 1 while paused");
        break;
      }
      [[fallthrough]];
    case kCommandReleaseDrive:
    case kCommandReleaseDriveAlso:
      Check(result == 0 || (result == 1 && detail == 0), "commands 1 to 3 codes");
      Check(!noDrives || result == 0, "commands 1 to 3 acted on a drive that is not there");
      break;
    case kCommandForwardMessage:
    case kCommandPause:
    case kCommandResume:
      Check(result == 0 && detail == 0, "commands 6 to 8 codes");
      break;
    case kCommandRefreshGauges:
    case kCommandSetStatus:
      Check(result == 1 && detail == 0, "commands 9 and 10 codes");
      break;
    case kCommandReadStatus:
      Check(detail == 0 && (result <= 8 || result == ERROR_INVALID_PARAMETER), "command 11 codes");
      Check(!noDrives || result == ERROR_INVALID_PARAMETER, "command 11 found a drive");
      break;
    case kCommandWriteControl:
      Check(detail == 0 && (result < 0x4000 || result == 0xFFFFFFFFu), "command 12 codes");
      Check(!noDrives || result == ERROR_INVALID_PARAMETER, "command 12 found a drive");
      break;
    case kCommandRegistry:
      Check(result < 0x4000, "command 13 result is no registry code");
      Check(detail == registryLength, "command 13 detail is not the data length");
      break;
    default:
      Check(result == kCommandUnknownResult && detail == kCommandUnknownResult, "unknown code");
      break;
  }
}

}  // namespace

void Check(bool condition, const char* what) {
  if (!condition) {
    std::fprintf(stderr, "command channel fuzz invariant violated: %s\n", what);
    std::abort();
  }
}

void UsePrivateEmulation(const char* tag) {
  const std::string stem = std::string(tag) + "-" + std::to_string(getpid());
  setenv("SKYVANE_NAMESPACE", stem.c_str(), 0);
  if (std::getenv("SKYVANE_REGISTRY") == nullptr) {
    privateRegistry = std::filesystem::temp_directory_path() / stem;
    std::filesystem::create_directories(privateRegistry);
    setenv("SKYVANE_REGISTRY", (privateRegistry / "registry").c_str(), 1);
    std::atexit(RemovePrivateRegistry);
  }
  setenv("SKYVANE_TIME_SCALE", "0.001", 0);
}

StateBlock* SetUpMonitor(bool withMapping) {
  InitializeProcessLocks();
  auto* block = static_cast<StateBlock*>(std::calloc(1, sizeof(StateBlock)));
  monitorState = MonitorState{};
  monitorState.tick = 1;
  monitorState.osKind = kOsXpOrLater;
  monitorState.stateBlock = block;
  monitorState.stateMutex = CreateMutexW(nullptr, FALSE, nullptr);
  if (withMapping) {
    monitorState.fileMapping = CreateFileMappingW(INVALID_HANDLE_VALUE, nullptr, PAGE_READWRITE, 0,
                                                  kStateBlockSize, nullptr);
  }
  monitorState.pipeStopEvent = CreateEventW(nullptr, FALSE, FALSE, nullptr);
  monitorState.stopEvent = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  monitorState.workerStopEvent = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  Check(block != nullptr && monitorState.stateMutex != nullptr &&
            (monitorState.fileMapping != nullptr || !withMapping) &&
            monitorState.pipeStopEvent != nullptr,
        "set-up");
  return block;
}

void KeepRegistrySmall() {
  const char* store = std::getenv("SKYVANE_REGISTRY");
  if (store == nullptr) return;
  std::error_code ignored;
  const std::uintmax_t size = std::filesystem::file_size(store, ignored);
  if (!ignored && size > 4096) std::filesystem::remove(store, ignored);
}

RecordingComputer::RecordingComputer(std::unique_ptr<sim::Machine> machine)
    : machine_(std::move(machine)) {
  machine_->Install();  // answers every device call but opens, which come here
  emu::SetDeviceProvider(this);
}

std::vector<std::u16string> RecordingComputer::TakeOpened() {
  std::lock_guard<std::mutex> lock(mutex_);
  std::vector<std::u16string> taken;
  taken.swap(opened_);
  return taken;
}

std::unique_ptr<emu::DeviceFile> RecordingComputer::Open(const WCHAR* path, DWORD access,
                                                         DWORD share, DWORD flags, DWORD* error) {
  {
    std::lock_guard<std::mutex> lock(mutex_);
    opened_.emplace_back(path);
  }
  return machine_->Open(path, access, share, flags, error);
}

void CheckReply(const std::uint8_t* original, std::size_t received, const std::uint8_t* reply,
                std::size_t length, bool paused, bool noDrives) {
  const std::uint64_t declared = ReadAt(original, received, offsetof(CommandMessage, length), 8);
  const bool inRange = declared >= kCommandMinLength && declared <= kCommandMaxLength;
  Check(length == (inRange ? declared : 0), "reply length");
  if (length == 0) return;

  const auto command =
      static_cast<std::uint32_t>(ReadAt(original, received, offsetof(CommandMessage, command), 4));
  // Result and detail; the status block for 11; a query's reply for 13.
  const std::size_t status = offsetof(CommandMessage, statusBlock);
  const std::size_t registry = kRegistryRequestOffset;
  const bool query = command == kCommandRegistry &&
                     ReadAt(original, received, registry + offsetof(RegistryRequest, operation),
                            4) == kRegistryQuery;
  const std::uint64_t nameOffset =
      ReadAt(original, received, registry + offsetof(RegistryRequest, nameOffset), 8);
  const std::uint64_t dataOffset =
      ReadAt(original, received, registry + offsetof(RegistryRequest, dataOffset), 8);
  const std::uint64_t dataLength =
      ReadAt(original, received, registry + offsetof(RegistryRequest, dataLength), 4);
  std::uint64_t dataBegin = 0;
  std::uint64_t dataEnd = 0;
  if (nameOffset < kCommandMaxLength && dataOffset < kCommandMaxLength) {
    dataBegin = registry + kRegistryPathOffset + nameOffset + dataOffset;
    dataEnd = dataBegin + dataLength;
  }
  // What arrived, zero beyond it, the reply's bytes where the command writes.
  static std::uint8_t expected[kCommandMaxLength];
  std::memset(expected, 0, length);
  std::memcpy(expected, original, std::min(received, length));
  const auto allow = [&](std::uint64_t begin, std::uint64_t end) {
    end = std::min<std::uint64_t>(end, length);
    if (begin < end) std::memcpy(expected + begin, reply + begin, end - begin);
  };
  allow(offsetof(CommandMessage, result), offsetof(CommandMessage, resultSlot));
  if (command == kCommandReadStatus) allow(status, status + 8);
  if (query) {
    allow(registry + offsetof(RegistryRequest, dataLength),
          registry + offsetof(RegistryRequest, operation));
    allow(dataBegin, dataEnd);
  }
  if (std::memcmp(expected, reply, length) != 0) {
    std::size_t i = 0;
    while (expected[i] == reply[i]) ++i;
    std::fprintf(stderr, "command %u: reply byte %zu is %02x, %02x expected\n", command, i,
                 reply[i], expected[i]);
    Check(false, "reply byte the command does not write was changed");
  }
  std::uint32_t result = 0;
  std::uint32_t detail = 0;
  std::uint32_t registryLength = 0;
  std::memcpy(&result, reply + offsetof(CommandMessage, result), 4);
  std::memcpy(&detail, reply + offsetof(CommandMessage, detail), 4);
  std::memcpy(&registryLength, reply + registry + offsetof(RegistryRequest, dataLength), 4);
  CheckCodes(command, result, detail, registryLength, paused, noDrives);
}

}  // namespace fuzzsupport
