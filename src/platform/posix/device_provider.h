// How the emulation reaches devices: CreateFileW on a path that is neither a
// named pipe nor a file the emulation knows asks the installed provider (the
// simulated computer) to open it; ReadFile, WriteFile, DeviceIoControl and
// CancelIo on the handle go to the DeviceFile it returned.
#pragma once

#include <memory>

#include "platform/posix/win32_base.h"

namespace emu {

// One I/O request started on a device handle. The emulation owns it; a device
// that cannot answer at once keeps the shared pointer and completes it later,
// from any thread, with CompleteIo. Until then the caller's buffers and
// OVERLAPPED stay in use, exactly as on Windows.
struct IoRequest;
using IoRequestPtr = std::shared_ptr<IoRequest>;

// Completes a pending request: `error` is a Win32 error code (0 = success),
// `bytes` the count transferred (already written into the caller's output
// buffer by the device). Sets the OVERLAPPED status and count and signals its
// event. A second completion of the same request is ignored.
void CompleteIo(const IoRequestPtr& request, DWORD error, DWORD bytes);
// The output buffer and its length of a pending request (null/0 for writes).
void* IoOutputBuffer(const IoRequestPtr& request);
DWORD IoOutputLength(const IoRequestPtr& request);
// Whether CancelIo has been called for the request (it may still complete).
bool IoCancelRequested(const IoRequestPtr& request);

// Result of starting a request: either done at once (error and byte count),
// or pending (the device keeps `request` and completes it later).
struct IoStart {
  bool pending = false;
  DWORD error = ERROR_SUCCESS;
  DWORD bytes = 0;
};

class DeviceFile {
 public:
  DeviceFile() = default;
  DeviceFile(const DeviceFile&) = delete;
  DeviceFile& operator=(const DeviceFile&) = delete;
  virtual ~DeviceFile() = default;

  // `overlapped` tells whether the handle was opened with FILE_FLAG_OVERLAPPED;
  // a synchronous handle makes the caller wait until a pending request ends.
  virtual IoStart Control(DWORD code, const void* input, DWORD inputLength, void* output,
                          DWORD outputLength, const IoRequestPtr& request) = 0;
  virtual IoStart Read(void* buffer, DWORD length, const IoRequestPtr& request) = 0;
  virtual IoStart Write(const void* buffer, DWORD length, const IoRequestPtr& request) = 0;
  // CancelIo was called for a pending request of this file. The default
  // completes it at once with ERROR_OPERATION_ABORTED; a device may complete
  // it later (a device slow to cancel) or not at all.
  virtual void Cancel(const IoRequestPtr& request) {
    CompleteIo(request, ERROR_OPERATION_ABORTED, 0);
  }
  // The handle was closed (pending requests have been cancelled first).
  virtual void Closed() {}
};

class DeviceProvider {
 public:
  DeviceProvider() = default;
  DeviceProvider(const DeviceProvider&) = delete;
  DeviceProvider& operator=(const DeviceProvider&) = delete;
  virtual ~DeviceProvider() = default;
  // Opens `path` or returns null with *error set (ERROR_FILE_NOT_FOUND, ...).
  virtual std::unique_ptr<DeviceFile> Open(const WCHAR* path, DWORD access, DWORD share,
                                           DWORD flags, DWORD* error) = 0;
};

// Installs the provider that answers device paths; null means a computer with
// no devices (every device path is ERROR_FILE_NOT_FOUND). Not owned.
void SetDeviceProvider(DeviceProvider* provider);
DeviceProvider* GetDeviceProvider();

}  // namespace emu
