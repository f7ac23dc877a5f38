// The command sender and dispatcher: what each kind of channel puts on the
// wire for a command, and when nothing may be sent at all.
#include "transport/drive_command.h"

#include <thread>

#include "commands_fixture.h"
#include "support/test_support.h"
#include "transport/io_block.h"

namespace cmdtest {
namespace {

using Kind = sim::Command::Kind;

class DriveCommandTest : public CommandTest {};

TEST_F(DriveCommandTest, HidChannelsWriteTheReportTheirModelAsksFor) {
  // Models with flag 0x10 (7B44, and 5E24 found through the lower-case
  // interface path) send 5-byte reports with ID 1 and translate gauge and
  // state values; a plain channel sends the value untranslated.
  ChannelRecord* gauge = Gauge();
  EXPECT_EQ(SendDriveCommand(gauge, CTL_SET_GAUGE, 8, nullptr), 1u);
  EXPECT_EQ(SendDriveCommand(gauge, CTL_SET_GAUGE, 0x8100, nullptr), 1u);
  EXPECT_EQ(SendDriveCommand(gauge, CTL_SET_STATE, 2, nullptr), 1u);   // becomes 0, still sent
  EXPECT_EQ(SendDriveCommand(gauge, CTL_SET_STATE, 16, nullptr), 1u);  // becomes 4
  EXPECT_EQ(SendDriveCommand(Wide(), CTL_SET_GAUGE, 0x8100, nullptr), 1u);
  BYTE reply = 0x40;
  EXPECT_EQ(DriveCommand(Plain(), CTL_EVENT_REPLY, &reply, 1, nullptr), 1u);
  EXPECT_EQ(HidReports("gauge"), (std::vector<Bytes>{
                                     {0x01, 0x02, 0x00, 0x00, 0x00},
                                     {0x01, 0x00, 0x81, 0x00, 0x00},
                                     {0x01, 0x00, 0x00, 0x00, 0x00},
                                     {0x01, 0x04, 0x00, 0x00, 0x00},
                                 }));
  EXPECT_EQ(HidReports("wide"), (std::vector<Bytes>{{0x01, 0x00, 0x81, 0x00, 0x00}}));
  EXPECT_EQ(HidReports("plain"), (std::vector<Bytes>{{0x00, 0x40, 0x00}}));

  // Value 0 succeeds without opening anything: an armed open failure is met
  // by the next real command.
  machine_.ClearCommands();
  machine_.FailOpen("gauge", sim::Endpoint::Hid, ERROR_ACCESS_DENIED, 1);
  EXPECT_EQ(SendDriveCommand(gauge, CTL_SET_GAUGE, 0, nullptr), 1u);
  EXPECT_EQ(SendDriveCommand(gauge, CTL_SET_GAUGE, 0x8300, nullptr), 0u);
  EXPECT_TRUE(HidReports("gauge").empty());
  EXPECT_EQ(SendDriveCommand(gauge, CTL_SET_GAUGE, 0x8300, nullptr), 1u);
  EXPECT_EQ(HidReports("gauge").size(), 1u);
}

TEST_F(DriveCommandTest, DriverControlsCarryTheValueOnlyForCodesWithInput) {
  ChannelRecord* fireWire = FireWire();
  BYTE reply = 0x40;
  EXPECT_EQ(DriveCommand(fireWire, CTL_EVENT_REPLY, &reply, 1, nullptr), 1u);
  EXPECT_EQ(SendDriveCommand(fireWire, CTL_SET_GAUGE, 0x8F00, nullptr), 1u);
  BYTE state = 4;
  EXPECT_EQ(DriveCommand(fireWire, CTL_SET_STATE, &state, 1, nullptr), 1u);
  BYTE word[2] = {0x34, 0x12};
  EXPECT_EQ(DriveCommand(fireWire, CTL_QUIESCE, word, 2, nullptr), 1u);
  EXPECT_EQ(DriveCommand(fireWire, CTL_SET_GAUGE, word, 2, nullptr), 1u);
  EXPECT_EQ(DriveCommand(fireWire, CTL_SET_GAUGE, word, 1, nullptr), 1u);  // one byte given
  EXPECT_EQ(DriveCommand(fireWire, CTL_SET_STATE, nullptr, 0, nullptr), 1u);

  const std::vector<sim::Command> sent = Sent("firewire", Kind::Control);
  ASSERT_EQ(sent.size(), 7u);
  const std::vector<std::pair<DWORD, Bytes>> expected = {
      {CTL_EVENT_REPLY, {}},
      {CTL_SET_GAUGE, {0x00, 0x8F, 0x00, 0x00}},
      {CTL_SET_STATE, {0x04, 0x00, 0x00, 0x00}},
      {CTL_QUIESCE, {}},
      {CTL_SET_GAUGE, {0x34, 0x12, 0x00, 0x00}},
      {CTL_SET_GAUGE, {0x34, 0x00, 0x00, 0x00}},
      {CTL_SET_STATE, {0x00, 0x00, 0x00, 0x00}},
  };
  for (std::size_t i = 0; i < sent.size(); ++i) {
    EXPECT_EQ(sent[i].code, expected[i].first) << i;
    EXPECT_EQ(sent[i].data, expected[i].second) << i;
  }
}

TEST_F(DriveCommandTest, EnclosureMapsCommandsToDiagnosticPages) {
  ChannelRecord* enclosure = Enclosure();
  EXPECT_EQ(SendDriveCommand(enclosure, CTL_SET_GAUGE, 0x8700, nullptr), 1u);
  EXPECT_EQ(SendDriveCommand(enclosure, CTL_SET_GAUGE, 2, nullptr), 1u);  // no mapping
  EXPECT_EQ(SendDriveCommand(enclosure, CTL_SET_GAUGE, 1, nullptr), 1u);
  BYTE notice = 0x20;
  EXPECT_EQ(DriveCommand(enclosure, CTL_EJECT_NOTICE, &notice, 1, nullptr), 1u);
  EXPECT_EQ(DriveCommand(enclosure, CTL_NOTICE_8, &notice, 1, nullptr), 1u);
  EXPECT_EQ(SendDriveCommand(enclosure, CTL_NOTICE_2, 0, nullptr), 1u);
  EXPECT_EQ(SendDriveCommand(enclosure, CTL_EVENT_REPLY, 0x40, nullptr), 1u);  // no mapping
  EXPECT_EQ(SendDriveCommand(enclosure, CTL_QUIESCE, 0, nullptr), 1u);         // no mapping

  std::vector<Bytes> pages;
  for (const sim::Command& c : Scsi("enclosure", 0x1D)) {
    EXPECT_EQ(c.cdb, (Bytes{0x1D, 0x10, 0x00, 0x00, 0x05, 0x00}));
    pages.push_back(c.data);
  }
  EXPECT_EQ(pages, (std::vector<Bytes>{
                       {0x81, 0x00, 0x00, 0x01, 0x87},
                       {0x80, 0x00, 0x00, 0x01, 0x01},
                       {0x80, 0x00, 0x00, 0x01, 0x04},
                       {0x80, 0x00, 0x00, 0x01, 0x08},
                       {0x80, 0x00, 0x00, 0x01, 0x02},
                   }));
  EXPECT_EQ(machine_.Commands("enclosure").size(), 5u) << machine_.Transcript();
}

TEST_F(DriveCommandTest, EnclosureDrainStopsAfterTwoClearReadsOrFourReads) {
  ChannelRecord* enclosure = Enclosure();
  const auto reads = [&] { return Scsi("enclosure", 0x1C).size(); };

  EXPECT_EQ(SendDriveCommand(enclosure, CTL_CLEAR_EVENT, 0, nullptr), 1u);
  EXPECT_EQ(reads(), 2u) << "nothing pressed: two clear reads";

  machine_.ClearCommands();
  machine_.Press("enclosure", 0x04);
  EXPECT_EQ(SendDriveCommand(enclosure, CTL_CLEAR_GAUGE_EVENT, 0, nullptr), 1u);
  EXPECT_EQ(reads(), 3u) << "set, clear, clear";

  machine_.ClearCommands();
  machine_.holdEnclosureButton = true;
  EXPECT_EQ(SendDriveCommand(enclosure, CTL_CLEAR_EVENT, 0, nullptr), 1u);
  machine_.holdEnclosureButton = false;
  EXPECT_EQ(reads(), 4u) << "the bit never clears: the fourth read ends the drain";
  for (const sim::Command& c : Scsi("enclosure", 0x1C)) {
    EXPECT_EQ(c.cdb, (Bytes{0x1C, 0x01, 0x80, 0x00, 0x05, 0x00}));
  }

  machine_.ClearCommands();
  machine_.FailIo("enclosure", sim::Endpoint::Enclosure, ERROR_GEN_FAILURE, 1, 0x1C);
  EXPECT_EQ(SendDriveCommand(enclosure, CTL_CLEAR_EVENT, 0, nullptr), 0u);
  EXPECT_EQ(reads(), 1u) << "a failed read ends the drain";
}

TEST_F(DriveCommandTest, WithoutTheSharedHandleEveryCommandFails) {
  for (ChannelRecord* channel : {Gauge(), FireWire(), Enclosure()}) {
    CloseHandle(channel->deviceHandle);
    channel->deviceHandle = nullptr;
    EXPECT_EQ(SendDriveCommand(channel, CTL_SET_GAUGE, 0x8100, nullptr), 0u);
    EXPECT_EQ(SendDriveCommand(channel, CTL_EJECT_NOTICE, 0x20, nullptr), 0u);
  }
  // Except a HID command with value 0, which sends nothing.
  EXPECT_EQ(SendDriveCommand(Gauge(), CTL_SET_GAUGE, 0, nullptr), 1u);
  EXPECT_TRUE(machine_.Commands().empty()) << machine_.Transcript();
}

TEST_F(DriveCommandTest, CommandThatDoesNotCompleteIsCancelledAndFails) {
  machine_.HangIo("firewire", sim::Endpoint::Driver, true);
  EXPECT_EQ(SendDriveCommand(FireWire(), CTL_SET_STATE, 1, nullptr), 0u);
  EXPECT_EQ(GetLastError(), static_cast<DWORD>(ERROR_OPERATION_ABORTED));
  EXPECT_EQ(machine_.PendingCount("firewire", sim::Endpoint::Driver), 0u);

  machine_.HangIo("gauge", sim::Endpoint::Hid, true);
  EXPECT_EQ(SendDriveCommand(Gauge(), CTL_SET_GAUGE, 0x8100, nullptr), 0u);
  EXPECT_EQ(machine_.PendingCount("gauge", sim::Endpoint::Hid), 0u);
  EXPECT_EQ(HidReports("gauge").size(), 1u) << "the report reached the device";

  // A driver that never finishes the cancellation holds the sender only for
  // the grace; the request is set aside until the driver completes it.
  const std::size_t aside = SetAsideIoBlockCount();
  machine_.SetCancelDelay("firewire", sim::Endpoint::Driver, INFINITE);
  EXPECT_EQ(SendDriveCommand(FireWire(), CTL_SET_STATE, 1, nullptr), 0u);
  EXPECT_EQ(SetAsideIoBlockCount(), aside + 1);
  machine_.FinishHeldCancels();
  EXPECT_EQ(SetAsideIoBlockCount(), aside);
}

TEST_F(DriveCommandTest, DispatcherRejectsCodesItDoesNotAccept) {
  BYTE value = 2;
  EXPECT_EQ(DriveCommand(nullptr, CTL_SET_STATE, &value, 1, nullptr), 0u);
  EXPECT_EQ(DriveCommand(Enclosure(), CTL_NOTICE_2, &value, 1, nullptr), 0u);
  EXPECT_EQ(DriveCommand(FireWire(), CTL_NOTICE_2, &value, 1, nullptr), 0u);
  EXPECT_EQ(DriveCommand(FireWire(), 0x222044, &value, 1, nullptr), 0u);
  EXPECT_EQ(DriveCommand(FireWire(), 0x223C2C, &value, 1, nullptr), 0u);
  EXPECT_TRUE(machine_.Commands().empty()) << machine_.Transcript();
}

}  // namespace
}  // namespace cmdtest
