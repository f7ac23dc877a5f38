// Named pipes of the emulation (internal entry used by CreateFileW).
#pragma once

#include "platform/posix/win32_base.h"

namespace emu {

// True when `path` names a pipe ("\\.\pipe\..." in any case); `*name` then
// points at the pipe's own name.
bool IsPipePath(const WCHAR* path, const WCHAR** name);

// The client side of CreateFileW on a pipe path: INVALID_HANDLE_VALUE with
// ERROR_FILE_NOT_FOUND when no such pipe exists, ERROR_PIPE_BUSY when no
// instance is free.
HANDLE OpenPipeClient(const WCHAR* name, DWORD access, DWORD flags);

}  // namespace emu
