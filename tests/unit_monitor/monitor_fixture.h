#pragma once

#include <gtest/gtest.h>

#include <cstring>

#include "monitor_setup.h"

class MonitorFixture : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(OpenMonitorState()); }
  void TearDown() override { CloseMonitorState(); }
  // A copy of what the mapping holds now, taken under the state mutex.
  StateBlock* MappedCopy() {
    void* view = MapViewOfFile(monitorState.fileMapping, FILE_MAP_READ, 0, 0, kStateBlockSize);
    EXPECT_NE(view, nullptr);
    if (view != nullptr) {
      WaitForSingleObject(monitorState.stateMutex, INFINITE);
      std::memcpy(static_cast<void*>(&mapped_), view, sizeof(StateBlock));
      ReleaseMutex(monitorState.stateMutex);
      UnmapViewOfFile(view);
    }
    return &mapped_;
  }

 private:
  static inline StateBlock mapped_;
};
