#include "platform/posix/kernel.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/file.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <new>
#include <string>

namespace emu::kernel {
namespace {

constexpr std::uint64_t kMagic = 0x314C4E524B56534BULL;  // "KSVKRNL1"
constexpr std::uint32_t kVersion = 4;

std::string& NamespaceString() {
  static std::string* name = [] {
    const char* env = std::getenv("SKYVANE_NAMESPACE");
    std::string value = env != nullptr && env[0] != '\0'
                            ? std::string(env)
                            : "skyvane-" + std::to_string(static_cast<unsigned long>(getuid()));
    for (char& c : value) {
      if (c == '/') c = '_';
    }
    return new std::string(value);
  }();
  return *name;
}

std::string& RegionPathString() {
  static std::string* path = new std::string("/dev/shm/" + NamespaceString());
  return *path;
}

void Die(const char* what) {
  std::fprintf(stderr, "skyvane emulation: %s failed: %s\n", what, std::strerror(errno));
  std::abort();
}

// The file is new and zero-filled (pages stay unallocated until used).
void InitializeRegion(Region* region) {
  pthread_mutexattr_t mutexAttr;
  pthread_mutexattr_init(&mutexAttr);
  pthread_mutexattr_setpshared(&mutexAttr, PTHREAD_PROCESS_SHARED);
  pthread_mutexattr_setrobust(&mutexAttr, PTHREAD_MUTEX_ROBUST);
  pthread_mutex_init(&region->lock, &mutexAttr);
  pthread_mutexattr_destroy(&mutexAttr);
  pthread_condattr_t condAttr;
  pthread_condattr_init(&condAttr);
  pthread_condattr_setpshared(&condAttr, PTHREAD_PROCESS_SHARED);
  pthread_condattr_setclock(&condAttr, CLOCK_MONOTONIC);
  pthread_cond_init(&region->changed, &condAttr);
  pthread_condattr_destroy(&condAttr);
  region->size = sizeof(Region);
  region->version = kVersion;
  region->magic = kMagic;
}

// Creates or attaches the region. An flock on the file serialises the first
// initialisation between processes; a file of another layout is replaced.
Region* AttachRegion() {
  const char* path = RegionPathString().c_str();
  int fd = open(path, O_RDWR | O_CREAT | O_CLOEXEC, 0600);
  if (fd < 0) Die("open of the shared region");
  if (flock(fd, LOCK_EX) != 0) Die("flock of the shared region");
  struct stat info {};
  if (fstat(fd, &info) != 0) Die("fstat of the shared region");
  bool fresh = static_cast<std::uint64_t>(info.st_size) != sizeof(Region);
  if (!fresh) {
    struct Header {
      std::uint64_t magic;
      std::uint32_t version;
      std::uint32_t reserved;
      std::uint64_t size;
    } header{};
    static_assert(offsetof(Region, lock) == sizeof(Header));
    if (pread(fd, &header, sizeof(header), 0) != static_cast<ssize_t>(sizeof(header))) {
      fresh = true;
    } else {
      fresh = header.magic != kMagic || header.version != kVersion || header.size != sizeof(Region);
    }
  }
  if (fresh) {
    if (ftruncate(fd, 0) != 0 || ftruncate(fd, static_cast<off_t>(sizeof(Region))) != 0) {
      Die("ftruncate of the shared region");
    }
  }
  void* memory = mmap(nullptr, sizeof(Region), PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
  if (memory == MAP_FAILED) Die("mmap of the shared region");
  auto* region = static_cast<Region*>(memory);
  if (fresh) InitializeRegion(region);
  flock(fd, LOCK_UN);
  close(fd);
  return region;
}

ProcessId g_self{};

// Reads state and start time of `pid` from /proc; false when it is gone.
bool ReadProcess(std::int32_t pid, char* state, std::uint64_t* startTime) {
  char path[64];
  std::snprintf(path, sizeof(path), "/proc/%d/stat", pid);
  FILE* file = std::fopen(path, "re");
  if (file == nullptr) return false;
  char buffer[1024];
  size_t length = std::fread(buffer, 1, sizeof(buffer) - 1, file);
  std::fclose(file);
  buffer[length] = '\0';
  const char* close = std::strrchr(buffer, ')');
  if (close == nullptr) return false;
  const char* p = close + 1;
  while (*p == ' ') ++p;
  *state = *p;
  int field = 3;
  while (*p != '\0' && field < 22) {
    while (*p != ' ' && *p != '\0') ++p;
    while (*p == ' ') ++p;
    ++field;
  }
  *startTime = field == 22 ? std::strtoull(p, nullptr, 10) : 0;
  return true;
}

ProcessId ReadSelf() {
  ProcessId id{};
  id.pid = static_cast<std::int32_t>(getpid());
  char state = 0;
  ReadProcess(id.pid, &state, &id.startTime);  // on failure 0, which still matches itself
  return id;
}

void ForkChild() {
  g_self = ReadSelf();
}

bool NameEqual(const WCHAR* a, const WCHAR* b) {
  for (std::uint32_t i = 0; i < kNameCapacity; ++i) {
    if (a[i] != b[i]) return false;
    if (a[i] == 0) return true;
  }
  return true;
}

void FreeSlot(Slot& slot, std::uint32_t index) {
  std::uint32_t kind = slot.kind;
  std::uint32_t generation = slot.generation;
  std::uint32_t nextGeneration = slot.generation + 1;
  std::memset(static_cast<void*>(&slot), 0, sizeof(Slot));
  slot.generation = nextGeneration;
  if (kind == kMapping) MappingSlotFreed(index, generation);
}

// Drops holders that died; frees the slot (and returns true) when none is left.
bool SweepSlot(Slot& slot, std::uint32_t index) {
  bool anyLeft = false;
  for (Holder& holder : slot.holders) {
    if (holder.count == 0) continue;
    if (!SameProcess(holder.process, Self()) && !ProcessAlive(holder.process)) {
      holder = Holder{};
      continue;
    }
    anyLeft = true;
  }
  if (!anyLeft) {
    FreeSlot(slot, index);
    return true;
  }
  return false;
}

}  // namespace

Region& GetRegion() {
  static Region* region = [] {
    g_self = ReadSelf();
    pthread_atfork(nullptr, nullptr, ForkChild);
    return AttachRegion();
  }();
  return *region;
}

const char* NamespaceName() {
  return NamespaceString().c_str();
}
const char* RegionPath() {
  return RegionPathString().c_str();
}

namespace {
// Nested holds by one thread (an object released while the lock is held
// takes it again to drop its slot) lock the mutex only once.
thread_local int t_lockDepth = 0;
}  // namespace

Lock::Lock() {
  if (t_lockDepth++ != 0) return;
  Region& region = GetRegion();
  int result = pthread_mutex_lock(&region.lock);
  if (result == EOWNERDEAD) {
    pthread_mutex_consistent(&region.lock);
  } else if (result != 0) {
    errno = result;
    Die("lock of the shared region");
  }
}

Lock::~Lock() {
  if (--t_lockDepth == 0) pthread_mutex_unlock(&GetRegion().lock);
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

void Broadcast() {
  Region& region = GetRegion();
  ++region.changeCount;
  pthread_cond_broadcast(&region.changed);
}

bool WaitChange(std::int64_t deadlineNs, int pollMs) {
  std::int64_t now = NowNs();
  if (deadlineNs >= 0 && now >= deadlineNs) return false;
  std::int64_t until = now + static_cast<std::int64_t>(pollMs) * 1000000LL;
  if (deadlineNs >= 0 && deadlineNs < until) until = deadlineNs;
  timespec at{};
  at.tv_sec = static_cast<time_t>(until / 1000000000LL);
  at.tv_nsec = static_cast<long>(until % 1000000000LL);
  Region& region = GetRegion();
  int result = pthread_cond_timedwait(&region.changed, &region.lock, &at);
  if (result == EOWNERDEAD) pthread_mutex_consistent(&region.lock);
  return deadlineNs < 0 || NowNs() < deadlineNs;
}

const ProcessId& Self() {
  GetRegion();
  return g_self;
}

bool SameProcess(const ProcessId& a, const ProcessId& b) {
  return a.pid == b.pid && a.startTime == b.startTime;
}

bool ProcessAlive(const ProcessId& process) {
  if (process.pid <= 0) return false;
  if (SameProcess(process, Self())) return true;
  char state = 0;
  std::uint64_t startTime = 0;
  if (!ReadProcess(process.pid, &state, &startTime)) return false;
  if (state == 'Z' || state == 'X') return false;
  return process.startTime == 0 || startTime == process.startTime;
}

std::int32_t ThreadId() {
  return static_cast<std::int32_t>(gettid());
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
    if (SweepSlot(slot, i)) return -1;
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
    for (std::uint32_t i = 0; i < kSlotCount; ++i) {
      if (region.slots[i].kind != kFree) SweepSlot(region.slots[i], i);
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
      ++holder.count;
      return;
    }
    if (holder.count == 0 && empty == nullptr) empty = &holder;
  }
  if (empty == nullptr) {
    // Every entry taken: make room by dropping processes that died.
    for (Holder& holder : slot->holders) {
      if (!ProcessAlive(holder.process)) {
        holder = Holder{};
        if (empty == nullptr) empty = &holder;
      }
    }
  }
  if (empty == nullptr) {
    std::fprintf(stderr, "skyvane emulation: more than %u processes hold one object\n",
                 kMaxHolders);
    std::abort();
  }
  empty->process = Self();
  empty->count = 1;
}

void DropHolder(const SlotRef& ref) {
  Slot* slot = SlotOf(ref);
  if (slot == nullptr) return;
  bool anyLeft = false;
  for (Holder& holder : slot->holders) {
    if (holder.count != 0 && SameProcess(holder.process, Self())) {
      if (--holder.count == 0) holder = Holder{};
    }
    if (holder.count != 0) anyLeft = true;
  }
  if (!anyLeft) FreeSlot(*slot, ref.index);
}

}  // namespace emu::kernel
