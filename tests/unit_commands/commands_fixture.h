// The machine of unit_features' MachineTest with one more HID drive, whose
// model sends reports with an ID, and an enclosure whose button can be held.
#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <string>
#include <vector>

#include "unit_features/features_fixture.h"

namespace cmdtest {

using featuretest::Bytes;
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

class CommandTest : public featuretest::MachineTest<TestMachine> {
 protected:
  void SetUp() override {
    using featuretest::FireWireDrive;
    using featuretest::UsbHidDrive;
    // gauge: standalone gauge model (mode 1); plain: a model outside the
    // channel list (mode 0); wide: reports with an ID; firewire and lights:
    // button filter driver (modes 0 and 1); enclosure: enclosure services.
    std::vector<sim::DriveSpec> drives = {
        UsbHidDrive("gauge", "7B44", "QX-7K2A9F31", {sim::VolumeSpec{'E'}}),
        UsbHidDrive("plain", "2A31", "QX-5M8B2D07", {sim::VolumeSpec{'F'}}),
        UsbHidDrive("wide", "5E24", "QX-1W2I3D4E", {sim::VolumeSpec{'G'}}),
        FireWireDrive("firewire", sim::ChannelKind::Driver, "EXTERNAL_HDD", "0030E0000001A2B3",
                      {sim::VolumeSpec{'H'}}),
        FireWireDrive("lights", sim::ChannelKind::Driver, "EXTERNAL_LIGHTS", "0030E0000002C4D5",
                      {sim::VolumeSpec{'J'}}),
        FireWireDrive("enclosure", sim::ChannelKind::Enclosure, "QUARRY", "0030E00000045D6F",
                      {sim::VolumeSpec{'I'}}),
    };
    drives[3].identity = 0x1122334455667788ull;
    drives[5].modelCode = "3C13";
    Start(drives, 6);
  }

  ChannelRecord* Wide() { return Channel("pid_5e24"); }

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
};

}  // namespace cmdtest
