// The heap block of one overlapped request: its OVERLAPPED record, its event
// and the buffers the device reads and writes. A request that is abandoned
// (its wait aborted) and does not finish cancelling within the grace is set
// aside rather than waited for, so no caller is held for longer than the
// grace by a device that never completes a cancelled request; the block is
// freed by whoever next sees it complete, or at exit. Its memory is never
// freed while the device may still write into it.
#pragma once

#include <cstddef>

#include "platform/win32.h"

struct IoBlock {
  OVERLAPPED overlapped;  // its event is `event`
  HANDLE event;           // manual-reset, owned by the block
  std::size_t capacity;   // bytes of Data()
  BYTE* Data() { return reinterpret_cast<BYTE*>(this + 1); }
};

static_assert(sizeof(IoBlock) % 8 == 0);

// A zeroed block with `dataBytes` of buffer and its event; null (last error
// set) when either cannot be had. Frees set-aside blocks that completed.
IoBlock* NewIoBlock(std::size_t dataBytes);
// Frees a block whose request is not pending (completed, or never started).
void FreeIoBlock(IoBlock* block);
// The request on the block is given up: the calling thread's I/O on the
// device is cancelled and the grace of kCancelGraceMs granted. A request
// that completed is freed; one still pending is set aside. The caller must
// not touch the block afterwards.
void AbandonIoBlock(HANDLE device, IoBlock* block);

// Set-aside blocks whose request has not been seen to complete.
std::size_t SetAsideIoBlockCount();
// At exit: frees every set-aside block that completed; one still pending is
// left to the end of the process, since its device may still write into it.
void FreeSetAsideIoBlocks();
