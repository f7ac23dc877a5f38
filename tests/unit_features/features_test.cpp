// The capacity gauge, the drive-gone command and safe removal against
// simulated drives.
#include <cstring>

#include "features_fixture.h"
#include "monitor/rescan.h"
#include "service/interface_classes.h"
#include "transport/drive_command.h"
#include "transport/drive_features.h"
#include "volume/eject.h"
#include "volume/safe_removal.h"

namespace featuretest {
namespace {

TEST(GaugePatternTest, IndexFollowsTheSegmentWidth) {
  // Never beyond the table, whatever the segment count.
  const struct {
    DWORD percent, segments, pattern;
  } rows[] = {{50, 6, 0x8F00}, {50, 4, 0x8700},  {16, 6, 0x8100},  {17, 6, 0x8300}, {0, 6, 0x8100},
              {99, 6, 0xBF00}, {100, 6, 0x0000}, {100, 4, 0x9F00}, {75, 4, 0x8F00}, {74, 4, 0x8700},
              {40, 0, 0x0000}, {100, 8, 0x0000}, {100, 64, 0x0000}};
  for (const auto& row : rows) {
    EXPECT_EQ(GaugePattern(row.percent, row.segments), row.pattern)
        << row.percent << " % on " << row.segments;
  }
}

class GaugeTest : public FeatureTest {};

// The gauge drive with 30 TiB of which 25 TiB free, a volume reporting more
// free than its size, and a plain 1000 MiB one.
class LargeVolumeGaugeTest : public FeatureTest {
  void Customize(std::vector<sim::DriveSpec>* drives) override {
    (*drives)[0].volumes = {Volume('E', 30ull << 20, 25ull << 20), Volume('K', 1000, 3000),
                            Volume('L', 1000, 840), Volume('M', 1000, 830)};
  }
};

TEST_F(LargeVolumeGaugeTest, UsedSpaceIsSummedInMebibytesOverReadableVolumes) {
  const DriveRecord gauge = CopyOf(Gauge());
  ASSERT_EQ(Narrow(gauge.volumeLetters), "EKLM");
  const struct {
    const char* letters;
    DWORD percent;
  } rows[] = {
      {"E", 17},   // 5 TiB of 30 used
      {"L", 16},   // 160 MiB of 1000
      {"M", 17},   // 170 MiB: the other side of the first six-segment step
      {"LM", 17},  // 330 MiB of 2000
      {"LK", 16},  // K cannot be right: left out, the gauge never passes 100 %
      {"LQ", 16},  // Q cannot be read: left out
      {"Q", 0},    // no readable volume shows 0 % used
  };
  for (const auto& row : rows) {
    DriveRecord drive = gauge;
    WideCopy(drive.volumeLetters, 26, Utf8ToWide(row.letters));
    drive.volumeCount = static_cast<DWORD>(std::strlen(row.letters));
    EXPECT_EQ(UsedSpacePercent(&drive), row.percent) << row.letters;
  }
}

TEST_F(GaugeTest, PatternIsSentOnlyWhenThePercentageChanges) {
  ChannelRecord* gauge = Gauge();  // HID, mode 1, four segments
  DriveRecord drive = CopyOf(gauge);
  ASSERT_EQ(drive.gaugeSegments, 4u);
  UpdateCapacityGauge(&drive, gauge, nullptr);
  EXPECT_EQ(gauge->gaugePercentSent, 50u);
  EXPECT_EQ(Working(gauge).gaugePercent, 50u);
  ASSERT_EQ(HidValues("gauge"), (std::vector<Bytes>{{0x00, 0x87}}));

  // Unchanged on both sides: nothing.
  UpdateCapacityGauge(&drive, gauge, nullptr);
  RefreshChannelGauge(gauge->ownIndex, nullptr);
  EXPECT_EQ(HidValues("gauge").size(), 1u);

  // The drive fills up: the new pattern goes out.
  machine_.SetFreeBytes('K', 250 * kMiB);
  RefreshChannelGauge(gauge->ownIndex, nullptr);
  EXPECT_EQ(Working(gauge).gaugePercent, 75u);
  EXPECT_EQ(HidValues("gauge").back(), (Bytes{0x00, 0x8F}));

  // Either stored side cleared (force argument, power suspend): sent again.
  gauge->gaugePercentSent = 0;
  RefreshChannelGauge(gauge->ownIndex, nullptr);
  EXPECT_EQ(HidValues("gauge").size(), 3u);
  Working(gauge).gaugePercent = 0;
  RefreshChannelGauge(gauge->ownIndex, nullptr);
  EXPECT_EQ(HidValues("gauge").size(), 4u);
  EXPECT_EQ(gauge->gaugePercentSent, 75u);

  // An unlinked channel is skipped.
  gauge->linkedDrive = -1;
  gauge->gaugePercentSent = 0;
  RefreshChannelGauge(gauge->ownIndex, nullptr);
  EXPECT_EQ(HidValues("gauge").size(), 4u);
  EXPECT_EQ(gauge->gaugePercentSent, 0u);
}

TEST_F(GaugeTest, EachTransportCarriesThePatternAndOnlyTheDriverSendsZero) {
  // Every drive is 50 % used. Mode 0 never sends; the percentage is kept
  // whatever went out.
  ChannelRecord* lights = Lights();        // driver channel, mode 1, six segments
  ChannelRecord* enclosure = Enclosure();  // four segments
  ChannelRecord* plain = Plain();
  DriveRecord lightsDrive = CopyOf(lights);
  DriveRecord enclosureDrive = CopyOf(enclosure);
  DriveRecord plainDrive = CopyOf(plain);
  UpdateCapacityGauge(&lightsDrive, lights, nullptr);
  UpdateCapacityGauge(&enclosureDrive, enclosure, nullptr);
  UpdateCapacityGauge(&plainDrive, plain, nullptr);
  EXPECT_EQ(ControlData("lights", CTL_SET_GAUGE), (std::vector<Bytes>{{0x00, 0x8F, 0x00, 0x00}}));
  EXPECT_EQ(EnclosurePages("enclosure"), (std::vector<Bytes>{{0x81, 0x87}}));
  EXPECT_TRUE(Sent("plain", Kind::HidOutput).empty());
  EXPECT_EQ(plain->gaugePercentSent, 50u);
  EXPECT_EQ(Working(plain).gaugePercent, 50u);

  // Full on six segments: pattern 0, which the HID and enclosure transports
  // do not send.
  machine_.ClearCommands();
  for (char letter : {'J', 'I', 'E', 'K'}) machine_.SetFreeBytes(letter, 0);
  ChannelRecord* gauge = Gauge();
  DriveRecord gaugeDrive = CopyOf(gauge);
  gaugeDrive.gaugeSegments = 6;
  enclosureDrive.gaugeSegments = 6;
  UpdateCapacityGauge(&lightsDrive, lights, nullptr);
  UpdateCapacityGauge(&enclosureDrive, enclosure, nullptr);
  UpdateCapacityGauge(&gaugeDrive, gauge, nullptr);
  EXPECT_EQ(ControlData("lights", CTL_SET_GAUGE), (std::vector<Bytes>{{0, 0, 0, 0}}));
  EXPECT_TRUE(EnclosurePages("enclosure").empty());
  EXPECT_TRUE(HidValues("gauge").empty());
  EXPECT_EQ(enclosure->gaugePercentSent, 100u);
  EXPECT_EQ(Working(gauge).gaugePercent, 100u);

  // A drive without segments gets pattern 0 too.
  machine_.ClearCommands();
  machine_.SetFreeBytes('J', 500 * kMiB);
  lightsDrive.gaugeSegments = 0;
  UpdateCapacityGauge(&lightsDrive, lights, nullptr);
  EXPECT_EQ(lights->gaugePercentSent, 50u);
  EXPECT_EQ(ControlData("lights", CTL_SET_GAUGE), (std::vector<Bytes>{{0, 0, 0, 0}}));
}

class DriveGoneTest : public FeatureTest {};

TEST_F(DriveGoneTest, EachChannelGetsItsOwnFormOnce) {
  EXPECT_EQ(SendDriveGone(Plain()), 1u);  // HID, mode 0: state 4
  EXPECT_EQ(HidValues("plain"), (std::vector<Bytes>{{0x04, 0x00}}));
  EXPECT_EQ(SendDriveGone(Gauge()), 1u);  // HID, mode 1: gauge value 1
  EXPECT_EQ(HidValues("gauge"), (std::vector<Bytes>{{0x01, 0x00}}));
  EXPECT_EQ(SendDriveGone(Enclosure()), 1u);  // page 0x80, parameter 1
  EXPECT_EQ(EnclosurePages("enclosure"), (std::vector<Bytes>{{0x80, 0x01}}));
  EXPECT_NE(Enclosure()->deviceHandle, nullptr) << "enclosures keep their handle";

  ChannelRecord* firewire = FireWire();  // driver, mode 0: state 1
  EXPECT_EQ(SendDriveGone(firewire), 1u);
  EXPECT_EQ(ControlData("firewire", CTL_SET_STATE), (std::vector<Bytes>{{1, 0, 0, 0}}));
  EXPECT_EQ(firewire->driveGoneSent, 1u);
  EXPECT_EQ(monitorState.skipTicks, kDriveGoneSkipTicks);

  monitorState.skipTicks = 0;
  EXPECT_EQ(SendDriveGone(firewire), 0u);
  EXPECT_EQ(SendDriveGone(nullptr), 0u);
  EXPECT_EQ(monitorState.skipTicks, 0u) << "a second call changes nothing";
  EXPECT_EQ(Sent("firewire", Kind::Control).size(), 1u);

  // A driver channel in gauge mode keeps its handle while the command fails
  // (which is not repeated either), then gets gauge value 1 and loses it.
  ChannelRecord* lights = Lights();
  machine_.FailIo("lights", sim::Endpoint::Driver, ERROR_GEN_FAILURE, 1);
  EXPECT_EQ(SendDriveGone(lights), 0u);
  EXPECT_EQ(lights->driveGoneSent, 1u);
  EXPECT_NE(lights->deviceHandle, nullptr);
  EXPECT_EQ(SendDriveGone(lights), 0u);
  EXPECT_EQ(Sent("lights", Kind::Control).size(), 1u);

  lights->driveGoneSent = 0;
  machine_.ClearCommands();
  EXPECT_EQ(SendDriveGone(lights), 1u);
  EXPECT_EQ(ControlData("lights", CTL_SET_GAUGE), (std::vector<Bytes>{{1, 0, 0, 0}}));
  EXPECT_EQ(lights->deviceHandle, nullptr);
  EXPECT_EQ(machine_.OpenCount("lights", sim::Endpoint::Driver), 0u);
}

TEST_F(DriveGoneTest, RemovalCheckSkipsAnEnumerationThatFailed) {
  // Every channel has had a gauge value; a list of disks that cannot be had
  // says nothing about which drives went.
  for (int i = 0; i < Block().channelCount; ++i) Block().channels[i].gaugePercentSent = 50;
  machine_.FailInterfaceList(kDiskInterfaceClass, ERROR_NOT_ENOUGH_MEMORY);
  EXPECT_EQ(EnumerateDrives(nullptr), kEnumerationFailed);
  EXPECT_EQ(CheckRemovedDrives(), 0);
  for (int i = 0; i < Block().channelCount; ++i) EXPECT_EQ(Block().channels[i].driveGoneSent, 0u);

  // Once the list works again, a drive that is no longer listed gets its
  // command.
  machine_.FailInterfaceList(kDiskInterfaceClass, 0);
  machine_.FailOpen("plain", sim::Endpoint::Disk, ERROR_FILE_NOT_FOUND);
  EXPECT_EQ(CheckRemovedDrives(), 1);
  EXPECT_EQ(Plain()->driveGoneSent, 1u);
}

bool NamesFunctionNode(const sim::Machine::EjectRequest& request) {
  return request.instanceId.find("&MI_00\\") != std::string::npos;
}

class SafeRemovalTest : public FeatureTest {
 protected:
  int Remove(ChannelRecord* channel) {
    DriveRecord copy = CopyOf(channel);
    return SafeRemoveDrive(&copy, channel);
  }
  ChannelRecord* Of(const std::string& drive) {
    return drive == "gauge" ? Gauge() : drive == "plain" ? Plain() : FireWire();
  }
  // The removal left the drive and its channel as they were.
  void ExpectNotRemoved(const std::string& drive, const ChannelRecord* channel, LONG linked) {
    EXPECT_TRUE(machine_.Attached(drive));
    EXPECT_EQ(channel->linkedDrive, linked);
    EXPECT_EQ(channel->driveGoneSent, 0u);
  }
};

TEST_F(SafeRemovalTest, WithoutABoundDriveOrAKnownNodeNothingIsTouched) {
  ChannelRecord* plain = Plain();
  DriveRecord unknown = CopyOf(plain);
  WideCopy(unknown.parentDeviceId, 256, WSTR("USB\\VID_0000&PID_0000\\NOWHERE"));
  EXPECT_EQ(EjectDriveDevice(&unknown, plain), 0);

  // An empty drive list: nothing says the volumes are offline.
  const LONG linked = plain->linkedDrive;
  DriveRecord copy = CopyOf(plain);
  Block().driveCount = 0;
  EXPECT_EQ(SafeRemoveDrive(&copy, plain), 0);
  EXPECT_EQ(machine_.DismountCount('F'), 0);
  EXPECT_TRUE(machine_.VolumeMounted('F'));
  ExpectNotRemoved("plain", plain, linked);
  Block().driveCount = 5;

  // A record made from a channel has no device ID: the root of the device
  // tree must never be asked to go.
  ChannelRecord* gauge = Gauge();
  machine_.FailOpen("gauge", sim::Endpoint::Disk, ERROR_ACCESS_DENIED);
  EnumerateDrives(nullptr);
  AssignVolumeLetters();
  DriveRecord made{};
  ASSERT_GE(BindChannelToDrive(gauge, &made, 1), 0);
  ASSERT_EQ(made.fromChannel, 1u);
  EXPECT_EQ(EjectDriveDevice(&made, gauge), 0);
  EXPECT_EQ(GetLastError(), DWORD{ERROR_NOT_FOUND});
  EXPECT_EQ(SafeRemoveDrive(&made, gauge), 0);
  EXPECT_EQ(GetLastError(), DWORD{ERROR_NOT_FOUND}) << "the detail the client is sent";
  EXPECT_TRUE(machine_.Ejects().empty());
  EXPECT_TRUE(HidValues("gauge").empty()) << "no drive-gone command";
  EXPECT_TRUE(machine_.Attached("gauge"));
}

TEST_F(SafeRemovalTest, RemovalActsOnTheChannelsOwnDriveAfterTheListChanged) {
  // The first drive goes and the list is read again; the channels still
  // carry their old indices, so the plain drive's index now names another.
  ChannelRecord* plain = Plain();
  machine_.Detach("gauge");
  EnumerateDrives(nullptr);
  AssignVolumeLetters();
  DriveRecord stale = CopyOf(plain);
  ASSERT_FALSE(WideEqual(stale.diskPath, plain->diskPath));
  ASSERT_EQ(SafeRemoveDrive(&stale, plain), 1);
  EXPECT_FALSE(machine_.Attached("plain"));
  EXPECT_EQ(machine_.DismountCount('F'), 1);
  for (const char* other : {"firewire", "lights", "enclosure"}) {
    EXPECT_TRUE(machine_.Attached(other)) << other;
  }
  EXPECT_EQ(machine_.DismountCount('H'), 0);
  ASSERT_EQ(machine_.Ejects().size(), 1u);
  EXPECT_EQ(machine_.Ejects()[0].drive, "plain");
}

TEST_F(SafeRemovalTest, OnlyAMissingMediumCountsAsNothingToDismount) {
  // Any other failure of the medium check (a spun-down drive, a changed
  // medium, a device error) may leave the volume mounted.
  ChannelRecord* plain = Plain();
  const LONG linked = plain->linkedDrive;
  for (DWORD error : {DWORD{1110}, DWORD{1117}, DWORD{ERROR_GEN_FAILURE}}) {
    machine_.SetMediumCheckError('F', error);
    EXPECT_EQ(Remove(plain), 0) << error;
    ExpectNotRemoved("plain", plain, linked);
    EXPECT_EQ(monitorState.driveListStale, 0u);
  }
  EXPECT_TRUE(machine_.Ejects().empty());
  const struct {
    const char* drive;
    char letter;
    DWORD error;
  } noMedium[] = {{"plain", 'F', ERROR_NOT_READY}, {"firewire", 'H', 1112}};
  for (const auto& c : noMedium) {
    machine_.SetMediumCheckError(c.letter, c.error);
    monitorState.driveListStale = 0;
    EXPECT_EQ(Remove(Of(c.drive)), 1);
    EXPECT_FALSE(machine_.Attached(c.drive));
    EXPECT_EQ(machine_.DismountCount(c.letter), 0);
    EXPECT_EQ(monitorState.driveListStale, 1u);
  }
}

TEST_F(SafeRemovalTest, HeldVolumeStopsTheRemovalBeforeAnyEject) {
  // A volume held open, a failed lock or a failed dismount fails the removal
  // before any eject or drive-gone command.
  ChannelRecord* gauge = Gauge();
  const LONG linked = gauge->linkedDrive;
  for (DWORD code : {DWORD{0}, DWORD{FSCTL_LOCK_VOLUME}, DWORD{FSCTL_DISMOUNT_VOLUME}}) {
    machine_.SetVolumeHeldOpen('K', code == 0);
    if (code != 0) machine_.SetVolumeControlError('E', code, ERROR_ACCESS_DENIED);
    EXPECT_EQ(Remove(gauge), 0) << code;
    if (code != 0) machine_.SetVolumeControlError('E', code, 0);
  }
  EXPECT_TRUE(machine_.Ejects().empty());
  ExpectNotRemoved("gauge", gauge, linked);
  EXPECT_TRUE(HidValues("gauge").empty());

  // A USB drive of an enclosure-mode channel loses the channel's handle
  // before its volumes are touched, and gets it back when they stay online.
  DriveRecord copy = CopyOf(gauge);
  copy.channelMode = kChannelModeEnclosure;
  machine_.SetVolumeHeldOpen('K', true);
  EXPECT_EQ(SafeRemoveDrive(&copy, gauge), 0);
  ASSERT_NE(gauge->deviceHandle, nullptr);
  EXPECT_EQ(machine_.OpenCount("gauge", sim::Endpoint::Hid), 1u);
  machine_.SetVolumeHeldOpen('K', false);
  ASSERT_EQ(SafeRemoveDrive(&copy, gauge), 1);
  EXPECT_EQ(gauge->deviceHandle, nullptr);
  EXPECT_EQ(machine_.OpenCount("gauge", sim::Endpoint::Hid), 0u);
}

TEST_F(SafeRemovalTest, VetoedEjectIsRetriedFourTimesInThreeForms) {
  // Each attempt: eject request, then query-and-remove narrow and wide; a
  // node that cannot be surprise-removed is only queried and removed.
  const struct {
    const char* drive;
    int vetoes;  // -1: every request
    bool surpriseRemovable;
    std::size_t requests;
  } rows[] = {
      {"plain", -1, true, 12},
      {"gauge", 3, true, 4},      // the fourth attempt's eject request succeeds
      {"firewire", 2, false, 3},  // IEEE 1394 unit: capabilities 0x04
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(std::string(row.drive) + " " + std::to_string(row.vetoes));
    ChannelRecord* channel = Of(row.drive);
    const LONG linked = channel->linkedDrive;
    const std::size_t before = machine_.Ejects().size();
    monitorState.skipTicks = 0;
    machine_.SetEjectVeto(row.drive, PNP_VetoOutstandingOpen, "another program", row.vetoes);
    EXPECT_EQ(Remove(channel), row.vetoes < 0 ? 0 : 1);
    const auto ejects = machine_.Ejects();
    ASSERT_EQ(ejects.size() - before, row.requests);
    for (std::size_t i = 0; i < row.requests; ++i) {
      const auto& request = ejects[before + i];
      EXPECT_EQ(request.vetoed, row.vetoes < 0 || i < static_cast<std::size_t>(row.vetoes)) << i;
      EXPECT_EQ(request.queryAndRemove, !row.surpriseRemovable || i % 3 != 0) << i;
      EXPECT_EQ(NamesFunctionNode(request), row.surpriseRemovable) << request.instanceId;
    }
    if (row.vetoes < 0) {
      ExpectNotRemoved(row.drive, channel, linked);
      EXPECT_NE(channel->deviceHandle, nullptr);
    } else {
      EXPECT_FALSE(machine_.Attached(row.drive));
      EXPECT_EQ(channel->linkedDrive, -1);
      EXPECT_EQ(channel->driveGoneSent, 1u);
      EXPECT_EQ(monitorState.skipTicks, kDriveGoneSkipTicks);
    }
  }
  EXPECT_EQ(machine_.DismountCount('E'), 1);
  EXPECT_EQ(machine_.DismountCount('K'), 1);
  EXPECT_TRUE(machine_.Attached("enclosure"));
}

// Windows 2000: the two listed models are told of the eject and their USB
// parent is ejected instead of the storage function.
using Windows2000RemovalTest = SafeRemovalTest;

TEST_F(Windows2000RemovalTest, ListedModelIsEjectedThroughItsParent) {
  monitorState.osKind = kOsWindows2000;
  ChannelRecord* plain = Plain();  // model 2A31
  const ULONGLONG start = GetTickCount64();
  ASSERT_EQ(Remove(plain), 1);
  EXPECT_GE(GetTickCount64() - start, kEjectNoticePauseMs) << "the drive's pause after the notice";
  EXPECT_EQ(HidValues("plain").at(0), (Bytes{0x20, 0x00})) << "eject notice first";
  const auto ejects = machine_.Ejects();
  ASSERT_EQ(ejects.size(), 1u);
  EXPECT_EQ(ejects[0].instanceId.find("USB\\VID_1A2B&PID_2A31\\"), 0u) << ejects[0].instanceId;
  EXPECT_FALSE(NamesFunctionNode(ejects[0]));
  EXPECT_EQ(plain->deviceHandle, nullptr) << "the device is gone; its handle stays closed";
  EXPECT_EQ(plain->linkedDrive, -1);

  // Other models: the storage function, no notice.
  ChannelRecord* gauge = Gauge();
  ASSERT_EQ(Remove(gauge), 1);
  ASSERT_EQ(machine_.Ejects().size(), 2u);
  EXPECT_TRUE(NamesFunctionNode(machine_.Ejects()[1]));
}

TEST_F(Windows2000RemovalTest, FailedParentEjectReopensTheChannel) {
  monitorState.osKind = kOsWindows2000;
  ChannelRecord* plain = Plain();
  const LONG linked = plain->linkedDrive;
  machine_.SetEjectVeto("plain", PNP_VetoOutstandingOpen, "another program");
  EXPECT_EQ(Remove(plain), 0);
  EXPECT_EQ(machine_.Ejects().size(), 12u);
  ExpectNotRemoved("plain", plain, linked);
  ASSERT_NE(plain->deviceHandle, nullptr);
  EXPECT_EQ(machine_.OpenCount("plain", sim::Endpoint::Hid), 1u);
  // The reopened handle works.
  EXPECT_EQ(SendDriveCommand(plain, CTL_SET_STATE, 2, nullptr), 1u);

  // Same when the library cannot be loaded.
  machine_.SetModuleLoadFails("setupapi.dll", true);
  EXPECT_EQ(Remove(plain), 0);
  EXPECT_NE(plain->deviceHandle, nullptr);
  EXPECT_EQ(machine_.OpenCount("plain", sim::Endpoint::Hid), 1u);
}

}  // namespace
}  // namespace featuretest
