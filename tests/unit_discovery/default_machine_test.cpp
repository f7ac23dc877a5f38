// The passes of a rescan (enumeration, volume letters, channel scan) on the
// embedded default machine. Every record is compared byte for byte with a record
// written here from the machine's description: the drives' inquiry data and
// pages, and the instance IDs and interface paths Windows gives such devices.
#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "discovery/channel_scan.h"
#include "discovery/drive_enumeration.h"
#include "discovery_fixture.h"
#include "volume/volume_letters.h"

namespace disctest {
namespace {

// Offset of the first byte that differs, -1 when none does.
long FirstDifference(const void* a, const void* b, std::size_t size) {
  const auto* x = static_cast<const unsigned char*>(a);
  const auto* y = static_cast<const unsigned char*>(b);
  for (std::size_t i = 0; i < size; ++i) {
    if (x[i] != y[i]) return static_cast<long>(i);
  }
  return -1;
}

template <std::size_t N>
void Set(WCHAR (&field)[N], const std::string& text) {
  WideCopy(field, N, W(text));
}

std::string Lower(std::string text) {
  for (char& c : text) {
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  }
  return text;
}

std::string Hex(const std::string& text) {
  std::string hex;
  const char digits[] = "0123456789ABCDEF";
  for (const char c : text) {
    hex += digits[static_cast<unsigned char>(c) >> 4];
    hex += digits[c & 15];
  }
  return hex;
}

std::string RefText(const WCHAR* ref) {
  return ref == nullptr ? "(none)" : N(ref);
}

// One drive of the default machine as its description gives it: the
// instance IDs and paths Windows gives such a device, its volumes, its
// inquiry data and, with an extended identity, its vital product data.
struct Described {
  const char* name;
  DWORD busKind;
  std::string diskId, parentId, letters;
  UINT driveType;
  DWORD busAddress, modelFlags, gaugeSegments;
  std::string firmwareSerial, friendlyName, model, suffix, productLine;
  std::string unitSerial, revision, vendorCode;  // empty: no extended identity
  DWORD lastLba;
};

DriveRecord Expected(const Described& d, int index, DWORD diskNumber) {
  DriveRecord drive{};
  drive.busKind = d.busKind;
  drive.recordIndex = index;
  const std::string tail = d.diskId.substr(d.diskId.rfind('\\') + 1);
  Set(drive.instanceTail, tail);
  Set(drive.instanceKey, tail);
  Set(drive.deviceIdLower, Lower(d.diskId));
  Set(drive.deviceIdUpper, d.diskId);
  Set(drive.parentDeviceId, d.parentId);
  std::string path = Lower(d.diskId);
  for (char& c : path) c = c == '\\' ? '#' : c;
  Set(drive.diskPath, "\\\\?\\" + path + "#{53f56307-b6bf-11d0-94f2-00a0c91efb8b}");
  drive.diskNumber = diskNumber;
  drive.volumeDriveType = d.driveType;
  drive.volumeCount = static_cast<DWORD>(d.letters.size());
  Set(drive.volumeLetters, d.letters);
  drive.busAddress = d.busAddress;
  drive.modelFlags = d.modelFlags;
  drive.gaugeSegments = d.gaugeSegments;
  Set(drive.firmwareSerial, d.firmwareSerial);
  Set(drive.firmwareSerialHex, Hex(d.firmwareSerial));
  Set(drive.friendlyName, d.friendlyName);
  Set(drive.model, d.model);
  if (!d.unitSerial.empty()) {
    drive.extendedIdentity = 1;
    Set(drive.model, "QX External HDD");
    Set(drive.serialNumber, d.unitSerial);
    Set(drive.modelCode, d.suffix.substr(1));
    Set(drive.revision, d.revision);
    drive.lastLba = d.lastLba;
    Set(drive.asciiInfo1, "FW 1.00 2004-11-02");
    Set(drive.asciiInfo2, "BRIDGE 2.10");
    Set(drive.vendorCode, d.vendorCode);
  }
  return drive;
}

class DefaultMachineTest : public DiscoveryTest {
 protected:
  void SetUp() override {
    DiscoveryTest::SetUp();
    std::string error;
    machine_ = sim::LoadMachine(sim::DefaultMachineText(), &error);
    ASSERT_NE(machine_, nullptr) << error;
    machine_->Install();
  }
  void TearDown() override {
    if (machine_ != nullptr) machine_->Uninstall();
    DiscoveryTest::TearDown();
  }
  std::unique_ptr<sim::Machine> machine_;
};

TEST_F(DefaultMachineTest, RescanPassesFillEveryRecordAsTheDescriptionSays) {
  EXPECT_EQ(EnumerateDrives(nullptr), 0);
  AssignVolumeLetters();
  RebuildChannelTable();

  ASSERT_EQ(Block().driveCount, 4);
  EXPECT_EQ(Block().countedDrives, 3);  // the 2A31 drive is of no channel model
  ASSERT_EQ(Block().channelCount, 4);

  // The USB serials are the firmware serials' last eight characters in hexadecimal.
  const Described drives[] = {
      {"gauge", 2, "USBSTOR\\DISK&VEN_QX&PROD_EXTERNAL_HDD&REV_0102\\374B324139463331&0",
       "USB\\VID_1A2B&PID_7B44&MI_00\\6&31411000&0&0000", "E", DRIVE_FIXED, 1, 0x30, 4,
       "QX-7K2A9F31", "QX External HDD USB Device", "", "_7B44", "(none)", "7K2A9F31", "0102",
       "QXV7B44", 976773167},
      // No extended identity: the 16-byte model text, untrimmed.
      {"plain", 2, "USBSTOR\\DISK&VEN_QX&PROD_EXTERNAL_HDD&REV_0100\\354D384232443037&0",
       "USB\\VID_1A2B&PID_2A31&MI_00\\6&31411001&0&0000", "FG", DRIVE_FIXED, 1, 0, 0, "QX-5M8B2D07",
       "QX External HDD USB Device", "QX Portable 250 ", "_2A31", "(none)", "", "", "", 0},
      // The vendor field's padding is removed from the friendly name.
      {"firewire", 3, "SBP2\\QX&EXTERNAL_HDD&LUN0\\0030E0000001A2B3",
       "1394\\QX&EXTERNAL_HDD\\0030E0000001A2B3", "H", DRIVE_FIXED, 0, 0, 6, "QX-9F1D0A55",
       "QX External HDD IEEE 1394 SBP2 Device", "", "_5E22", "(none)", "9F1D0A55", "0100",
       "QXD0001", 625142447},
      // The model row's product line names the drive.
      {"enclosure", 3, "SBP2\\QX&QUARRY&LUN0\\0030E00000045D6F",
       "1394\\QX&QUARRY\\0030E00000045D6F", "I", DRIVE_REMOVABLE, 0, 0, 4, "QX-3R7T0N21", "Rambler",
       "", "_3C13", "Rambler", "3R7T0N21", "0100", "QXD0001", 312581807},
  };
  for (int i = 0; i < 4; ++i) {
    const Described& d = drives[i];
    SCOPED_TRACE(d.name);
    const DriveRecord& actual = Drive(i);
    EXPECT_EQ(RefText(actual.modelSuffixRef), d.suffix);
    EXPECT_EQ(RefText(actual.productLineRef), d.productLine);
    // The row references point into the service's table; every other byte,
    // reserved ones included, must match; a difference names its offset.
    DriveRecord expected = Expected(d, i, machine_->DiskNumber(d.name));
    expected.modelSuffixRef = actual.modelSuffixRef;
    expected.productLineRef = actual.productLineRef;
    EXPECT_EQ(FirstDifference(&actual, &expected, sizeof(DriveRecord)), -1);
  }
  // The channel records and their binding are ChannelTest's, on machines
  // built for each rule, and WorkersTest links every channel of this one.
}

}  // namespace
}  // namespace disctest
