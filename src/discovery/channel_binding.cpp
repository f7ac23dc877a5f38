// Binding a channel record to the drive record it belongs to, or making a
// drive record from the channel alone when no disk of it was found.
#include "discovery/channel_binding.h"

#include <cstring>

#include "discovery/disk_number.h"
#include "discovery/model_table.h"
#include "monitor/monitor_state.h"
#include "platform/wide.h"

namespace {

constexpr std::size_t kMinSerialKeyLength = 16;
constexpr std::size_t kChannelLetterUnits = sizeof(ChannelRecord::volumeLetters) / sizeof(WCHAR);

bool RecordMatches(const ChannelRecord& channel, const DriveRecord& drive) {
  const bool haveTail = channel.instanceTail[0] != 0;
  if (channel.mode == kChannelModeEnclosure) {
    return haveTail && (WideEqual(drive.instanceKey, channel.instanceTail) ||
                        ContainsComponent(drive.deviceIdUpper, channel.instanceTail));
  }
  if (channel.kind == kChannelKindHid) {
    return channel.identityText[0] != 0 &&
           ContainsComponent(drive.deviceIdUpper, channel.identityText);
  }
  if (channel.kind == kChannelKindDriver) {
    if (haveTail && ContainsComponent(drive.parentDeviceId, channel.instanceTail)) return true;
    return WideLength(channel.serialKey, 128) >= kMinSerialKeyLength &&
           ContainsComponent(drive.instanceKey, channel.serialKey);
  }
  return false;
}

// The channel's volume-letter field: UTF-16 letters, zero beyond them.
void SetChannelLetters(ChannelRecord* channel, const WCHAR* letters) {
  std::memset(channel->volumeLetters, 0, sizeof(channel->volumeLetters));
  WCHAR units[kChannelLetterUnits] = {};
  WideCopy(units, 27, letters);
  std::memcpy(channel->volumeLetters, units, WideLength(units) * sizeof(WCHAR));
}

void LinkFields(ChannelRecord* channel, DriveRecord* drive, LONG index) {
  channel->linkedDrive = index;
  drive->channelIndex = channel->ownIndex;
  drive->channelMode = channel->mode;
  std::memset(drive->channelPath, 0, sizeof(drive->channelPath));
  WideCopy(drive->channelPath, 256, channel->devicePath);
}

int HexDigit(WCHAR ch) {
  if (ch >= WSTR('0') && ch <= WSTR('9')) return ch - WSTR('0');
  if (ch >= WSTR('A') && ch <= WSTR('F')) return ch - WSTR('A') + 10;
  return -1;
}

// The identity text of an HID channel read as hexadecimal digit pairs, one
// character each; decoding ends at an unpaired digit or a pair that is not
// hexadecimal.
void DecodeHexPairs(const WCHAR* hex, WCHAR* out, std::size_t capacity) {
  std::size_t written = 0;
  for (std::size_t i = 0; hex[i] != 0 && hex[i + 1] != 0 && written + 1 < capacity; i += 2) {
    const int high = HexDigit(hex[i]);
    const int low = HexDigit(hex[i + 1]);
    if (high < 0 || low < 0) break;
    out[written++] = static_cast<WCHAR>(high * 16 + low);
  }
  out[written] = 0;
}

// Fills a record that stands for the channel's drive.
void FillFromChannel(ChannelRecord* channel, DriveRecord* drive, LONG index) {
  drive->recordIndex = index;
  drive->fromChannel = 1;
  drive->busKind = channel->kind;
  LinkFields(channel, drive, index);
  SetChannelLetters(channel, WSTR(""));
  std::memset(drive->serialNumber, 0, sizeof(drive->serialNumber));
  std::memset(drive->model, 0, sizeof(drive->model));
  if (channel->kind == kChannelKindHid) {
    DecodeHexPairs(channel->identityText, drive->serialNumber, 256);
    WideCopy(drive->model, 128, WSTR("QX USB HDD"));
  } else {
    WideCopy(drive->serialNumber, 256, channel->identityText);
    WideCopy(drive->model, 128, WSTR("QX 1394 HDD"));
  }
  std::memset(drive->controlPath, 0, sizeof(drive->controlPath));
  WideCopy(drive->controlPath, 256, channel->controlPath);
  std::memset(drive->hidPath, 0, sizeof(drive->hidPath));
  WideCopy(drive->hidPath, 256, channel->devicePath);
  drive->extendedIdentity = 1;
}

// The record this channel made earlier (same channel path), or -1.
LONG RecordMadeByChannel(const StateBlock* block, const ChannelRecord& channel) {
  if (channel.devicePath[0] == 0) return -1;
  for (LONG i = 0; i < block->driveCount && i < kMaxDrives; ++i) {
    const DriveRecord& drive = block->drives[i];
    if (drive.fromChannel == 1 && WideEqual(drive.channelPath, channel.devicePath)) return i;
  }
  return -1;
}

LONG Bind(StateBlock* block, ChannelRecord* channel, DriveRecord* recordCopy, BYTE allowCreate) {
  for (LONG i = 0; i < block->driveCount && i < kMaxDrives; ++i) {
    DriveRecord* drive = &block->drives[i];
    if (!RecordMatches(*channel, *drive)) continue;
    drive->fromChannel = 0;
    LinkFields(channel, drive, i);
    std::memset(channel->diskPath, 0, sizeof(channel->diskPath));
    WideCopy(channel->diskPath, 256, drive->diskPath);
    SetChannelLetters(channel, drive->volumeLetters);
    if (drive->controlPath[0] == 0) WideCopy(drive->controlPath, 256, channel->controlPath);
    std::memset(drive->hidPath, 0, sizeof(drive->hidPath));
    WideCopy(drive->hidPath, 256, channel->devicePath);
    if (recordCopy != nullptr) *recordCopy = *drive;
    return i;
  }

  // A channel binding again finds the record it made before and refreshes
  // it, so its drive is listed once however often it binds.
  const LONG own = RecordMadeByChannel(block, *channel);
  if (own >= 0) {
    FillFromChannel(channel, &block->drives[own], own);
    if (recordCopy != nullptr) *recordCopy = block->drives[own];
    return own;
  }

  if (channel->mayCreateDrive == 0 || allowCreate != 1 || block->driveCount >= kMaxDrives)
    return -1;
  const LONG index = block->driveCount;
  block->driveCount = index + 1;
  DriveRecord* drive = &block->drives[index];
  // The slot may hold the uncounted 64th candidate of the enumeration; none
  // of that disk's fields belong to this drive.
  std::memset(drive, 0, sizeof(*drive));
  SetDiskNumberRead(index, false);
  FillFromChannel(channel, drive, index);
  if (recordCopy != nullptr) *recordCopy = *drive;
  return index;
}

}  // namespace

LONG BindChannelToDrive(ChannelRecord* channel, DriveRecord* recordCopy, BYTE allowCreate) {
  StateBlock* block = monitorState.stateBlock;
  if (block == nullptr || channel == nullptr) return -1;
  const LONG result = Bind(block, channel, recordCopy, allowCreate);
  monitorState.publishNeeded = 1;
  return result;
}
