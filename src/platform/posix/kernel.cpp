// The kernel lock with its journal, the futex waits and the slot table.
#include "platform/posix/kernel.h"

#include <errno.h>
#include <linux/futex.h>
#include <pthread.h>
#include <signal.h>
#include <sys/syscall.h>
#include <time.h>
#include <unistd.h>

#include <climits>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace emu::kernel {
namespace {

[[noreturn]] void Fatal(const char* what) {
  std::fprintf(stderr, "skyvane emulation: %s\n", what);
  std::abort();
}

// ---- Journal ------------------------------------------------------------------

void Rollback(Region& region) {
  Journal& journal = region.journal;
  if (journal.count > kJournalEntries || journal.bytes > kJournalBytes) {
    Fatal("the kernel journal is damaged");
  }
  std::uint32_t end = journal.bytes;
  for (std::uint32_t i = journal.count; i-- > 0;) {
    const JournalEntry& entry = journal.entries[i];
    end -= entry.length;
    std::memcpy(reinterpret_cast<std::uint8_t*>(&region) + entry.offset, journal.data + end,
                entry.length);
  }
  journal.count = 0;
  journal.bytes = 0;
}

void Commit(Region& region) {
  region.journal.count = 0;
  region.journal.bytes = 0;
}

// ---- Lock -------------------------------------------------------------------------

// Nested holds by one thread (an object released while the lock is held
// takes it again to drop its slot) lock the mutex only once.
thread_local int t_lockDepth = 0;

void WakeAll(Region& region);

// Takes the mutex; when its owner died, undoes what that owner left half
// done and cleans up after its process.
void Acquire(Region& region) {
  int result;
  do {
    result = pthread_mutex_lock(&region.lock);
  } while (result == EINTR);
  if (result == EOWNERDEAD) {
    ProcessId dead = region.lockOwner;
    Rollback(region);
    region.lockOwner = Self();
    if (!SameProcess(dead, Self()) && !ProcessAlive(dead)) ReapProcess(dead);
    Commit(region);
    pthread_mutex_consistent(&region.lock);
    // Its wake-ups may have been lost with it.
    WakeAll(region);
    return;
  }
  if (result != 0) {
    errno = result;
    Fatal("the kernel lock failed");
  }
  region.lockOwner = Self();
}

void Release(Region& region) {
  Commit(region);
  pthread_mutex_unlock(&region.lock);
}

// ---- Futex --------------------------------------------------------------------------

long Futex(std::uint32_t* word, int op, std::uint32_t value, const timespec* at) {
  return syscall(SYS_futex, word, op, value, at, nullptr, FUTEX_BITSET_MATCH_ANY);
}

void WakeWaiter(Waiter& waiter) {
  __atomic_add_fetch(&waiter.word, 1, __ATOMIC_SEQ_CST);
  Futex(&waiter.word, FUTEX_WAKE, INT_MAX, nullptr);
}

void WakeAll(Region& region) {
  for (std::uint32_t i = 0; i < region.waiterHigh; ++i) {
    if (region.waiters[i].inUse != 0) WakeWaiter(region.waiters[i]);
  }
}

int AllocateWaiter(Region& region) {
  for (int pass = 0; pass < 2; ++pass) {
    for (std::uint32_t i = 0; i < kWaiterCount; ++i) {
      Waiter& waiter = region.waiters[i];
      if (waiter.inUse != 0) continue;
      Touch(waiter);
      waiter.inUse = 1;
      waiter.process = Self();
      if (i >= region.waiterHigh) {
        Touch(region.waiterHigh);
        region.waiterHigh = i + 1;
      }
      return static_cast<int>(i);
    }
    // Full: free the records of processes that died.
    for (Waiter& waiter : region.waiters) {
      if (waiter.inUse != 0 && !ProcessAlive(waiter.process)) {
        Touch(waiter);
        waiter.inUse = 0;
      }
    }
  }
  return -1;
}

void FreeWaiter(Region& region, std::uint32_t index) {
  Touch(region.waiters[index]);
  region.waiters[index].inUse = 0;
  region.waiters[index].keyCount = 0;
  if (index + 1 == region.waiterHigh) {
    std::uint32_t high = index;
    while (high > 0 && region.waiters[high - 1].inUse == 0) --high;
    Touch(region.waiterHigh);
    region.waiterHigh = high;
  }
}

// ---- Slots --------------------------------------------------------------------------

bool NameEqual(const WCHAR* a, const WCHAR* b) {
  for (std::uint32_t i = 0; i < kNameCapacity; ++i) {
    if (a[i] != b[i]) return false;
    if (a[i] == 0) return true;
  }
  return true;
}

void FreeSlot(Slot& slot) {
  Touch(slot);
  if (slot.kind == kMapping) MappingSlotFreed(slot);
  std::uint32_t nextGeneration = slot.generation + 1;
  std::memset(static_cast<void*>(&slot), 0, sizeof(Slot));
  slot.generation = nextGeneration;
}

// Drops holders that died; frees the slot (and returns true) when none is left.
bool SweepSlot(Slot& slot) {
  bool anyLeft = false;
  for (Holder& holder : slot.holders) {
    if (holder.count == 0) continue;
    if (!ProcessAlive(holder.process)) {
      Touch(holder);
      holder = Holder{};
      continue;
    }
    anyLeft = true;
  }
  if (!anyLeft) {
    FreeSlot(slot);
    return true;
  }
  return false;
}

char g_crashPoint[64] = {};

}  // namespace

Lock::Lock() {
  if (t_lockDepth++ != 0) return;
  Acquire(GetRegion());
}

Lock::~Lock() {
  if (--t_lockDepth != 0) return;
  Release(GetRegion());
}

bool Journalled(const void* address) {
  Region& region = GetRegion();
  auto offset = static_cast<std::uint32_t>(static_cast<const std::uint8_t*>(address) -
                                           reinterpret_cast<const std::uint8_t*>(&region));
  const Journal& journal = region.journal;
  for (std::uint32_t i = 0; i < journal.count; ++i) {
    if (journal.entries[i].offset <= offset &&
        offset < journal.entries[i].offset + journal.entries[i].length) {
      return true;
    }
  }
  return false;
}

void Save(const void* address, std::size_t length) {
  Region& region = GetRegion();
  auto* base = reinterpret_cast<const std::uint8_t*>(&region);
  auto* at = static_cast<const std::uint8_t*>(address);
  if (at < base || at + length > base + sizeof(Region))
    Fatal("journal of memory outside the region");
  Journal& journal = region.journal;
  if (journal.count == kJournalEntries || journal.bytes + length > kJournalBytes) {
    Fatal("the kernel journal is full");
  }
  std::memcpy(journal.data + journal.bytes, at, length);
  journal.entries[journal.count] =
      JournalEntry{static_cast<std::uint32_t>(at - base), static_cast<std::uint32_t>(length)};
  journal.bytes += static_cast<std::uint32_t>(length);
  // The entry counts only once its bytes are saved.
  __atomic_store_n(&journal.count, journal.count + 1, __ATOMIC_RELEASE);
}

std::int64_t NowNs() {
  timespec now{};
  clock_gettime(CLOCK_MONOTONIC, &now);
  return static_cast<std::int64_t>(now.tv_sec) * 1000000000LL + now.tv_nsec;
}

double Scale() {
  static const double scale = [] {
    const char* env = std::getenv("SKYVANE_TIME_SCALE");
    if (env == nullptr || env[0] == '\0') return 1.0;
    char* end = nullptr;
    double value = std::strtod(env, &end);
    if (end == env || !(value > 0.0) || !std::isfinite(value)) return 1.0;
    return value;
  }();
  return scale;
}

DWORD ScaleTimeout(DWORD milliseconds) {
  if (milliseconds == 0 || milliseconds == INFINITE) return milliseconds;
  double scaled = std::ceil(static_cast<double>(milliseconds) * Scale());
  if (scaled < 1.0) return 1;
  if (scaled >= static_cast<double>(INFINITE - 1)) return INFINITE - 1;
  return static_cast<DWORD>(scaled);
}

std::int64_t DeadlineAfter(DWORD milliseconds) {
  if (milliseconds == INFINITE) return -1;
  return NowNs() + static_cast<std::int64_t>(milliseconds) * 1000000LL;
}

void Notify(std::uint32_t key) {
  Region& region = GetRegion();
  for (std::uint32_t i = 0; i < region.waiterHigh; ++i) {
    Waiter& waiter = region.waiters[i];
    if (waiter.inUse == 0) continue;
    for (std::uint32_t k = 0; k < waiter.keyCount; ++k) {
      if (waiter.keys[k] == key) {
        WakeWaiter(waiter);
        break;
      }
    }
  }
}

bool WaitKeys(const std::uint32_t* keys, std::uint32_t count, std::int64_t deadlineNs) {
  if (deadlineNs >= 0 && NowNs() >= deadlineNs) return false;
  Region& region = GetRegion();
  if (count > kMaxWaitKeys) Fatal("a wait on too many objects");
  int index = AllocateWaiter(region);
  timespec at{};
  if (deadlineNs >= 0) {
    at.tv_sec = static_cast<time_t>(deadlineNs / 1000000000LL);
    at.tv_nsec = static_cast<long>(deadlineNs % 1000000000LL);
  }
  if (index < 0) {
    // Every record taken by live waiters: sleep a moment and let the caller
    // look again, rather than fail the wait.
    Release(region);
    timespec pause{0, 1000000};
    nanosleep(&pause, nullptr);
    Acquire(region);
    return deadlineNs < 0 || NowNs() < deadlineNs;
  }
  Waiter& waiter = region.waiters[index];
  waiter.keyCount = count;
  std::memcpy(waiter.keys, keys, count * sizeof(std::uint32_t));
  std::uint32_t seen = __atomic_load_n(&waiter.word, __ATOMIC_SEQ_CST);
  Release(region);
  // A notification between the release and the sleep changed the word, so
  // the sleep returns at once. EINTR and EAGAIN return to the caller, which
  // looks again.
  Futex(&waiter.word, FUTEX_WAIT_BITSET, seen, deadlineNs >= 0 ? &at : nullptr);
  Acquire(region);
  FreeWaiter(region, static_cast<std::uint32_t>(index));
  return deadlineNs < 0 || NowNs() < deadlineNs;
}

bool SameProcess(const ProcessId& a, const ProcessId& b) {
  return a.pid == b.pid && a.startTime == b.startTime;
}

namespace {

// The thread's id, asked of the system once: every kernel call names its
// caller. A forked child's one thread has a new id, so it asks again.
thread_local std::int32_t cachedThreadId = 0;

void ForgetThreadIdInChild() {
  cachedThreadId = 0;
}

}  // namespace

std::int32_t ThreadId() {
  if (cachedThreadId == 0) {
    static const int registered = pthread_atfork(nullptr, nullptr, ForgetThreadIdInChild);
    (void)registered;
    cachedThreadId = static_cast<std::int32_t>(gettid());
  }
  return cachedThreadId;
}

void ReapProcess(const ProcessId& process) {
  if (process.pid <= 0 || SameProcess(process, Self())) return;
  Region& region = GetRegion();
  AbandonMutexesOfProcess(process);
  ClosePipeEndsOfProcess(process);
  for (Slot& slot : region.slots) {
    if (slot.kind == kFree) continue;
    bool held = false;
    bool anyLeft = false;
    for (Holder& holder : slot.holders) {
      if (holder.count == 0) continue;
      if (SameProcess(holder.process, process)) {
        Touch(holder);
        holder = Holder{};
        held = true;
      } else {
        anyLeft = true;
      }
    }
    if (held && !anyLeft) FreeSlot(slot);
  }
  for (std::uint32_t i = 0; i < region.waiterHigh; ++i) {
    Waiter& waiter = region.waiters[i];
    if (waiter.inUse != 0 && SameProcess(waiter.process, process)) FreeWaiter(region, i);
  }
}

bool NormalizeName(const WCHAR* name, WCHAR* out) {
  static const char16_t kGlobal[] = u"Global\\";
  static const char16_t kLocal[] = u"Local\\";
  auto hasPrefix = [name](const char16_t* prefix) {
    for (std::size_t i = 0; prefix[i] != 0; ++i) {
      if (name[i] != prefix[i]) return false;
    }
    return true;
  };
  const WCHAR* rest = name;
  if (hasPrefix(kGlobal)) {
    rest = name + 7;
  } else if (hasPrefix(kLocal)) {
    rest = name + 6;
  }
  for (std::uint32_t i = 0; i < kNameCapacity; ++i) {
    out[i] = rest[i];
    if (rest[i] == 0) return true;
  }
  out[0] = 0;
  return false;
}

int FindNamed(const WCHAR* normalizedName) {
  Region& region = GetRegion();
  for (std::uint32_t i = 0; i < kSlotCount; ++i) {
    Slot& slot = region.slots[i];
    if (slot.kind == kFree || slot.name[0] == 0) continue;
    if (!NameEqual(slot.name, normalizedName)) continue;
    if (SweepSlot(slot)) return -1;
    return static_cast<int>(i);
  }
  return -1;
}

bool AllocateSlot(SlotKind kind, const WCHAR* normalizedName, SlotRef* ref) {
  Region& region = GetRegion();
  for (int pass = 0; pass < 2; ++pass) {
    for (std::uint32_t i = 0; i < kSlotCount; ++i) {
      Slot& slot = region.slots[i];
      if (slot.kind != kFree) continue;
      Touch(slot);
      slot.kind = kind;
      if (normalizedName != nullptr) {
        for (std::uint32_t k = 0; k < kNameCapacity; ++k) {
          slot.name[k] = normalizedName[k];
          if (normalizedName[k] == 0) break;
        }
      }
      slot.holders[0].process = Self();
      slot.holders[0].count = 1;
      ref->index = i;
      ref->generation = slot.generation;
      return true;
    }
    // Full: free what dead processes left behind and try once more.
    for (Slot& slot : region.slots) {
      if (slot.kind != kFree) SweepSlot(slot);
    }
  }
  return false;
}

Slot* SlotOf(const SlotRef& ref) {
  if (ref.index >= kSlotCount) return nullptr;
  Slot& slot = GetRegion().slots[ref.index];
  if (slot.kind == kFree || slot.generation != ref.generation) return nullptr;
  return &slot;
}

void AddHolder(const SlotRef& ref) {
  Slot* slot = SlotOf(ref);
  if (slot == nullptr) return;
  Holder* empty = nullptr;
  for (Holder& holder : slot->holders) {
    if (holder.count != 0 && SameProcess(holder.process, Self())) {
      Touch(holder);
      ++holder.count;
      return;
    }
    if (holder.count == 0 && empty == nullptr) empty = &holder;
  }
  if (empty == nullptr) {
    // Every entry taken: make room by dropping processes that died.
    for (Holder& holder : slot->holders) {
      if (!ProcessAlive(holder.process)) {
        Touch(holder);
        holder = Holder{};
        if (empty == nullptr) empty = &holder;
      }
    }
  }
  if (empty == nullptr) Fatal("more processes hold one object than the table has room for");
  Touch(*empty);
  empty->process = Self();
  empty->count = 1;
}

void DropHolder(const SlotRef& ref) {
  Slot* slot = SlotOf(ref);
  if (slot == nullptr) return;
  bool anyLeft = false;
  for (Holder& holder : slot->holders) {
    if (holder.count != 0 && SameProcess(holder.process, Self())) {
      Touch(holder);
      if (--holder.count == 0) holder = Holder{};
    }
    if (holder.count != 0) anyLeft = true;
  }
  if (!anyLeft) FreeSlot(*slot);
}

void SetCrashPoint(const char* name) {
  std::snprintf(g_crashPoint, sizeof(g_crashPoint), "%s", name != nullptr ? name : "");
}

void CrashPoint(const char* name) {
  if (g_crashPoint[0] != '\0' && std::strcmp(g_crashPoint, name) == 0) {
    kill(getpid(), SIGKILL);
    for (;;) pause();
  }
}

}  // namespace emu::kernel
