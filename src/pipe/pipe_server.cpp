#include "pipe/pipe_server.h"

#include <cstring>

#include "monitor/monitor_state.h"
#include "pipe/dispatcher.h"
#include "pipe/pipe_instance.h"

namespace {

// Only the instances this thread creates may exist: with no spare slot no
// other process can add an instance of the pipe and answer our clients.
constexpr DWORD kPipeMaxInstances = kPipeInstanceCount;
constexpr DWORD kPipeOpenMode = PIPE_ACCESS_DUPLEX | FILE_FLAG_OVERLAPPED;
constexpr DWORD kPipeMode = PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_WAIT;
constexpr DWORD kPipeDefaultTimeout = 5000;

PipeInstance instances[kPipeInstanceCount];
// Slot 0: the stop event; slot k: the event of instance k - 1.
HANDLE waitList[kPipeInstanceCount + 1];

// Starts waiting for a client on the instance.
void ConnectInstance(PipeInstance& instance) {
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
        break;
    }
  }
  instance.pending = pending ? TRUE : FALSE;
  instance.state = pending ? kPipeConnecting : kPipeReading;
}

void ReconnectInstance(PipeInstance& instance) {
  DisconnectNamedPipe(instance.pipe);
  ConnectInstance(instance);
}

// Creates instance `index` with its event; false when either cannot be made.
bool CreateInstance(int index) {
  PipeInstance& instance = instances[index];
  std::memset(&instance, 0, sizeof(instance));
  if (!InitNullDaclSecurity(&instance.security)) return false;
  HANDLE event = CreateEventW(&instance.security.attributes, TRUE, TRUE, nullptr);
  if (event == nullptr) return false;
  instance.overlapped.hEvent = event;
  waitList[index + 1] = event;
  // The first instance claims the name: if another process holds it, the
  // creation fails and the service runs without a command channel.
  const DWORD openMode = kPipeOpenMode | (index == 0 ? FILE_FLAG_FIRST_PIPE_INSTANCE : 0);
  HANDLE pipe = CreateNamedPipeW(kPipeName, openMode, kPipeMode, kPipeMaxInstances, kPipeReadSize,
                                 kPipeReadSize, kPipeDefaultTimeout, &instance.security.attributes);
  if (pipe == INVALID_HANDLE_VALUE) return false;
  instance.pipe = pipe;
  return true;
}

// Closes what the first `count` instances hold, ending their exchanges.
void CloseInstances(int count) {
  for (int i = 0; i < count; ++i) {
    PipeInstance& instance = instances[i];
    if (instance.pipe != nullptr) {
      if (instance.pending) {
        DWORD ignored = 0;
        CancelIo(instance.pipe);
        GetOverlappedResult(instance.pipe, &instance.overlapped, &ignored, TRUE);
      }
      CloseHandle(instance.pipe);
      instance.pipe = nullptr;
    }
    if (instance.overlapped.hEvent != nullptr) {
      CloseHandle(instance.overlapped.hEvent);
      instance.overlapped.hEvent = nullptr;
    }
    waitList[i + 1] = nullptr;
  }
}

// Takes the result of the instance's finished operation. Returns false when
// the thread must end; sets `served` to false when the instance was
// reconnected and needs nothing more this round.
bool CompletePending(PipeInstance& instance, bool* served) {
  DWORD count = 0;
  const BOOL done = GetOverlappedResult(instance.pipe, &instance.overlapped, &count, FALSE);
  switch (instance.state) {
    case kPipeConnecting:
      if (!done) return false;
      instance.state = kPipeReading;
      return true;
    case kPipeReading:
      if (!done || count == 0) {
        ReconnectInstance(instance);
        *served = false;
        return true;
      }
      instance.bytesRead = count;
      instance.state = kPipeWriting;
      return true;
    case kPipeWriting:
      if (!done || count != instance.replyLength) {
        ReconnectInstance(instance);
        *served = false;
        return true;
      }
      instance.state = kPipeReading;
      return true;
    default:
      return false;
  }
}

void StartRead(PipeInstance& instance) {
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
  ReconnectInstance(instance);
}

void StartWrite(PipeInstance& instance) {
  DispatchCommand(&instance);
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
  ReconnectInstance(instance);
}

}  // namespace

DWORD WINAPI PipeServerThread(LPVOID) {
  waitList[0] = monitorState.pipeStopEvent;
  int created = 0;
  for (; created < kPipeInstanceCount; ++created) {
    if (!CreateInstance(created)) {
      CloseInstances(created + 1);
      return 0;
    }
    ConnectInstance(instances[created]);
  }

  for (;;) {
    const DWORD wait = WaitForMultipleObjects(kPipeInstanceCount + 1, waitList, FALSE, INFINITE);
    if (wait == WAIT_OBJECT_0) break;  // stop, even with exchanges in progress
    const DWORD index = wait - WAIT_OBJECT_0 - 1;
    if (index >= static_cast<DWORD>(kPipeInstanceCount)) break;  // failed or abandoned
    PipeInstance& instance = instances[index];

    bool served = true;
    if (instance.pending && !CompletePending(instance, &served)) break;
    if (!served) continue;

    if (instance.state == kPipeReading) {
      StartRead(instance);
    } else if (instance.state == kPipeWriting) {
      StartWrite(instance);
    }
  }
  CloseInstances(created);
  return 0;
}
