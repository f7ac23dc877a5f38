// Emulation-only properties of handles, waits, mutexes and threads, plus the
// quick semantic checks the emulation must pass before the conformance suite.
#include <gtest/gtest.h>

#include <cstdlib>
#include <functional>
#include <utility>

#include "platform/diagnostics.h"
#include "platform/posix/handle_table.h"
#include "platform/win32.h"

namespace {

TEST(Handles, CountedAndCheckedAfterClose) {
  long before = platform::LiveHandleCount();
  HANDLE event = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  HANDLE mutex = CreateMutexW(nullptr, FALSE, nullptr);
  ASSERT_NE(event, nullptr);
  ASSERT_NE(mutex, nullptr);
  EXPECT_NE(event, mutex);
  EXPECT_EQ(reinterpret_cast<std::uintptr_t>(event) % 4, 0u);
  EXPECT_EQ(platform::LiveHandleCount(), before + 2);

  EXPECT_TRUE(CloseHandle(event));
  EXPECT_EQ(platform::LiveHandleCount(), before + 1);
  // Every use of the closed value, and a handle of the wrong kind, fails
  // with ERROR_INVALID_HANDLE.
  HANDLE pair[2] = {mutex, event};
  const std::pair<const char*, std::function<bool()>> uses[] = {
      {"CloseHandle", [&] { return !CloseHandle(event); }},
      {"SetEvent", [&] { return !SetEvent(event); }},
      {"WaitForSingleObject", [&] { return WaitForSingleObject(event, 0) == WAIT_FAILED; }},
      {"WaitForMultipleObjects",
       [&] { return WaitForMultipleObjects(2, pair, FALSE, 0) == WAIT_FAILED; }},
      {"SetEvent on a mutex", [&] { return !SetEvent(mutex); }},
  };
  for (const auto& [name, failed] : uses) {
    SCOPED_TRACE(name);
    SetLastError(0);
    EXPECT_TRUE(failed());
    EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
  }

  // The closed value is not handed out again at once.
  HANDLE next = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  EXPECT_NE(next, event);
  EXPECT_TRUE(CloseHandle(next));
  EXPECT_TRUE(CloseHandle(mutex));
  EXPECT_EQ(platform::LiveHandleCount(), before);
  EXPECT_FALSE(CloseHandle(nullptr));
  EXPECT_TRUE(CloseHandle(GetCurrentProcess()));
}

// Objects of other emulation parts share the table and its checks.
TEST(Handles, ForeignKindsFollowTheirOwnCloseRule) {
  struct Key : emu::KernelObject {
    bool ClosableByCloseHandle() const override { return false; }
  };
  HANDLE key = emu::AllocateHandle(std::make_shared<Key>());
  EXPECT_EQ(platform::LiveHandleCount(), 1);
  EXPECT_NE(emu::LookupHandleAs<Key>(key), nullptr);
  SetLastError(0);
  EXPECT_FALSE(CloseHandle(key));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
  SetLastError(0);
  EXPECT_EQ(WaitForSingleObject(key, 0), WAIT_FAILED);
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
  EXPECT_TRUE(emu::ReleaseHandle(key));
  EXPECT_FALSE(emu::ReleaseHandle(key));
  EXPECT_EQ(emu::LookupHandleAs<Key>(key), nullptr);
  EXPECT_EQ(platform::LiveHandleCount(), 0);
}

TEST(Waits, SixtyFiveHandlesAreRefusedAndWaitAllTakesAllAtOnce) {
  HANDLE events[MAXIMUM_WAIT_OBJECTS + 1];
  for (auto& event : events) event = CreateEventW(nullptr, FALSE, FALSE, nullptr);
  SetEvent(events[64]);
  SetLastError(0);
  EXPECT_EQ(WaitForMultipleObjects(65, events, FALSE, 0), WAIT_FAILED);
  EXPECT_EQ(GetLastError(), ERROR_INVALID_PARAMETER);
  EXPECT_EQ(WaitForSingleObject(events[64], 0), WAIT_OBJECT_0);  // the refused wait took nothing

  // Wait-all takes nothing until every object is signalled, then all at once.
  SetEvent(events[0]);
  EXPECT_EQ(WaitForMultipleObjects(2, events, TRUE, 0), WAIT_TIMEOUT);
  SetEvent(events[1]);
  EXPECT_EQ(WaitForMultipleObjects(2, events, TRUE, 0), WAIT_OBJECT_0);
  EXPECT_EQ(WaitForMultipleObjects(2, events, FALSE, 0), WAIT_TIMEOUT);
  for (auto& event : events) CloseHandle(event);
}

struct ParkArgs {
  HANDLE mutex;
  HANDLE owned;
  HANDLE release;
  bool exitThread;
};

DWORD WINAPI TakeMutexAndEnd(LPVOID parameter) {
  auto* args = static_cast<ParkArgs*>(parameter);
  WaitForSingleObject(args->mutex, INFINITE);
  WaitForSingleObject(args->mutex, INFINITE);  // recursive
  SetEvent(args->owned);
  WaitForSingleObject(args->release, INFINITE);
  if (args->exitThread) ExitThread(42);
  return 5;
}

TEST(Threads, CountedWhileRunningAndMutexAbandonedOnEnd) {
  for (bool useExitThread : {false, true}) {
    HANDLE mutex = CreateMutexW(nullptr, FALSE, nullptr);
    HANDLE owned = CreateEventW(nullptr, FALSE, FALSE, nullptr);
    HANDLE release = CreateEventW(nullptr, FALSE, FALSE, nullptr);
    ParkArgs args{mutex, owned, release, useExitThread};
    HANDLE thread = CreateThread(nullptr, 0, TakeMutexAndEnd, &args, 0, nullptr);
    ASSERT_NE(thread, nullptr);
    EXPECT_EQ(platform::LiveThreadCount(), 1);
    ASSERT_EQ(WaitForSingleObject(owned, 10000), WAIT_OBJECT_0);
    SetLastError(0);
    EXPECT_FALSE(ReleaseMutex(mutex));
    EXPECT_EQ(GetLastError(), ERROR_NOT_OWNER);
    EXPECT_EQ(WaitForSingleObject(mutex, 0), WAIT_TIMEOUT);

    SetEvent(release);
    HANDLE pair[2] = {owned, mutex};
    EXPECT_EQ(WaitForMultipleObjects(2, pair, FALSE, 10000), WAIT_ABANDONED_0 + 1);
    // Now owned here, without the abandoned mark.
    EXPECT_TRUE(ReleaseMutex(mutex));
    EXPECT_EQ(WaitForSingleObject(mutex, 0), WAIT_OBJECT_0);
    EXPECT_TRUE(ReleaseMutex(mutex));
    EXPECT_FALSE(ReleaseMutex(mutex));

    EXPECT_EQ(WaitForSingleObject(thread, 10000), WAIT_OBJECT_0);
    DWORD code = 0;
    EXPECT_TRUE(GetExitCodeThread(thread, &code));
    EXPECT_EQ(code, useExitThread ? 42u : 5u);
    EXPECT_EQ(platform::LiveThreadCount(), 0);
    for (HANDLE h : {thread, mutex, owned, release}) CloseHandle(h);
  }
}

TEST(Threads, HandleClosedBeforeTheThreadEnds) {
  HANDLE release = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  HANDLE thread = CreateThread(
      nullptr, 0, [](LPVOID p) -> DWORD { return WaitForSingleObject(p, INFINITE); }, release, 0,
      nullptr);
  ASSERT_NE(thread, nullptr);
  EXPECT_TRUE(CloseHandle(thread));
  EXPECT_EQ(platform::LiveThreadCount(), 1);
  SetEvent(release);
  CloseHandle(release);
  // The count drops when the thread has finished; nothing here keeps it.
  while (platform::LiveThreadCount() != 0) Sleep(1);
  EXPECT_EQ(platform::LiveHandleCount(), 0);
}

TEST(Mutexes, InitialOwnerAndNamedReopen) {
  HANDLE first = CreateMutexW(nullptr, TRUE, WSTR("Global\\EmuMutexReopen"));
  ASSERT_NE(first, nullptr);
  EXPECT_EQ(GetLastError(), ERROR_SUCCESS);
  // The same name (with or without the Global prefix) is the same object;
  // initial ownership is not granted again.
  HANDLE second = CreateMutexW(nullptr, TRUE, WSTR("EmuMutexReopen"));
  ASSERT_NE(second, nullptr);
  EXPECT_EQ(GetLastError(), ERROR_ALREADY_EXISTS);
  EXPECT_TRUE(ReleaseMutex(second));
  EXPECT_FALSE(ReleaseMutex(first));
  EXPECT_EQ(GetLastError(), ERROR_NOT_OWNER);
  // A name in use by another kind cannot be created or opened as an event.
  SetLastError(0);
  EXPECT_EQ(CreateEventW(nullptr, FALSE, FALSE, WSTR("Global\\EmuMutexReopen")), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
  EXPECT_EQ(OpenEventW(EVENT_ALL_ACCESS, FALSE, WSTR("Global\\EmuMutexReopen")), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
  HANDLE opened = OpenMutexW(MUTEX_ALL_ACCESS, FALSE, WSTR("Global\\EmuMutexReopen"));
  EXPECT_NE(opened, nullptr);
  CloseHandle(opened);
  CloseHandle(first);
  CloseHandle(second);
  // Gone with its last handle.
  EXPECT_EQ(OpenMutexW(MUTEX_ALL_ACCESS, FALSE, WSTR("Global\\EmuMutexReopen")), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_FILE_NOT_FOUND);
}

TEST(Time, ScaleAppliesToSleepAndWaits) {
  // The test programs run with the scale from the environment; the factor is
  // read once, so only its report and the tick arithmetic are checked here.
  const char* env = std::getenv("SKYVANE_TIME_SCALE");
  double expected = env != nullptr ? std::atof(env) : 1.0;
  if (!(expected > 0.0)) expected = 1.0;
  EXPECT_DOUBLE_EQ(platform::TimeScale(), expected);
  // A time-out is never shorter than asked in emulated time.
  ULONGLONG start = GetTickCount64();
  HANDLE event = CreateEventW(nullptr, FALSE, FALSE, nullptr);
  EXPECT_EQ(WaitForSingleObject(event, 200), WAIT_TIMEOUT);
  Sleep(100);
  EXPECT_GE(GetTickCount64() - start, 300u);
  CloseHandle(event);
}

// Many threads contending for one mutex (some through wait-all with an
// event) never overlap inside it: the plain counter ends exact, and the
// sanitizer builds see the mutex as the synchronisation it is.
struct Contention {
  HANDLE mutex;
  HANDLE always;  // manual-reset, set
  long counter = 0;
};

DWORD WINAPI Contend(LPVOID parameter) {
  auto* c = static_cast<Contention*>(parameter);
  HANDLE both[2] = {c->always, c->mutex};
  for (int i = 0; i < 300; ++i) {
    DWORD result = (i % 2 == 0) ? WaitForSingleObject(c->mutex, INFINITE)
                                : WaitForMultipleObjects(2, both, TRUE, INFINITE);
    if (result != WAIT_OBJECT_0) return 1;
    long seen = c->counter;
    if ((i % 50) == 0) Sleep(0);
    c->counter = seen + 1;
    if (!ReleaseMutex(c->mutex)) return 2;
  }
  return 0;
}

TEST(Mutexes, ContendingThreadsAreExclusive) {
  Contention c{CreateMutexW(nullptr, FALSE, nullptr), CreateEventW(nullptr, TRUE, TRUE, nullptr)};
  HANDLE threads[8];
  for (HANDLE& t : threads) t = CreateThread(nullptr, 0, Contend, &c, 0, nullptr);
  EXPECT_EQ(WaitForMultipleObjects(8, threads, TRUE, INFINITE), WAIT_OBJECT_0);
  for (HANDLE t : threads) {
    DWORD code = 9;
    GetExitCodeThread(t, &code);
    EXPECT_EQ(code, 0u);
    CloseHandle(t);
  }
  EXPECT_EQ(c.counter, 8 * 300);
  CloseHandle(c.mutex);
  CloseHandle(c.always);
}

}  // namespace
