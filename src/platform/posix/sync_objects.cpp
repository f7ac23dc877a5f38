// Events, mutexes and the wait functions over the shared kernel region.
#include <cstring>
#include <vector>

#include "platform/posix/kernel.h"
#include "platform/posix/slot_object.h"
#include "platform/posix/win32_sync.h"

namespace emu {

using kernel::Slot;
using kernel::SlotKind;
using kernel::SlotRef;

SlotObject::~SlotObject() {
  kernel::Lock lock;
  kernel::DropHolder(ref_);
}

std::shared_ptr<SlotObject> LookupSlotObject(HANDLE handle, SlotKind kind) {
  std::shared_ptr<SlotObject> object = LookupHandleAs<SlotObject>(handle);
  if (object == nullptr || (kind != kernel::kFree && object->Kind() != kind)) {
    SetLastError(ERROR_INVALID_HANDLE);
    return nullptr;
  }
  return object;
}

HANDLE CreateSlotHandle(SlotKind kind, LPCWSTR name, const std::function<void(Slot&)>& initialise,
                        DWORD access) {
  WCHAR normalized[kernel::kNameCapacity] = {};
  bool named = name != nullptr && name[0] != 0;
  if (named && !kernel::NormalizeName(name, normalized)) {
    SetLastError(ERROR_INVALID_NAME);
    return nullptr;
  }
  SlotRef ref;
  bool existed = false;
  {
    kernel::Lock lock;
    int found = named ? kernel::FindNamed(normalized) : -1;
    if (found >= 0) {
      Slot& slot = kernel::GetRegion().slots[found];
      if (slot.kind != kind) {
        SetLastError(ERROR_INVALID_HANDLE);
        return nullptr;
      }
      ref.index = static_cast<std::uint32_t>(found);
      ref.generation = slot.generation;
      kernel::AddHolder(ref);
      existed = true;
    } else {
      if (!kernel::AllocateSlot(kind, named ? normalized : nullptr, &ref)) {
        SetLastError(ERROR_NOT_ENOUGH_MEMORY);
        return nullptr;
      }
      initialise(*kernel::SlotOf(ref));
    }
  }
  HANDLE handle = AllocateHandle(std::make_shared<SlotObject>(kind, ref, access));
  SetLastError(existed ? ERROR_ALREADY_EXISTS : ERROR_SUCCESS);
  return handle;
}

HANDLE OpenSlotHandle(SlotKind kind, LPCWSTR name, DWORD access) {
  WCHAR normalized[kernel::kNameCapacity] = {};
  if (name == nullptr) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return nullptr;
  }
  if (!kernel::NormalizeName(name, normalized)) {
    SetLastError(ERROR_INVALID_NAME);
    return nullptr;
  }
  SlotRef ref;
  {
    kernel::Lock lock;
    int found = normalized[0] != 0 ? kernel::FindNamed(normalized) : -1;
    if (found < 0) {
      SetLastError(ERROR_FILE_NOT_FOUND);
      return nullptr;
    }
    Slot& slot = kernel::GetRegion().slots[found];
    if (slot.kind != kind) {
      SetLastError(ERROR_INVALID_HANDLE);
      return nullptr;
    }
    ref.index = static_cast<std::uint32_t>(found);
    ref.generation = slot.generation;
    kernel::AddHolder(ref);
  }
  return AllocateHandle(std::make_shared<SlotObject>(kind, ref, access));
}

namespace {

std::uint32_t KeyOf(const Slot& slot) {
  return kernel::SlotKey(static_cast<std::uint32_t>(&slot - kernel::GetRegion().slots));
}

// The mutex is free again: marked abandoned, and its waiters woken.
void Abandon(Slot& slot) {
  kernel::Touch(slot);
  slot.ownerThread = 0;
  slot.ownerProcess = kernel::ProcessId{};
  slot.recursion = 0;
  slot.abandoned = 1;
  kernel::Notify(KeyOf(slot));
}

bool OwnedByCaller(const Slot& slot) {
  return slot.ownerThread != 0 && slot.ownerThread == kernel::ThreadId() &&
         kernel::SameProcess(slot.ownerProcess, kernel::Self());
}

// A mutex whose owner process has died is abandoned (threads of this process
// abandon their mutexes themselves when they end). Asking starts watching
// the owner, so a wait on the mutex is woken if it dies later.
void CheckMutexOwner(Slot& slot) {
  if (slot.ownerThread == 0 || kernel::SameProcess(slot.ownerProcess, kernel::Self())) return;
  if (kernel::ProcessAlive(slot.ownerProcess)) return;
  Abandon(slot);
}

bool Signaled(const Slot& slot) {
  switch (slot.kind) {
    case kernel::kEvent:
    case kernel::kThread:
      return slot.signaled != 0;
    case kernel::kMutex:
      return slot.ownerThread == 0 || OwnedByCaller(slot);
    default:
      return false;
  }
}

// Takes what a satisfied wait takes; true when it was an abandoned mutex.
bool Acquire(Slot& slot);

// Every thread that takes a mutex gets an exit hook, so that a thread ending
// while it owns mutexes (however it was created) abandons them.
struct OwnerExitHook {
  bool armed = false;
  ~OwnerExitHook() {
    if (!armed) return;
    kernel::Lock lock;
    AbandonMutexesOfThread(kernel::ThreadId());
  }
};
thread_local OwnerExitHook t_ownerExitHook;

bool Acquire(Slot& slot) {
  if (slot.kind == kernel::kEvent) {
    if (slot.manualReset == 0) {
      kernel::Touch(slot.signaled);
      slot.signaled = 0;
    }
    return false;
  }
  if (slot.kind != kernel::kMutex) return false;
  kernel::Touch(slot);
  if (slot.ownerThread == 0) {
    slot.ownerThread = kernel::ThreadId();
    slot.ownerProcess = kernel::Self();
    slot.recursion = 1;
    t_ownerExitHook.armed = true;
  } else {
    ++slot.recursion;
  }
  bool abandoned = slot.abandoned != 0;
  slot.abandoned = 0;
  return abandoned;
}

bool IsWaitable(SlotKind kind) {
  return kind == kernel::kEvent || kind == kernel::kMutex || kind == kernel::kThread;
}

HANDLE const kPseudoThread = reinterpret_cast<HANDLE>(static_cast<LONG_PTR>(-2));

}  // namespace

void AbandonMutexesOfThread(std::int32_t threadId) {
  for (Slot& slot : kernel::GetRegion().slots) {
    if (slot.kind != kernel::kMutex || slot.ownerThread != threadId) continue;
    if (kernel::SameProcess(slot.ownerProcess, kernel::Self())) Abandon(slot);
  }
}

namespace kernel {

void AbandonMutexesOfProcess(const ProcessId& process) {
  for (Slot& slot : GetRegion().slots) {
    if (slot.kind != kMutex || slot.ownerThread == 0) continue;
    if (SameProcess(slot.ownerProcess, process)) Abandon(slot);
  }
}

}  // namespace kernel

}  // namespace emu

using emu::kernel::Slot;

HANDLE CreateEventW(LPSECURITY_ATTRIBUTES /*attributes*/, BOOL manualReset, BOOL initialState,
                    LPCWSTR name) {
  return emu::CreateSlotHandle(emu::kernel::kEvent, name, [&](Slot& slot) {
    slot.manualReset = manualReset ? 1 : 0;
    slot.signaled = initialState ? 1 : 0;
  });
}

HANDLE OpenEventW(DWORD /*desiredAccess*/, BOOL /*inheritHandle*/, LPCWSTR name) {
  return emu::OpenSlotHandle(emu::kernel::kEvent, name);
}

namespace {

BOOL SetEventState(HANDLE event, std::uint32_t state) {
  auto object = emu::LookupSlotObject(event, emu::kernel::kEvent);
  if (object == nullptr) return FALSE;
  emu::kernel::Lock lock;
  Slot* slot = emu::kernel::SlotOf(object->Ref());
  if (slot == nullptr) {
    SetLastError(ERROR_INVALID_HANDLE);
    return FALSE;
  }
  emu::kernel::Touch(slot->signaled);
  slot->signaled = state;
  emu::kernel::CrashPoint("set-event");
  if (state != 0) emu::kernel::Notify(emu::KeyOf(*slot));
  return TRUE;
}

}  // namespace

BOOL SetEvent(HANDLE event) {
  return SetEventState(event, 1);
}
BOOL ResetEvent(HANDLE event) {
  return SetEventState(event, 0);
}

HANDLE CreateMutexW(LPSECURITY_ATTRIBUTES /*attributes*/, BOOL initialOwner, LPCWSTR name) {
  return emu::CreateSlotHandle(emu::kernel::kMutex, name, [&](Slot& slot) {
    if (initialOwner) emu::Acquire(slot);
  });
}

HANDLE OpenMutexW(DWORD /*desiredAccess*/, BOOL /*inheritHandle*/, LPCWSTR name) {
  return emu::OpenSlotHandle(emu::kernel::kMutex, name);
}

BOOL ReleaseMutex(HANDLE mutex) {
  auto object = emu::LookupSlotObject(mutex, emu::kernel::kMutex);
  if (object == nullptr) return FALSE;
  emu::kernel::Lock lock;
  Slot* slot = emu::kernel::SlotOf(object->Ref());
  if (slot == nullptr) {
    SetLastError(ERROR_INVALID_HANDLE);
    return FALSE;
  }
  if (!emu::OwnedByCaller(*slot)) {
    SetLastError(ERROR_NOT_OWNER);
    return FALSE;
  }
  emu::kernel::Touch(*slot);
  if (--slot->recursion == 0) {
    slot->ownerThread = 0;
    slot->ownerProcess = emu::kernel::ProcessId{};
    emu::kernel::Notify(emu::KeyOf(*slot));
  }
  return TRUE;
}

DWORD WaitForSingleObject(HANDLE handle, DWORD milliseconds) {
  return WaitForMultipleObjects(1, &handle, FALSE, milliseconds);
}

DWORD WaitForMultipleObjects(DWORD count, const HANDLE* handles, BOOL waitAll, DWORD milliseconds) {
  if (count == 0 || count > MAXIMUM_WAIT_OBJECTS || handles == nullptr) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return WAIT_FAILED;
  }
  std::shared_ptr<emu::SlotObject> objects[MAXIMUM_WAIT_OBJECTS];
  std::uint32_t keys[MAXIMUM_WAIT_OBJECTS];
  for (DWORD i = 0; i < count; ++i) {
    if (handles[i] == emu::kPseudoThread) {
      // The calling thread never ends while it waits on itself.
      SetLastError(ERROR_INVALID_HANDLE);
      return WAIT_FAILED;
    }
    objects[i] = emu::LookupSlotObject(handles[i], emu::kernel::kFree);
    if (objects[i] == nullptr || !emu::IsWaitable(objects[i]->Kind())) {
      SetLastError(ERROR_INVALID_HANDLE);
      return WAIT_FAILED;
    }
    keys[i] = emu::kernel::SlotKey(objects[i]->Ref().index);
    if (waitAll) {
      for (DWORD k = 0; k < i; ++k) {
        if (objects[k]->Ref().index == objects[i]->Ref().index) {
          SetLastError(ERROR_INVALID_PARAMETER);
          return WAIT_FAILED;
        }
      }
    }
  }
  std::int64_t deadline = emu::kernel::DeadlineAfter(emu::kernel::ScaleTimeout(milliseconds));
  emu::kernel::Lock lock;
  Slot* slots[MAXIMUM_WAIT_OBJECTS];
  for (;;) {
    for (DWORD i = 0; i < count; ++i) {
      slots[i] = emu::kernel::SlotOf(objects[i]->Ref());
      if (slots[i] == nullptr) {
        SetLastError(ERROR_INVALID_HANDLE);
        return WAIT_FAILED;
      }
      if (slots[i]->kind == emu::kernel::kMutex) emu::CheckMutexOwner(*slots[i]);
    }
    if (!waitAll) {
      for (DWORD i = 0; i < count; ++i) {
        if (!emu::Signaled(*slots[i])) continue;
        return (emu::Acquire(*slots[i]) ? WAIT_ABANDONED_0 : WAIT_OBJECT_0) + i;
      }
    } else {
      bool all = true;
      for (DWORD i = 0; i < count && all; ++i) all = emu::Signaled(*slots[i]);
      if (all) {
        DWORD result = WAIT_OBJECT_0;
        for (DWORD i = 0; i < count; ++i) {
          if (emu::Acquire(*slots[i]) && result == WAIT_OBJECT_0) result = WAIT_ABANDONED_0 + i;
        }
        return result;
      }
    }
    // Checked after the look above, so a change that raced the time-out counts.
    if (deadline >= 0 && emu::kernel::NowNs() >= deadline) return WAIT_TIMEOUT;
    emu::kernel::WaitKeys(keys, count, deadline);
  }
}
