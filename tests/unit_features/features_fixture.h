// A drive of each channel kind and mode, the monitor state of a running
// service, the channel records of a rescan with their shared handles open.
// FeatureTest adds the binding and holds the state mutex.
#pragma once

#include <gtest/gtest.h>

#include <cstdlib>
#include <memory>
#include <string>
#include <vector>

#include "discovery/channel_binding.h"
#include "discovery/channel_scan.h"
#include "discovery/drive_enumeration.h"
#include "machine.h"
#include "monitor/monitor_state.h"
#include "platform/wide.h"
#include "service/process_locks.h"
#include "support/channel_helpers.h"
#include "transport/button_events.h"
#include "transport/refresh_on_change.h"
#include "volume/volume_letters.h"

namespace featuretest {

using Bytes = std::vector<std::uint8_t>;
using Kind = sim::Command::Kind;

constexpr std::uint64_t kMiB = 1ull << 20;

using testsupport::Narrow;

inline sim::VolumeSpec Volume(char letter, std::uint64_t sizeMiB = 1000,
                              std::uint64_t freeMiB = 500) {
  sim::VolumeSpec volume;
  volume.letter = letter;
  volume.sizeBytes = sizeMiB * kMiB;
  volume.freeBytes = freeMiB * kMiB;
  return volume;
}

inline sim::DriveSpec UsbHidDrive(const std::string& name, const std::string& model,
                                  const std::string& serial, std::vector<sim::VolumeSpec> volumes) {
  sim::DriveSpec spec;
  spec.name = name;
  spec.bus = sim::Bus::Usb;
  spec.channel = sim::ChannelKind::Hid;
  spec.modelCode = model;
  spec.serial = serial;
  spec.volumes = std::move(volumes);
  return spec;
}

inline sim::DriveSpec FireWireDrive(const std::string& name, sim::ChannelKind channel,
                                    const std::string& unitModel, const std::string& unitId,
                                    std::vector<sim::VolumeSpec> volumes) {
  sim::DriveSpec spec;
  spec.name = name;
  spec.bus = sim::Bus::Ieee1394;
  spec.channel = channel;
  spec.modelCode = "5E22";
  spec.unitModel = unitModel;
  spec.unitId = unitId;
  spec.serial = "QX-" + unitId.substr(8);
  spec.volumes = std::move(volumes);
  return spec;
}

// Channels of mode 1 (gauge: 1000 MiB volumes E and K, 250 and 750 free;
// lights: driver), mode 0 (plain: HID; firewire: driver) and 2 (enclosure).
inline std::vector<sim::DriveSpec> OneDriveOfEachKind() {
  std::vector<sim::DriveSpec> drives = {
      UsbHidDrive("gauge", "7B44", "QX-7K2A9F31", {Volume('E', 1000, 250), Volume('K', 1000, 750)}),
      UsbHidDrive("plain", "2A31", "QX-5M8B2D07", {Volume('F')}),
      FireWireDrive("firewire", sim::ChannelKind::Driver, "EXTERNAL_HDD", "0030E0000001A2B3",
                    {Volume('H')}),
      FireWireDrive("lights", sim::ChannelKind::Driver, "EXTERNAL_LIGHTS", "0030E0000002C4D5",
                    {Volume('J')}),
      FireWireDrive("enclosure", sim::ChannelKind::Enclosure, "QUARRY", "0030E00000045D6F",
                    {Volume('I')}),
  };
  drives.back().modelCode = "3C13";
  return drives;
}

// The machine `M` with `drives` installed, the rescan passes run and every
// channel's shared handle open.
template <typename M>
class MachineTest : public ::testing::Test {
 protected:
  void Start(const std::vector<sim::DriveSpec>& drives, int channels) {
    InitializeProcessLocks();
    ForgetRefreshConditions();
    monitorState = MonitorState{};
    monitorState.tick = 1;
    monitorState.osKind = kOsXpOrLater;
    monitorState.stateMutex = CreateMutexW(nullptr, FALSE, nullptr);
    monitorState.workerStopEvent = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    block_.reset(static_cast<StateBlock*>(std::calloc(1, sizeof(StateBlock))));
    monitorState.stateBlock = block_.get();
    for (const sim::DriveSpec& drive : drives) machine_.AddDrive(drive);
    machine_.Install();
    EnumerateDrives(nullptr);
    AssignVolumeLetters();
    RebuildChannelTable();
    ASSERT_EQ(Block().channelCount, channels);
    for (int i = 0; i < channels; ++i) testsupport::OpenSharedChannelHandle(&Block().channels[i]);
    machine_.ClearCommands();
  }

  void TearDown() override {
    testsupport::CloseChannelHandles(Block());
    machine_.WaitForDeviceEvents();
    machine_.Uninstall();
    for (HANDLE handle : {monitorState.workerStopEvent, monitorState.stopEvent}) {
      if (handle != nullptr) CloseHandle(handle);
    }
    CloseHandle(monitorState.stateMutex);
    monitorState = MonitorState{};
  }

  StateBlock& Block() { return *block_; }
  ChannelRecord* Channel(const std::string& part) {
    return testsupport::FindChannel(Block(), part);
  }
  ChannelRecord* Gauge() { return Channel("pid_7b44"); }
  ChannelRecord* Plain() { return Channel("pid_2a31"); }
  ChannelRecord* FireWire() { return Channel("external_hdd#"); }
  ChannelRecord* Lights() { return Channel("external_lights#"); }
  ChannelRecord* Enclosure() { return Channel("_ses"); }

  // What the drive received of one kind, in order.
  std::vector<sim::Command> Sent(const std::string& drive, Kind kind) {
    std::vector<sim::Command> out;
    for (const sim::Command& command : machine_.Commands(drive)) {
      if (command.kind == kind) out.push_back(command);
    }
    return out;
  }

  struct FreeBlock {
    void operator()(StateBlock* block) const { std::free(block); }
  };
  std::unique_ptr<StateBlock, FreeBlock> block_;
  M machine_;
};

class FeatureTest : public MachineTest<sim::Machine> {
 protected:
  // Lets a case change a drive before the machine is installed.
  virtual void Customize(std::vector<sim::DriveSpec>* /*drives*/) {}

  void SetUp() override {
    std::vector<sim::DriveSpec> drives = OneDriveOfEachKind();
    Customize(&drives);
    Start(drives, 5);
    if (HasFatalFailure()) return;
    monitorState.stopEvent = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    // The callers of every procedure here hold the state mutex.
    ASSERT_EQ(WaitForSingleObject(monitorState.stateMutex, 0), WAIT_OBJECT_0);
    for (int i = 0; i < Block().channelCount; ++i) {
      ChannelRecord& channel = Block().channels[i];
      // HID channels are matched by the serial string their worker reads.
      if (channel.kind == kChannelKindHid) {
        ASSERT_EQ(ReadDriveIdentity(&channel, nullptr, 0), 1u);
      }
      ASSERT_GE(BindChannelToDrive(&channel, nullptr, 0), 0) << Narrow(channel.devicePath);
      ASSERT_GE(channel.linkedDrive, 0);
    }
    machine_.ClearCommands();
  }

  void TearDown() override {
    ReleaseMutex(monitorState.stateMutex);
    MachineTest::TearDown();
  }

  // The working drive record the channel is linked to, and a private copy.
  DriveRecord& Working(const ChannelRecord* channel) {
    return Block().drives[channel->linkedDrive];
  }
  DriveRecord CopyOf(const ChannelRecord* channel) { return Working(channel); }

  // Value bytes of the HID output reports written (report ID stripped).
  std::vector<Bytes> HidValues(const std::string& drive) {
    std::vector<Bytes> out;
    for (const sim::Command& c : Sent(drive, Kind::HidOutput)) {
      out.push_back(Bytes(c.data.begin() + 1, c.data.begin() + 3));
    }
    return out;
  }
  // Data of one button-filter-driver control the drive got, in order.
  std::vector<Bytes> ControlData(const std::string& drive, DWORD code) {
    std::vector<Bytes> out;
    for (const sim::Command& c : Sent(drive, Kind::Control)) {
      if (c.code == code) out.push_back(c.data);
    }
    return out;
  }
  // SEND DIAGNOSTIC pages (page code and parameter byte) an enclosure got.
  std::vector<Bytes> EnclosurePages(const std::string& drive) {
    std::vector<Bytes> out;
    for (const sim::Command& c : Sent(drive, Kind::Scsi)) {
      if (c.code == 0x1D && c.data.size() >= 5) out.push_back(Bytes{c.data[0], c.data[4]});
    }
    return out;
  }
};

}  // namespace featuretest
