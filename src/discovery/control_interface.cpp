#include "discovery/control_interface.h"

#include "discovery/device_interfaces.h"
#include "discovery/model_table.h"
#include "platform/wide.h"

namespace {

// The grandparent of the device, lower-cased, contains the key.
bool GrandparentCarriesKey(DEVINST device, const WCHAR* lowerKey) {
  DEVINST parent = 0;
  DEVINST grandparent = 0;
  WCHAR id[512] = {};
  if (CM_Get_Parent(&parent, device, 0) != CR_SUCCESS) return false;
  if (!ReadNodeInstanceId(parent, id, 512)) return false;
  if (CM_Get_Parent(&grandparent, parent, 0) != CR_SUCCESS) return false;
  if (!ReadNodeInstanceId(grandparent, id, 512)) return false;
  WideToLower(id);
  return ContainsComponent(id, lowerKey);
}

bool StoragePathCarriesKey(const WCHAR* path, const WCHAR* lowerKey) {
  if (!WideContains(path, WSTR("qx")) || !WideContains(path, WSTR("quarry")) ||
      !ContainsComponent(path, lowerKey)) {
    return false;
  }
  return (WideContains(path, WSTR("usbstor")) && WideContains(path, WSTR("other"))) ||
         WideContains(path, WSTR("sbp2"));
}

}  // namespace

LONG FindControlInterfacePath(const GUID& interfaceClass, const WCHAR* key, WCHAR* path,
                              std::size_t capacity) {
  // An empty key would be contained in every ID and pick an arbitrary drive.
  if (key == nullptr || key[0] == 0) return -1;
  InterfaceList list(interfaceClass);
  if (!list.Opened()) return -1;
  WCHAR lowerKey[256] = {};
  WideCopy(lowerKey, 256, key);
  WideToLower(lowerKey);

  WideString candidate;
  SP_DEVINFO_DATA devInfo{};
  for (DWORD index = 0;; ++index) {
    const InterfaceList::Fetch fetch = list.Member(index, &candidate, &devInfo);
    if (fetch == InterfaceList::Fetch::End) break;
    if (fetch == InterfaceList::Fetch::Skip) continue;
    const bool match = WideContains(candidate.c_str(), WSTR("hid"))
                           ? GrandparentCarriesKey(devInfo.DevInst, lowerKey)
                           : StoragePathCarriesKey(candidate.c_str(), lowerKey);
    if (match) {
      WideCopy(path, capacity, candidate);
      return 0;
    }
  }
  return -1;
}
