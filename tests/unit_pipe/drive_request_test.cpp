#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "discovery/channel_binding.h"
#include "discovery/channel_scan.h"
#include "discovery/drive_enumeration.h"
#include "machine.h"
#include "pipe/dispatcher.h"
#include "pipe/pipe_instance.h"
#include "pipe_fixture.h"
#include "service/process_locks.h"
#include "transport/button_events.h"
#include "transport/status_pages.h"
#include "volume/volume_letters.h"

namespace {

using pipetest::Handle;
using pipetest::NewCommand;

class DriveRequestTest : public pipetest::MonitorFixture {
 protected:
  void SetUp() override {
    MonitorFixture::SetUp();
    if (HasFatalFailure()) return;
    InitializeProcessLocks();
    monitorState.osKind = kOsXpOrLater;
    sim::DriveSpec drive;
    drive.name = "usb";
    drive.volumes = {sim::VolumeSpec{'E'}};
    machine_.AddDrive(drive);
    machine_.Install();
    EnumerateDrives(nullptr);
    AssignVolumeLetters();
    RebuildChannelTable();
    ASSERT_EQ(Block().driveCount, 1);
    ASSERT_EQ(Block().channelCount, 1);
    ASSERT_EQ(ReadDriveIdentity(&Block().channels[0], nullptr, 0), 1u);
    DriveRecord scratch{};
    ASSERT_GE(BindChannelToDrive(&Block().channels[0], &scratch, 0), 0);
    ASSERT_NE(Block().drives[0].hidPath[0], 0);
  }
  void TearDown() override {
    machine_.Uninstall();
    MonitorFixture::TearDown();
  }

  sim::Machine machine_;
};

// Commands 11 and 12 take only the drive's key from the client's image: its
// paths, once opened, handed a pipe's server the system account to impersonate.
TEST_F(DriveRequestTest, PathsOfTheImageAreNeverOpened) {
  const WideString decoy = Utf8ToWide("\\\\.\\pipe\\" + skytest::UniqueStem("decoy"));
  Handle server(CreateNamedPipeW(decoy.c_str(), PIPE_ACCESS_DUPLEX | FILE_FLAG_OVERLAPPED,
                                 PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_WAIT, 1, 4096,
                                 4096, 0, nullptr));
  ASSERT_TRUE(server.Valid());
  Handle connected(CreateEventW(nullptr, TRUE, FALSE, nullptr));
  OVERLAPPED overlapped{};
  overlapped.hEvent = connected.Get();
  ASSERT_FALSE(ConnectNamedPipe(server.Get(), &overlapped));
  ASSERT_EQ(GetLastError(), static_cast<DWORD>(ERROR_IO_PENDING));

  DriveRecord image = Block().drives[0];
  image.modelSuffixRef = nullptr;
  image.productLineRef = nullptr;
  for (WCHAR* path : {image.diskPath, image.channelPath, image.controlPath, image.hidPath}) {
    std::memcpy(path, decoy.c_str(), (decoy.size() + 1) * sizeof(WCHAR));
  }
  BYTE expected[8] = {};
  const DWORD expectedCode = ReadDriveStatus(&Block().drives[0], expected);

  std::vector<BYTE> request(kPipeBufferBytes);
  std::vector<BYTE> reply(kPipeBufferBytes);
  for (DWORD command : {kCommandReadStatus, kCommandWriteControl}) {
    auto message = NewCommand(command);
    std::memcpy(message->driveImage, &image, sizeof(image));
    std::memcpy(request.data(), message.get(), sizeof(CommandMessage));
    machine_.ClearCommands();
    ASSERT_EQ(DispatchRequest(request.data(), sizeof(CommandMessage), reply.data()),
              sizeof(CommandMessage));
    CommandMessage answer;
    std::memcpy(static_cast<void*>(&answer), reply.data(), sizeof(answer));
    if (command == kCommandReadStatus) {
      EXPECT_EQ(answer.result, expectedCode);
      EXPECT_EQ(std::memcmp(answer.statusBlock, expected, sizeof(expected)), 0);
    } else {
      EXPECT_EQ(answer.result, ERROR_SUCCESS);
    }
    EXPECT_FALSE(machine_.Commands("usb").empty()) << command;
    EXPECT_EQ(WaitForSingleObject(connected.Get(), 0), static_cast<DWORD>(WAIT_TIMEOUT))
        << "command " << command << " connected to the image's pipe";
  }
  CancelIo(server.Get());
}

}  // namespace
