// CreateThread threads and critical sections.
#include <pthread.h>

#include <atomic>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <mutex>
#include <utility>

#include "platform/posix/kernel.h"
#include "platform/posix/slot_object.h"
#include "platform/posix/win32_sync.h"

namespace emu {
namespace {

std::atomic<long> g_runningThreads{0};

struct ThreadStart {
  LPTHREAD_START_ROUTINE routine = nullptr;
  LPVOID parameter = nullptr;
  kernel::SlotRef ref;
  DWORD exitCode = 0;
  std::mutex lock;
  std::condition_variable started;
  std::int32_t threadId = 0;
};

thread_local ThreadStart* t_current = nullptr;

// Runs when the thread ends, by return or by ExitThread (pthread_exit unwinds
// through it): the thread's mutexes become abandoned, the count drops and the
// thread object is signalled with the exit code.
struct ThreadFinisher {
  std::shared_ptr<ThreadStart> start;
  ~ThreadFinisher() {
    {
      kernel::Lock lock;
      AbandonMutexesOfThread(kernel::ThreadId());
      g_runningThreads.fetch_sub(1);
      kernel::Slot* slot = kernel::SlotOf(start->ref);
      if (slot != nullptr) {
        kernel::Touch(*slot);
        slot->exitCode = start->exitCode;
        slot->signaled = 1;
        kernel::Notify(kernel::SlotKey(start->ref.index));
      }
      kernel::DropHolder(start->ref);
    }
    t_current = nullptr;
  }
};

void* ThreadMain(void* argument) {
  std::shared_ptr<ThreadStart> start =
      std::move(*static_cast<std::shared_ptr<ThreadStart>*>(argument));
  delete static_cast<std::shared_ptr<ThreadStart>*>(argument);
  t_current = start.get();
  {
    std::lock_guard<std::mutex> guard(start->lock);
    start->threadId = kernel::ThreadId();
  }
  start->started.notify_all();
  ThreadFinisher finisher{start};
  start->exitCode = start->routine(start->parameter);
  return nullptr;
}

}  // namespace

long RunningThreadCount() {
  return g_runningThreads.load();
}

}  // namespace emu

HANDLE CreateThread(LPSECURITY_ATTRIBUTES /*attributes*/, SIZE_T stackSize,
                    LPTHREAD_START_ROUTINE startAddress, LPVOID parameter, DWORD creationFlags,
                    LPDWORD threadId) {
  if (startAddress == nullptr || (creationFlags & CREATE_SUSPENDED) != 0) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return nullptr;
  }
  HANDLE handle = emu::CreateSlotHandle(emu::kernel::kThread, nullptr, [](emu::kernel::Slot&) {});
  if (handle == nullptr) return nullptr;
  auto object = emu::LookupSlotObject(handle, emu::kernel::kThread);
  auto start = std::make_shared<emu::ThreadStart>();
  start->routine = startAddress;
  start->parameter = parameter;
  start->ref = object->Ref();
  {
    emu::kernel::Lock lock;
    emu::kernel::AddHolder(start->ref);  // the running thread's own hold
  }
  emu::g_runningThreads.fetch_add(1);

  pthread_attr_t attr;
  pthread_attr_init(&attr);
  pthread_attr_setdetachstate(&attr, PTHREAD_CREATE_DETACHED);
  if (stackSize != 0) {
    SIZE_T size = stackSize < 64 * 1024 ? 64 * 1024 : stackSize;
    pthread_attr_setstacksize(&attr, size);
  }
  pthread_t thread;
  auto* argument = new std::shared_ptr<emu::ThreadStart>(start);
  int result = pthread_create(&thread, &attr, emu::ThreadMain, argument);
  pthread_attr_destroy(&attr);
  if (result != 0) {
    emu::g_runningThreads.fetch_sub(1);
    {
      emu::kernel::Lock lock;
      emu::kernel::DropHolder(start->ref);
    }
    delete argument;
    emu::ReleaseHandle(handle);
    SetLastError(ERROR_NOT_ENOUGH_MEMORY);
    return nullptr;
  }
  if (threadId != nullptr) {
    std::unique_lock<std::mutex> guard(start->lock);
    start->started.wait(guard, [start] { return start->threadId != 0; });
    *threadId = static_cast<DWORD>(start->threadId);
  }
  SetLastError(ERROR_SUCCESS);
  return handle;
}

void ExitThread(DWORD exitCode) {
  if (emu::t_current != nullptr) emu::t_current->exitCode = exitCode;
  pthread_exit(nullptr);
}

BOOL GetExitCodeThread(HANDLE thread, LPDWORD exitCode) {
  auto object = emu::LookupSlotObject(thread, emu::kernel::kThread);
  if (object == nullptr) return FALSE;
  if (exitCode == nullptr) {
    SetLastError(ERROR_NOACCESS);
    return FALSE;
  }
  emu::kernel::Lock lock;
  emu::kernel::Slot* slot = emu::kernel::SlotOf(object->Ref());
  if (slot == nullptr) {
    SetLastError(ERROR_INVALID_HANDLE);
    return FALSE;
  }
  *exitCode = slot->signaled != 0 ? slot->exitCode : STILL_ACTIVE;
  return TRUE;
}

// ---- Critical sections: a recursive pthread mutex kept behind DebugInfo ----

namespace {

pthread_mutex_t* SectionLock(LPCRITICAL_SECTION section) {
  auto* lock = static_cast<pthread_mutex_t*>(section->DebugInfo);
  if (lock == nullptr) {
    std::fprintf(stderr, "skyvane emulation: critical section used before initialisation\n");
    std::abort();
  }
  return lock;
}

}  // namespace

void InitializeCriticalSection(LPCRITICAL_SECTION section) {
  auto* lock = new pthread_mutex_t;
  pthread_mutexattr_t attr;
  pthread_mutexattr_init(&attr);
  pthread_mutexattr_settype(&attr, PTHREAD_MUTEX_RECURSIVE);
  pthread_mutex_init(lock, &attr);
  pthread_mutexattr_destroy(&attr);
  *section = CRITICAL_SECTION{};
  section->DebugInfo = lock;
  section->LockCount = -1;
}

void EnterCriticalSection(LPCRITICAL_SECTION section) {
  pthread_mutex_lock(SectionLock(section));
}

void LeaveCriticalSection(LPCRITICAL_SECTION section) {
  pthread_mutex_unlock(SectionLock(section));
}

BOOL TryEnterCriticalSection(LPCRITICAL_SECTION section) {
  return pthread_mutex_trylock(SectionLock(section)) == 0 ? TRUE : FALSE;
}

void DeleteCriticalSection(LPCRITICAL_SECTION section) {
  auto* lock = static_cast<pthread_mutex_t*>(section->DebugInfo);
  if (lock == nullptr) return;
  pthread_mutex_destroy(lock);
  delete lock;
  section->DebugInfo = nullptr;
}
