// Named kernel objects under "Global\": the pagefile-backed mapping, the
// mutex and the events that the service shares with the user-interface
// process. Creating an existing name opens the same object
// (ERROR_ALREADY_EXISTS) and another process sees it.
#include <gtest/gtest.h>

#include <cstring>
#include <functional>

#include "support/child_process.h"
#include "support/test_support.h"

namespace {

using skytest::ChildRole;
using skytest::Handle;
using skytest::kGuardMs;

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

// Security attributes with a null DACL, as the service creates its objects.
struct OpenToAll {
  SECURITY_DESCRIPTOR descriptor{};
  SECURITY_ATTRIBUTES attributes{};
  OpenToAll() {
    InitializeSecurityDescriptor(&descriptor, SECURITY_DESCRIPTOR_REVISION);
    SetSecurityDescriptorDacl(&descriptor, TRUE, nullptr, FALSE);
    attributes = {sizeof(attributes), &descriptor, FALSE};
  }
};

Handle CreateBlockMapping(const WideString& name, SECURITY_ATTRIBUTES* attributes = nullptr) {
  return Handle(CreateFileMappingW(INVALID_HANDLE_VALUE, attributes, PAGE_READWRITE, 0, kBlockBytes,
                                   name.c_str()));
}

// The three kinds of named object, each with its create and open call and a
// check that two handles reach one object.
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

TEST(NamedObjects, MappingCreatedByOneProcessIsReadByAnother) {
  WideString name = GlobalName("map");
  if (ChildRole() != nullptr) {
    // The reader: opens the parent's mapping by name, checks the parent's
    // bytes and answers in the same memory.
    Handle opened(OpenFileMappingW(FILE_MAP_ALL_ACCESS, FALSE, name.c_str()));
    ASSERT_TRUE(opened) << GetLastError();
    View view(opened.Get(), FILE_MAP_ALL_ACCESS);
    ASSERT_TRUE(view);
    EXPECT_EQ(std::memcmp(view.Bytes(), "block", 5), 0);
    EXPECT_EQ(view.Bytes()[kBlockBytes - 1], 0x5A);
    EXPECT_EQ(view.Bytes()[kBlockBytes / 2], 0);  // never written: zero-filled
    std::memcpy(view.Bytes() + 1000, "seen", 4);
    SetLastError(0);
    Handle created = CreateBlockMapping(name);  // opens the parent's block too
    ASSERT_TRUE(created);
    EXPECT_EQ(GetLastError(), ERROR_ALREADY_EXISTS);
    return;
  }
  OpenToAll security;
  Handle mapping = CreateBlockMapping(name, &security.attributes);
  ASSERT_TRUE(mapping);
  View view(mapping.Get(), FILE_MAP_ALL_ACCESS);
  ASSERT_TRUE(view);
  std::memcpy(view.Bytes(), "block", 5);
  view.Bytes()[kBlockBytes - 1] = 0x5A;
  ASSERT_EQ(skytest::RunChildSelf("reader", skytest::kProcessGuardMs), 0);
  EXPECT_EQ(std::memcmp(view.Bytes() + 1000, "seen", 4), 0);
}

TEST(NamedObjects, MutexAndEventsWorkAcrossProcessesAndAbandonOnExit) {
  WideString mutexName = GlobalName("mutex");
  WideString readyName = GlobalName("ready");
  WideString goName = GlobalName("go");
  if (ChildRole() != nullptr) {
    // The peer: finds the mutex held by the parent, says so, waits for the
    // parent to let go, takes the mutex and ends while owning it.
    Handle mutex(OpenMutexW(SYNCHRONIZE | MUTEX_MODIFY_STATE, FALSE, mutexName.c_str()));
    SetLastError(0);
    Handle ready(CreateEventW(nullptr, TRUE, FALSE, readyName.c_str()));
    EXPECT_EQ(GetLastError(), ERROR_ALREADY_EXISTS);
    Handle go(OpenEventW(SYNCHRONIZE | EVENT_MODIFY_STATE, FALSE, goName.c_str()));
    ASSERT_TRUE(mutex && ready && go);
    ASSERT_EQ(WaitForSingleObject(mutex.Get(), 0), WAIT_TIMEOUT);
    ASSERT_TRUE(SetEvent(ready.Get()));
    ASSERT_EQ(WaitForSingleObject(go.Get(), kGuardMs), WAIT_OBJECT_0);
    ASSERT_EQ(WaitForSingleObject(mutex.Get(), kGuardMs), WAIT_OBJECT_0);
    return;  // handles close; ownership ends with the process
  }
  OpenToAll security;
  Handle mutex(CreateMutexW(&security.attributes, TRUE, mutexName.c_str()));
  Handle ready(CreateEventW(&security.attributes, TRUE, FALSE, readyName.c_str()));
  Handle go(CreateEventW(&security.attributes, FALSE, FALSE, goName.c_str()));
  ASSERT_TRUE(mutex && ready && go);
  skytest::ChildProcess child;
  ASSERT_TRUE(child.Start("peer"));
  ASSERT_EQ(WaitForSingleObject(ready.Get(), kGuardMs), WAIT_OBJECT_0);
  ASSERT_TRUE(ReleaseMutex(mutex.Get()));
  ASSERT_TRUE(SetEvent(go.Get()));
  ASSERT_EQ(child.Wait(skytest::kProcessGuardMs), 0);
  EXPECT_EQ(WaitForSingleObject(mutex.Get(), kGuardMs), WAIT_ABANDONED);
  EXPECT_TRUE(ReleaseMutex(mutex.Get()));
}

}  // namespace
