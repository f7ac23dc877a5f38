// Events and waits: auto- and manual-reset events, WaitForSingleObject and
// WaitForMultipleObjects (any of up to 64 handles, lowest index first,
// time-outs, failure on a closed handle).
#include <gtest/gtest.h>

#include <atomic>
#include <vector>

#include "support/test_support.h"

namespace {

using skytest::Handle;
using skytest::kGuardMs;

Handle NewEvent(bool manualReset, bool signalled) {
  return Handle(
      CreateEventW(nullptr, manualReset ? TRUE : FALSE, signalled ? TRUE : FALSE, nullptr));
}

TEST(Events, AutoResetSignalIsConsumedByExactlyOneWait) {
  Handle event = NewEvent(false, false);
  ASSERT_TRUE(event);
  EXPECT_EQ(WaitForSingleObject(event.Get(), 0), WAIT_TIMEOUT);
  ASSERT_TRUE(SetEvent(event.Get()));
  ASSERT_TRUE(SetEvent(event.Get()));  // setting twice does not count twice
  EXPECT_EQ(WaitForSingleObject(event.Get(), 0), WAIT_OBJECT_0);
  EXPECT_EQ(WaitForSingleObject(event.Get(), 0), WAIT_TIMEOUT);

  Handle initiallySet = NewEvent(false, true);
  ASSERT_TRUE(initiallySet);
  EXPECT_EQ(WaitForSingleObject(initiallySet.Get(), 0), WAIT_OBJECT_0);
  EXPECT_EQ(WaitForSingleObject(initiallySet.Get(), 0), WAIT_TIMEOUT);

  ASSERT_TRUE(SetEvent(event.Get()));
  ASSERT_TRUE(ResetEvent(event.Get()));
  EXPECT_EQ(WaitForSingleObject(event.Get(), 0), WAIT_TIMEOUT);
}

// Several threads wait on one auto-reset event; one SetEvent must release
// exactly one of them. Each waiter waits for the event or a quit event, so the
// others can be sent home afterwards and counted.
struct AutoResetWaiters {
  HANDLE event = nullptr;
  HANDLE quit = nullptr;
  HANDLE released = nullptr;  // auto-reset: a waiter got the event
  std::atomic<int> waiting{0};
  std::atomic<int> releasedCount{0};
};

DWORD WINAPI AutoResetWaiter(LPVOID parameter) {
  auto* shared = static_cast<AutoResetWaiters*>(parameter);
  HANDLE handles[2] = {shared->event, shared->quit};
  shared->waiting.fetch_add(1);
  DWORD result = WaitForMultipleObjects(2, handles, FALSE, kGuardMs);
  if (result == WAIT_OBJECT_0) {
    shared->releasedCount.fetch_add(1);
    SetEvent(shared->released);
    return 0;
  }
  return result == WAIT_OBJECT_0 + 1 ? 0 : 1;
}

TEST(Events, AutoResetReleasesExactlyOneWaiter) {
  AutoResetWaiters shared;
  Handle event = NewEvent(false, false);
  Handle quit = NewEvent(true, false);
  Handle released = NewEvent(false, false);
  ASSERT_TRUE(event && quit && released);
  shared.event = event.Get();
  shared.quit = quit.Get();
  shared.released = released.Get();

  constexpr int kWaiters = 4;
  std::vector<Handle> threads;
  for (int i = 0; i < kWaiters; ++i) {
    threads.emplace_back(CreateThread(nullptr, 0, AutoResetWaiter, &shared, 0, nullptr));
    ASSERT_TRUE(threads.back());
  }
  // Let the waiters reach their wait (best effort: a waiter that arrives late
  // still finds the event set, and exactly one may consume it either way).
  while (shared.waiting.load() < kWaiters) Sleep(1);
  Sleep(20);

  ASSERT_TRUE(SetEvent(event.Get()));
  ASSERT_EQ(WaitForSingleObject(released.Get(), kGuardMs), WAIT_OBJECT_0);
  ASSERT_TRUE(SetEvent(quit.Get()));
  for (Handle& thread : threads) {
    ASSERT_EQ(WaitForSingleObject(thread.Get(), kGuardMs), WAIT_OBJECT_0);
    DWORD code = 99;
    ASSERT_TRUE(GetExitCodeThread(thread.Get(), &code));
    EXPECT_EQ(code, 0u);
  }
  EXPECT_EQ(shared.releasedCount.load(), 1);
  EXPECT_EQ(WaitForSingleObject(event.Get(), 0), WAIT_TIMEOUT);
}

struct ManualResetWaiters {
  HANDLE event = nullptr;
};

DWORD WINAPI ManualResetWaiter(LPVOID parameter) {
  auto* shared = static_cast<ManualResetWaiters*>(parameter);
  return WaitForSingleObject(shared->event, kGuardMs);
}

TEST(Events, ManualResetReleasesEveryWaiterAndStaysSetUntilReset) {
  ManualResetWaiters shared;
  Handle event = NewEvent(true, false);
  ASSERT_TRUE(event);
  shared.event = event.Get();
  std::vector<Handle> threads;
  for (int i = 0; i < 3; ++i) {
    threads.emplace_back(CreateThread(nullptr, 0, ManualResetWaiter, &shared, 0, nullptr));
    ASSERT_TRUE(threads.back());
  }
  ASSERT_TRUE(SetEvent(event.Get()));
  for (Handle& thread : threads) {
    ASSERT_EQ(WaitForSingleObject(thread.Get(), kGuardMs), WAIT_OBJECT_0);
    DWORD code = 99;
    ASSERT_TRUE(GetExitCodeThread(thread.Get(), &code));
    EXPECT_EQ(code, WAIT_OBJECT_0);
  }
  EXPECT_EQ(WaitForSingleObject(event.Get(), 0), WAIT_OBJECT_0);
  EXPECT_EQ(WaitForSingleObject(event.Get(), 0), WAIT_OBJECT_0);
  ASSERT_TRUE(ResetEvent(event.Get()));
  EXPECT_EQ(WaitForSingleObject(event.Get(), 0), WAIT_TIMEOUT);

  Handle initiallySet = NewEvent(true, true);
  ASSERT_TRUE(initiallySet);
  EXPECT_EQ(WaitForSingleObject(initiallySet.Get(), 0), WAIT_OBJECT_0);
  EXPECT_EQ(WaitForSingleObject(initiallySet.Get(), 0), WAIT_OBJECT_0);
}

TEST(Waits, AnyOfSixtyFourReportsLowestSignalledIndexAndConsumesOnlyThat) {
  std::vector<Handle> events;
  std::vector<HANDLE> raw;
  for (DWORD i = 0; i < MAXIMUM_WAIT_OBJECTS; ++i) {
    events.push_back(NewEvent(false, false));
    ASSERT_TRUE(events.back());
    raw.push_back(events.back().Get());
  }
  EXPECT_EQ(WaitForMultipleObjects(MAXIMUM_WAIT_OBJECTS, raw.data(), FALSE, 0), WAIT_TIMEOUT);
  for (DWORD index : {40u, 63u, 7u}) ASSERT_TRUE(SetEvent(raw[index]));
  // Lowest index first; each wait consumes only the auto-reset event it reports.
  EXPECT_EQ(WaitForMultipleObjects(MAXIMUM_WAIT_OBJECTS, raw.data(), FALSE, 0), WAIT_OBJECT_0 + 7);
  EXPECT_EQ(WaitForMultipleObjects(MAXIMUM_WAIT_OBJECTS, raw.data(), FALSE, 0), WAIT_OBJECT_0 + 40);
  EXPECT_EQ(WaitForMultipleObjects(MAXIMUM_WAIT_OBJECTS, raw.data(), FALSE, 0), WAIT_OBJECT_0 + 63);
  EXPECT_EQ(WaitForMultipleObjects(MAXIMUM_WAIT_OBJECTS, raw.data(), FALSE, 0), WAIT_TIMEOUT);
}

TEST(Waits, ManualResetInFrontWinsEveryTime) {
  // The pipe server's stop event sits in slot 0: while it is set, no instance
  // behind it is ever reported.
  Handle stop = NewEvent(true, false);
  Handle instance = NewEvent(true, true);
  ASSERT_TRUE(stop && instance);
  HANDLE handles[2] = {stop.Get(), instance.Get()};
  EXPECT_EQ(WaitForMultipleObjects(2, handles, FALSE, 0), WAIT_OBJECT_0 + 1);
  ASSERT_TRUE(SetEvent(stop.Get()));
  EXPECT_EQ(WaitForMultipleObjects(2, handles, FALSE, 0), WAIT_OBJECT_0);
  EXPECT_EQ(WaitForMultipleObjects(2, handles, FALSE, kGuardMs), WAIT_OBJECT_0);
}

struct DelayedSetter {
  HANDLE go = nullptr;
  HANDLE target = nullptr;
};

DWORD WINAPI SetAfterGo(LPVOID parameter) {
  auto* setter = static_cast<DelayedSetter*>(parameter);
  if (WaitForSingleObject(setter->go, kGuardMs) != WAIT_OBJECT_0) return 1;
  return SetEvent(setter->target) ? 0 : 2;
}

TEST(Waits, BlockedWaitWakesOnLaterSignalAndTimesOutOtherwise) {
  Handle a = NewEvent(false, false);
  Handle b = NewEvent(false, false);
  Handle go = NewEvent(true, true);
  ASSERT_TRUE(a && b && go);
  HANDLE handles[2] = {a.Get(), b.Get()};
  EXPECT_EQ(WaitForMultipleObjects(2, handles, FALSE, 30), WAIT_TIMEOUT);
  EXPECT_EQ(WaitForSingleObject(a.Get(), 30), WAIT_TIMEOUT);

  DelayedSetter setter{go.Get(), b.Get()};
  Handle thread(CreateThread(nullptr, 0, SetAfterGo, &setter, 0, nullptr));
  ASSERT_TRUE(thread);
  EXPECT_EQ(WaitForMultipleObjects(2, handles, FALSE, kGuardMs), WAIT_OBJECT_0 + 1);
  ASSERT_EQ(WaitForSingleObject(thread.Get(), kGuardMs), WAIT_OBJECT_0);
  EXPECT_EQ(WaitForSingleObject(b.Get(), 0), WAIT_TIMEOUT);
}

TEST(Waits, ClosedHandleFailsWithInvalidHandle) {
  Handle live = NewEvent(true, false);
  HANDLE closed = CreateEventW(nullptr, TRUE, TRUE, nullptr);
  ASSERT_TRUE(live && closed != nullptr);
  ASSERT_TRUE(CloseHandle(closed));

  SetLastError(0);
  EXPECT_EQ(WaitForSingleObject(closed, 0), WAIT_FAILED);
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);

  HANDLE handles[2] = {live.Get(), closed};
  SetLastError(0);
  EXPECT_EQ(WaitForMultipleObjects(2, handles, FALSE, 0), WAIT_FAILED);
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);

  SetLastError(0);
  EXPECT_FALSE(SetEvent(closed));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
  SetLastError(0);
  EXPECT_FALSE(CloseHandle(closed));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
}

}  // namespace
