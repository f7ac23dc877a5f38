// Scoped ownership of the global state mutex: waits without time-out,
// releases in the destructor. The mutex is recursive, so an owner may nest.
// The guard keeps the handle it waited on and releases that one, and only
// when the wait gave it ownership: the global may be closed and cleared
// while the guard is alive.
#pragma once

#include <atomic>

#include "monitor/monitor_state.h"
#include "platform/win32.h"

class StateLock {
 public:
  StateLock() : mutex_(std::atomic_ref<HANDLE>(monitorState.stateMutex).load()) {
    const DWORD wait = mutex_ != nullptr ? WaitForSingleObject(mutex_, INFINITE) : WAIT_FAILED;
    owned_ = wait == WAIT_OBJECT_0 || wait == WAIT_ABANDONED;
  }
  ~StateLock() {
    if (owned_) ReleaseMutex(mutex_);
  }
  StateLock(const StateLock&) = delete;
  StateLock& operator=(const StateLock&) = delete;
  bool Owned() const { return owned_; }

 private:
  HANDLE mutex_;
  bool owned_;
};
