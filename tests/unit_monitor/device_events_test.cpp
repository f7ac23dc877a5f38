#include "volume/device_events.h"

#include <utility>
#include <vector>

#include "lock_probe.h"
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
  DEV_BROADCAST_HDR volume_ = {sizeof(DEV_BROADCAST_HDR), DBT_DEVTYP_VOLUME, 0};
  const InterfaceEvent disk_ = Interface(kDiskInterfaceClass);
  const InterfaceEvent usb_ = Interface(kUsbDeviceInterfaceClass);
};

// Each row: refreshes added, then the three flags, from clear flags.
TEST_F(DeviceEvents, EachEventAsksForWhatItsKindNeeds) {
  GUID hidClass;
  ASSERT_TRUE(GetHidClassGuid(&hidClass));
  const InterfaceEvent volumeInterface = Interface(kVolumeInterfaceClass);
  const InterfaceEvent hid = Interface(hidClass);
  const InterfaceEvent vendor = Interface(kVendorClassB);
  // The name test comes before the storage classes and is case-sensitive.
  const InterfaceEvent named = Interface(kDiskInterfaceClass, WSTR("\\\\?\\scsi#SES_dev"));
  const InterfaceEvent lower = Interface(kUsbDeviceInterfaceClass, WSTR("\\\\?\\quarry#ses"));
  const InterfaceEvent other = Interface(GUID{0x12345678, 1, 2, {3, 4, 5, 6, 7, 8, 9, 10}});
  const struct {
    const char* what;
    DWORD type;
    const void* record;
    Requests expected;
  } cases[] = {
      {"volume arrival", DBT_DEVICEARRIVAL, &volume_, {1, 1, 0, 0}},
      {"volume removal", DBT_DEVICEREMOVECOMPLETE, &volume_, {0, 1, 0, 1}},
      {"disk arrival", DBT_DEVICEARRIVAL, &disk_, {1, 0, 0, 0}},
      {"disk removal", DBT_DEVICEREMOVECOMPLETE, &disk_, {0, 1, 0, 1}},
      {"volume interface removal", DBT_DEVICEREMOVECOMPLETE, &volumeInterface, {0, 1, 0, 1}},
      {"usb arrival", DBT_DEVICEARRIVAL, &usb_, {0, 1, 1, 0}},
      {"usb removal", DBT_DEVICEREMOVECOMPLETE, &usb_, {0, 1, 1, 0}},
      {"hid arrival", DBT_DEVICEARRIVAL, &hid, {1, 0, 0, 0}},
      {"vendor class removal", DBT_DEVICEREMOVECOMPLETE, &vendor, {0, 0, 0, 1}},
      {"SES name removal", DBT_DEVICEREMOVECOMPLETE, &named, {0, 0, 0, 1}},
      {"lower-case ses name", DBT_DEVICEARRIVAL, &lower, {0, 1, 1, 0}},
      {"query remove", DBT_DEVICEQUERYREMOVE, &disk_, {0, 0, 0, 0}},
      {"nodes changed", DBT_DEVNODES_CHANGED, nullptr, {0, 0, 0, 0}},
      {"unknown class", DBT_DEVICEARRIVAL, &other, {0, 0, 0, 0}},
      // Forwarded by the application: the record is never read.
      {"forwarded arrival", DBT_DEVICEARRIVAL, nullptr, {1, 0, 0, 0}},
      {"forwarded removal", DBT_DEVICEREMOVECOMPLETE, nullptr, {0, 0, 0, 1}},
  };
  for (const auto& c : cases) {
    monitorState.driveListStale = monitorState.deviceChangePending =
        monitorState.removalCheckRequested = 0;
    EXPECT_EQ(Handle(c.type, c.record), c.expected) << c.what;
  }
}

TEST_F(DeviceEvents, FlagsAreSetUnderTheStateMutex) {
  const std::pair<DWORD, const void*> events[] = {{DBT_DEVICEREMOVECOMPLETE, &volume_},
                                                  {DBT_DEVICEREMOVECOMPLETE, &disk_},
                                                  {DBT_DEVICEARRIVAL, &usb_}};
  for (const auto& [type, record] : events) {
    EXPECT_TRUE(lockprobe::WaitsForTheStateMutex([&] { HandleDeviceEvent(type, record, nullptr); }))
        << type;
  }
  EXPECT_EQ(Current(), (Requests{0, 1, 1, 1}));
  EXPECT_TRUE(lockprobe::WaitsForTheStateMutex([] { RequestRefresh(); })) << "a refresh request";
}

}  // namespace
