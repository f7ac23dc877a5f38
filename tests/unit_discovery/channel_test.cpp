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

sim::DriveSpec HidDrive(const std::string& name, const std::string& modelCode,
                        const std::string& usbSerial) {
  sim::DriveSpec spec = UsbDrive(name, modelCode, usbSerial);
  spec.channel = sim::ChannelKind::Hid;
  spec.hidInstanceId = "HID\\VID_1A2B&PID_" + modelCode + "&MI_01\\7&" + usbSerial + "&0&0000";
  return spec;
}

class ChannelTest : public DiscoveryTest {
 protected:
  // The stored channel whose device has this instance ID, or null.
  ChannelRecord* ChannelOf(const std::string& instanceId) {
    for (LONG i = 0; i < Block().channelCount; ++i) {
      if (N(Channel(i).deviceInstanceId) == instanceId) return &Channel(i);
    }
    return nullptr;
  }

  void Discover() {
    EnumerateDrives(nullptr);
    AssignVolumeLetters();
    RebuildChannelTable();
  }
};

TEST_F(ChannelTest, HidChannelsTakeModeAndCreationFromTheModelLists) {
  const sim::DriveSpec plain = HidDrive("plain", "2A31", "504C41494E");
  const sim::DriveSpec standalone = HidDrive("gauge", "7B44", "4741554745");
  const sim::DriveSpec listed = HidDrive("listed", "5E22", "4C49535445");
  // The composite device is found whatever language its description is in.
  machine_.SetLanguage(sim::Language::German);
  machine_.AddDrive(plain);
  machine_.SetLanguage(sim::Language::English);
  machine_.AddDrive(standalone);
  machine_.SetLanguage(sim::Language::Japanese);
  machine_.AddDrive(listed);
  // Someone's mouse: an HID collection of no listed model.
  const DEVINST mouse =
      machine_.AddNode(machine_.RootNode(), "HID\\VID_046D&PID_C52B\\8&1&0&0000", "HID mouse");
  machine_.AddInterface(mouse, emu::kHidInterfaceClass);
  Install();
  RebuildChannelTable();

  ASSERT_EQ(Block().channelCount, 3);
  const ChannelRecord* plainChannel = ChannelOf(plain.hidInstanceId);
  const ChannelRecord* gaugeChannel = ChannelOf(standalone.hidInstanceId);
  const ChannelRecord* listedChannel = ChannelOf(listed.hidInstanceId);
  ASSERT_NE(plainChannel, nullptr);
  ASSERT_NE(gaugeChannel, nullptr);
  ASSERT_NE(listedChannel, nullptr);

  EXPECT_EQ(plainChannel->mode, 0u);  // in the model table, not in the channel list
  EXPECT_EQ(plainChannel->mayCreateDrive, 0u);
  EXPECT_EQ(gaugeChannel->mode, 1u);
  EXPECT_EQ(gaugeChannel->mayCreateDrive, 1u);
  EXPECT_EQ(listedChannel->mode, 1u);
  EXPECT_EQ(listedChannel->mayCreateDrive, 0u);

  for (LONG i = 0; i < Block().channelCount; ++i) {
    const ChannelRecord& channel = Channel(i);
    EXPECT_EQ(channel.kind, 2u);
    EXPECT_EQ(channel.ownIndex, i);
    EXPECT_EQ(channel.linkedDrive, -1);
    EXPECT_EQ(N(channel.devicePath), PathOf(N(channel.deviceInstanceId), kHidGuid));
    EXPECT_EQ(channel.instanceTail[0], 0);
    EXPECT_EQ(channel.controlPath[0], 0);
  }
  // The serial key is the serial of the composite USB device above.
  EXPECT_EQ(N(gaugeChannel->serialKey), "4741554745");
  EXPECT_EQ(N(plainChannel->serialKey), "504C41494E");
  EXPECT_EQ(N(listedChannel->serialKey), "4C49535445");
}

TEST_F(ChannelTest, EnclosureIsModeTwoKindThreeUnderAnyVendorClass) {
  const char* const unitIds[3] = {"0030E0000000E0A1", "0030E0000000E0B2", "0030E0000000E0C3"};
  const char* const guids[3] = {kClassAGuid, kClassBGuid, kClassCGuid};
  for (int i = 0; i < 3; ++i) {
    sim::DriveSpec spec = FireWireDrive("enclosure" + std::to_string(i), "3C13", unitIds[i]);
    spec.channel = sim::ChannelKind::Enclosure;
    spec.unitModel = "QUARRY";
    spec.enclosureClass = i + 1;
    spec.controlInstanceId = std::string("SBP2\\QX&QUARRY_SES&LUN1\\") + unitIds[i];
    machine_.AddDrive(spec);
  }
  Install();
  RebuildChannelTable();

  ASSERT_EQ(Block().channelCount, 3);
  for (int i = 0; i < 3; ++i) {
    const std::string id = std::string("SBP2\\QX&QUARRY_SES&LUN1\\") + unitIds[i];
    const ChannelRecord* channel = ChannelOf(id);
    ASSERT_NE(channel, nullptr) << id;
    EXPECT_EQ(channel->mode, 2u);
    EXPECT_EQ(channel->kind, 3u);
    EXPECT_EQ(channel->mayCreateDrive, 1u);
    EXPECT_EQ(N(channel->devicePath), PathOf(id, guids[i]));
    EXPECT_EQ(N(channel->instanceTail), unitIds[i]);
    EXPECT_EQ(N(channel->serialKey), "000E0300");  // "0030E000" reversed
    // Only class C interfaces are control interfaces.
    EXPECT_EQ(N(channel->controlPath), i == 2 ? N(channel->devicePath) : std::string());
  }
}

TEST_F(ChannelTest, DriverChannelsFollowTheIeee1394Rules) {
  sim::DriveSpec controlClass = FireWireDrive("plain", "5E22", "0030E00000000C0C");
  controlClass.channel = sim::ChannelKind::Driver;
  controlClass.driverClass = 3;
  controlClass.controlInstanceId = "1394\\QX&EXTERNAL_HDD&BUTTONS\\0030E00000000C0C";
  sim::DriveSpec lights = FireWireDrive("lights", "5E22", "0030E00000000D0D");
  lights.channel = sim::ChannelKind::Driver;
  lights.driverClass = 1;
  lights.controlInstanceId = "1394\\QX&LIGHTS\\1A2B3C4D5E";
  sim::DriveSpec otherVendor = FireWireDrive("other", "5E22", "0030E00000000E0E");
  otherVendor.channel = sim::ChannelKind::Driver;
  otherVendor.driverClass = 2;
  otherVendor.controlInstanceId = "1394\\ACME&DISK\\0030E00000000E0E";
  sim::DriveSpec unknown = FireWireDrive("unknown", "5E22", "0011220000000F0F");
  unknown.channel = sim::ChannelKind::Driver;
  unknown.driverClass = 2;
  unknown.controlInstanceId = "1394\\ACME&DISK\\0011220000000F0F";
  machine_.AddDrive(controlClass);
  machine_.AddDrive(lights);
  machine_.AddDrive(otherVendor);
  machine_.AddDrive(unknown);
  Install();
  RebuildChannelTable();

  ASSERT_EQ(Block().channelCount, 3);  // the last has neither QX nor a known unit prefix
  const ChannelRecord* plain = ChannelOf(controlClass.controlInstanceId);
  const ChannelRecord* lit = ChannelOf(lights.controlInstanceId);
  const ChannelRecord* other = ChannelOf(otherVendor.controlInstanceId);
  ASSERT_NE(plain, nullptr);
  ASSERT_NE(lit, nullptr);
  ASSERT_NE(other, nullptr);

  EXPECT_EQ(plain->kind, 0u);  // class C keeps the kind of its rule
  EXPECT_EQ(plain->mode, 0u);
  EXPECT_EQ(N(plain->controlPath), PathOf(controlClass.controlInstanceId, kClassCGuid));
  EXPECT_EQ(lit->kind, 3u);
  EXPECT_EQ(lit->mode, 1u);
  EXPECT_EQ(lit->controlPath[0], 0);
  EXPECT_EQ(N(lit->serialKey), "A1000000");  // "0000001A2B3C4D5E", first eight reversed
  EXPECT_EQ(other->kind, 3u);
  EXPECT_EQ(other->mode, 1u);
  for (const ChannelRecord* channel : {plain, lit, other}) EXPECT_EQ(channel->mayCreateDrive, 1u);
}

TEST_F(ChannelTest, RebuildClearsEveryRecordButItsReadyEvent) {
  for (int i = 0; i < kMaxChannels; ++i) {
    std::memset(&Channel(i), 0x5A, sizeof(ChannelRecord));
    Channel(i).readyEvent = reinterpret_cast<HANDLE>(static_cast<std::uintptr_t>(0x1000 + i));
  }
  Block().channelCount = 17;
  Install();

  EXPECT_EQ(RebuildChannelTable(), -1);
  EXPECT_EQ(Block().channelCount, 0);
  for (int i = 0; i < kMaxChannels; ++i) {
    ChannelRecord expected{};
    expected.linkedDrive = -1;
    expected.readyEvent = reinterpret_cast<HANDLE>(static_cast<std::uintptr_t>(0x1000 + i));
    EXPECT_EQ(std::memcmp(&Channel(i), &expected, sizeof(expected)), 0) << i;
  }
}

TEST_F(ChannelTest, BindingLinksTheChannelsOfEachKindToTheirDrives) {
  sim::DriveSpec usb = HidDrive("usb", "7B44", "5553424844");
  sim::VolumeSpec volume;
  volume.letter = 'E';
  usb.volumes = {volume};
  sim::DriveSpec enclosure = FireWireDrive("enclosure", "3C13", "0030E00000045D6F");
  enclosure.channel = sim::ChannelKind::Enclosure;
  enclosure.controlInstanceId = "SBP2\\QX&QUARRY_SES&LUN1\\0030E00000045D6F";
  sim::DriveSpec fireWire = FireWireDrive("firewire", "5E22", "0030E0000001A2B3");
  fireWire.channel = sim::ChannelKind::Driver;
  fireWire.driverClass = 1;
  fireWire.controlInstanceId = "1394\\QX&EXTERNAL_HDD&FILTER\\0030E0000001A2B3";
  machine_.AddDrive(usb);
  machine_.AddDrive(enclosure);
  machine_.AddDrive(fireWire);
  Install();
  Discover();
  ASSERT_EQ(Block().driveCount, 3);
  ASSERT_EQ(Block().channelCount, 3);

  ChannelRecord* hid = ChannelOf(usb.hidInstanceId);
  ASSERT_NE(hid, nullptr);
  WideCopy(hid->identityText, 128, WSTR("5553424844"));  // the HID serial, as the worker reads it
  monitorState.publishNeeded = 0;
  DriveRecord copy{};
  ASSERT_EQ(BindChannelToDrive(hid, &copy, 0), 0);
  EXPECT_EQ(monitorState.publishNeeded, 1u);
  const DriveRecord& usbDrive = Drive(0);
  EXPECT_EQ(hid->linkedDrive, 0);
  EXPECT_EQ(usbDrive.channelIndex, hid->ownIndex);
  EXPECT_EQ(usbDrive.channelMode, 1u);
  EXPECT_EQ(N(usbDrive.channelPath), N(hid->devicePath));
  EXPECT_EQ(N(usbDrive.hidPath), N(hid->devicePath));
  EXPECT_EQ(usbDrive.controlPath[0], 0);
  EXPECT_EQ(usbDrive.fromChannel, 0u);
  EXPECT_EQ(N(hid->diskPath), usb.diskPath);
  EXPECT_EQ(std::string(reinterpret_cast<const char*>(hid->volumeLetters), 4),
            std::string("E\0\0\0", 4));
  EXPECT_EQ(std::memcmp(&copy, &usbDrive, sizeof(copy)), 0);

  ChannelRecord* ses = ChannelOf(enclosure.controlInstanceId);
  ASSERT_NE(ses, nullptr);
  ASSERT_EQ(BindChannelToDrive(ses, nullptr, 0), 1);  // instance key equals the tail
  EXPECT_EQ(Drive(1).channelMode, 2u);
  EXPECT_EQ(N(Drive(1).controlPath), PathOf(enclosure.controlInstanceId, kClassCGuid));
  EXPECT_EQ(N(ses->diskPath), enclosure.diskPath);

  ChannelRecord* driver = ChannelOf(fireWire.controlInstanceId);
  ASSERT_NE(driver, nullptr);
  ASSERT_EQ(BindChannelToDrive(driver, nullptr, 0), 2);  // the parent's ID carries the tail
  EXPECT_EQ(Drive(2).channelIndex, driver->ownIndex);
  EXPECT_EQ(Drive(2).controlPath[0], 0);  // class A is no control interface
  EXPECT_EQ(Block().driveCount, 3);
}

TEST_F(ChannelTest, AChannelWithoutDiskMakesOneRecordHoweverOftenItBinds) {
  const sim::DriveSpec usb = HidDrive("usb", "7B44", "2D41");
  machine_.AddDrive(usb);
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
  EXPECT_EQ(drive.recordIndex, 0);
  EXPECT_EQ(drive.fromChannel, 1u);
  EXPECT_EQ(drive.extendedIdentity, 1u);
  EXPECT_EQ(drive.busKind, 2u);
  EXPECT_EQ(drive.channelMode, 1u);
  EXPECT_EQ(drive.channelIndex, 0);
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
  ChannelRecord MakeChannel(DWORD kind, DWORD mode) {
    ChannelRecord channel{};
    channel.kind = kind;
    channel.mode = mode;
    channel.linkedDrive = -1;
    channel.ownIndex = 5;
    WideCopy(channel.devicePath, 256, WSTR("\\\\?\\channel#5"));
    return channel;
  }
};

TEST_F(BindingRulesTest, DriverChannelMatchesOnlyThroughItsKeys) {
  Block().driveCount = 1;
  WideCopy(Drive(0).parentDeviceId, 256, WSTR("1394\\QX&EXTERNAL_HDD\\0030E0000001A2B3"));
  WideCopy(Drive(0).instanceKey, 128, WSTR("ABCDEF0123456789&0"));

  ChannelRecord noKeys = MakeChannel(3, 0);
  WideCopy(noKeys.serialKey, 128, WSTR("ABCDEF012345678"));  // 15 units: too short
  EXPECT_EQ(BindChannelToDrive(&noKeys, nullptr, 1), -1);

  ChannelRecord longKey = MakeChannel(3, 0);
  WideCopy(longKey.serialKey, 128, WSTR("ABCDEF0123456789"));
  EXPECT_EQ(BindChannelToDrive(&longKey, nullptr, 1), 0);

  ChannelRecord controlKind = MakeChannel(0, 0);  // kind 0 has no matching rule
  WideCopy(controlKind.instanceTail, 256, WSTR("0030E0000001A2B3"));
  EXPECT_EQ(BindChannelToDrive(&controlKind, nullptr, 0), -1);
}

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

  // Without the drive that carries the key as a whole, nothing matches.
  Block().driveCount = 1;
  for (ChannelRecord* channel : {&hid, &driver, &enclosure}) {
    EXPECT_EQ(BindChannelToDrive(channel, nullptr, 0), -1);
  }
}

TEST_F(BindingRulesTest, CreatedRecordsReplaceTheScratchCandidateAndStopAt64) {
  Block().driveCount = 63;
  WideCopy(Drive(63).diskPath, 256, WSTR("\\\\?\\scratch#disk"));
  Drive(63).lastLba = 12345;

  ChannelRecord usb = MakeChannel(2, 1);
  usb.mayCreateDrive = 1;
  WideCopy(usb.identityText, 128, WSTR("41427"));  // the unpaired digit is ignored
  ASSERT_EQ(BindChannelToDrive(&usb, nullptr, 1), 63);
  EXPECT_EQ(Block().driveCount, 64);
  EXPECT_EQ(N(Drive(63).serialNumber), "AB");
  EXPECT_EQ(Drive(63).diskPath[0], 0);
  EXPECT_EQ(Drive(63).lastLba, 0u);

  ChannelRecord fireWire = MakeChannel(3, 0);
  fireWire.mayCreateDrive = 1;
  WideCopy(fireWire.devicePath, 256, WSTR("\\\\?\\channel#6"));
  WideCopy(fireWire.identityText, 128, WSTR("0030E0000001A2B3"));
  EXPECT_EQ(BindChannelToDrive(&fireWire, nullptr, 1), -1);  // no slot left
  EXPECT_EQ(Block().driveCount, 64);
}

TEST_F(BindingRulesTest, ChannelsWithoutAPathNeverShareARecord) {
  ChannelRecord first = MakeChannel(2, 1);
  first.mayCreateDrive = 1;
  first.devicePath[0] = 0;
  WideCopy(first.identityText, 128, WSTR("4142"));
  ASSERT_EQ(BindChannelToDrive(&first, nullptr, 1), 0);
  ChannelRecord second = first;
  second.ownIndex = 6;
  second.linkedDrive = -1;
  WideCopy(second.identityText, 128, WSTR("4344"));
  EXPECT_EQ(BindChannelToDrive(&second, nullptr, 1), 1);
  EXPECT_EQ(N(Drive(0).serialNumber), "AB");
  EXPECT_EQ(N(Drive(1).serialNumber), "CD");
}

TEST_F(BindingRulesTest, FireWireChannelRecordKeepsItsIdentityText) {
  ChannelRecord fireWire = MakeChannel(3, 1);
  fireWire.mayCreateDrive = 1;
  WideCopy(fireWire.identityText, 128, WSTR("0030E0000001A2B3"));
  WideCopy(fireWire.controlPath, 256, WSTR("\\\\?\\control#c"));
  ASSERT_EQ(BindChannelToDrive(&fireWire, nullptr, 1), 0);
  EXPECT_EQ(N(Drive(0).model), "QX 1394 HDD");
  EXPECT_EQ(N(Drive(0).serialNumber), "0030E0000001A2B3");
  EXPECT_EQ(N(Drive(0).controlPath), "\\\\?\\control#c");
  EXPECT_EQ(Drive(0).busKind, 3u);
}

}  // namespace
}  // namespace disctest
