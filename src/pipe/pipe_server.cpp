#include "pipe/pipe_server.h"

#include <cstring>

#include "monitor/monitor_state.h"
#include "pipe/dispatcher.h"
#include "pipe/pipe_instance.h"
#include "service/service_host.h"

namespace {

// Only the instances this thread creates may exist: with no spare slot no
// other process can add an instance of the pipe and answer our clients.
constexpr DWORD kPipeMaxInstances = kPipeInstanceCount;
constexpr DWORD kPipeOpenMode = PIPE_ACCESS_DUPLEX | FILE_FLAG_OVERLAPPED;
constexpr DWORD kPipeMode = PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_WAIT;
constexpr DWORD kPipeDefaultTimeout = 5000;
// An instance that cannot be created or connected is tried again after this
// pause, doubled at every further failure up to the limit.
constexpr DWORD kRetryFirstMs = 500;
constexpr DWORD kRetryLimitMs = 30000;

PipeInstance instances[kPipeInstanceCount];

// Instances that wait to be created again: the time it is due (0: the
// instance is open) and the pause used last.
struct Retry {
  ULONGLONG dueAt;
  DWORD pauseMs;
};
Retry retries[kPipeInstanceCount];
bool failureLogged;  // an event reports instances that are not open
int scanStart;       // the wait list starts with this instance; rotates

bool AnyPipeOpen() {
  for (const PipeInstance& instance : instances) {
    if (instance.pipe != nullptr) return true;
  }
  return false;
}

// Starts waiting for a client on the instance; false on an unexpected error.
bool ConnectInstance(PipeInstance& instance) {
  bool pending = false;
  if (!ConnectNamedPipe(instance.pipe, &instance.overlapped)) {
    switch (GetLastError()) {
      case ERROR_PIPE_CONNECTED:  // a client is already there
        SetEvent(instance.overlapped.hEvent);
        break;
      case ERROR_IO_PENDING:
        pending = true;
        break;
      case ERROR_NO_DATA:
        // A client came and went before the connect: serve the instance at
        // once, so that its failing read disconnects it and it listens again
        // instead of waiting on an event that nothing will signal.
        SetEvent(instance.overlapped.hEvent);
        break;
      default:
        return false;
    }
  }
  instance.pending = pending ? TRUE : FALSE;
  instance.state = pending ? kPipeConnecting : kPipeReading;
  return true;
}

// Cancels the instance's operation, waits for the cancel (a pipe completes
// it at once) and closes its pipe; its event stays.
void ClosePipe(PipeInstance& instance) {
  if (instance.pipe != nullptr) {
    if (instance.pending) {
      DWORD ignored = 0;
      CancelIo(instance.pipe);
      GetOverlappedResult(instance.pipe, &instance.overlapped, &ignored, TRUE);
    }
    CloseHandle(instance.pipe);
    instance.pipe = nullptr;
  }
  instance.pending = FALSE;
}

// Closes the instance's pipe (its event stays) and schedules it to be
// created again; the first of a run of failures is logged.
void SetAside(int index) {
  ClosePipe(instances[index]);
  Retry& retry = retries[index];
  retry.pauseMs = retry.pauseMs == 0 ? kRetryFirstMs : retry.pauseMs * 2;
  if (retry.pauseMs > kRetryLimitMs) retry.pauseMs = kRetryLimitMs;
  retry.dueAt = GetTickCount64() + retry.pauseMs;
  if (!failureLogged) {
    failureLogged = true;
    LogServiceError(WSTR("An instance of the command pipe cannot be opened; trying again."));
  }
}

// Creates instance `index` (its event once) and connects it; false when
// either step fails.
bool OpenInstance(int index) {
  PipeInstance& instance = instances[index];
  HANDLE event = instance.overlapped.hEvent;
  std::memset(&instance, 0, sizeof(instance));
  if (!InitNullDaclSecurity(&instance.security)) return false;
  if (event == nullptr) event = CreateEventW(&instance.security.attributes, TRUE, TRUE, nullptr);
  instance.overlapped.hEvent = event;
  if (event == nullptr) return false;
  // While none of ours exists the instance must be the first of the name:
  // if another process holds it, the creation fails instead of joining it.
  const DWORD openMode = kPipeOpenMode | (AnyPipeOpen() ? 0 : FILE_FLAG_FIRST_PIPE_INSTANCE);
  // Only local clients may reach the pipe: how that is said depends on the
  // system version (see PipeSecurity). The system copies the descriptor.
  PipeSecurity security;
  if (!InitPipeSecurity(&security, GetVersion() & 0xFF)) return false;
  HANDLE pipe =
      CreateNamedPipeW(kPipeName, openMode, kPipeMode | security.pipeModeFlags, kPipeMaxInstances,
                       kPipeReadSize, kPipeReadSize, kPipeDefaultTimeout, &security.attributes);
  if (pipe == INVALID_HANDLE_VALUE) return false;
  instance.pipe = pipe;
  return ConnectInstance(instance);
}

void OpenOrSetAside(int index) {
  if (OpenInstance(index)) {
    retries[index].dueAt = 0;
  } else {
    SetAside(index);
  }
}

// Opens the instances whose retry is due; the wait's time-out until the next
// one (INFINITE when none waits).
DWORD RetryDueInstances() {
  ULONGLONG now = GetTickCount64();
  ULONGLONG next = 0;
  bool allOpen = true;
  for (int i = 0; i < kPipeInstanceCount; ++i) {
    if (retries[i].dueAt != 0 && retries[i].dueAt <= now) {
      OpenOrSetAside(i);
      now = GetTickCount64();
    }
    if (retries[i].dueAt != 0) {
      allOpen = false;
      if (next == 0 || retries[i].dueAt < next) next = retries[i].dueAt;
    }
  }
  if (allOpen) {
    failureLogged = false;
    return INFINITE;
  }
  return next > now ? static_cast<DWORD>(next - now) : 0;
}

void ReconnectInstance(int index) {
  DisconnectNamedPipe(instances[index].pipe);
  if (!ConnectInstance(instances[index])) SetAside(index);
}

// Closes what the instances hold, ending their exchanges.
void CloseInstances() {
  for (PipeInstance& instance : instances) {
    ClosePipe(instance);
    if (instance.overlapped.hEvent != nullptr) {
      CloseHandle(instance.overlapped.hEvent);
      instance.overlapped.hEvent = nullptr;
    }
  }
}

// Takes the result of the instance's finished operation. Returns false when
// the thread must end; sets `served` to false when the instance was
// reconnected or set aside and needs nothing more this round.
bool CompletePending(int index, bool* served) {
  PipeInstance& instance = instances[index];
  DWORD count = 0;
  const BOOL done = GetOverlappedResult(instance.pipe, &instance.overlapped, &count, FALSE);
  instance.pending = FALSE;
  switch (instance.state) {
    case kPipeConnecting:
      if (!done) {
        SetAside(index);
        *served = false;
        return true;
      }
      instance.state = kPipeReading;
      return true;
    case kPipeReading:
      if (!done || count == 0) {
        ReconnectInstance(index);
        *served = false;
        return true;
      }
      instance.bytesRead = count;
      instance.state = kPipeWriting;
      return true;
    case kPipeWriting:
      if (!done || count != instance.replyLength) {
        ReconnectInstance(index);
        *served = false;
        return true;
      }
      instance.state = kPipeReading;
      return true;
    default:
      return false;
  }
}

void StartRead(int index) {
  PipeInstance& instance = instances[index];
  DWORD count = 0;
  if (ReadFile(instance.pipe, instance.request, kPipeReadSize, &count, &instance.overlapped)) {
    if (count != 0) {
      // The reply is built when the wait next selects this instance.
      instance.bytesRead = count;
      instance.pending = FALSE;
      instance.state = kPipeWriting;
      return;
    }
  } else if (GetLastError() == ERROR_IO_PENDING) {
    instance.pending = TRUE;
    return;
  }
  // An empty message, one longer than the buffer, or a broken pipe.
  ReconnectInstance(index);
}

void StartWrite(int index) {
  PipeInstance& instance = instances[index];
  DispatchCommand(&instance);
  retries[index].pauseMs = 0;  // the instance works: a later failure starts afresh
  DWORD count = 0;
  if (WriteFile(instance.pipe, instance.reply, instance.replyLength, &count,
                &instance.overlapped)) {
    if (count == instance.replyLength) {
      instance.pending = FALSE;
      instance.state = kPipeReading;
      return;
    }
  } else if (GetLastError() == ERROR_IO_PENDING) {
    instance.pending = TRUE;
    return;
  }
  ReconnectInstance(index);
}

}  // namespace

DWORD WINAPI PipeServerThread(LPVOID) {
  const HANDLE stop = monitorState.pipeStopEvent;
  failureLogged = false;
  scanStart = 0;
  for (int i = 0; i < kPipeInstanceCount; ++i) {
    instances[i].overlapped.hEvent = nullptr;
    instances[i].pipe = nullptr;
    retries[i] = Retry{0, 0};
    OpenOrSetAside(i);
  }

  for (;;) {
    const DWORD timeout = RetryDueInstances();
    // Slot 0: the stop event; then the open instances, starting after the
    // one served last, so that a busy client cannot starve the others.
    HANDLE waitList[kPipeInstanceCount + 1];
    int instanceOf[kPipeInstanceCount + 1];
    DWORD listed = 0;
    waitList[listed++] = stop;
    for (int k = 0; k < kPipeInstanceCount; ++k) {
      const int i = (scanStart + k) % kPipeInstanceCount;
      if (instances[i].pipe == nullptr) continue;
      instanceOf[listed] = i;
      waitList[listed++] = instances[i].overlapped.hEvent;
    }
    const DWORD wait = WaitForMultipleObjects(listed, waitList, FALSE, timeout);
    if (wait == WAIT_OBJECT_0) break;  // stop, even with exchanges in progress
    if (wait == WAIT_TIMEOUT) continue;
    const DWORD slot = wait - WAIT_OBJECT_0;
    if (slot >= listed) break;  // failed or abandoned
    const int index = instanceOf[slot];
    scanStart = (index + 1) % kPipeInstanceCount;
    PipeInstance& instance = instances[index];

    bool served = true;
    if (instance.pending && !CompletePending(index, &served)) break;
    if (!served) continue;

    if (instance.state == kPipeReading) {
      StartRead(index);
    } else if (instance.state == kPipeWriting) {
      StartWrite(index);
    }
  }
  CloseInstances();
  return 0;
}
