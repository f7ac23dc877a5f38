#include "service/interface_classes.h"

bool GetHidClassGuid(GUID* hidClass) {
  *hidClass = GUID{};
  HMODULE library = LoadLibraryW(WSTR("hid.dll"));
  if (library == nullptr) return false;
  using GetHidGuidFunction = void(WINAPI*)(LPGUID);
  const auto function = reinterpret_cast<GetHidGuidFunction>(
      reinterpret_cast<void (*)()>(GetProcAddress(library, "HidD_GetHidGuid")));
  if (function != nullptr) function(hidClass);
  FreeLibrary(library);
  return function != nullptr;
}
