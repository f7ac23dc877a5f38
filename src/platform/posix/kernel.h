// The emulation's "kernel": one shared region per namespace (a file in
// /dev/shm, mapped by every process of the namespace) holding the state of
// every waitable object, named object, mapping descriptor and pipe instance,
// guarded by one robust process-shared mutex with one process-shared
// condition variable that is broadcast on every change of state. Waits of
// any kind are condition waits on that variable, which gives exact
// multi-object wait semantics within and across processes.
//
// Everything here except Lock's constructor and the time helpers must be
// called with the lock held.
#pragma once

#include <pthread.h>

#include <cstdint>

#include "platform/posix/win32_base.h"

namespace emu::kernel {

constexpr std::uint32_t kSlotCount = 1024;
constexpr std::uint32_t kNameCapacity = 260;  // units, terminator included
constexpr std::uint32_t kMaxHolders = 16;
constexpr std::uint32_t kPipeInstanceCount = 64;
constexpr std::uint32_t kPipeQueueBytes = 64 * 1024;

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
  // Mappings.
  std::uint64_t mappingSize;
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

struct Region {
  std::uint64_t magic;
  std::uint32_t version;
  std::uint32_t reserved;
  std::uint64_t size;
  pthread_mutex_t lock;
  pthread_cond_t changed;
  std::uint64_t changeCount;
  Slot slots[kSlotCount];
  PipeInstance pipes[kPipeInstanceCount];
  // Ring storage of each instance: [0] server to client, [1] client to server.
  std::uint8_t pipeData[kPipeInstanceCount][2][kPipeQueueBytes];
};

// The region of this process's namespace, created or attached on first use.
Region& GetRegion();
// The namespace name (SKYVANE_NAMESPACE or "skyvane-<uid>").
const char* NamespaceName();
// "/dev/shm/<namespace>" and the prefix of the namespace's other files.
const char* RegionPath();

// Scoped hold of the kernel lock (a process that died holding it leaves it
// consistent again for the next owner). A thread may nest holds.
class Lock {
 public:
  Lock();
  ~Lock();
  Lock(const Lock&) = delete;
  Lock& operator=(const Lock&) = delete;
};

// Monotonic clock in nanoseconds.
std::int64_t NowNs();
// Deadline for a wait of `milliseconds` (already scaled); INFINITE → -1.
std::int64_t DeadlineAfter(DWORD milliseconds);
// Applies the time scale to a Sleep or wait time-out.
DWORD ScaleTimeout(DWORD milliseconds);
double Scale();

// Marks a change of state: wakes every waiter of every process.
void Broadcast();
// Waits for the next change or until `deadlineNs` (-1 = none). A wait lasts
// at most `pollMs` real milliseconds so that callers can look again at
// processes that may have died. Returns false once the deadline has passed.
bool WaitChange(std::int64_t deadlineNs, int pollMs = 1000);
// Short poll used by waits that depend on other processes staying alive.
constexpr int kLivenessPollMs = 100;

// This process and a liveness test for others (zombies count as dead).
const ProcessId& Self();
bool ProcessAlive(const ProcessId& process);
bool SameProcess(const ProcessId& a, const ProcessId& b);
// The calling thread's id (the Linux tid).
std::int32_t ThreadId();

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

// Called whenever a slot is freed (mappings unlink their storage file).
void MappingSlotFreed(std::uint32_t index, std::uint32_t generation);

}  // namespace emu::kernel
