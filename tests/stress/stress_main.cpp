// Stop/start cycles of the whole service on the default machine under device
// faults, presses, attach/detach loops and pipe clients. Each stop must end in
// its limit, leave no handle or thread, and leave a sane block.
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "machine.h"
#include "monitor/monitor_state.h"
#include "pipe/pipe_client.h"
#include "platform/diagnostics.h"
#include "service/process_locks.h"
#include "service/service_host.h"
#include "transport/io_block.h"

namespace {

using Clock = std::chrono::steady_clock;

struct Options {
  int cycles = 20;
  int runMs = 300;
  int stopLimitMs = 3000;
  bool heldCancels = true;  // faults whose cancel completes only when released
  unsigned seed = 1;
};

const char* const kDrives[] = {"gauge", "plain", "firewire", "enclosure"};
const sim::Endpoint kEndpoints[] = {sim::Endpoint::Disk, sim::Endpoint::Hid, sim::Endpoint::Driver,
                                    sim::Endpoint::Enclosure};

struct Totals {
  int cycles = 0;
  int failed = 0;  // cycles with a slow stop, a leak or an insane last block
  long maxStopMs = 0;
};

DWORD Pick(std::mt19937& random, DWORD n) {
  return static_cast<DWORD>(random() % n);
}

std::atomic<bool> chaosRunning{false};
std::atomic<long> exchanges{0};

// The first published drive's record, for commands 11 and 12.
void FirstPublishedDrive(HANDLE mapping, BYTE* image) {
  const auto* block =
      static_cast<const StateBlock*>(MapViewOfFile(mapping, FILE_MAP_READ, 0, 0, kStateBlockSize));
  if (block == nullptr) return;
  if (block->publishedCount > 0) std::memcpy(image, &block->published[0], kDriveImageSize);
  UnmapViewOfFile(block);
}

// Streams commands 1, 2, 6 (suspend, resume), 7/8, 9, 11, 12 and 13.
void PipeClient(unsigned seed, HANDLE mapping) {
  std::mt19937 random(seed);
  auto request = std::make_unique<CommandMessage>();
  auto reply = std::make_unique<CommandMessage>();
  while (chaosRunning) {
    HANDLE pipe = OpenCommandPipe(200);
    if (pipe == INVALID_HANDLE_VALUE) {
      Sleep(5);
      continue;
    }
    for (int n = 0; n < 20 && chaosRunning; ++n) {
      switch (Pick(random, 10)) {
        case 0:
        case 1:
          InitCommand(request.get(), Pick(random, 2) ? kCommandSafeRemove : kCommandReleaseDrive,
                      Pick(random, 4));
          break;
        case 2:
          InitCommand(request.get(), kCommandForwardMessage, 0x218, Pick(random, 2) ? 4 : 7);
          break;
        case 3:
          InitCommand(request.get(), Pick(random, 2) ? kCommandPause : kCommandResume);
          break;
        case 4:
        case 5:
          InitCommand(request.get(), kCommandRefreshGauges, Pick(random, 4), 1 + Pick(random, 3));
          break;
        case 6:
        case 7: {
          const DWORD command = Pick(random, 2) ? kCommandReadStatus : kCommandWriteControl;
          InitCommand(request.get(), command);
          FirstPublishedDrive(mapping, request->driveImage);
          break;
        }
        default:
          InitCommand(request.get(), kCommandRegistry);
          LayOutRegistryRequest(request.get(), RootKeyValue(HKEY_LOCAL_MACHINE),
                                WSTR("SOFTWARE\\Microsoft\\Windows NT\\CurrentVersion"),
                                WSTR("ProductName"), kRegistryQuery, 0, nullptr, 64);
          break;
      }
      DWORD length = 0;
      if (!ExchangeCommand(pipe, request.get(), sizeof(CommandMessage), reply.get(),
                           sizeof(CommandMessage), &length)) {
        break;
      }
      exchanges += 1;
    }
    CloseHandle(pipe);
  }
}

// Presses, attach/detach loops and device faults, changed every few ms.
void DeviceChaos(unsigned seed, sim::Machine* machine, bool heldCancels) {
  std::mt19937 random(seed);
  static const BYTE kPresses[] = {0x01, 0x02, 0x04};
  static const DWORD kVanish[] = {ERROR_INVALID_HANDLE, ERROR_DEVICE_NOT_CONNECTED,
                                  ERROR_DEV_NOT_EXIST};
  while (chaosRunning) {
    const std::string drive = kDrives[Pick(random, 4)];
    const sim::Endpoint endpoint = kEndpoints[Pick(random, 4)];
    switch (Pick(random, 8)) {
      case 0:
      case 1:
        machine->Press(drive, kPresses[Pick(random, 3)]);
        break;
      case 2:
        if (machine->Attached(drive)) machine->Detach(drive, kVanish[Pick(random, 3)]);
        break;
      case 3:
        if (!machine->Attached(drive)) machine->Attach(drive);
        break;
      case 4:
        machine->HangIo(drive, endpoint, Pick(random, 2) == 0);
        break;
      case 5:
        machine->SetCancelDelay(drive, endpoint,
                                heldCancels && Pick(random, 4) == 0 ? INFINITE : 50);
        break;
      case 6:
        machine->FailIo(drive, endpoint, kVanish[Pick(random, 3)],
                        static_cast<int>(1 + Pick(random, 3)));
        break;
      default:
        machine->ClearFaults();
        break;
    }
    Sleep(5 + Pick(random, 20));
  }
}

// The block the stopped service left in the mapping is sane.
bool SaneLastBlock(HANDLE mapping, std::string* why) {
  const auto* block =
      static_cast<const StateBlock*>(MapViewOfFile(mapping, FILE_MAP_READ, 0, 0, kStateBlockSize));
  if (block == nullptr) {
    *why = "mapping";
    return false;
  }
  bool sane = true;
  auto check = [&](bool ok, const char* what) {
    if (!ok && sane) *why = what;
    sane = sane && ok;
  };
  check(block->statusWord == kStatusStopping, "statusWord is not 500");
  check(block->driveCount >= 0 && block->driveCount <= kMaxDrives, "driveCount");
  check(block->channelCount >= 0 && block->channelCount <= kMaxChannels, "channelCount");
  check(block->publishedCount >= 0 && block->publishedCount <= block->driveCount, "publishedCount");
  for (LONG p = 0; p < block->publishedCount && p < kMaxDrives; ++p) {
    const DriveRecord& drive = block->published[p];
    check(drive.statusCode <= 8 && drive.statusCode != 4, "published statusCode");
    check(drive.statusLevel >= -1 && drive.statusLevel <= 3, "published statusLevel");
  }
  for (int i = 0; i < kMaxDrives; ++i) {
    check(block->drives[i].modelSuffixRef == nullptr &&
              block->drives[i].productLineRef == nullptr &&
              block->published[i].modelSuffixRef == nullptr &&
              block->published[i].productLineRef == nullptr,
          "row reference");
  }
  UnmapViewOfFile(block);
  return sane;
}

// Waits (real time) until the emulation's counts are back to the baseline.
bool CountsSettle(long handles, long threads) {
  const auto deadline = Clock::now() + std::chrono::seconds(5);
  while (platform::LiveHandleCount() != handles || platform::LiveThreadCount() != threads) {
    if (Clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
  return true;
}

std::atomic<bool> monitorDone{false};

void RunCycle(const Options& options, sim::Machine* machine, HANDLE mapping, std::mt19937& random,
              Totals* totals) {
  const long handles = platform::LiveHandleCount();
  const long threads = platform::LiveThreadCount();
  monitorDone = false;
  std::thread monitor([] {
    RunMonitor(0, nullptr);
    monitorDone = true;
  });
  chaosRunning = true;
  std::vector<std::thread> clients;
  clients.emplace_back(PipeClient, random(), mapping);
  clients.emplace_back(PipeClient, random(), mapping);
  std::thread devices(DeviceChaos, random(), machine, options.heldCancels);
  // Some stops come at once, before the monitor has even started.
  const int runMs = Pick(random, 5) == 0
                        ? 0
                        : static_cast<int>(Pick(random, static_cast<DWORD>(options.runMs) + 1));
  std::this_thread::sleep_for(std::chrono::milliseconds(runMs));

  const auto stopAt = Clock::now();
  StopMonitor();
  bool released = false;
  while (!monitorDone) {
    const auto waited = Clock::now() - stopAt;
    if (!released && waited > std::chrono::milliseconds(options.stopLimitMs)) {
      // Over the limit: see whether releasing held cancels ends it.
      chaosRunning = false;
      devices.join();
      machine->ClearFaults();
      machine->FinishHeldCancels();
      released = true;
    }
    if (waited > std::chrono::seconds(60)) {
      std::fprintf(stderr, "cycle %d: the service did not stop\n", totals->cycles);
      std::fflush(nullptr);
      std::abort();
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  const long stopMs = static_cast<long>(
      std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - stopAt).count());
  monitor.join();
  chaosRunning = false;
  if (devices.joinable()) devices.join();
  for (std::thread& t : clients) t.join();

  totals->maxStopMs = std::max(totals->maxStopMs, stopMs);
  bool failed = stopMs > options.stopLimitMs;
  if (failed) {
    std::fprintf(stderr, "cycle %d: stop took %ld ms%s\n", totals->cycles, stopMs,
                 released ? " (ended after held cancels were released)" : "");
  }
  std::string why;
  if (!SaneLastBlock(mapping, &why)) {
    failed = true;
    std::fprintf(stderr, "cycle %d: last block: %s\n", totals->cycles, why.c_str());
  }
  machine->ClearFaults();
  machine->FinishHeldCancels();
  for (const char* drive : kDrives) {
    if (!machine->Attached(drive)) machine->Attach(drive);
  }
  machine->WaitForDeviceEvents();
  // Requests set aside after their cancel grace completed only now; the
  // service would free them on its next run, so the harness does.
  FreeSetAsideIoBlocks();
  if (!CountsSettle(handles, threads)) {
    failed = true;
    std::fprintf(stderr, "cycle %d: handles %ld -> %ld, threads %ld -> %ld\n", totals->cycles,
                 handles, platform::LiveHandleCount(), threads, platform::LiveThreadCount());
  }
  totals->failed += failed ? 1 : 0;
  totals->cycles += 1;
}

bool ParseOptions(int argc, char** argv, Options* options) {
  for (int i = 1; i < argc; ++i) {
    const std::string word = argv[i];
    if (word == "--no-held-cancels") {
      options->heldCancels = false;
      continue;
    }
    int* number = word == "--cycles"          ? &options->cycles
                  : word == "--run-ms"        ? &options->runMs
                  : word == "--stop-limit-ms" ? &options->stopLimitMs
                                              : nullptr;
    if (i + 1 == argc || (number == nullptr && word != "--seed")) return false;
    const unsigned long value = std::strtoul(argv[++i], nullptr, 10);
    if (number != nullptr) {
      *number = static_cast<int>(value);
    } else {
      options->seed = static_cast<unsigned>(value);
    }
  }
  return options->cycles > 0 && options->runMs >= 0 && options->stopLimitMs > 0;
}

}  // namespace

int main(int argc, char** argv) {
  Options options;
  if (!ParseOptions(argc, argv, &options)) {
    std::fprintf(stderr,
                 "usage: stress [--cycles N] [--run-ms MS] [--stop-limit-ms MS] "
                 "[--no-held-cancels] [--seed S]\n");
    return 2;
  }
  // A namespace of its own, so a killed run leaves nothing shared behind.
  if (std::getenv("SKYVANE_NAMESPACE") == nullptr) {
    const std::string name = "stress-" + std::to_string(static_cast<long>(getpid()));
    setenv("SKYVANE_NAMESPACE", name.c_str(), 1);
  }
  InitializeProcessLocks();
  debugMode = true;
  std::string error;
  std::unique_ptr<sim::Machine> machine = sim::LoadMachine(sim::DefaultMachineText(), &error);
  if (machine == nullptr) {
    std::fprintf(stderr, "machine: %s\n", error.c_str());
    return 2;
  }
  machine->SetDeviceEventSink([](DWORD, const void*) {});
  machine->Install();
  // Held open across cycles, so that the block each stop leaves can be read.
  HANDLE mapping = CreateFileMappingW(INVALID_HANDLE_VALUE, nullptr, PAGE_READWRITE, 0,
                                      kStateBlockSize, kFileMapName);
  if (mapping == nullptr) return 2;

  std::mt19937 random(options.seed);
  Totals totals;
  const auto begin = Clock::now();
  for (int i = 0; i < options.cycles; ++i) {
    RunCycle(options, machine.get(), mapping, random, &totals);
  }
  const long seconds = static_cast<long>(
      std::chrono::duration_cast<std::chrono::seconds>(Clock::now() - begin).count());
  CloseHandle(mapping);
  machine->WaitForDeviceEvents();
  machine->Uninstall();

  std::printf("stress: %d cycles in %ld s, %ld exchanges, longest stop %ld ms; failed cycles: %d\n",
              totals.cycles, seconds, static_cast<long>(exchanges), totals.maxStopMs,
              totals.failed);
  return totals.failed == 0 ? 0 : 1;
}
