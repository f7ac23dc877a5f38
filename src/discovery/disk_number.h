// The disk number a drive record carries when the storage stack's
// device-number query fails: a value no volume reports, so that no volume
// letter is ever tied to such a drive.
#pragma once

#include "platform/win32.h"

constexpr DWORD kUnknownDiskNumber = 0xFFFFFFFF;
