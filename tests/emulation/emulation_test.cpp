// Properties of the emulation itself that the conformance suite cannot state.
#include <gtest/gtest.h>
#include <stdlib.h>

#include <mutex>
#include <string>
#include <vector>

#include "platform/diagnostics.h"
#include "platform/posix/device_provider.h"
#include "platform/win32.h"
#include "support/child_process.h"
#include "support/test_support.h"

namespace {

using skytest::Handle;
using skytest::NewEvent;
using skytest::RunAsChild;
using skytest::Thread;

TEST(Handles, HandlesAndThreadsAreCountedAndAClosedHandleIsNeverValid) {
  long before = platform::LiveHandleCount();
  HANDLE event = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  HANDLE mutex = CreateMutexW(nullptr, FALSE, nullptr);
  ASSERT_TRUE(event != nullptr && mutex != nullptr && event != mutex);
  EXPECT_EQ(platform::LiveHandleCount(), before + 2);
  EXPECT_TRUE(CloseHandle(event));
  EXPECT_EQ(platform::LiveHandleCount(), before + 1);
  // A handle of the wrong kind fails as a closed one does.
  SetLastError(0);
  EXPECT_FALSE(SetEvent(mutex));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
  // The closed value is not handed out again at once.
  HANDLE next = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  EXPECT_NE(next, event);
  EXPECT_FALSE(SetEvent(event));
  EXPECT_TRUE(CloseHandle(next));
  EXPECT_TRUE(CloseHandle(mutex));
  EXPECT_EQ(platform::LiveHandleCount(), before);
  EXPECT_FALSE(CloseHandle(nullptr));
  EXPECT_TRUE(CloseHandle(GetCurrentProcess()));

  // A thread counts until it ends, even with its handle closed first.
  Handle release = NewEvent(true, false);
  HANDLE thread = CreateThread(
      nullptr, 0, [](LPVOID p) -> DWORD { return WaitForSingleObject(p, INFINITE); }, release.Get(),
      0, nullptr);
  ASSERT_NE(thread, nullptr);
  EXPECT_TRUE(CloseHandle(thread));
  EXPECT_EQ(platform::LiveThreadCount(), 1);
  SetEvent(release.Get());
  while (platform::LiveThreadCount() != 0) Sleep(1);  // ends with the thread, or the case times out
}

// The factor is read once per process, so a child runs with its own value.
TEST(TimeScale, HoursOfWaitingPassQuicklyWithATinyScale) {
  if (skytest::ChildRole() != nullptr) {
    EXPECT_DOUBLE_EQ(platform::TimeScale(), 0.0001);
    Handle event = NewEvent(false, false);
    ULONGLONG start = GetTickCount64();
    EXPECT_EQ(WaitForSingleObject(event.Get(), 10000000), WAIT_TIMEOUT);
    Sleep(5000000);
    EXPECT_GE(GetTickCount64() - start, 15000000u);  // the emulated clock ran as far
    HANDLE pair[2] = {event.Get(), event.Get()};
    EXPECT_EQ(WaitForMultipleObjects(2, pair, FALSE, 1), WAIT_TIMEOUT);
    return;
  }
  const char* previous = getenv("SKYVANE_TIME_SCALE");
  const std::string saved = previous != nullptr ? previous : "1";
  setenv("SKYVANE_TIME_SCALE", "0.0001", 1);
  EXPECT_EQ(skytest::RunChildSelf("scaled", 120000), 0);  // real time
  setenv("SKYVANE_TIME_SCALE", saved.c_str(), 1);
}

TEST(Namespace, ObjectsOfADeadProcessGoWithIt) {
  RunAsChild("leaker", [] {
    HANDLE event = CreateEventW(nullptr, TRUE, TRUE, WSTR("Global\\EmuXpLeaked"));
    return event != nullptr ? 0 : 10;  // ends without closing
  });
  ASSERT_EQ(skytest::RunChildSelf("leaker", skytest::kProcessGuardMs), 0);
  SetLastError(0);
  Handle fresh(CreateEventW(nullptr, TRUE, FALSE, WSTR("Global\\EmuXpLeaked")));
  ASSERT_TRUE(fresh);
  EXPECT_EQ(GetLastError(), ERROR_SUCCESS);  // a new object, not the dead one's
  EXPECT_EQ(WaitForSingleObject(fresh.Get(), 0), WAIT_TIMEOUT);
}

// A device that keeps every request pending until the test completes it.
struct FakeDevice : emu::DeviceFile {
  std::mutex lock;
  std::vector<emu::IoRequestPtr> pending;
  emu::IoStart Control(DWORD, const void*, DWORD, void*, DWORD,
                       const emu::IoRequestPtr& request) override {
    return Read(nullptr, 0, request);
  }
  emu::IoStart Read(void*, DWORD, const emu::IoRequestPtr& request) override {
    std::lock_guard<std::mutex> guard(lock);
    pending.push_back(request);
    return {true, ERROR_SUCCESS, 0};
  }
  emu::IoStart Write(const void*, DWORD length, const emu::IoRequestPtr&) override {
    return {false, ERROR_SUCCESS, length};
  }
};

struct FakeProvider : emu::DeviceProvider {
  FakeDevice* last = nullptr;
  std::unique_ptr<emu::DeviceFile> Open(const WCHAR*, DWORD, DWORD, DWORD, DWORD*) override {
    auto device = std::make_unique<FakeDevice>();
    last = device.get();
    return device;
  }
};

// A device request completes once, from any thread, into the caller's buffer;
// closing the handle cancels what is pending.
TEST(DeviceRequests, CompleteOnceIntoTheCallersBufferAndAreCancelledOnClose) {
  FakeProvider provider;
  emu::SetDeviceProvider(&provider);
  HANDLE device = CreateFileW(WSTR("\\\\?\\fake#1"), GENERIC_READ | GENERIC_WRITE, 0, nullptr,
                              OPEN_EXISTING, FILE_FLAG_OVERLAPPED, nullptr);
  ASSERT_NE(device, INVALID_HANDLE_VALUE);
  Handle event = NewEvent(true, false);
  OVERLAPPED ov{};
  ov.hEvent = event.Get();
  DWORD bytes = 0;
  unsigned char out[8] = {};
  EXPECT_FALSE(DeviceIoControl(device, 9, nullptr, 0, out, sizeof(out), &bytes, &ov));
  EXPECT_EQ(GetLastError(), ERROR_IO_PENDING);
  emu::IoRequestPtr request = provider.last->pending.back();
  EXPECT_EQ(emu::IoOutputBuffer(request), out);
  Thread completer([&]() -> DWORD {
    static_cast<unsigned char*>(emu::IoOutputBuffer(request))[0] = 0xAB;
    emu::CompleteIo(request, ERROR_SUCCESS, 1);
    emu::CompleteIo(request, ERROR_GEN_FAILURE, 5);  // ignored
    return 0;
  });
  EXPECT_TRUE(GetOverlappedResult(device, &ov, &bytes, TRUE));
  EXPECT_EQ(bytes, 1u);
  EXPECT_EQ(out[0], 0xAB);
  EXPECT_EQ(completer.Join(), 0u);
  EXPECT_EQ(ov.InternalHigh, 1u);

  skytest::Overlapped pending;
  char buffer[4];
  EXPECT_FALSE(ReadFile(device, buffer, 4, nullptr, pending.Get()));
  EXPECT_EQ(GetLastError(), ERROR_IO_PENDING);
  CloseHandle(device);
  EXPECT_EQ(WaitForSingleObject(pending.event.Get(), skytest::kGuardMs), WAIT_OBJECT_0);
  EXPECT_EQ(pending.record.Internal, 0xC0000120u);  // STATUS_CANCELLED
  emu::SetDeviceProvider(nullptr);
}

}  // namespace
