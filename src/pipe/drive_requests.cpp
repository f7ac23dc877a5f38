#include "pipe/drive_requests.h"

#include <algorithm>
#include <cstdint>
#include <cstring>

#include "discovery/channel_binding.h"
#include "monitor/channel_workers.h"
#include "monitor/monitor_state.h"
#include "monitor/rescan.h"
#include "pipe/command_message.h"
#include "transport/drive_command.h"
#include "transport/drive_features.h"
#include "transport/status_pages.h"
#include "volume/safe_removal.h"

static_assert(sizeof(DriveRecord) == kDriveImageSize);
static_assert(offsetof(DriveRecord, firmwareSerial) == kDriveKeyOffsetInImage);
static_assert(sizeof(DriveRecord::firmwareSerial) / sizeof(WCHAR) == kDriveKeyCapacity);

namespace {

StateBlock& Block() {
  return *monitorState.stateBlock;
}

int ClampedCount(LONG count, int capacity) {
  return static_cast<int>(std::clamp<LONG>(count, 0, capacity));
}

bool Linked(const ChannelRecord& channel) {
  return channel.linkedDrive >= 0 && channel.linkedDrive < kMaxDrives;
}

// The index-th channel, in array order, among the first channelCount records
// that are linked to a drive; null when there are fewer.
ChannelRecord* FindLinkedChannel(DWORD index) {
  StateBlock& block = Block();
  const int count = ClampedCount(block.channelCount, kMaxChannels);
  DWORD seen = 0;
  for (int i = 0; i < count; ++i) {
    ChannelRecord& channel = block.channels[i];
    if (!Linked(channel)) continue;
    if (seen == index) return &channel;
    ++seen;
  }
  return nullptr;
}

// Equality of two serials, unit by unit up to the terminator; a text with no
// terminator inside the field names no drive.
bool SameSerial(const WCHAR* a, const WCHAR* b) {
  for (std::size_t i = 0; i < kDriveKeyCapacity; ++i) {
    if (a[i] != b[i]) return false;
    if (a[i] == 0) return true;
  }
  return false;
}

// The first drive record whose firmware serial equals the key in the image,
// or -1. Only the key is read from the image: every path the commands open
// comes from the service's own record, never from a client.
int FindDriveByKey(const BYTE* driveImage) {
  WCHAR key[kDriveKeyCapacity];
  std::memcpy(key, driveImage + kDriveKeyOffsetInImage, sizeof(key));
  StateBlock& block = Block();
  const int count = ClampedCount(block.driveCount, kMaxDrives);
  for (int i = 0; i < count; ++i) {
    if (SameSerial(block.drives[i].firmwareSerial, key)) return i;
  }
  return -1;
}

// The first volume letter a channel shows (its letters are UTF-16 text).
WCHAR FirstLetter(const ChannelRecord& channel) {
  WCHAR letter = 0;
  std::memcpy(&letter, channel.volumeLetters, sizeof(letter));
  return letter;
}

}  // namespace

DWORD SafeRemoveRequest(DWORD index, DWORD* detail) {
  if (monitorState.paused) {
    *detail = 1;
    return 0;
  }
  int removed = 0;
  if (ChannelRecord* channel = FindLinkedChannel(index); channel != nullptr) {
    DriveRecord drive = Block().drives[channel->linkedDrive];
    removed = SafeRemoveDrive(&drive, channel);
  }
  if (removed == 0) {
    *detail = GetLastError();
    Block().statusWord = kStatusRemovalFailedBase + index;
    return 0;
  }
  return 1;
}

DWORD ReleaseDriveRequest(DWORD index, DWORD* detail) {
  Block().statusWord = kStatusRescanDone;
  ChannelRecord* channel = FindLinkedChannel(index);
  if (channel == nullptr) {
    *detail = GetLastError();
    return 0;
  }
  DriveRecord drive = Block().drives[channel->linkedDrive];
  return SendDriveGoneFor(&drive, channel);
}

void ForwardMessageRequest(DWORD message, DWORD parameter, DWORD eventData, BYTE* resultSlot) {
  // The second parameter is a number from another process: it is passed on
  // as a number, and the monitor never reads through it.
  HandleForwardedMessage(message, parameter, eventData, resultSlot);
}

DWORD RefreshGaugesRequest(DWORD letterArg, DWORD forceResend) {
  // The low byte is a signed character, widened with its sign.
  const auto key = static_cast<WCHAR>(static_cast<std::int16_t>(
      static_cast<std::int8_t>(static_cast<std::uint8_t>(letterArg & 0xFF))));
  StateBlock& block = Block();
  const int count = ClampedCount(block.channelCount, kMaxChannels);
  for (int i = 0; i < count; ++i) {
    ChannelRecord& channel = block.channels[i];
    const WCHAR letter = FirstLetter(channel);
    if (channel.mode == kChannelModePlain && (key == 0 || letter == key)) {
      if (letter != 0) {
        CountedDrivesCheck();
        SendDriveCommand(&channel, CTL_SET_STATE, 2, nullptr);
      }
      if (key != 0) break;
    }
    DriveRecord drive{};
    if (BindChannelToDrive(&channel, &drive, 0) >= 0) {
      if (forceResend != 0) channel.gaugePercentSent = 0;
      UpdateCapacityGauge(&drive, &channel, monitorState.pipeStopEvent);
    }
  }
  return 1;
}

DWORD ReadStatusRequest(const BYTE* driveImage, BYTE* statusBlock) {
  const int found = FindDriveByKey(driveImage);
  if (found < 0) return ERROR_INVALID_PARAMETER;
  return ReadDriveStatus(&Block().drives[found], statusBlock, monitorState.pipeStopEvent);
}

DWORD WriteControlRequest(const BYTE* driveImage, const BYTE* controlBlock) {
  const int found = FindDriveByKey(driveImage);
  if (found < 0) return ERROR_INVALID_PARAMETER;
  return WriteDriveControl(&Block().drives[found], controlBlock, monitorState.pipeStopEvent);
}
