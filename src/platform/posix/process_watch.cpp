// Liveness of the other processes of the namespace, and cleanup after them.
//
// The first time this process asks whether another one is alive, it opens a
// pidfd for it (checked against the start time, so a reused pid is never
// taken for the old process) and hands it to its watcher thread. The
// watcher sleeps in poll() on those pidfds; when one becomes readable the
// process has ended, and the watcher runs ReapProcess for it under the
// kernel lock, which wakes whoever waited on its objects. Later liveness
// tests of a watched process are one poll() of its pidfd.
#include <errno.h>
#include <poll.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdint>
#include <mutex>
#include <vector>

#include "platform/posix/kernel.h"

namespace emu::kernel {
namespace {

struct Watched {
  ProcessId process;
  int pidfd;
};

struct Watch {
  std::mutex lock;
  std::vector<Watched> processes;
  int wakeFd = -1;  // eventfd: the set changed
  bool threadRunning = false;
};

Watch* g_watch = nullptr;

void ForkChild() {
  // The child has no watcher thread; it starts its own when it needs one.
  g_watch = new Watch();
}

Watch& GetWatch() {
  static Watch* watch = [] {
    g_watch = new Watch();
    pthread_atfork(nullptr, nullptr, ForkChild);
    return g_watch;
  }();
  (void)watch;
  return *g_watch;
}

bool Readable(int fd) {
  pollfd entry{fd, POLLIN, 0};
  int result;
  do {
    result = poll(&entry, 1, 0);
  } while (result < 0 && errno == EINTR);
  return result > 0;
}

void* WatcherThread(void* argument) {
  auto* watch = static_cast<Watch*>(argument);
  std::vector<pollfd> fds;
  std::vector<ProcessId> ids;
  for (;;) {
    fds.clear();
    ids.clear();
    {
      std::lock_guard<std::mutex> guard(watch->lock);
      fds.push_back(pollfd{watch->wakeFd, POLLIN, 0});
      for (const Watched& w : watch->processes) {
        fds.push_back(pollfd{w.pidfd, POLLIN, 0});
        ids.push_back(w.process);
      }
    }
    if (poll(fds.data(), fds.size(), -1) < 0) continue;  // EINTR: look again
    if ((fds[0].revents & POLLIN) != 0) {
      std::uint64_t count = 0;
      static_cast<void>(read(watch->wakeFd, &count, sizeof(count)));
    }
    std::vector<ProcessId> dead;
    for (std::size_t i = 1; i < fds.size(); ++i) {
      if (fds[i].revents != 0) dead.push_back(ids[i - 1]);
    }
    if (dead.empty()) continue;
    {
      Lock lock;
      for (const ProcessId& process : dead) ReapProcess(process);
    }
    std::lock_guard<std::mutex> guard(watch->lock);
    for (const ProcessId& process : dead) {
      for (auto it = watch->processes.begin(); it != watch->processes.end(); ++it) {
        if (SameProcess(it->process, process)) {
          close(it->pidfd);
          watch->processes.erase(it);
          break;
        }
      }
    }
  }
  return nullptr;
}

// Called with watch.lock held.
void StartWatching(Watch& watch, const ProcessId& process, int pidfd) {
  watch.processes.push_back(Watched{process, pidfd});
  if (!watch.threadRunning) {
    watch.wakeFd = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    pthread_t thread;
    pthread_attr_t attr;
    pthread_attr_init(&attr);
    pthread_attr_setdetachstate(&attr, PTHREAD_CREATE_DETACHED);
    pthread_attr_setstacksize(&attr, 256 * 1024);
    watch.threadRunning = pthread_create(&thread, &attr, WatcherThread, &watch) == 0;
    pthread_attr_destroy(&attr);
    return;
  }
  std::uint64_t one = 1;
  static_cast<void>(write(watch.wakeFd, &one, sizeof(one)));
}

}  // namespace

bool ProcessAlive(const ProcessId& process) {
  if (process.pid <= 0) return false;
  if (SameProcess(process, Self())) return true;
  Watch& watch = GetWatch();
  std::lock_guard<std::mutex> guard(watch.lock);
  for (const Watched& w : watch.processes) {
    if (SameProcess(w.process, process)) return !Readable(w.pidfd);
  }
  int pidfd = static_cast<int>(syscall(SYS_pidfd_open, process.pid, 0));
  if (pidfd < 0) return false;  // ESRCH: gone and reaped
  // The pid may belong to a later process by now.
  char state = 0;
  std::uint64_t startTime = 0;
  bool same = ReadProcessStart(process.pid, &state, &startTime) && state != 'Z' && state != 'X' &&
              (process.startTime == 0 || startTime == process.startTime);
  if (!same || Readable(pidfd)) {
    close(pidfd);
    return false;
  }
  StartWatching(watch, process, pidfd);
  return true;
}

}  // namespace emu::kernel
