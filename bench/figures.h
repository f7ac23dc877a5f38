// One measured figure of the benchmark, and the shared helpers to take them.
#pragma once

#include <algorithm>
#include <chrono>
#include <cstddef>
#include <string>
#include <vector>

namespace bench {

struct Figure {
  std::string name;
  std::string unit;
  double value;
  // The floor this figure is compared with ("" when none), and the ratio.
  std::string floorName;
  double ratio = 0.0;
};

struct Options {
  bool quick = false;  // CI's short mode: few iterations, only proving it works
  std::string service;  // the service executable; empty: no service figures
};

inline double NowMicros() {
  using Clock = std::chrono::steady_clock;
  return std::chrono::duration<double, std::micro>(Clock::now().time_since_epoch()).count();
}

// The p-th percentile (0..100) of `samples` (sorted in place).
inline double Percentile(std::vector<double>& samples, double p) {
  if (samples.empty()) return 0.0;
  std::sort(samples.begin(), samples.end());
  auto index = static_cast<std::size_t>(p / 100.0 * static_cast<double>(samples.size() - 1) + 0.5);
  return samples[std::min(index, samples.size() - 1)];
}

// The kernel's wake-up latency: one event signalled while 64 other threads
// wait on other events; the time until its waiter runs, p50 and p99.
void MeasureWakeLatency(const Options& options, std::vector<Figure>& figures);

// The floor: a message-mode pipe echo of 9,896 bytes plus one copy of the
// 1,215,512-byte block, in this process. Returns its p50 in microseconds.
double MeasureFloor(const Options& options, std::vector<Figure>& figures);

// Command 10 and command 13 round trips against the running service, as
// ratios to `floor`. False when the service did not answer.
bool MeasureCommands(const Options& options, double floor, std::vector<Figure>& figures);

// One forced publish of the block through the kept view.
void MeasurePublish(const Options& options, double floor, std::vector<Figure>& figures);

// A full rescan of a simulated machine with 63 drives, measured in a child
// process (`self` is this program) at time scale 0.001 (host build only).
void MeasureRescan(const Options& options, const char* self, std::vector<Figure>& figures);
int RunRescanChild(bool quick);

// Starts the service, waits for it to be ready, takes the command figures,
// its idle CPU and its resident memory, and stops it. False on failure.
bool MeasureService(const Options& options, double floor, std::vector<Figure>& figures);

}  // namespace bench
