// The emulation's "kernel": one shared region per namespace holding the
// state of every waitable object, named object, mapping and pipe instance.
//
// - The region is an anonymous memory file. Processes find it through the
//   abstract socket names its members hold (region_attach.cpp), so it and
//   everything in it vanish with the last process of the namespace, however
//   that process ends.
// - One robust process-shared mutex guards it. Every change made under the
//   lock is journalled first (Save/Touch); a process that dies holding the
//   lock has its unfinished changes rolled back by the next owner.
// - Waits sleep on a futex word of their own (a waiter record in the region
//   naming the object keys waited on); a change wakes only the waiters of
//   its key (Notify). Nothing polls.
// - Each process watches the processes it depends on (mutex owners, pipe
//   peers) through pidfds and cleans up after them when they die
//   (process_watch.cpp), as Windows does.
//
// Everything here except Lock's constructor and the time helpers must be
// called with the lock held.
#pragma once

#include <pthread.h>

#include <cstddef>
#include <cstdint>

#include "platform/posix/win32_base.h"

namespace emu::kernel {

constexpr std::uint32_t kSlotCount = 1024;
constexpr std::uint32_t kNameCapacity = 260;  // units, terminator included
constexpr std::uint32_t kMaxHolders = 16;
constexpr std::uint32_t kPipeInstanceCount = 64;
constexpr std::uint32_t kPipeQueueBytes = 64 * 1024;
constexpr std::uint32_t kWaiterCount = 4096;  // threads asleep at once, all processes
constexpr std::uint32_t kMaxWaitKeys = 72;    // 64 objects, or a process's pipe instances
constexpr std::uint32_t kJournalEntries = 32768;
constexpr std::uint32_t kJournalBytes = 4 * 1024 * 1024;

// Keys name what a waiter waits for: a slot, a pipe instance, the set of
// pipe names (an instance that starts or stops listening), or one process
// (its pipe service thread).
constexpr std::uint32_t kPipeKeyBase = kSlotCount;
constexpr std::uint32_t kPipeNamesKey = kPipeKeyBase + kPipeInstanceCount;
constexpr std::uint32_t kProcessKeyBase = kPipeNamesKey + 1;
inline std::uint32_t SlotKey(std::uint32_t index) {
  return index;
}
inline std::uint32_t PipeKey(std::uint32_t index) {
  return kPipeKeyBase + index;
}

enum SlotKind : std::uint32_t {
  kFree = 0,
  kEvent = 1,
  kMutex = 2,
  kThread = 3,
  kMapping = 4,
};

// A process, told apart from a later one with the same pid by its start time.
struct ProcessId {
  std::int32_t pid;
  std::uint32_t reserved;
  std::uint64_t startTime;
};

struct Holder {
  ProcessId process;
  std::uint32_t count;
  std::uint32_t reserved;
};

struct Slot {
  std::uint32_t kind;
  std::uint32_t generation;
  WCHAR name[kNameCapacity];  // empty for unnamed objects
  Holder holders[kMaxHolders];
  // Events and threads.
  std::uint32_t signaled;
  std::uint32_t manualReset;
  // Mutexes: owner thread 0 = free.
  ProcessId ownerProcess;
  std::int32_t ownerThread;
  std::uint32_t recursion;
  std::uint32_t abandoned;
  // Threads.
  std::uint32_t exitCode;
  // Mappings: size, and where the storage lies in the region's arena.
  std::uint64_t mappingSize;
  std::uint64_t arenaOffset;
  std::uint64_t arenaLength;
};

// One direction of a pipe instance: a ring of records [u32 length][bytes]
// kept in Region::pipeData (apart from the instance table, so that looking
// through the table touches little memory).
struct PipeQueue {
  std::uint32_t readPos;
  std::uint32_t usedBytes;
  std::uint32_t messages;
  std::uint32_t headConsumed;  // bytes of the first message already read
};

enum PipeState : std::uint32_t {
  kPipeListening = 1,    // waiting for a client
  kPipeConnected = 2,    // a client is attached
  kPipeClosing = 3,      // the client closed its end; the server must disconnect
  kPipeDisconnected = 4  // DisconnectNamedPipe; ConnectNamedPipe makes it listen again
};

struct PipeInstance {
  std::uint32_t inUse;
  std::uint32_t generation;
  WCHAR name[kNameCapacity];  // lower case, after "\\.\pipe\"
  std::uint32_t maxInstances;
  std::uint32_t openMode;
  std::uint32_t pipeMode;
  std::uint32_t defaultTimeout;
  std::uint32_t state;
  std::uint32_t serverOpen;  // the server handle is open
  std::uint32_t clientOpen;  // a client handle of the current connection is open
  std::uint32_t connection;  // incremented for every client connection
  ProcessId server;
  ProcessId client;
  PipeQueue toClient;
  PipeQueue toServer;
};

// A thread asleep in a wait: it sleeps on `word`, which Notify bumps for
// any of its keys.
struct Waiter {
  std::uint32_t word;
  std::uint32_t inUse;
  ProcessId process;
  std::uint32_t keyCount;
  std::uint32_t reserved;
  std::uint32_t keys[kMaxWaitKeys];
};

// Saved bytes of the region that the current lock owner has changed.
struct JournalEntry {
  std::uint32_t offset;  // from the region's start
  std::uint32_t length;
};
struct Journal {
  std::uint32_t count;
  std::uint32_t bytes;
  JournalEntry entries[kJournalEntries];
  std::uint8_t data[kJournalBytes];
};

struct Region {
  std::uint64_t magic;
  std::uint32_t version;
  std::uint32_t reserved;
  std::uint64_t size;
  pthread_mutex_t lock;
  ProcessId lockOwner;       // the process that holds `lock` (never journalled)
  std::uint32_t waiterHigh;  // waiters[waiterHigh..] are all free
  std::uint32_t reserved2;
  Journal journal;
  Waiter waiters[kWaiterCount];
  Slot slots[kSlotCount];
  PipeInstance pipes[kPipeInstanceCount];
  // Ring storage of each instance: [0] server to client, [1] client to server.
  std::uint8_t pipeData[kPipeInstanceCount][2][kPipeQueueBytes];
};

// Mapping storage: an arena in the same memory file, after the region.
constexpr std::uint64_t kArenaGranularity = 64 * 1024;
constexpr std::uint64_t kArenaOffset =
    (sizeof(Region) + kArenaGranularity - 1) / kArenaGranularity * kArenaGranularity;
constexpr std::uint64_t kArenaBytes = 1ULL << 30;

// The region of this process's namespace, created or attached on first use.
Region& GetRegion();
// The memory file behind the region (for mapping views of the arena).
int RegionFd();
// The namespace name (SKYVANE_NAMESPACE or "skyvane-<uid>").
const char* NamespaceName();

// Scoped hold of the kernel lock. A thread may nest holds. A process that
// died holding it has its journalled changes rolled back and its objects
// cleaned up before the next owner goes on.
class Lock {
 public:
  Lock();
  ~Lock();
  Lock(const Lock&) = delete;
  Lock& operator=(const Lock&) = delete;
};

// Journals `length` bytes at `address` (inside the region) before the lock
// owner changes them.
void Save(const void* address, std::size_t length);
// Whether the current lock hold has already saved the bytes at `address`.
bool Journalled(const void* address);
template <class T>
void Touch(const T& object) {
  Save(&object, sizeof(T));
}

// Monotonic clock in nanoseconds.
std::int64_t NowNs();
// Deadline for a wait of `milliseconds` (already scaled); INFINITE → -1.
std::int64_t DeadlineAfter(DWORD milliseconds);
// Applies the time scale to a Sleep or wait time-out.
DWORD ScaleTimeout(DWORD milliseconds);
double Scale();

// Wakes every waiter that waits on `key`.
void Notify(std::uint32_t key);
// Sleeps (releasing the lock) until one of `keys` is notified, the deadline
// (-1 = none) passes or a signal arrives; the lock is held again on return.
// Callers look at their objects again afterwards: a wake-up may be spurious.
// Returns false once the deadline has passed.
bool WaitKeys(const std::uint32_t* keys, std::uint32_t count, std::int64_t deadlineNs);

// This process and a liveness test for others (zombies count as dead). The
// first test of a process starts watching it: when it dies, ReapProcess runs
// for it without anyone having to look.
const ProcessId& Self();
bool ProcessAlive(const ProcessId& process);
bool SameProcess(const ProcessId& a, const ProcessId& b);
// The calling thread's id (the Linux tid).
std::int32_t ThreadId();
// Cleans up after a dead process: its holds are dropped (objects left
// without holders are destroyed), its mutexes abandoned, its pipe ends
// closed and its waiter records freed. Idempotent.
void ReapProcess(const ProcessId& process);

// Slot management. Names are compared exactly; "Global\" and "Local\"
// prefixes are removed by NormalizeName first.
struct SlotRef {
  std::uint32_t index = 0;
  std::uint32_t generation = 0;
};
// Copies `name` without its "Global\"/"Local\" prefix into out[kNameCapacity];
// false when it does not fit.
bool NormalizeName(const WCHAR* name, WCHAR* out);
// Finds the live named slot (any kind); -1 when none. Holders that died are
// dropped first, and a slot left without holders is freed.
int FindNamed(const WCHAR* normalizedName);
// Allocates a slot of `kind` (name may be null or empty) held once by this
// process. False when the table is full.
bool AllocateSlot(SlotKind kind, const WCHAR* normalizedName, SlotRef* ref);
Slot* SlotOf(const SlotRef& ref);  // null when the slot no longer matches
void AddHolder(const SlotRef& ref);
// Drops one hold of this process; frees the slot when no process holds it.
void DropHolder(const SlotRef& ref);

// Hooks of the object kinds, called with the lock held.
// A mapping slot is being freed: its arena range is given back.
void MappingSlotFreed(const Slot& slot);
// Mutexes owned by `process` become abandoned.
void AbandonMutexesOfProcess(const ProcessId& process);
// Pipe ends held by `process` are closed on its behalf.
void ClosePipeEndsOfProcess(const ProcessId& process);

// Internal: the start time of a process read from /proc (false when it is
// gone).
bool ReadProcessStart(std::int32_t pid, char* state, std::uint64_t* startTime);

// Test hook: when `name` matches the crash point set by the test, the
// process is killed on the spot (inside the kernel lock).
void CrashPoint(const char* name);
void SetCrashPoint(const char* name);

}  // namespace emu::kernel
