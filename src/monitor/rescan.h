// The full rescan and the other reactions to device changes.
#pragma once

#include "platform/win32.h"

// Enumerates the drives, rebuilds the channel records, starts the workers,
// waits until each is ready and rebuilds the published list (statusWord 102).
// A stop ends the wait; the workers are then told to stop and the published
// list is left as the enumeration left it.
void RescanDrives();
// Rebuilds the channel table and starts the workers when none runs; waits
// for a quiesce in progress first. Called without the mutex.
void RestartWorkers();
// Sends the quiesce command where needed and stops all workers.
void QuiesceChannels();
// QuiesceChannels then RescanDrives, as one unit that no other rescan overlaps.
void QuiesceAndRescan();
// After a removal notice: re-enumerates and sends drive-gone to channels whose
// drive vanished. Returns how many were sent. Called without the mutex.
int CheckRemovedDrives();
// A window message forwarded by the user-interface application: power
// broadcast (0x218) and device change (0x219). Called without the mutex.
void HandleForwardedMessage(DWORD message, ULONG_PTR parameter, ULONG_PTR eventData,
                            void* resultSlot);
