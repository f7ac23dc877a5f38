// Minimal form: no transport is implemented yet, so nothing is sent.
#include "transport/drive_command.h"

DWORD DriveCommand(ChannelRecord*, DWORD, BYTE*, DWORD, HANDLE) {
  return 0;
}

DWORD SendDriveCommand(ChannelRecord* channel, DWORD controlCode, WORD value, HANDLE abortEvent) {
  BYTE data[2] = {static_cast<BYTE>(value & 0xFF), static_cast<BYTE>(value >> 8)};
  return DriveCommand(channel, controlCode, data, sizeof(data), abortEvent) != 0 ? 1 : 0;
}
