// A working state block and a simulated computer for the discovery tests.
#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <string>

#include "machine.h"
#include "monitor/monitor_state.h"
#include "platform/wide.h"
#include "service/process_locks.h"

namespace disctest {

inline WideString W(const std::string& text) {
  return Utf8ToWide(text);
}
inline std::string N(const WCHAR* text) {
  return WideToUtf8(WideView(text, WideLength(text)));
}

// A USB drive with every identifier spelled out, not derived by the simulator.
inline sim::DriveSpec UsbDrive(const std::string& name, const std::string& modelCode,
                               const std::string& usbSerial) {
  sim::DriveSpec spec;
  spec.name = name;
  spec.bus = sim::Bus::Usb;
  spec.channel = sim::ChannelKind::None;
  spec.modelCode = modelCode;
  spec.usbPid = modelCode;
  spec.usbSerial = usbSerial;
  spec.diskInstanceId = "USBSTOR\\DISK&VEN_QX&PROD_EXTERNAL_HDD&REV_0100\\" + usbSerial + "&0";
  spec.parentInstanceId = "USB\\VID_1A2B&PID_" + modelCode + "&MI_00\\6&" + usbSerial + "&0&0000";
  spec.diskPath = "\\\\?\\usbstor#disk&ven_qx&prod_external_hdd&rev_0100#" + usbSerial +
                  "&0#{53f56307-b6bf-11d0-94f2-00a0c91efb8b}";
  spec.friendlyName = "QX External HDD USB Device";
  return spec;
}

inline sim::DriveSpec HidDrive(const std::string& name, const std::string& modelCode,
                               const std::string& usbSerial) {
  sim::DriveSpec spec = UsbDrive(name, modelCode, usbSerial);
  spec.channel = sim::ChannelKind::Hid;
  spec.hidInstanceId = "HID\\VID_1A2B&PID_" + modelCode + "&MI_01\\7&" + usbSerial + "&0&0000";
  return spec;
}

// An IEEE 1394 drive of the maker, identifiers spelled out likewise.
inline sim::DriveSpec FireWireDrive(const std::string& name, const std::string& modelCode,
                                    const std::string& unitId) {
  sim::DriveSpec spec;
  spec.name = name;
  spec.bus = sim::Bus::Ieee1394;
  spec.channel = sim::ChannelKind::None;
  spec.modelCode = modelCode;
  spec.unitId = unitId;
  spec.diskInstanceId = "SBP2\\QX&EXTERNAL_HDD&LUN0\\" + unitId;
  spec.parentInstanceId = "1394\\QX&EXTERNAL_HDD\\" + unitId;
  spec.diskPath =
      "\\\\?\\sbp2#qx&external_hdd&lun0#" + unitId + "#{53f56307-b6bf-11d0-94f2-00a0c91efb8b}";
  spec.friendlyName = "QX       External HDD IEEE 1394 SBP2 Device";  // vendor field padded to 8
  return spec;
}

class DiscoveryTest : public ::testing::Test {
 protected:
  void SetUp() override {
    InitializeProcessLocks();
    block_ = std::make_unique<StateBlock>();
    monitorState = MonitorState{};
    monitorState.tick = 1;
    monitorState.osKind = kOsXpOrLater;
    monitorState.stateBlock = block_.get();
  }

  void TearDown() override {
    monitorState.stateBlock = nullptr;
    if (installed_) machine_.Uninstall();
  }

  void Install() {
    machine_.Install();
    installed_ = true;
  }

  // The stored channel whose device has this instance ID, or null.
  ChannelRecord* ChannelOf(const std::string& instanceId) {
    for (LONG i = 0; i < Block().channelCount; ++i) {
      if (N(Channel(i).deviceInstanceId) == instanceId) return &Channel(i);
    }
    return nullptr;
  }

  StateBlock& Block() { return *block_; }
  DriveRecord& Drive(int index) { return block_->drives[index]; }
  ChannelRecord& Channel(int index) { return block_->channels[index]; }

  sim::Machine machine_;

 private:
  std::unique_ptr<StateBlock> block_;
  bool installed_ = false;
};

}  // namespace disctest
