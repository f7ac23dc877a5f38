// RunMonitor on a thread of its own, scripted from its pass hook: the script
// runs on the monitor thread after every pass and returns true to stop it.
#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "machine.h"
#include "monitor/channel_workers.h"
#include "monitor/monitor_state.h"
#include "monitor/state_lock.h"
#include "service/process_locks.h"
#include "service/service_host.h"

namespace monitorrun {

// A guard against a run that never reaches its goal: 3000 passes of 10 ms.
constexpr std::size_t kMaxPasses = 3000;

struct Pass {
  PassKind kind = PassKind::Regular;
  DWORD tick = 0, sequence = 0, statusWord = 0, rescans = 0;
  LONG driveCount = 0, channelCount = 0;
  std::vector<LONG> linked;
  std::vector<DWORD> pendingAction, lightMarker, fromChannel;
  DWORD endedWorkers = 0;
};
using Script = std::function<bool(const std::vector<Pass>&)>;

class MonitorRun : public ::testing::Test {
 protected:
  void SetUp() override {
    InitializeProcessLocks();
    debugMode = true;  // no service control manager: status reports are skipped
    active = this;
    monitorHooks.afterPass = AfterPass;
    monitorHooks.afterPublish = AfterPublish;
  }
  void TearDown() override {
    if (monitor_.joinable()) {
      StopMonitor();
      monitor_.join();
    }
    monitorHooks = MonitorHooks{};
    active = nullptr;
    debugMode = true;
    if (machine_ != nullptr) {
      machine_->ClearFaults();
      machine_->FinishHeldCancels();
      machine_->WaitForDeviceEvents();
      machine_->Uninstall();
    }
  }
  void Run(Script script) {
    Start(std::move(script));
    Finish();
  }
  void Start(Script script) {
    script_ = std::move(script);
    monitor_ = std::thread([this] {
      RunMonitor(0, nullptr);
      finished_ = true;
    });
  }
  // A monitor that never stops ends the program: its thread cannot be joined.
  void Finish() {
    if (!WaitUntil([this] { return finished_.load(); }, 60)) {
      std::fprintf(stderr, "the monitor did not stop\n");
      std::abort();
    }
    monitor_.join();
    finished_ = false;
    EXPECT_LT(passes_.size(), kMaxPasses) << "the run did not reach its goal";
  }
  static bool WaitUntil(const std::function<bool()>& done, int seconds = 20) {
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(seconds);
    while (!done()) {
      if (std::chrono::steady_clock::now() > deadline) return false;
      std::this_thread::sleep_for(std::chrono::milliseconds(2));
    }
    return true;
  }
  DWORD LastPublished() { return published_.empty() ? 0 : published_.back(); }
  std::size_t PassCount() {
    std::lock_guard<std::mutex> guard(lock_);
    return passes_.size();
  }

 public:
  static std::unique_ptr<sim::Machine> Load(std::string_view text = sim::DefaultMachineText()) {
    std::string error;
    std::unique_ptr<sim::Machine> machine = sim::LoadMachine(text, &error);
    EXPECT_NE(machine, nullptr) << error;
    return machine;
  }

 protected:
  void Install(std::unique_ptr<sim::Machine> machine) {
    ASSERT_NE(machine, nullptr);
    machine_ = std::move(machine);
    machine_->SetDeviceEventSink([](DWORD, const void*) {});
    machine_->Install();
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

  std::unique_ptr<sim::Machine> machine_;
  std::vector<Pass> passes_;
  std::vector<DWORD> published_;  // statusWord of every copy into the mapping
  std::mutex lock_;               // guards passes_ and published_

 private:
  static void AfterPass(PassKind kind) {
    Pass s;
    s.kind = kind;
    {
      StateLock lock;
      const StateBlock* block = monitorState.stateBlock;
      s.tick = monitorState.tick;
      s.sequence = block->sequence;
      s.statusWord = block->statusWord;
      s.rescans = monitorState.rescanCount;
      s.driveCount = block->driveCount;
      s.channelCount = block->channelCount;
      for (LONG i = 0; i < block->channelCount; ++i) {
        s.linked.push_back(block->channels[i].linkedDrive);
        s.pendingAction.push_back(block->channels[i].pendingPanelAction);
        s.lightMarker.push_back(block->channels[i].lightPulseMarker);
      }
      for (LONG i = 0; i < block->driveCount; ++i) {
        s.fromChannel.push_back(block->drives[i].fromChannel);
      }
      for (DWORD i = 0; i < workerState.workerHandleCount; ++i) {
        s.endedWorkers += WaitForSingleObject(workerState.workerThreads[i], 0) == WAIT_OBJECT_0;
      }
    }
    {
      std::lock_guard<std::mutex> guard(active->lock_);
      active->passes_.push_back(std::move(s));
    }
    // Only this thread changes the list, so the script may read it unlocked.
    const std::vector<Pass>& seen = active->passes_;
    if ((active->script_ && active->script_(seen)) || seen.size() >= kMaxPasses) StopMonitor();
  }
  static void AfterPublish(const StateBlock* block) {
    std::lock_guard<std::mutex> guard(active->lock_);
    active->published_.push_back(block->statusWord);
  }

  static inline MonitorRun* active = nullptr;
  std::atomic<bool> finished_{false};
  Script script_;
  std::thread monitor_;
};

}  // namespace monitorrun
