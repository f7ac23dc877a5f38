// Minimal form: no removal is attempted yet, so it reports failure.
#include "volume/safe_removal.h"

#include "platform/win32.h"

int SafeRemoveDrive(DriveRecord*, ChannelRecord*) {
  SetLastError(ERROR_NOT_SUPPORTED);
  return 0;
}
