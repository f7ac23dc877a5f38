// The monitor state RunMonitor would set up (mutex, working block, unnamed
// mapping) for code that calls single functions: the monitor unit tests and
// the publish figure of the benchmark. No test framework here.
#pragma once

#include <cstdlib>

#include "monitor/monitor_state.h"
#include "platform/win32.h"
#include "service/process_locks.h"

// True when the mutex, the block and the mapping were all created.
inline bool OpenMonitorState() {
  InitializeProcessLocks();
  monitorState = MonitorState{};
  monitorState.stateMutex = CreateMutexW(nullptr, FALSE, nullptr);
  monitorState.stateBlock = static_cast<StateBlock*>(std::calloc(1, sizeof(StateBlock)));
  monitorState.fileMapping = CreateFileMappingW(INVALID_HANDLE_VALUE, nullptr, PAGE_READWRITE, 0,
                                                kStateBlockSize, nullptr);
  return monitorState.stateMutex != nullptr && monitorState.stateBlock != nullptr &&
         monitorState.fileMapping != nullptr;
}

inline void CloseMonitorState() {
  CloseStateMapping();
  if (monitorState.stateMutex != nullptr) CloseHandle(monitorState.stateMutex);
  std::free(monitorState.stateBlock);
  monitorState = MonitorState{};
}
