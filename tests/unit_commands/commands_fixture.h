// A machine with one drive of each channel kind, the monitor state a running
// service would have (mutex, working block, worker stop event), the channel
// records as a rescan builds them and each channel's shared handle opened as
// the worker starter opens it.
#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <memory>
#include <string>
#include <vector>

#include "discovery/channel_scan.h"
#include "discovery/drive_enumeration.h"
#include "machine.h"
#include "monitor/monitor_state.h"
#include "platform/wide.h"
#include "service/process_locks.h"
#include "support/channel_helpers.h"
#include "transport/refresh_on_change.h"
#include "volume/volume_letters.h"

namespace cmdtest {

using Bytes = std::vector<std::uint8_t>;

using testsupport::Narrow;

// A machine whose enclosure can be told to keep reporting the removal bit:
// every read of its event page is preceded by a press, as if the button were
// held down.
class TestMachine : public sim::Machine {
 public:
  std::atomic<bool> holdEnclosureButton{false};

  std::unique_ptr<emu::DeviceFile> Open(const WCHAR* path, DWORD access, DWORD share, DWORD flags,
                                        DWORD* error) override;
};

class HeldButtonFile : public emu::DeviceFile {
 public:
  HeldButtonFile(std::unique_ptr<emu::DeviceFile> inner, TestMachine* machine)
      : inner_(std::move(inner)), machine_(machine) {}
  emu::IoStart Control(DWORD code, const void* input, DWORD inputLength, void* output,
                       DWORD outputLength, const emu::IoRequestPtr& request) override {
    if (machine_->holdEnclosureButton && code == IOCTL_SCSI_PASS_THROUGH_DIRECT &&
        input != nullptr && inputLength >= sizeof(SCSI_PASS_THROUGH_DIRECT)) {
      const auto* sptd = static_cast<const SCSI_PASS_THROUGH_DIRECT*>(input);
      if (sptd->Cdb[0] == 0x1C && sptd->Cdb[2] == 0x80) machine_->Press("enclosure", 0x04);
    }
    return inner_->Control(code, input, inputLength, output, outputLength, request);
  }
  emu::IoStart Read(void* buffer, DWORD length, const emu::IoRequestPtr& request) override {
    return inner_->Read(buffer, length, request);
  }
  emu::IoStart Write(const void* buffer, DWORD length, const emu::IoRequestPtr& request) override {
    return inner_->Write(buffer, length, request);
  }
  void Cancel(const emu::IoRequestPtr& request) override { inner_->Cancel(request); }
  void Closed() override { inner_->Closed(); }

 private:
  std::unique_ptr<emu::DeviceFile> inner_;
  TestMachine* machine_;
};

inline std::unique_ptr<emu::DeviceFile> TestMachine::Open(const WCHAR* path, DWORD access,
                                                          DWORD share, DWORD flags, DWORD* error) {
  std::unique_ptr<emu::DeviceFile> file = sim::Machine::Open(path, access, share, flags, error);
  if (file != nullptr && Narrow(path).find("_ses") != std::string::npos) {
    return std::make_unique<HeldButtonFile>(std::move(file), this);
  }
  return file;
}

inline sim::DriveSpec UsbHidDrive(const std::string& name, const std::string& model,
                                  const std::string& serial, char letter) {
  sim::DriveSpec spec;
  spec.name = name;
  spec.bus = sim::Bus::Usb;
  spec.channel = sim::ChannelKind::Hid;
  spec.modelCode = model;
  spec.serial = serial;
  spec.volumes = {sim::VolumeSpec{letter}};
  return spec;
}

inline sim::DriveSpec FireWireDrive(const std::string& name, sim::ChannelKind channel,
                                    const std::string& unitModel, const std::string& unitId,
                                    char letter) {
  sim::DriveSpec spec;
  spec.name = name;
  spec.bus = sim::Bus::Ieee1394;
  spec.channel = channel;
  spec.modelCode = "5E22";
  spec.unitModel = unitModel;
  spec.unitId = unitId;
  spec.serial = "QX-" + unitId.substr(8);
  spec.volumes = {sim::VolumeSpec{letter}};
  return spec;
}

class CommandTest : public ::testing::Test {
 protected:
  void SetUp() override {
    InitializeProcessLocks();
    ForgetRefreshConditions();
    monitorState = MonitorState{};
    monitorState.tick = 1;
    monitorState.osKind = kOsXpOrLater;
    monitorState.stateMutex = CreateMutexW(nullptr, FALSE, nullptr);
    monitorState.workerStopEvent = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    block_.reset(static_cast<StateBlock*>(std::calloc(1, sizeof(StateBlock))));
    monitorState.stateBlock = block_.get();

    // gauge: HID, standalone gauge model (mode 1); plain: HID of a model
    // outside the channel list (mode 0); wide: HID whose model sends reports
    // with an ID; firewire: button filter driver (mode 0); lights: button
    // filter driver of a unit with lights (mode 1); enclosure: IEEE 1394
    // enclosure services (mode 2).
    machine_.AddDrive(UsbHidDrive("gauge", "7B44", "QX-7K2A9F31", 'E'));
    machine_.AddDrive(UsbHidDrive("plain", "2A31", "QX-5M8B2D07", 'F'));
    machine_.AddDrive(UsbHidDrive("wide", "5E24", "QX-1W2I3D4E", 'G'));
    sim::DriveSpec fireWire = FireWireDrive("firewire", sim::ChannelKind::Driver, "EXTERNAL_HDD",
                                            "0030E0000001A2B3", 'H');
    fireWire.identity = 0x1122334455667788ull;
    machine_.AddDrive(fireWire);
    machine_.AddDrive(FireWireDrive("lights", sim::ChannelKind::Driver, "EXTERNAL_LIGHTS",
                                    "0030E0000002C4D5", 'J'));
    sim::DriveSpec enclosure =
        FireWireDrive("enclosure", sim::ChannelKind::Enclosure, "QUARRY", "0030E00000045D6F", 'I');
    enclosure.modelCode = "3C13";
    machine_.AddDrive(enclosure);
    machine_.Install();

    EnumerateDrives(nullptr);
    AssignVolumeLetters();
    RebuildChannelTable();
    ASSERT_EQ(Block().channelCount, 6);
    for (int i = 0; i < Block().channelCount; ++i) OpenShared(&Block().channels[i]);
    machine_.ClearCommands();
  }

  void TearDown() override {
    testsupport::CloseChannelHandles(Block());
    machine_.WaitForDeviceEvents();
    machine_.Uninstall();
    CloseHandle(monitorState.workerStopEvent);
    CloseHandle(monitorState.stateMutex);
    monitorState = MonitorState{};
  }

  static void OpenShared(ChannelRecord* channel) { testsupport::OpenSharedChannelHandle(channel); }

  StateBlock& Block() { return *block_; }

  ChannelRecord* Channel(const std::string& part) {
    return testsupport::FindChannel(Block(), part);
  }
  ChannelRecord* Gauge() { return Channel("pid_7b44"); }
  ChannelRecord* Plain() { return Channel("pid_2a31"); }
  ChannelRecord* Wide() { return Channel("pid_5e24"); }
  ChannelRecord* FireWire() { return Channel("external_hdd#"); }
  ChannelRecord* Lights() { return Channel("external_lights#"); }
  ChannelRecord* Enclosure() { return Channel("_ses"); }

  // What the drive received of one kind, in order.
  std::vector<sim::Command> Sent(const std::string& drive, sim::Command::Kind kind) {
    std::vector<sim::Command> out;
    for (const sim::Command& command : machine_.Commands(drive)) {
      if (command.kind == kind) out.push_back(command);
    }
    return out;
  }
  std::vector<Bytes> HidReports(const std::string& drive) {
    std::vector<Bytes> out;
    for (const sim::Command& c : Sent(drive, sim::Command::Kind::HidOutput)) out.push_back(c.data);
    return out;
  }
  // SCSI commands with the given operation code.
  std::vector<sim::Command> Scsi(const std::string& drive, std::uint8_t operation) {
    std::vector<sim::Command> out;
    for (const sim::Command& c : Sent(drive, sim::Command::Kind::Scsi)) {
      if (c.code == operation) out.push_back(c);
    }
    return out;
  }

  struct FreeBlock {
    void operator()(StateBlock* block) const { std::free(block); }
  };
  std::unique_ptr<StateBlock, FreeBlock> block_;
  TestMachine machine_;
};

}  // namespace cmdtest
