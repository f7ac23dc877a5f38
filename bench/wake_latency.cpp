// Wake-up latency of a wait: SetEvent on one event to the moment its waiting
// thread runs, while 64 other threads wait on events of their own.
#include <atomic>
#include <vector>

#include "figures.h"
#include "platform/win32.h"

namespace bench {
namespace {

constexpr int kBystanders = 64;

struct Shared {
  HANDLE target = nullptr;
  HANDLE ack = nullptr;
  HANDLE quit = nullptr;
  std::atomic<double> wokenAt{0.0};
};

DWORD WINAPI Bystander(LPVOID event) {
  WaitForSingleObject(static_cast<HANDLE>(event), INFINITE);
  return 0;
}

DWORD WINAPI Responder(LPVOID argument) {
  auto* shared = static_cast<Shared*>(argument);
  HANDLE both[2] = {shared->quit, shared->target};
  while (WaitForMultipleObjects(2, both, FALSE, INFINITE) == WAIT_OBJECT_0 + 1) {
    shared->wokenAt.store(NowMicros());
    SetEvent(shared->ack);
  }
  return 0;
}

}  // namespace

void MeasureWakeLatency(const Options& options, std::vector<Figure>& figures) {
  std::vector<HANDLE> events;
  std::vector<HANDLE> threads;
  for (int i = 0; i < kBystanders; ++i) {
    events.push_back(CreateEventW(nullptr, TRUE, FALSE, nullptr));
    threads.push_back(CreateThread(nullptr, 0, Bystander, events.back(), 0, nullptr));
  }
  Shared shared;
  shared.target = CreateEventW(nullptr, FALSE, FALSE, nullptr);
  shared.ack = CreateEventW(nullptr, FALSE, FALSE, nullptr);
  shared.quit = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  HANDLE responder = CreateThread(nullptr, 0, Responder, &shared, 0, nullptr);
  const int rounds = options.quick ? 200 : 5000;
  std::vector<double> samples;
  samples.reserve(static_cast<std::size_t>(rounds));
  for (int i = 0; i < rounds; ++i) {
    Sleep(0);  // let the responder reach its wait
    const double start = NowMicros();
    SetEvent(shared.target);
    WaitForSingleObject(shared.ack, INFINITE);
    samples.push_back(shared.wokenAt.load() - start);
  }
  SetEvent(shared.quit);
  WaitForSingleObject(responder, INFINITE);
  for (HANDLE event : events) SetEvent(event);
  for (HANDLE thread : threads) {
    WaitForSingleObject(thread, INFINITE);
    CloseHandle(thread);
  }
  for (HANDLE event : events) CloseHandle(event);
  for (HANDLE h : {responder, shared.target, shared.ack, shared.quit}) CloseHandle(h);
  figures.push_back({"wake-up latency p50 (64 other waiters)", "us", Percentile(samples, 50), "", 0});
  figures.push_back({"wake-up latency p99 (64 other waiters)", "us", Percentile(samples, 99), "", 0});
}

}  // namespace bench
