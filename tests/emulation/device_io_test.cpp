// Device handles: CreateFileW and the I/O calls reach the installed
// DeviceProvider, and requests it keeps pending complete through CompleteIo
// with Win32 overlapped semantics.
#include <gtest/gtest.h>

#include <cstring>
#include <mutex>
#include <vector>

#include "platform/diagnostics.h"
#include "platform/posix/device_provider.h"
#include "platform/wide.h"
#include "platform/win32.h"

namespace {

// A device that answers code 1 at once (echoing the input), fails code 2 at
// once, and keeps every other request pending until the test completes it.
struct FakeDevice : emu::DeviceFile {
  std::mutex lock;
  std::vector<emu::IoRequestPtr> pending;
  int cancels = 0;
  bool* closed;
  explicit FakeDevice(bool* closedFlag) : closed(closedFlag) {}

  emu::IoStart Control(DWORD code, const void* input, DWORD inputLength, void* output,
                       DWORD outputLength, const emu::IoRequestPtr& request) override {
    if (code == 1) {
      DWORD n = inputLength < outputLength ? inputLength : outputLength;
      std::memcpy(output, input, n);
      return {false, ERROR_SUCCESS, n};
    }
    if (code == 2) return {false, ERROR_INVALID_FUNCTION, 0};
    std::lock_guard<std::mutex> guard(lock);
    pending.push_back(request);
    return {true, ERROR_SUCCESS, 0};
  }
  emu::IoStart Read(void*, DWORD, const emu::IoRequestPtr& request) override {
    std::lock_guard<std::mutex> guard(lock);
    pending.push_back(request);
    return {true, ERROR_SUCCESS, 0};
  }
  emu::IoStart Write(const void*, DWORD length, const emu::IoRequestPtr&) override {
    return {false, ERROR_SUCCESS, length};
  }
  void Cancel(const emu::IoRequestPtr& request) override {
    {
      std::lock_guard<std::mutex> guard(lock);
      ++cancels;
    }
    emu::DeviceFile::Cancel(request);
  }
  void Closed() override { *closed = true; }

  emu::IoRequestPtr Take() {
    std::lock_guard<std::mutex> guard(lock);
    if (pending.empty()) return nullptr;
    emu::IoRequestPtr request = pending.front();
    pending.erase(pending.begin());
    return request;
  }
};

struct FakeProvider : emu::DeviceProvider {
  FakeDevice* last = nullptr;
  bool closed = false;
  std::unique_ptr<emu::DeviceFile> Open(const WCHAR* path, DWORD, DWORD, DWORD,
                                        DWORD* error) override {
    if (!WideEqual(path, WSTR("\\\\?\\fake#1"))) {
      *error = ERROR_FILE_NOT_FOUND;
      return nullptr;
    }
    auto device = std::make_unique<FakeDevice>(&closed);
    last = device.get();
    return device;
  }
};

class DeviceIo : public ::testing::Test {
 protected:
  void SetUp() override { emu::SetDeviceProvider(&provider_); }
  void TearDown() override { emu::SetDeviceProvider(nullptr); }
  HANDLE Open(DWORD flags) {
    return CreateFileW(WSTR("\\\\?\\fake#1"), GENERIC_READ | GENERIC_WRITE, 0, nullptr,
                       OPEN_EXISTING, flags, nullptr);
  }
  FakeProvider provider_;
};

TEST_F(DeviceIo, PathsWithoutADeviceAreNotFound) {
  emu::SetDeviceProvider(nullptr);
  SetLastError(0);
  EXPECT_EQ(Open(0), INVALID_HANDLE_VALUE);
  EXPECT_EQ(GetLastError(), ERROR_FILE_NOT_FOUND);
  emu::SetDeviceProvider(&provider_);
  EXPECT_EQ(CreateFileW(WSTR("\\\\?\\other"), GENERIC_READ, 0, nullptr, OPEN_EXISTING, 0, nullptr),
            INVALID_HANDLE_VALUE);
  EXPECT_EQ(GetLastError(), ERROR_FILE_NOT_FOUND);
  EXPECT_EQ(platform::LiveHandleCount(), 0);
}

TEST_F(DeviceIo, ImmediateResultsOnAnOverlappedHandle) {
  HANDLE device = Open(FILE_FLAG_OVERLAPPED);
  ASSERT_NE(device, INVALID_HANDLE_VALUE);
  HANDLE event = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  OVERLAPPED ov{};
  ov.hEvent = event;
  char in[4] = {1, 2, 3, 4};
  char out[4] = {};
  DWORD bytes = 99;
  EXPECT_TRUE(DeviceIoControl(device, 1, in, 4, out, 4, &bytes, &ov));
  EXPECT_EQ(bytes, 4u);
  EXPECT_EQ(out[3], 4);
  EXPECT_EQ(ov.Internal, STATUS_SUCCESS);
  EXPECT_EQ(ov.InternalHigh, 4u);
  EXPECT_EQ(WaitForSingleObject(event, 0), WAIT_OBJECT_0);  // signalled as well

  // A failure at once leaves the event alone.
  ResetEvent(event);
  EXPECT_FALSE(DeviceIoControl(device, 2, nullptr, 0, nullptr, 0, &bytes, &ov));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_FUNCTION);
  EXPECT_EQ(WaitForSingleObject(event, 0), WAIT_TIMEOUT);
  CloseHandle(event);
  CloseHandle(device);
  EXPECT_TRUE(provider_.closed);
}

TEST_F(DeviceIo, PendingRequestCompletesFromAnotherThread) {
  HANDLE device = Open(FILE_FLAG_OVERLAPPED);
  HANDLE event = CreateEventW(nullptr, FALSE, FALSE, nullptr);
  OVERLAPPED ov{};
  ov.hEvent = event;
  unsigned char out[8] = {};
  DWORD bytes = 0;
  EXPECT_FALSE(DeviceIoControl(device, 9, nullptr, 0, out, sizeof(out), &bytes, &ov));
  EXPECT_EQ(GetLastError(), ERROR_IO_PENDING);
  EXPECT_EQ(ov.Internal, STATUS_PENDING);
  EXPECT_FALSE(GetOverlappedResult(device, &ov, &bytes, FALSE));
  EXPECT_EQ(GetLastError(), ERROR_IO_INCOMPLETE);

  emu::IoRequestPtr request = provider_.last->Take();
  ASSERT_NE(request, nullptr);
  EXPECT_EQ(emu::IoOutputBuffer(request), out);
  EXPECT_EQ(emu::IoOutputLength(request), sizeof(out));
  struct Args {
    emu::IoRequestPtr request;
  } args{request};
  HANDLE completer = CreateThread(
      nullptr, 0,
      [](LPVOID p) -> DWORD {
        auto* a = static_cast<Args*>(p);
        static_cast<unsigned char*>(emu::IoOutputBuffer(a->request))[0] = 0xAB;
        emu::CompleteIo(a->request, ERROR_SUCCESS, 1);
        emu::CompleteIo(a->request, ERROR_GEN_FAILURE, 5);  // ignored
        return 0;
      },
      &args, 0, nullptr);
  EXPECT_TRUE(GetOverlappedResult(device, &ov, &bytes, TRUE));
  EXPECT_EQ(bytes, 1u);
  EXPECT_EQ(out[0], 0xAB);
  WaitForSingleObject(completer, INFINITE);
  EXPECT_EQ(ov.InternalHigh, 1u);
  CloseHandle(completer);
  CloseHandle(event);
  CloseHandle(device);
}

TEST_F(DeviceIo, CancelIoTouchesOnlyTheCallingThreadsRequests) {
  HANDLE device = Open(FILE_FLAG_OVERLAPPED);
  struct Args {
    HANDLE device;
    HANDLE started;
    OVERLAPPED ov;
  } args{device, CreateEventW(nullptr, TRUE, FALSE, nullptr), {}};
  args.ov.hEvent = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  HANDLE other = CreateThread(
      nullptr, 0,
      [](LPVOID p) -> DWORD {
        auto* a = static_cast<Args*>(p);
        char buffer[4];
        ReadFile(a->device, buffer, 4, nullptr, &a->ov);
        SetEvent(a->started);
        return GetLastError();
      },
      &args, 0, nullptr);
  ASSERT_EQ(WaitForSingleObject(args.started, 10000), WAIT_OBJECT_0);
  OVERLAPPED mine{};
  mine.hEvent = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  char buffer[4];
  EXPECT_FALSE(ReadFile(device, buffer, 4, nullptr, &mine));
  EXPECT_EQ(GetLastError(), ERROR_IO_PENDING);
  EXPECT_TRUE(CancelIo(device));
  DWORD bytes = 7;
  EXPECT_FALSE(GetOverlappedResult(device, &mine, &bytes, TRUE));
  EXPECT_EQ(GetLastError(), ERROR_OPERATION_ABORTED);
  EXPECT_EQ(bytes, 0u);
  EXPECT_EQ(WaitForSingleObject(args.ov.hEvent, 0), WAIT_TIMEOUT);
  EXPECT_EQ(provider_.last->cancels, 1);
  // The thread that started it has ended; its request is still pending
  // until the device or a close ends it.
  WaitForSingleObject(other, INFINITE);
  DWORD code = 0;
  GetExitCodeThread(other, &code);
  EXPECT_EQ(code, ERROR_IO_PENDING);
  EXPECT_EQ(args.ov.Internal, STATUS_PENDING);
  CloseHandle(device);  // cancels what is left
  EXPECT_EQ(WaitForSingleObject(args.ov.hEvent, 10000), WAIT_OBJECT_0);
  EXPECT_EQ(args.ov.Internal, 0xC0000120u);  // STATUS_CANCELLED
  for (HANDLE h : {other, args.started, args.ov.hEvent, mine.hEvent}) CloseHandle(h);
}

TEST_F(DeviceIo, SynchronousHandleWaitsForThePendingRequest) {
  HANDLE device = Open(0);
  struct Args {
    FakeProvider* provider;
  } args{&provider_};
  HANDLE completer = CreateThread(
      nullptr, 0,
      [](LPVOID p) -> DWORD {
        auto* a = static_cast<Args*>(p);
        emu::IoRequestPtr request;
        while ((request = a->provider->last->Take()) == nullptr) Sleep(1);
        emu::CompleteIo(request, ERROR_DEV_NOT_EXIST, 0);
        return 0;
      },
      &args, 0, nullptr);
  DWORD bytes = 5;
  SetLastError(0);
  EXPECT_FALSE(DeviceIoControl(device, 9, nullptr, 0, nullptr, 0, &bytes, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_DEV_NOT_EXIST);
  EXPECT_EQ(bytes, 0u);
  WaitForSingleObject(completer, INFINITE);
  CloseHandle(completer);
  CloseHandle(device);
}

}  // namespace
