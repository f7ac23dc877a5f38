// Safe removal: volumes offline, the device node ejected (retried while
// vetoed), the drive-gone command and the channel unlinked; and the paths on
// which nothing is ejected.
#include "volume/safe_removal.h"

#include "features_fixture.h"
#include "transport/drive_command.h"
#include "transport/drive_features.h"
#include "volume/eject.h"

namespace featuretest {
namespace {

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

  // The channel's disk dropped out of the list; the worker's scratch record
  // is all zero.
  machine_.FailOpen("plain", sim::Endpoint::Disk, ERROR_ACCESS_DENIED);
  EnumerateDrives(nullptr);
  AssignVolumeLetters();
  DriveRecord zero{};
  EXPECT_EQ(SafeRemoveDrive(&zero, plain), 0);
  EXPECT_EQ(machine_.DismountCount('F'), 0);

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
  ChannelRecord* gauge = Gauge();
  const LONG linked = gauge->linkedDrive;
  machine_.SetVolumeHeldOpen('K', true);
  EXPECT_EQ(Remove(gauge), 0);
  EXPECT_EQ(machine_.DismountCount('E'), 1) << "volumes before the held one stay dismounted";
  EXPECT_EQ(machine_.DismountCount('K'), 0);
  EXPECT_TRUE(machine_.Ejects().empty());
  ExpectNotRemoved("gauge", gauge, linked);
  EXPECT_TRUE(HidValues("gauge").empty());

  // A failed lock or dismount fails the removal the same way.
  for (DWORD code : {FSCTL_LOCK_VOLUME, FSCTL_DISMOUNT_VOLUME}) {
    machine_.SetVolumeHeldOpen('K', false);
    machine_.SetVolumeControlError('E', code, ERROR_ACCESS_DENIED);
    EXPECT_EQ(Remove(gauge), 0) << code;
    EXPECT_TRUE(machine_.Ejects().empty());
    machine_.SetVolumeControlError('E', code, 0);
  }

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
      {"plain", 1, true, 2},
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

TEST_F(SafeRemovalTest, LibraryAndFunctionsAreFoundAtRunTime) {
  ChannelRecord* gauge = Gauge();
  const LONG linked = gauge->linkedDrive;
  machine_.SetModuleLoadFails("setupapi.dll", true);
  EXPECT_EQ(Remove(gauge), 0);
  EXPECT_TRUE(machine_.Ejects().empty());
  ExpectNotRemoved("gauge", gauge, linked);

  // A missing function counts as a failed call: the next one is tried.
  machine_.SetModuleLoadFails("setupapi.dll", false);
  machine_.RemoveExport("setupapi.dll", "CM_Request_Device_EjectA");
  machine_.RemoveExport("setupapi.dll", "CM_Query_And_Remove_SubTreeA");
  machine_.SetEjectVeto("gauge", PNP_VetoOutstandingOpen, "another program", 1);
  EXPECT_EQ(Remove(gauge), 1);
  const auto ejects = machine_.Ejects();
  ASSERT_EQ(ejects.size(), 2u) << "only the wide query-and-remove, in two attempts";
  EXPECT_TRUE(ejects[0].queryAndRemove);
  EXPECT_TRUE(ejects[1].queryAndRemove);

  machine_.RemoveExport("setupapi.dll", "CM_Query_And_Remove_SubTreeW");
  ChannelRecord* plain = Plain();
  EXPECT_EQ(Remove(plain), 0);
  EXPECT_EQ(machine_.Ejects().size(), 2u);
  EXPECT_TRUE(machine_.Attached("plain"));
}

// Windows 2000: the two listed models are told of the eject and their USB
// parent is ejected instead of the storage function.
using Windows2000RemovalTest = SafeRemovalTest;

TEST_F(Windows2000RemovalTest, ListedModelIsEjectedThroughItsParent) {
  monitorState.osKind = kOsWindows2000;
  ChannelRecord* plain = Plain();  // model 2A31
  ASSERT_EQ(Remove(plain), 1);
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

// The listed model served by the maker's own driver service, with a parent
// that cannot be surprise-removed.
class OwnDriverRemovalTest : public SafeRemovalTest {
  void Customize(std::vector<sim::DriveSpec>* drives) override {
    (*drives)[1].parentService = "VEVUV_UR";
    (*drives)[1].parentCapabilities = 0x04;
  }
};

TEST_F(OwnDriverRemovalTest, StorageFunctionIsEjectedWithoutNotice) {
  monitorState.osKind = kOsWindows2000;
  ChannelRecord* plain = Plain();
  ASSERT_EQ(Remove(plain), 1);
  const auto ejects = machine_.Ejects();
  ASSERT_EQ(ejects.size(), 1u);
  EXPECT_TRUE(NamesFunctionNode(ejects[0]));
  EXPECT_TRUE(ejects[0].queryAndRemove) << "capabilities come from the USB parent";
  for (const Bytes& value : HidValues("plain")) EXPECT_NE(value[0], 0x20);
}

}  // namespace
}  // namespace featuretest
