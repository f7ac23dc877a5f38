// RunMonitor on a thread of its own with its channel workers, on the embedded
// default machine and on a machine whose drives are all of channel models.
// Each case scripts the run from the monitor's pass hook (monitor thread,
// mutex released) and copies what it checks out of the working block there,
// since the block is freed when the monitor ends.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "machine.h"
#include "monitor/channel_workers.h"
#include "monitor/monitor_state.h"
#include "monitor/state_lock.h"
#include "platform/wide.h"
#include "service/process_locks.h"
#include "service/service_host.h"
#include "transport/drive_command.h"
#include "transport/drive_features.h"

namespace {

// A guard against a run that never reaches its goal: 3000 passes of 10 ms.
constexpr std::size_t kMaxPasses = 3000;

struct Snapshot {
  PassKind kind = PassKind::Regular;
  DWORD statusWord = 0;
  DWORD rescans = 0;
  LONG driveCount = 0;
  LONG channelCount = 0;
  std::vector<LONG> linked;
  std::vector<DWORD> fromChannel;
  std::vector<DWORD> pendingAction;
  std::vector<DWORD> lightMarker;
  DWORD endedWorkers = 0;
};

Snapshot Take(PassKind kind) {
  Snapshot s;
  s.kind = kind;
  StateLock lock;
  const StateBlock* block = monitorState.stateBlock;
  s.statusWord = block->statusWord;
  s.rescans = monitorState.rescanCount;
  s.driveCount = block->driveCount;
  s.channelCount = block->channelCount;
  for (LONG i = 0; i < block->channelCount; ++i) {
    s.linked.push_back(block->channels[i].linkedDrive);
    s.pendingAction.push_back(block->channels[i].pendingPanelAction);
    s.lightMarker.push_back(block->channels[i].lightPulseMarker);
  }
  for (LONG i = 0; i < block->driveCount; ++i)
    s.fromChannel.push_back(block->drives[i].fromChannel);
  for (DWORD i = 0; i < workerState.workerHandleCount; ++i) {
    s.endedWorkers += WaitForSingleObject(workerState.workerThreads[i], 0) == WAIT_OBJECT_0;
  }
  return s;
}

// The script sees every snapshot so far and returns true to stop the monitor.
using Script = std::function<bool(const std::vector<Snapshot>&)>;
Script* activeScript = nullptr;
std::vector<Snapshot>* activeSnapshots = nullptr;

void AfterPass(PassKind kind) {
  activeSnapshots->push_back(Take(kind));
  if ((*activeScript)(*activeSnapshots) || activeSnapshots->size() >= kMaxPasses) StopMonitor();
}

class WorkersTest : public ::testing::Test {
 protected:
  void SetUp() override {
    InitializeProcessLocks();
    debugMode = true;  // no service control manager: status reports are skipped
  }
  void TearDown() override {
    monitorHooks = MonitorHooks{};
    if (machine_ != nullptr) {
      machine_->WaitForDeviceEvents();
      machine_->Uninstall();
    }
  }
  void Install(std::unique_ptr<sim::Machine> machine) {
    machine_ = std::move(machine);
    machine_->SetDeviceEventSink([](DWORD, const void*) {});
    machine_->Install();
  }
  // Runs the monitor until the script stops it.
  void Run(Script script) {
    activeScript = &script;
    activeSnapshots = &snapshots_;
    monitorHooks.afterPass = AfterPass;
    std::thread monitor([] { RunMonitor(0, nullptr); });
    monitor.join();
    monitorHooks = MonitorHooks{};
    activeScript = nullptr;
    activeSnapshots = nullptr;
    ASSERT_LT(snapshots_.size(), kMaxPasses) << "the run did not reach its goal";
  }
  // Commands of one control code that the drive received.
  std::vector<sim::Command> Controls(const std::string& drive, DWORD code) const {
    std::vector<sim::Command> out;
    for (const sim::Command& c : machine_->Commands(drive)) {
      if (c.kind == sim::Command::Kind::Control && c.code == code) out.push_back(c);
    }
    return out;
  }

  std::unique_ptr<sim::Machine> machine_;
  std::vector<Snapshot> snapshots_;
};

std::unique_ptr<sim::Machine> DefaultMachine() {
  std::string error;
  std::unique_ptr<sim::Machine> machine = sim::LoadMachine(sim::DefaultMachineText(), &error);
  EXPECT_NE(machine, nullptr) << error;
  return machine;
}

TEST_F(WorkersTest, DefaultMachineLinksEveryChannelAndStaysSettled) {
  Install(DefaultMachine());
  Run([](const std::vector<Snapshot>& passes) {
    std::size_t regular = 0;
    for (const Snapshot& s : passes) regular += s.kind == PassKind::Regular ? 1 : 0;
    return regular >= 40;
  });
  ASSERT_FALSE(snapshots_.empty());
  for (std::size_t i = 0; i < snapshots_.size(); ++i) {
    const Snapshot& s = snapshots_[i];
    SCOPED_TRACE("pass " + std::to_string(i));
    EXPECT_EQ(s.rescans, 1u) << "a refresh was requested after the first rescan";
    EXPECT_EQ(s.statusWord, 102u);
    EXPECT_EQ(s.driveCount, 4) << "no drive record may be made from a channel";
    ASSERT_EQ(s.channelCount, 4);
    // gauge HID, plain HID, firewire driver, enclosure: drives 0 to 3.
    EXPECT_EQ(s.linked, (std::vector<LONG>{0, 1, 2, 3}));
    EXPECT_EQ(s.fromChannel, (std::vector<DWORD>{0, 0, 0, 0}));
  }
  // The start commands each worker gives its channel.
  EXPECT_EQ(Controls("firewire", CTL_WORKER_START).size(), 1u);
  EXPECT_EQ(Controls("firewire", CTL_CLEAR_EVENT).size(), 1u);
  EXPECT_EQ(Controls("firewire", CTL_GET_IDENTITY).size(), 1u);
  std::size_t serialQueries = 0;
  for (const sim::Command& c : machine_->Commands()) {
    serialQueries += c.kind == sim::Command::Kind::HidSerial ? 1 : 0;
  }
  EXPECT_EQ(serialQueries, 2u) << "both HID channels read their identity once";
}

TEST_F(WorkersTest, DrivesThatStayIncompleteAskForOneRescanAtMost) {
  // bare: linked to its HID channel, no volume and no extended identity, so
  // every gauge pass finds it without letters. loose: extended identity, no
  // channel and no control path, so no status pass can open it.
  std::string text(sim::DefaultMachineText());
  text += R"(
drive bare
  bus usb
  channel hid
  model-code 2A31
  serial QX-8B4E2C19
  rcs no
end
drive loose
  bus 1394
  channel none
  model-code 5E22
  serial QX-6C2D7E01
  unit-model EXTERNAL_HDD
  unit-id 0030E00000077E01
  volume L fixed 100G 50G
end
)";
  std::string error;
  std::unique_ptr<sim::Machine> machine = sim::LoadMachine(text, &error);
  ASSERT_NE(machine, nullptr) << error;
  Install(std::move(machine));
  Run([](const std::vector<Snapshot>& passes) {
    std::size_t regular = 0;
    for (const Snapshot& s : passes) regular += s.kind == PassKind::Regular ? 1 : 0;
    return regular >= 120;
  });
  ASSERT_FALSE(snapshots_.empty());
  EXPECT_LE(snapshots_.back().rescans, 2u) << "the start-up rescan and at most one more";
  EXPECT_EQ(snapshots_.back().statusWord, 102u);
}

TEST_F(WorkersTest, PanelEventsOnAnUncountedMachineOnlyReportTheUncountedDrive) {
  // The plain drive is not of a channel model: the counted-drives check
  // reports it and holds back the panel actions.
  Install(DefaultMachine());
  bool pressed = false;
  Run([&](const std::vector<Snapshot>& passes) {
    if (!pressed && passes.back().rescans >= 1 &&
        machine_->PendingCount("firewire", sim::Endpoint::Driver) >= 1) {
      machine_->Press("firewire", 0x01);
      pressed = true;
    }
    return pressed && passes.back().statusWord == 100;
  });
  EXPECT_TRUE(Controls("firewire", CTL_EVENT_REPLY).empty());
}

std::unique_ptr<sim::Machine> CountedMachine() {
  // Only drives of channel models: a button-filter-driver drive and an
  // enclosure, both IEEE 1394.
  std::string text(sim::DefaultMachineText());
  const std::size_t gauge = text.find("# USB drive of a standalone gauge model");
  const std::size_t fireWire = text.find("# IEEE 1394 drive reached through");
  EXPECT_NE(gauge, std::string::npos);
  EXPECT_NE(fireWire, std::string::npos);
  text.erase(gauge, fireWire - gauge);
  std::string error;
  std::unique_ptr<sim::Machine> machine = sim::LoadMachine(text, &error);
  EXPECT_NE(machine, nullptr) << error;
  return machine;
}

TEST_F(WorkersTest, PanelEventsOnAControlChannelLightTheDriveAndSetTheAction) {
  Install(CountedMachine());
  int step = 0;
  Run([&](const std::vector<Snapshot>& passes) {
    const Snapshot& now = passes.back();
    const bool waiting = machine_->PendingCount("firewire", sim::Endpoint::Driver) >= 1;
    switch (step) {
      case 0:  // workers running and waiting
        if (now.rescans >= 1 && waiting) {
          machine_->Press("firewire", 0x01);
          step = 1;
        }
        return false;
      case 1:  // the reply was sent; the marker now holds further replies back
        if (!Controls("firewire", CTL_EVENT_REPLY).empty() && waiting) {
          machine_->Press("firewire", 0x01);
          machine_->Press("firewire", 0x02);
          step = 2;
        }
        return false;
      default:  // both events handled, in order
        return now.channelCount >= 1 && now.pendingAction[0] == 5;
    }
  });
  const std::vector<sim::Command> replies = Controls("firewire", CTL_EVENT_REPLY);
  ASSERT_EQ(replies.size(), 1u);
  EXPECT_TRUE(replies[0].data.empty()) << "the reply carries no input on a driver channel";
  const Snapshot& last = snapshots_.back();
  ASSERT_EQ(last.channelCount, 2);
  EXPECT_EQ(last.lightMarker[0], 120u);
  EXPECT_EQ(last.statusWord, 102u);
  EXPECT_EQ(last.rescans, 1u);
}

TEST_F(WorkersTest, FailedRemovalIsReportedWithTheDriveIndex) {
  Install(CountedMachine());
  machine_->SetEjectVeto("firewire", PNP_VetoOutstandingOpen, "test");
  machine_->SetEjectVeto("enclosure", PNP_VetoOutstandingOpen, "test");
  int step = 0;
  Run([&](const std::vector<Snapshot>& passes) {
    const Snapshot& now = passes.back();
    switch (step) {
      case 0:
        if (now.rescans >= 1 && machine_->PendingCount("firewire", sim::Endpoint::Driver) >= 1) {
          machine_->Press("firewire", 0x04);  // control channel, drive 0
          step = 1;
        }
        return false;
      case 1:
        if (now.statusWord == 600) {
          machine_->Press("enclosure", 0x04);  // storage channel, drive 1
          step = 2;
        }
        return false;
      default:
        return now.statusWord == 601;
    }
  });
  EXPECT_EQ(step, 2);
  EXPECT_EQ(snapshots_.back().driveCount, 2) << "the storage worker enumerated again";
}

TEST_F(WorkersTest, EjectButtonRemovesTheDriveAndTheRescanForgetsIt) {
  // The whole path of a removal request: the control worker dismounts the
  // drive's volume, the eject succeeds, the drive's channel ends with the
  // device, and the refresh it asks for rebuilds the block without it.
  Install(CountedMachine());
  bool pressed = false;
  Run([&](const std::vector<Snapshot>& passes) {
    const Snapshot& now = passes.back();
    if (!pressed) {
      if (now.rescans >= 1 && machine_->PendingCount("firewire", sim::Endpoint::Driver) >= 1) {
        machine_->Press("firewire", 0x04);
        pressed = true;
      }
      return false;
    }
    return now.rescans >= 2 && now.statusWord == 102 && now.driveCount == 1;
  });
  ASSERT_TRUE(pressed);
  EXPECT_FALSE(machine_->Attached("firewire"));
  EXPECT_TRUE(machine_->Attached("enclosure"));
  EXPECT_EQ(machine_->DismountCount('H'), 1) << "the drive's volume was taken offline first";
  const std::vector<sim::Machine::EjectRequest> ejects = machine_->Ejects();
  ASSERT_EQ(ejects.size(), 1u);
  EXPECT_EQ(ejects[0].drive, "firewire");
  EXPECT_FALSE(ejects[0].vetoed);
  for (const Snapshot& s : snapshots_) EXPECT_LT(s.statusWord, 600u) << "no removal failed";
  const Snapshot& last = snapshots_.back();
  EXPECT_EQ(last.channelCount, 1);
  EXPECT_EQ(last.linked, (std::vector<LONG>{0}));
}

TEST_F(WorkersTest, RemovalFailingAfterTheDriveWentNamesTheDriveTheWorkerLinked) {
  // Ejecting the gauge drive's disk leaves its HID channel in place, unlinked
  // (a model that makes no drive record of its own); a second removal
  // request on it then fails and names drive 0 all the same.
  std::string text(sim::DefaultMachineText());
  const std::size_t model = text.find("model-code 7B44");
  ASSERT_NE(model, std::string::npos);
  text.replace(model, 15, "model-code 7B43");
  std::string error;
  std::unique_ptr<sim::Machine> machine = sim::LoadMachine(text, &error);
  ASSERT_NE(machine, nullptr) << error;
  Install(std::move(machine));
  int step = 0;
  Run([&](const std::vector<Snapshot>& passes) {
    const Snapshot& now = passes.back();
    const bool waiting = machine_->PendingCount("gauge", sim::Endpoint::Hid) >= 1;
    if (step == 0 && now.rescans >= 1 && waiting) {
      machine_->Press("gauge", 0x04);
      step = 1;
    } else if (step == 1 && !machine_->Ejects().empty() && now.linked[0] == -1 && waiting) {
      machine_->Press("gauge", 0x04);
      step = 2;
    }
    return step == 2 && now.statusWord >= 599;
  });
  const std::vector<sim::Machine::EjectRequest> ejects = machine_->Ejects();
  ASSERT_EQ(ejects.size(), 1u);
  EXPECT_FALSE(ejects[0].vetoed);
  EXPECT_EQ(snapshots_.back().statusWord, 600u);
}

TEST_F(WorkersTest, DriveGoneFromAnotherThreadLeavesTheHandleToItsWorker) {
  // A driver channel in gauge mode ends with the drive-gone command. Its
  // worker is blocked in a read on a device that never completes a cancel:
  // only the worker can give that read up, so it must be the one to close.
  std::unique_ptr<sim::Machine> machine = CountedMachine();
  sim::DriveSpec lights;
  lights.name = "lights";
  lights.bus = sim::Bus::Ieee1394;
  lights.channel = sim::ChannelKind::Driver;
  lights.modelCode = "5E22";
  lights.unitModel = "EXTERNAL_LIGHTS";
  lights.unitId = "0030E0000002C4D5";
  lights.serial = "QX-02C4D5";
  sim::VolumeSpec volume;
  volume.letter = 'J';
  lights.volumes.push_back(volume);
  machine->AddDrive(lights);
  Install(std::move(machine));
  int step = 0;
  Run([&](const std::vector<Snapshot>& passes) {
    if (step == 0) {
      if (passes.back().rescans < 1 || machine_->PendingCount("lights", sim::Endpoint::Driver) < 1)
        return false;
      machine_->SetCancelDelay("lights", sim::Endpoint::Driver, INFINITE);
      StateLock lock;
      StateBlock* block = monitorState.stateBlock;
      for (int i = 0; i < block->channelCount; ++i) {
        ChannelRecord& channel = block->channels[i];
        if (WideContains(channel.devicePath, WSTR("external_lights")) &&
            channel.mode == kChannelModeGauge) {
          EXPECT_EQ(SendDriveGone(&channel), 1u);
          step = 1;
        }
      }
      EXPECT_EQ(step, 1) << "no gauge-mode driver channel";
      return step != 1;
    }
    if (passes.back().endedWorkers == 0) return false;
    // The read the worker gave up completes now; the monitor's teardown
    // frees what it left behind.
    machine_->FinishHeldCancels();
    return true;
  });
  EXPECT_EQ(step, 1);
  EXPECT_EQ(snapshots_.back().endedWorkers, 1u) << "only the lights worker ended on its own";
  EXPECT_EQ(machine_->OpenCount("lights", sim::Endpoint::Driver), 0u);
}

TEST_F(WorkersTest, AStatusReadThatTheEnclosureNeverAnswersEndsOnItsTimeOutOrAStop) {
  // The enclosure stops answering while the monitor reads its status page
  // with the mutex held. The read is given up after the device time-out, so
  // the passes go on; and a stop ends a read at once.
  Install(DefaultMachine());
  std::atomic<bool> monitorEnded{false};
  std::atomic<int> passesAfterAsk{-1};
  std::thread stopper;
  Run([&](const std::vector<Snapshot>& passes) {
    if (passesAfterAsk >= 0) passesAfterAsk += 1;
    if (stopper.joinable() || passes.back().rescans < 1) return false;
    machine_->HangIo("enclosure", sim::Endpoint::Enclosure, true);
    machine_->ClearCommands();
    stopper = std::thread([&] {
      // Two status reads (page 0x82) asked for: the first was given up, and
      // the stop comes while the second is pending.
      std::size_t asked = 0;
      for (int i = 0; i < 4000 && asked < 2; ++i) {
        asked = 0;
        for (const sim::Command& c : machine_->Commands("enclosure")) {
          asked += c.code == 0x1C && c.cdb.size() > 2 && c.cdb[2] == 0x82;
        }
        if (asked == 1 && passesAfterAsk < 0) passesAfterAsk = 0;
        if (asked < 2) std::this_thread::sleep_for(std::chrono::milliseconds(10));
      }
      EXPECT_EQ(asked, 2u) << "the first read never ended";
      StopMonitor();
      // A hang guard only: the stop takes a cancellation grace at most.
      for (int i = 0; i < 2000 && !monitorEnded; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
      }
      if (!monitorEnded) {
        ADD_FAILURE() << "the stop did not end the status read";
        machine_->Detach("enclosure");
      }
    });
    return false;
  });
  monitorEnded = true;
  stopper.join();
  EXPECT_GE(passesAfterAsk, 1) << "no pass ran between the two reads";
}

}  // namespace
