// Classification of Plug and Play device events into monitor requests.
#pragma once

#include "platform/win32.h"

// Handles arrival (0x8000) and remove-complete (0x8004); ignores the rest.
// eventData may be null (a forwarded event whose record cannot be read): the
// event is then treated like one of an unknown device type. resultSlot is
// never written. The caller must not hold the state mutex.
void HandleDeviceEvent(DWORD eventType, const void* eventData, void* resultSlot);
