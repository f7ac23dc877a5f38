// Pagefile-backed file mappings: the storage of each mapping is a range of
// the arena that follows the kernel region in the namespace's memory file;
// the slot is held by every handle and every view, and the range is
// released (its pages given back, so that it reads as zero when it is
// used again) when the slot is freed, under the kernel lock.
#include <fcntl.h>
#include <pthread.h>
#include <sys/mman.h>
#include <unistd.h>

#include <algorithm>
#include <map>
#include <mutex>
#include <vector>

#include "platform/posix/kernel.h"
#include "platform/posix/slot_object.h"
#include "platform/posix/win32_sync.h"

namespace emu {
namespace {

constexpr std::uint64_t kAllocationGranularity = 64 * 1024;

struct View {
  kernel::SlotRef ref;
  std::size_t length;
};

struct Views {
  std::mutex lock;
  std::map<std::uintptr_t, View> byAddress;
};

Views* g_views = nullptr;

void ForkPrepare() {
  g_views->lock.lock();
}
void ForkParent() {
  g_views->lock.unlock();
}
// The child's copies of the views stay mapped but belong to the parent's
// holds; the child starts with an empty table.
void ForkChild() {
  g_views->lock.unlock();
  g_views = new Views();
}

Views& GetViews() {
  static Views* views = [] {
    g_views = new Views();
    pthread_atfork(ForkPrepare, ForkParent, ForkChild);
    return g_views;
  }();
  (void)views;
  return *g_views;
}

// Gives the pages of an arena range back (they read as zero afterwards).
void ReleaseRange(std::uint64_t offset, std::uint64_t length) {
  static_cast<void>(fallocate(kernel::RegionFd(), FALLOC_FL_PUNCH_HOLE | FALLOC_FL_KEEP_SIZE,
                              static_cast<off_t>(kernel::kArenaOffset + offset),
                              static_cast<off_t>(length)));
}

// First fit among the ranges of the other mappings; false when full.
bool AllocateRange(const kernel::Slot& self, std::uint64_t length, std::uint64_t* offset) {
  std::vector<std::pair<std::uint64_t, std::uint64_t>> used;
  for (const kernel::Slot& slot : kernel::GetRegion().slots) {
    if (&slot != &self && slot.kind == kernel::kMapping && slot.arenaLength != 0) {
      used.emplace_back(slot.arenaOffset, slot.arenaLength);
    }
  }
  std::sort(used.begin(), used.end());
  std::uint64_t at = 0;
  for (const auto& range : used) {
    if (range.first >= at + length) break;
    at = std::max(at, range.first + range.second);
  }
  if (at + length > kernel::kArenaBytes) return false;
  *offset = at;
  return true;
}

}  // namespace

namespace kernel {

void MappingSlotFreed(const Slot& slot) {
  if (slot.arenaLength != 0) ReleaseRange(slot.arenaOffset, slot.arenaLength);
}

}  // namespace kernel
}  // namespace emu

HANDLE CreateFileMappingW(HANDLE file, LPSECURITY_ATTRIBUTES /*attributes*/, DWORD protect,
                          DWORD maximumSizeHigh, DWORD maximumSizeLow, LPCWSTR name) {
  if (file != INVALID_HANDLE_VALUE) {
    // Only pagefile-backed mappings are offered.
    SetLastError(ERROR_INVALID_HANDLE);
    return nullptr;
  }
  DWORD access = protect & 0xFF;
  std::uint64_t size = (static_cast<std::uint64_t>(maximumSizeHigh) << 32) | maximumSizeLow;
  if ((access != PAGE_READWRITE && access != PAGE_READONLY) || size == 0) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return nullptr;
  }
  bool failed = false;
  HANDLE handle = emu::CreateSlotHandle(
      emu::kernel::kMapping, name,
      [&](emu::kernel::Slot& slot) {
        std::uint64_t length = (size + emu::kAllocationGranularity - 1) /
                               emu::kAllocationGranularity * emu::kAllocationGranularity;
        std::uint64_t offset = 0;
        if (!emu::AllocateRange(slot, length, &offset)) {
          failed = true;
          return;
        }
        slot.mappingSize = size;
        slot.arenaOffset = offset;
        slot.arenaLength = length;
      },
      access == PAGE_READONLY ? FILE_MAP_READ : FILE_MAP_ALL_ACCESS);
  if (handle != nullptr && failed) {
    CloseHandle(handle);
    SetLastError(ERROR_NOT_ENOUGH_MEMORY);
    return nullptr;
  }
  return handle;
}

HANDLE OpenFileMappingW(DWORD desiredAccess, BOOL /*inheritHandle*/, LPCWSTR name) {
  return emu::OpenSlotHandle(emu::kernel::kMapping, name, desiredAccess);
}

LPVOID MapViewOfFile(HANDLE mapping, DWORD desiredAccess, DWORD fileOffsetHigh, DWORD fileOffsetLow,
                     SIZE_T numberOfBytesToMap) {
  auto object = emu::LookupSlotObject(mapping, emu::kernel::kMapping);
  if (object == nullptr) return nullptr;
  std::uint64_t offset = (static_cast<std::uint64_t>(fileOffsetHigh) << 32) | fileOffsetLow;
  if (offset % emu::kAllocationGranularity != 0) {
    SetLastError(ERROR_MAPPED_ALIGNMENT);
    return nullptr;
  }
  bool write = (desiredAccess & FILE_MAP_WRITE) != 0;
  // A copy-on-write view: writable here, its changes never shared.
  bool copy = !write && (desiredAccess & FILE_MAP_COPY) != 0;
  if (!write && !copy && (desiredAccess & FILE_MAP_READ) == 0) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return nullptr;
  }
  // A view cannot give more than the handle was opened for.
  DWORD granted = object->Access();
  if ((write && (granted & FILE_MAP_WRITE) == 0) ||
      (granted & (FILE_MAP_READ | FILE_MAP_WRITE)) == 0) {
    SetLastError(ERROR_ACCESS_DENIED);
    return nullptr;
  }
  emu::kernel::Lock lock;
  emu::kernel::Slot* slot = emu::kernel::SlotOf(object->Ref());
  if (slot == nullptr) {
    SetLastError(ERROR_INVALID_HANDLE);
    return nullptr;
  }
  std::uint64_t size = slot->mappingSize;
  if (offset >= size || numberOfBytesToMap > size - offset) {
    SetLastError(ERROR_ACCESS_DENIED);
    return nullptr;
  }
  std::size_t length =
      numberOfBytesToMap == 0 ? static_cast<std::size_t>(size - offset) : numberOfBytesToMap;
  int protection = write || copy ? PROT_READ | PROT_WRITE : PROT_READ;
  void* view =
      mmap(nullptr, length, protection, copy ? MAP_PRIVATE : MAP_SHARED, emu::kernel::RegionFd(),
           static_cast<off_t>(emu::kernel::kArenaOffset + slot->arenaOffset + offset));
  if (view == MAP_FAILED) {
    SetLastError(ERROR_NOT_ENOUGH_MEMORY);
    return nullptr;
  }
  emu::kernel::AddHolder(object->Ref());
  emu::Views& views = emu::GetViews();
  std::lock_guard<std::mutex> guard(views.lock);
  views.byAddress[reinterpret_cast<std::uintptr_t>(view)] = emu::View{object->Ref(), length};
  return view;
}

BOOL UnmapViewOfFile(LPCVOID baseAddress) {
  emu::View view{};
  {
    emu::Views& views = emu::GetViews();
    std::lock_guard<std::mutex> guard(views.lock);
    auto it = views.byAddress.find(reinterpret_cast<std::uintptr_t>(baseAddress));
    if (it == views.byAddress.end()) {
      SetLastError(ERROR_INVALID_ADDRESS);
      return FALSE;
    }
    view = it->second;
    views.byAddress.erase(it);
  }
  munmap(const_cast<void*>(baseAddress), view.length);
  emu::kernel::Lock lock;
  emu::kernel::DropHolder(view.ref);
  return TRUE;
}
