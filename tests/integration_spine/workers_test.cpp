#include <atomic>
#include <chrono>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "integration_spine/monitor_run.h"
#include "platform/wide.h"
#include "transport/drive_command.h"
#include "transport/drive_features.h"

namespace {

using monitorrun::Pass;

class WorkersTest : public monitorrun::MonitorRun {
 protected:
  std::vector<sim::Command> Controls(const std::string& drive, DWORD code) const {
    std::vector<sim::Command> out;
    for (const sim::Command& c : machine_->Commands(drive)) {
      if (c.kind == sim::Command::Kind::Control && c.code == code) out.push_back(c);
    }
    return out;
  }
  bool Waiting(const std::vector<Pass>& passes, const char* drive,
               sim::Endpoint endpoint = sim::Endpoint::Driver) const {
    return passes.back().rescans >= 1 && machine_->PendingCount(drive, endpoint) >= 1;
  }
};

// Only drives of channel models: a driver-channel drive and an enclosure.
std::unique_ptr<sim::Machine> CountedMachine(const std::string& more = "") {
  std::string text(sim::DefaultMachineText());
  const std::size_t gauge = text.find("# USB drive of a standalone gauge model");
  const std::size_t fireWire = text.find("# IEEE 1394 drive reached through");
  EXPECT_NE(gauge, std::string::npos);
  EXPECT_NE(fireWire, std::string::npos);
  text.erase(gauge, fireWire - gauge);
  return monitorrun::MonitorRun::Load(text + more);
}

// The plain drive is not of a channel model: a panel event reports it (100).
TEST_F(WorkersTest, DefaultMachineLinksEveryChannelAndStaysSettled) {
  Install(Load());
  std::size_t settled = 0;  // passes before the press
  std::size_t startCommands[3] = {};
  Run([&](const std::vector<Pass>& passes) {
    if (settled == 0 && Count(passes, PassKind::Regular) >= 40 && Waiting(passes, "firewire")) {
      settled = passes.size();
      const DWORD codes[] = {CTL_WORKER_START, CTL_CLEAR_EVENT, CTL_GET_IDENTITY};
      for (int i = 0; i < 3; ++i) startCommands[i] = Controls("firewire", codes[i]).size();
      machine_->Press("firewire", 0x01);
    }
    return settled != 0 && passes.back().statusWord == 100;
  });
  ASSERT_GT(settled, 0u);
  for (std::size_t i = 0; i < settled; ++i) {
    const Pass& s = passes_[i];
    SCOPED_TRACE("pass " + std::to_string(i));
    EXPECT_EQ(s.rescans, 1u) << "a refresh was requested after the first rescan";
    EXPECT_EQ(s.statusWord, 102u);
    EXPECT_EQ(s.driveCount, 4) << "no drive record may be made from a channel";
    ASSERT_EQ(s.channelCount, 4);
    EXPECT_EQ(s.linked, (std::vector<LONG>{0, 1, 2, 3}));
    EXPECT_EQ(s.fromChannel, (std::vector<DWORD>{0, 0, 0, 0}));
  }
  for (std::size_t count : startCommands) EXPECT_EQ(count, 1u);
  std::size_t serialQueries = 0;
  for (const sim::Command& c : machine_->Commands()) {
    serialQueries += c.kind == sim::Command::Kind::HidSerial ? 1 : 0;
  }
  EXPECT_EQ(serialQueries, 2u) << "both HID channels read their identity once";
  EXPECT_TRUE(Controls("firewire", CTL_EVENT_REPLY).empty());
}

// A wait that fails at once on a device that is still there is tried again
// only after a pause: the worker must not spin.
TEST_F(WorkersTest, AWaitThatFailsAtOnceIsRetriedAfterAPause) {
  Install(CountedMachine());
  machine_->FailIo("firewire", sim::Endpoint::Driver, ERROR_INVALID_FUNCTION, -1, CTL_WAIT_EVENT);
  const ULONGLONG start = GetTickCount64();
  Run([&](const std::vector<Pass>& passes) { return passes.size() >= 5; });
  const ULONGLONG elapsed = GetTickCount64() - start;
  const std::size_t waits = Controls("firewire", CTL_WAIT_EVENT).size();
  EXPECT_GE(waits, 2u);
  EXPECT_LE(waits, elapsed / 100 + 2) << "in " << elapsed << " ms";
}

TEST_F(WorkersTest, DrivesThatStayIncompleteAskForOneRescanAtMost) {
  // bare: a gauge drive without letters; loose: no path a status pass can open.
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
  Install(Load(text));
  Run([](const std::vector<Pass>& passes) { return Count(passes, PassKind::Regular) >= 120; });
  EXPECT_LE(passes_.back().rescans, 2u) << "the start-up rescan and at most one more";
  EXPECT_EQ(passes_.back().statusWord, 102u);
}

TEST_F(WorkersTest, PanelEventsOnAControlChannelLightTheDriveAndSetTheAction) {
  Install(CountedMachine());
  int step = 0;
  Run([&](const std::vector<Pass>& passes) {
    const Pass& now = passes.back();
    const bool waiting = Waiting(passes, "firewire");
    switch (step) {
      case 0:
        if (waiting) {
          machine_->Press("firewire", 0x01);
          step = 1;
        }
        return false;
      case 1:  // the marker now holds further replies back
        if (!Controls("firewire", CTL_EVENT_REPLY).empty() && waiting) {
          machine_->Press("firewire", 0x01);
          machine_->Press("firewire", 0x02);
          step = 2;
        }
        return false;
      default:
        return now.channelCount >= 1 && now.pendingAction[0] == 5;
    }
  });
  const std::vector<sim::Command> replies = Controls("firewire", CTL_EVENT_REPLY);
  ASSERT_EQ(replies.size(), 1u);
  EXPECT_TRUE(replies[0].data.empty()) << "the reply carries no input on a driver channel";
  const Pass& last = passes_.back();
  ASSERT_EQ(last.channelCount, 2);
  EXPECT_EQ(last.lightMarker[0], 120u);
  EXPECT_EQ(last.statusWord, 102u);
  EXPECT_EQ(last.rescans, 1u);
}

// Refused removals name the drive (600, 601); then a removal dismounts the
// volume, ejects, and the refresh rebuilds the block without the drive.
TEST_F(WorkersTest, EjectButtonRemovesTheDriveAndTheRescanForgetsIt) {
  Install(CountedMachine());
  machine_->SetEjectVeto("firewire", PNP_VetoOutstandingOpen, "test");
  machine_->SetEjectVeto("enclosure", PNP_VetoOutstandingOpen, "test");
  int step = 0;
  std::size_t ejectPressed = 0, ejectsBefore = 0;
  int dismountsBefore = 0;
  LONG drivesAfterFailures = 0;
  Run([&](const std::vector<Pass>& passes) {
    const Pass& now = passes.back();
    if (step == 0 && Waiting(passes, "firewire")) {
      machine_->Press("firewire", 0x04);
      step = 1;
    } else if (step == 1 && now.statusWord == 600) {
      machine_->Press("enclosure", 0x04);
      step = 2;
    } else if (step == 2 && now.statusWord == 601 && Waiting(passes, "firewire")) {
      drivesAfterFailures = now.driveCount;
      ejectPressed = passes.size();
      ejectsBefore = machine_->Ejects().size();
      dismountsBefore = machine_->DismountCount('H');
      machine_->SetEjectVeto("firewire", PNP_VetoOutstandingOpen, "test", 0);
      machine_->Press("firewire", 0x04);
      step = 3;
    }
    return step == 3 && now.rescans >= 2 && now.statusWord == 102 && now.driveCount == 1;
  });
  ASSERT_EQ(step, 3);
  EXPECT_EQ(drivesAfterFailures, 2) << "the storage worker enumerated again";
  EXPECT_FALSE(machine_->Attached("firewire"));
  EXPECT_TRUE(machine_->Attached("enclosure"));
  EXPECT_EQ(machine_->DismountCount('H'), dismountsBefore + 1)
      << "the drive's volume was taken offline first";
  const std::vector<sim::Machine::EjectRequest> ejects = machine_->Ejects();
  ASSERT_EQ(ejects.size(), ejectsBefore + 1);
  EXPECT_EQ(ejects.back().drive, "firewire");
  EXPECT_FALSE(ejects.back().vetoed);
  for (std::size_t i = ejectPressed; i < passes_.size(); ++i) {
    EXPECT_NE(passes_[i].statusWord, 600u) << "the last removal failed";
  }
  const Pass& last = passes_.back();
  EXPECT_EQ(last.channelCount, 1);
  EXPECT_EQ(last.linked, (std::vector<LONG>{0}));
}

TEST_F(WorkersTest, RemovalFailingAfterTheDriveWentNamesTheDriveTheWorkerLinked) {
  // The gauge drive's HID channel stays, unlinked, after its disk went; a
  // second removal on it fails and names drive 0 all the same.
  std::string text(sim::DefaultMachineText());
  const std::size_t model = text.find("model-code 7B44");
  ASSERT_NE(model, std::string::npos);
  text.replace(model, 15, "model-code 7B43");
  Install(Load(text));
  int step = 0;
  Run([&](const std::vector<Pass>& passes) {
    const Pass& now = passes.back();
    const bool waiting = Waiting(passes, "gauge", sim::Endpoint::Hid);
    if (step == 0 && waiting) {
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
  EXPECT_EQ(passes_.back().statusWord, 600u);
}

TEST_F(WorkersTest, DriveGoneFromAnotherThreadLeavesTheHandleToItsWorker) {
  // The worker is blocked in a read whose cancel never completes: only it can
  // give that read up, so it must be the one to close.
  Install(CountedMachine(R"(
drive lights
  bus 1394
  channel driver
  model-code 5E22
  unit-model EXTERNAL_LIGHTS
  unit-id 0030E0000002C4D5
  serial QX-02C4D5
  volume J fixed 100G 50G
end
)"));
  int step = 0;
  Run([&](const std::vector<Pass>& passes) {
    if (step == 0) {
      if (!Waiting(passes, "lights")) return false;
      machine_->SetCancelDelay("lights", sim::Endpoint::Driver, INFINITE);
      StateLock lock;
      StateBlock* block = monitorState.stateBlock;
      ChannelRecord* gone = nullptr;
      for (int i = 0; i < block->channelCount; ++i) {
        ChannelRecord& channel = block->channels[i];
        if (WideContains(channel.devicePath, WSTR("external_lights")) &&
            channel.mode == kChannelModeGauge) {
          EXPECT_EQ(SendDriveGone(&channel), 1u);
          gone = &channel;
          step = 1;
        }
      }
      EXPECT_EQ(step, 1) << "no gauge-mode driver channel";
      if (gone == nullptr) return true;
      // The worker gives its read up after the grace, but closes only under
      // the mutex, which this script still holds.
      const auto until = std::chrono::steady_clock::now() + std::chrono::milliseconds(200);
      while (gone->deviceHandle != nullptr && std::chrono::steady_clock::now() < until) {
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
      }
      EXPECT_NE(gone->deviceHandle, nullptr) << "closed without the state mutex";
      return false;
    }
    if (passes.back().endedWorkers == 0) return false;
    machine_->FinishHeldCancels();
    return true;
  });
  EXPECT_EQ(step, 1);
  EXPECT_EQ(passes_.back().endedWorkers, 1u) << "only the lights worker ended on its own";
  EXPECT_EQ(machine_->OpenCount("lights", sim::Endpoint::Driver), 0u);
}

TEST_F(WorkersTest, AStatusReadThatTheEnclosureNeverAnswersEndsOnItsTimeOutOrAStop) {
  // A status read under the mutex ends on the device time-out or a stop.
  Install(Load());
  std::atomic<bool> monitorEnded{false};
  std::atomic<int> passesAfterAsk{-1};
  std::thread stopper;
  Run([&](const std::vector<Pass>& passes) {
    if (passesAfterAsk >= 0) passesAfterAsk += 1;
    if (stopper.joinable() || passes.back().rescans < 1) return false;
    machine_->HangIo("enclosure", sim::Endpoint::Enclosure, true);
    machine_->ClearCommands();
    stopper = std::thread([&] {
      // The stop comes while the second status read (page 0x82) is pending.
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
