// Registration for the device-interface notifications the service listens to.
#pragma once

#include "platform/win32.h"

constexpr int kMaxNotifications = 32;

struct NotificationTable {
  HDEVNOTIFY handles[kMaxNotifications];
  int count;
};
extern NotificationTable notificationTable;

// Registers the nine interface classes in order; on any failure removes what
// it registered and returns false.
bool RegisterDeviceInterfaceNotifications(DWORD flags, HANDLE recipient);
void UnregisterDeviceInterfaceNotifications();
