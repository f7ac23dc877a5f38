#include "transport/io_block.h"

#include <vector>

#include "service/process_locks.h"
#include "transport/pass_through.h"

namespace {

// Holds a critical section for one scope.
struct SetAside {
  CRITICAL_SECTION lock;
  std::vector<IoBlock*> blocks;
};

SetAside& Aside() {
  // Lives to the end of the process: blocks set aside may outlive any owner.
  static SetAside* aside = [] {
    auto* made = new SetAside();
    InitializeCriticalSection(&made->lock);
    return made;
  }();
  return *aside;
}

bool Completed(IoBlock* block) {
  return WaitForSingleObject(block->event, 0) == WAIT_OBJECT_0;
}

void Release(IoBlock* block) {
  CloseHandle(block->event);
  HeapFree(GetProcessHeap(), 0, block);
}

// Frees the set-aside blocks whose request completed.
void Reap() {
  std::vector<IoBlock*> done;
  {
    SetAside& aside = Aside();
    SectionLock guard(&aside.lock);
    for (auto it = aside.blocks.begin(); it != aside.blocks.end();) {
      if (Completed(*it)) {
        done.push_back(*it);
        it = aside.blocks.erase(it);
      } else {
        ++it;
      }
    }
  }
  for (IoBlock* block : done) Release(block);
}

}  // namespace

IoBlock* NewIoBlock(std::size_t dataBytes) {
  Reap();
  auto* block = static_cast<IoBlock*>(
      HeapAlloc(GetProcessHeap(), HEAP_ZERO_MEMORY, sizeof(IoBlock) + dataBytes));
  if (block == nullptr) {
    SetLastError(ERROR_NOT_ENOUGH_MEMORY);
    return nullptr;
  }
  block->event = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  if (block->event == nullptr) {
    const DWORD error = GetLastError();
    HeapFree(GetProcessHeap(), 0, block);
    SetLastError(error);
    return nullptr;
  }
  block->overlapped.hEvent = block->event;
  block->capacity = dataBytes;
  return block;
}

void FreeIoBlock(IoBlock* block) {
  if (block != nullptr) Release(block);
}

void AbandonIoBlock(HANDLE device, IoBlock* block) {
  if (block == nullptr) return;
  const DWORD error = GetLastError();
  CancelIo(device);
  if (WaitForSingleObject(block->event, kCancelGraceMs) == WAIT_OBJECT_0) {
    Release(block);
  } else {
    SetAside& aside = Aside();
    SectionLock guard(&aside.lock);
    aside.blocks.push_back(block);
  }
  SetLastError(error);
}

std::size_t SetAsideIoBlockCount() {
  Reap();
  SetAside& aside = Aside();
  SectionLock guard(&aside.lock);
  return aside.blocks.size();
}

void FreeSetAsideIoBlocks() {
  Reap();
}
