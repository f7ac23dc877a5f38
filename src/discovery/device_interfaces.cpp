#include "discovery/device_interfaces.h"

InterfaceList::InterfaceList(const GUID& interfaceClass)
    : interfaceClass_(interfaceClass),
      list_(SetupDiGetClassDevsW(&interfaceClass, nullptr, nullptr,
                                 DIGCF_PRESENT | DIGCF_DEVICEINTERFACE)) {}

InterfaceList::~InterfaceList() {
  if (Opened()) SetupDiDestroyDeviceInfoList(list_);
}

InterfaceList::Fetch InterfaceList::Member(DWORD index, WideString* path,
                                           SP_DEVINFO_DATA* devInfo) {
  SP_DEVICE_INTERFACE_DATA interfaceData{};
  interfaceData.cbSize = sizeof(interfaceData);
  if (!SetupDiEnumDeviceInterfaces(list_, nullptr, &interfaceClass_, index, &interfaceData))
    return Fetch::End;

  // First the size, then the detail itself together with the device node.
  DWORD required = 0;
  SetupDiGetDeviceInterfaceDetailW(list_, &interfaceData, nullptr, 0, &required, nullptr);
  if (required < sizeof(SP_DEVICE_INTERFACE_DETAIL_DATA_W)) return Fetch::Skip;
  auto* detail = static_cast<SP_DEVICE_INTERFACE_DETAIL_DATA_W*>(
      HeapAlloc(GetProcessHeap(), HEAP_ZERO_MEMORY, required));
  if (detail == nullptr) return Fetch::Skip;
  detail->cbSize = sizeof(SP_DEVICE_INTERFACE_DETAIL_DATA_W);
  *devInfo = SP_DEVINFO_DATA{};
  devInfo->cbSize = sizeof(SP_DEVINFO_DATA);
  Fetch result = Fetch::Skip;
  if (SetupDiGetDeviceInterfaceDetailW(list_, &interfaceData, detail, required, nullptr, devInfo)) {
    const std::size_t capacity =
        (required - offsetof(SP_DEVICE_INTERFACE_DETAIL_DATA_W, DevicePath)) / sizeof(WCHAR);
    path->assign(detail->DevicePath, WideLength(detail->DevicePath, capacity));
    result = Fetch::Ok;
  }
  HeapFree(GetProcessHeap(), 0, detail);
  return result;
}

bool ReadNodeInstanceId(DEVINST node, WCHAR* id, ULONG capacity) {
  if (capacity == 0) return false;
  id[0] = 0;
  WCHAR buffer[512 + 1] = {};
  if (CM_Get_Device_IDW(node, buffer, 512, 0) != CR_SUCCESS) return false;
  WideCopy(id, capacity, buffer);
  return true;
}
