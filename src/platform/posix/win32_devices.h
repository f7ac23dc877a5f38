// Device-facing subset of Win32 for the POSIX emulation: SetupAPI, the
// configuration manager, the HID class library, run-time linking of
// "setupapi.dll" and "hid.dll", the storage controls, drive letters and the
// OS version. Names, values and 64-bit layouts are those of the Windows SDK.
// The calls are answered by the simulated computer (device_model.h).
#pragma once

#include <cstddef>

#include "platform/posix/win32_base.h"

struct HWND__;
using HWND = HWND__*;

// ---- SetupAPI --------------------------------------------------------------
using HDEVINFO = PVOID;

struct SP_DEVINFO_DATA {
  DWORD cbSize;
  GUID ClassGuid;
  DWORD DevInst;
  ULONG_PTR Reserved;
};
using PSP_DEVINFO_DATA = SP_DEVINFO_DATA*;
static_assert(sizeof(SP_DEVINFO_DATA) == 32);

struct SP_DEVICE_INTERFACE_DATA {
  DWORD cbSize;
  GUID InterfaceClassGuid;
  DWORD Flags;
  ULONG_PTR Reserved;
};
using PSP_DEVICE_INTERFACE_DATA = SP_DEVICE_INTERFACE_DATA*;
static_assert(sizeof(SP_DEVICE_INTERFACE_DATA) == 32);

struct SP_DEVICE_INTERFACE_DETAIL_DATA_W {
  DWORD cbSize;  // must be sizeof(SP_DEVICE_INTERFACE_DETAIL_DATA_W), 8 on 64-bit
  WCHAR DevicePath[1];
};
using PSP_DEVICE_INTERFACE_DETAIL_DATA_W = SP_DEVICE_INTERFACE_DETAIL_DATA_W*;
static_assert(sizeof(SP_DEVICE_INTERFACE_DETAIL_DATA_W) == 8);
static_assert(offsetof(SP_DEVICE_INTERFACE_DETAIL_DATA_W, DevicePath) == 4);

constexpr DWORD DIGCF_DEFAULT = 0x00000001;
constexpr DWORD DIGCF_PRESENT = 0x00000002;
constexpr DWORD DIGCF_ALLCLASSES = 0x00000004;
constexpr DWORD DIGCF_PROFILE = 0x00000008;
constexpr DWORD DIGCF_DEVICEINTERFACE = 0x00000010;

constexpr DWORD SPINT_ACTIVE = 0x00000001;
constexpr DWORD SPINT_DEFAULT = 0x00000002;
constexpr DWORD SPINT_REMOVED = 0x00000004;

constexpr DWORD SPDRP_DEVICEDESC = 0x00000000;
constexpr DWORD SPDRP_HARDWAREID = 0x00000001;
constexpr DWORD SPDRP_SERVICE = 0x00000004;
constexpr DWORD SPDRP_FRIENDLYNAME = 0x0000000C;
constexpr DWORD SPDRP_CAPABILITIES = 0x0000000F;
constexpr DWORD SPDRP_ADDRESS = 0x0000001C;

// SetupAPI's own error codes (customer bit set), as SetupAPI reports them.
constexpr DWORD ERROR_NO_SUCH_DEVINST = 0xE000020B;
constexpr DWORD ERROR_INVALID_REG_PROPERTY = 0xE0000209;

HDEVINFO SetupDiGetClassDevsW(const GUID* classGuid, PCWSTR enumerator, HWND parent, DWORD flags);
BOOL SetupDiEnumDeviceInterfaces(HDEVINFO deviceInfoSet, PSP_DEVINFO_DATA deviceInfoData,
                                 const GUID* interfaceClassGuid, DWORD memberIndex,
                                 PSP_DEVICE_INTERFACE_DATA deviceInterfaceData);
BOOL SetupDiGetDeviceInterfaceDetailW(HDEVINFO deviceInfoSet,
                                      PSP_DEVICE_INTERFACE_DATA deviceInterfaceData,
                                      PSP_DEVICE_INTERFACE_DETAIL_DATA_W detail, DWORD detailSize,
                                      PDWORD requiredSize, PSP_DEVINFO_DATA deviceInfoData);
BOOL SetupDiGetDeviceRegistryPropertyW(HDEVINFO deviceInfoSet, PSP_DEVINFO_DATA deviceInfoData,
                                       DWORD property, PDWORD propertyRegDataType,
                                       PBYTE propertyBuffer, DWORD propertyBufferSize,
                                       PDWORD requiredSize);
BOOL SetupDiGetDeviceInstanceIdW(HDEVINFO deviceInfoSet, PSP_DEVINFO_DATA deviceInfoData,
                                 PWSTR deviceInstanceId, DWORD deviceInstanceIdSize,
                                 PDWORD requiredSize);
BOOL SetupDiDestroyDeviceInfoList(HDEVINFO deviceInfoSet);

// ---- Configuration manager -------------------------------------------------
using DEVINST = DWORD;
using DEVNODE = DWORD;
using PDEVINST = DEVINST*;
using CONFIGRET = DWORD;
using DEVINSTID_W = WCHAR*;

constexpr ULONG MAX_DEVICE_ID_LEN = 200;

constexpr CONFIGRET CR_SUCCESS = 0x00000000;
constexpr CONFIGRET CR_DEFAULT = 0x00000001;
constexpr CONFIGRET CR_OUT_OF_MEMORY = 0x00000002;
constexpr CONFIGRET CR_INVALID_POINTER = 0x00000003;
constexpr CONFIGRET CR_INVALID_FLAG = 0x00000004;
constexpr CONFIGRET CR_INVALID_DEVNODE = 0x00000005;
constexpr CONFIGRET CR_INVALID_DEVINST = CR_INVALID_DEVNODE;
constexpr CONFIGRET CR_NO_SUCH_DEVNODE = 0x0000000D;
constexpr CONFIGRET CR_NO_SUCH_DEVINST = CR_NO_SUCH_DEVNODE;
constexpr CONFIGRET CR_FAILURE = 0x00000013;
constexpr CONFIGRET CR_REMOVE_VETOED = 0x00000017;
constexpr CONFIGRET CR_BUFFER_SMALL = 0x0000001A;
constexpr CONFIGRET CR_INVALID_DEVICE_ID = 0x0000001E;
constexpr CONFIGRET CR_INVALID_DATA = 0x0000001F;
constexpr CONFIGRET CR_NO_SUCH_VALUE = 0x00000025;
constexpr CONFIGRET CR_ACCESS_DENIED = 0x00000033;

constexpr ULONG CM_LOCATE_DEVNODE_NORMAL = 0x00000000;
constexpr ULONG CM_LOCATE_DEVNODE_PHANTOM = 0x00000001;

// CM_DRP_* are the SPDRP_* values plus one.
constexpr ULONG CM_DRP_DEVICEDESC = 0x00000001;
constexpr ULONG CM_DRP_SERVICE = 0x00000005;
constexpr ULONG CM_DRP_FRIENDLYNAME = 0x0000000D;
constexpr ULONG CM_DRP_CAPABILITIES = 0x00000010;
constexpr ULONG CM_DRP_ADDRESS = 0x0000001D;

constexpr DWORD CM_DEVCAP_LOCKSUPPORTED = 0x00000001;
constexpr DWORD CM_DEVCAP_EJECTSUPPORTED = 0x00000002;
constexpr DWORD CM_DEVCAP_REMOVABLE = 0x00000004;
constexpr DWORD CM_DEVCAP_DOCKDEVICE = 0x00000008;
constexpr DWORD CM_DEVCAP_UNIQUEID = 0x00000010;
constexpr DWORD CM_DEVCAP_SILENTINSTALL = 0x00000020;
constexpr DWORD CM_DEVCAP_RAWDEVICEOK = 0x00000040;
constexpr DWORD CM_DEVCAP_SURPRISEREMOVALOK = 0x00000080;

enum PNP_VETO_TYPE {
  PNP_VetoTypeUnknown,
  PNP_VetoLegacyDevice,
  PNP_VetoPendingClose,
  PNP_VetoWindowsApp,
  PNP_VetoWindowsService,
  PNP_VetoOutstandingOpen,
  PNP_VetoDevice,
  PNP_VetoDriver,
  PNP_VetoIllegalDeviceRequest,
  PNP_VetoInsufficientPower,
  PNP_VetoNonDisableable,
  PNP_VetoLegacyDriver,
  PNP_VetoInsufficientRights,
  PNP_VetoAlreadyRemoved
};
using PPNP_VETO_TYPE = PNP_VETO_TYPE*;
static_assert(sizeof(PNP_VETO_TYPE) == 4);

CONFIGRET CM_Get_Parent(PDEVINST parent, DEVINST devInst, ULONG flags);
CONFIGRET CM_Get_Device_ID_Size(PULONG length, DEVINST devInst, ULONG flags);
CONFIGRET CM_Get_Device_IDW(DEVINST devInst, PWCHAR buffer, ULONG bufferLength, ULONG flags);
CONFIGRET CM_Locate_DevNodeW(PDEVINST devInst, DEVINSTID_W deviceId, ULONG flags);
CONFIGRET CM_Get_DevNode_Registry_PropertyW(DEVINST devInst, ULONG property, PULONG regDataType,
                                            PVOID buffer, PULONG length, ULONG flags);
// Exported by "setupapi.dll"; the service reaches them through GetProcAddress.
CONFIGRET CM_Request_Device_EjectA(DEVINST devInst, PPNP_VETO_TYPE vetoType, LPSTR vetoName,
                                   ULONG nameLength, ULONG flags);
CONFIGRET CM_Request_Device_EjectW(DEVINST devInst, PPNP_VETO_TYPE vetoType, LPWSTR vetoName,
                                   ULONG nameLength, ULONG flags);
CONFIGRET CM_Query_And_Remove_SubTreeA(DEVINST ancestor, PPNP_VETO_TYPE vetoType, LPSTR vetoName,
                                       ULONG nameLength, ULONG flags);
CONFIGRET CM_Query_And_Remove_SubTreeW(DEVINST ancestor, PPNP_VETO_TYPE vetoType, LPWSTR vetoName,
                                       ULONG nameLength, ULONG flags);

// ---- HID class library ("hid.dll") -----------------------------------------
void HidD_GetHidGuid(LPGUID hidGuid);
BOOLEAN HidD_GetSerialNumberString(HANDLE hidDeviceObject, PVOID buffer, ULONG bufferLength);
BOOLEAN HidD_GetInputReport(HANDLE hidDeviceObject, PVOID reportBuffer, ULONG reportBufferLength);

// ---- Run-time linking ------------------------------------------------------
HMODULE LoadLibraryW(LPCWSTR fileName);
FARPROC GetProcAddress(HMODULE module, LPCSTR procName);
BOOL FreeLibrary(HMODULE module);

// ---- Device interface classes ----------------------------------------------
inline constexpr GUID GUID_DEVINTERFACE_DISK = {
    0x53F56307, 0xB6BF, 0x11D0, {0x94, 0xF2, 0x00, 0xA0, 0xC9, 0x1E, 0xFB, 0x8B}};
inline constexpr GUID GUID_DEVINTERFACE_VOLUME = {
    0x53F5630D, 0xB6BF, 0x11D0, {0x94, 0xF2, 0x00, 0xA0, 0xC9, 0x1E, 0xFB, 0x8B}};
inline constexpr GUID GUID_DEVINTERFACE_USB_DEVICE = {
    0xA5DCBF10, 0x6530, 0x11D2, {0x90, 0x1F, 0x00, 0xC0, 0x4F, 0xB9, 0x51, 0xED}};

// ---- Storage controls ------------------------------------------------------
constexpr DWORD IOCTL_SCSI_PASS_THROUGH_DIRECT = 0x0004D014;
constexpr DWORD IOCTL_STORAGE_GET_DEVICE_NUMBER = 0x002D1080;
constexpr DWORD IOCTL_STORAGE_CHECK_VERIFY = 0x002D4800;
constexpr DWORD IOCTL_HID_GET_INPUT_REPORT = 0x000B01A2;
constexpr DWORD IOCTL_HID_GET_SERIALNUMBER_STRING = 0x000B01C2;
constexpr DWORD FSCTL_LOCK_VOLUME = 0x00090018;
constexpr DWORD FSCTL_UNLOCK_VOLUME = 0x0009001C;
constexpr DWORD FSCTL_DISMOUNT_VOLUME = 0x00090020;

constexpr UCHAR SCSI_IOCTL_DATA_OUT = 0;
constexpr UCHAR SCSI_IOCTL_DATA_IN = 1;
constexpr UCHAR SCSI_IOCTL_DATA_UNSPECIFIED = 2;

struct SCSI_PASS_THROUGH_DIRECT {
  USHORT Length;
  UCHAR ScsiStatus;
  UCHAR PathId;
  UCHAR TargetId;
  UCHAR Lun;
  UCHAR CdbLength;
  UCHAR SenseInfoLength;
  UCHAR DataIn;
  ULONG DataTransferLength;
  ULONG TimeOutValue;
  PVOID DataBuffer;
  ULONG SenseInfoOffset;
  UCHAR Cdb[16];
};
using PSCSI_PASS_THROUGH_DIRECT = SCSI_PASS_THROUGH_DIRECT*;
static_assert(sizeof(SCSI_PASS_THROUGH_DIRECT) == 56);
static_assert(offsetof(SCSI_PASS_THROUGH_DIRECT, ScsiStatus) == 2);
static_assert(offsetof(SCSI_PASS_THROUGH_DIRECT, CdbLength) == 6);
static_assert(offsetof(SCSI_PASS_THROUGH_DIRECT, SenseInfoLength) == 7);
static_assert(offsetof(SCSI_PASS_THROUGH_DIRECT, DataIn) == 8);
static_assert(offsetof(SCSI_PASS_THROUGH_DIRECT, DataTransferLength) == 12);
static_assert(offsetof(SCSI_PASS_THROUGH_DIRECT, TimeOutValue) == 16);
static_assert(offsetof(SCSI_PASS_THROUGH_DIRECT, DataBuffer) == 24);
static_assert(offsetof(SCSI_PASS_THROUGH_DIRECT, SenseInfoOffset) == 32);
static_assert(offsetof(SCSI_PASS_THROUGH_DIRECT, Cdb) == 36);

using DEVICE_TYPE = DWORD;
struct STORAGE_DEVICE_NUMBER {
  DEVICE_TYPE DeviceType;
  DWORD DeviceNumber;
  DWORD PartitionNumber;
};
using PSTORAGE_DEVICE_NUMBER = STORAGE_DEVICE_NUMBER*;
static_assert(sizeof(STORAGE_DEVICE_NUMBER) == 12);

// ---- Drive letters ---------------------------------------------------------
constexpr UINT DRIVE_UNKNOWN = 0;
constexpr UINT DRIVE_NO_ROOT_DIR = 1;
constexpr UINT DRIVE_REMOVABLE = 2;
constexpr UINT DRIVE_FIXED = 3;
constexpr UINT DRIVE_REMOTE = 4;
constexpr UINT DRIVE_CDROM = 5;
constexpr UINT DRIVE_RAMDISK = 6;

DWORD GetLogicalDrives();
UINT GetDriveTypeW(LPCWSTR rootPathName);
BOOL GetDiskFreeSpaceExW(LPCWSTR directoryName, PULARGE_INTEGER freeBytesAvailableToCaller,
                         PULARGE_INTEGER totalNumberOfBytes,
                         PULARGE_INTEGER totalNumberOfFreeBytes);
