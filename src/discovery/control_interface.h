// The search for a drive's control interface by its serial key.
#pragma once

#include <cstddef>

#include "platform/win32.h"

// Finds the interface of interfaceClass that belongs to the drive with the
// given serial key and copies its path into path[capacity]. An HID interface
// belongs to the drive when its grandparent's instance ID (the composite USB
// device) contains the key; any other when its path names the maker's drive,
// the key and a USB or SBP-2 storage bus. 0 when found, -1 otherwise (an
// empty key matches nothing).
LONG FindControlInterfacePath(const GUID& interfaceClass, const WCHAR* key, WCHAR* path,
                              std::size_t capacity);
