// Last error, CloseHandle, security descriptors, time, process identity and
// the process heap.
#include <sched.h>
#include <time.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "platform/diagnostics.h"
#include "platform/posix/handle_table.h"
#include "platform/posix/kernel.h"
#include "platform/posix/slot_object.h"

namespace {

thread_local DWORD t_lastError = ERROR_SUCCESS;

HANDLE const kCurrentProcess = reinterpret_cast<HANDLE>(static_cast<LONG_PTR>(-1));
HANDLE const kCurrentThread = reinterpret_cast<HANDLE>(static_cast<LONG_PTR>(-2));
HANDLE const kProcessHeap = reinterpret_cast<HANDLE>(static_cast<ULONG_PTR>(0x7FFE0000));

}  // namespace

DWORD GetLastError() {
  return t_lastError;
}
void SetLastError(DWORD error) {
  t_lastError = error;
}

BOOL CloseHandle(HANDLE handle) {
  if (handle == kCurrentProcess || handle == kCurrentThread) return TRUE;
  std::shared_ptr<emu::KernelObject> object = emu::LookupHandle(handle);
  if (object == nullptr || !object->ClosableByCloseHandle() || !emu::ReleaseHandle(handle)) {
    SetLastError(ERROR_INVALID_HANDLE);
    return FALSE;
  }
  return TRUE;
}

BOOL InitializeSecurityDescriptor(PSECURITY_DESCRIPTOR descriptor, DWORD revision) {
  if (revision != SECURITY_DESCRIPTOR_REVISION) {
    SetLastError(ERROR_UNKNOWN_REVISION);
    return FALSE;
  }
  if (descriptor == nullptr) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return FALSE;
  }
  auto* sd = static_cast<SECURITY_DESCRIPTOR*>(descriptor);
  std::memset(sd, 0, sizeof(SECURITY_DESCRIPTOR));
  sd->Revision = static_cast<BYTE>(revision);
  return TRUE;
}

BOOL SetSecurityDescriptorDacl(PSECURITY_DESCRIPTOR descriptor, BOOL daclPresent, PACL dacl,
                               BOOL daclDefaulted) {
  constexpr WORD kDaclPresent = 0x0004;
  constexpr WORD kDaclDefaulted = 0x0008;
  auto* sd = static_cast<SECURITY_DESCRIPTOR*>(descriptor);
  if (sd == nullptr || sd->Revision != SECURITY_DESCRIPTOR_REVISION) {
    SetLastError(ERROR_UNKNOWN_REVISION);
    return FALSE;
  }
  sd->Control = static_cast<WORD>(sd->Control & ~(kDaclPresent | kDaclDefaulted));
  if (daclPresent) {
    sd->Control = static_cast<WORD>(sd->Control | kDaclPresent);
    if (daclDefaulted) sd->Control = static_cast<WORD>(sd->Control | kDaclDefaulted);
    sd->Dacl = dacl;
  } else {
    sd->Dacl = nullptr;
  }
  return TRUE;
}

void Sleep(DWORD milliseconds) {
  DWORD scaled = emu::kernel::ScaleTimeout(milliseconds);
  if (scaled == 0) {
    sched_yield();
    return;
  }
  if (scaled == INFINITE) {
    for (;;) pause();
  }
  timespec delay{};
  delay.tv_sec = static_cast<time_t>(scaled / 1000);
  delay.tv_nsec = static_cast<long>(scaled % 1000) * 1000000L;
  while (nanosleep(&delay, &delay) != 0 && errno == EINTR) {
  }
}

// The emulated clock runs 1/scale times as fast as the real one, so that
// tick arithmetic agrees with the scaled Sleep and wait time-outs.
ULONGLONG GetTickCount64() {
  double realMs = static_cast<double>(emu::kernel::NowNs()) / 1e6;
  return static_cast<ULONGLONG>(realMs / emu::kernel::Scale());
}

DWORD GetTickCount() {
  return static_cast<DWORD>(GetTickCount64());
}

DWORD GetCurrentThreadId() {
  return static_cast<DWORD>(emu::kernel::ThreadId());
}
DWORD GetCurrentProcessId() {
  return static_cast<DWORD>(getpid());
}
HANDLE GetCurrentProcess() {
  return kCurrentProcess;
}
HANDLE GetCurrentThread() {
  return kCurrentThread;
}

HANDLE GetProcessHeap() {
  return kProcessHeap;
}

LPVOID HeapAlloc(HANDLE heap, DWORD flags, SIZE_T bytes) {
  if (heap != kProcessHeap) return nullptr;
  // Zero bytes still gives a unique block, as on Windows.
  SIZE_T size = bytes == 0 ? 1 : bytes;
  return (flags & HEAP_ZERO_MEMORY) != 0 ? std::calloc(1, size) : std::malloc(size);
}

BOOL HeapFree(HANDLE heap, DWORD /*flags*/, LPVOID memory) {
  if (heap != kProcessHeap) {
    SetLastError(ERROR_INVALID_HANDLE);
    return FALSE;
  }
  std::free(memory);
  return TRUE;
}

// Blocks handed out by the emulation for LocalFree (FormatMessageW,
// CommandLineToArgvW) come from std::malloc.
HLOCAL LocalFree(HLOCAL memory) {
  std::free(memory);
  return nullptr;
}

namespace platform {

long LiveHandleCount() {
  return emu::HandleCount();
}
long LiveThreadCount() {
  return emu::RunningThreadCount();
}
double TimeScale() {
  return emu::kernel::Scale();
}

}  // namespace platform
