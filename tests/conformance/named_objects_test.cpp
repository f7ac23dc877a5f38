// Named kernel objects under "Global\": the pagefile-backed mapping, the
// mutex and events that the service shares with the user-interface process.
// Creating an existing name opens the same object (ERROR_ALREADY_EXISTS), a
// second process sees it, and the object lives as long as any handle does.
#include <gtest/gtest.h>

#include <cstring>

#include "support/child_process.h"
#include "support/test_support.h"

namespace {

using skytest::ChildRole;
using skytest::Handle;
using skytest::kGuardMs;
using skytest::UniqueName;

constexpr DWORD kBlockBytes = 1215512;  // the size of the service's state block

WideString GlobalName(const char* tag) {
  return UniqueName("Global\\", tag);
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
    // Creating the name again here opens the parent's block too.
    SetLastError(0);
    Handle created = CreateBlockMapping(name);
    ASSERT_TRUE(created);
    EXPECT_EQ(GetLastError(), ERROR_ALREADY_EXISTS);
    View second(created.Get(), FILE_MAP_READ);
    ASSERT_TRUE(second);
    EXPECT_EQ(std::memcmp(second.Bytes() + 1000, "seen", 4), 0);
    return;
  }
  OpenToAll security;
  SetLastError(ERROR_INVALID_DATA);
  Handle mapping = CreateBlockMapping(name, &security.attributes);
  ASSERT_TRUE(mapping);
  EXPECT_EQ(GetLastError(), ERROR_SUCCESS);  // a new object
  View view(mapping.Get(), FILE_MAP_ALL_ACCESS);
  ASSERT_TRUE(view);
  std::memcpy(view.Bytes(), "block", 5);
  view.Bytes()[kBlockBytes - 1] = 0x5A;

  ASSERT_EQ(skytest::RunChildSelf("reader", skytest::kProcessGuardMs), 0);
  EXPECT_EQ(std::memcmp(view.Bytes() + 1000, "seen", 4), 0);
}

TEST(NamedObjects, CreatingAnExistingNameOpensTheSameObject) {
  WideString mapName = GlobalName("map");
  Handle first = CreateBlockMapping(mapName);
  ASSERT_TRUE(first);
  SetLastError(0);
  Handle second = CreateBlockMapping(mapName);
  ASSERT_TRUE(second);
  EXPECT_EQ(GetLastError(), ERROR_ALREADY_EXISTS);
  View a(first.Get(), FILE_MAP_ALL_ACCESS);
  View b(second.Get(), FILE_MAP_READ);
  ASSERT_TRUE(a && b);
  a.Bytes()[12345] = 0xC3;
  EXPECT_EQ(b.Bytes()[12345], 0xC3);

  WideString eventName = GlobalName("event");
  Handle event(CreateEventW(nullptr, TRUE, FALSE, eventName.c_str()));
  ASSERT_TRUE(event);
  SetLastError(0);
  Handle sameEvent(CreateEventW(nullptr, TRUE, FALSE, eventName.c_str()));
  ASSERT_TRUE(sameEvent);
  EXPECT_EQ(GetLastError(), ERROR_ALREADY_EXISTS);
  ASSERT_TRUE(SetEvent(event.Get()));
  EXPECT_EQ(WaitForSingleObject(sameEvent.Get(), 0), WAIT_OBJECT_0);

  WideString mutexName = GlobalName("mutex");
  Handle mutex(CreateMutexW(nullptr, FALSE, mutexName.c_str()));
  ASSERT_TRUE(mutex);
  SetLastError(0);
  Handle sameMutex(CreateMutexW(nullptr, FALSE, mutexName.c_str()));
  ASSERT_TRUE(sameMutex);
  EXPECT_EQ(GetLastError(), ERROR_ALREADY_EXISTS);
  // Ownership taken through one handle is released through the other.
  ASSERT_EQ(WaitForSingleObject(mutex.Get(), 0), WAIT_OBJECT_0);
  EXPECT_TRUE(ReleaseMutex(sameMutex.Get()));
}

TEST(NamedObjects, OpeningAMissingNameGivesFileNotFound) {
  WideString name = GlobalName("absent");
  SetLastError(0);
  EXPECT_EQ(OpenFileMappingW(FILE_MAP_READ, FALSE, name.c_str()), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_FILE_NOT_FOUND);
  SetLastError(0);
  EXPECT_EQ(OpenEventW(EVENT_MODIFY_STATE | SYNCHRONIZE, FALSE, name.c_str()), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_FILE_NOT_FOUND);
  SetLastError(0);
  EXPECT_EQ(OpenMutexW(SYNCHRONIZE, FALSE, name.c_str()), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_FILE_NOT_FOUND);
}

TEST(NamedObjects, NameHeldByAnotherKindOfObjectIsRefused) {
  WideString name = GlobalName("event");
  Handle event(CreateEventW(nullptr, TRUE, FALSE, name.c_str()));
  ASSERT_TRUE(event);
  SetLastError(0);
  Handle mutex(CreateMutexW(nullptr, FALSE, name.c_str()));
  EXPECT_FALSE(mutex);
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
  SetLastError(0);
  Handle mapping = CreateBlockMapping(name);
  EXPECT_FALSE(mapping);
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
}

TEST(NamedObjects, MappingLivesAsLongAsAnyHandleAndThenGoes) {
  WideString name = GlobalName("map");
  Handle creator = CreateBlockMapping(name);
  ASSERT_TRUE(creator);
  {
    View view(creator.Get(), FILE_MAP_ALL_ACCESS);
    ASSERT_TRUE(view);
    view.Bytes()[kBlockBytes - 4] = 0x77;
  }
  Handle reader(OpenFileMappingW(FILE_MAP_READ, FALSE, name.c_str()));
  ASSERT_TRUE(reader);
  creator.Reset();  // the creator is gone; the reader still holds the block
  {
    Handle again(OpenFileMappingW(FILE_MAP_READ, FALSE, name.c_str()));
    ASSERT_TRUE(again);
    View view(again.Get(), FILE_MAP_READ);
    ASSERT_TRUE(view);
    EXPECT_EQ(view.Bytes()[kBlockBytes - 4], 0x77);
  }
  reader.Reset();

  // With the last handle closed the name is free and a new block starts zeroed.
  SetLastError(ERROR_INVALID_DATA);
  Handle fresh = CreateBlockMapping(name);
  ASSERT_TRUE(fresh);
  EXPECT_EQ(GetLastError(), ERROR_SUCCESS);
  View view(fresh.Get(), FILE_MAP_READ);
  ASSERT_TRUE(view);
  EXPECT_EQ(view.Bytes()[kBlockBytes - 4], 0);
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
