// Ownership of the global state mutex. Any program may open the named
// mutex and keep it, so a wait for it must not keep a stop from ending:
// while the service runs the wait has no time-out; once the stop event is
// signalled it is bounded by kStopLockLimitMs, longer than any hold of the
// service's own threads during a stop (their transfers end on the stop too).
// Only a program that keeps the mutex makes such a wait end without it.
#pragma once

#include <atomic>

#include "monitor/monitor_state.h"
#include "platform/win32.h"

inline constexpr DWORD kStopLockLimitMs = 30000;
// Set when a wait after the stop ended without the mutex: later waits of the
// same stop only try it, so that the stop does not pay the limit at every
// step. RunMonitor clears it.
inline std::atomic<bool> stateMutexKept{false};

// Waits for `mutex` as above; true when the caller now owns it.
inline bool TakeStateMutex(HANDLE mutex) {
  if (mutex == nullptr) return false;
  const HANDLE stop = std::atomic_ref<HANDLE>(monitorState.stopEvent).load();
  const HANDLE waits[2] = {mutex, stop};
  DWORD wait = WaitForMultipleObjects(stop != nullptr ? 2 : 1, waits, FALSE, INFINITE);
  if (wait == WAIT_OBJECT_0 + 1) {
    wait = WaitForSingleObject(mutex, stateMutexKept ? 0 : kStopLockLimitMs);
    if (wait == WAIT_TIMEOUT) stateMutexKept = true;
  }
  return wait == WAIT_OBJECT_0 || wait == WAIT_ABANDONED_0;
}

// Scoped ownership: the guard keeps the handle it waited on and releases
// that one, and only when the wait gave it ownership (the global may be
// closed and cleared while the guard is alive). The mutex is recursive, so
// an owner may nest.
class StateLock {
 public:
  StateLock()
      : mutex_(std::atomic_ref<HANDLE>(monitorState.stateMutex).load()),
        owned_(TakeStateMutex(mutex_)) {}
  ~StateLock() {
    if (owned_) ReleaseMutex(mutex_);
  }
  StateLock(const StateLock&) = delete;
  StateLock& operator=(const StateLock&) = delete;
  bool Owned() const { return owned_; }
  // The mutex exists but the wait ended without it (kept by another program
  // past a stop): the block must not be written to the mapping.
  bool Lost() const { return mutex_ != nullptr && !owned_; }

 private:
  HANDLE mutex_;
  bool owned_;
};
