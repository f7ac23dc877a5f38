// Drive records, channel records and their binding, and the drives' volumes,
// against simulated computers.
#include <gtest/gtest.h>

#include <chrono>
#include <cstring>
#include <future>
#include <string>

#include "discovery/channel_binding.h"
#include "discovery/channel_scan.h"
#include "discovery/disk_number.h"
#include "discovery/drive_enumeration.h"
#include "discovery/model_table.h"
#include "discovery_fixture.h"
#include "platform/diagnostics.h"
#include "service/interface_classes.h"
#include "support/test_support.h"
#include "volume/dismount.h"
#include "volume/volume_letters.h"

namespace disctest {
namespace {

constexpr char kHidGuid[] = "{4d1e55b2-f16f-11cf-88cb-001111000030}";
constexpr char kClassAGuid[] = "{6b1e0c27-5a94-4d3b-9f10-2c7e8a41d5b3}";
constexpr char kClassBGuid[] = "{a37f52d9-0e6c-4b81-8d24-f91b6c3e7a05}";
constexpr char kClassCGuid[] = "{1d9c4e6a-73b2-4f05-a6e8-5b20c9d41f7e}";

std::string Lower(std::string text) {
  for (char& c : text) {
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  }
  return text;
}

// The interface path Windows gives an interface of a device node.
std::string PathOf(const std::string& instanceId, const char* classGuid) {
  std::string path = Lower(instanceId);
  for (char& c : path) c = c == '\\' ? '#' : c;
  return "\\\\?\\" + path + "#" + classGuid;
}

sim::DriveSpec DriverDrive(const std::string& name, const std::string& unitId, int driverClass,
                           const std::string& controlInstanceId) {
  sim::DriveSpec spec = FireWireDrive(name, "5E22", unitId);
  spec.channel = sim::ChannelKind::Driver;
  spec.driverClass = driverClass;
  spec.controlInstanceId = controlInstanceId;
  return spec;
}

sim::DriveSpec EnclosureDrive(const std::string& name, const std::string& unitId,
                              int enclosureClass) {
  sim::DriveSpec spec = FireWireDrive(name, "3C13", unitId);
  spec.channel = sim::ChannelKind::Enclosure;
  spec.unitModel = "QUARRY";
  spec.enclosureClass = enclosureClass;
  spec.controlInstanceId = "SBP2\\QX&QUARRY_SES&LUN1\\" + unitId;
  return spec;
}

using EnumerationTest = DiscoveryTest;

TEST_F(EnumerationTest, OnlyReadableDisksOfTheMakersModelsBecomeRecords) {
  sim::DriveSpec usbWithoutMaker = UsbDrive("no-qx", "7B44", "4E4F5158");
  usbWithoutMaker.diskPath =
      "\\\\?\\usbstor#disk&ven_acme&prod_external_hdd#4e4f5158&0#{53f56307-b6bf-11d0-94f2-"
      "00a0c91efb8b}";
  sim::DriveSpec rambler = FireWireDrive("rambler", "5E22", "0030E00000000002");
  rambler.diskPath =
      "\\\\?\\sbp2#orvanel&rambler&lun0#0030e00000000002#{53f56307-b6bf-11d0-94f2-00a0c91efb8b}";
  sim::DriveSpec enough32 = UsbDrive("enough", "7B44", "3332");
  enough32.additionalLength = 32;
  sim::DriveSpec orphan = UsbDrive("orphan", "7B44", "4F525048");
  orphan.parentInstanceId = "USB\\VID_1A2B&PID_9999&MI_00\\6&2A0B&0&0000";
  orphan.asciiInfo1 = "ORPHAN INFO";
  sim::DriveSpec plain = UsbDrive("plain", "2A31", "504C4149");
  plain.rcsIdentity = false;  // no extended identity: no vendor pages read
  plain.modelCode = "2A34";   // the inquiry names another row than the parent
  sim::DriveSpec short31 = UsbDrive("short", "7B44", "3331");
  short31.additionalLength = 31;
  machine_.AddDrive(usbWithoutMaker);
  machine_.AddDrive(rambler);
  machine_.AddDrive(UsbDrive("closed", "7B44", "434C"));
  machine_.AddDrive(UsbDrive("mute", "7B44", "4D55"));
  machine_.AddDrive(enough32);
  machine_.AddDrive(UsbDrive("nonumber", "7B44", "4E4E"));
  machine_.AddDrive(orphan);
  machine_.AddDrive(plain);
  machine_.AddDrive(short31);
  machine_.FailOpen("closed", sim::Endpoint::Disk, ERROR_ACCESS_DENIED);
  machine_.FailIo("mute", sim::Endpoint::Disk, ERROR_NOT_READY, -1, 0x12);
  machine_.FailIo("nonumber", sim::Endpoint::Disk, ERROR_NOT_READY, -1,
                  IOCTL_STORAGE_GET_DEVICE_NUMBER);
  Install();

  EXPECT_EQ(EnumerateDrives(nullptr), 0);
  ASSERT_EQ(Block().driveCount, 4);
  EXPECT_EQ(N(Drive(0).diskPath), rambler.diskPath);
  EXPECT_EQ(N(Drive(1).diskPath), enough32.diskPath);
  // A failed device number query keeps the disk, with a number no volume carries.
  EXPECT_TRUE(WideContains(Drive(2).deviceIdUpper, WSTR("4E4E")));
  EXPECT_EQ(Drive(2).diskNumber, kUnknownDiskNumber);
  // A USB disk needs a model suffix in its parent, whose row replaces the
  // one of the model code; nothing of the orphan read before stays.
  EXPECT_EQ(N(Drive(3).diskPath), plain.diskPath);
  EXPECT_EQ(N(Drive(3).modelSuffixRef), "_2A31");
  EXPECT_EQ(Drive(3).asciiInfo1[0], 0);
  // Nor of the short disk in the slot it was read into.
  EXPECT_EQ(Drive(4).diskPath[0], 0);
  EXPECT_EQ(Drive(4).busKind, 0u);
  // The skipped disks were never opened, or closed after the failure.
  EXPECT_TRUE(machine_.Commands("no-qx").empty());
  EXPECT_EQ(machine_.OpenCount("mute", sim::Endpoint::Disk), 0u);
}

TEST_F(EnumerationTest, SerialTextOfOnlyThePrefixBecomesNaWithoutAsciiPages) {
  sim::DriveSpec spec = FireWireDrive("bare", "5E24", "0030E0000000BA5E");
  spec.serial = "QX-";
  spec.vpdPages = {0x00, 0x80, 0x83, 0xC0};  // page list without 0x01 and 0x02
  spec.unitSerial = "UNITSER1";
  machine_.AddDrive(spec);
  // Lists the ASCII pages but rejects page 0x80 (and lacks 0xC1): the
  // serial text of the inquiry data stays.
  sim::DriveSpec lacking = FireWireDrive("lacking", "5E24", "0030E0000000CA5E");
  lacking.serial = "QX-4F2C11";
  lacking.vpdPages = {0x00, 0x01, 0x02, 0xC0};
  machine_.AddDrive(lacking);
  Install();

  EnumerateDrives(nullptr);
  ASSERT_EQ(Block().driveCount, 2);
  EXPECT_EQ(N(Drive(1).serialNumber), "4F2C11");
  EXPECT_EQ(N(Drive(1).asciiInfo1), lacking.asciiInfo1);
  EXPECT_EQ(Drive(1).vendorCode[0], 0);
  const DriveRecord& drive = Drive(0);
  EXPECT_EQ(drive.extendedIdentity, 1u);
  EXPECT_EQ(N(drive.serialNumber), "NA");  // page 0x80 is not read either
  EXPECT_EQ(N(drive.firmwareSerial), "QX-");
  EXPECT_EQ(N(drive.firmwareSerialHex), "51582D");
  EXPECT_EQ(drive.asciiInfo1[0], 0);
  EXPECT_EQ(drive.asciiInfo2[0], 0);
  EXPECT_EQ(drive.vendorCode[0], 0);
}

TEST_F(EnumerationTest, ModelKeySelectsTheModelRow) {
  sim::DriveSpec blank = FireWireDrive("blank", "    ", "0030E00000000B1A");
  sim::DriveSpec flagged = FireWireDrive("flagged", "5E24", "0030E00000000F1A");
  flagged.rcsIdentity = false;  // extended identity from the row's flag alone
  sim::DriveSpec rambler = FireWireDrive("rambler", "3C13", "0030E0000000AB1E");
  sim::DriveSpec named = FireWireDrive("named", "3C14", "0030E0000000AB1F");
  named.friendlyName = "My Rambler drive";
  machine_.AddDrive(blank);
  machine_.AddDrive(flagged);
  machine_.AddDrive(rambler);
  machine_.AddDrive(named);
  Install();

  EnumerateDrives(nullptr);
  ASSERT_EQ(Block().driveCount, 4);
  // Four spaces make an empty key, which selects the first row.
  EXPECT_EQ(N(Drive(0).modelSuffixRef), "_2A30");
  EXPECT_EQ(N(Drive(0).modelCode), "    ");
  EXPECT_EQ(N(Drive(1).modelSuffixRef), "_5E24");
  EXPECT_EQ(Drive(1).modelFlags, 0x10u);
  EXPECT_EQ(Drive(1).gaugeSegments, 6u);
  EXPECT_EQ(Drive(1).extendedIdentity, 1u);
  EXPECT_EQ(N(Drive(2).modelSuffixRef), "_3C13");
  EXPECT_EQ(N(Drive(2).productLineRef), "Rambler");
  EXPECT_EQ(N(Drive(2).friendlyName), "Rambler");
  EXPECT_EQ(N(Drive(3).friendlyName), "My Rambler drive");  // already names the line
}

TEST_F(EnumerationTest, SeventyDisksCountSixtyThreeAndKeepTheLastInTheScratchSlot) {
  constexpr int kDisks = 70;
  for (int i = 0; i < kDisks; ++i) {
    char serial[16];
    std::snprintf(serial, sizeof(serial), "5345%04d", i);
    sim::DriveSpec spec = HidDrive("d" + std::to_string(i), "7B44", serial);
    spec.rcsIdentity = false;
    machine_.AddDrive(spec);
  }
  // A driver channel scanned after the seventy HID channels.
  const std::string lightsId = "1394\\QX&LIGHTS\\1A2B3C4D5E";
  machine_.AddInterface(machine_.AddNode(machine_.RootNode(), lightsId, "lights"),
                        sim::kVendorClassA);
  Install();

  EXPECT_EQ(EnumerateDrives(nullptr), 0);
  EXPECT_EQ(Block().driveCount, 63);
  EXPECT_EQ(Block().countedDrives, kDisks);  // every parent is of a channel model
  EXPECT_TRUE(WideContains(Drive(0).deviceIdUpper, WSTR("53450000")));
  EXPECT_TRUE(WideContains(Drive(63).deviceIdUpper, WSTR("53450069")));
  EXPECT_EQ(Drive(63).recordIndex, 63);

  // The channels likewise; the 64th record holds the last one alone.
  RebuildChannelTable();
  EXPECT_EQ(Block().channelCount, 63);
  const ChannelRecord& scratch = Channel(63);
  ASSERT_EQ(N(scratch.deviceInstanceId), lightsId);
  EXPECT_EQ(scratch.kind, 3u);
  for (const WCHAR* text : {scratch.deviceInstanceId, scratch.devicePath}) {
    for (std::size_t i = WideLength(text); i < 256; ++i) ASSERT_EQ(text[i], 0) << i;
  }
}

TEST_F(EnumerationTest, NoDiskLeavesEverythingZero) {
  std::memset(&Block().drives[5], 0xAB, sizeof(DriveRecord));
  Block().driveCount = 9;
  Block().countedDrives = 4;
  Install();

  EXPECT_EQ(EnumerateDrives(nullptr), -1);
  EXPECT_EQ(Block().driveCount, 0);
  EXPECT_EQ(Block().countedDrives, 0);
  const DriveRecord zero{};
  for (int i = 0; i < kMaxDrives; ++i) {
    EXPECT_EQ(std::memcmp(&Block().drives[i], &zero, sizeof(zero)), 0) << i;
  }
}

using ChannelTest = DiscoveryTest;

TEST_F(ChannelTest, ScanClassifiesEachInterface) {
  // The composite device is found whatever language its description is in.
  machine_.SetLanguage(sim::Language::German);
  machine_.AddDrive(HidDrive("plain", "2A31", "504C41494E"));
  machine_.SetLanguage(sim::Language::English);
  machine_.AddDrive(HidDrive("gauge", "7B44", "4741554745"));
  machine_.SetLanguage(sim::Language::Japanese);
  machine_.AddDrive(HidDrive("listed", "5E22", "4C49535445"));
  machine_.SetLanguage(sim::Language::English);
  // Someone's mouse: an HID collection of no listed model.
  const DEVINST mouse =
      machine_.AddNode(machine_.RootNode(), "HID\\VID_046D&PID_C52B\\8&1&0&0000", "HID mouse");
  machine_.AddInterface(mouse, emu::kHidInterfaceClass);
  machine_.AddDrive(EnclosureDrive("sesA", "0030E0000000E0A1", 1));
  machine_.AddDrive(EnclosureDrive("sesC", "0030E0000000E0C3", 3));
  machine_.AddDrive(DriverDrive("buttons", "0030E00000000C0C", 3,
                                "1394\\QX&EXTERNAL_HDD&BUTTONS\\0030E00000000C0C"));
  machine_.AddDrive(DriverDrive("lights", "0030E00000000D0D", 1, "1394\\QX&LIGHTS\\1A2B3C4D5E"));
  machine_.AddDrive(
      DriverDrive("other", "0030E00000000E0E", 2, "1394\\ACME&DISK\\0030E00000000E0E"));
  // Neither QX nor a known unit prefix: no channel.
  machine_.AddDrive(
      DriverDrive("unknown", "0011220000000F0F", 2, "1394\\ACME&DISK\\0011220000000F0F"));
  Install();
  RebuildChannelTable();

  const struct {
    std::string id;
    const char* guid;
    DWORD kind, mode, mayCreate;
    std::string tail, serialKey;
    bool control;
  } rows[] = {
      // HID mode and creation follow the two model lists; the key is the
      // serial of the composite USB device above.
      {"HID\\VID_1A2B&PID_2A31&MI_01\\7&504C41494E&0&0000", kHidGuid, 2, 0, 0, "", "504C41494E",
       false},
      {"HID\\VID_1A2B&PID_7B44&MI_01\\7&4741554745&0&0000", kHidGuid, 2, 1, 1, "", "4741554745",
       false},
      {"HID\\VID_1A2B&PID_5E22&MI_01\\7&4C49535445&0&0000", kHidGuid, 2, 1, 0, "", "4C49535445",
       false},
      // Enclosures under any vendor class; only class C is a control interface.
      {"SBP2\\QX&QUARRY_SES&LUN1\\0030E0000000E0A1", kClassAGuid, 3, 2, 1, "0030E0000000E0A1",
       "000E0300", false},
      {"SBP2\\QX&QUARRY_SES&LUN1\\0030E0000000E0C3", kClassCGuid, 3, 2, 1, "0030E0000000E0C3",
       "000E0300", true},
      // Driver channels: class C keeps the kind of its rule (0).
      {"1394\\QX&EXTERNAL_HDD&BUTTONS\\0030E00000000C0C", kClassCGuid, 0, 0, 1, "0030E00000000C0C",
       "000E0300", true},
      {"1394\\QX&LIGHTS\\1A2B3C4D5E", kClassAGuid, 3, 1, 1, "1A2B3C4D5E", "A1000000", false},
      {"1394\\ACME&DISK\\0030E00000000E0E", kClassBGuid, 3, 1, 1, "0030E00000000E0E", "000E0300",
       false},
  };
  ASSERT_EQ(Block().channelCount, 8);
  for (const auto& row : rows) {
    SCOPED_TRACE(row.id);
    const ChannelRecord* channel = ChannelOf(row.id);
    ASSERT_NE(channel, nullptr);
    EXPECT_EQ(channel->kind, row.kind);
    EXPECT_EQ(channel->mode, row.mode);
    EXPECT_EQ(channel->mayCreateDrive, row.mayCreate);
    EXPECT_EQ(channel->linkedDrive, -1);
    EXPECT_EQ(N(channel->devicePath), PathOf(row.id, row.guid));
    EXPECT_EQ(N(channel->instanceTail), row.tail);
    EXPECT_EQ(N(channel->serialKey), row.serialKey);
    EXPECT_EQ(N(channel->controlPath), row.control ? PathOf(row.id, row.guid) : "");
    EXPECT_EQ(channel->ownIndex, channel - &Channel(0));
  }
}

// Records and channels written directly, for the matching rules alone.
class BindingRulesTest : public DiscoveryTest {
 protected:
  ChannelRecord MakeChannel(DWORD kind, DWORD mode, const WCHAR* identity = nullptr) {
    ChannelRecord channel{};
    channel.kind = kind;
    channel.mode = mode;
    channel.linkedDrive = -1;
    channel.ownIndex = 5;
    WideCopy(channel.devicePath, 256, WSTR("\\\\?\\channel#5"));
    if (identity != nullptr) {
      channel.mayCreateDrive = 1;
      WideCopy(channel.identityText, 128, identity);
    }
    return channel;
  }
};

TEST_F(BindingRulesTest, KeysMatchWholeComponentsOnly) {
  // Drive 0's IDs carry the short keys inside longer components.
  Block().driveCount = 2;
  WideCopy(Drive(0).deviceIdUpper, 256, WSTR("USBSTOR\\DISK&VEN_QX\\15A3&0"));
  WideCopy(Drive(0).parentDeviceId, 256, WSTR("1394\\QX&EXTERNAL_HDD\\00305&0"));
  WideCopy(Drive(1).deviceIdUpper, 256, WSTR("USBSTOR\\DISK&VEN_QX\\5&0"));
  WideCopy(Drive(1).parentDeviceId, 256, WSTR("1394\\QX&EXTERNAL_HDD\\5"));
  WideCopy(Drive(1).instanceKey, 128, WSTR("5&0"));

  ChannelRecord hid = MakeChannel(2, 0);
  WideCopy(hid.identityText, 128, WSTR("5"));
  EXPECT_EQ(BindChannelToDrive(&hid, nullptr, 0), 1);
  ChannelRecord driver = MakeChannel(3, 0);
  WideCopy(driver.instanceTail, 256, WSTR("5"));
  EXPECT_EQ(BindChannelToDrive(&driver, nullptr, 0), 1);
  ChannelRecord enclosure = MakeChannel(3, 2);
  WideCopy(enclosure.instanceTail, 256, WSTR("5"));
  EXPECT_EQ(BindChannelToDrive(&enclosure, nullptr, 0), 1);
  ChannelRecord controlKind = MakeChannel(0, 0);  // kind 0 has no matching rule
  WideCopy(controlKind.instanceTail, 256, WSTR("5"));
  EXPECT_EQ(BindChannelToDrive(&controlKind, nullptr, 0), -1);

  // Without the drive that carries the key as a whole, nothing matches.
  Block().driveCount = 1;
  for (ChannelRecord* channel : {&hid, &driver, &enclosure}) {
    EXPECT_EQ(BindChannelToDrive(channel, nullptr, 0), -1);
  }

  // A driver channel's serial key matches a drive's instance key from 16 units on.
  WideCopy(Drive(0).instanceKey, 128, WSTR("ABCDEF0123456789&0"));
  ChannelRecord shortKey = MakeChannel(3, 0);
  WideCopy(shortKey.serialKey, 128, WSTR("ABCDEF012345678"));
  EXPECT_EQ(BindChannelToDrive(&shortKey, nullptr, 1), -1);
  ChannelRecord longKey = MakeChannel(3, 0);
  WideCopy(longKey.serialKey, 128, WSTR("ABCDEF0123456789"));
  EXPECT_EQ(BindChannelToDrive(&longKey, nullptr, 1), 0);
}

TEST_F(BindingRulesTest, CreatedRecordsNeverShareASlotAndStopAt64) {
  // Channels without a path are never taken for the same channel.
  ChannelRecord first = MakeChannel(2, 1, WSTR("2D41"));
  first.devicePath[0] = 0;
  ASSERT_EQ(BindChannelToDrive(&first, nullptr, 1), 0);
  ChannelRecord second = first;
  second.ownIndex = 6;
  second.linkedDrive = -1;
  WideCopy(second.identityText, 128, WSTR("4344"));
  EXPECT_EQ(BindChannelToDrive(&second, nullptr, 1), 1);
  EXPECT_EQ(N(Drive(0).serialNumber), "-A");  // the identity's hexadecimal pairs
  EXPECT_EQ(N(Drive(0).model), "QX USB HDD");
  EXPECT_EQ(N(Drive(1).serialNumber), "CD");

  // An IEEE 1394 record keeps the identity text as its serial.
  ChannelRecord fireWire = MakeChannel(3, 1, WSTR("0030E0000001A2B3"));
  WideCopy(fireWire.controlPath, 256, WSTR("\\\\?\\control#c"));
  ASSERT_EQ(BindChannelToDrive(&fireWire, nullptr, 1), 2);
  EXPECT_EQ(N(Drive(2).model), "QX 1394 HDD");
  EXPECT_EQ(N(Drive(2).serialNumber), "0030E0000001A2B3");
  EXPECT_EQ(N(Drive(2).controlPath), "\\\\?\\control#c");
  EXPECT_EQ(Drive(2).busKind, 3u);
  EXPECT_EQ(Drive(2).recordIndex, 2);
  EXPECT_EQ(Drive(2).fromChannel, 1u);
  // Bound again, into a copy, it finds its record; a caller that allows no
  // creation gets none.
  DriveRecord copy{};
  EXPECT_EQ(BindChannelToDrive(&fireWire, &copy, 1), 2);
  EXPECT_EQ(std::memcmp(&copy, &Drive(2), sizeof(copy)), 0);
  ChannelRecord refused = MakeChannel(2, 1, WSTR("4546"));
  WideCopy(refused.devicePath, 256, WSTR("\\\\?\\channel#9"));
  EXPECT_EQ(BindChannelToDrive(&refused, nullptr, 0), -1);
  EXPECT_EQ(Block().driveCount, 3);

  // The 64th slot holds the enumeration's scratch candidate: replaced whole.
  Block().driveCount = 63;
  WideCopy(Drive(63).diskPath, 256, WSTR("\\\\?\\scratch#disk"));
  Drive(63).lastLba = 12345;
  ChannelRecord usb = MakeChannel(2, 1, WSTR("41427"));  // the unpaired digit is ignored
  WideCopy(usb.devicePath, 256, WSTR("\\\\?\\channel#7"));
  ASSERT_EQ(BindChannelToDrive(&usb, nullptr, 1), 63);
  EXPECT_EQ(Block().driveCount, 64);
  EXPECT_EQ(N(Drive(63).serialNumber), "AB");
  EXPECT_EQ(Drive(63).diskPath[0], 0);
  EXPECT_EQ(Drive(63).lastLba, 0u);
  ChannelRecord late = MakeChannel(3, 0, WSTR("0030E0000009A2B3"));
  WideCopy(late.devicePath, 256, WSTR("\\\\?\\channel#8"));
  EXPECT_EQ(BindChannelToDrive(&late, nullptr, 1), -1);  // no slot left
  EXPECT_EQ(Block().driveCount, 64);
}

sim::VolumeSpec Volume(char letter, UINT type, std::uint32_t partition = 1) {
  sim::VolumeSpec volume;
  volume.letter = letter;
  volume.driveType = type;
  volume.partition = partition;
  return volume;
}

class VolumeTest : public DiscoveryTest {
 protected:
  // System disk 0 with C:, a volume S: that spans disks, a CD-ROM D: and a
  // floppy A: that claim the drive's disk number, and the drive's volumes.
  void Build(const std::vector<sim::VolumeSpec>& driveVolumes) {
    sim::VolumeSpec system = Volume('C', DRIVE_FIXED);
    system.diskNumber = 0;
    machine_.AddVolume(system);
    sim::VolumeSpec spanned = Volume('S', DRIVE_FIXED);
    spanned.diskNumber = 0xFFFFFFFF;
    machine_.AddVolume(spanned);
    sim::DriveSpec spec = UsbDrive("drive", "7B44", "564F4C");
    spec.volumes = driveVolumes;
    machine_.AddDrive(spec);
    const std::uint32_t number = machine_.DiskNumber("drive");
    sim::VolumeSpec cdrom = Volume('D', DRIVE_CDROM);
    cdrom.diskNumber = number;
    machine_.AddVolume(cdrom);
    sim::VolumeSpec floppy = Volume('A', DRIVE_REMOVABLE);
    floppy.diskNumber = number;
    machine_.AddVolume(floppy);
    Install();
  }
};

TEST_F(VolumeTest, LettersOfTheDrivesVolumesInLetterOrderAndNoneWithoutADiskNumber) {
  Build({Volume('G', DRIVE_REMOVABLE, 2), Volume('F', DRIVE_FIXED, 1)});
  EnumerateDrives(nullptr);
  ASSERT_EQ(Block().driveCount, 1);
  AssignVolumeLetters();
  EXPECT_EQ(Drive(0).diskNumber, machine_.DiskNumber("drive"));
  EXPECT_EQ(N(Drive(0).volumeLetters), "FG");  // not A:, the CD-ROM, C: of disk 0 or S:
  EXPECT_EQ(Drive(0).volumeCount, 2u);
  EXPECT_EQ(Drive(0).volumeDriveType, DWORD{DRIVE_REMOVABLE});  // that of the last letter

  machine_.FailIo("drive", sim::Endpoint::Disk, ERROR_NOT_READY, -1,
                  IOCTL_STORAGE_GET_DEVICE_NUMBER);
  EnumerateDrives(nullptr);
  ASSERT_EQ(Block().driveCount, 1);
  AssignVolumeLetters();
  EXPECT_EQ(Drive(0).volumeCount, 0u);  // in particular not C: of disk 0, nor S:
  EXPECT_EQ(Drive(0).volumeLetters[0], 0);
}

TEST_F(VolumeTest, DismountTakesEveryVolumeOfflineAndStopsAtOneHeldOpen) {
  Build({Volume('F', DRIVE_FIXED, 1), Volume('G', DRIVE_FIXED, 2), Volume('H', DRIVE_FIXED, 3)});
  EnumerateDrives(nullptr);
  AssignVolumeLetters();
  EXPECT_EQ(DismountDriveVolumes(&Drive(0)), 1);
  for (char letter : {'F', 'G', 'H'}) {
    EXPECT_EQ(machine_.DismountCount(letter), 1) << letter;
    EXPECT_FALSE(machine_.VolumeLocked(letter)) << letter;  // unlocked again after the dismount
  }
  const DriveRecord noLetters{};
  EXPECT_EQ(DismountDriveVolumes(&noLetters), 1);

  machine_.SetVolumeHeldOpen('G', true);
  const auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(DismountDriveVolumes(&Drive(0)), 0);
  const auto elapsed = std::chrono::steady_clock::now() - start;
  // A lower bound only: the failed lock pauses (scaled) before reporting.
  const double elapsedMs = std::chrono::duration<double, std::milli>(elapsed).count();
  EXPECT_GE(elapsedMs, 1000.0 * platform::TimeScale());
  EXPECT_EQ(machine_.DismountCount('F'), 2);
  EXPECT_EQ(machine_.DismountCount('G'), 1);
  EXPECT_EQ(machine_.DismountCount('H'), 1);  // stopped at the first failure
  EXPECT_EQ(monitorState.driveListStale, 0u);
}

TEST_F(VolumeTest, AVolumeThatNeverAnswersIsGivenUpAtTheStop) {
  Build({Volume('F', DRIVE_FIXED)});
  machine_.HangIo("drive", sim::Endpoint::Volume, true);
  const skytest::Handle stop = skytest::NewEvent(true, true);
  monitorState.stopEvent = stop.Get();
  auto dismount = std::async(std::launch::async, [] { return DismountVolume(WSTR('F')); });
  const bool ended = dismount.wait_for(std::chrono::seconds(60)) == std::future_status::ready;
  machine_.HangIo("drive", sim::Endpoint::Volume, false);
  ASSERT_TRUE(ended) << "a hung volume held the caller (and the mutex it holds) past the stop";
  EXPECT_EQ(dismount.get(), 0);
  monitorState.stopEvent = nullptr;
}

template <std::size_t N>
void Set(WCHAR (&field)[N], const std::string& text) {
  WideCopy(field, N, W(text));
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

// A drive of the default machine as its description and Windows' naming
// give it, with an extended identity its vital product data too.
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
  Set(drive.diskPath, PathOf(d.diskId, "{53f56307-b6bf-11d0-94f2-00a0c91efb8b}"));
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
    EXPECT_EQ(N(actual.modelSuffixRef), d.suffix);
    EXPECT_EQ(actual.productLineRef == nullptr ? "(none)" : N(actual.productLineRef),
              d.productLine);
    // The row references point into the service's table; every other byte,
    // reserved ones included, must match.
    DriveRecord expected = Expected(d, i, machine_->DiskNumber(d.name));
    expected.modelSuffixRef = actual.modelSuffixRef;
    expected.productLineRef = actual.productLineRef;
    EXPECT_EQ(std::memcmp(&actual, &expected, sizeof(DriveRecord)), 0);
  }
}

}  // namespace
}  // namespace disctest
