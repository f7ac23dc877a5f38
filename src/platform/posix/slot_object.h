// Handles to objects that live in the shared kernel region (events, mutexes,
// threads, mappings): the handle's object holds one reference on the slot.
#pragma once

#include <functional>
#include <memory>

#include "platform/posix/handle_table.h"
#include "platform/posix/kernel.h"

namespace emu {

class SlotObject : public KernelObject {
 public:
  // Takes over one hold on `ref` that the caller already added. `access` is
  // what the handle was opened for (checked where Windows checks it).
  SlotObject(kernel::SlotKind kind, kernel::SlotRef ref, DWORD access = kAllAccess)
      : kind_(kind), ref_(ref), access_(access) {}
  ~SlotObject() override;
  kernel::SlotKind Kind() const { return kind_; }
  const kernel::SlotRef& Ref() const { return ref_; }
  DWORD Access() const { return access_; }

  static constexpr DWORD kAllAccess = 0xFFFFFFFF;

 private:
  kernel::SlotKind kind_;
  kernel::SlotRef ref_;
  DWORD access_;
};

// The slot object behind `handle` when it is of `kind` (kFree: any kind);
// otherwise null with ERROR_INVALID_HANDLE as the last error.
std::shared_ptr<SlotObject> LookupSlotObject(HANDLE handle, kernel::SlotKind kind);

// Creates (or, for a name already in use by the same kind, opens) a kernel
// object and returns a new handle. `initialise` fills a new slot (under the
// kernel lock). The last error is ERROR_ALREADY_EXISTS when an existing
// object was opened and 0 otherwise; on failure null with the error.
HANDLE CreateSlotHandle(kernel::SlotKind kind, LPCWSTR name,
                        const std::function<void(kernel::Slot&)>& initialise,
                        DWORD access = SlotObject::kAllAccess);
// Opens an existing named object of `kind` (ERROR_FILE_NOT_FOUND when there is
// none, ERROR_INVALID_HANDLE when the name belongs to another kind).
HANDLE OpenSlotHandle(kernel::SlotKind kind, LPCWSTR name, DWORD access = SlotObject::kAllAccess);

// Threads made by CreateThread that are still running.
long RunningThreadCount();

// Called with the kernel lock held: every mutex the calling thread owns
// becomes abandoned (the thread is ending).
void AbandonMutexesOfThread(std::int32_t threadId);

}  // namespace emu
