// Safe removal: every volume offline, the device node ejected, then the
// drive-gone command and the channel unlinked. Runs with the mutex held,
// sleeps included.
#include "volume/safe_removal.h"

#include "discovery/channel_binding.h"
#include "platform/wide.h"
#include "platform/win32.h"
#include "transport/drive_features.h"
#include "volume/dismount.h"
#include "volume/eject.h"

namespace {

// The same drive: the same disk, or both made from the same channel.
bool SameDrive(const DriveRecord& a, const DriveRecord& b) {
  return a.fromChannel == b.fromChannel && WideEqual(a.diskPath, b.diskPath) &&
         WideEqual(a.channelPath, b.channelPath);
}

}  // namespace

int SafeRemoveDrive(DriveRecord* drive, ChannelRecord* channel) {
  if (drive == nullptr || channel == nullptr) return 0;
  // The drive list may have been read again since the caller took its copy,
  // so the channel is bound afresh: the removal acts on the drive that is
  // the channel's now, or on none. With no drive listed (an enumeration
  // that failed or was aborted) nothing tells which volumes are mounted,
  // so nothing is removed.
  DriveRecord bound{};
  if (BindChannelToDrive(channel, &bound, 0) < 0) {
    SetLastError(ERROR_NOT_FOUND);
    return 0;
  }
  if (!SameDrive(bound, *drive)) *drive = bound;
  // Without a device ID the eject would be aimed at the root of the tree.
  if (drive->parentDeviceId[0] == 0) {
    SetLastError(ERROR_NOT_FOUND);
    return 0;
  }
  bool handleClosed = false;
  if (drive->busKind == kBusKindUsb && drive->channelMode == kChannelModeEnclosure) {
    handleClosed = channel->deviceHandle != nullptr;
    CloseChannelDevice(channel);
  }
  // A volume that stays online stops the removal before any eject.
  if (DismountDriveVolumes(drive) == 0 || EjectDriveDevice(drive, channel) == 0) {
    const DWORD error = GetLastError();
    if (handleClosed) ReopenChannelDevice(channel);
    SetLastError(error);
    return 0;
  }
  SendDriveGone(channel);
  channel->linkedDrive = -1;
  return 1;
}
