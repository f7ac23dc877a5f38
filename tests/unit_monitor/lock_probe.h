// Whether a call, run on a thread of its own, waits for a lock that the test
// holds: it must not return within 200 ms (real time), and must once `release`
// (which runs in every case) gives the lock up.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <cstdlib>
#include <functional>
#include <future>
#include <thread>

#include "monitor/monitor_state.h"
#include "platform/win32.h"

namespace lockprobe {

inline ::testing::AssertionResult WaitsForTheHeldLock(const std::function<void()>& call,
                                                      const std::function<void()>& release) {
  std::promise<void> returned;
  std::future<void> done = returned.get_future();
  std::thread caller([&] {
    call();
    returned.set_value();
  });
  const bool waited = done.wait_for(std::chrono::milliseconds(200)) == std::future_status::timeout;
  release();
  if (done.wait_for(std::chrono::seconds(60)) != std::future_status::ready) {
    std::abort();  // the call never returned; its thread cannot be joined
  }
  caller.join();
  if (waited) return ::testing::AssertionSuccess();
  return ::testing::AssertionFailure() << "returned while the lock was held";
}

inline ::testing::AssertionResult WaitsForTheStateMutex(const std::function<void()>& call) {
  if (WaitForSingleObject(monitorState.stateMutex, INFINITE) != WAIT_OBJECT_0) {
    return ::testing::AssertionFailure() << "cannot take the state mutex";
  }
  return WaitsForTheHeldLock(call, [] { ReleaseMutex(monitorState.stateMutex); });
}

inline ::testing::AssertionResult WaitsForTheSection(CRITICAL_SECTION* section,
                                                     const std::function<void()>& call) {
  EnterCriticalSection(section);
  return WaitsForTheHeldLock(call, [section] { LeaveCriticalSection(section); });
}

}  // namespace lockprobe
