#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "discovery/channel_binding.h"
#include "discovery/channel_scan.h"
#include "discovery/drive_enumeration.h"
#include "fuzz_support.h"
#include "monitor/monitor_state.h"
#include "pipe/command_message.h"
#include "pipe/dispatcher.h"
#include "pipe/pipe_instance.h"
#include "transport/button_events.h"
#include "volume/volume_letters.h"

namespace {

using fuzzsupport::Check;

constexpr std::uint32_t kDriveCommands[] = {kCommandSafeRemove,       kCommandReleaseDrive,
                                            kCommandReleaseDriveAlso, kCommandRefreshGauges,
                                            kCommandReadStatus,       kCommandWriteControl};

fuzzsupport::RecordingComputer* computer = nullptr;
StateBlock* block = nullptr;
StateBlock* snapshot = nullptr;
HANDLE channelHandles[kMaxChannels] = {};
std::vector<std::string> driveNames;
// Every path the service found itself: only these may ever be opened.
std::set<std::u16string> servicePaths;

void AddPath(const WCHAR* path) {
  if (path[0] != 0) servicePaths.insert(std::u16string(path));
}

// Closes the channels' shared handles that the service has not closed itself.
void CloseChannels() {
  for (int i = 0; i < kMaxChannels; ++i) {
    if (channelHandles[i] != nullptr && block->channels[i].deviceHandle == channelHandles[i]) {
      CloseHandle(channelHandles[i]);
    }
    channelHandles[i] = nullptr;
  }
}

// Opens each channel's shared handle as the worker starter does.
void OpenChannels() {
  for (int i = 0; i < block->channelCount && i < kMaxChannels; ++i) {
    ChannelRecord& channel = block->channels[i];
    const bool readWrite = channel.kind == kChannelKindHid || channel.mode != 0;
    channel.deviceHandle =
        CreateFileW(channel.devicePath, readWrite ? GENERIC_READ | GENERIC_WRITE : 0,
                    readWrite ? FILE_SHARE_READ | FILE_SHARE_WRITE : 0, nullptr, OPEN_EXISTING,
                    FILE_FLAG_OVERLAPPED, nullptr);
    Check(channel.deviceHandle != INVALID_HANDLE_VALUE, "channel opens");
    channelHandles[i] = channel.deviceHandle;
  }
}

// What a rescan and the workers' linking build, without worker threads.
void Scan() {
  CloseChannels();
  std::memset(static_cast<void*>(block), 0, sizeof(StateBlock));
  EnumerateDrives(nullptr);
  AssignVolumeLetters();
  RebuildChannelTable();
  OpenChannels();
  for (int i = 0; i < block->channelCount && i < kMaxChannels; ++i) {
    ChannelRecord& channel = block->channels[i];
    ReadDriveIdentity(&channel, nullptr, 0);
    DriveRecord scratch{};
    BindChannelToDrive(&channel, &scratch, 0);
  }
  BuildPublishedList(block);
  int linked = 0;
  for (int i = 0; i < block->channelCount; ++i) linked += block->channels[i].linkedDrive >= 0;
  Check(block->driveCount > 0 && linked == block->channelCount, "every channel is linked");
  Check(static_cast<std::size_t>(block->driveCount) >= driveNames.size(), "every drive is found");

  for (const std::u16string& path : computer->TakeOpened()) servicePaths.insert(path);
  for (int i = 0; i < block->driveCount; ++i) {
    const DriveRecord& drive = block->drives[i];
    for (const WCHAR* path : {drive.diskPath, drive.channelPath, drive.controlPath, drive.hidPath})
      AddPath(path);
    for (const WCHAR* letter = drive.volumeLetters; *letter != 0; ++letter) {
      servicePaths.insert(u"\\\\.\\" + std::u16string(1, *letter) + u":");
    }
  }
  for (int i = 0; i < block->channelCount; ++i) {
    const ChannelRecord& channel = block->channels[i];
    for (const WCHAR* path : {channel.diskPath, channel.devicePath, channel.controlPath})
      AddPath(path);
  }
  std::memcpy(static_cast<void*>(snapshot), block, sizeof(StateBlock));
}

void SetUpOnce() {
  static bool done = false;
  if (done) return;
  done = true;
  fuzzsupport::UsePrivateEmulation("drivefuzz");
  std::string error;
  std::unique_ptr<sim::Machine> machine = sim::LoadMachine(sim::DefaultMachineText(), &error);
  Check(machine != nullptr, "the default machine loads");
  machine->SetDeviceEventSink([](DWORD, const void*) {});
  for (const sim::Machine::DriveSummary& drive : machine->Drives())
    driveNames.push_back(drive.name);
  computer = new fuzzsupport::RecordingComputer(std::move(machine));
  // No mapping: a 1.2 MB publish per input would take most of the time.
  block = fuzzsupport::SetUpMonitor(false);
  snapshot = static_cast<StateBlock*>(std::calloc(1, sizeof(StateBlock)));
  Check(snapshot != nullptr, "set-up");
  Scan();
}

// Puts the computer and the block back as the set-up left them; the set-up's
// records still describe the computer, so they are restored, not rebuilt.
void Restore() {
  bool reopen = false;
  for (const std::string& name : driveNames) {
    if (computer->Inner().Attached(name)) continue;
    computer->Inner().Attach(name);
    reopen = true;
  }
  for (int i = 0; i < kMaxChannels && !reopen; ++i) {
    reopen = block->channels[i].deviceHandle != channelHandles[i];
  }
  if (reopen) {
    computer->Inner().WaitForDeviceEvents();
    CloseChannels();
    std::memcpy(static_cast<void*>(block), snapshot, sizeof(StateBlock));
    OpenChannels();
    for (int i = 0; i < kMaxChannels; ++i) snapshot->channels[i].deviceHandle = channelHandles[i];
  } else {
    std::memcpy(static_cast<void*>(block), snapshot, sizeof(StateBlock));
  }
  computer->Inner().ClearCommands();
  computer->TakeOpened();
  monitorState.paused = 0;
  monitorState.pauseTicks = 0;
  monitorState.skipTicks = 0;
}

}  // namespace

int DriveFuzzOneInput(const std::uint8_t* data, std::size_t size) {
  SetUpOnce();
  if (size == 0) return 0;
  const std::uint8_t selector = data[0];
  const std::size_t received = std::min<std::size_t>(size - 1, kPipeReadSize);
  // In a buffer of exactly its size, with the selected command and drive key.
  std::unique_ptr<BYTE[]> message(new BYTE[received == 0 ? 1 : received]);
  std::memcpy(message.get(), data + 1, received);
  const std::uint32_t command = kDriveCommands[(selector & 7) % std::size(kDriveCommands)];
  if (received >= offsetof(CommandMessage, arg1)) {
    std::memcpy(message.get() + offsetof(CommandMessage, command), &command, sizeof(command));
  }
  const int drive = selector >> 4;
  const std::size_t key = offsetof(CommandMessage, driveImage) + kDriveKeyOffsetInImage;
  if (drive < block->driveCount && received >= key + kDriveKeyCapacity * sizeof(WCHAR)) {
    std::memcpy(message.get() + key, block->drives[drive].firmwareSerial,
                kDriveKeyCapacity * sizeof(WCHAR));
  }
  const bool paused = (selector & 8) != 0;
  monitorState.paused = paused ? 1 : 0;

  static std::unique_ptr<BYTE[]> request(new BYTE[kPipeBufferBytes]);
  static std::unique_ptr<BYTE[]> reply(new BYTE[kPipeBufferBytes]);
  std::memcpy(request.get(), message.get(), received);
  const DWORD length = DispatchRequest(request.get(), static_cast<DWORD>(received), reply.get());
  fuzzsupport::CheckReply(message.get(), received, reply.get(), length, paused, false);
  for (const std::u16string& path : computer->TakeOpened()) {
    Check(servicePaths.count(path) != 0, "a path the service did not find was opened");
  }
  Restore();
  return 0;
}
