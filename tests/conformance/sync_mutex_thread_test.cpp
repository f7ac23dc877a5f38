// Mutexes (recursive ownership, release by a non-owner, abandonment), threads
// (signalled at their end, exit codes, per-thread last error) and critical
// sections.
#include <gtest/gtest.h>

#include "support/test_support.h"

namespace {

using skytest::Handle;
using skytest::kGuardMs;

// Runs `procedure(parameter)` on a new thread, waits for it and returns its
// exit code (0xFFFFFFFF if the thread could not be run).
DWORD RunOnThread(LPTHREAD_START_ROUTINE procedure, LPVOID parameter) {
  Handle thread(CreateThread(nullptr, 0, procedure, parameter, 0, nullptr));
  if (!thread || WaitForSingleObject(thread.Get(), kGuardMs) != WAIT_OBJECT_0) return 0xFFFFFFFF;
  DWORD code = 0xFFFFFFFF;
  GetExitCodeThread(thread.Get(), &code);
  return code;
}

// Tries the mutex without waiting from another thread; releases it again if
// it was taken. Returns the wait result.
DWORD WINAPI TryTakeMutex(LPVOID parameter) {
  HANDLE mutex = parameter;
  DWORD result = WaitForSingleObject(mutex, 0);
  if (result == WAIT_OBJECT_0 || result == WAIT_ABANDONED) ReleaseMutex(mutex);
  return result;
}

DWORD WINAPI ReleaseForeignMutex(LPVOID parameter) {
  SetLastError(0);
  if (ReleaseMutex(parameter)) return 0;
  return GetLastError();
}

TEST(Mutex, OwnerTakesItAgainAndNeedsAsManyReleases) {
  Handle mutex(CreateMutexW(nullptr, FALSE, nullptr));
  ASSERT_TRUE(mutex);
  EXPECT_EQ(RunOnThread(TryTakeMutex, mutex.Get()), WAIT_OBJECT_0);  // free at first

  ASSERT_EQ(WaitForSingleObject(mutex.Get(), 0), WAIT_OBJECT_0);
  ASSERT_EQ(WaitForSingleObject(mutex.Get(), kGuardMs), WAIT_OBJECT_0);  // owner again
  EXPECT_EQ(RunOnThread(TryTakeMutex, mutex.Get()), WAIT_TIMEOUT);
  EXPECT_EQ(RunOnThread(ReleaseForeignMutex, mutex.Get()), ERROR_NOT_OWNER);

  ASSERT_TRUE(ReleaseMutex(mutex.Get()));
  EXPECT_EQ(RunOnThread(TryTakeMutex, mutex.Get()), WAIT_TIMEOUT);  // still held once
  ASSERT_TRUE(ReleaseMutex(mutex.Get()));
  EXPECT_EQ(RunOnThread(TryTakeMutex, mutex.Get()), WAIT_OBJECT_0);

  SetLastError(0);
  EXPECT_FALSE(ReleaseMutex(mutex.Get()));
  EXPECT_EQ(GetLastError(), ERROR_NOT_OWNER);
}

TEST(Mutex, InitialOwnerIsTheCreatingThread) {
  Handle mutex(CreateMutexW(nullptr, TRUE, nullptr));
  ASSERT_TRUE(mutex);
  EXPECT_EQ(RunOnThread(TryTakeMutex, mutex.Get()), WAIT_TIMEOUT);
  ASSERT_TRUE(ReleaseMutex(mutex.Get()));
  EXPECT_EQ(RunOnThread(TryTakeMutex, mutex.Get()), WAIT_OBJECT_0);
}

DWORD WINAPI TakeMutexAndEnd(LPVOID parameter) {
  return WaitForSingleObject(parameter, kGuardMs);
}

TEST(Mutex, OwnerThreadEndingAbandonsItToTheNextWaiter) {
  Handle mutex(CreateMutexW(nullptr, FALSE, nullptr));
  ASSERT_TRUE(mutex);
  ASSERT_EQ(RunOnThread(TakeMutexAndEnd, mutex.Get()), WAIT_OBJECT_0);

  // The next waiter gets it, told that it was abandoned, and owns it now.
  ASSERT_EQ(WaitForSingleObject(mutex.Get(), kGuardMs), WAIT_ABANDONED);
  EXPECT_EQ(RunOnThread(TryTakeMutex, mutex.Get()), WAIT_TIMEOUT);
  ASSERT_TRUE(ReleaseMutex(mutex.Get()));
  // Abandonment is reported once only.
  ASSERT_EQ(WaitForSingleObject(mutex.Get(), 0), WAIT_OBJECT_0);
  ASSERT_TRUE(ReleaseMutex(mutex.Get()));

  // The same through a multiple wait: WAIT_ABANDONED_0 plus the index.
  ASSERT_EQ(RunOnThread(TakeMutexAndEnd, mutex.Get()), WAIT_OBJECT_0);
  Handle unrelated(CreateEventW(nullptr, TRUE, FALSE, nullptr));
  ASSERT_TRUE(unrelated);
  HANDLE handles[2] = {unrelated.Get(), mutex.Get()};
  EXPECT_EQ(WaitForMultipleObjects(2, handles, FALSE, kGuardMs), WAIT_ABANDONED_0 + 1);
  ASSERT_TRUE(ReleaseMutex(mutex.Get()));
}

struct ThreadStart {
  HANDLE go = nullptr;
  DWORD seenId = 0;
  bool useExitThread = false;
};

DWORD WINAPI WaitForGoThenEnd(LPVOID parameter) {
  auto* start = static_cast<ThreadStart*>(parameter);
  start->seenId = GetCurrentThreadId();
  if (WaitForSingleObject(start->go, kGuardMs) != WAIT_OBJECT_0) return 1;
  if (start->useExitThread) ExitThread(7);
  return 42;
}

TEST(Threads, HandleIsSignalledWhenTheThreadEndsWithItsExitCode) {
  for (bool useExitThread : {false, true}) {
    SCOPED_TRACE(useExitThread ? "ExitThread" : "return");
    Handle go(CreateEventW(nullptr, TRUE, FALSE, nullptr));
    ASSERT_TRUE(go);
    ThreadStart start{go.Get(), 0, useExitThread};
    DWORD id = 0;
    Handle thread(CreateThread(nullptr, 0, WaitForGoThenEnd, &start, 0, &id));
    ASSERT_TRUE(thread);
    EXPECT_NE(id, 0u);
    EXPECT_NE(id, GetCurrentThreadId());

    EXPECT_EQ(WaitForSingleObject(thread.Get(), 0), WAIT_TIMEOUT);
    DWORD code = 0;
    ASSERT_TRUE(GetExitCodeThread(thread.Get(), &code));
    EXPECT_EQ(code, STILL_ACTIVE);

    ASSERT_TRUE(SetEvent(go.Get()));
    ASSERT_EQ(WaitForSingleObject(thread.Get(), kGuardMs), WAIT_OBJECT_0);
    EXPECT_EQ(WaitForSingleObject(thread.Get(), 0), WAIT_OBJECT_0);  // stays signalled
    ASSERT_TRUE(GetExitCodeThread(thread.Get(), &code));
    EXPECT_EQ(code, useExitThread ? 7u : 42u);
    EXPECT_EQ(start.seenId, id);
  }
}

DWORD WINAPI SetOwnLastErrorAfterGo(LPVOID parameter) {
  if (WaitForSingleObject(parameter, kGuardMs) != WAIT_OBJECT_0) return 0;
  SetLastError(ERROR_BROKEN_PIPE);
  return GetLastError();
}

// Also pins that successful SetEvent and waits leave the last error alone.
TEST(Threads, LastErrorIsPerThread) {
  Handle go(CreateEventW(nullptr, TRUE, FALSE, nullptr));
  ASSERT_TRUE(go);
  Handle thread(CreateThread(nullptr, 0, SetOwnLastErrorAfterGo, go.Get(), 0, nullptr));
  ASSERT_TRUE(thread);
  SetLastError(ERROR_OPERATION_ABORTED);
  ASSERT_TRUE(SetEvent(go.Get()));
  ASSERT_EQ(WaitForSingleObject(thread.Get(), kGuardMs), WAIT_OBJECT_0);
  EXPECT_EQ(GetLastError(), ERROR_OPERATION_ABORTED);
  DWORD code = 0;
  ASSERT_TRUE(GetExitCodeThread(thread.Get(), &code));
  EXPECT_EQ(code, ERROR_BROKEN_PIPE);
}

struct Counter {
  CRITICAL_SECTION lock;
  long value = 0;
};

constexpr long kIncrements = 20000;

DWORD WINAPI CountUnderLock(LPVOID parameter) {
  auto* counter = static_cast<Counter*>(parameter);
  for (long i = 0; i < kIncrements; ++i) {
    EnterCriticalSection(&counter->lock);
    EnterCriticalSection(&counter->lock);  // the owner may enter again
    long seen = counter->value;
    counter->value = seen + 1;
    LeaveCriticalSection(&counter->lock);
    LeaveCriticalSection(&counter->lock);
  }
  return 0;
}

TEST(CriticalSection, ExcludesOtherThreadsAndNestsForItsOwner) {
  Counter counter;
  InitializeCriticalSection(&counter.lock);
  Handle first(CreateThread(nullptr, 0, CountUnderLock, &counter, 0, nullptr));
  Handle second(CreateThread(nullptr, 0, CountUnderLock, &counter, 0, nullptr));
  ASSERT_TRUE(first && second);
  HANDLE threads[2] = {first.Get(), second.Get()};
  for (HANDLE thread : threads) ASSERT_EQ(WaitForSingleObject(thread, kGuardMs), WAIT_OBJECT_0);
  EXPECT_EQ(counter.value, 2 * kIncrements);

  // Entered twice here and left twice: another thread can then enter.
  EnterCriticalSection(&counter.lock);
  EnterCriticalSection(&counter.lock);
  LeaveCriticalSection(&counter.lock);
  LeaveCriticalSection(&counter.lock);
  counter.value = 0;
  Handle after(CreateThread(nullptr, 0, CountUnderLock, &counter, 0, nullptr));
  ASSERT_TRUE(after);
  ASSERT_EQ(WaitForSingleObject(after.Get(), kGuardMs), WAIT_OBJECT_0);
  EXPECT_EQ(counter.value, kIncrements);
  DeleteCriticalSection(&counter.lock);
}

}  // namespace
