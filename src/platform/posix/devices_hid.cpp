// The HID class library and run-time linking of "setupapi.dll" and "hid.dll".
#include <cstring>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>

#include "platform/posix/device_model.h"
#include "platform/posix/handle_table.h"
#include "platform/win32.h"

// ---- HID class library -----------------------------------------------------------

namespace {

// Issues one of the HID class driver's internal controls on an open HID
// collection and waits for it, whether the handle is overlapped or not.
BOOLEAN HidControl(HANDLE device, DWORD code, void* input, DWORD inputLength, void* output,
                   DWORD outputLength) {
  HANDLE event = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  if (event == nullptr) return FALSE;
  OVERLAPPED overlapped{};
  overlapped.hEvent = event;
  DWORD bytes = 0;
  BOOL ok =
      DeviceIoControl(device, code, input, inputLength, output, outputLength, &bytes, &overlapped);
  if (!ok && GetLastError() == ERROR_IO_PENDING) {
    ok = GetOverlappedResult(device, &overlapped, &bytes, TRUE);
  }
  DWORD error = ok ? ERROR_SUCCESS : GetLastError();
  CloseHandle(event);
  SetLastError(error);
  return ok ? TRUE : FALSE;
}

}  // namespace

void HidD_GetHidGuid(LPGUID hidGuid) {
  if (hidGuid != nullptr) *hidGuid = emu::kHidInterfaceClass;
}

BOOLEAN HidD_GetSerialNumberString(HANDLE hidDeviceObject, PVOID buffer, ULONG bufferLength) {
  if (buffer == nullptr || bufferLength == 0) {
    SetLastError(ERROR_INVALID_USER_BUFFER);
    return FALSE;
  }
  return HidControl(hidDeviceObject, emu::kHidIoctlGetSerialNumberString, nullptr, 0, buffer,
                    bufferLength);
}

BOOLEAN HidD_GetInputReport(HANDLE hidDeviceObject, PVOID reportBuffer, ULONG reportBufferLength) {
  if (reportBuffer == nullptr || reportBufferLength == 0) {
    SetLastError(ERROR_INVALID_USER_BUFFER);
    return FALSE;
  }
  // The first byte names the report; the driver reads it and fills the buffer.
  return HidControl(hidDeviceObject, emu::kHidIoctlGetInputReport, reportBuffer, reportBufferLength,
                    reportBuffer, reportBufferLength);
}

// ---- Run-time linking ------------------------------------------------------------

namespace {

struct Export {
  const char* name;
  FARPROC address;
};

template <class F>
FARPROC AsProc(F* function) {
  // Through void (*)(), the one function type every other converts to and from
  // without a cast-function-type warning.
  return reinterpret_cast<FARPROC>(reinterpret_cast<void (*)()>(function));
}

const Export kSetupApiExports[] = {
    {"SetupDiGetClassDevsW", AsProc(&SetupDiGetClassDevsW)},
    {"SetupDiEnumDeviceInterfaces", AsProc(&SetupDiEnumDeviceInterfaces)},
    {"SetupDiGetDeviceInterfaceDetailW", AsProc(&SetupDiGetDeviceInterfaceDetailW)},
    {"SetupDiGetDeviceRegistryPropertyW", AsProc(&SetupDiGetDeviceRegistryPropertyW)},
    {"SetupDiGetDeviceInstanceIdW", AsProc(&SetupDiGetDeviceInstanceIdW)},
    {"SetupDiDestroyDeviceInfoList", AsProc(&SetupDiDestroyDeviceInfoList)},
    {"CM_Get_Parent", AsProc(&CM_Get_Parent)},
    {"CM_Get_Device_ID_Size", AsProc(&CM_Get_Device_ID_Size)},
    {"CM_Get_Device_IDW", AsProc(&CM_Get_Device_IDW)},
    {"CM_Locate_DevNodeW", AsProc(&CM_Locate_DevNodeW)},
    {"CM_Get_DevNode_Registry_PropertyW", AsProc(&CM_Get_DevNode_Registry_PropertyW)},
    {"CM_Request_Device_EjectA", AsProc(&CM_Request_Device_EjectA)},
    {"CM_Request_Device_EjectW", AsProc(&CM_Request_Device_EjectW)},
    {"CM_Query_And_Remove_SubTreeA", AsProc(&CM_Query_And_Remove_SubTreeA)},
    {"CM_Query_And_Remove_SubTreeW", AsProc(&CM_Query_And_Remove_SubTreeW)},
};

const Export kHidExports[] = {
    {"HidD_GetHidGuid", AsProc(&HidD_GetHidGuid)},
    {"HidD_GetSerialNumberString", AsProc(&HidD_GetSerialNumberString)},
    {"HidD_GetInputReport", AsProc(&HidD_GetInputReport)},
};

// A loaded module. One handle per module while its load count is above 0,
// as LoadLibraryW returns the same module for every load.
class Module : public emu::KernelObject {
 public:
  bool ClosableByCloseHandle() const override { return false; }
  std::u16string name;
};

struct LoadedModule {
  HANDLE handle = nullptr;
  int loads = 0;
};

std::mutex modulesMutex;
std::map<std::u16string, LoadedModule>& LoadedModules() {
  static std::map<std::u16string, LoadedModule> modules;
  return modules;
}

// "C:\Windows\system32\SetupAPI" → "setupapi.dll".
std::u16string CanonicalModuleName(LPCWSTR fileName) {
  std::u16string name(fileName);
  std::size_t slash = name.find_last_of(u"\\/");
  if (slash != std::u16string::npos) name.erase(0, slash + 1);
  for (auto& c : name) {
    if (c >= u'A' && c <= u'Z') c = static_cast<char16_t>(c - u'A' + u'a');
  }
  if (name.find(u'.') == std::u16string::npos) {
    name += u".dll";
  } else if (!name.empty() && name.back() == u'.') {
    name.pop_back();
  }
  return name;
}

}  // namespace

HMODULE LoadLibraryW(LPCWSTR fileName) {
  if (fileName == nullptr || fileName[0] == 0) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return nullptr;
  }
  std::u16string name = CanonicalModuleName(fileName);
  if (name != u"setupapi.dll" && name != u"hid.dll") {
    SetLastError(ERROR_MOD_NOT_FOUND);
    return nullptr;
  }
  emu::DeviceModel* model = emu::ActiveDeviceModel();
  DWORD error = ERROR_SUCCESS;
  if (model != nullptr && !model->ModuleLoads(name, &error)) {
    SetLastError(error != ERROR_SUCCESS ? error : ERROR_MOD_NOT_FOUND);
    return nullptr;
  }
  std::lock_guard<std::mutex> lock(modulesMutex);
  LoadedModule& loaded = LoadedModules()[name];
  if (loaded.loads == 0) {
    auto module = std::make_shared<Module>();
    module->name = name;
    loaded.handle = emu::AllocateHandle(module);
  }
  ++loaded.loads;
  SetLastError(ERROR_SUCCESS);
  return reinterpret_cast<HMODULE>(loaded.handle);
}

FARPROC GetProcAddress(HMODULE module, LPCSTR procName) {
  auto object = emu::LookupHandleAs<Module>(reinterpret_cast<HANDLE>(module));
  if (!object) {
    SetLastError(ERROR_MOD_NOT_FOUND);
    return nullptr;
  }
  // Names only; an ordinal (a value below 0x10000) finds nothing here.
  if (reinterpret_cast<ULONG_PTR>(procName) < 0x10000) {
    SetLastError(ERROR_PROC_NOT_FOUND);
    return nullptr;
  }
  std::string_view wanted(procName);
  const Export* begin =
      object->name == u"hid.dll" ? std::begin(kHidExports) : std::begin(kSetupApiExports);
  const Export* end =
      object->name == u"hid.dll" ? std::end(kHidExports) : std::end(kSetupApiExports);
  for (const Export* e = begin; e != end; ++e) {
    if (wanted != e->name) continue;
    emu::DeviceModel* model = emu::ActiveDeviceModel();
    if (model != nullptr && !model->ExportPresent(object->name, wanted)) break;
    SetLastError(ERROR_SUCCESS);
    return e->address;
  }
  SetLastError(ERROR_PROC_NOT_FOUND);
  return nullptr;
}

BOOL FreeLibrary(HMODULE module) {
  auto object = emu::LookupHandleAs<Module>(reinterpret_cast<HANDLE>(module));
  if (!object) {
    SetLastError(ERROR_MOD_NOT_FOUND);
    return FALSE;
  }
  HANDLE release = nullptr;
  {
    std::lock_guard<std::mutex> lock(modulesMutex);
    LoadedModule& loaded = LoadedModules()[object->name];
    if (loaded.loads > 0 && --loaded.loads == 0) {
      release = loaded.handle;
      loaded.handle = nullptr;
    }
  }
  if (release != nullptr) emu::ReleaseHandle(release);
  SetLastError(ERROR_SUCCESS);
  return TRUE;
}
