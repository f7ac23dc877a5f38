// Finding or creating the namespace's region.
//
// The region is an anonymous memory file (memfd). Every process that uses it
// binds an abstract Unix socket named "skyvane:<namespace>:m:<pid>:<fd>";
// the kernel drops that name when the process ends, however it ends. A new
// process reads the names from /proc/net/unix and opens the region through
// /proc/<pid>/fd/<fd> of any member. Creation is serialised by another
// abstract name, "...:init", held while a process looks for members. When
// the last member ends, the memory file goes with it: nothing is left behind.
#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
#include <sys/mman.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <time.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "platform/posix/kernel.h"

namespace emu::kernel {
namespace {

constexpr std::uint64_t kMagic = 0x314C4E524B56534BULL;  // "KSVKRNL1"
constexpr std::uint32_t kVersion = 6;
constexpr std::uint64_t kFileBytes = kArenaOffset + kArenaBytes;

[[noreturn]] void Die(const char* what) {
  std::fprintf(stderr, "skyvane emulation: %s failed: %s\n", what, std::strerror(errno));
  std::abort();
}

std::string& NamespaceString() {
  static std::string* name = [] {
    const char* env = std::getenv("SKYVANE_NAMESPACE");
    std::string value = env != nullptr && env[0] != '\0'
                            ? std::string(env)
                            : "skyvane-" + std::to_string(static_cast<unsigned long>(getuid()));
    return new std::string(value);
  }();
  return *name;
}

// The socket-name stem: the namespace itself when it is short and plain,
// otherwise a hash of it (abstract names hold at most 107 bytes).
std::string Stem() {
  const std::string& name = NamespaceString();
  bool plain = name.size() <= 48;
  for (char c : name) plain = plain && c > ' ' && c != ':' && c != '@' && c != 0x7F;
  if (plain) return "skyvane:" + name;
  std::uint64_t hash = 1469598103934665603ULL;
  for (char c : name) hash = (hash ^ static_cast<unsigned char>(c)) * 1099511628211ULL;
  char text[32];
  std::snprintf(text, sizeof(text), "%016llx", static_cast<unsigned long long>(hash));
  return std::string("skyvane:#") + text;
}

// A datagram socket bound to the abstract `name`; -1 with errno when taken.
int BindAbstract(const std::string& name) {
  int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  if (fd < 0) Die("socket for the namespace");
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path + 1, name.data(), name.size());
  auto length = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + 1 + name.size());
  if (bind(fd, reinterpret_cast<sockaddr*>(&address), length) != 0) {
    int error = errno;
    close(fd);
    errno = error;
    return -1;
  }
  return fd;
}

bool ValidRegion(int fd) {
  struct stat info {};
  if (fstat(fd, &info) != 0 || static_cast<std::uint64_t>(info.st_size) != kFileBytes) return false;
  struct Header {
    std::uint64_t magic;
    std::uint32_t version;
    std::uint32_t reserved;
    std::uint64_t size;
  } header{};
  static_assert(offsetof(Region, lock) == sizeof(Header));
  if (pread(fd, &header, sizeof(header), 0) != static_cast<ssize_t>(sizeof(header))) return false;
  return header.magic == kMagic && header.version == kVersion && header.size == sizeof(Region);
}

// Opens the region of a live member, or returns -1 when there is none.
int OpenFromMember(const std::string& stem) {
  FILE* table = std::fopen("/proc/net/unix", "re");
  if (table == nullptr) return -1;
  std::string prefix = "@" + stem + ":m:";
  char line[512];
  int found = -1;
  while (found < 0 && std::fgets(line, sizeof(line), table) != nullptr) {
    char* path = std::strchr(line, '@');
    if (path == nullptr || std::strncmp(path, prefix.c_str(), prefix.size()) != 0) continue;
    int pid = 0;
    int memberFd = 0;
    if (std::sscanf(path + prefix.size(), "%d:%d", &pid, &memberFd) != 2) continue;
    if (pid == getpid()) continue;
    char procPath[64];
    std::snprintf(procPath, sizeof(procPath), "/proc/%d/fd/%d", pid, memberFd);
    int fd = open(procPath, O_RDWR | O_CLOEXEC);
    if (fd < 0) continue;  // gone in the meantime
    if (ValidRegion(fd)) {
      found = fd;
    } else {
      close(fd);
    }
  }
  std::fclose(table);
  return found;
}

void InitializeRegion(Region* region) {
  pthread_mutexattr_t mutexAttr;
  pthread_mutexattr_init(&mutexAttr);
  pthread_mutexattr_setpshared(&mutexAttr, PTHREAD_PROCESS_SHARED);
  pthread_mutexattr_setrobust(&mutexAttr, PTHREAD_MUTEX_ROBUST);
  pthread_mutex_init(&region->lock, &mutexAttr);
  pthread_mutexattr_destroy(&mutexAttr);
  region->size = sizeof(Region);
  region->version = kVersion;
  region->magic = kMagic;
}

int g_regionFd = -1;
int g_memberSocket = -1;
Region* g_region = nullptr;
ProcessId g_self{};

// Reads state and start time of `pid` from /proc; false when it is gone.
bool ReadProcess(std::int32_t pid, char* state, std::uint64_t* startTime) {
  char path[64];
  std::snprintf(path, sizeof(path), "/proc/%d/stat", pid);
  int fd;
  do {
    fd = open(path, O_RDONLY | O_CLOEXEC);
  } while (fd < 0 && errno == EINTR);
  if (fd < 0) return false;
  char buffer[1024];
  ssize_t length;
  do {
    length = read(fd, buffer, sizeof(buffer) - 1);
  } while (length < 0 && errno == EINTR);
  close(fd);
  if (length <= 0) return false;
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

void Advertise() {
  std::string name = Stem() + ":m:" + std::to_string(getpid()) + ":" + std::to_string(g_regionFd);
  g_memberSocket = BindAbstract(name);
  if (g_memberSocket < 0) Die("bind of the namespace member name");
}

// A child has the parent's mapping and file, and becomes a member itself. A
// kernel lock held by another thread of the parent at the fork is that
// thread's: the parent releases it in the shared region as usual.
void ForkChild() {
  g_self = ReadSelf();
  close(g_memberSocket);
  Advertise();
}

Region* Attach() {
  g_self = ReadSelf();
  const std::string stem = Stem();
  int initSocket;
  const std::int64_t giveUp = NowNs() + 30LL * 1000000000LL;
  while ((initSocket = BindAbstract(stem + ":init")) < 0) {
    if (errno != EADDRINUSE || NowNs() > giveUp) Die("bind of the namespace init name");
    timespec pause{0, 200000};  // another process is attaching; it takes microseconds
    nanosleep(&pause, nullptr);
  }
  int fd = OpenFromMember(stem);
  bool fresh = fd < 0;
  if (fresh) {
    fd = memfd_create(("skyvane:" + NamespaceString()).c_str(), MFD_CLOEXEC);
    if (fd < 0) Die("memfd_create of the region");
    if (ftruncate(fd, static_cast<off_t>(kFileBytes)) != 0) Die("ftruncate of the region");
  }
  void* memory = mmap(nullptr, sizeof(Region), PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
  if (memory == MAP_FAILED) Die("mmap of the region");
  auto* region = static_cast<Region*>(memory);
  if (fresh) InitializeRegion(region);
  g_regionFd = fd;
  g_region = region;
  Advertise();
  close(initSocket);
  pthread_atfork(nullptr, nullptr, ForkChild);
  return region;
}

}  // namespace

Region& GetRegion() {
  static Region* region = Attach();
  return *region;
}

int RegionFd() {
  GetRegion();
  return g_regionFd;
}

const char* NamespaceName() {
  return NamespaceString().c_str();
}

const ProcessId& Self() {
  GetRegion();
  return g_self;
}

bool ReadProcessStart(std::int32_t pid, char* state, std::uint64_t* startTime) {
  return ReadProcess(pid, state, startTime);
}

}  // namespace emu::kernel
