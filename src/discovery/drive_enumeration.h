// Enumeration of the maker's drives into the working drive array.
#pragma once

#include "platform/win32.h"

// Rebuilds drives, driveCount and countedDrives (and clears published and
// publishedCount). cancelEvent aborts hanging device commands; may be null.
// Returns 0 when at least one drive was accepted, else -1. Mutex held.
LONG EnumerateDrives(HANDLE cancelEvent);
