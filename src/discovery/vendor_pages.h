// The vital-product-data pages of a drive that carries the maker's extended
// identity: its two ASCII information pages, its unit serial number and its
// vendor code.
#pragma once

#include "discovery/drive_record.h"
#include "platform/win32.h"

// Reads the pages of the open disk into the record being filled. 0 when the
// drive's page list does not name pages 0x00, 0x01 and 0x02 (nothing is
// read then), else 1. The requests carry no abort event.
int ReadVendorPages(HANDLE disk, DriveRecord* slot);
