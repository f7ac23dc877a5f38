// Objects shared between processes of one emulation namespace. The other
// process is this test program started again for the case, which runs the
// child's few Win32 calls and ends with their result.
#include <gtest/gtest.h>

#include <cstring>

#include "child_body.h"
#include "platform/diagnostics.h"
#include "platform/win32.h"

namespace {

TEST(CrossProcess, NamedEventSetByChildReleasesWaiter) {
  RunAsChild("setter", [] {
    // The child inherits no handles: it opens the event by name.
    HANDLE event = OpenEventW(EVENT_MODIFY_STATE, FALSE, WSTR("Global\\EmuXpReady"));
    if (event == nullptr) return 10;
    if (platform::LiveHandleCount() != 1) return 11;
    if (!SetEvent(event)) return 12;
    return CloseHandle(event) ? 0 : 13;
  });
  HANDLE ready = CreateEventW(nullptr, TRUE, FALSE, WSTR("Global\\EmuXpReady"));
  ASSERT_NE(ready, nullptr);
  skytest::ChildProcess child;
  ASSERT_TRUE(child.Start("setter"));
  EXPECT_EQ(WaitForSingleObject(ready, 10000), WAIT_OBJECT_0);
  EXPECT_EQ(child.Wait(skytest::kProcessGuardMs), 0);
  // The child's handle went with it; the parent's still works.
  EXPECT_TRUE(ResetEvent(ready));
  EXPECT_EQ(WaitForSingleObject(ready, 0), WAIT_TIMEOUT);
  CloseHandle(ready);
}

TEST(CrossProcess, MappingContentAndLifetime) {
  constexpr DWORD kSize = 1215512;
  RunAsChild("writer", [] {
    HANDLE again = CreateFileMappingW(INVALID_HANDLE_VALUE, nullptr, PAGE_READWRITE, 0, 4096,
                                      WSTR("Global\\EmuXpMap"));
    if (again == nullptr || GetLastError() != ERROR_ALREADY_EXISTS) return 10;
    auto* v = static_cast<unsigned char*>(MapViewOfFile(again, FILE_MAP_ALL_ACCESS, 0, 0, 0));
    if (v == nullptr) return 11;
    if (std::memcmp(v + kSize - 5, "abcd", 4) != 0) return 12;
    v[0] = 0x5A;
    // Closing the handle first: the view keeps the mapping alive.
    CloseHandle(again);
    v[1] = 0xA5;
    return UnmapViewOfFile(v) ? 0 : 13;
  });
  HANDLE mapping = CreateFileMappingW(INVALID_HANDLE_VALUE, nullptr, PAGE_READWRITE, 0, kSize,
                                      WSTR("Global\\EmuXpMap"));
  ASSERT_NE(mapping, nullptr);
  EXPECT_EQ(GetLastError(), ERROR_SUCCESS);
  auto* view = static_cast<unsigned char*>(MapViewOfFile(mapping, FILE_MAP_ALL_ACCESS, 0, 0, 0));
  ASSERT_NE(view, nullptr);
  EXPECT_EQ(view[0], 0);
  EXPECT_EQ(view[kSize - 1], 0);
  std::memcpy(view + kSize - 5, "abcd", 4);
  EXPECT_EQ(RunChild("writer"), 0);
  EXPECT_EQ(view[0], 0x5A);
  EXPECT_EQ(view[1], 0xA5);

  // A view of part of it, at an allocation-granularity offset.
  auto* part = static_cast<unsigned char*>(MapViewOfFile(mapping, FILE_MAP_READ, 0, 65536, 16));
  ASSERT_NE(part, nullptr);
  view[65536] = 7;
  EXPECT_EQ(part[0], 7);
  EXPECT_EQ(MapViewOfFile(mapping, FILE_MAP_READ, 0, 100, 16), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_MAPPED_ALIGNMENT);
  EXPECT_TRUE(UnmapViewOfFile(part));
  EXPECT_FALSE(UnmapViewOfFile(part));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_ADDRESS);

  // A handle opened for reading gives read views only.
  HANDLE reader = OpenFileMappingW(FILE_MAP_READ, FALSE, WSTR("Global\\EmuXpMap"));
  ASSERT_NE(reader, nullptr);
  EXPECT_EQ(MapViewOfFile(reader, FILE_MAP_WRITE, 0, 0, 0), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_ACCESS_DENIED);
  auto* readView = static_cast<unsigned char*>(MapViewOfFile(reader, FILE_MAP_READ, 0, 0, 0));
  ASSERT_NE(readView, nullptr);
  EXPECT_EQ(readView[1], 0xA5);
  EXPECT_TRUE(UnmapViewOfFile(readView));
  CloseHandle(reader);

  // The handle goes, the view keeps the object: it is still found by name.
  EXPECT_TRUE(CloseHandle(mapping));
  HANDLE reopened = OpenFileMappingW(FILE_MAP_READ, FALSE, WSTR("Global\\EmuXpMap"));
  ASSERT_NE(reopened, nullptr);
  CloseHandle(reopened);
  EXPECT_TRUE(UnmapViewOfFile(view));
  EXPECT_EQ(OpenFileMappingW(FILE_MAP_READ, FALSE, WSTR("Global\\EmuXpMap")), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_FILE_NOT_FOUND);
}

TEST(CrossProcess, ObjectsOfDeadProcessesAreFreed) {
  RunAsChild("leaker", [] {
    HANDLE e = CreateEventW(nullptr, TRUE, TRUE, WSTR("Global\\EmuXpLeaked"));
    return e != nullptr ? 0 : 10;  // ends without closing
  });
  ASSERT_EQ(RunChild("leaker"), 0);
  SetLastError(0);
  HANDLE fresh = CreateEventW(nullptr, TRUE, FALSE, WSTR("Global\\EmuXpLeaked"));
  ASSERT_NE(fresh, nullptr);
  EXPECT_EQ(GetLastError(), ERROR_SUCCESS);  // a new object, not the dead one's
  EXPECT_EQ(WaitForSingleObject(fresh, 0), WAIT_TIMEOUT);
  CloseHandle(fresh);
}

}  // namespace
