// The service's one door to the operating system.
//
// On Windows this is the SDK itself. Elsewhere it declares the same subset of
// Win32 types, constants and functions, implemented by src/platform/posix on
// top of POSIX and the simulated computer. Service code includes only this
// header (and the portable helpers beside it) and calls Win32 as written.
#pragma once

#if defined(_WIN32)
#ifndef WIN32_LEAN_AND_MEAN
#define WIN32_LEAN_AND_MEAN
#endif
#ifndef NOMINMAX
#define NOMINMAX
#endif
// clang-format off
#include <windows.h>
#include <winioctl.h>
#include <ntddscsi.h>
#include <hidclass.h>
#include <setupapi.h>
#include <cfgmgr32.h>
extern "C" {
#include <hidsdi.h>  // declared without C linkage by mingw-w64
}
#include <dbt.h>
#include <shellapi.h>
// clang-format on

// UTF-16 literal: L"..." on Windows, where WCHAR is wchar_t.
#define WSTR(text) L##text

#else
// clang-format off
#include "platform/posix/win32_base.h"
#include "platform/posix/win32_sync.h"
#include "platform/posix/win32_io.h"
#include "platform/posix/win32_registry.h"
#include "platform/posix/win32_service.h"
#include "platform/posix/win32_devices.h"
// clang-format on

// UTF-16 literal: u"..." here, where WCHAR is char16_t.
#define WSTR(text) u##text
#endif

static_assert(sizeof(WCHAR) == 2, "WCHAR must be a 16-bit code unit on every platform");
static_assert(sizeof(void*) == 8, "the 64-bit record layout is the one built");
