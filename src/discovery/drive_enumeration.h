// Enumeration of the maker's drives into the working drive array.
#pragma once

#include "platform/win32.h"

// Rebuilds drives, driveCount and countedDrives (and clears published and
// publishedCount). cancelEvent aborts hanging device commands; may be null.
// Returns 0 when at least one drive was accepted, -1 when none was, and
// kEnumerationFailed when the list of disks could not be had (the array is
// then empty, and says nothing about which drives are present). Mutex held.
constexpr LONG kEnumerationFailed = -2;
LONG EnumerateDrives(HANDLE cancelEvent);
