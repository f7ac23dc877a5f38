#include "volume/device_events.h"

#include <vector>

#include "monitor_fixture.h"
#include "platform/wide.h"
#include "service/interface_classes.h"

namespace {

struct Requests {
  DWORD refreshRequests, driveListStale, deviceChangePending, removalCheckRequested;
  bool operator==(const Requests&) const = default;
};

Requests Current() {
  return {monitorState.refreshRequests, monitorState.driveListStale,
          monitorState.deviceChangePending, monitorState.removalCheckRequested};
}

// A device-interface record with a name long enough for the name tests.
struct InterfaceEvent {
  DEV_BROADCAST_DEVICEINTERFACE_W header;
  WCHAR rest[64];
};

InterfaceEvent Interface(const GUID& interfaceClass, WideView name = WSTR("\\\\?\\usb#x")) {
  InterfaceEvent event = {};
  event.header.dbcc_size = sizeof(event);
  event.header.dbcc_devicetype = DBT_DEVTYP_DEVICEINTERFACE;
  event.header.dbcc_classguid = interfaceClass;
  WideCopy(event.header.dbcc_name, 65, name);
  return event;
}

class DeviceEvents : public MonitorFixture {
 protected:
  Requests Handle(DWORD type, const void* record) {
    const Requests before = Current();
    HandleDeviceEvent(type, record, nullptr);
    const Requests after = Current();
    return {after.refreshRequests - before.refreshRequests, after.driveListStale,
            after.deviceChangePending, after.removalCheckRequested};
  }
  void Reset() {
    monitorState.driveListStale = monitorState.deviceChangePending =
        monitorState.removalCheckRequested = 0;
  }
};

TEST_F(DeviceEvents, VolumeEvents) {
  DEV_BROADCAST_HDR volume = {};
  volume.dbch_size = sizeof(volume);
  volume.dbch_devicetype = DBT_DEVTYP_VOLUME;
  EXPECT_EQ(Handle(DBT_DEVICEARRIVAL, &volume), (Requests{1, 1, 0, 0}));
  Reset();
  EXPECT_EQ(Handle(DBT_DEVICEREMOVECOMPLETE, &volume), (Requests{0, 1, 0, 1}));
}

TEST_F(DeviceEvents, StorageAndUsbInterfaces) {
  InterfaceEvent disk = Interface(kDiskInterfaceClass);
  EXPECT_EQ(Handle(DBT_DEVICEARRIVAL, &disk), (Requests{1, 0, 0, 0}));
  EXPECT_EQ(Handle(DBT_DEVICEREMOVECOMPLETE, &disk), (Requests{0, 1, 0, 1}));
  Reset();
  InterfaceEvent volume = Interface(kVolumeInterfaceClass);
  EXPECT_EQ(Handle(DBT_DEVICEREMOVECOMPLETE, &volume), (Requests{0, 1, 0, 1}));
  Reset();
  InterfaceEvent usb = Interface(kUsbDeviceInterfaceClass);
  EXPECT_EQ(Handle(DBT_DEVICEARRIVAL, &usb), (Requests{0, 1, 1, 0}));
  Reset();
  EXPECT_EQ(Handle(DBT_DEVICEREMOVECOMPLETE, &usb), (Requests{0, 1, 1, 0}));
}

TEST_F(DeviceEvents, DriveControlInterfacesByClassOrName) {
  GUID hidClass;
  ASSERT_TRUE(GetHidClassGuid(&hidClass));
  InterfaceEvent hid = Interface(hidClass);
  EXPECT_EQ(Handle(DBT_DEVICEARRIVAL, &hid), (Requests{1, 0, 0, 0}));
  InterfaceEvent vendor = Interface(kVendorClassB);
  EXPECT_EQ(Handle(DBT_DEVICEREMOVECOMPLETE, &vendor), (Requests{0, 0, 0, 1}));
  Reset();
  // The name test comes before the storage classes and is case-sensitive.
  InterfaceEvent named = Interface(kDiskInterfaceClass, WSTR("\\\\?\\scsi#SES_dev"));
  EXPECT_EQ(Handle(DBT_DEVICEREMOVECOMPLETE, &named), (Requests{0, 0, 0, 1}));
  Reset();
  InterfaceEvent lower = Interface(kUsbDeviceInterfaceClass, WSTR("\\\\?\\quarry#ses"));
  EXPECT_EQ(Handle(DBT_DEVICEARRIVAL, &lower), (Requests{0, 1, 1, 0}));
}

TEST_F(DeviceEvents, OtherEventsAndUnknownClassesAreIgnored) {
  InterfaceEvent disk = Interface(kDiskInterfaceClass);
  EXPECT_EQ(Handle(DBT_DEVICEQUERYREMOVE, &disk), (Requests{0, 0, 0, 0}));
  EXPECT_EQ(Handle(DBT_DEVNODES_CHANGED, nullptr), (Requests{0, 0, 0, 0}));
  InterfaceEvent other = Interface(GUID{0x12345678, 1, 2, {3, 4, 5, 6, 7, 8, 9, 10}});
  EXPECT_EQ(Handle(DBT_DEVICEARRIVAL, &other), (Requests{0, 0, 0, 0}));
}

TEST_F(DeviceEvents, ForwardedEventWithoutRecordIsHandledWithoutReadingIt) {
  EXPECT_EQ(Handle(DBT_DEVICEARRIVAL, nullptr), (Requests{1, 0, 0, 0}));
  EXPECT_EQ(Handle(DBT_DEVICEREMOVECOMPLETE, nullptr), (Requests{0, 0, 0, 1}));
}

}  // namespace
