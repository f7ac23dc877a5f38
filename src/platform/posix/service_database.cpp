// The service database of the emulated manager: installed services live in
// the registry store under HKLM\SYSTEM\CurrentControlSet\Services\<name>
// (values Type, Start, ErrorControl, ImagePath, DisplayName, ObjectName and
// Description, as Windows keeps them), so an install in one process is seen
// by every other. Manager and service handles are checked handles.
//
// Differences from Windows, because the host cannot launch a service
// process: StartServiceW fails with ERROR_NOT_SUPPORTED for a service that
// could otherwise start, and DeleteService removes the entry at once.
// ControlService and QueryServiceStatus reach a service only when it runs in
// this process's manager session (emu_scm.h); any other is stopped.
#include <cstring>
#include <memory>

#include "platform/posix/handle_table.h"
#include "platform/posix/registry_store.h"
#include "platform/posix/service_session.h"
#include "platform/posix/win32_service.h"

namespace emu::scm {
namespace {

using registry::Store;
using registry::Text;
using registry::TextView;

constexpr TextView kServicesKey = u"HKEY_LOCAL_MACHINE\\SYSTEM\\CurrentControlSet\\Services";

class ScObject : public KernelObject {
 public:
  ScObject(bool isManager, DWORD grantedAccess, Text serviceName)
      : manager(isManager), access(grantedAccess), name(std::move(serviceName)) {}
  bool ClosableByCloseHandle() const override { return false; }
  const bool manager;
  const DWORD access;
  const Text name;  // service name as installed (services only)
};

// Generic rights mapped to service rights, as the manager maps them.
DWORD MapServiceAccess(DWORD desired) {
  DWORD access = desired & ~(GENERIC_READ | GENERIC_WRITE | GENERIC_EXECUTE | GENERIC_ALL);
  if ((desired & GENERIC_READ) != 0) {
    access |= READ_CONTROL | SERVICE_QUERY_CONFIG | SERVICE_QUERY_STATUS | SERVICE_INTERROGATE |
              SERVICE_ENUMERATE_DEPENDENTS;
  }
  if ((desired & GENERIC_WRITE) != 0) access |= READ_CONTROL | SERVICE_CHANGE_CONFIG;
  if ((desired & GENERIC_EXECUTE) != 0) {
    access |= READ_CONTROL | SERVICE_START | SERVICE_STOP | SERVICE_PAUSE_CONTINUE |
              SERVICE_USER_DEFINED_CONTROL;
  }
  if ((desired & GENERIC_ALL) != 0) access |= SERVICE_ALL_ACCESS;
  return access;
}

SC_HANDLE NewHandle(bool manager, DWORD access, Text name) {
  if (!manager) access = MapServiceAccess(access);
  return static_cast<SC_HANDLE>(
      AllocateHandle(std::make_shared<ScObject>(manager, access, std::move(name))));
}

// The object behind `handle` if it is of the wanted kind and grants `needed`;
// otherwise sets the last error and returns null.
std::shared_ptr<ScObject> Check(SC_HANDLE handle, bool manager, DWORD needed) {
  auto object = LookupHandleAs<ScObject>(handle);
  if (object == nullptr || object->manager != manager) {
    SetLastError(ERROR_INVALID_HANDLE);
    return nullptr;
  }
  if ((object->access & needed) != needed) {
    SetLastError(ERROR_ACCESS_DENIED);
    return nullptr;
  }
  return object;
}

Text ServicePath(TextView name) {
  return Text(kServicesKey) + u'\\' + Text(name);
}

// A key under Services is an installed service when it has a Type value.
registry::Key* FindService(Store& store, TextView name) {
  registry::Key* key = store.Find(ServicePath(name));
  if (key == nullptr || store.FindValue(*key, u"Type") == nullptr) return nullptr;
  return key;
}

void SetValue(Store& store, registry::Key& key, TextView name, DWORD type, const void* data,
              std::size_t size) {
  registry::Value* value = store.FindValue(key, name);
  if (value == nullptr) {
    key.values.push_back(registry::Value{Text(name), type, {}});
    value = &key.values.back();
  }
  value->type = type;
  const auto* bytes = static_cast<const BYTE*>(data);
  value->data.assign(bytes, bytes + size);
}

void SetDword(Store& store, registry::Key& key, TextView name, DWORD data) {
  BYTE bytes[4] = {static_cast<BYTE>(data), static_cast<BYTE>(data >> 8),
                   static_cast<BYTE>(data >> 16), static_cast<BYTE>(data >> 24)};
  SetValue(store, key, name, REG_DWORD, bytes, sizeof bytes);
}

void SetText(Store& store, registry::Key& key, TextView name, DWORD type, TextView text) {
  Text terminated(text);
  terminated += u'\0';
  SetValue(store, key, name, type, terminated.data(), terminated.size() * sizeof(char16_t));
}

DWORD GetDword(Store& store, registry::Key& key, TextView name, DWORD fallback) {
  registry::Value* value = store.FindValue(key, name);
  if (value == nullptr || value->data.size() != 4) return fallback;
  return static_cast<DWORD>(value->data[0]) | (static_cast<DWORD>(value->data[1]) << 8) |
         (static_cast<DWORD>(value->data[2]) << 16) | (static_cast<DWORD>(value->data[3]) << 24);
}

bool ValidServiceName(LPCWSTR name) {
  if (name == nullptr || name[0] == 0) return false;
  for (LPCWSTR p = name; *p != 0; ++p) {
    if (*p == u'\\' || *p == u'/') return false;
  }
  return true;
}

// Length of a list of strings ended by an empty one, in units, both
// terminators included (0 for a null or empty list).
std::size_t MultiStringUnits(LPCWSTR list) {
  if (list == nullptr || list[0] == 0) return 0;
  std::size_t i = 0;
  while (list[i] != 0 || list[i + 1] != 0) ++i;
  return i + 2;
}

}  // namespace
}  // namespace emu::scm

using namespace emu::scm;

SC_HANDLE OpenSCManagerW(LPCWSTR machineName, LPCWSTR databaseName, DWORD desiredAccess) {
  if (machineName != nullptr && machineName[0] != 0) {
    SetLastError(ERROR_INVALID_NAME);  // only the local machine is known here
    return nullptr;
  }
  if (databaseName != nullptr &&
      !emu::registry::EqualNoCase(databaseName, SERVICES_ACTIVE_DATABASEW)) {
    SetLastError(ERROR_INVALID_NAME);
    return nullptr;
  }
  // The local system account gets every right it asks for.
  DWORD access = desiredAccess | SC_MANAGER_CONNECT;
  if ((desiredAccess & GENERIC_ALL) != 0) access |= SC_MANAGER_ALL_ACCESS;
  return NewHandle(true, access, Text());
}

SC_HANDLE CreateServiceW(SC_HANDLE manager, LPCWSTR serviceName, LPCWSTR displayName,
                         DWORD desiredAccess, DWORD serviceType, DWORD startType,
                         DWORD errorControl, LPCWSTR binaryPathName, LPCWSTR loadOrderGroup,
                         LPDWORD tagId, LPCWSTR dependencies, LPCWSTR serviceStartName,
                         LPCWSTR password) {
  (void)password;
  if (Check(manager, true, SC_MANAGER_CREATE_SERVICE) == nullptr) return nullptr;
  if (!ValidServiceName(serviceName)) {
    SetLastError(ERROR_INVALID_NAME);
    return nullptr;
  }
  DWORD baseType = serviceType & ~SERVICE_INTERACTIVE_PROCESS;
  bool validType = baseType == SERVICE_WIN32_OWN_PROCESS ||
                   baseType == SERVICE_WIN32_SHARE_PROCESS || baseType == SERVICE_KERNEL_DRIVER ||
                   baseType == SERVICE_FILE_SYSTEM_DRIVER;
  if (!validType || startType > SERVICE_DISABLED || errorControl > SERVICE_ERROR_CRITICAL ||
      binaryPathName == nullptr || binaryPathName[0] == 0 || tagId != nullptr) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return nullptr;
  }
  Text name(serviceName);
  bool exists = false;
  DWORD storeError = emu::registry::Transact([&](Store& store) {
    if (FindService(store, name) != nullptr) {
      exists = true;
      return false;
    }
    emu::registry::Key& key = store.Create(ServicePath(name));
    SetDword(store, key, u"Type", serviceType);
    SetDword(store, key, u"Start", startType);
    SetDword(store, key, u"ErrorControl", errorControl);
    SetText(store, key, u"ImagePath", REG_EXPAND_SZ, binaryPathName);
    SetText(store, key, u"DisplayName", REG_SZ,
            displayName != nullptr && displayName[0] != 0 ? TextView(displayName) : TextView(name));
    SetText(store, key, u"ObjectName", REG_SZ,
            serviceStartName != nullptr ? TextView(serviceStartName) : TextView(u"LocalSystem"));
    if (loadOrderGroup != nullptr && loadOrderGroup[0] != 0) {
      SetText(store, key, u"Group", REG_SZ, loadOrderGroup);
    }
    if (std::size_t units = MultiStringUnits(dependencies); units != 0) {
      SetValue(store, key, u"DependOnService", REG_MULTI_SZ, dependencies, units * sizeof(WCHAR));
    }
    return true;
  });
  if (storeError != ERROR_SUCCESS) {
    SetLastError(storeError);
    return nullptr;
  }
  if (exists) {
    SetLastError(ERROR_SERVICE_EXISTS);
    return nullptr;
  }
  return NewHandle(false, desiredAccess, name);
}

SC_HANDLE OpenServiceW(SC_HANDLE manager, LPCWSTR serviceName, DWORD desiredAccess) {
  if (Check(manager, true, SC_MANAGER_CONNECT) == nullptr) return nullptr;
  if (serviceName == nullptr) {
    SetLastError(ERROR_INVALID_ADDRESS);
    return nullptr;
  }
  Text name;
  DWORD storeError = emu::registry::Transact([&](Store& store) {
    if (emu::registry::Key* key = FindService(store, serviceName)) {
      name = key->path.substr(key->path.rfind(u'\\') + 1);
    }
    return false;
  });
  if (storeError != ERROR_SUCCESS) {
    SetLastError(storeError);
    return nullptr;
  }
  if (name.empty()) {
    SetLastError(ERROR_SERVICE_DOES_NOT_EXIST);
    return nullptr;
  }
  return NewHandle(false, desiredAccess, name);
}

BOOL ChangeServiceConfig2W(SC_HANDLE service, DWORD infoLevel, LPVOID info) {
  auto object = Check(service, false, SERVICE_CHANGE_CONFIG);
  if (object == nullptr) return FALSE;
  if (infoLevel == SERVICE_CONFIG_FAILURE_ACTIONS) {
    SetLastError(ERROR_NOT_SUPPORTED);
    return FALSE;
  }
  if (infoLevel != SERVICE_CONFIG_DESCRIPTION || info == nullptr) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return FALSE;
  }
  LPCWSTR description = static_cast<SERVICE_DESCRIPTIONW*>(info)->lpDescription;
  bool deleted = false;
  DWORD storeError = emu::registry::Transact([&](Store& store) {
    emu::registry::Key* key = FindService(store, object->name);
    if (key == nullptr) {
      deleted = true;
      return false;
    }
    if (description == nullptr) return false;  // no change
    if (description[0] == 0) {
      std::erase_if(key->values, [](const emu::registry::Value& v) {
        return emu::registry::EqualNoCase(v.name, u"Description");
      });
    } else {
      SetText(store, *key, u"Description", REG_SZ, description);
    }
    return true;
  });
  if (storeError != ERROR_SUCCESS || deleted) {
    SetLastError(deleted ? ERROR_SERVICE_MARKED_FOR_DELETE : storeError);
    return FALSE;
  }
  return TRUE;
}

BOOL StartServiceW(SC_HANDLE service, DWORD argumentCount, LPCWSTR* arguments) {
  (void)argumentCount;
  (void)arguments;
  auto object = Check(service, false, SERVICE_START);
  if (object == nullptr) return FALSE;
  bool deleted = false;
  DWORD startType = SERVICE_DEMAND_START;
  DWORD storeError = emu::registry::Transact([&](Store& store) {
    emu::registry::Key* key = FindService(store, object->name);
    if (key == nullptr) {
      deleted = true;
    } else {
      startType = GetDword(store, *key, u"Start", SERVICE_DEMAND_START);
    }
    return false;
  });
  DWORD error = ERROR_NOT_SUPPORTED;
  if (storeError != ERROR_SUCCESS) {
    error = storeError;
  } else if (deleted) {
    error = ERROR_SERVICE_MARKED_FOR_DELETE;
  } else if (FindRunningService(object->name).running) {
    error = ERROR_SERVICE_ALREADY_RUNNING;
  } else if (startType == SERVICE_DISABLED) {
    error = ERROR_SERVICE_DISABLED;
  }
  SetLastError(error);
  return FALSE;
}

BOOL ControlService(SC_HANDLE service, DWORD control, LPSERVICE_STATUS status) {
  DWORD needed = SERVICE_USER_DEFINED_CONTROL;
  if (control == SERVICE_CONTROL_STOP) needed = SERVICE_STOP;
  if (control == SERVICE_CONTROL_INTERROGATE) needed = SERVICE_INTERROGATE;
  if (control == SERVICE_CONTROL_PAUSE || control == SERVICE_CONTROL_CONTINUE ||
      (control >= SERVICE_CONTROL_PARAMCHANGE && control <= SERVICE_CONTROL_NETBINDDISABLE)) {
    needed = SERVICE_PAUSE_CONTINUE;
  }
  if (status == nullptr) {
    SetLastError(ERROR_INVALID_ADDRESS);
    return FALSE;
  }
  auto object = Check(service, false, needed);
  if (object == nullptr) return FALSE;
  // Controls reserved to the system (device events, power, ...) cannot be sent.
  if (control == 0 || (control > SERVICE_CONTROL_NETBINDDISABLE && control < 128) ||
      control > 255) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return FALSE;
  }
  RunningService running = FindRunningService(object->name);
  if (!running.running) {
    std::memset(status, 0, sizeof *status);
    status->dwServiceType = SERVICE_WIN32_OWN_PROCESS;
    status->dwCurrentState = SERVICE_STOPPED;
    SetLastError(ERROR_SERVICE_NOT_ACTIVE);
    return FALSE;
  }
  *status = running.status;
  DWORD state = running.status.dwCurrentState;
  if (state == SERVICE_START_PENDING || state == SERVICE_STOP_PENDING) {
    SetLastError(ERROR_SERVICE_CANNOT_ACCEPT_CTRL);
    return FALSE;
  }
  DWORD accepted = running.status.dwControlsAccepted;
  bool acceptable =
      control == SERVICE_CONTROL_INTERROGATE || control >= 128 ||
      (control == SERVICE_CONTROL_STOP && (accepted & SERVICE_ACCEPT_STOP) != 0) ||
      ((control == SERVICE_CONTROL_PAUSE || control == SERVICE_CONTROL_CONTINUE) &&
       (accepted & SERVICE_ACCEPT_PAUSE_CONTINUE) != 0) ||
      (control == SERVICE_CONTROL_PARAMCHANGE && (accepted & SERVICE_ACCEPT_PARAMCHANGE) != 0) ||
      (control >= SERVICE_CONTROL_NETBINDADD && control <= SERVICE_CONTROL_NETBINDDISABLE &&
       (accepted & SERVICE_ACCEPT_NETBINDCHANGE) != 0);
  if (!acceptable) {
    SetLastError(ERROR_INVALID_SERVICE_CONTROL);
    return FALSE;
  }
  if (!ControlRunningService(object->name, control).delivered) {
    SetLastError(ERROR_SERVICE_REQUEST_TIMEOUT);
    return FALSE;
  }
  RunningService after = FindRunningService(object->name);
  if (after.running) {
    *status = after.status;
  } else {
    // It reported stopped while handling the control.
    auto reports = emu::ServiceStatusReports();
    if (!reports.empty()) *status = reports.back();
  }
  return TRUE;
}

BOOL QueryServiceStatus(SC_HANDLE service, LPSERVICE_STATUS status) {
  if (status == nullptr) {
    SetLastError(ERROR_INVALID_ADDRESS);
    return FALSE;
  }
  auto object = Check(service, false, SERVICE_QUERY_STATUS);
  if (object == nullptr) return FALSE;
  RunningService running = FindRunningService(object->name);
  if (running.running && running.status.dwCurrentState != 0) {
    *status = running.status;
    return TRUE;
  }
  DWORD type = SERVICE_WIN32_OWN_PROCESS;
  emu::registry::Transact([&](Store& store) {
    if (emu::registry::Key* key = FindService(store, object->name)) {
      type = GetDword(store, *key, u"Type", type);
    }
    return false;
  });
  std::memset(status, 0, sizeof *status);
  status->dwServiceType = type;
  status->dwCurrentState = running.running ? SERVICE_START_PENDING : SERVICE_STOPPED;
  return TRUE;
}

BOOL DeleteService(SC_HANDLE service) {
  auto object = Check(service, false, DELETE);
  if (object == nullptr) return FALSE;
  bool found = false;
  DWORD storeError = emu::registry::Transact([&](Store& store) {
    if (FindService(store, object->name) == nullptr) return false;
    found = true;
    store.EraseTree(ServicePath(object->name));
    return true;
  });
  if (storeError != ERROR_SUCCESS) {
    SetLastError(storeError);
    return FALSE;
  }
  if (!found) {
    SetLastError(ERROR_SERVICE_MARKED_FOR_DELETE);
    return FALSE;
  }
  return TRUE;
}

BOOL CloseServiceHandle(SC_HANDLE handle) {
  if (emu::LookupHandleAs<ScObject>(handle) == nullptr || !emu::ReleaseHandle(handle)) {
    SetLastError(ERROR_INVALID_HANDLE);
    return FALSE;
  }
  return TRUE;
}
