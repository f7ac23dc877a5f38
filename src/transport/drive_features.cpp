// RefreshChannelGauge and SendDriveGoneFor are complete; the gauge computation
// and the drive-gone command are in their minimal form and send nothing yet.
#include "transport/drive_features.h"

#include "monitor/monitor_state.h"

void UpdateCapacityGauge(DriveRecord*, ChannelRecord*, HANDLE) {}

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
  return 0;
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
