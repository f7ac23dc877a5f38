#include "pipe/registry_access.h"

#include <cstdint>
#include <cstring>

#include "pipe/command_message.h"

namespace {

// The longest text a message can carry after the fixed part of the request,
// in UTF-16 units, plus its terminator.
constexpr std::size_t kTextCapacity =
    (kCommandMaxLength - kRegistryRequestOffset - kRegistryPathOffset) / 2 + 1;

// Only the predefined roots are accepted: any other number would name a
// handle of the service itself. A 64-bit client sends a root sign-extended
// (0xFFFFFFFF80000002), a 32-bit one zero-extended (0x80000002); both name
// the same root.
bool PredefinedRoot(std::uint64_t value, HKEY* root) {
  const HKEY roots[] = {HKEY_CLASSES_ROOT, HKEY_CURRENT_USER, HKEY_LOCAL_MACHINE, HKEY_USERS,
                        HKEY_CURRENT_CONFIG};
  for (HKEY candidate : roots) {
    const auto signExtended =
        static_cast<std::uint64_t>(reinterpret_cast<std::uintptr_t>(candidate));
    if (value == signExtended || value == (signExtended & 0xFFFFFFFFu)) {
      *root = candidate;
      return true;
    }
  }
  return false;
}

// Copies the UTF-16 text that starts `offset` bytes into area[0, size) to
// `text`, which then is aligned and terminated. False unless the terminator
// lies inside the area (and the text fits, which it always does for a text
// from one message).
bool CopyTerminatedText(const BYTE* area, std::size_t size, std::uint64_t offset, WCHAR* text) {
  if (offset > size) return false;
  std::size_t at = static_cast<std::size_t>(offset);
  for (std::size_t units = 0; units < kTextCapacity && size - at >= sizeof(WCHAR); ++units) {
    std::memcpy(&text[units], area + at, sizeof(WCHAR));
    if (text[units] == 0) return true;
    at += sizeof(WCHAR);
  }
  return false;
}

}  // namespace

DWORD RunRegistryRequest(BYTE* request, std::size_t available) {
  RegistryRequest fields;
  if (available < kRegistryPathOffset) return ERROR_INVALID_PARAMETER;
  std::memcpy(&fields, request, sizeof(fields));

  HKEY root = nullptr;
  if (!PredefinedRoot(fields.rootKey, &root)) return ERROR_INVALID_PARAMETER;

  // Everything below is measured from the start of the subkey path.
  BYTE* texts = request + kRegistryPathOffset;
  const std::size_t size = available - kRegistryPathOffset;
  WCHAR path[kTextCapacity];
  WCHAR name[kTextCapacity];
  if (!CopyTerminatedText(texts, size, 0, path)) return ERROR_INVALID_PARAMETER;
  if (!CopyTerminatedText(texts, size, fields.nameOffset, name)) return ERROR_INVALID_PARAMETER;
  // nameOffset <= size holds now; the data area must fit in what follows it.
  const std::uint64_t afterName = size - fields.nameOffset;
  if (fields.dataOffset > afterName || fields.dataLength > afterName - fields.dataOffset) {
    return ERROR_INVALID_PARAMETER;
  }
  BYTE* data = texts + fields.nameOffset + fields.dataOffset;

  HKEY key = nullptr;
  LONG status = RegOpenKeyExW(root, path, 0, KEY_ALL_ACCESS, &key);
  if (status != ERROR_SUCCESS) return static_cast<DWORD>(status);

  if (fields.operation == kRegistryQuery) {
    DWORD type = fields.valueType;
    DWORD length = fields.dataLength;
    status = RegQueryValueExW(key, name, nullptr, &type, data, &length);
    fields.valueType = type;
    fields.dataLength = length;
    fields.dataLengthHigh = 0;
    std::memcpy(request + offsetof(RegistryRequest, dataLength), &fields.dataLength, sizeof(DWORD));
    std::memcpy(request + offsetof(RegistryRequest, dataLengthHigh), &fields.dataLengthHigh,
                sizeof(DWORD));
    std::memcpy(request + offsetof(RegistryRequest, valueType), &fields.valueType, sizeof(DWORD));
  } else if (fields.operation == kRegistrySet) {
    status = RegSetValueExW(key, name, 0, fields.valueType, data, fields.dataLength);
  } else {
    status = ERROR_SUCCESS;
  }
  RegCloseKey(key);
  return static_cast<DWORD>(status);
}
