// The eject: the drive's node (or, on Windows 2000 for two models, its USB
// parent) is handed to the Plug and Play manager, retried while vetoed. The
// eject functions are looked up in "setupapi.dll" at each call.
#include "volume/eject.h"

#include "monitor/monitor_state.h"
#include "platform/wide.h"
#include "transport/drive_command.h"
#include "transport/drive_features.h"

namespace {

constexpr ULONG kVetoNameBytes = 520;
constexpr ULONG kVetoNameChars = kVetoNameBytes / sizeof(WCHAR);
constexpr ULONG kServiceNameBytes = 512;
constexpr std::size_t kIdCapacity = 256;

using NarrowEjectFunction = CONFIGRET(WINAPI*)(DEVINST, PPNP_VETO_TYPE, LPSTR, ULONG, ULONG);
using WideEjectFunction = CONFIGRET(WINAPI*)(DEVINST, PPNP_VETO_TYPE, LPWSTR, ULONG, ULONG);

// The node's capabilities; `fallback` when they cannot be read.
DWORD ReadCapabilities(DEVINST node, DWORD fallback) {
  DWORD capabilities = 0;
  ULONG length = sizeof(capabilities);
  if (CM_Get_DevNode_Registry_PropertyW(node, CM_DRP_CAPABILITIES, nullptr, &capabilities, &length,
                                        0) != CR_SUCCESS ||
      length != sizeof(capabilities)) {
    return fallback;
  }
  return capabilities;
}

// The node's service name, empty when it cannot be read.
void ReadServiceName(DEVINST node, WCHAR (&name)[kServiceNameBytes / sizeof(WCHAR) + 1]) {
  name[0] = 0;
  ULONG length = kServiceNameBytes;
  if (CM_Get_DevNode_Registry_PropertyW(node, CM_DRP_SERVICE, nullptr, name, &length, 0) !=
      CR_SUCCESS) {
    name[0] = 0;
  }
  name[kServiceNameBytes / sizeof(WCHAR)] = 0;
}

// The veto of the last call, reset before each call so that an earlier
// call's veto is never taken for the next one's.
struct Veto {
  PNP_VETO_TYPE type;
  WCHAR name[kVetoNameChars];
  void Reset() {
    type = PNP_VetoTypeUnknown;
    name[0] = 0;
  }
};

CONFIGRET CallNarrow(HMODULE library, const char* function, DEVINST node, Veto* veto) {
  veto->Reset();
  const auto call = reinterpret_cast<NarrowEjectFunction>(
      reinterpret_cast<void (*)()>(GetProcAddress(library, function)));
  if (call == nullptr) return CR_FAILURE;
  return call(node, &veto->type, reinterpret_cast<LPSTR>(veto->name), kVetoNameBytes, 0);
}

CONFIGRET CallWide(HMODULE library, const char* function, DEVINST node, Veto* veto) {
  veto->Reset();
  const auto call = reinterpret_cast<WideEjectFunction>(
      reinterpret_cast<void (*)()>(GetProcAddress(library, function)));
  if (call == nullptr) return CR_FAILURE;
  return call(node, &veto->type, veto->name, kVetoNameChars, 0);
}

// One attempt: the eject request (nodes that may be surprise-removed), then
// query-and-remove, narrow and wide, each only when the one before failed.
bool EjectAttempt(HMODULE library, DEVINST node, DWORD capabilities) {
  Veto veto{};
  CONFIGRET result = CR_FAILURE;
  if ((capabilities & CM_DEVCAP_SURPRISEREMOVALOK) != 0) {
    result = CallNarrow(library, "CM_Request_Device_EjectA", node, &veto);
  }
  if (result != CR_SUCCESS) {
    result = CallNarrow(library, "CM_Query_And_Remove_SubTreeA", node, &veto);
  }
  if (result != CR_SUCCESS) {
    result = CallWide(library, "CM_Query_And_Remove_SubTreeW", node, &veto);
  }
  return result == CR_SUCCESS && veto.type == PNP_VetoTypeUnknown;
}

}  // namespace

void ReopenChannelDevice(ChannelRecord* channel) {
  if (channel == nullptr) return;
  // A close only asked of the worker is called off: its handle stays.
  if (WithdrawChannelClose(channel) || channel->deviceHandle != nullptr) return;
  const HANDLE device = CreateFileW(channel->devicePath, GENERIC_READ | GENERIC_WRITE,
                                    FILE_SHARE_READ | FILE_SHARE_WRITE, nullptr, OPEN_EXISTING,
                                    FILE_FLAG_OVERLAPPED, nullptr);
  if (device != INVALID_HANDLE_VALUE) channel->deviceHandle = device;
}

int EjectDriveDevice(const DriveRecord* drive, ChannelRecord* channel) {
  WCHAR parentId[kIdCapacity] = {};
  WideCopy(parentId, kIdCapacity, drive->parentDeviceId);
  // An empty ID would locate the root of the device tree.
  if (parentId[0] == 0) {
    SetLastError(ERROR_NOT_FOUND);
    return 0;
  }
  DEVINST node = 0;
  if (CM_Locate_DevNodeW(&node, parentId, CM_LOCATE_DEVNODE_NORMAL) != CR_SUCCESS) return 0;

  DWORD capabilities = CM_DEVCAP_SURPRISEREMOVALOK;
  bool reopen = false;
  if (drive->busKind == kBusKindUsb) {
    DEVINST parent = 0;
    const bool haveParent = CM_Get_Parent(&parent, node, 0) == CR_SUCCESS;
    if (haveParent) capabilities = ReadCapabilities(parent, capabilities);
    if (monitorState.osKind == kOsWindows2000) {
      WCHAR service[kServiceNameBytes / sizeof(WCHAR) + 1];
      ReadServiceName(node, service);
      if (!WideContains(service, WSTR("VEVUV_UR")) &&
          (WideContains(parentId, WSTR("_2A30")) || WideContains(parentId, WSTR("_2A31")))) {
        // These models are ejected through their USB parent once told so.
        BYTE notice = kEjectNoticeValue;
        DriveCommand(channel, CTL_EJECT_NOTICE, &notice, 1, nullptr);
        Sleep(kEjectNoticePauseMs);
        CloseChannelDevice(channel);
        reopen = true;
        if (haveParent) node = parent;
      }
    }
  } else if (drive->busKind == kBusKindIeee1394) {
    capabilities = ReadCapabilities(node, capabilities);
  }

  const HMODULE library = LoadLibraryW(WSTR("setupapi.dll"));
  if (library == nullptr) {
    if (reopen) ReopenChannelDevice(channel);
    return 0;
  }
  bool ejected = false;
  for (int attempt = 0; attempt < kEjectAttempts && !ejected; ++attempt) {
    ejected = EjectAttempt(library, node, capabilities);
    if (!ejected) Sleep(kEjectRetryPauseMs);
  }
  FreeLibrary(library);

  if (ejected) return 1;
  if (reopen) ReopenChannelDevice(channel);
  return 0;
}
