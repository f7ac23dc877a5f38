// The scan of control interfaces (HID and the maker's vendor classes) into
// the channel records.
#pragma once

#include "platform/win32.h"

// Clears every channel record (keeping its ready event, linked drive -1) and
// refills one record per control interface found. Mutex held.
LONG RebuildChannelTable();
// Stores one record per suitable interface of the class; 0 when it stored at
// least one, else -1.
LONG ScanControlInterfaces(const GUID& interfaceClass);
