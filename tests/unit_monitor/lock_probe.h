// Whether a call waits for a lock that the calling test holds: run on a thread
// of its own, it must not return within 200 ms (real time) and must return
// once the lock is given up; a call that skips the lock fails the check.
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

// `release` gives up the lock this thread holds; it runs in every case.
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

// The same for the state mutex, or one of the process's critical sections.
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
