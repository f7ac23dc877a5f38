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

constexpr char kDiskClass[] = "#{53f56307-b6bf-11d0-94f2-00a0c91efb8b}";

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

// What every drive of the maker in this machine has in common.
DriveRecord MakerDrive(DWORD busKind, int index, const std::string& diskId,
                       const std::string& diskPath, const std::string& parentId) {
  DriveRecord drive{};
  drive.busKind = busKind;
  drive.recordIndex = index;
  const std::string tail = diskId.substr(diskId.rfind('\\') + 1);
  Set(drive.instanceTail, tail);
  Set(drive.instanceKey, tail);
  Set(drive.deviceIdLower, Lower(diskId));
  Set(drive.deviceIdUpper, diskId);
  Set(drive.parentDeviceId, parentId);
  Set(drive.diskPath, diskPath);
  return drive;
}

// The fields an extended identity adds: standard inquiry and vital product
// data as the drive description gives them.
void AddExtendedIdentity(DriveRecord* drive, const std::string& unitSerial,
                         const std::string& modelCode, const std::string& revision, DWORD lastLba,
                         const std::string& vendorCode) {
  drive->extendedIdentity = 1;
  Set(drive->model, "QX External HDD");
  Set(drive->serialNumber, unitSerial);
  Set(drive->modelCode, modelCode);
  Set(drive->revision, revision);
  drive->lastLba = lastLba;
  Set(drive->asciiInfo1, "FW 1.00 2004-11-02");
  Set(drive->asciiInfo2, "BRIDGE 2.10");
  Set(drive->vendorCode, vendorCode);
}

// The row references point into the service's table; their texts are
// checked by the caller. Everything else, reserved bytes included, must match
// exactly; a difference names the offset of its first byte.
void ExpectSameDrive(const DriveRecord& actual, DriveRecord expected, const std::string& name) {
  expected.modelSuffixRef = actual.modelSuffixRef;
  expected.productLineRef = actual.productLineRef;
  EXPECT_EQ(FirstDifference(&actual, &expected, sizeof(DriveRecord)), -1) << name;
}

std::string RefText(const WCHAR* ref) {
  return ref == nullptr ? "(none)" : N(ref);
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

  // ---- drive "gauge": USB, model 7B44, revision 0102, serial QX-7K2A9F31 ----
  const std::string gaugeSerial = "374B324139463331";  // "7K2A9F31" as hexadecimal pairs
  const std::string gaugeDiskId =
      "USBSTOR\\DISK&VEN_QX&PROD_EXTERNAL_HDD&REV_0102\\" + gaugeSerial + "&0";
  DriveRecord gauge =
      MakerDrive(2, 0, gaugeDiskId,
                 "\\\\?\\" + Lower("USBSTOR#DISK&VEN_QX&PROD_EXTERNAL_HDD&REV_0102#") +
                     Lower(gaugeSerial) + "&0" + kDiskClass,
                 "USB\\VID_1A2B&PID_7B44&MI_00\\6&31411000&0&0000");
  gauge.diskNumber = machine_->DiskNumber("gauge");
  gauge.volumeDriveType = DRIVE_FIXED;
  gauge.volumeCount = 1;
  Set(gauge.volumeLetters, "E");
  gauge.busAddress = 1;
  gauge.modelFlags = 0x30;
  gauge.gaugeSegments = 4;
  Set(gauge.firmwareSerial, "QX-7K2A9F31");
  Set(gauge.firmwareSerialHex, "51582D374B324139463331");
  Set(gauge.friendlyName, "QX External HDD USB Device");
  AddExtendedIdentity(&gauge, "7K2A9F31", "7B44", "0102", 976773167, "QXV7B44");
  EXPECT_EQ(RefText(Drive(0).modelSuffixRef), "_7B44");
  EXPECT_EQ(RefText(Drive(0).productLineRef), "(none)");
  ExpectSameDrive(Drive(0), gauge, "gauge");

  // ---- drive "plain": USB, model 2A31, no extended identity ----
  const std::string plainSerial = "354D384232443037";  // "5M8B2D07"
  const std::string plainDiskId =
      "USBSTOR\\DISK&VEN_QX&PROD_EXTERNAL_HDD&REV_0100\\" + plainSerial + "&0";
  DriveRecord plain =
      MakerDrive(2, 1, plainDiskId,
                 "\\\\?\\" + Lower("USBSTOR#DISK&VEN_QX&PROD_EXTERNAL_HDD&REV_0100#") +
                     Lower(plainSerial) + "&0" + kDiskClass,
                 "USB\\VID_1A2B&PID_2A31&MI_00\\6&31411001&0&0000");
  plain.diskNumber = machine_->DiskNumber("plain");
  plain.volumeDriveType = DRIVE_FIXED;
  plain.volumeCount = 2;
  Set(plain.volumeLetters, "FG");
  plain.busAddress = 1;
  Set(plain.firmwareSerial, "QX-5M8B2D07");
  Set(plain.firmwareSerialHex, "51582D354D384232443037");
  Set(plain.model, "QX Portable 250 ");  // the 16-byte model text, untrimmed
  Set(plain.friendlyName, "QX External HDD USB Device");
  EXPECT_EQ(RefText(Drive(1).modelSuffixRef), "_2A31");
  ExpectSameDrive(Drive(1), plain, "plain");

  // ---- drive "firewire": IEEE 1394, model 5E22, unit 0030E0000001A2B3 ----
  DriveRecord fireWire =
      MakerDrive(3, 2, "SBP2\\QX&EXTERNAL_HDD&LUN0\\0030E0000001A2B3",
                 std::string("\\\\?\\sbp2#qx&external_hdd&lun0#0030e0000001a2b3") + kDiskClass,
                 "1394\\QX&EXTERNAL_HDD\\0030E0000001A2B3");
  fireWire.diskNumber = machine_->DiskNumber("firewire");
  fireWire.volumeDriveType = DRIVE_FIXED;
  fireWire.volumeCount = 1;
  Set(fireWire.volumeLetters, "H");
  fireWire.gaugeSegments = 6;
  Set(fireWire.firmwareSerial, "QX-9F1D0A55");
  Set(fireWire.firmwareSerialHex, "51582D3946314430413535");
  Set(fireWire.friendlyName,
      "QX External HDD IEEE 1394 SBP2 Device");  // the vendor field's padding removed
  AddExtendedIdentity(&fireWire, "9F1D0A55", "5E22", "0100", 625142447, "QXD0001");
  EXPECT_EQ(RefText(Drive(2).modelSuffixRef), "_5E22");
  ExpectSameDrive(Drive(2), fireWire, "firewire");

  // ---- drive "enclosure": IEEE 1394 Rambler, model 3C13 ----
  DriveRecord enclosure =
      MakerDrive(3, 3, "SBP2\\QX&QUARRY&LUN0\\0030E00000045D6F",
                 std::string("\\\\?\\sbp2#qx&quarry&lun0#0030e00000045d6f") + kDiskClass,
                 "1394\\QX&QUARRY\\0030E00000045D6F");
  enclosure.diskNumber = machine_->DiskNumber("enclosure");
  enclosure.volumeDriveType = DRIVE_REMOVABLE;
  enclosure.volumeCount = 1;
  Set(enclosure.volumeLetters, "I");
  enclosure.gaugeSegments = 4;
  Set(enclosure.firmwareSerial, "QX-3R7T0N21");
  Set(enclosure.firmwareSerialHex, "51582D33523754304E3231");
  Set(enclosure.friendlyName, "Rambler");  // the model row's product line
  AddExtendedIdentity(&enclosure, "3R7T0N21", "3C13", "0100", 312581807, "QXD0001");
  EXPECT_EQ(RefText(Drive(3).modelSuffixRef), "_3C13");
  EXPECT_EQ(RefText(Drive(3).productLineRef), "Rambler");
  ExpectSameDrive(Drive(3), enclosure, "enclosure");

  // The channel records and their binding are ChannelTest's, on machines
  // built for each rule, and WorkersTest links every channel of this one.
}

}  // namespace
}  // namespace disctest
