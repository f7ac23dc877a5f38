// The button-event wait on each kind of channel, its end by a stop or a
// vanished device, and the identity query.
#include "transport/button_events.h"

#include <chrono>
#include <future>
#include <thread>

#include "commands_fixture.h"
#include "support/test_support.h"
#include "transport/drive_command.h"
#include "unit_monitor/lock_probe.h"

namespace cmdtest {
namespace {

using Kind = sim::Command::Kind;

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

TEST_F(ButtonEventTest, EachChannelKindDeliversItsEventByte) {
  machine_.Press("firewire", 0x05);  // kept until a wait takes it
  EXPECT_EQ(ReadButtonEvent(FireWire()), 0x05);
  machine_.Press("gauge", 0x04);  // input report 01 04 ...
  EXPECT_EQ(ReadButtonEvent(Gauge()), 0x04);
  machine_.Press("enclosure", 0x01);
  EXPECT_EQ(ReadButtonEvent(Enclosure()), 0x01);
  EXPECT_EQ(GetLastError(), 0u);
  EXPECT_EQ(ReadButtonEvent(Enclosure()), 0x00) << "the page is polled: no press, no bits";

  const EventResult pressed =
      WaitThen(Lights(), "lights", sim::Endpoint::Driver, [&] { machine_.Press("lights", 0x02); });
  EXPECT_EQ(pressed.event, 0x02);
  EXPECT_EQ(pressed.error, 0u);
  EXPECT_EQ(Sent("lights", Kind::Control).at(0).code, CTL_WAIT_GAUGE_EVENT);
  EXPECT_EQ(Sent("firewire", Kind::Control).at(0).code, CTL_WAIT_EVENT);
}

TEST_F(ButtonEventTest, AWaitEndsOnAStopOrWithTheErrorOfAVanishedDevice) {
  const auto stop = [&] { SetEvent(monitorState.workerStopEvent); };
  const struct {
    ChannelRecord* channel;
    const char* drive;
    sim::Endpoint endpoint;
  } waits[] = {{FireWire(), "firewire", sim::Endpoint::Driver},
               {Gauge(), "gauge", sim::Endpoint::Hid}};
  for (const auto& wait : waits) {
    ResetEvent(monitorState.workerStopEvent);
    const EventResult stopped = WaitThen(wait.channel, wait.drive, wait.endpoint, stop);
    EXPECT_EQ(stopped.event, kNoButtonEvent) << wait.drive;
    EXPECT_EQ(stopped.error, static_cast<DWORD>(ERROR_IO_PENDING)) << wait.drive;
    EXPECT_EQ(machine_.PendingCount(wait.drive, wait.endpoint), 0u) << wait.drive;
  }
  // A press after the stop is kept for the next wait, not lost in a
  // cancelled one.
  ResetEvent(monitorState.workerStopEvent);
  machine_.Press("firewire", 0x01);
  EXPECT_EQ(ReadButtonEvent(FireWire()), 0x01);

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

TEST_F(ButtonEventTest, StaleDriveListIsReadAgainBeforeTheEventIsTaken) {
  monitorState.driveListStale = 1;
  const LONG drives = Block().driveCount;
  Block().driveCount = 0;
  machine_.Press("firewire", 0x01);
  EXPECT_EQ(ReadButtonEvent(FireWire()), 0x01);
  EXPECT_EQ(monitorState.driveListStale, 0u);
  EXPECT_EQ(Block().driveCount, drives);

  // Not while the workers stop: the list stays as it is.
  monitorState.driveListStale = 1;
  Block().driveCount = 0;
  SetEvent(monitorState.workerStopEvent);
  machine_.Press("enclosure", 0x04);
  EXPECT_EQ(ReadButtonEvent(Enclosure()), 0x04) << "a poll that was read keeps its byte";
  EXPECT_EQ(monitorState.driveListStale, 1u);
  EXPECT_EQ(Block().driveCount, 0);
}

// Workers read identities while the monitor rebuilds the records: the HID
// identity is stored, and the driver channel's handle read, under the mutex.
TEST_F(ButtonEventTest, IdentityReadsWaitForTheStateMutex) {
  DWORD hid = 0;
  EXPECT_TRUE(
      lockprobe::WaitsForTheStateMutex([&] { hid = ReadDriveIdentity(Gauge(), nullptr, 0); }));
  EXPECT_EQ(hid, 1u);
  EXPECT_EQ(Narrow(Gauge()->identityText), "374B324139463331");
  WCHAR buffer[20] = {};
  EXPECT_TRUE(lockprobe::WaitsForTheStateMutex(
      [&] { ReadDriveIdentity(FireWire(), reinterpret_cast<BYTE*>(buffer), 34); }));
  EXPECT_EQ(Narrow(buffer), "1122334455667788");
}

TEST_F(ButtonEventTest, IdentityIsHexadecimalTextWithinTheLengthAsked) {
  // The driver's 8 identity bytes 88 77 ... 11, within the length given.
  ChannelRecord* fireWire = FireWire();
  WCHAR buffer[128];
  const auto fill = [&] {
    for (WCHAR& unit : buffer) unit = WSTR('#');
  };
  fill();
  EXPECT_EQ(ReadDriveIdentity(fireWire, reinterpret_cast<BYTE*>(buffer), 34), 0u);
  EXPECT_EQ(Narrow(buffer), "1122334455667788");
  EXPECT_EQ(fireWire->identityText[0], 0) << "the record's identity is not written";
  fill();
  EXPECT_EQ(ReadDriveIdentity(fireWire, reinterpret_cast<BYTE*>(buffer), 10), 0u);
  EXPECT_EQ(Narrow(buffer), "1122");
  EXPECT_EQ(buffer[5], WSTR('#'));
  fill();
  EXPECT_EQ(DriveCommand(fireWire, CTL_GET_IDENTITY, reinterpret_cast<BYTE*>(buffer), 1, nullptr),
            0u);
  EXPECT_EQ(buffer[0], WSTR('#')) << "a length of 1 writes nothing";
  EXPECT_EQ(ReadDriveIdentity(Enclosure(), reinterpret_cast<BYTE*>(buffer), 40), 0u);
  EXPECT_EQ(buffer[0], WSTR('#'));

  // The HID serial string, whatever the length, also into the record.
  ChannelRecord* gauge = Gauge();
  EXPECT_EQ(DriveCommand(gauge, CTL_GET_IDENTITY, reinterpret_cast<BYTE*>(buffer), 1, nullptr), 1u);
  EXPECT_EQ(Narrow(buffer), "374B324139463331");  // "7K2A9F31" as hexadecimal pairs
  EXPECT_EQ(Narrow(gauge->identityText), "374B324139463331");
  EXPECT_EQ(Sent("gauge", Kind::HidSerial).size(), 1u);

  machine_.FailOpen("gauge", sim::Endpoint::Hid, ERROR_ACCESS_DENIED, 1);
  gauge->identityText[0] = WSTR('Z');
  EXPECT_EQ(ReadDriveIdentity(gauge, reinterpret_cast<BYTE*>(buffer), 256), 0u);
  EXPECT_EQ(gauge->identityText[0], WSTR('Z')) << "a failed read changes nothing";

  // A collection that never answers is given up when the workers stop.
  machine_.HangIo("gauge", sim::Endpoint::Hid, true);
  SetEvent(monitorState.workerStopEvent);
  auto hung = std::async(std::launch::async, [&] {
    return ReadDriveIdentity(gauge, reinterpret_cast<BYTE*>(buffer), 256);
  });
  const bool ended = hung.wait_for(std::chrono::seconds(60)) == std::future_status::ready;
  machine_.HangIo("gauge", sim::Endpoint::Hid, false);
  ASSERT_TRUE(ended) << "a hung HID collection held the worker past its stop";
  EXPECT_EQ(hung.get(), 0u);
  EXPECT_EQ(gauge->identityText[0], WSTR('Z'));
}

}  // namespace
}  // namespace cmdtest
