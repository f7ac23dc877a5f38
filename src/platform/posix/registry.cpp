// Reg* calls over the registry store. An open key is a checked handle that
// remembers the key's path and the access granted; every call re-reads the
// store, so a key deleted meanwhile (by any process) gives ERROR_KEY_DELETED.
// Like Windows, these calls return their error and leave the last error alone.
#include <cstring>
#include <memory>

#include "platform/posix/emu_scm.h"
#include "platform/posix/handle_table.h"
#include "platform/posix/registry_store.h"
#include "platform/posix/win32_registry.h"

namespace emu::registry {
namespace {

constexpr REGSAM kWriteRights =
    KEY_SET_VALUE | KEY_CREATE_SUB_KEY | KEY_CREATE_LINK | DELETE | WRITE_DAC | WRITE_OWNER;
constexpr REGSAM kAllRights = KEY_ALL_ACCESS;

class KeyObject : public KernelObject {
 public:
  KeyObject(Text keyPath, REGSAM keyAccess) : path(std::move(keyPath)), access(keyAccess) {}
  bool ClosableByCloseHandle() const override { return false; }
  const Text path;
  const REGSAM access;
};

// Generic rights mapped to key rights; the WOW64 view flags do not apply.
REGSAM MapAccess(REGSAM desired) {
  REGSAM mapped = desired & ~(KEY_WOW64_32KEY | KEY_WOW64_64KEY | GENERIC_READ | GENERIC_WRITE |
                              GENERIC_EXECUTE | GENERIC_ALL);
  if ((desired & GENERIC_READ) != 0) mapped |= KEY_READ;
  if ((desired & GENERIC_WRITE) != 0) mapped |= KEY_WRITE;
  if ((desired & GENERIC_EXECUTE) != 0) mapped |= KEY_EXECUTE;
  if ((desired & GENERIC_ALL) != 0) mapped |= KEY_ALL_ACCESS;
  return mapped;
}

struct Resolved {
  LSTATUS error = ERROR_SUCCESS;
  Text path;
  REGSAM access = 0;
};

Resolved Resolve(HKEY key) {
  Resolved resolved;
  TextView root = RootName(key);
  if (!root.empty()) {
    resolved.path = Text(root);
    resolved.access = kAllRights;
    return resolved;
  }
  auto object = LookupHandleAs<KeyObject>(key);
  if (object == nullptr) {
    resolved.error = ERROR_INVALID_HANDLE;
    return resolved;
  }
  resolved.path = object->path;
  resolved.access = object->access;
  return resolved;
}

HKEY NewKeyHandle(const Text& path, REGSAM access) {
  return static_cast<HKEY>(AllocateHandle(std::make_shared<KeyObject>(path, access)));
}

// Runs `body` on the key behind `key` (which must grant `needed`); the
// store is written back when `body` returns true.
template <class Body>
LSTATUS WithKey(HKEY key, REGSAM needed, Body body) {
  Resolved resolved = Resolve(key);
  if (resolved.error != ERROR_SUCCESS) return resolved.error;
  if ((resolved.access & needed) != needed) return ERROR_ACCESS_DENIED;
  LSTATUS result = ERROR_SUCCESS;
  DWORD storeError = Transact([&](Store& store) {
    Key* found = store.Find(resolved.path);
    if (found == nullptr) {
      result = ERROR_KEY_DELETED;
      return false;
    }
    if ((needed & kWriteRights) != 0 && found->readOnly) {
      result = ERROR_ACCESS_DENIED;
      return false;
    }
    bool changed = false;
    result = body(store, *found, changed);
    return changed;
  });
  return storeError != ERROR_SUCCESS ? static_cast<LSTATUS>(storeError) : result;
}

TextView NameOf(const WCHAR* name) {
  return name == nullptr ? TextView() : TextView(name);
}

// Copies a value's data the way RegQueryValueExW and RegEnumValueW report it.
LSTATUS ReportData(const Value& value, LPDWORD type, LPBYTE data, LPDWORD dataSize) {
  if (type != nullptr) *type = value.type;
  auto size = static_cast<DWORD>(value.data.size());
  if (data == nullptr) {
    if (dataSize != nullptr) *dataSize = size;
    return ERROR_SUCCESS;
  }
  DWORD capacity = *dataSize;
  *dataSize = size;
  if (capacity < size) return ERROR_MORE_DATA;
  if (size != 0) std::memcpy(data, value.data.data(), size);
  return ERROR_SUCCESS;
}

}  // namespace
}  // namespace emu::registry

using namespace emu::registry;

LSTATUS RegOpenKeyExW(HKEY key, LPCWSTR subKey, DWORD options, REGSAM desired, PHKEY result) {
  (void)options;
  if (result == nullptr) return ERROR_INVALID_PARAMETER;
  *result = nullptr;
  Resolved base = Resolve(key);
  if (base.error != ERROR_SUCCESS) return base.error;
  Text path;
  if (!JoinPath(base.path, subKey, path)) return ERROR_BAD_PATHNAME;
  REGSAM access = MapAccess(desired);
  LSTATUS status = ERROR_SUCCESS;
  DWORD storeError = Transact([&](Store& store) {
    Key* found = store.Find(path);
    if (found == nullptr) {
      status = ERROR_FILE_NOT_FOUND;
    } else if (found->readOnly && (access & kWriteRights) != 0) {
      status = ERROR_ACCESS_DENIED;
    } else {
      path = found->path;
    }
    return false;
  });
  if (storeError != ERROR_SUCCESS) return static_cast<LSTATUS>(storeError);
  if (status == ERROR_SUCCESS) *result = NewKeyHandle(path, access);
  return status;
}

LSTATUS RegCreateKeyExW(HKEY key, LPCWSTR subKey, DWORD reserved, LPWSTR keyClass, DWORD options,
                        REGSAM desired, const SECURITY_ATTRIBUTES* security, PHKEY result,
                        LPDWORD disposition) {
  (void)reserved;
  (void)keyClass;
  (void)security;
  if (result == nullptr) return ERROR_INVALID_PARAMETER;
  *result = nullptr;
  if ((options & REG_OPTION_CREATE_LINK) != 0) return ERROR_INVALID_PARAMETER;
  Resolved base = Resolve(key);
  if (base.error != ERROR_SUCCESS) return base.error;
  Text path;
  if (!JoinPath(base.path, subKey, path)) return ERROR_BAD_PATHNAME;
  REGSAM access = MapAccess(desired);
  LSTATUS status = ERROR_SUCCESS;
  DWORD outcome = REG_OPENED_EXISTING_KEY;
  DWORD storeError = Transact([&](Store& store) {
    if (store.Find(base.path) == nullptr) {
      status = ERROR_KEY_DELETED;
      return false;
    }
    if (Key* found = store.Find(path)) {
      if (found->readOnly && (access & kWriteRights) != 0) {
        status = ERROR_ACCESS_DENIED;
      } else {
        path = found->path;
      }
      return false;
    }
    // A new key: the base handle must allow creating sub-keys, and the
    // nearest existing key above the new one must not be read-only.
    Text ancestor = path;
    Key* nearest = nullptr;
    while (nearest == nullptr) {
      ancestor.resize(ancestor.rfind(u'\\'));
      nearest = store.Find(ancestor);
    }
    if ((base.access & KEY_CREATE_SUB_KEY) == 0 || nearest->readOnly) {
      status = ERROR_ACCESS_DENIED;
      return false;
    }
    // Keep the existing spelling of the keys above, the caller's below.
    Text spelled = nearest->path + path.substr(ancestor.size());
    path = store.Create(spelled).path;
    outcome = REG_CREATED_NEW_KEY;
    return true;
  });
  if (storeError != ERROR_SUCCESS) return static_cast<LSTATUS>(storeError);
  if (status != ERROR_SUCCESS) return status;
  *result = NewKeyHandle(path, access);
  if (disposition != nullptr) *disposition = outcome;
  return ERROR_SUCCESS;
}

LSTATUS RegCloseKey(HKEY key) {
  if (!RootName(key).empty()) return ERROR_SUCCESS;
  if (emu::LookupHandleAs<KeyObject>(key) == nullptr) return ERROR_INVALID_HANDLE;
  return emu::ReleaseHandle(key) ? ERROR_SUCCESS : ERROR_INVALID_HANDLE;
}

LSTATUS RegQueryValueExW(HKEY key, LPCWSTR valueName, LPDWORD reserved, LPDWORD type, LPBYTE data,
                         LPDWORD dataSize) {
  if (reserved != nullptr) return ERROR_INVALID_PARAMETER;
  if (data != nullptr && dataSize == nullptr) return ERROR_INVALID_PARAMETER;
  return WithKey(key, KEY_QUERY_VALUE, [&](Store& store, Key& found, bool&) -> LSTATUS {
    Value* value = store.FindValue(found, NameOf(valueName));
    if (value == nullptr) return ERROR_FILE_NOT_FOUND;
    return ReportData(*value, type, data, dataSize);
  });
}

LSTATUS RegSetValueExW(HKEY key, LPCWSTR valueName, DWORD reserved, DWORD type, const BYTE* data,
                       DWORD dataSize) {
  (void)reserved;
  if (data == nullptr && dataSize != 0) return ERROR_NOACCESS;
  return WithKey(key, KEY_SET_VALUE, [&](Store& store, Key& found, bool& changed) -> LSTATUS {
    Value* value = store.FindValue(found, NameOf(valueName));
    if (value == nullptr) {
      found.values.push_back(Value{Text(NameOf(valueName)), type, {}});
      value = &found.values.back();
    }
    value->type = type;
    value->data.assign(data, data + dataSize);
    changed = true;
    return ERROR_SUCCESS;
  });
}

LSTATUS RegDeleteValueW(HKEY key, LPCWSTR valueName) {
  return WithKey(key, KEY_SET_VALUE, [&](Store&, Key& found, bool& changed) -> LSTATUS {
    TextView name = NameOf(valueName);
    for (auto it = found.values.begin(); it != found.values.end(); ++it) {
      if (EqualNoCase(it->name, name)) {
        found.values.erase(it);
        changed = true;
        return ERROR_SUCCESS;
      }
    }
    return ERROR_FILE_NOT_FOUND;
  });
}

LSTATUS RegDeleteKeyW(HKEY key, LPCWSTR subKey) {
  if (subKey == nullptr) return ERROR_INVALID_PARAMETER;
  Resolved base = Resolve(key);
  if (base.error != ERROR_SUCCESS) return base.error;
  Text path;
  if (!JoinPath(base.path, subKey, path)) return ERROR_BAD_PATHNAME;
  // A root cannot be deleted, nor the key the handle itself names.
  if (path == base.path) return ERROR_ACCESS_DENIED;
  LSTATUS status = ERROR_SUCCESS;
  DWORD storeError = Transact([&](Store& store) {
    Key* found = store.Find(path);
    if (found == nullptr) {
      status = ERROR_FILE_NOT_FOUND;
      return false;
    }
    if (found->readOnly || store.HasSubKeys(path)) {
      status = ERROR_ACCESS_DENIED;
      return false;
    }
    store.EraseTree(path);
    return true;
  });
  return storeError != ERROR_SUCCESS ? static_cast<LSTATUS>(storeError) : status;
}

LSTATUS RegEnumKeyExW(HKEY key, DWORD index, LPWSTR name, LPDWORD nameLength, LPDWORD reserved,
                      LPWSTR keyClass, LPDWORD classLength, PFILETIME lastWriteTime) {
  if (reserved != nullptr || name == nullptr || nameLength == nullptr) {
    return ERROR_INVALID_PARAMETER;
  }
  return WithKey(key, KEY_ENUMERATE_SUB_KEYS, [&](Store& store, Key& found, bool&) -> LSTATUS {
    std::vector<Text> names = store.SubKeyNames(found.path);
    if (index >= names.size()) return ERROR_NO_MORE_ITEMS;
    const Text& entry = names[index];
    if (*nameLength <= entry.size()) return ERROR_MORE_DATA;
    std::memcpy(name, entry.data(), entry.size() * sizeof(WCHAR));
    name[entry.size()] = 0;
    *nameLength = static_cast<DWORD>(entry.size());
    if (keyClass != nullptr && classLength != nullptr && *classLength > 0) keyClass[0] = 0;
    if (classLength != nullptr) *classLength = 0;
    if (lastWriteTime != nullptr) *lastWriteTime = FILETIME{0, 0};
    return ERROR_SUCCESS;
  });
}

LSTATUS RegEnumValueW(HKEY key, DWORD index, LPWSTR valueName, LPDWORD valueNameLength,
                      LPDWORD reserved, LPDWORD type, LPBYTE data, LPDWORD dataSize) {
  if (reserved != nullptr || valueName == nullptr || valueNameLength == nullptr ||
      (data != nullptr && dataSize == nullptr)) {
    return ERROR_INVALID_PARAMETER;
  }
  return WithKey(key, KEY_QUERY_VALUE, [&](Store&, Key& found, bool&) -> LSTATUS {
    if (index >= found.values.size()) return ERROR_NO_MORE_ITEMS;
    const Value& value = found.values[index];
    if (*valueNameLength <= value.name.size()) return ERROR_MORE_DATA;
    std::memcpy(valueName, value.name.data(), value.name.size() * sizeof(WCHAR));
    valueName[value.name.size()] = 0;
    *valueNameLength = static_cast<DWORD>(value.name.size());
    return ReportData(value, type, data, dataSize);
  });
}

namespace emu {

LSTATUS SetRegistryKeyReadOnly(HKEY root, const WCHAR* subKey, bool readOnly) {
  Resolved base = Resolve(root);
  if (base.error != ERROR_SUCCESS) return base.error;
  Text path;
  if (!JoinPath(base.path, subKey, path)) return ERROR_BAD_PATHNAME;
  LSTATUS status = ERROR_SUCCESS;
  DWORD storeError = Transact([&](Store& store) {
    Key* found = store.Find(path);
    if (found == nullptr) {
      status = ERROR_FILE_NOT_FOUND;
      return false;
    }
    found->readOnly = readOnly;
    return true;
  });
  return storeError != ERROR_SUCCESS ? static_cast<LSTATUS>(storeError) : status;
}

std::string RegistryStorePath() {
  return StorePath();
}

}  // namespace emu
