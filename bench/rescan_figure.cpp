// A full rescan of a simulated machine with 63 drives (host build only).
//
// The rescan waits as the service prescribes (the monitor's tick before it
// acts, the workers' 100 ms wait slices while they stop, their start), so
// it is measured in a child process whose time scale is 0.001: each of those
// waits shrinks to at most a few milliseconds, and what remains is the work
// of the rescan itself (enumeration, channel scan, worker start and binding).
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "figures.h"
#include "machine.h"
#include "monitor/monitor_state.h"
#include "monitor/state_lock.h"
#include "service/process_locks.h"
#include "service/service_host.h"

extern char** environ;

namespace bench {
namespace {

constexpr int kDrives = 63;

std::unique_ptr<sim::Machine> MachineWithDrives(int count) {
  auto machine = std::make_unique<sim::Machine>();
  for (int i = 0; i < count; ++i) {
    sim::DriveSpec spec;
    spec.name = "d" + std::to_string(i);
    char serial[32];
    std::snprintf(serial, sizeof(serial), "QX-%08d", 10000000 + i);
    spec.serial = serial;
    spec.busAddress = static_cast<std::uint32_t>(i + 1);
    if (i < 20) {
      sim::VolumeSpec volume;
      volume.letter = static_cast<char>('E' + i);
      spec.volumes.push_back(volume);
    }
    machine->AddDrive(spec);
  }
  return machine;
}

DWORD RescanCount() {
  StateLock lock;
  return monitorState.rescanCount;
}

bool WaitForRescans(DWORD count) {
  for (int i = 0; i < 600000 && RescanCount() < count; ++i) Sleep(0);
  return RescanCount() >= count;
}

}  // namespace

// In the child: prints the median rescan time in milliseconds.
int RunRescanChild(bool quick) {
  InitializeProcessLocks();
  debugMode = true;
  auto machine = MachineWithDrives(kDrives);
  machine->SetDeviceEventSink([](DWORD, const void*) {});
  machine->Install();
  std::thread monitor([] { RunMonitor(0, nullptr); });
  std::vector<double> samples;
  bool ok = WaitForRescans(1);
  for (int i = 0; ok && i < (quick ? 3 : 20); ++i) {
    const DWORD before = RescanCount();
    const double start = NowMicros();
    {
      StateLock lock;
      RequestRefresh();
    }
    ok = WaitForRescans(before + 1);
    samples.push_back((NowMicros() - start) / 1000.0);
  }
  StopMonitor();
  monitor.join();
  machine->WaitForDeviceEvents();
  machine->Uninstall();
  if (!ok) return 1;
  std::printf("%.3f\n", Percentile(samples, 50));
  return 0;
}

void MeasureRescan(const Options& options, const char* self, std::vector<Figure>& figures) {
  int out[2];
  if (pipe(out) != 0) return;
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, out[1], 1);
  posix_spawn_file_actions_addclose(&actions, out[0]);
  std::vector<std::string> variables;
  for (char** entry = environ; *entry != nullptr; ++entry) {
    std::string text = *entry;
    if (text.rfind("SKYVANE_TIME_SCALE=", 0) != 0 && text.rfind("SKYVANE_NAMESPACE=", 0) != 0) {
      variables.push_back(text);
    }
  }
  variables.push_back("SKYVANE_TIME_SCALE=0.001");
  variables.push_back("SKYVANE_NAMESPACE=bench-rescan-" + std::to_string(getpid()));
  std::vector<char*> envp;
  for (std::string& v : variables) envp.push_back(v.data());
  envp.push_back(nullptr);
  std::string path = self;
  std::string flag = options.quick ? "--rescan-child-quick" : "--rescan-child";
  char* argv[] = {path.data(), flag.data(), nullptr};
  pid_t pid = 0;
  const bool started = posix_spawn(&pid, "/proc/self/exe", &actions, nullptr, argv, envp.data()) == 0;
  posix_spawn_file_actions_destroy(&actions);
  close(out[1]);
  std::string text;
  char buffer[64];
  ssize_t got;
  while ((got = read(out[0], buffer, sizeof(buffer))) > 0) text.append(buffer, static_cast<std::size_t>(got));
  close(out[0]);
  int status = 0;
  if (!started || waitpid(pid, &status, 0) != pid || !WIFEXITED(status) ||
      WEXITSTATUS(status) != 0 || text.empty()) {
    std::fprintf(stderr, "the rescan measurement failed\n");
    return;
  }
  figures.push_back({"rescan of 63 drives (time scale 0.001), median", "ms", std::atof(text.c_str()),
                     "", 0});
}

}  // namespace bench
