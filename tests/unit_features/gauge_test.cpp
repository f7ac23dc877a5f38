// The capacity gauge: used space summed over a drive's volumes, the pattern
// chosen for the gauge's segment count, and a send only when the stored
// percentage changed.
#include "features_fixture.h"
#include "transport/drive_command.h"
#include "transport/drive_features.h"

namespace featuretest {
namespace {

TEST(GaugePatternTest, IndexFollowsTheSegmentWidth) {
  // Index 6 holds no pattern; four segments reach index 4; never beyond the
  // table, whatever the segment count.
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

TEST_F(GaugeTest, UsedSpaceIsSummedInMebibytesOverReadableVolumes) {
  DriveRecord drive = CopyOf(Gauge());
  ASSERT_EQ(drive.volumeCount, 2u);
  EXPECT_EQ(UsedSpacePercent(&drive), 50u);  // 1000 of 2000 MiB free

  // 16 % and 17 % used, the two sides of the first six-segment step.
  machine_.SetFreeBytes('E', 840 * kMiB);
  machine_.SetFreeBytes('K', 840 * kMiB);
  EXPECT_EQ(UsedSpacePercent(&drive), 16u);
  machine_.SetFreeBytes('K', 820 * kMiB);
  EXPECT_EQ(UsedSpacePercent(&drive), 17u);
  machine_.SetFreeBytes('E', 0);
  machine_.SetFreeBytes('K', 0);
  EXPECT_EQ(UsedSpacePercent(&drive), 100u);

  // A letter whose space cannot be read is left out of the sums.
  machine_.SetFreeBytes('E', 250 * kMiB);
  drive.volumeLetters[1] = WSTR('Q');
  EXPECT_EQ(UsedSpacePercent(&drive), 75u);
  drive.volumeLetters[0] = WSTR('R');
  EXPECT_EQ(UsedSpacePercent(&drive), 0u) << "no readable volume shows 0 % used";
}

class LargeVolumeGaugeTest : public FeatureTest {
  void Customize(std::vector<sim::DriveSpec>* drives) override {
    // 30 TiB with 25 TiB free, and a volume reporting more free than its size.
    (*drives)[0].volumes = {Volume('E', 30ull << 20, 25ull << 20), Volume('K', 1000, 3000),
                            Volume('L', 1000, 250)};
  }
};

TEST_F(LargeVolumeGaugeTest, LargeVolumesCountAndImpossibleReadingsDoNot) {
  DriveRecord drive = CopyOf(Gauge());
  ASSERT_EQ(drive.volumeCount, 3u);
  drive.volumeLetters[2] = 0;
  drive.volumeCount = 1;
  EXPECT_EQ(UsedSpacePercent(&drive), 17u) << "30 TiB, 5 TiB used";
  drive = CopyOf(Gauge());
  drive.volumeLetters[0] = WSTR('L');
  drive.volumeLetters[2] = 0;
  drive.volumeCount = 2;
  // K says 3000 MiB free of 1000: left out, so only L counts (75 % used),
  // and the gauge can never be driven past 100 %.
  EXPECT_EQ(UsedSpacePercent(&drive), 75u);
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

TEST_F(GaugeTest, DriveWithoutVolumesAsksForARescan) {
  ChannelRecord* lights = Lights();
  DriveRecord drive = CopyOf(lights);
  drive.volumeCount = 0;
  drive.volumeLetters[0] = 0;
  drive.extendedIdentity = 1;
  drive.statusCode = 2;  // a drive known to be busy: no rescan
  UpdateCapacityGauge(&drive, lights, nullptr);
  EXPECT_EQ(monitorState.refreshRequests, 0u);
  EXPECT_TRUE(Sent("lights", Kind::Control).empty()) << "0 % used equals the stored 0";

  drive.statusCode = 0;
  UpdateCapacityGauge(&drive, lights, nullptr);
  EXPECT_EQ(monitorState.refreshRequests, 1u);
  drive.extendedIdentity = 0;
  drive.statusCode = 5;
  UpdateCapacityGauge(&drive, lights, nullptr);
  EXPECT_EQ(monitorState.refreshRequests, 1u) << "not again while the drive stays so";
  // Once it had volumes, losing them again asks again.
  drive.volumeCount = 1;
  drive.volumeLetters[0] = WSTR('J');
  UpdateCapacityGauge(&drive, lights, nullptr);
  drive.volumeCount = 0;
  drive.volumeLetters[0] = 0;
  UpdateCapacityGauge(&drive, lights, nullptr);
  EXPECT_EQ(monitorState.refreshRequests, 2u);
  EXPECT_EQ(monitorState.burstRequested, 1u);
  EXPECT_EQ(monitorState.gaugePassRequested, 1u);
  EXPECT_EQ(monitorState.sleepPassRequested, 1u);
}

}  // namespace
}  // namespace featuretest
