// Named kernel objects under "Global\" that the service shares with the
// user-interface process; creating an existing name opens the same object.
#include <gtest/gtest.h>

#include <functional>

#include "support/test_support.h"

namespace {

using skytest::Handle;

constexpr DWORD kBlockBytes = 1215512;  // the size of the service's state block

WideString GlobalName(const char* tag) {
  return skytest::UniqueName("Global\\", tag);
}

// A mapped view, unmapped at the end of its scope.
class View {
 public:
  View(HANDLE mapping, DWORD access) : base_(MapViewOfFile(mapping, access, 0, 0, 0)) {}
  View(const View&) = delete;
  View& operator=(const View&) = delete;
  ~View() {
    if (base_ != nullptr) UnmapViewOfFile(base_);
  }
  unsigned char* Bytes() const { return static_cast<unsigned char*>(base_); }
  explicit operator bool() const { return base_ != nullptr; }

 private:
  void* base_;
};

// Each kind's create and open calls, and a check that two handles reach one
// object.
struct Kind {
  const char* name;
  std::function<HANDLE(const WCHAR*)> create;
  std::function<HANDLE(const WCHAR*)> open;
  std::function<bool(HANDLE, HANDLE)> same;
};

const Kind kKinds[] = {
    {"mapping",
     [](const WCHAR* name) {
       return CreateFileMappingW(INVALID_HANDLE_VALUE, nullptr, PAGE_READWRITE, 0, kBlockBytes,
                                 name);
     },
     [](const WCHAR* name) { return OpenFileMappingW(FILE_MAP_READ, FALSE, name); },
     [](HANDLE a, HANDLE b) {
       View first(a, FILE_MAP_ALL_ACCESS);
       View second(b, FILE_MAP_READ);
       if (!first || !second) return false;
       first.Bytes()[12345] = 0xC3;
       return second.Bytes()[12345] == 0xC3;
     }},
    {"event", [](const WCHAR* name) { return CreateEventW(nullptr, TRUE, FALSE, name); },
     [](const WCHAR* name) { return OpenEventW(EVENT_MODIFY_STATE | SYNCHRONIZE, FALSE, name); },
     [](HANDLE a, HANDLE b) { return SetEvent(a) && WaitForSingleObject(b, 0) == WAIT_OBJECT_0; }},
    {"mutex", [](const WCHAR* name) { return CreateMutexW(nullptr, FALSE, name); },
     [](const WCHAR* name) { return OpenMutexW(SYNCHRONIZE | MUTEX_MODIFY_STATE, FALSE, name); },
     // Ownership taken through one handle is released through the other.
     [](HANDLE a, HANDLE b) {
       return WaitForSingleObject(a, 0) == WAIT_OBJECT_0 && ReleaseMutex(b);
     }},
};

TEST(NamedObjects, CreatingOrOpeningANameReachesTheSameObjectOfItsKindOnly) {
  for (const Kind& kind : kKinds) {
    SCOPED_TRACE(kind.name);
    WideString name = GlobalName(kind.name);
    SetLastError(0);
    EXPECT_EQ(kind.open(name.c_str()), nullptr);
    EXPECT_EQ(GetLastError(), ERROR_FILE_NOT_FOUND);
    SetLastError(ERROR_INVALID_DATA);
    Handle first(kind.create(name.c_str()));
    ASSERT_TRUE(first);
    EXPECT_EQ(GetLastError(), ERROR_SUCCESS);  // a new object
    SetLastError(0);
    Handle again(kind.create(name.c_str()));
    ASSERT_TRUE(again);
    EXPECT_EQ(GetLastError(), ERROR_ALREADY_EXISTS);
    Handle opened(kind.open(name.c_str()));
    ASSERT_TRUE(opened);
    EXPECT_TRUE(kind.same(first.Get(), again.Get()));
    EXPECT_TRUE(kind.same(again.Get(), opened.Get()));
    // A name held by another kind of object is refused.
    for (const Kind& other : kKinds) {
      if (&other == &kind) continue;
      SetLastError(0);
      EXPECT_FALSE(Handle(other.create(name.c_str()))) << other.name;
      EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE) << other.name;
    }
  }
}

}  // namespace
