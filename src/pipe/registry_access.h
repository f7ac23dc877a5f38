// Registry access on the user-interface application's behalf (command 13):
// one query or one set of a value named in the request, with the service's
// rights.
#pragma once

#include <cstddef>

#include "platform/win32.h"

// Runs the registry request (layout RegistryRequest, followed by its texts)
// that starts at `request`, in place. `available` is the number of bytes from
// `request` on that the client actually delivered: the subkey path, the value
// name and the data area must lie inside them (path and name terminated), and
// the root key must be a predefined one, sign- or zero-extended from its 32-bit
// value; otherwise the request is refused with ERROR_INVALID_PARAMETER without
// touching the registry. Returns the registry error code (ERROR_SUCCESS on
// success).
DWORD RunRegistryRequest(BYTE* request, std::size_t available);
