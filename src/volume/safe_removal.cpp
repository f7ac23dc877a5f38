// Safe removal: every volume offline, the device node ejected, then the
// drive-gone command and the channel unlinked. Runs with the mutex held,
// sleeps included.
#include "volume/safe_removal.h"

#include "monitor/monitor_state.h"
#include "platform/win32.h"
#include "transport/drive_features.h"
#include "volume/dismount.h"
#include "volume/eject.h"

int SafeRemoveDrive(DriveRecord* drive, ChannelRecord* channel) {
  if (drive == nullptr) return 0;
  if (drive->busKind == kBusKindUsb && drive->channelMode == kChannelModeEnclosure) {
    CloseChannelDevice(channel);
  }
  // A volume that stays online stops the removal before any eject.
  if (DismountDriveVolumes(drive) == 0) return 0;
  const StateBlock* block = monitorState.stateBlock;
  if ((block == nullptr || block->driveCount != 0) && EjectDriveDevice(drive, channel) == 0) {
    return 0;
  }
  SendDriveGone(channel);
  if (channel != nullptr) channel->linkedDrive = -1;
  return 1;
}
