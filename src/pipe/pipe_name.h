// Name of the pipe on which the service takes the user-interface
// application's requests.
#pragma once

#include "platform/win32.h"

#define SKYVANE_PIPE_NAME WSTR("\\\\.\\pipe\\QxSvcPipe")
inline constexpr const WCHAR* kPipeName = SKYVANE_PIPE_NAME;
