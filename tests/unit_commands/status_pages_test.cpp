// Status page, sleep state and control block over both paths: the drive's
// control interface (diagnostic pages) and its HID collection (reports).
#include "transport/status_pages.h"

#include <algorithm>
#include <chrono>
#include <future>
#include <set>

#include "commands_fixture.h"

namespace cmdtest {
namespace {

using Kind = sim::Command::Kind;

class StatusPagesTest : public CommandTest {
 protected:
  // A USB drive reached through its HID collection.
  DriveRecord HidDrive() {
    DriveRecord drive{};
    drive.busKind = 2;
    WideCopy(drive.hidPath, 256, Gauge()->devicePath);
    return drive;
  }
  // An IEEE 1394 drive reached through its enclosure's control interface.
  DriveRecord DiagnosticDrive() {
    DriveRecord drive{};
    drive.busKind = 3;
    WideCopy(drive.controlPath, 256, Enclosure()->devicePath);
    WideCopy(drive.hidPath, 256, Gauge()->devicePath);  // not used: the control path wins
    return drive;
  }
  static Bytes Page(const BYTE* page, std::size_t length) { return Bytes(page, page + length); }
  static void SetStatus(sim::Machine& machine, const char* drive, Bytes bytes4to7) {
    machine.SetStatus(drive, bytes4to7.data());
  }
};

TEST_F(StatusPagesTest, HidStatusReportIsPresentedAsTheStatusPage) {
  const DriveRecord drive = HidDrive();
  BYTE page[8];
  SetStatus(machine_, "gauge", {0xC5, 0x33, 0x22, 0x11});  // report 02 11 22 33 C5
  EXPECT_EQ(ReadDriveStatus(&drive, page), 3u);
  EXPECT_EQ(Page(page, 8), (Bytes{0x82, 0x00, 0x00, 0x00, 0xC5, 0x33, 0x22, 0x11}));
  EXPECT_EQ(page[4] >> 6, 3) << "2-bit level";

  SetStatus(machine_, "gauge", {0x3A, 0x00, 0x00, 0x00});
  EXPECT_EQ(ReadDriveStatus(&drive, page), 4u);
  EXPECT_EQ(page[4], 0x0A) << "bits 4 and 5 are cleared on the HID path";

  // The sleep report (ID 3) is presented as page 0x83.
  machine_.SetSleepState("gauge", 6);
  EXPECT_EQ(ReadSleepState(&drive, page), 2u);
  EXPECT_EQ(Page(page, 5), (Bytes{0x83, 0x00, 0x00, 0x00, 0x80}));
  machine_.SetSleepState("gauge", 1);
  EXPECT_EQ(ReadSleepState(&drive, page), 0u);
  EXPECT_EQ(page[4], 0x40);
  machine_.SetSleepState("gauge", 3);
  EXPECT_EQ(ReadSleepState(&drive, page), 3u);

  const std::vector<sim::Command> queries = Sent("gauge", Kind::HidInputReport);
  ASSERT_EQ(queries.size(), 5u);
  EXPECT_EQ(queries[0].data, (Bytes{0x02}));
  EXPECT_EQ(queries[2].data, (Bytes{0x03}));
  EXPECT_EQ(monitorState.refreshRequests, 0u);

  // The control block goes out as report 2, bytes reordered.
  const BYTE control[8] = {0x82, 0x00, 0x00, 0x00, 0x07, 0x00, 0xAA, 0xBB};
  EXPECT_EQ(WriteDriveControl(&drive, control), 0u);
  EXPECT_EQ(HidReports("gauge"), (std::vector<Bytes>{{0x02, 0xBB, 0xAA, 0x00, 0x07}}));
  machine_.FailIo("gauge", sim::Endpoint::Hid, ERROR_GEN_FAILURE, 1);
  EXPECT_EQ(WriteDriveControl(&drive, control), static_cast<DWORD>(ERROR_GEN_FAILURE));
}

TEST_F(StatusPagesTest, StatusNibbleMapsToTheStatusCode) {
  const DriveRecord drive = HidDrive();
  const DWORD expected[16] = {0, 5, 1, 6, 1, 3, 2, 1, 7, 8, 4, 4, 4, 4, 4, 4};
  for (BYTE nibble = 0; nibble < 16; ++nibble) {
    SetStatus(machine_, "gauge", {static_cast<std::uint8_t>(0x40 | nibble), 0, 0, 0});
    BYTE page[8];
    EXPECT_EQ(ReadDriveStatus(&drive, page), expected[nibble]) << int{nibble};
  }
}

TEST_F(StatusPagesTest, DiagnosticPathReadsAndWritesPagesThroughPassThrough) {
  const DriveRecord drive = DiagnosticDrive();
  SetStatus(machine_, "enclosure", {0x76, 0x01, 0x02, 0x03});
  machine_.SetSleepState("enclosure", 2);
  BYTE status[8];
  EXPECT_EQ(ReadDriveStatus(&drive, status), 2u);  // nibble 6
  EXPECT_EQ(Page(status, 8), (Bytes{0x82, 0x00, 0x00, 0x04, 0x76, 0x01, 0x02, 0x03}))
      << "the drive's page is passed on unchanged";
  BYTE sleep[5];
  EXPECT_EQ(ReadSleepState(&drive, sleep), 2u);
  const BYTE control[8] = {0x82, 0x00, 0x00, 0x00, 0x07, 0x00, 0xAA, 0xBB};
  EXPECT_EQ(WriteDriveControl(&drive, control), 0u);
  const std::vector<sim::Command> receives = Scsi("enclosure", 0x1C);
  ASSERT_EQ(receives.size(), 2u);
  EXPECT_EQ(receives[0].cdb, (Bytes{0x1C, 0x01, 0x82, 0x00, 0x08, 0x00}));
  EXPECT_EQ(receives[1].cdb, (Bytes{0x1C, 0x01, 0x83, 0x00, 0x05, 0x00}));
  const std::vector<sim::Command> sends = Scsi("enclosure", 0x1D);
  ASSERT_EQ(sends.size(), 1u);
  EXPECT_EQ(sends[0].cdb, (Bytes{0x1D, 0x10, 0x00, 0x00, 0x08, 0x00}));
  EXPECT_EQ(sends[0].data, Bytes(control, control + 8));
  EXPECT_TRUE(Sent("gauge", Kind::HidInputReport).empty());

  machine_.FailIo("enclosure", sim::Endpoint::Enclosure, ERROR_GEN_FAILURE, -1, 0x1C);
  EXPECT_EQ(ReadDriveStatus(&drive, status), 0u);
  EXPECT_EQ(status[0], 0x00);
  EXPECT_EQ(ReadSleepState(&drive, sleep), 3u);
  EXPECT_EQ(monitorState.refreshRequests, 0u) << "the drive opened: no rescan is asked for";
}

// What enumeration, a status read and a control write hand to the port
// driver: the block it expects, the data right behind the request in the
// request's own block (never the caller's buffer), sense space zeroed.
TEST_F(StatusPagesTest, EveryPassThroughRequestIsTheBlockThePortDriverExpects) {
  machine_.requests.clear();
  EnumerateDrives(nullptr);
  const DriveRecord drive = DiagnosticDrive();
  BYTE status[8];
  ReadDriveStatus(&drive, status);
  const BYTE control[8] = {0x82};
  WriteDriveControl(&drive, control);
  std::set<BYTE> operations;
  for (const TestMachine::Request& r : machine_.requests) {
    const SCSI_PASS_THROUGH_DIRECT& spt = r.block.spt;
    SCOPED_TRACE(int{spt.Cdb[0]});
    operations.insert(spt.Cdb[0]);
    EXPECT_EQ(r.input, r.output);
    EXPECT_EQ(r.inputLength, 80u);
    EXPECT_EQ(r.outputLength, 80u);
    EXPECT_EQ(spt.Length, 56);
    EXPECT_EQ(spt.ScsiStatus | spt.PathId | spt.TargetId | spt.Lun, 0);
    EXPECT_EQ(spt.CdbLength, spt.Cdb[0] == 0x25 ? 10 : 6);
    EXPECT_EQ(spt.SenseInfoLength, 18);
    EXPECT_EQ(spt.TimeOutValue, 20u);
    EXPECT_EQ(spt.DataBuffer, static_cast<const BYTE*>(r.input) + 80);
    EXPECT_EQ(spt.SenseInfoOffset, 60u);
    EXPECT_EQ(r.block.totalLength, 80u);
    EXPECT_EQ(std::count(r.block.sense, r.block.sense + 20, 0), 20);
  }
  EXPECT_EQ(operations, (std::set<BYTE>{0x12, 0x25, 0x1C, 0x1D}));
}

// A USB drive whose HID collection never answers: every read and write is
// given up on the caller's stop event instead of holding it (and the mutex
// it holds) for good.
TEST_F(StatusPagesTest, HungHidCollectionIsGivenUpOnTheStopEvent) {
  const DriveRecord drive = HidDrive();
  machine_.HangIo("gauge", sim::Endpoint::Hid, true);
  const HANDLE stop = CreateEventW(nullptr, TRUE, TRUE, nullptr);
  const BYTE control[8] = {0x82, 0x00, 0x00, 0x00, 0x07, 0x00, 0xAA, 0xBB};
  auto calls = std::async(std::launch::async, [&] {
    BYTE status[8];
    BYTE sleep[5];
    return std::vector<DWORD>{ReadDriveStatus(&drive, status, stop),
                              ReadSleepState(&drive, sleep, stop),
                              WriteDriveControl(&drive, control, stop)};
  });
  const bool ended = calls.wait_for(std::chrono::seconds(60)) == std::future_status::ready;
  machine_.HangIo("gauge", sim::Endpoint::Hid, false);
  ASSERT_TRUE(ended) << "a hung HID collection held the caller";
  EXPECT_EQ(calls.get(), (std::vector<DWORD>{0, 3, static_cast<DWORD>(ERROR_OPERATION_ABORTED)}));
  EXPECT_EQ(Sent("gauge", Kind::HidInputReport).size(), 2u);
  CloseHandle(stop);
}

TEST_F(StatusPagesTest, ADriveThatDoesNotOpenAsksForARescanOnceUnlessNoneCanHelp) {
  machine_.FailOpen("gauge", sim::Endpoint::Hid, ERROR_FILE_NOT_FOUND);
  const DriveRecord drive = HidDrive();
  BYTE status[8];
  BYTE sleep[5];
  const BYTE control[8] = {};
  EXPECT_EQ(ReadDriveStatus(&drive, status), 0u);
  EXPECT_EQ(ReadSleepState(&drive, sleep), 3u);
  EXPECT_EQ(WriteDriveControl(&drive, control), 0xFFFFFFFFu);
  EXPECT_EQ(monitorState.refreshRequests, 1u) << "once while the drive stays so";
  EXPECT_EQ(monitorState.burstRequested, 1u);
  EXPECT_EQ(monitorState.gaugePassRequested, 1u);
  EXPECT_EQ(monitorState.sleepPassRequested, 1u);

  // Once the drive opened again, a new failure asks again.
  machine_.ClearFaults();
  ReadDriveStatus(&drive, status);
  machine_.FailOpen("gauge", sim::Endpoint::Hid, ERROR_FILE_NOT_FOUND);
  EXPECT_EQ(ReadDriveStatus(&drive, status), 0u);
  EXPECT_EQ(monitorState.refreshRequests, 2u);

  // Not bound yet (USB without its HID collection, IEEE 1394 without a
  // control path): the binding may still give it a path.
  DriveRecord unbound{};
  unbound.busKind = 2;
  EXPECT_EQ(ReadDriveStatus(&unbound, status), 0u);
  EXPECT_EQ(monitorState.refreshRequests, 3u);
  unbound.busKind = 3;
  EXPECT_EQ(ReadDriveStatus(&unbound, status), 0u);
  EXPECT_EQ(ReadDriveStatus(&unbound, status), 0u);
  EXPECT_EQ(monitorState.refreshRequests, 4u) << "not again on every pass";

  // An IEEE 1394 drive bound to its button-filter-driver channel has neither
  // a control interface nor a HID collection; a rescan cannot change that.
  machine_.ClearCommands();
  DriveRecord bound{};
  bound.busKind = 3;
  WideCopy(bound.channelPath, 256, FireWire()->devicePath);
  WideCopy(bound.hidPath, 256, FireWire()->devicePath);
  monitorState.refreshRequests = 0;
  EXPECT_EQ(ReadDriveStatus(&bound, status), 0u);
  EXPECT_EQ(ReadSleepState(&bound, sleep), 3u);
  EXPECT_EQ(WriteDriveControl(&bound, control), 0xFFFFFFFFu);
  EXPECT_EQ(monitorState.refreshRequests, 0u);
  EXPECT_TRUE(machine_.Commands().empty()) << machine_.Transcript();
}

}  // namespace
}  // namespace cmdtest
