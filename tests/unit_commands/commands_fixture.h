// The machine of unit_features' MachineTest with one more HID drive, and an
// enclosure whose button can be held.
#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "transport/pass_through.h"
#include "unit_features/features_fixture.h"

namespace cmdtest {

using featuretest::Bytes;
using testsupport::Narrow;

// A machine that keeps every pass-through request block handed to a device,
// and whose enclosure button can be held: each read of its event page is
// preceded by a press.
class TestMachine : public sim::Machine {
 public:
  struct Request {
    PassThroughRequest block;
    const void* input;
    void* output;
    DWORD inputLength, outputLength;
  };
  std::atomic<bool> holdEnclosureButton{false};
  std::mutex requestsLock;
  std::vector<Request> requests;

  std::unique_ptr<emu::DeviceFile> Open(const WCHAR* path, DWORD access, DWORD share, DWORD flags,
                                        DWORD* error) override;
};

class WatchedFile : public emu::DeviceFile {
 public:
  WatchedFile(std::unique_ptr<emu::DeviceFile> inner, TestMachine* machine)
      : inner_(std::move(inner)), machine_(machine) {}
  emu::IoStart Control(DWORD code, const void* input, DWORD inputLength, void* output,
                       DWORD outputLength, const emu::IoRequestPtr& request) override {
    if (code == IOCTL_SCSI_PASS_THROUGH_DIRECT && inputLength >= sizeof(PassThroughRequest)) {
      const auto* block = static_cast<const PassThroughRequest*>(input);
      if (machine_->holdEnclosureButton && block->spt.Cdb[0] == 0x1C && block->spt.Cdb[2] == 0x80) {
        machine_->Press("enclosure", 0x04);
      }
      std::lock_guard<std::mutex> lock(machine_->requestsLock);
      machine_->requests.push_back({*block, input, output, inputLength, outputLength});
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
  if (file == nullptr) return file;
  return std::make_unique<WatchedFile>(std::move(file), this);
}

class CommandTest : public featuretest::MachineTest<TestMachine> {
 protected:
  void SetUp() override {
    // The drives of unit_features, and one whose reports carry an ID.
    std::vector<sim::DriveSpec> drives = featuretest::OneDriveOfEachKind();
    drives.push_back(featuretest::UsbHidDrive("wide", "5E24", "QX-1W2I3D4E", {}));
    drives[2].identity = 0x1122334455667788ull;
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
