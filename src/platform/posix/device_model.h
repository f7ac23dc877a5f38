// What the emulation's device calls ask of the computer they run on.
//
// SetupDi*, CM_*, HidD_*, LoadLibraryW/GetProcAddress, GetLogicalDrives,
// GetDriveTypeW, GetDiskFreeSpaceExW and GetVersion/GetVersionExW are answered
// by the installed DeviceModel (the simulated computer). The model is also the
// DeviceProvider that CreateFileW asks for device and volume paths.
//
// When no model was installed, the first device call installs the default one
// from the factory registered with SetDefaultDeviceModelFactory (the host
// executable links a registration of the embedded default machine); without a
// factory the computer has no devices at all.
#pragma once

#include <string>
#include <string_view>
#include <vector>

#include "platform/posix/device_provider.h"
#include "platform/posix/win32_base.h"
#include "platform/posix/win32_devices.h"

namespace emu {

// One present device interface: its path and the device node it belongs to.
struct InterfaceEntry {
  std::u16string path;
  DEVINST devInst = 0;
  std::u16string instanceId;  // kept by the list, as SetupAPI keeps it
  GUID setupClass{};          // the node's setup class (reported in SP_DEVINFO_DATA)
};

struct OsVersion {
  DWORD major = 5;
  DWORD minor = 1;
  DWORD build = 2600;
  DWORD platformId = VER_PLATFORM_WIN32_NT;
  std::u16string servicePack = u"Service Pack 3";
};

class DeviceModel : public DeviceProvider {
 public:
  // ---- Plug and Play tree (device nodes are named by DEVINST numbers that
  // stay valid until the node is removed; a removed node answers
  // CR_NO_SUCH_DEVNODE) ----
  // Present interfaces of a class, in the order the system lists them.
  // False (with *error) when the list cannot be opened.
  virtual bool ListInterfaces(const GUID& interfaceClass, std::vector<InterfaceEntry>* out,
                              DWORD* error) = 0;
  virtual CONFIGRET Parent(DEVINST node, DEVINST* parent) = 0;
  virtual CONFIGRET InstanceId(DEVINST node, std::u16string* id) = 0;
  // Instance IDs compare without regard to ASCII case, as on Windows.
  virtual CONFIGRET Locate(std::u16string_view instanceId, DEVINST* node) = 0;
  // A registry property by its SPDRP_* index: REG_SZ text (with terminator)
  // or REG_DWORD data. CR_NO_SUCH_VALUE when the node lacks it.
  virtual CONFIGRET Property(DEVINST node, DWORD spdrp, DWORD* regType,
                             std::vector<BYTE>* data) = 0;
  // CM_Request_Device_Eject (queryAndRemove false) or
  // CM_Query_And_Remove_SubTree (true) on a node. A veto gives
  // CR_REMOVE_VETOED with the veto type and name.
  virtual CONFIGRET Eject(DEVINST node, bool queryAndRemove, PNP_VETO_TYPE* vetoType,
                          std::u16string* vetoName) = 0;

  // ---- Run-time linking: module names are lower case with ".dll" ----
  virtual bool ModuleLoads(std::u16string_view module, DWORD* error) = 0;
  virtual bool ExportPresent(std::u16string_view module, std::string_view name) = 0;

  // ---- Drive letters ----
  virtual DWORD LogicalDrives() = 0;
  // Letter is upper case 'A'..'Z'.
  virtual UINT DriveType(WCHAR letter) = 0;
  virtual bool FreeSpace(WCHAR letter, ULONGLONG* availableToCaller, ULONGLONG* total,
                         ULONGLONG* totalFree, DWORD* error) = 0;

  // ---- Operating system ----
  virtual OsVersion Version() = 0;
};

// Installs the model (and makes it the device provider); null uninstalls it.
// Not owned. Install and uninstall while no device call is running.
void SetDeviceModel(DeviceModel* model);
// The installed model, installing the default one first when there is none.
// Null when there is neither.
DeviceModel* ActiveDeviceModel();
// The installed model without installing the default one.
DeviceModel* ActiveDeviceModelIfAny();

using DeviceModelFactory = DeviceModel* (*)();
void SetDefaultDeviceModelFactory(DeviceModelFactory factory);

// The HID interface class, as HidD_GetHidGuid reports it.
inline constexpr GUID kHidInterfaceClass = {
    0x4D1E55B2, 0xF16F, 0x11CF, {0x88, 0xCB, 0x00, 0x11, 0x11, 0x00, 0x00, 0x30}};

// Internal controls by which the HID class library reaches a HID collection
// opened with CreateFileW (as the real library does). METHOD_NEITHER and
// METHOD_OUT_DIRECT codes of device type FILE_DEVICE_KEYBOARD.
constexpr DWORD kHidIoctlGetSerialNumberString = 0x000B01C2;
constexpr DWORD kHidIoctlGetInputReport = 0x000B01A2;

}  // namespace emu
