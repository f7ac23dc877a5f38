// Device-interface notifications for the nine classes the service follows.
#include "service/device_notifications.h"

#include "service/interface_classes.h"

NotificationTable notificationTable;

static void RemoveAll() {
  for (int i = 0; i < notificationTable.count; ++i) {
    if (notificationTable.handles[i] != nullptr)
      UnregisterDeviceNotification(notificationTable.handles[i]);
    notificationTable.handles[i] = nullptr;
  }
  notificationTable.count = 0;
}

bool RegisterDeviceInterfaceNotifications(DWORD flags, HANDLE recipient) {
  GUID hidClass;
  GetHidClassGuid(&hidClass);
  const GUID classes[] = {kVendorClassA,
                          kVendorClassB,
                          kVendorClassC,
                          hidClass,
                          kDiskInterfaceClass,
                          kVolumeInterfaceClass,
                          kUsbDeviceInterfaceClass,
                          kNotifyClass8,
                          kNotifyClass9};
  DEV_BROADCAST_DEVICEINTERFACE_W filter = {};
  filter.dbcc_size = 32;
  filter.dbcc_devicetype = DBT_DEVTYP_DEVICEINTERFACE;
  filter.dbcc_reserved = 0;
  for (const GUID& interfaceClass : classes) {
    if (notificationTable.count >= kMaxNotifications) {
      RemoveAll();
      return false;
    }
    filter.dbcc_classguid = interfaceClass;
    HDEVNOTIFY handle = RegisterDeviceNotificationW(recipient, &filter, flags);
    notificationTable.handles[notificationTable.count++] = handle;
    if (notificationTable.count >= kMaxNotifications || handle == nullptr) {
      RemoveAll();
      return false;
    }
  }
  return true;
}

void UnregisterDeviceInterfaceNotifications() {
  RemoveAll();
}
