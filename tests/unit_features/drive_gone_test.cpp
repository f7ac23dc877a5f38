// The drive-gone command: once per channel record, in the form each channel
// kind and mode takes, and the end of a driver gauge channel's handle.
#include "features_fixture.h"
#include "monitor/rescan.h"
#include "service/interface_classes.h"
#include "transport/drive_command.h"
#include "transport/drive_features.h"

namespace featuretest {
namespace {

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
  std::vector<sim::Command> controls = Sent("firewire", Kind::Control);
  ASSERT_EQ(controls.size(), 1u);
  EXPECT_EQ(controls[0].code, CTL_SET_STATE);
  EXPECT_EQ(controls[0].data, (Bytes{0x01, 0x00, 0x00, 0x00}));
  EXPECT_EQ(firewire->driveGoneSent, 1u);
  EXPECT_EQ(monitorState.skipTicks, kDriveGoneSkipTicks);

  monitorState.skipTicks = 0;
  EXPECT_EQ(SendDriveGone(firewire), 0u);
  EXPECT_EQ(SendDriveGone(nullptr), 0u);
  EXPECT_EQ(monitorState.skipTicks, 0u) << "a second call changes nothing";
  EXPECT_EQ(Sent("firewire", Kind::Control).size(), 1u);

  // By drive record: always 1, even when nothing went.
  ChannelRecord* plain = Plain();
  DriveRecord drive = CopyOf(plain);
  drive.channelIndex = plain->ownIndex;
  EXPECT_EQ(SendDriveGoneFor(&drive, nullptr), 1u);
  EXPECT_EQ(HidValues("plain").size(), 1u);
  drive.channelIndex = -1;
  EXPECT_EQ(SendDriveGoneFor(&drive, nullptr), 1u);
}

TEST_F(DriveGoneTest, DriverGaugeChannelLosesItsHandleOnlyWhenTheCommandWent) {
  // A failed send is not repeated either.
  ChannelRecord* lights = Lights();
  machine_.FailIo("lights", sim::Endpoint::Driver, ERROR_GEN_FAILURE, 1);
  EXPECT_EQ(SendDriveGone(lights), 0u);
  EXPECT_EQ(lights->driveGoneSent, 1u);
  EXPECT_NE(lights->deviceHandle, nullptr);
  EXPECT_EQ(SendDriveGone(lights), 0u);
  EXPECT_EQ(Sent("lights", Kind::Control).size(), 1u);

  // Gauge value 1, then the handle is closed, which ends the channel's worker.
  lights->driveGoneSent = 0;
  machine_.ClearCommands();
  EXPECT_EQ(SendDriveGone(lights), 1u);
  const std::vector<sim::Command> controls = Sent("lights", Kind::Control);
  ASSERT_EQ(controls.size(), 1u);
  EXPECT_EQ(controls[0].code, CTL_SET_GAUGE);
  EXPECT_EQ(controls[0].data, (Bytes{0x01, 0x00, 0x00, 0x00}));
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

}  // namespace
}  // namespace featuretest
