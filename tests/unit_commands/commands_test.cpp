// The drive command transport against simulated drives.
#include <algorithm>
#include <chrono>
#include <future>
#include <set>
#include <thread>

#include "commands_fixture.h"
#include "support/test_support.h"
#include "transport/button_events.h"
#include "transport/drive_command.h"
#include "transport/io_block.h"
#include "transport/status_pages.h"
#include "unit_monitor/lock_probe.h"

namespace cmdtest {
namespace {

using Kind = sim::Command::Kind;

class DriveCommandTest : public CommandTest {};

TEST_F(DriveCommandTest, HidChannelsWriteTheReportTheirModelAsksFor) {
  // Models with flag 0x10 (5E24 found through the lower-case path) send
  // 5-byte reports with ID 1, values translated; a plain one sends them as is.
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
}

TEST_F(DriveCommandTest, DriverControlsCarryTheValueOnlyForCodesWithInput) {
  const struct {
    DWORD code;
    Bytes input, sent;
  } rows[] = {
      {CTL_EVENT_REPLY, {0x40}, {}},
      {CTL_SET_GAUGE, {0x00, 0x8F}, {0x00, 0x8F, 0x00, 0x00}},
      {CTL_SET_STATE, {0x04}, {0x04, 0x00, 0x00, 0x00}},
      {CTL_QUIESCE, {0x34, 0x12}, {}},
      {CTL_SET_GAUGE, {0x34, 0x12}, {0x34, 0x12, 0x00, 0x00}},
      {CTL_SET_GAUGE, {0x34}, {0x34, 0x00, 0x00, 0x00}},
      {CTL_SET_STATE, {}, {0x00, 0x00, 0x00, 0x00}},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(testing::Message() << std::hex << row.code << " with " << row.input.size());
    machine_.ClearCommands();
    Bytes input = row.input;
    EXPECT_EQ(DriveCommand(FireWire(), row.code, input.empty() ? nullptr : input.data(),
                           static_cast<DWORD>(input.size()), nullptr),
              1u);
    const std::vector<sim::Command> sent = Sent("firewire", Kind::Control);
    ASSERT_EQ(sent.size(), 1u);
    EXPECT_EQ(sent[0].code, row.code);
    EXPECT_EQ(sent[0].data, row.sent);
  }
}

TEST_F(DriveCommandTest, EnclosureMapsCommandsToDiagnosticPages) {
  // Page and parameter of each command; codes without a mapping send nothing.
  const struct {
    DWORD code;
    WORD value;
    Bytes page;
  } rows[] = {
      {CTL_SET_GAUGE, 0x8700, {0x81, 0x00, 0x00, 0x01, 0x87}},
      {CTL_SET_GAUGE, 2, {}},
      {CTL_SET_GAUGE, 1, {0x80, 0x00, 0x00, 0x01, 0x01}},
      {CTL_EJECT_NOTICE, 0x20, {0x80, 0x00, 0x00, 0x01, 0x04}},
      {CTL_NOTICE_8, 0x20, {0x80, 0x00, 0x00, 0x01, 0x08}},
      {CTL_NOTICE_2, 0, {0x80, 0x00, 0x00, 0x01, 0x02}},
      {CTL_EVENT_REPLY, 0x40, {}},
      {CTL_QUIESCE, 0, {}},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(testing::Message() << std::hex << row.code << " " << row.value);
    machine_.ClearCommands();
    EXPECT_EQ(SendDriveCommand(Enclosure(), row.code, row.value, nullptr), 1u);
    const std::vector<sim::Command> sent = machine_.Commands("enclosure");
    ASSERT_EQ(sent.size(), row.page.empty() ? 0u : 1u) << machine_.Transcript();
    if (row.page.empty()) continue;
    EXPECT_EQ(sent[0].cdb, (Bytes{0x1D, 0x10, 0x00, 0x00, 0x05, 0x00}));
    EXPECT_EQ(sent[0].data, row.page);
  }
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

TEST_F(DriveCommandTest, NothingGoesOutForACodeNotAcceptedOrWithoutTheSharedHandle) {
  BYTE value = 2;
  EXPECT_EQ(DriveCommand(nullptr, CTL_SET_STATE, &value, 1, nullptr), 0u);
  EXPECT_EQ(DriveCommand(Enclosure(), CTL_NOTICE_2, &value, 1, nullptr), 0u);
  EXPECT_EQ(DriveCommand(FireWire(), CTL_NOTICE_2, &value, 1, nullptr), 0u);
  EXPECT_EQ(DriveCommand(FireWire(), 0x222044, &value, 1, nullptr), 0u);
  EXPECT_EQ(DriveCommand(FireWire(), 0x223C2C, &value, 1, nullptr), 0u);
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

// Request blocks go to the port driver with the data right behind the request
// in the block's own memory (never the caller's buffer), sense space zeroed.
TEST_F(StatusPagesTest, DiagnosticPathHandsThePortDriverTheBlocksItExpects) {
  const DriveRecord drive = DiagnosticDrive();
  SetStatus(machine_, "enclosure", {0x76, 0x01, 0x02, 0x03});
  machine_.SetSleepState("enclosure", 2);
  machine_.requests.clear();
  EnumerateDrives(nullptr);
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

  machine_.FailIo("enclosure", sim::Endpoint::Enclosure, ERROR_GEN_FAILURE, -1, 0x1C);
  EXPECT_EQ(ReadDriveStatus(&drive, status), 0u);
  EXPECT_EQ(status[0], 0x00);
  EXPECT_EQ(ReadSleepState(&drive, sleep), 3u);
  EXPECT_EQ(monitorState.refreshRequests, 0u) << "the drive opened: no rescan is asked for";
}

// Every transfer with a HID collection that never answers ends on the stop.
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

struct EventResult {
  BYTE event = 0;
  DWORD error = 0;
};

class ButtonEventTest : public CommandTest {
 protected:
  // Runs ReadButtonEvent on its own thread once the channel's wait is
  // pending, lets `act` end it, and returns what the wait returned.
  template <class Act>
  EventResult WaitThen(ChannelRecord* channel, const char* drive, sim::Endpoint endpoint, Act act) {
    EventResult result;
    std::thread waiter([&] {
      result.event = ReadButtonEvent(channel);
      result.error = GetLastError();
    });
    EXPECT_TRUE(machine_.WaitForPending(drive, endpoint, 1));
    act();
    waiter.join();
    return result;
  }
};

TEST_F(ButtonEventTest, AWaitEndsOnAStopOrWithTheErrorOfAVanishedDevice) {
  // The wait control follows the channel's mode.
  const auto stop = [&] { SetEvent(monitorState.workerStopEvent); };
  const struct {
    ChannelRecord* channel;
    const char* drive;
    sim::Endpoint endpoint;
    DWORD waitCode;
  } waits[] = {{FireWire(), "firewire", sim::Endpoint::Driver, CTL_WAIT_EVENT},
               {Lights(), "lights", sim::Endpoint::Driver, CTL_WAIT_GAUGE_EVENT},
               {Gauge(), "gauge", sim::Endpoint::Hid, 0}};
  for (const auto& wait : waits) {
    SCOPED_TRACE(wait.drive);
    ResetEvent(monitorState.workerStopEvent);
    const EventResult stopped = WaitThen(wait.channel, wait.drive, wait.endpoint, stop);
    EXPECT_EQ(stopped.event, kNoButtonEvent);
    EXPECT_EQ(stopped.error, static_cast<DWORD>(ERROR_IO_PENDING));
    EXPECT_EQ(machine_.PendingCount(wait.drive, wait.endpoint), 0u);
    if (wait.waitCode != 0) {
      EXPECT_EQ(Sent(wait.drive, Kind::Control).at(0).code, wait.waitCode);
    }
  }
  // A stale drive list is not read again while the workers stop; a polled
  // page that was read keeps its byte.
  const LONG drives = Block().driveCount;
  monitorState.driveListStale = 1;
  Block().driveCount = 0;
  machine_.Press("enclosure", 0x04);
  EXPECT_EQ(ReadButtonEvent(Enclosure()), 0x04);
  EXPECT_EQ(Block().driveCount, 0);
  // Otherwise it is, before the event is taken. A press after the stop is
  // kept for the next wait, not lost in a cancelled one; an enclosure's page
  // is polled: no press, no bits.
  ResetEvent(monitorState.workerStopEvent);
  machine_.Press("firewire", 0x05);
  EXPECT_EQ(ReadButtonEvent(FireWire()), 0x05);
  EXPECT_EQ(monitorState.driveListStale, 0u);
  EXPECT_EQ(Block().driveCount, drives);
  machine_.Press("gauge", 0x04);  // input report 01 04 ...
  EXPECT_EQ(ReadButtonEvent(Gauge()), 0x04);
  machine_.Press("enclosure", 0x01);
  EXPECT_EQ(ReadButtonEvent(Enclosure()), 0x01);
  EXPECT_EQ(GetLastError(), 0u);
  EXPECT_EQ(ReadButtonEvent(Enclosure()), 0x00);
  // With no workers there is no stop event; a pending wait still takes a press.
  const HANDLE workerStop = monitorState.workerStopEvent;
  monitorState.workerStopEvent = nullptr;
  const EventResult pressed = WaitThen(FireWire(), "firewire", sim::Endpoint::Driver,
                                       [&] { machine_.Press("firewire", 0x06); });
  monitorState.workerStopEvent = workerStop;
  EXPECT_EQ(pressed.event, 0x06);

  const EventResult gone = WaitThen(FireWire(), "firewire", sim::Endpoint::Driver,
                                    [&] { machine_.Detach("firewire", ERROR_DEV_NOT_EXIST); });
  EXPECT_EQ(gone.event, kNoButtonEvent);
  EXPECT_EQ(gone.error, static_cast<DWORD>(ERROR_DEV_NOT_EXIST));
  // Later waits on the handle fail at once with the same error.
  EXPECT_EQ(ReadButtonEvent(FireWire()), kNoButtonEvent);
  EXPECT_EQ(GetLastError(), static_cast<DWORD>(ERROR_DEV_NOT_EXIST));

  machine_.FailIo("enclosure", sim::Endpoint::Enclosure, ERROR_DEVICE_NOT_CONNECTED, 1);
  EXPECT_EQ(ReadButtonEvent(Enclosure()), kNoButtonEvent);
  EXPECT_EQ(GetLastError(), static_cast<DWORD>(ERROR_DEVICE_NOT_CONNECTED));

  ChannelRecord* gauge = Gauge();
  CloseHandle(gauge->deviceHandle);
  gauge->deviceHandle = nullptr;
  EXPECT_EQ(ReadButtonEvent(gauge), kNoButtonEvent);
  EXPECT_EQ(GetLastError(), static_cast<DWORD>(ERROR_INVALID_HANDLE));
}

// Identities are stored (HID) and handles read (driver) under the mutex; the
// driver's bytes go out as hexadecimal within the length given, never into
// the record; the HID serial string, whatever its length, into the record too.
TEST_F(ButtonEventTest, IdentityReadsWaitForTheStateMutex) {
  ChannelRecord* fireWire = FireWire();
  ChannelRecord* gauge = Gauge();
  WCHAR buffer[128];
  BYTE* const bytes = reinterpret_cast<BYTE*>(buffer);
  const auto fill = [&] {
    for (WCHAR& unit : buffer) unit = WSTR('#');
  };
  fill();
  DWORD result = 1;
  EXPECT_TRUE(
      lockprobe::WaitsForTheStateMutex([&] { result = ReadDriveIdentity(fireWire, bytes, 34); }));
  EXPECT_EQ(result, 0u);
  EXPECT_EQ(Narrow(buffer), "1122334455667788");
  EXPECT_EQ(fireWire->identityText[0], 0);
  fill();
  EXPECT_EQ(ReadDriveIdentity(fireWire, bytes, 10), 0u);
  EXPECT_EQ(Narrow(buffer), "1122");
  EXPECT_EQ(buffer[5], WSTR('#'));
  fill();
  EXPECT_EQ(DriveCommand(fireWire, CTL_GET_IDENTITY, bytes, 1, nullptr), 0u);
  EXPECT_EQ(ReadDriveIdentity(Enclosure(), bytes, 40), 0u);
  EXPECT_EQ(buffer[0], WSTR('#'));

  EXPECT_TRUE(lockprobe::WaitsForTheStateMutex(
      [&] { result = DriveCommand(gauge, CTL_GET_IDENTITY, bytes, 1, nullptr); }));
  EXPECT_EQ(result, 1u);
  EXPECT_EQ(Narrow(buffer), "374B324139463331");  // "7K2A9F31" as hexadecimal pairs
  EXPECT_EQ(Narrow(gauge->identityText), "374B324139463331");
  EXPECT_EQ(Sent("gauge", Kind::HidSerial).size(), 1u);

  machine_.FailOpen("gauge", sim::Endpoint::Hid, ERROR_ACCESS_DENIED, 1);
  gauge->identityText[0] = WSTR('Z');
  EXPECT_EQ(ReadDriveIdentity(gauge, bytes, 256), 0u);
  EXPECT_EQ(gauge->identityText[0], WSTR('Z')) << "a failed read changes nothing";

  // A collection that never answers is given up when the workers stop.
  machine_.HangIo("gauge", sim::Endpoint::Hid, true);
  SetEvent(monitorState.workerStopEvent);
  auto hung = std::async(std::launch::async, [&] { return ReadDriveIdentity(gauge, bytes, 256); });
  const bool ended = hung.wait_for(std::chrono::seconds(60)) == std::future_status::ready;
  machine_.HangIo("gauge", sim::Endpoint::Hid, false);
  ASSERT_TRUE(ended) << "a hung HID collection held the worker past its stop";
  EXPECT_EQ(hung.get(), 0u);
  EXPECT_EQ(gauge->identityText[0], WSTR('Z'));
}

}  // namespace
}  // namespace cmdtest
