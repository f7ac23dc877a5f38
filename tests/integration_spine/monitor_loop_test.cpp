// RunMonitor on a thread of its own, observed through its pass and publish
// hooks. Each case scripts the loop from the pass hook, which runs on the
// monitor thread between passes, so the sequence of passes is deterministic.
#include <gtest/gtest.h>

#include <condition_variable>
#include <cstdlib>
#include <functional>
#include <mutex>
#include <thread>
#include <vector>

#include "monitor/monitor_state.h"
#include "monitor/state_lock.h"
#include "platform/diagnostics.h"
#include "service/process_locks.h"
#include "service/service_host.h"

namespace {

// One-second passes take 10 ms; set before the emulation's first wait.
const bool kTimeScaled = [] {
  setenv("SKYVANE_TIME_SCALE", "0.01", 0);
  return true;
}();

struct Pass {
  PassKind kind;
  DWORD tick;
  DWORD sequence;
  DWORD statusWord;
  DWORD rescans;
};

// What the hooks saw; `script` runs after every pass on the monitor thread
// and may change the monitor's flags (under the mutex) or stop it.
struct Observer {
  std::mutex lock;
  std::condition_variable changed;
  std::vector<Pass> passes;
  std::vector<DWORD> publishedStatus;  // statusWord of every copy into the mapping
  std::function<void(const std::vector<Pass>&)> script;
  bool finished = false;
};
Observer* observer = nullptr;

void AfterPass(PassKind kind) {
  Pass pass{kind, 0, 0, 0, 0};
  {
    StateLock lock;
    pass.tick = monitorState.tick;
    pass.sequence = monitorState.stateBlock->sequence;
    pass.statusWord = monitorState.stateBlock->statusWord;
    pass.rescans = monitorState.rescanCount;
  }
  std::vector<Pass> seen;
  {
    std::lock_guard<std::mutex> guard(observer->lock);
    observer->passes.push_back(pass);
    seen = observer->passes;
  }
  if (observer->script) observer->script(seen);
}

void AfterPublish(const StateBlock* block) {
  std::lock_guard<std::mutex> guard(observer->lock);
  observer->publishedStatus.push_back(block->statusWord);
}

class MonitorLoop : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(kTimeScaled);
    InitializeProcessLocks();
    debugMode = true;  // no service control manager: status reports are skipped
    observer = &observer_;
    monitorHooks.afterPass = AfterPass;
    monitorHooks.afterPublish = AfterPublish;
  }
  void TearDown() override {
    if (monitor_.joinable()) {
      StopMonitor();
      monitor_.join();
    }
    monitorHooks = MonitorHooks{};
    observer = nullptr;
  }
  // Runs the monitor until `script` stops it; returns when RunMonitor did.
  void Run(std::function<void(const std::vector<Pass>&)> script) {
    observer_.script = std::move(script);
    monitor_ = std::thread([this] {
      RunMonitor(0, nullptr);
      std::lock_guard<std::mutex> guard(observer_.lock);
      observer_.finished = true;
      observer_.changed.notify_all();
    });
    std::unique_lock<std::mutex> guard(observer_.lock);
    ASSERT_TRUE(observer_.changed.wait_for(guard, std::chrono::seconds(120), [this] {
      return observer_.finished;
    })) << "the monitor did not stop";
    guard.unlock();
    monitor_.join();
  }
  static void Set(DWORD MonitorState::*flag, DWORD value) {
    StateLock lock;
    monitorState.*flag = value;
  }
  static std::size_t Count(const std::vector<Pass>& passes, PassKind kind) {
    std::size_t count = 0;
    for (const Pass& pass : passes) count += pass.kind == kind ? 1 : 0;
    return count;
  }
  Observer observer_;
  std::thread monitor_;
};

TEST_F(MonitorLoop, WithoutDrivesPublishesAtLeastEveryFifthTick) {
  Run([](const std::vector<Pass>& passes) {
    if (passes.size() == 23) StopMonitor();
  });
  const std::vector<Pass>& passes = observer_.passes;
  ASSERT_EQ(passes.size(), 23u);
  for (const Pass& pass : passes) EXPECT_EQ(pass.kind, PassKind::Regular);
  for (std::size_t i = 5; i < passes.size(); ++i) {
    EXPECT_GT(passes[i].sequence, passes[i - 5].sequence)
        << "no publish in the five ticks before pass " << i;
  }
  EXPECT_EQ(passes.back().tick, 24u);
  // The first rescan ended with 102; the last publish is the stop's 500.
  EXPECT_EQ(passes.front().statusWord, 102u);
  ASSERT_FALSE(observer_.publishedStatus.empty());
  EXPECT_EQ(observer_.publishedStatus.back(), 500u);
}

TEST_F(MonitorLoop, PauseFreezesTheTickAndEndsAfterSixtyPassesWithARescan) {
  Run([](const std::vector<Pass>& passes) {
    if (passes.size() == 2) Set(&MonitorState::paused, 1);
    if (passes.size() > 2 && passes.back().kind == PassKind::Regular &&
        passes[passes.size() - 2].kind == PassKind::Paused) {
      StopMonitor();
    }
    if (passes.size() > 200) StopMonitor();
  });
  const std::vector<Pass>& passes = observer_.passes;
  ASSERT_EQ(Count(passes, PassKind::Paused), 60u);
  const DWORD frozen = passes[1].tick;
  for (std::size_t i = 2; i < 62; ++i) {
    EXPECT_EQ(passes[i].kind, PassKind::Paused);
    EXPECT_EQ(passes[i].tick, frozen) << "the tick moved while paused";
    EXPECT_EQ(passes[i].rescans, passes[1].rescans);
  }
  // The pause ended by itself with a refresh: the next regular tick rescans.
  ASSERT_EQ(passes.size(), 63u);
  EXPECT_EQ(passes[62].rescans, passes[1].rescans + 1);
  EXPECT_EQ(monitorState.paused, 0u);
}

TEST_F(MonitorLoop, SkipTicksIdlesTenPasses) {
  Run([](const std::vector<Pass>& passes) {
    if (passes.size() == 1) Set(&MonitorState::skipTicks, 10);
    if (passes.size() == 14) StopMonitor();
  });
  const std::vector<Pass>& passes = observer_.passes;
  ASSERT_EQ(passes.size(), 14u);
  for (std::size_t i = 1; i <= 10; ++i) {
    EXPECT_EQ(passes[i].kind, PassKind::Skipped) << i;
    EXPECT_EQ(passes[i].tick, passes[0].tick) << i;
  }
  EXPECT_EQ(passes[11].kind, PassKind::Regular);
  EXPECT_EQ(passes[11].tick, passes[0].tick + 1);
}

TEST_F(MonitorLoop, DeviceChangeAndStaleListBecomeOneImmediateRefresh) {
  Run([](const std::vector<Pass>& passes) {
    if (passes.size() == 1) {
      StateLock lock;
      monitorState.deviceChangePending = 1;
      monitorState.driveListStale = 1;
    }
    if (passes.size() == 4) StopMonitor();
  });
  const std::vector<Pass>& passes = observer_.passes;
  ASSERT_EQ(passes.size(), 4u);
  // The flags are turned into a refresh on a pass of their own, which does
  // not sleep and does not advance the tick.
  EXPECT_EQ(passes[1].kind, PassKind::DeviceChange);
  EXPECT_EQ(passes[1].tick, passes[0].tick);
  // One refresh: the next regular tick runs exactly one rescan.
  EXPECT_EQ(passes[2].kind, PassKind::Regular);
  EXPECT_EQ(passes[2].rescans, passes[0].rescans + 1);
  EXPECT_EQ(passes[3].rescans, passes[2].rescans);
}

TEST_F(MonitorLoop, RestartAndRemovalRequestsTakePassesOfTheirOwn) {
  Run([](const std::vector<Pass>& passes) {
    if (passes.size() == 1) Set(&MonitorState::workersRestartRequested, 1);
    if (passes.size() == 2) Set(&MonitorState::removalCheckRequested, 1);
    if (passes.size() == 5) StopMonitor();
  });
  const std::vector<Pass>& passes = observer_.passes;
  ASSERT_EQ(passes.size(), 5u);
  EXPECT_EQ(passes[1].kind, PassKind::WorkersRestart);
  EXPECT_EQ(passes[2].kind, PassKind::RemovalCheck);
  EXPECT_EQ(passes[1].tick, passes[0].tick);
  EXPECT_EQ(passes[2].tick, passes[0].tick);
  // The removal check is followed by a refresh: one rescan on the next tick.
  EXPECT_EQ(passes[3].kind, PassKind::Regular);
  EXPECT_EQ(passes[3].rescans, passes[0].rescans + 1);
  EXPECT_EQ(passes[4].rescans, passes[3].rescans);
}

TEST_F(MonitorLoop, RefreshIsPublishedAs101ThenAs102) {
  std::size_t publishesBefore = 0;
  Run([this, &publishesBefore](const std::vector<Pass>& passes) {
    if (passes.size() == 2) {
      {
        std::lock_guard<std::mutex> guard(observer_.lock);
        publishesBefore = observer_.publishedStatus.size();
      }
      RequestRefresh();
    }
    if (passes.size() == 4) StopMonitor();
  });
  std::vector<DWORD> after(observer_.publishedStatus.begin() + static_cast<long>(publishesBefore),
                           observer_.publishedStatus.end());
  ASSERT_GE(after.size(), 3u);
  EXPECT_EQ(after[0], 101u);
  EXPECT_EQ(after[1], 102u);
  EXPECT_EQ(after.back(), 500u);
  EXPECT_EQ(observer_.passes[2].rescans, observer_.passes[1].rescans + 1);
}

TEST_F(MonitorLoop, StopIsNoticedAtTheTopOfTheNextPassAndLeavesNothingBehind) {
  // Threads are checked after every case by the test main's leak check.
  const long handles = platform::LiveHandleCount();
  Run([](const std::vector<Pass>& passes) {
    if (passes.size() == 3) StopMonitor();
  });
  EXPECT_EQ(observer_.passes.size(), 3u) << "a pass ran after the stop";
  EXPECT_EQ(observer_.publishedStatus.back(), 500u);
  EXPECT_EQ(monitorState.stateBlock, nullptr);
  EXPECT_EQ(monitorState.stateMutex, nullptr);
  EXPECT_EQ(platform::LiveHandleCount(), handles);
}

TEST_F(MonitorLoop, TickWrapsFrom3000To1) {
  Run([](const std::vector<Pass>& passes) {
    if (passes.size() == 1) Set(&MonitorState::tick, 2999);
    if (passes.size() == 4) StopMonitor();
  });
  const std::vector<Pass>& passes = observer_.passes;
  ASSERT_EQ(passes.size(), 4u);
  EXPECT_EQ(passes[1].tick, 3000u);
  EXPECT_EQ(passes[2].tick, 1u);
  EXPECT_EQ(passes[3].tick, 2u);
}

TEST_F(MonitorLoop, ExistingSharedObjectsAreUsedAndOutliveTheService) {
  // The application may create the objects first.
  HANDLE mutex = CreateMutexW(nullptr, FALSE, kStateMutexName);
  HANDLE mapping = CreateFileMappingW(INVALID_HANDLE_VALUE, nullptr, PAGE_READWRITE, 0,
                                      kStateBlockSize, kFileMapName);
  ASSERT_NE(mutex, nullptr);
  ASSERT_NE(mapping, nullptr);
  Run([](const std::vector<Pass>& passes) {
    if (passes.size() == 2) StopMonitor();
  });
  void* view = MapViewOfFile(mapping, FILE_MAP_READ, 0, 0, kStateBlockSize);
  ASSERT_NE(view, nullptr);
  const StateBlock* block = static_cast<const StateBlock*>(view);
  EXPECT_EQ(block->statusWord, 500u);
  EXPECT_GT(block->sequence, 1u);
  EXPECT_EQ(block->driveCount, 0);
  EXPECT_EQ(block->channelCount, 0);
  EXPECT_EQ(block->publishedCount, 0);
  for (const ChannelRecord& channel : block->channels) EXPECT_EQ(channel.linkedDrive, -1);
  UnmapViewOfFile(view);
  CloseHandle(mapping);
  CloseHandle(mutex);
}

TEST_F(MonitorLoop, FailedStartUpTearsDownWithoutRunningTheLoop) {
  // An event already holds the mapping's name, so the mapping cannot be made.
  HANDLE squatter = CreateEventW(nullptr, TRUE, FALSE, kFileMapName);
  ASSERT_NE(squatter, nullptr);
  const long handles = platform::LiveHandleCount();
  Run([](const std::vector<Pass>&) { StopMonitor(); });
  EXPECT_TRUE(observer_.passes.empty());
  EXPECT_TRUE(observer_.publishedStatus.empty());
  EXPECT_EQ(platform::LiveHandleCount(), handles);
  CloseHandle(squatter);
}

}  // namespace
