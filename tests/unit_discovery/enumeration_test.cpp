// Drive enumeration against simulated disks: which disks become drive
// records, and what their records hold.
#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "discovery/channel_scan.h"
#include "discovery/control_interface.h"
#include "discovery/disk_number.h"
#include "discovery/drive_enumeration.h"
#include "discovery/model_table.h"
#include "discovery_fixture.h"
#include "service/interface_classes.h"

namespace disctest {
namespace {

using EnumerationTest = DiscoveryTest;

TEST_F(EnumerationTest, OnlyReadableDisksOfTheMakersModelsBecomeRecords) {
  sim::DriveSpec usbWithoutMaker = UsbDrive("no-qx", "7B44", "4E4F5158");
  usbWithoutMaker.diskPath =
      "\\\\?\\usbstor#disk&ven_acme&prod_external_hdd#4e4f5158&0#{53f56307-b6bf-11d0-94f2-"
      "00a0c91efb8b}";
  sim::DriveSpec fireWireNoLine = FireWireDrive("no-line", "5E22", "0030E00000000001");
  fireWireNoLine.diskPath =
      "\\\\?\\sbp2#orvanel&backup_disk&lun0#0030e00000000001#{53f56307-b6bf-11d0-94f2-"
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
  machine_.AddDrive(fireWireNoLine);
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
  EXPECT_EQ(Drive(0).busKind, 3u);
  EXPECT_EQ(N(Drive(1).diskPath), enough32.diskPath);
  EXPECT_EQ(Drive(1).busKind, 2u);
  EXPECT_EQ(Drive(1).recordIndex, 1);
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
  EXPECT_TRUE(machine_.Commands("no-line").empty());
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
  for (int i = 0; i < 63; ++i) {
    char serial[16];
    std::snprintf(serial, sizeof(serial), "5345%04d", i);
    EXPECT_TRUE(WideContains(Drive(i).deviceIdUpper, W(serial).c_str())) << i;
  }
  EXPECT_TRUE(WideContains(Drive(63).deviceIdUpper, WSTR("53450069")));
  EXPECT_EQ(Drive(63).recordIndex, 63);

  // The channels likewise: 63 counted, and the 64th record rewritten by each
  // further channel holds the last one alone, nothing of a longer one before.
  RebuildChannelTable();
  EXPECT_EQ(Block().channelCount, 63);
  const ChannelRecord& scratch = Channel(63);
  ASSERT_EQ(N(scratch.deviceInstanceId), lightsId);
  EXPECT_EQ(scratch.kind, 3u);
  for (const WCHAR* text : {scratch.deviceInstanceId, scratch.devicePath}) {
    for (std::size_t i = WideLength(text); i < 256; ++i) ASSERT_EQ(text[i], 0) << i;
  }
}

TEST_F(EnumerationTest, Windows2000FindsTheControlInterfaceBySerialKey) {
  sim::DriveSpec first = UsbDrive("first", "7B44", "A1B2C3");
  first.channel = sim::ChannelKind::Driver;
  first.driverClass = 3;
  first.controlInstanceId = "USBSTOR\\OTHER&VEN_QX&PROD_QUARRY\\A1B2C3&0";
  sim::DriveSpec enclosure = FireWireDrive("enclosure", "3C13", "0030E00000045D6F");
  enclosure.channel = sim::ChannelKind::Enclosure;
  enclosure.enclosureClass = 3;
  enclosure.controlInstanceId = "SBP2\\QX&QUARRY_SES&LUN1\\0030E00000045D6F";
  machine_.AddDrive(first);
  machine_.AddDrive(enclosure);
  // A USB drive whose control interface is an HID collection of its composite
  // device; another USB device's collection is listed first.
  machine_.AddDrive(UsbDrive("usb", "7B44", "C0FFEE12"));
  const char* const serials[2] = {"BADBEEF0", "C0FFEE12"};
  for (int i = 0; i < 2; ++i) {
    const DEVINST composite =
        machine_.AddNode(machine_.RootNode(), std::string("USB\\VID_1A2B&PID_7B44\\") + serials[i],
                         "USB Composite Device");
    const DEVINST function = machine_.AddNode(
        composite, "USB\\VID_1A2B&PID_7B44&MI_01\\6&" + std::to_string(i) + "&0&0001",
        "USB Input Device");
    const DEVINST hid = machine_.AddNode(
        function, "HID\\VID_1A2B&PID_7B44&MI_01\\7&" + std::to_string(i) + "&0&0000",
        "HID-compliant device");
    machine_.AddInterface(hid, sim::kVendorClassC);
  }
  Install();

  monitorState.osKind = kOsWindows2000;
  EnumerateDrives(nullptr);
  ASSERT_EQ(Block().driveCount, 3);
  const std::string classC = "#{1d9c4e6a-73b2-4f05-a6e8-5b20c9d41f7e}";
  EXPECT_EQ(N(Drive(0).controlPath), "\\\\?\\usbstor#other&ven_qx&prod_quarry#a1b2c3&0" + classC);
  EXPECT_EQ(N(Drive(1).controlPath), "\\\\?\\sbp2#qx&quarry_ses&lun1#0030e00000045d6f" + classC);
  EXPECT_EQ(N(Drive(2).controlPath), "\\\\?\\hid#vid_1a2b&pid_7b44&mi_01#7&1&0&0000" + classC);

  // Later systems fill the control path only when a channel is bound.
  monitorState.osKind = kOsXpOrLater;
  EnumerateDrives(nullptr);
  ASSERT_EQ(Block().driveCount, 3);
  for (int i = 0; i < 3; ++i) EXPECT_EQ(Drive(i).controlPath[0], 0) << i;

  // An empty key would be contained in any composite device's ID.
  WCHAR path[256] = {};
  EXPECT_EQ(FindControlInterfacePath(kVendorClassC, WSTR(""), path, 256), -1);
  EXPECT_EQ(path[0], 0);
  EXPECT_EQ(FindControlInterfacePath(kVendorClassC, WSTR("BADBEEF0"), path, 256), 0);
}

TEST_F(EnumerationTest, NoDiskLeavesEverythingZero) {
  std::memset(&Block().drives[5], 0xAB, sizeof(DriveRecord));
  std::memset(&Block().published[7], 0xCD, sizeof(DriveRecord));
  Block().driveCount = 9;
  Block().countedDrives = 4;
  Block().publishedCount = 8;
  Install();

  EXPECT_EQ(EnumerateDrives(nullptr), -1);
  EXPECT_EQ(Block().driveCount, 0);
  EXPECT_EQ(Block().countedDrives, 0);
  EXPECT_EQ(Block().publishedCount, 0);
  const DriveRecord zero{};
  for (int i = 0; i < kMaxDrives; ++i) {
    EXPECT_EQ(std::memcmp(&Block().drives[i], &zero, sizeof(zero)), 0) << i;
    EXPECT_EQ(std::memcmp(&Block().published[i], &zero, sizeof(zero)), 0) << i;
  }
}

}  // namespace
}  // namespace disctest
