// The disk number a drive record carries when the storage stack's
// device-number query fails. Volumes may report this value too (a volume
// that spans disks), so whether a record's number was read is kept apart.
#pragma once

#include "platform/win32.h"

constexpr DWORD kUnknownDiskNumber = 0xFFFFFFFF;

// Whether the disk number of the working record at `index` was read from
// its disk. Kept beside the block (the record's layout is fixed): every
// enumeration starts it afresh, and a record made from a channel has none.
void SetDiskNumberRead(LONG index, bool read);
bool DiskNumberRead(LONG index);
