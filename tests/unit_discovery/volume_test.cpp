// Volume letters of the drives, and taking a drive's volumes offline.
#include <gtest/gtest.h>

#include <chrono>
#include <future>

#include "discovery/drive_enumeration.h"
#include "discovery_fixture.h"
#include "platform/diagnostics.h"
#include "support/test_support.h"
#include "volume/dismount.h"
#include "volume/volume_letters.h"

namespace disctest {
namespace {

sim::VolumeSpec Volume(char letter, UINT type, std::uint32_t partition = 1) {
  sim::VolumeSpec volume;
  volume.letter = letter;
  volume.driveType = type;
  volume.partition = partition;
  return volume;
}

class VolumeTest : public DiscoveryTest {
 protected:
  // A system disk (number 0) with C:, a volume S: that spans disks (with
  // the number that stands for none), a CD-ROM D: and a floppy A: that claim
  // the drive's disk number, and the maker's drive with the given volumes.
  void Build(const std::vector<sim::VolumeSpec>& driveVolumes) {
    sim::VolumeSpec system = Volume('C', DRIVE_FIXED);
    system.diskNumber = 0;
    machine_.AddVolume(system);
    sim::VolumeSpec spanned = Volume('S', DRIVE_FIXED);
    spanned.diskNumber = 0xFFFFFFFF;
    machine_.AddVolume(spanned);
    sim::DriveSpec spec = UsbDrive("drive", "7B44", "564F4C");
    spec.volumes = driveVolumes;
    machine_.AddDrive(spec);
    const std::uint32_t number = machine_.DiskNumber("drive");
    sim::VolumeSpec cdrom = Volume('D', DRIVE_CDROM);
    cdrom.diskNumber = number;
    machine_.AddVolume(cdrom);
    sim::VolumeSpec floppy = Volume('A', DRIVE_REMOVABLE);
    floppy.diskNumber = number;
    machine_.AddVolume(floppy);
    Install();
  }
};

TEST_F(VolumeTest, LettersOfTheDrivesVolumesInLetterOrderAndNoneWithoutADiskNumber) {
  Build({Volume('G', DRIVE_REMOVABLE, 2), Volume('F', DRIVE_FIXED, 1)});
  EnumerateDrives(nullptr);
  ASSERT_EQ(Block().driveCount, 1);
  AssignVolumeLetters();
  EXPECT_EQ(Drive(0).diskNumber, machine_.DiskNumber("drive"));
  EXPECT_EQ(N(Drive(0).volumeLetters), "FG");  // not A:, the CD-ROM, C: of disk 0 or S:
  EXPECT_EQ(Drive(0).volumeCount, 2u);
  EXPECT_EQ(Drive(0).volumeDriveType, DWORD{DRIVE_REMOVABLE});  // that of the last letter

  machine_.FailIo("drive", sim::Endpoint::Disk, ERROR_NOT_READY, -1,
                  IOCTL_STORAGE_GET_DEVICE_NUMBER);
  EnumerateDrives(nullptr);
  ASSERT_EQ(Block().driveCount, 1);
  AssignVolumeLetters();
  EXPECT_EQ(Drive(0).volumeCount, 0u);  // in particular not C: of disk 0, nor S:
  EXPECT_EQ(Drive(0).volumeLetters[0], 0);
}

TEST_F(VolumeTest, DismountTakesEveryVolumeOfflineAndStopsAtOneHeldOpen) {
  Build({Volume('F', DRIVE_FIXED, 1), Volume('G', DRIVE_FIXED, 2), Volume('H', DRIVE_FIXED, 3)});
  EnumerateDrives(nullptr);
  AssignVolumeLetters();
  EXPECT_EQ(DismountDriveVolumes(&Drive(0)), 1);
  for (char letter : {'F', 'G', 'H'}) {
    EXPECT_EQ(machine_.DismountCount(letter), 1) << letter;
    EXPECT_FALSE(machine_.VolumeLocked(letter)) << letter;  // unlocked again after the dismount
  }
  const DriveRecord noLetters{};
  EXPECT_EQ(DismountDriveVolumes(&noLetters), 1);

  machine_.SetVolumeHeldOpen('G', true);
  const auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(DismountDriveVolumes(&Drive(0)), 0);
  const auto elapsed = std::chrono::steady_clock::now() - start;
  // A lower bound only: the failed lock pauses (scaled) before reporting.
  const double elapsedMs = std::chrono::duration<double, std::milli>(elapsed).count();
  EXPECT_GE(elapsedMs, 1000.0 * platform::TimeScale());
  EXPECT_EQ(machine_.DismountCount('F'), 2);
  EXPECT_EQ(machine_.DismountCount('G'), 1);
  EXPECT_EQ(machine_.DismountCount('H'), 1);  // stopped at the first failure
  EXPECT_EQ(monitorState.driveListStale, 0u);
}

TEST_F(VolumeTest, AVolumeThatNeverAnswersIsGivenUpAtTheStop) {
  Build({Volume('F', DRIVE_FIXED)});
  machine_.HangIo("drive", sim::Endpoint::Volume, true);
  const skytest::Handle stop = skytest::NewEvent(true, true);
  monitorState.stopEvent = stop.Get();
  auto dismount = std::async(std::launch::async, [] { return DismountVolume(WSTR('F')); });
  const bool ended = dismount.wait_for(std::chrono::seconds(60)) == std::future_status::ready;
  machine_.HangIo("drive", sim::Endpoint::Volume, false);
  ASSERT_TRUE(ended) << "a hung volume held the caller (and the mutex it holds) past the stop";
  EXPECT_EQ(dismount.get(), 0);
  monitorState.stopEvent = nullptr;
}

TEST_F(VolumeTest, WrongDriveTypeOrTheWindows95FamilyDismountNothing) {
  Build({Volume('F', DRIVE_FIXED)});
  testing::internal::CaptureStdout();
  EXPECT_EQ(DismountVolume(WSTR('D')), 0);
  // The console writer turns the line break into the C library's own.
  EXPECT_EQ(testing::internal::GetCapturedStdout(), "Cannot eject.  Drive type is incorrect.\n");
  machine_.SetOsVersion(4, 10, 2222, VER_PLATFORM_WIN32_WINDOWS);
  EXPECT_EQ(DismountVolume(WSTR('F')), 0);
  EXPECT_EQ(machine_.DismountCount('F'), 0);
}

}  // namespace
}  // namespace disctest
