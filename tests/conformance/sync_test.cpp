// Events, waits, mutexes, threads and critical sections as the service uses
// them.
#include <gtest/gtest.h>

#include <vector>

#include "support/test_support.h"

namespace {

using skytest::Handle;
using skytest::kGuardMs;
using skytest::NewEvent;
using skytest::Thread;

// A zero wait on `object` from another thread (which gives back a mutex it got).
DWORD TryFromOtherThread(HANDLE object) {
  Thread thread([object]() -> DWORD {
    DWORD result = WaitForSingleObject(object, 0);
    if (result == WAIT_OBJECT_0 || result == WAIT_ABANDONED) ReleaseMutex(object);
    return result;
  });
  return thread.Join();
}

TEST(Events, AutoResetIsConsumedByOneWaitAndManualResetStaysSet) {
  for (bool manual : {false, true}) {
    SCOPED_TRACE(manual ? "manual" : "auto");
    const DWORD second = manual ? WAIT_OBJECT_0 : WAIT_TIMEOUT;
    Handle event = NewEvent(manual, false);
    Handle initiallySet = NewEvent(manual, true);
    ASSERT_TRUE(event && initiallySet);
    EXPECT_EQ(WaitForSingleObject(event.Get(), 0), WAIT_TIMEOUT);
    ASSERT_TRUE(SetEvent(event.Get()));
    ASSERT_TRUE(SetEvent(event.Get()));  // setting twice does not count twice
    EXPECT_EQ(WaitForSingleObject(event.Get(), 0), WAIT_OBJECT_0);
    EXPECT_EQ(WaitForSingleObject(event.Get(), 0), second);
    EXPECT_EQ(WaitForSingleObject(initiallySet.Get(), 0), WAIT_OBJECT_0);
    EXPECT_EQ(WaitForSingleObject(initiallySet.Get(), 0), second);
    ASSERT_TRUE(SetEvent(event.Get()));
    ASSERT_TRUE(ResetEvent(event.Get()));
    EXPECT_EQ(WaitForSingleObject(event.Get(), 0), WAIT_TIMEOUT);
  }
}

TEST(Waits, AnyOfSixtyFourReportsLowestSignalledIndexAndConsumesOnlyThat) {
  std::vector<Handle> events;
  std::vector<HANDLE> raw;
  for (DWORD i = 0; i < MAXIMUM_WAIT_OBJECTS; ++i) {
    events.push_back(NewEvent(false, false));
    ASSERT_TRUE(events.back());
    raw.push_back(events.back().Get());
  }
  auto waitAny = [&] { return WaitForMultipleObjects(MAXIMUM_WAIT_OBJECTS, raw.data(), FALSE, 0); };
  EXPECT_EQ(waitAny(), WAIT_TIMEOUT);
  for (DWORD index : {40u, 63u, 7u}) ASSERT_TRUE(SetEvent(raw[index]));
  EXPECT_EQ(waitAny(), WAIT_OBJECT_0 + 7);
  EXPECT_EQ(waitAny(), WAIT_OBJECT_0 + 40);
  EXPECT_EQ(waitAny(), WAIT_OBJECT_0 + 63);
  EXPECT_EQ(waitAny(), WAIT_TIMEOUT);

  // A set event in slot 0 (the pipe server's stop event) always wins.
  Handle stop = NewEvent(true, true);
  raw[0] = stop.Get();
  ASSERT_TRUE(SetEvent(raw[5]));
  EXPECT_EQ(waitAny(), WAIT_OBJECT_0);
  EXPECT_EQ(WaitForMultipleObjects(MAXIMUM_WAIT_OBJECTS, raw.data(), FALSE, kGuardMs),
            WAIT_OBJECT_0);
  EXPECT_EQ(WaitForSingleObject(raw[5], 0), WAIT_OBJECT_0);  // untouched behind it
}

TEST(Waits, ClosedHandleFailsWithInvalidHandle) {
  Handle live = NewEvent(true, false);
  HANDLE closed = CreateEventW(nullptr, TRUE, TRUE, nullptr);
  ASSERT_TRUE(live && closed != nullptr);
  ASSERT_TRUE(CloseHandle(closed));
  HANDLE handles[2] = {live.Get(), closed};
  // A braced list runs left to right, so each error is read right after its call.
  const struct {
    const char* call;
    bool failed;
    DWORD error;
  } uses[] = {
      {"WaitForSingleObject", (SetLastError(0), WaitForSingleObject(closed, 0) == WAIT_FAILED),
       GetLastError()},
      {"WaitForMultipleObjects",
       (SetLastError(0), WaitForMultipleObjects(2, handles, FALSE, 0) == WAIT_FAILED),
       GetLastError()},
      {"SetEvent", (SetLastError(0), !SetEvent(closed)), GetLastError()},
      {"CloseHandle", (SetLastError(0), !CloseHandle(closed)), GetLastError()},
  };
  for (const auto& use : uses) {
    EXPECT_TRUE(use.failed) << use.call;
    EXPECT_EQ(use.error, ERROR_INVALID_HANDLE) << use.call;
  }
}

TEST(Mutex, OwnerTakesItAgainNeedsAsManyReleasesAndAbandonsItByEnding) {
  Handle mutex(CreateMutexW(nullptr, FALSE, nullptr));
  Handle initiallyOwned(CreateMutexW(nullptr, TRUE, nullptr));
  Handle unrelated = NewEvent(true, false);
  ASSERT_TRUE(mutex && initiallyOwned && unrelated);
  EXPECT_EQ(TryFromOtherThread(initiallyOwned.Get()), WAIT_TIMEOUT);
  ASSERT_TRUE(ReleaseMutex(initiallyOwned.Get()));
  EXPECT_EQ(TryFromOtherThread(initiallyOwned.Get()), WAIT_OBJECT_0);

  EXPECT_EQ(TryFromOtherThread(mutex.Get()), WAIT_OBJECT_0);  // free at first
  ASSERT_EQ(WaitForSingleObject(mutex.Get(), 0), WAIT_OBJECT_0);
  ASSERT_EQ(WaitForSingleObject(mutex.Get(), kGuardMs), WAIT_OBJECT_0);  // owner again
  EXPECT_EQ(TryFromOtherThread(mutex.Get()), WAIT_TIMEOUT);
  Thread foreign([&]() -> DWORD {
    SetLastError(0);
    return ReleaseMutex(mutex.Get()) ? 0 : GetLastError();
  });
  EXPECT_EQ(foreign.Join(), ERROR_NOT_OWNER);
  ASSERT_TRUE(ReleaseMutex(mutex.Get()));
  EXPECT_EQ(TryFromOtherThread(mutex.Get()), WAIT_TIMEOUT);  // still held once
  ASSERT_TRUE(ReleaseMutex(mutex.Get()));
  EXPECT_EQ(TryFromOtherThread(mutex.Get()), WAIT_OBJECT_0);
  SetLastError(0);
  EXPECT_FALSE(ReleaseMutex(mutex.Get()));
  EXPECT_EQ(GetLastError(), ERROR_NOT_OWNER);

  auto takeAndEnd = [&] {
    Thread owner([&] { return WaitForSingleObject(mutex.Get(), kGuardMs); });
    return owner.Join();
  };
  ASSERT_EQ(takeAndEnd(), WAIT_OBJECT_0);
  ASSERT_EQ(WaitForSingleObject(mutex.Get(), kGuardMs), WAIT_ABANDONED);
  EXPECT_EQ(TryFromOtherThread(mutex.Get()), WAIT_TIMEOUT);  // owned now
  ASSERT_TRUE(ReleaseMutex(mutex.Get()));
  ASSERT_EQ(WaitForSingleObject(mutex.Get(), 0), WAIT_OBJECT_0);  // reported once only
  ASSERT_TRUE(ReleaseMutex(mutex.Get()));
  // Through a multiple wait: WAIT_ABANDONED_0 plus the index.
  ASSERT_EQ(takeAndEnd(), WAIT_OBJECT_0);
  HANDLE handles[2] = {unrelated.Get(), mutex.Get()};
  EXPECT_EQ(WaitForMultipleObjects(2, handles, FALSE, kGuardMs), WAIT_ABANDONED_0 + 1);
  ASSERT_TRUE(ReleaseMutex(mutex.Get()));
}

TEST(Threads, HandleIsSignalledWhenTheThreadEndsWithItsExitCodeAndOwnLastError) {
  Handle go = NewEvent(true, false);
  ASSERT_TRUE(go);
  DWORD seenId = 0;
  Thread thread([&]() -> DWORD {
    seenId = GetCurrentThreadId();
    if (WaitForSingleObject(go.Get(), kGuardMs) != WAIT_OBJECT_0) return 1;
    SetLastError(ERROR_BROKEN_PIPE);
    return 42;
  });
  EXPECT_NE(thread.Id(), GetCurrentThreadId());
  EXPECT_EQ(WaitForSingleObject(thread.Get(), 0), WAIT_TIMEOUT);
  DWORD code = 0;
  ASSERT_TRUE(GetExitCodeThread(thread.Get(), &code));
  EXPECT_EQ(code, STILL_ACTIVE);
  // The last error is per thread; successful SetEvent and waits leave it alone.
  SetLastError(ERROR_OPERATION_ABORTED);
  ASSERT_TRUE(SetEvent(go.Get()));
  ASSERT_EQ(WaitForSingleObject(thread.Get(), kGuardMs), WAIT_OBJECT_0);
  EXPECT_EQ(GetLastError(), ERROR_OPERATION_ABORTED);
  EXPECT_EQ(thread.Join(), 42u);
  EXPECT_EQ(WaitForSingleObject(thread.Get(), 0), WAIT_OBJECT_0);  // stays signalled
  EXPECT_EQ(seenId, thread.Id());
}

// Half of the mutex takes go through a wait-all with a set event, as the
// worker table waits; the critical section is entered twice.
TEST(Exclusion, MutexAndCriticalSectionKeepConcurrentCountsExact) {
  constexpr long kIncrements = 20000;
  Handle mutex(CreateMutexW(nullptr, FALSE, nullptr));
  Handle always = NewEvent(true, true);
  ASSERT_TRUE(mutex && always);
  CRITICAL_SECTION lock;
  InitializeCriticalSection(&lock);
  long underMutex = 0;
  long underLock = 0;
  auto count = [&]() -> DWORD {
    HANDLE both[2] = {always.Get(), mutex.Get()};
    for (long i = 0; i < kIncrements; ++i) {
      EnterCriticalSection(&lock);
      EnterCriticalSection(&lock);  // the owner may enter again
      long seen = underLock;
      underLock = seen + 1;
      LeaveCriticalSection(&lock);
      LeaveCriticalSection(&lock);
      if (i % 20 != 0) continue;
      DWORD result = (i % 40 == 0) ? WaitForSingleObject(mutex.Get(), kGuardMs)
                                   : WaitForMultipleObjects(2, both, TRUE, kGuardMs);
      if (result != WAIT_OBJECT_0) return 1;
      seen = underMutex;
      if (i % 400 == 0) Sleep(0);
      underMutex = seen + 1;
      if (!ReleaseMutex(mutex.Get())) return 2;
    }
    return 0;
  };
  {
    Thread first(count);
    Thread second(count);
    EXPECT_EQ(first.Join(), 0u);
    EXPECT_EQ(second.Join(), 0u);
  }
  EXPECT_EQ(underLock, 2 * kIncrements);
  EXPECT_EQ(underMutex, 2 * kIncrements / 20);
  DeleteCriticalSection(&lock);
}

}  // namespace
