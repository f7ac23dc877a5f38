#include "volume/device_events.h"

#include "monitor/monitor_state.h"
#include "monitor/state_lock.h"
#include "platform/wide.h"
#include "service/interface_classes.h"

namespace {

enum class InterfaceGroup { None, DriveControl, Storage, UsbDevice };

InterfaceGroup Classify(const DEV_BROADCAST_DEVICEINTERFACE_W* record) {
  GUID hidClass;
  const bool hidKnown = GetHidClassGuid(&hidClass);
  const GUID& cls = record->dbcc_classguid;
  const WCHAR* name = record->dbcc_name;
  if ((hidKnown && cls == hidClass) || cls == kVendorClassA || cls == kVendorClassB ||
      cls == kVendorClassC || WideContains(name, WSTR("SES")) ||
      WideContains(name, WSTR("Quarry"))) {
    return InterfaceGroup::DriveControl;
  }
  if (cls == kDiskInterfaceClass || cls == kVolumeInterfaceClass) return InterfaceGroup::Storage;
  if (cls == kUsbDeviceInterfaceClass) return InterfaceGroup::UsbDevice;
  return InterfaceGroup::None;
}

// Sets one request flag under the mutex.
void SetFlag(DWORD MonitorState::*flag) {
  StateLock lock;
  monitorState.*flag = 1;
}

}  // namespace

void HandleDeviceEvent(DWORD eventType, const void* eventData, void*) {
  if (eventType != DBT_DEVICEARRIVAL && eventType != DBT_DEVICEREMOVECOMPLETE) return;
  const bool removal = eventType == DBT_DEVICEREMOVECOMPLETE;
  const auto* header = static_cast<const DEV_BROADCAST_HDR*>(eventData);
  const DWORD deviceType = header != nullptr ? header->dbch_devicetype : 0;
  if (deviceType == DBT_DEVTYP_VOLUME) SetFlag(&MonitorState::driveListStale);
  if (deviceType != DBT_DEVTYP_DEVICEINTERFACE) {
    if (removal) {
      SetFlag(&MonitorState::removalCheckRequested);
    } else {
      RequestRefresh();
    }
    return;
  }
  switch (Classify(static_cast<const DEV_BROADCAST_DEVICEINTERFACE_W*>(eventData))) {
    case InterfaceGroup::DriveControl:
      if (removal) {
        SetFlag(&MonitorState::removalCheckRequested);
      } else {
        RequestRefresh();
      }
      Sleep(1500);
      break;
    case InterfaceGroup::Storage:
      if (removal) {
        StateLock lock;
        monitorState.driveListStale = 1;
        monitorState.removalCheckRequested = 1;
      } else {
        RequestRefresh();
      }
      break;
    case InterfaceGroup::UsbDevice: {
      StateLock lock;
      monitorState.driveListStale = 1;
      monitorState.deviceChangePending = 1;
      break;
    }
    case InterfaceGroup::None:
      break;
  }
}
