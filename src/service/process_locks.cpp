#include "service/process_locks.h"

CRITICAL_SECTION passThroughLock;
CRITICAL_SECTION workerStopLock;
CRITICAL_SECTION rescanLock;
CRITICAL_SECTION serviceStatusLock;
CRITICAL_SECTION deviceEventLock;

void InitializeProcessLocks() {
  static const bool initialized = [] {
    InitializeCriticalSection(&passThroughLock);
    InitializeCriticalSection(&workerStopLock);
    InitializeCriticalSection(&rescanLock);
    InitializeCriticalSection(&serviceStatusLock);
    InitializeCriticalSection(&deviceEventLock);
    return true;
  }();
  (void)initialized;
}
