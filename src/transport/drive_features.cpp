// The drive features the service drives on its own: the capacity gauge and
// the drive-gone command, both carried by the drive command sender.
#include "transport/drive_features.h"

#include <atomic>
#include <cstddef>
#include <cstdint>

#include "monitor/monitor_state.h"
#include "platform/wide.h"
#include "transport/drive_command.h"
#include "transport/refresh_on_change.h"

namespace {

constexpr int kMebibyteShift = 20;
constexpr BYTE kDriveGoneHidState = 4;
constexpr BYTE kDriveGoneDriverState = 1;
constexpr WORD kDriveGoneGaugeValue = 1;
constexpr std::size_t kMaxVolumeLetters = 26;

struct VolumeSpace {
  std::uint64_t totalMiB;
  std::uint64_t freeMiB;
};

bool QueryVolumeSpace(const WCHAR* root, VolumeSpace* space) {
  ULARGE_INTEGER available{};
  ULARGE_INTEGER total{};
  ULARGE_INTEGER totalFree{};
  if (!GetDiskFreeSpaceExW(root, &available, &total, &totalFree)) return false;
  space->totalMiB = total.QuadPart >> kMebibyteShift;
  space->freeMiB = totalFree.QuadPart >> kMebibyteShift;
  return true;
}

// A reading the gauge can use: some size, and no more free than there is.
// (64-bit arithmetic, so that very large volumes are not taken for broken
// ones, and a free count above the total cannot drive the sum past 100 %.)
bool Usable(const VolumeSpace& space) {
  return space.totalMiB != 0 && space.freeMiB <= space.totalMiB;
}

// Closes asked of channel workers, by channel index.
std::atomic<bool> closeRequests[kMaxChannels];
// The channel whose worker runs on this thread, if any.
thread_local const ChannelRecord* ownedChannel = nullptr;

// The close-request slot of a record of the working channel array; null for
// any other record (a copy, or one outside a running monitor).
std::atomic<bool>* CloseRequestSlot(const ChannelRecord* channel) {
  const StateBlock* block = monitorState.stateBlock;
  if (block == nullptr || channel == nullptr || channel->ownIndex < 0 ||
      channel->ownIndex >= kMaxChannels || &block->channels[channel->ownIndex] != channel) {
    return nullptr;
  }
  return &closeRequests[channel->ownIndex];
}

// The drive record in the working array that the channel is linked to.
DriveRecord* LinkedWorkingDrive(const ChannelRecord* channel) {
  StateBlock* block = monitorState.stateBlock;
  if (block == nullptr || channel->linkedDrive < 0 || channel->linkedDrive >= kMaxDrives) {
    return nullptr;
  }
  return &block->drives[channel->linkedDrive];
}

}  // namespace

DWORD UsedSpacePercent(const DriveRecord* drive) {
  std::uint64_t freeSum = 0;
  std::uint64_t totalSum = 0;
  const std::size_t letters = WideLength(drive->volumeLetters, kMaxVolumeLetters);
  const std::size_t count = drive->volumeCount < letters ? drive->volumeCount : letters;
  for (std::size_t i = 0; i < count; ++i) {
    const WCHAR root[] = {drive->volumeLetters[i], WSTR(':'), WSTR('\\'), 0};
    VolumeSpace first{};
    if (!QueryVolumeSpace(root, &first) || !Usable(first)) continue;
    // The figures summed are those of a second reading.
    VolumeSpace second{};
    if (!QueryVolumeSpace(root, &second) || !Usable(second)) continue;
    freeSum += second.freeMiB;
    totalSum += second.totalMiB;
  }
  if (totalSum == 0) return 0;
  return static_cast<DWORD>(100 - freeSum * 100 / totalSum);
}

WORD GaugePattern(DWORD usedPercent, DWORD segments) {
  if (segments == 0) return 0;
  const double step = 100.0 / static_cast<double>(segments);
  const double index = static_cast<double>(usedPercent) / step;
  constexpr std::size_t kPatternCount = sizeof(kGaugePatterns) / sizeof(kGaugePatterns[0]);
  // Segment counts other than 4 and 6 could reach past the table: no pattern.
  if (!(index >= 0.0) || index >= static_cast<double>(kPatternCount)) return 0;
  return kGaugePatterns[static_cast<std::size_t>(index)];
}

void UpdateCapacityGauge(DriveRecord* drive, ChannelRecord* channel, HANDLE abortEvent) {
  if (drive == nullptr || channel == nullptr) return;
  // A drive without volumes: the list may be out of date. One rescan is
  // asked for when the drive is first seen so, none while it stays so.
  NoteRefreshConditions(
      drive, kRefreshNoVolumes,
      drive->volumeCount == 0 && (drive->extendedIdentity == 0 ||
                                  (drive->extendedIdentity == 1 && drive->statusCode == 0)));
  const DWORD used = UsedSpacePercent(drive);
  const WORD pattern = GaugePattern(used, drive->gaugeSegments);

  DriveRecord* working = LinkedWorkingDrive(channel);
  const DWORD workingPercent = working != nullptr ? working->gaugePercent : used;
  if (used == channel->gaugePercentSent && used == workingPercent) return;
  channel->gaugePercentSent = used;
  if (working != nullptr) working->gaugePercent = used;

  if (channel->mode == kChannelModeGauge || channel->mode == kChannelModeEnclosure) {
    // A failed send is repeated only when the percentage changes again.
    SendDriveCommand(channel, CTL_SET_GAUGE, pattern, abortEvent);
  }
}

void RefreshChannelGauge(int channelIndex, HANDLE abortEvent) {
  StateBlock* block = monitorState.stateBlock;
  if (block == nullptr || channelIndex < 0 || channelIndex >= kMaxChannels) return;
  ChannelRecord* channel = &block->channels[channelIndex];
  if (channel->linkedDrive < 0 || channel->linkedDrive >= kMaxDrives) return;
  DriveRecord drive = block->drives[channel->linkedDrive];
  UpdateCapacityGauge(&drive, channel, abortEvent);
}

DWORD SendDriveGone(ChannelRecord* channel) {
  if (channel == nullptr || channel->driveGoneSent != 0) return 0;
  channel->driveGoneSent = 1;
  monitorState.skipTicks = kDriveGoneSkipTicks;
  if (channel->mode == kChannelModePlain) {
    const BYTE state =
        channel->kind == kChannelKindHid ? kDriveGoneHidState : kDriveGoneDriverState;
    return SendDriveCommand(channel, CTL_SET_STATE, state, nullptr);
  }
  const DWORD sent = SendDriveCommand(channel, CTL_SET_GAUGE, kDriveGoneGaugeValue, nullptr);
  if (sent != 0 && channel->mode == kChannelModeGauge && channel->kind == kChannelKindDriver) {
    // Closing the shared handle ends the channel's worker (which closes it
    // itself when it runs).
    CloseChannelDevice(channel);
  }
  return sent;
}

void CloseChannelDevice(ChannelRecord* channel) {
  if (channel == nullptr) return;
  std::atomic<bool>* request = CloseRequestSlot(channel);
  if (request != nullptr && channel->threadHandle != nullptr && ownedChannel != channel) {
    // The worker may be blocked on the handle: closing it here would leave
    // the worker with a raw value that may soon name another object.
    if (channel->deviceHandle != nullptr) request->store(true);
    return;
  }
  if (request != nullptr) request->store(false);
  if (channel->deviceHandle != nullptr && channel->deviceHandle != INVALID_HANDLE_VALUE) {
    CloseHandle(channel->deviceHandle);
  }
  channel->deviceHandle = nullptr;
}

void ClaimChannelDevice(ChannelRecord* channel) {
  ownedChannel = channel;
}

bool WithdrawChannelClose(ChannelRecord* channel) {
  std::atomic<bool>* request = CloseRequestSlot(channel);
  return request != nullptr && request->exchange(false);
}

bool ChannelCloseRequested(const ChannelRecord* channel) {
  const std::atomic<bool>* request = CloseRequestSlot(channel);
  return request != nullptr && request->load();
}

DWORD SendDriveGoneFor(DriveRecord* drive, ChannelRecord* channel) {
  StateBlock* block = monitorState.stateBlock;
  if (channel == nullptr && block != nullptr && drive != nullptr && drive->channelIndex >= 0 &&
      drive->channelIndex < kMaxChannels) {
    channel = &block->channels[drive->channelIndex];
  }
  SendDriveGone(channel);
  return 1;
}
