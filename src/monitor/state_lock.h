// Scoped ownership of the global state mutex: waits without time-out,
// releases in the destructor. The mutex is recursive, so an owner may nest.
#pragma once

#include "monitor/monitor_state.h"
#include "platform/win32.h"

class StateLock {
 public:
  StateLock() { WaitForSingleObject(monitorState.stateMutex, INFINITE); }
  ~StateLock() { ReleaseMutex(monitorState.stateMutex); }
  StateLock(const StateLock&) = delete;
  StateLock& operator=(const StateLock&) = delete;
};
