// The monitor state RunMonitor would set up, for the unit tests and the
// benchmark's publish figure. No test framework here.
#pragma once

#include <cstdlib>

#include "monitor/monitor_state.h"
#include "platform/win32.h"
#include "service/process_locks.h"

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
