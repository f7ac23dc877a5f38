// The scan of control interfaces into channel records, and the binding of a
// channel to its drive record.
#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "discovery/channel_binding.h"
#include "discovery/channel_scan.h"
#include "discovery/drive_enumeration.h"
#include "discovery_fixture.h"
#include "volume/volume_letters.h"

namespace disctest {
namespace {

constexpr char kHidGuid[] = "{4d1e55b2-f16f-11cf-88cb-001111000030}";
constexpr char kClassAGuid[] = "{6b1e0c27-5a94-4d3b-9f10-2c7e8a41d5b3}";
constexpr char kClassBGuid[] = "{a37f52d9-0e6c-4b81-8d24-f91b6c3e7a05}";
constexpr char kClassCGuid[] = "{1d9c4e6a-73b2-4f05-a6e8-5b20c9d41f7e}";

// The interface path Windows gives an interface of a device node.
std::string PathOf(std::string instanceId, const char* classGuid) {
  for (char& c : instanceId) {
    if (c == '\\') c = '#';
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  }
  return "\\\\?\\" + instanceId + "#" + classGuid;
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

class ChannelTest : public DiscoveryTest {
 protected:
  void Discover() {
    EnumerateDrives(nullptr);
    AssignVolumeLetters();
    RebuildChannelTable();
  }
};

TEST_F(ChannelTest, ScanClassifiesEachInterfaceAndClearsEveryOtherRecord) {
  for (int i = 0; i < kMaxChannels; ++i) {
    std::memset(&Channel(i), 0x5A, sizeof(ChannelRecord));
    Channel(i).readyEvent = reinterpret_cast<HANDLE>(static_cast<std::uintptr_t>(0x1000 + i));
  }
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
  machine_.AddDrive(EnclosureDrive("sesB", "0030E0000000E0B2", 2));
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
      {"SBP2\\QX&QUARRY_SES&LUN1\\0030E0000000E0B2", kClassBGuid, 3, 2, 1, "0030E0000000E0B2",
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
  ASSERT_EQ(Block().channelCount, 9);
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
  }
  for (int i = 0; i < kMaxChannels; ++i) {
    const HANDLE ready = reinterpret_cast<HANDLE>(static_cast<std::uintptr_t>(0x1000 + i));
    EXPECT_EQ(Channel(i).readyEvent, ready) << i;
    if (i < 9) {
      EXPECT_EQ(Channel(i).ownIndex, i);
      continue;
    }
    ChannelRecord expected{};
    expected.linkedDrive = -1;
    expected.readyEvent = ready;
    EXPECT_EQ(std::memcmp(&Channel(i), &expected, sizeof(expected)), 0) << i;
  }
}

TEST_F(ChannelTest, AChannelWithoutDiskMakesOneRecordHoweverOftenItBinds) {
  machine_.AddDrive(HidDrive("usb", "7B44", "2D41"));
  machine_.FailOpen("usb", sim::Endpoint::Disk, ERROR_ACCESS_DENIED);
  Install();
  Discover();
  ASSERT_EQ(Block().driveCount, 0);
  ASSERT_EQ(Block().channelCount, 1);
  ChannelRecord& channel = Channel(0);
  WideCopy(channel.identityText, 128, WSTR("2D41"));
  std::memcpy(channel.volumeLetters, WSTR("XY"), 4);

  EXPECT_EQ(BindChannelToDrive(&channel, nullptr, 0), -1);  // creation not allowed by the caller
  EXPECT_EQ(Block().driveCount, 0);
  EXPECT_EQ(channel.linkedDrive, -1);

  DriveRecord copy{};
  for (int round = 0; round < 4; ++round) {
    ASSERT_EQ(BindChannelToDrive(&channel, &copy, 1), 0) << round;
    EXPECT_EQ(Block().driveCount, 1) << round;
  }
  const DriveRecord& drive = Drive(0);
  EXPECT_EQ(drive.fromChannel, 1u);
  EXPECT_EQ(drive.extendedIdentity, 1u);
  EXPECT_EQ(drive.busKind, 2u);
  EXPECT_EQ(drive.channelMode, 1u);
  EXPECT_EQ(N(drive.model), "QX USB HDD");
  EXPECT_EQ(N(drive.serialNumber), "-A");
  EXPECT_EQ(N(drive.hidPath), N(channel.devicePath));
  EXPECT_EQ(N(drive.channelPath), N(channel.devicePath));
  EXPECT_EQ(drive.deviceIdUpper[0], 0);
  EXPECT_EQ(channel.linkedDrive, 0);
  EXPECT_EQ(channel.volumeLetters[0], 0);
  EXPECT_EQ(std::memcmp(&copy, &drive, sizeof(copy)), 0);
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
  ChannelRecord first = MakeChannel(2, 1, WSTR("4142"));
  first.devicePath[0] = 0;
  ASSERT_EQ(BindChannelToDrive(&first, nullptr, 1), 0);
  ChannelRecord second = first;
  second.ownIndex = 6;
  second.linkedDrive = -1;
  WideCopy(second.identityText, 128, WSTR("4344"));
  EXPECT_EQ(BindChannelToDrive(&second, nullptr, 1), 1);
  EXPECT_EQ(N(Drive(0).serialNumber), "AB");
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

}  // namespace
}  // namespace disctest
