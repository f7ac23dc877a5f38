// CreateFileW and the device handles answered by the DeviceProvider.
#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <mutex>
#include <vector>

#include "platform/posix/device_provider.h"
#include "platform/posix/file_object.h"
#include "platform/posix/pipes.h"
#include "platform/win32.h"

namespace emu {

class DeviceFileObject;

struct IoRequest {
  std::weak_ptr<DeviceFileObject> owner;
  OVERLAPPED* overlapped = nullptr;
  std::shared_ptr<SlotObject> event;
  void* output = nullptr;
  DWORD outputLength = 0;
  std::int32_t thread = 0;
  std::atomic<bool> cancelRequested{false};
  // Guarded by the device I/O lock below.
  bool completed = false;  // taken by one completer; the device may not complete it again
  bool settled = false;    // its OVERLAPPED and event are written: the caller may go on
  DWORD error = ERROR_SUCCESS;
  DWORD bytes = 0;
};

namespace {

std::atomic<DeviceProvider*> g_provider{nullptr};

// Completion of device requests: a synchronous caller waits here for its
// request. Never destroyed (devices may complete during exit).
struct DeviceIo {
  std::mutex lock;
  std::condition_variable completed;
};

DeviceIo& Io() {
  static DeviceIo* io = new DeviceIo();
  return *io;
}

}  // namespace

class DeviceFileObject : public FileObject, public std::enable_shared_from_this<DeviceFileObject> {
 public:
  DeviceFileObject(std::unique_ptr<DeviceFile> file, bool overlapped)
      : FileObject(overlapped), file_(std::move(file)) {}

  BOOL Read(void* buffer, DWORD length, DWORD* done, OVERLAPPED* overlapped) override {
    return Run(overlapped, buffer, length, done,
               [&](const IoRequestPtr& request) { return file_->Read(buffer, length, request); });
  }
  BOOL Write(const void* buffer, DWORD length, DWORD* done, OVERLAPPED* overlapped) override {
    return Run(overlapped, nullptr, 0, done,
               [&](const IoRequestPtr& request) { return file_->Write(buffer, length, request); });
  }
  BOOL Control(DWORD code, void* input, DWORD inputLength, void* output, DWORD outputLength,
               DWORD* done, OVERLAPPED* overlapped) override {
    return Run(overlapped, output, outputLength, done, [&](const IoRequestPtr& request) {
      return file_->Control(code, input, inputLength, output, outputLength, request);
    });
  }

  int Cancel(std::int32_t threadId, OVERLAPPED* overlapped) override {
    std::vector<IoRequestPtr> chosen;
    {
      std::lock_guard<std::mutex> guard(lock_);
      for (const IoRequestPtr& request : pending_) {
        if (overlapped != nullptr ? request->overlapped == overlapped
                                  : threadId == 0 || request->thread == threadId) {
          chosen.push_back(request);
        }
      }
    }
    for (const IoRequestPtr& request : chosen) {
      request->cancelRequested = true;
      file_->Cancel(request);
    }
    return static_cast<int>(chosen.size());
  }

  void HandleClosed() override {
    Cancel(0, nullptr);
    file_->Closed();
  }

  void Forget(IoRequest* request) {
    std::lock_guard<std::mutex> guard(lock_);
    pending_.erase(std::remove_if(pending_.begin(), pending_.end(),
                                  [request](const IoRequestPtr& p) { return p.get() == request; }),
                   pending_.end());
  }

 private:
  template <class Start>
  BOOL Run(OVERLAPPED* overlapped, void* output, DWORD outputLength, DWORD* done, Start start) {
    std::shared_ptr<SlotObject> event;
    if (!ResolveEvent(overlapped, &event)) return FALSE;
    auto request = std::make_shared<IoRequest>();
    request->owner = weak_from_this();
    request->overlapped = overlapped;
    request->event = event;
    request->output = output;
    request->outputLength = outputLength;
    request->thread = kernel::ThreadId();
    bool asynchronous = Overlapped() && overlapped != nullptr;
    if (asynchronous) StartOverlapped(overlapped, event);
    {
      std::lock_guard<std::mutex> guard(lock_);
      pending_.push_back(request);
    }
    IoStart result = start(request);
    if (!result.pending) {
      // Finished at once: the device must not complete it later.
      {
        std::lock_guard<std::mutex> guard(Io().lock);
        request->completed = true;
        request->settled = true;
      }
      Forget(request.get());
      if (asynchronous) return FinishAtOnce(overlapped, event, result.error, result.bytes, done);
      return Report(overlapped, event, result.error, result.bytes, done);
    }
    if (asynchronous) {
      SetLastError(ERROR_IO_PENDING);
      return FALSE;
    }
    // A synchronous handle: wait here until the device completes it and its
    // OVERLAPPED, if one was given, is written (the caller may free it as
    // soon as the call returns).
    DWORD error;
    DWORD bytes;
    {
      std::unique_lock<std::mutex> guard(Io().lock);
      Io().completed.wait(guard, [&] { return request->settled; });
      error = request->error;
      bytes = request->bytes;
    }
    if (done != nullptr) *done = bytes;
    if (error != ERROR_SUCCESS) {
      SetLastError(error);
      return FALSE;
    }
    return TRUE;
  }

  // Result of a request on a synchronous handle (an OVERLAPPED given with it
  // still receives the status and its event is signalled).
  static BOOL Report(OVERLAPPED* overlapped, const std::shared_ptr<SlotObject>& event, DWORD error,
                     DWORD bytes, DWORD* done) {
    if (overlapped != nullptr) {
      StoreOverlapped(overlapped, error, bytes);
      SignalEvent(event);
    }
    if (done != nullptr) *done = bytes;
    if (error != ERROR_SUCCESS) {
      SetLastError(error);
      return FALSE;
    }
    return TRUE;
  }

  std::unique_ptr<DeviceFile> file_;
  std::mutex lock_;
  std::vector<IoRequestPtr> pending_;
};

void CompleteIo(const IoRequestPtr& request, DWORD error, DWORD bytes) {
  if (request == nullptr) return;
  {
    std::lock_guard<std::mutex> guard(Io().lock);
    if (request->completed) return;
    request->completed = true;
    request->error = error;
    request->bytes = bytes;
  }
  if (auto owner = request->owner.lock()) owner->Forget(request.get());
  StoreOverlapped(request->overlapped, error, bytes);
  SignalEvent(request->event);
  {
    std::lock_guard<std::mutex> guard(Io().lock);
    request->settled = true;
  }
  Io().completed.notify_all();
}

void* IoOutputBuffer(const IoRequestPtr& request) {
  return request->output;
}
DWORD IoOutputLength(const IoRequestPtr& request) {
  return request->outputLength;
}
bool IoCancelRequested(const IoRequestPtr& request) {
  return request->cancelRequested;
}

void SetDeviceProvider(DeviceProvider* provider) {
  g_provider = provider;
}
DeviceProvider* GetDeviceProvider() {
  return g_provider;
}

}  // namespace emu

HANDLE CreateFileW(LPCWSTR fileName, DWORD desiredAccess, DWORD shareMode,
                   LPSECURITY_ATTRIBUTES /*securityAttributes*/, DWORD creationDisposition,
                   DWORD flagsAndAttributes, HANDLE /*templateFile*/) {
  if (fileName == nullptr || fileName[0] == 0) {
    SetLastError(ERROR_PATH_NOT_FOUND);
    return INVALID_HANDLE_VALUE;
  }
  const WCHAR* pipeName = nullptr;
  if (emu::IsPipePath(fileName, &pipeName)) {
    if (creationDisposition != OPEN_EXISTING) {
      SetLastError(ERROR_INVALID_PARAMETER);
      return INVALID_HANDLE_VALUE;
    }
    return emu::OpenPipeClient(pipeName, desiredAccess, flagsAndAttributes);
  }
  emu::DeviceProvider* provider = emu::GetDeviceProvider();
  if (provider == nullptr) {
    SetLastError(ERROR_FILE_NOT_FOUND);
    return INVALID_HANDLE_VALUE;
  }
  DWORD error = ERROR_FILE_NOT_FOUND;
  std::unique_ptr<emu::DeviceFile> file =
      provider->Open(fileName, desiredAccess, shareMode, flagsAndAttributes, &error);
  if (file == nullptr) {
    SetLastError(error == ERROR_SUCCESS ? ERROR_FILE_NOT_FOUND : error);
    return INVALID_HANDLE_VALUE;
  }
  bool overlapped = (flagsAndAttributes & FILE_FLAG_OVERLAPPED) != 0;
  HANDLE handle =
      emu::AllocateHandle(std::make_shared<emu::DeviceFileObject>(std::move(file), overlapped));
  SetLastError(ERROR_SUCCESS);
  return handle;
}
