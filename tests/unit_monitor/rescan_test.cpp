#include "monitor/rescan.h"

#include "lock_probe.h"
#include "monitor/channel_workers.h"
#include "monitor_fixture.h"
#include "service/process_locks.h"

namespace {

class Rescan : public MonitorFixture {
 protected:
  void SetUp() override {
    MonitorFixture::SetUp();
    ResetWorkerState();
    StateBlock* block = monitorState.stateBlock;
    block->driveCount = 2;
    block->drives[0].gaugePercent = 40;
    block->drives[1].gaugePercent = 75;
    block->drives[2].gaugePercent = 9;  // beyond driveCount
    block->channelCount = 1;
    block->channels[0].kind = kChannelKindHid;
    block->channels[0].linkedDrive = 0;
    block->channels[0].gaugePercentSent = 40;
    block->statusWord = 101;
  }
};

// Suspend forgets the gauges and stops the workers, resume rebuilds all; a
// forwarded device change's record (the application's memory) is never read.
TEST_F(Rescan, ForwardedMessagesSuspendResumeOrClassify) {
  StateBlock* block = monitorState.stateBlock;
  HandleForwardedMessage(0x218, 5, 0, nullptr);
  HandleForwardedMessage(0x100, 7, 0, nullptr);
  EXPECT_EQ(block->statusWord, 101u);
  EXPECT_EQ(block->drives[0].gaugePercent, 40u);

  HandleForwardedMessage(0x218, 4, 0, nullptr);
  EXPECT_EQ(block->drives[0].gaugePercent, 0u);
  EXPECT_EQ(block->drives[1].gaugePercent, 0u);
  EXPECT_EQ(block->drives[2].gaugePercent, 9u) << "only records below driveCount are touched";
  EXPECT_EQ(block->statusWord, 102u) << "stopping the workers sets 102";
  EXPECT_EQ(monitorState.publishNeeded, 1u);
  EXPECT_EQ(monitorState.rescanCount, 0u);
  EXPECT_EQ(block->channelCount, 1) << "the channel table is kept until the next rescan";

  for (ULONG_PTR resume : {ULONG_PTR{6}, ULONG_PTR{7}, ULONG_PTR{0x12}}) {
    block->statusWord = 101;
    const DWORD before = monitorState.rescanCount;
    HandleForwardedMessage(0x218, resume, 0, nullptr);
    EXPECT_EQ(monitorState.rescanCount, before + 1) << resume;
    EXPECT_EQ(block->statusWord, 102u);
    EXPECT_EQ(monitorState.rescanInProgress, 0u);
    EXPECT_EQ(block->driveCount, 0);
    EXPECT_EQ(block->channelCount, 0);
    EXPECT_EQ(block->channels[0].linkedDrive, -1);
    EXPECT_EQ(block->channels[0].gaugePercentSent, 0u);
  }

  HandleForwardedMessage(0x219, 0x8004, 0x12345678, nullptr);
  EXPECT_EQ(monitorState.removalCheckRequested, 1u);
  const DWORD refreshes = monitorState.refreshRequests;
  HandleForwardedMessage(0x219, 0x8000, 0x12345678, nullptr);
  EXPECT_EQ(monitorState.refreshRequests, refreshes + 1);
}

TEST_F(Rescan, RemovalCheckCutShortByAStopSendsNoDriveGone) {
  // The enumeration aborted by the stop finds no drive: that is no removal.
  HANDLE stop = CreateEventW(nullptr, TRUE, TRUE, nullptr);
  ASSERT_NE(stop, nullptr);
  monitorState.stopEvent = stop;
  ChannelRecord& channel = monitorState.stateBlock->channels[0];
  channel.mode = kChannelModeGauge;
  EXPECT_EQ(CheckRemovedDrives(), 0);
  EXPECT_EQ(channel.driveGoneSent, 0u);
  EXPECT_EQ(monitorState.skipTicks, 0u);
  monitorState.stopEvent = nullptr;
  CloseHandle(stop);
}

TEST_F(Rescan, RestartWaitsForARescanOrQuiesceInProgress) {
  // A restart never runs amid a rescan or quiesce, and waits holding no lock
  // taken after the rescan lock.
  bool mutexFree = false;
  EnterCriticalSection(&rescanLock);
  EXPECT_TRUE(lockprobe::WaitsForTheHeldLock(
      [] { RestartWorkers(); },
      [&mutexFree] {
        mutexFree = WaitForSingleObject(monitorState.stateMutex, 0) == WAIT_OBJECT_0;
        if (mutexFree) ReleaseMutex(monitorState.stateMutex);
        LeaveCriticalSection(&rescanLock);
      }));
  EXPECT_TRUE(mutexFree) << "the state mutex was taken before the rescan lock";
  EXPECT_TRUE(lockprobe::WaitsForTheSection(&workerStopLock, [] { RestartWorkers(); }));
  EXPECT_EQ(monitorState.stateBlock->channelCount, 0) << "the table was rebuilt";
  EXPECT_EQ(StopWorkers(), 0u);
}

TEST_F(Rescan, CountedDrivesCheckReportsUncountedDrivesAndSets102Once) {
  StateBlock* block = monitorState.stateBlock;
  EXPECT_EQ(StopWorkers(), 0u) << "none running";
  EXPECT_EQ(block->statusWord, 102u);
  block->countedDrives = 1;
  EXPECT_FALSE(CountedDrivesCheck());
  EXPECT_EQ(block->statusWord, 100u);
  block->countedDrives = 2;
  EXPECT_TRUE(CountedDrivesCheck());
  EXPECT_EQ(block->statusWord, 102u);
  block->statusWord = 600;
  EXPECT_TRUE(CountedDrivesCheck());
  EXPECT_EQ(block->statusWord, 600u) << "102 is set only when the flag was clear";
}

}  // namespace
