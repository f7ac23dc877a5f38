// SetupAPI device-interface lists and the configuration manager's node calls,
// answered by the installed device model.
#include <algorithm>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "platform/posix/device_model.h"
#include "platform/posix/handle_table.h"
#include "platform/win32.h"

namespace {

constexpr CONFIGRET kCrInvalidProperty = 0x00000035;

// A device information list: the snapshot of one interface class taken by
// SetupDiGetClassDevsW, as SetupAPI keeps it.
class DeviceInfoList : public emu::KernelObject {
 public:
  bool ClosableByCloseHandle() const override { return false; }
  GUID interfaceClass{};
  std::vector<emu::InterfaceEntry> entries;
};

std::shared_ptr<DeviceInfoList> LookupList(HDEVINFO handle) {
  if (handle == nullptr || handle == INVALID_HANDLE_VALUE) return nullptr;
  return emu::LookupHandleAs<DeviceInfoList>(handle);
}

BOOL Fail(DWORD error) {
  SetLastError(error);
  return FALSE;
}

// The list entry that an SP_DEVINFO_DATA names (by its node), or null.
const emu::InterfaceEntry* EntryForDevice(const DeviceInfoList& list, const SP_DEVINFO_DATA* data) {
  if (data == nullptr || data->cbSize != sizeof(SP_DEVINFO_DATA)) return nullptr;
  for (const auto& entry : list.entries) {
    if (entry.devInst == data->DevInst) return &entry;
  }
  return nullptr;
}

void FillDevInfo(SP_DEVINFO_DATA* data, const emu::InterfaceEntry& entry) {
  data->ClassGuid = entry.setupClass;
  data->DevInst = entry.devInst;
  data->Reserved = entry.devInst;
}

DWORD ErrorFromConfigRet(CONFIGRET result) {
  switch (result) {
    case CR_SUCCESS:
      return ERROR_SUCCESS;
    case CR_NO_SUCH_VALUE:
      return ERROR_INVALID_DATA;
    case CR_NO_SUCH_DEVNODE:
    case CR_INVALID_DEVNODE:
      return ERROR_NO_SUCH_DEVINST;
    default:
      return ERROR_GEN_FAILURE;
  }
}

}  // namespace

// ---- SetupAPI ------------------------------------------------------------------

HDEVINFO SetupDiGetClassDevsW(const GUID* classGuid, PCWSTR /*enumerator*/, HWND /*parent*/,
                              DWORD flags) {
  // Only the device-interface form is offered (the one the service uses);
  // lists hold present interfaces only.
  if (classGuid == nullptr || (flags & DIGCF_DEVICEINTERFACE) == 0 ||
      (flags & DIGCF_ALLCLASSES) != 0) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return INVALID_HANDLE_VALUE;
  }
  auto list = std::make_shared<DeviceInfoList>();
  list->interfaceClass = *classGuid;
  if (emu::DeviceModel* model = emu::ActiveDeviceModel()) {
    DWORD error = ERROR_SUCCESS;
    if (!model->ListInterfaces(*classGuid, &list->entries, &error)) {
      SetLastError(error != ERROR_SUCCESS ? error : ERROR_GEN_FAILURE);
      return INVALID_HANDLE_VALUE;
    }
  }
  HANDLE handle = emu::AllocateHandle(list);
  SetLastError(ERROR_SUCCESS);
  return handle;
}

BOOL SetupDiEnumDeviceInterfaces(HDEVINFO deviceInfoSet, PSP_DEVINFO_DATA deviceInfoData,
                                 const GUID* interfaceClassGuid, DWORD memberIndex,
                                 PSP_DEVICE_INTERFACE_DATA deviceInterfaceData) {
  auto list = LookupList(deviceInfoSet);
  if (!list) return Fail(ERROR_INVALID_HANDLE);
  if (interfaceClassGuid == nullptr || deviceInterfaceData == nullptr) {
    return Fail(ERROR_INVALID_PARAMETER);
  }
  if (deviceInterfaceData->cbSize != sizeof(SP_DEVICE_INTERFACE_DATA)) {
    return Fail(ERROR_INVALID_USER_BUFFER);
  }
  if (deviceInfoData != nullptr && deviceInfoData->cbSize != sizeof(SP_DEVINFO_DATA)) {
    return Fail(ERROR_INVALID_USER_BUFFER);
  }
  if (*interfaceClassGuid != list->interfaceClass) return Fail(ERROR_NO_MORE_ITEMS);
  DWORD seen = 0;
  for (std::size_t i = 0; i < list->entries.size(); ++i) {
    const auto& entry = list->entries[i];
    if (deviceInfoData != nullptr && entry.devInst != deviceInfoData->DevInst) continue;
    if (seen++ != memberIndex) continue;
    deviceInterfaceData->InterfaceClassGuid = list->interfaceClass;
    deviceInterfaceData->Flags = SPINT_ACTIVE;
    deviceInterfaceData->Reserved = i + 1;
    SetLastError(ERROR_SUCCESS);
    return TRUE;
  }
  return Fail(ERROR_NO_MORE_ITEMS);
}

BOOL SetupDiGetDeviceInterfaceDetailW(HDEVINFO deviceInfoSet,
                                      PSP_DEVICE_INTERFACE_DATA deviceInterfaceData,
                                      PSP_DEVICE_INTERFACE_DETAIL_DATA_W detail, DWORD detailSize,
                                      PDWORD requiredSize, PSP_DEVINFO_DATA deviceInfoData) {
  auto list = LookupList(deviceInfoSet);
  if (!list) return Fail(ERROR_INVALID_HANDLE);
  if (deviceInterfaceData == nullptr ||
      deviceInterfaceData->cbSize != sizeof(SP_DEVICE_INTERFACE_DATA) ||
      deviceInterfaceData->Reserved == 0 || deviceInterfaceData->Reserved > list->entries.size()) {
    return Fail(ERROR_INVALID_PARAMETER);
  }
  if (deviceInfoData != nullptr && deviceInfoData->cbSize != sizeof(SP_DEVINFO_DATA)) {
    return Fail(ERROR_INVALID_USER_BUFFER);
  }
  if (detail == nullptr && detailSize != 0) return Fail(ERROR_INVALID_USER_BUFFER);
  if (detail != nullptr && detail->cbSize != sizeof(SP_DEVICE_INTERFACE_DETAIL_DATA_W)) {
    return Fail(ERROR_INVALID_USER_BUFFER);
  }
  const auto& entry = list->entries[deviceInterfaceData->Reserved - 1];
  const DWORD needed = static_cast<DWORD>(offsetof(SP_DEVICE_INTERFACE_DETAIL_DATA_W, DevicePath) +
                                          (entry.path.size() + 1) * sizeof(WCHAR));
  if (requiredSize != nullptr) *requiredSize = needed;
  if (deviceInfoData != nullptr) FillDevInfo(deviceInfoData, entry);
  if (detail == nullptr || detailSize < needed) return Fail(ERROR_INSUFFICIENT_BUFFER);
  std::memcpy(detail->DevicePath, entry.path.c_str(), (entry.path.size() + 1) * sizeof(WCHAR));
  SetLastError(ERROR_SUCCESS);
  return TRUE;
}

BOOL SetupDiGetDeviceRegistryPropertyW(HDEVINFO deviceInfoSet, PSP_DEVINFO_DATA deviceInfoData,
                                       DWORD property, PDWORD propertyRegDataType,
                                       PBYTE propertyBuffer, DWORD propertyBufferSize,
                                       PDWORD requiredSize) {
  auto list = LookupList(deviceInfoSet);
  if (!list) return Fail(ERROR_INVALID_HANDLE);
  const emu::InterfaceEntry* entry = EntryForDevice(*list, deviceInfoData);
  if (entry == nullptr) return Fail(ERROR_INVALID_PARAMETER);
  if (propertyBuffer == nullptr && propertyBufferSize != 0) return Fail(ERROR_INVALID_USER_BUFFER);
  emu::DeviceModel* model = emu::ActiveDeviceModel();
  if (model == nullptr) return Fail(ERROR_NO_SUCH_DEVINST);
  DWORD type = 0;
  std::vector<BYTE> data;
  CONFIGRET result = model->Property(entry->devInst, property, &type, &data);
  if (result != CR_SUCCESS) {
    return Fail(result == kCrInvalidProperty ? ERROR_INVALID_REG_PROPERTY
                                             : ErrorFromConfigRet(result));
  }
  if (requiredSize != nullptr) *requiredSize = static_cast<DWORD>(data.size());
  if (propertyRegDataType != nullptr) *propertyRegDataType = type;
  if (propertyBuffer == nullptr || propertyBufferSize < data.size()) {
    return Fail(ERROR_INSUFFICIENT_BUFFER);
  }
  std::memcpy(propertyBuffer, data.data(), data.size());
  SetLastError(ERROR_SUCCESS);
  return TRUE;
}

BOOL SetupDiGetDeviceInstanceIdW(HDEVINFO deviceInfoSet, PSP_DEVINFO_DATA deviceInfoData,
                                 PWSTR deviceInstanceId, DWORD deviceInstanceIdSize,
                                 PDWORD requiredSize) {
  auto list = LookupList(deviceInfoSet);
  if (!list) return Fail(ERROR_INVALID_HANDLE);
  const emu::InterfaceEntry* entry = EntryForDevice(*list, deviceInfoData);
  if (entry == nullptr) return Fail(ERROR_INVALID_PARAMETER);
  if (deviceInstanceId == nullptr && deviceInstanceIdSize != 0) {
    return Fail(ERROR_INVALID_USER_BUFFER);
  }
  // The list keeps the ID, so it is still known after the device went.
  const std::u16string& id = entry->instanceId;
  const DWORD needed = static_cast<DWORD>(id.size() + 1);
  if (requiredSize != nullptr) *requiredSize = needed;
  if (deviceInstanceId == nullptr || deviceInstanceIdSize < needed) {
    return Fail(ERROR_INSUFFICIENT_BUFFER);
  }
  std::memcpy(deviceInstanceId, id.c_str(), needed * sizeof(WCHAR));
  SetLastError(ERROR_SUCCESS);
  return TRUE;
}

BOOL SetupDiDestroyDeviceInfoList(HDEVINFO deviceInfoSet) {
  if (!LookupList(deviceInfoSet)) return Fail(ERROR_INVALID_HANDLE);
  emu::ReleaseHandle(deviceInfoSet);
  SetLastError(ERROR_SUCCESS);
  return TRUE;
}

// ---- Configuration manager -----------------------------------------------------

CONFIGRET CM_Get_Parent(PDEVINST parent, DEVINST devInst, ULONG flags) {
  if (parent == nullptr) return CR_INVALID_POINTER;
  *parent = 0;
  if (flags != 0) return CR_INVALID_FLAG;
  emu::DeviceModel* model = emu::ActiveDeviceModel();
  if (model == nullptr) return CR_INVALID_DEVNODE;
  return model->Parent(devInst, parent);
}

CONFIGRET CM_Get_Device_ID_Size(PULONG length, DEVINST devInst, ULONG flags) {
  if (length == nullptr) return CR_INVALID_POINTER;
  *length = 0;
  if (flags != 0) return CR_INVALID_FLAG;
  emu::DeviceModel* model = emu::ActiveDeviceModel();
  std::u16string id;
  CONFIGRET result = model != nullptr ? model->InstanceId(devInst, &id) : CR_INVALID_DEVNODE;
  if (result == CR_SUCCESS) *length = static_cast<ULONG>(id.size());
  return result;
}

CONFIGRET CM_Get_Device_IDW(DEVINST devInst, PWCHAR buffer, ULONG bufferLength, ULONG flags) {
  if (buffer == nullptr || bufferLength == 0) return CR_INVALID_POINTER;
  if (flags != 0) return CR_INVALID_FLAG;
  emu::DeviceModel* model = emu::ActiveDeviceModel();
  std::u16string id;
  CONFIGRET result = model != nullptr ? model->InstanceId(devInst, &id) : CR_INVALID_DEVNODE;
  if (result != CR_SUCCESS) return result;
  // As documented for the real call: what fits is copied, and when the
  // terminator does not fit the text is left unterminated and the result is
  // CR_BUFFER_SMALL.
  if (bufferLength < id.size() + 1) {
    // NOLINTNEXTLINE(bugprone-not-null-terminated-result): unterminated on purpose
    std::memcpy(buffer, id.data(), std::min<std::size_t>(bufferLength, id.size()) * sizeof(WCHAR));
    return CR_BUFFER_SMALL;
  }
  std::memcpy(buffer, id.c_str(), (id.size() + 1) * sizeof(WCHAR));
  return CR_SUCCESS;
}

CONFIGRET CM_Locate_DevNodeW(PDEVINST devInst, DEVINSTID_W deviceId, ULONG flags) {
  if (devInst == nullptr) return CR_INVALID_POINTER;
  *devInst = 0;
  if ((flags & ~CM_LOCATE_DEVNODE_PHANTOM) != 0) return CR_INVALID_FLAG;
  emu::DeviceModel* model = emu::ActiveDeviceModel();
  if (model == nullptr) return CR_NO_SUCH_DEVNODE;
  std::u16string id = deviceId != nullptr ? std::u16string(deviceId) : std::u16string();
  if (id.size() > MAX_DEVICE_ID_LEN) return CR_INVALID_DEVICE_ID;
  return model->Locate(id, devInst);
}

CONFIGRET CM_Get_DevNode_Registry_PropertyW(DEVINST devInst, ULONG property, PULONG regDataType,
                                            PVOID buffer, PULONG length, ULONG flags) {
  if (length == nullptr) return CR_INVALID_POINTER;
  if (buffer == nullptr && *length != 0) return CR_INVALID_POINTER;
  if (flags != 0) return CR_INVALID_FLAG;
  if (property == 0) return kCrInvalidProperty;
  emu::DeviceModel* model = emu::ActiveDeviceModel();
  if (model == nullptr) return CR_INVALID_DEVNODE;
  DWORD type = 0;
  std::vector<BYTE> data;
  CONFIGRET result = model->Property(devInst, property - 1, &type, &data);
  if (result != CR_SUCCESS) return result;
  if (regDataType != nullptr) *regDataType = type;
  const ULONG needed = static_cast<ULONG>(data.size());
  if (buffer == nullptr || *length < needed) {
    *length = needed;
    return CR_BUFFER_SMALL;
  }
  std::memcpy(buffer, data.data(), needed);
  *length = needed;
  return CR_SUCCESS;
}

namespace {

template <class Char>
CONFIGRET RemoveNode(DEVINST devInst, bool queryAndRemove, PPNP_VETO_TYPE vetoType, Char* vetoName,
                     ULONG nameLength, ULONG flags) {
  if (vetoName != nullptr && nameLength == 0) return CR_INVALID_POINTER;
  if (flags != 0) return CR_INVALID_FLAG;
  if (vetoType != nullptr) *vetoType = PNP_VetoTypeUnknown;
  if (vetoName != nullptr) vetoName[0] = 0;
  emu::DeviceModel* model = emu::ActiveDeviceModel();
  if (model == nullptr) return CR_INVALID_DEVNODE;
  PNP_VETO_TYPE type = PNP_VetoTypeUnknown;
  std::u16string name;
  CONFIGRET result = model->Eject(devInst, queryAndRemove, &type, &name);
  if (result == CR_REMOVE_VETOED) {
    if (vetoType != nullptr) *vetoType = type;
    if (vetoName != nullptr) {
      std::size_t n = std::min<std::size_t>(name.size(), nameLength - 1);
      for (std::size_t i = 0; i < n; ++i) {
        if constexpr (sizeof(Char) == 1) {
          vetoName[i] = static_cast<Char>(name[i] < 0x80 ? name[i] : u'?');
        } else {
          vetoName[i] = name[i];
        }
      }
      vetoName[n] = 0;
    }
  }
  return result;
}

}  // namespace

CONFIGRET CM_Request_Device_EjectA(DEVINST devInst, PPNP_VETO_TYPE vetoType, LPSTR vetoName,
                                   ULONG nameLength, ULONG flags) {
  return RemoveNode(devInst, false, vetoType, vetoName, nameLength, flags);
}

CONFIGRET CM_Request_Device_EjectW(DEVINST devInst, PPNP_VETO_TYPE vetoType, LPWSTR vetoName,
                                   ULONG nameLength, ULONG flags) {
  return RemoveNode(devInst, false, vetoType, vetoName, nameLength, flags);
}

CONFIGRET CM_Query_And_Remove_SubTreeA(DEVINST ancestor, PPNP_VETO_TYPE vetoType, LPSTR vetoName,
                                       ULONG nameLength, ULONG flags) {
  return RemoveNode(ancestor, true, vetoType, vetoName, nameLength, flags);
}

CONFIGRET CM_Query_And_Remove_SubTreeW(DEVINST ancestor, PPNP_VETO_TYPE vetoType, LPWSTR vetoName,
                                       ULONG nameLength, ULONG flags) {
  return RemoveNode(ancestor, true, vetoType, vetoName, nameLength, flags);
}
