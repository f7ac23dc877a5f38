// Overlapped status bookkeeping, GetOverlappedResult, cancellation and the
// dispatch of ReadFile / WriteFile / DeviceIoControl to the handle's object.
#include <linux/futex.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <climits>
#include <mutex>

#include "platform/posix/file_object.h"
#include "platform/win32.h"

namespace emu {
namespace {

// Guards every write and read of OVERLAPPED status words made by the
// emulation; `completions` counts stored results, and GetOverlappedResult
// calls that wait without an event sleep on it (a private futex word).
// Never destroyed: completions may run while the process exits.
struct IoState {
  std::mutex lock;
  std::uint32_t completions = 0;
};

void WakeCompletionWaiters(IoState& state) {
  __atomic_add_fetch(&state.completions, 1, __ATOMIC_SEQ_CST);
  syscall(SYS_futex, &state.completions, FUTEX_WAKE_PRIVATE, INT_MAX, nullptr, nullptr, 0);
}

// Sleeps until a result is stored after `seen` was read (or a signal comes).
void WaitForCompletion(IoState& state, std::uint32_t seen) {
  syscall(SYS_futex, &state.completions, FUTEX_WAIT_PRIVATE, seen, nullptr, nullptr, 0);
}

IoState& State() {
  static IoState* state = new IoState();
  return *state;
}

struct StatusPair {
  DWORD error;
  ULONG_PTR status;
};

constexpr StatusPair kStatusTable[] = {
    {ERROR_SUCCESS, 0x00000000},
    {ERROR_MORE_DATA, 0x80000005},             // STATUS_BUFFER_OVERFLOW
    {ERROR_OPERATION_ABORTED, 0xC0000120},     // STATUS_CANCELLED
    {ERROR_INVALID_FUNCTION, 0xC0000010},      // STATUS_INVALID_DEVICE_REQUEST
    {ERROR_INVALID_PARAMETER, 0xC000000D},     // STATUS_INVALID_PARAMETER
    {ERROR_INSUFFICIENT_BUFFER, 0xC0000023},   // STATUS_BUFFER_TOO_SMALL
    {ERROR_ACCESS_DENIED, 0xC0000022},         // STATUS_ACCESS_DENIED
    {ERROR_GEN_FAILURE, 0xC0000001},           // STATUS_UNSUCCESSFUL
    {ERROR_NOT_READY, 0xC00000A3},             // STATUS_DEVICE_NOT_READY
    {ERROR_NOT_SUPPORTED, 0xC00000BB},         // STATUS_NOT_SUPPORTED
    {ERROR_DEVICE_NOT_CONNECTED, 0xC000009D},  // STATUS_DEVICE_NOT_CONNECTED
    {ERROR_DEV_NOT_EXIST, 0xC00000C0},         // STATUS_DEVICE_DOES_NOT_EXIST
    {ERROR_INVALID_HANDLE, 0xC0000008},        // STATUS_INVALID_HANDLE
    {ERROR_BROKEN_PIPE, 0xC000014B},           // STATUS_PIPE_BROKEN
    {ERROR_PIPE_NOT_CONNECTED, 0xC00000B0},    // STATUS_PIPE_DISCONNECTED
    {ERROR_NO_DATA, 0xC00000B1},               // STATUS_PIPE_CLOSING
    {ERROR_PIPE_LISTENING, 0xC00000B3},        // STATUS_PIPE_LISTENING
    {ERROR_PIPE_BUSY, 0xC00000AE},             // STATUS_PIPE_BUSY
    {ERROR_PIPE_CONNECTED, 0xC00000B2},        // STATUS_PIPE_CONNECTED
    {ERROR_HANDLE_EOF, 0xC0000011},            // STATUS_END_OF_FILE
    {ERROR_SEM_TIMEOUT, 0xC00000B5},           // STATUS_IO_TIMEOUT
    {ERROR_NOT_ENOUGH_MEMORY, 0xC0000017},     // STATUS_NO_MEMORY
    {ERROR_NOT_ENOUGH_QUOTA, 0xC0000044},      // STATUS_QUOTA_EXCEEDED
};

constexpr ULONG_PTR kWin32Facility = 0xC0070000;  // NTSTATUS carrying a Win32 code

}  // namespace

ULONG_PTR StatusFromError(DWORD error) {
  for (const StatusPair& pair : kStatusTable) {
    if (pair.error == error) return pair.status;
  }
  return kWin32Facility | (error & 0xFFFF);
}

DWORD ErrorFromStatus(ULONG_PTR status) {
  for (const StatusPair& pair : kStatusTable) {
    if (pair.status == status) return pair.error;
  }
  if ((status & 0xFFFF0000) == kWin32Facility) return static_cast<DWORD>(status & 0xFFFF);
  return ERROR_MR_MID_NOT_FOUND;
}

bool ResolveEvent(const OVERLAPPED* overlapped, std::shared_ptr<SlotObject>* event) {
  event->reset();
  if (overlapped == nullptr) return true;
  // The low bit of hEvent only tells a completion port to stay silent.
  auto value = reinterpret_cast<std::uintptr_t>(overlapped->hEvent) & ~std::uintptr_t{1};
  if (value == 0) return true;
  *event = LookupSlotObject(reinterpret_cast<HANDLE>(value), kernel::kEvent);
  return *event != nullptr;
}

void StartOverlapped(OVERLAPPED* overlapped, const std::shared_ptr<SlotObject>& event) {
  if (overlapped != nullptr) {
    std::lock_guard<std::mutex> guard(State().lock);
    overlapped->Internal = STATUS_PENDING;
    overlapped->InternalHigh = 0;
  }
  if (event != nullptr) {
    kernel::Lock lock;
    kernel::Slot* slot = kernel::SlotOf(event->Ref());
    if (slot != nullptr) {
      kernel::Touch(slot->signaled);
      slot->signaled = 0;
    }
  }
}

void StoreOverlapped(OVERLAPPED* overlapped, DWORD error, DWORD bytes) {
  IoState& state = State();
  {
    std::lock_guard<std::mutex> guard(state.lock);
    if (overlapped != nullptr) {
      overlapped->Internal = StatusFromError(error);
      overlapped->InternalHigh = bytes;
    }
  }
  WakeCompletionWaiters(state);
}

void SignalEventLocked(const std::shared_ptr<SlotObject>& event) {
  if (event == nullptr) return;
  kernel::Slot* slot = kernel::SlotOf(event->Ref());
  if (slot == nullptr) return;
  kernel::Touch(slot->signaled);
  slot->signaled = 1;
  kernel::Notify(kernel::SlotKey(event->Ref().index));
}

void SignalEvent(const std::shared_ptr<SlotObject>& event) {
  if (event == nullptr) return;
  kernel::Lock lock;
  SignalEventLocked(event);
}

void StoreOverlappedLocked(OVERLAPPED* overlapped, const std::shared_ptr<SlotObject>& event,
                           DWORD error, DWORD bytes) {
  StoreOverlapped(overlapped, error, bytes);
  SignalEventLocked(event);
}

BOOL FinishAtOnce(OVERLAPPED* overlapped, const std::shared_ptr<SlotObject>& event, DWORD error,
                  DWORD bytes, DWORD* done) {
  if (error == ERROR_SUCCESS || IsWarning(error)) {
    StoreOverlapped(overlapped, error, bytes);
    SignalEvent(event);
  }
  if (done != nullptr) *done = error == ERROR_SUCCESS || IsWarning(error) ? bytes : 0;
  if (error != ERROR_SUCCESS) {
    SetLastError(error);
    return FALSE;
  }
  return TRUE;
}

namespace {

std::shared_ptr<FileObject> LookupFile(HANDLE handle) {
  std::shared_ptr<FileObject> file = LookupHandleAs<FileObject>(handle);
  if (file == nullptr) SetLastError(ERROR_INVALID_HANDLE);
  return file;
}

}  // namespace
}  // namespace emu

BOOL ReadFile(HANDLE file, LPVOID buffer, DWORD numberOfBytesToRead, LPDWORD numberOfBytesRead,
              LPOVERLAPPED overlapped) {
  auto object = emu::LookupFile(file);
  if (object == nullptr) return FALSE;
  if (numberOfBytesRead != nullptr) *numberOfBytesRead = 0;
  return object->Read(buffer, numberOfBytesToRead, numberOfBytesRead, overlapped);
}

BOOL WriteFile(HANDLE file, LPCVOID buffer, DWORD numberOfBytesToWrite,
               LPDWORD numberOfBytesWritten, LPOVERLAPPED overlapped) {
  auto object = emu::LookupFile(file);
  if (object == nullptr) return FALSE;
  if (numberOfBytesWritten != nullptr) *numberOfBytesWritten = 0;
  return object->Write(buffer, numberOfBytesToWrite, numberOfBytesWritten, overlapped);
}

BOOL DeviceIoControl(HANDLE device, DWORD ioControlCode, LPVOID inBuffer, DWORD inBufferSize,
                     LPVOID outBuffer, DWORD outBufferSize, LPDWORD bytesReturned,
                     LPOVERLAPPED overlapped) {
  auto object = emu::LookupFile(device);
  if (object == nullptr) return FALSE;
  if (bytesReturned == nullptr && overlapped == nullptr) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return FALSE;
  }
  if (bytesReturned != nullptr) *bytesReturned = 0;
  return object->Control(ioControlCode, inBuffer, inBufferSize, outBuffer, outBufferSize,
                         bytesReturned, overlapped);
}

BOOL GetOverlappedResult(HANDLE file, LPOVERLAPPED overlapped, LPDWORD numberOfBytesTransferred,
                         BOOL wait) {
  if (emu::LookupFile(file) == nullptr) return FALSE;
  if (overlapped == nullptr) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return FALSE;
  }
  emu::IoState& state = emu::State();
  auto pending = [&] {
    std::lock_guard<std::mutex> guard(state.lock);
    return overlapped->Internal == STATUS_PENDING;
  };
  if (pending()) {
    if (!wait) {
      SetLastError(ERROR_IO_INCOMPLETE);
      return FALSE;
    }
    // As the system does: wait on the request's event (which consumes an
    // auto-reset event), or on the file when there is none.
    auto event = reinterpret_cast<std::uintptr_t>(overlapped->hEvent) & ~std::uintptr_t{1};
    if (event != 0 &&
        WaitForSingleObject(reinterpret_cast<HANDLE>(event), INFINITE) == WAIT_FAILED) {
      return FALSE;
    }
    for (;;) {
      const std::uint32_t seen = __atomic_load_n(&state.completions, __ATOMIC_SEQ_CST);
      {
        std::lock_guard<std::mutex> guard(state.lock);
        if (overlapped->Internal != STATUS_PENDING) break;
      }
      emu::WaitForCompletion(state, seen);
    }
  }
  ULONG_PTR status;
  ULONG_PTR bytes;
  {
    std::lock_guard<std::mutex> guard(state.lock);
    status = overlapped->Internal;
    bytes = overlapped->InternalHigh;
  }
  if (numberOfBytesTransferred != nullptr) *numberOfBytesTransferred = static_cast<DWORD>(bytes);
  if (status != STATUS_SUCCESS) {
    SetLastError(emu::ErrorFromStatus(status));
    return FALSE;
  }
  return TRUE;
}

BOOL CancelIo(HANDLE file) {
  auto object = emu::LookupFile(file);
  if (object == nullptr) return FALSE;
  object->Cancel(emu::kernel::ThreadId(), nullptr);
  return TRUE;
}

BOOL CancelIoEx(HANDLE file, LPOVERLAPPED overlapped) {
  auto object = emu::LookupFile(file);
  if (object == nullptr) return FALSE;
  if (object->Cancel(0, overlapped) == 0) {
    SetLastError(ERROR_NOT_FOUND);
    return FALSE;
  }
  return TRUE;
}

BOOL FlushFileBuffers(HANDLE file) {
  auto object = emu::LookupFile(file);
  if (object == nullptr) return FALSE;
  return object->Flush();
}
