// A monitor state with its mutex, working block and an unnamed mapping, as
// RunMonitor would set them up, for cases that call single functions.
#pragma once

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>

#include "monitor/monitor_state.h"
#include "platform/win32.h"
#include "service/process_locks.h"

class MonitorFixture : public ::testing::Test {
 protected:
  void SetUp() override {
    InitializeProcessLocks();
    monitorState = MonitorState{};
    monitorState.stateMutex = CreateMutexW(nullptr, FALSE, nullptr);
    monitorState.stateBlock = static_cast<StateBlock*>(std::calloc(1, sizeof(StateBlock)));
    monitorState.fileMapping = CreateFileMappingW(INVALID_HANDLE_VALUE, nullptr, PAGE_READWRITE, 0,
                                                  kStateBlockSize, nullptr);
    ASSERT_NE(monitorState.stateMutex, nullptr);
    ASSERT_NE(monitorState.stateBlock, nullptr);
    ASSERT_NE(monitorState.fileMapping, nullptr);
  }
  void TearDown() override {
    CloseStateMapping();
    CloseHandle(monitorState.stateMutex);
    std::free(monitorState.stateBlock);
    monitorState = MonitorState{};
  }
  // A copy of what the mapping holds now.
  StateBlock* MappedCopy() {
    void* view = MapViewOfFile(monitorState.fileMapping, FILE_MAP_READ, 0, 0, kStateBlockSize);
    EXPECT_NE(view, nullptr);
    if (view != nullptr) {
      std::memcpy(&mapped_, view, sizeof(StateBlock));
      UnmapViewOfFile(view);
    }
    return &mapped_;
  }

 private:
  static inline StateBlock mapped_;
};
