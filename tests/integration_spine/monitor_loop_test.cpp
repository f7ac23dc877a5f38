#include <atomic>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "integration_spine/monitor_run.h"
#include "monitor/rescan.h"
#include "pipe/pipe_client.h"
#include "platform/diagnostics.h"
#include "platform/posix/emu_scm.h"
#include "support/test_support.h"

namespace {

using monitorrun::Pass;
using MonitorLoop = monitorrun::MonitorRun;

TEST_F(MonitorLoop, WithoutDrivesPublishesEveryFifthTickAndStopsCleanly) {
  // Left behind by an earlier run: a new run starts from a clean state.
  monitorState.paused = 1;
  monitorState.skipTicks = 7;
  monitorState.tick = 2999;
  const long handles = platform::LiveHandleCount();
  Run([](const std::vector<Pass>& passes) { return passes.size() == 23; });
  const std::vector<Pass>& passes = passes_;
  ASSERT_EQ(passes.size(), 23u) << "a pass ran after the stop";
  EXPECT_EQ(monitorState.stateBlock, nullptr);
  EXPECT_EQ(monitorState.stateMutex, nullptr);
  EXPECT_EQ(platform::LiveHandleCount(), handles);
  for (const Pass& pass : passes) EXPECT_EQ(pass.kind, PassKind::Regular);
  for (std::size_t i = 5; i < passes.size(); ++i) {
    EXPECT_GT(passes[i].sequence, passes[i - 5].sequence)
        << "no publish in the five ticks before pass " << i;
  }
  EXPECT_EQ(passes.back().tick, 24u);
  EXPECT_EQ(passes.front().statusWord, 102u);
  EXPECT_EQ(LastPublished(), 500u);
}

// Each request that takes passes of its own, made after the previous one
// settled; the pause ends by itself after sixty passes with a refresh.
TEST_F(MonitorLoop, PauseFreezesTheTickAndEndsAfterSixtyPassesWithARescan) {
  std::size_t publishesBefore = 0;
  Run([this, &publishesBefore](const std::vector<Pass>& passes) {
    switch (passes.size()) {
      case 1:
        Set(&MonitorState::skipTicks, 10);
        break;
      case 12: {
        StateLock lock;
        monitorState.deviceChangePending = 1;
        monitorState.driveListStale = 1;
        break;
      }
      case 15:
        Set(&MonitorState::workersRestartRequested, 1);
        break;
      case 16:
        Set(&MonitorState::removalCheckRequested, 1);
        break;
      case 19:
        Set(&MonitorState::tick, 2999);
        break;
      case 22: {
        std::lock_guard<std::mutex> guard(lock_);
        publishesBefore = published_.size();
      }
        RequestRefresh();
        break;
    }
    if (passes.size() == 24) Set(&MonitorState::paused, 1);
    return passes.size() == 85;
  });
  const std::vector<Pass>& passes = passes_;
  ASSERT_EQ(passes.size(), 85u);
  // The flags become a refresh on a pass that does not advance the tick; one
  // refresh is one rescan on the next regular tick.
  const std::string kinds = "RSSSSSSSSSSRDRRWCRRRRRRR" + std::string(60, 'P') + "R";
  const DWORD ticks[] = {0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1, 1, 2, 3, 3, 3, 4, 5};
  const DWORD wrapped[] = {3000, 1, 2, 3, 4};
  const DWORD rescans[] = {0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 1, 1, 1, 1, 2, 2, 2, 2, 2, 3, 3};
  const std::string kindLetters = "PSDWCR";  // in PassKind's order
  for (std::size_t i = 0; i < passes.size(); ++i) {
    SCOPED_TRACE(i);
    EXPECT_EQ(kinds[i], kindLetters[static_cast<std::size_t>(passes[i].kind)]);
    EXPECT_EQ(passes[i].tick, i < 19   ? passes[0].tick + ticks[i]
                              : i < 24 ? wrapped[i - 19]
                                       : (i < 84 ? 4u : 5u));
    EXPECT_EQ(passes[i].rescans, passes[0].rescans + (i < 24 ? rescans[i] : i < 84 ? 3 : 4));
  }
  std::vector<DWORD> after(published_.begin() + static_cast<long>(publishesBefore),
                           published_.end());
  ASSERT_GE(after.size(), 3u);
  EXPECT_EQ(after[0], 101u);
  EXPECT_EQ(after[1], 102u);
  EXPECT_EQ(after.back(), 500u);
  EXPECT_EQ(monitorState.paused, 0u);
}

TEST_F(MonitorLoop, AProgramThatKeepsTheMutexCannotKeepTheStopFromEnding) {
  std::atomic<bool> taken{false};
  std::atomic<bool> release{false};
  std::thread holder;
  Run([&](const std::vector<Pass>& passes) {
    if (passes.size() != 2) return false;
    holder = std::thread([&] {
      const HANDLE mutex = OpenMutexW(SYNCHRONIZE | MUTEX_MODIFY_STATE, FALSE, kStateMutexName);
      WaitForSingleObject(mutex, INFINITE);
      taken = true;
      while (!release) Sleep(1);
      ReleaseMutex(mutex);
      CloseHandle(mutex);
    });
    while (!taken) Sleep(1);
    return true;
  });
  release = true;
  holder.join();
  EXPECT_NE(LastPublished(), 500u) << "the block was written without the mutex";
  EXPECT_EQ(monitorState.stateMutex, nullptr);
}

TEST_F(MonitorLoop, ExistingSharedObjectsAreUsedAndOutliveTheService) {
  HANDLE mutex = CreateMutexW(nullptr, FALSE, kStateMutexName);
  HANDLE mapping = CreateFileMappingW(INVALID_HANDLE_VALUE, nullptr, PAGE_READWRITE, 0,
                                      kStateBlockSize, kFileMapName);
  ASSERT_NE(mutex, nullptr);
  ASSERT_NE(mapping, nullptr);
  Run([](const std::vector<Pass>& passes) { return passes.size() == 2; });
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

// An early stop is used up by the run it ends.
TEST_F(MonitorLoop, EarlyStopOrFailedStartUpEndsTheRunBeforeItsFirstPass) {
  skytest::Handle uiStop(CreateEventW(nullptr, FALSE, FALSE, kUiStopEventName));
  ASSERT_TRUE(uiStop);
  StopMonitor();  // before RunMonitor created any of its events
  Run([](const std::vector<Pass>&) { return true; });
  EXPECT_TRUE(passes_.empty()) << "the early stop was lost";
  EXPECT_EQ(WaitForSingleObject(uiStop.Get(), 0), WAIT_OBJECT_0);
  Run([](const std::vector<Pass>& passes) { return passes.size() == 2; });
  EXPECT_EQ(passes_.size(), 2u);

  skytest::Handle squatter(CreateEventW(nullptr, TRUE, FALSE, kFileMapName));
  ASSERT_TRUE(squatter);
  passes_.clear();
  published_.clear();
  const long handles = platform::LiveHandleCount();
  Run([](const std::vector<Pass>&) { return true; });
  EXPECT_TRUE(passes_.empty());
  EXPECT_TRUE(published_.empty());
  EXPECT_EQ(platform::LiveHandleCount(), handles);
}

TEST_F(MonitorLoop, PlantedSmallMappingIsReportedOnceAndReplacedWhenFreed) {
  HANDLE planted =
      CreateFileMappingW(INVALID_HANDLE_VALUE, nullptr, PAGE_READWRITE, 0, 4096, kFileMapName);
  ASSERT_NE(planted, nullptr);
  debugMode = false;  // events are logged only outside debug mode
  emu::ClearEventLog();
  Run([&planted](const std::vector<Pass>& passes) {
    if (passes.size() == 8) {
      CloseHandle(planted);
      planted = nullptr;
    }
    return passes.size() == 16;
  });
  const std::vector<Pass>& passes = passes_;
  ASSERT_EQ(passes.size(), 16u);
  EXPECT_EQ(passes[7].sequence, 0u) << "something was published into the small mapping";
  EXPECT_GT(passes.back().sequence, 0u) << "the service did not take the name back";
  EXPECT_EQ(LastPublished(), 500u);
  std::size_t reports = 0;
  for (const emu::EventLogEntry& entry : emu::EventLogEntries()) {
    for (const std::u16string& text : entry.strings) {
      if (text.find(u"mapping") != std::u16string::npos) ++reports;
    }
  }
  EXPECT_EQ(reports, 1u);
}

TEST_F(MonitorLoop, StopDuringAForwardedResumeWithAHungWorkerEndsWith500) {
  Install(Load());
  Start(nullptr);
  ASSERT_TRUE(WaitUntil([this] { return PassCount() >= 1; }));
  // The loop idles, so that only the rescan's worker start meets the hung device.
  Set(&MonitorState::skipTicks, 1000000);
  machine_->HangIo("enclosure", sim::Endpoint::Enclosure, true);
  machine_->ClearCommands();
  std::thread client([] {
    HANDLE pipe = OpenCommandPipe(skytest::kGuardMs);
    if (pipe == INVALID_HANDLE_VALUE) return;
    auto request = std::make_unique<CommandMessage>();
    InitCommand(request.get(), kCommandForwardMessage, 0x218, 7);  // resume
    auto reply = std::make_unique<CommandMessage>();
    DWORD length = 0;
    ExchangeCommand(pipe, request.get(), sizeof(CommandMessage), reply.get(),
                    sizeof(CommandMessage), &length);
    CloseHandle(pipe);
  });
  const bool hung = WaitUntil([this] {
    for (const sim::Command& c : machine_->Commands("enclosure")) {
      if (c.endpoint == sim::Endpoint::Enclosure && c.kind == sim::Command::Kind::Scsi &&
          c.code == 0x12) {
        return true;
      }
    }
    return false;
  });
  StopMonitor();
  Finish();
  client.join();
  ASSERT_TRUE(hung) << "the rescan never reached the enclosure";
  EXPECT_EQ(LastPublished(), 500u) << "a command published after the stop";
}

// A forwarded resume may start workers before the start-up rescan (the leak
// check finds the channel handles of workers the rescan did not stop).
TEST_F(MonitorLoop, RescanWhileWorkersRunStopsThemFirst) {
  Install(Load());
  Start(nullptr);
  ASSERT_TRUE(WaitUntil([this] { return PassCount() >= 1; }));
  ASSERT_TRUE(WaitUntil([] {
    StateLock lock;
    return monitorState.rescanCount >= 1 && workerState.workerCount > 0;
  }));
  RescanDrives();
  StopMonitor();
  Finish();
}

TEST_F(MonitorLoop, StatusPassWritesOnlyIntoTheCopyOfTheSameDrive) {
  Install(Load());
  // Kept out of the published list, the firewire record keeps the index 0 of
  // another drive's copy.
  const std::uint8_t notPublishable[4] = {0x4A, 0x00, 0x00, 0x00};
  machine_->SetStatus("firewire", notPublishable);
  // Per pass, each published drive's copy and own record as (code, level).
  std::vector<std::vector<std::pair<DWORD, LONG>>> copies, records;
  Run([&](const std::vector<Pass>& passes) {
    StateLock lock;
    const StateBlock* block = monitorState.stateBlock;
    copies.emplace_back();
    records.emplace_back();
    for (LONG p = 0; p < block->publishedCount; ++p) {
      const DriveRecord& copy = block->published[p];
      const DriveRecord& own = block->drives[copy.recordIndex];
      EXPECT_NE(copy.statusCode, 4u) << "pass " << passes.size();
      copies.back().emplace_back(copy.statusCode, copy.statusLevel);
      records.back().emplace_back(own.statusCode, own.statusLevel);
    }
    return passes.size() == 12;
  });
  ASSERT_EQ(copies.size(), 12u);
  ASSERT_FALSE(copies.back().empty());
  EXPECT_EQ(copies, records);
  // Every published drive answered its status page: a level of 0 to 3.
  for (const auto& [code, level] : copies.back()) {
    EXPECT_TRUE(code < 10 && level >= 0 && level <= 3) << code << "/" << level;
  }
}

}  // namespace
