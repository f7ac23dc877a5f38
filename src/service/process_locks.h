// The process-wide critical sections, initialised at process start before
// any other thread runs and never deleted. Lock order: (rescan lock,) worker-stop
// lock, then the state mutex, then the pass-through lock.
#pragma once

#include "platform/win32.h"

// Serialises INQUIRY, VPD INQUIRY and diagnostic pass-through transfers.
extern CRITICAL_SECTION passThroughLock;
// Serialises stopping the channel workers.
extern CRITICAL_SECTION workerStopLock;
// Makes each status report one whole rewrite of the record plus its send,
// between the control handler and the monitor. Taken last; nothing inside.
extern CRITICAL_SECTION serviceStatusLock;
// Keeps two full rescans (monitor thread, forwarded resume on the pipe
// thread) from overlapping. Taken before every other lock.
extern CRITICAL_SECTION rescanLock;
// Keeps a device event out of the monitor while it starts or ends; held
// while the event is handled, so taken before the state mutex.
extern CRITICAL_SECTION deviceEventLock;

// Holds a critical section for a scope.
class SectionLock {
 public:
  explicit SectionLock(CRITICAL_SECTION* section) : section_(section) {
    EnterCriticalSection(section_);
  }
  ~SectionLock() { LeaveCriticalSection(section_); }
  SectionLock(const SectionLock&) = delete;
  SectionLock& operator=(const SectionLock&) = delete;

 private:
  CRITICAL_SECTION* section_;
};

// Initialises both locks; later calls do nothing (tests start the service
// many times in one process).
void InitializeProcessLocks();
