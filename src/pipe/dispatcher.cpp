#include "pipe/dispatcher.h"

#include <algorithm>
#include <cstdint>
#include <cstring>

#include "monitor/monitor_state.h"
#include "pipe/command_message.h"
#include "pipe/drive_requests.h"
#include "pipe/registry_access.h"

namespace {

struct Outcome {
  DWORD result;
  DWORD detail;
};

template <typename T>
T ReadField(const BYTE* message, std::size_t offset) {
  T value;
  std::memcpy(&value, message + offset, sizeof(value));
  return value;
}

template <typename T>
void WriteField(BYTE* message, std::size_t offset, T value) {
  std::memcpy(message + offset, &value, sizeof(value));
}

// Command 13: the registry request inside the bytes this request delivered.
Outcome RunRegistryCommand(BYTE* message, std::size_t delivered) {
  const std::size_t available =
      delivered > kRegistryRequestOffset ? delivered - kRegistryRequestOffset : 0;
  Outcome outcome;
  outcome.result = RunRegistryRequest(message + kRegistryRequestOffset, available);
  outcome.detail =
      ReadField<DWORD>(message, kRegistryRequestOffset + offsetof(RegistryRequest, dataLength));
  return outcome;
}

// Takes the state mutex; false when the pipe server is stopped first. Any
// account may open and hold the mutex, so the wait must also end on a stop.
bool LockOrStop() {
  const HANDLE list[2] = {monitorState.pipeStopEvent, monitorState.stateMutex};
  const DWORD count = list[0] != nullptr ? 2 : 1;
  const DWORD wait = WaitForMultipleObjects(count, list + (2 - count), FALSE, INFINITE);
  const DWORD mutexSlot = count - 1;
  if (count == 2 && wait == WAIT_OBJECT_0) {
    // The server's own wait must still see the stop, whatever the event's kind.
    SetEvent(list[0]);
    return false;
  }
  return wait == WAIT_OBJECT_0 + mutexSlot || wait == WAIT_ABANDONED_0 + mutexSlot;
}

// Carries out one command; the state mutex is held (command 6 lets it go
// while it runs, and `*locked` tells whether it has it again).
Outcome RunCommand(BYTE* message, std::size_t delivered, bool* locked) {
  const DWORD command = ReadField<DWORD>(message, offsetof(CommandMessage, command));
  const DWORD arg1 = ReadField<DWORD>(message, offsetof(CommandMessage, arg1));
  const DWORD arg2 = ReadField<DWORD>(message, offsetof(CommandMessage, arg2));
  const DWORD arg3 = ReadField<DWORD>(message, offsetof(CommandMessage, arg3));
  StateBlock* block = monitorState.stateBlock;
  Outcome outcome{0, 0};
  switch (command) {
    case kCommandSafeRemove:
      outcome.result = SafeRemoveRequest(arg1, &outcome.detail);
      break;
    case kCommandReleaseDrive:
    case kCommandReleaseDriveAlso:
      outcome.result = ReleaseDriveRequest(arg1, &outcome.detail);
      break;
    case kCommandForwardMessage:
      ReleaseMutex(monitorState.stateMutex);
      ForwardMessageRequest(arg1, arg2, arg3, message + offsetof(CommandMessage, resultSlot));
      *locked = LockOrStop();
      break;
    case kCommandPause:
      monitorState.paused = 1;
      monitorState.pauseTicks = 0;
      break;
    case kCommandResume:
      monitorState.paused = 0;
      break;
    case kCommandRefreshGauges:
      outcome.result = RefreshGaugesRequest(arg1, arg2);
      break;
    case kCommandSetStatus:
      block->statusWord = arg1;
      monitorState.publishNeeded = 1;
      outcome.result = 1;
      break;
    case kCommandReadStatus:
      outcome.result = ReadStatusRequest(message + offsetof(CommandMessage, driveImage),
                                         message + offsetof(CommandMessage, statusBlock));
      break;
    case kCommandWriteControl:
      outcome.result = WriteControlRequest(message + offsetof(CommandMessage, driveImage),
                                           message + offsetof(CommandMessage, controlBlock));
      break;
    case kCommandRegistry:
      outcome = RunRegistryCommand(message, delivered);
      break;
    default:
      outcome.result = kCommandUnknownResult;
      outcome.detail = kCommandUnknownResult;
      break;
  }
  return outcome;
}

}  // namespace

DWORD DispatchRequest(BYTE* request, DWORD received, BYTE* reply) {
  received = std::min(received, kPipeReadSize);
  // The buffer is reused from one request to the next: nothing of an earlier
  // request may show through in this one's reply.
  std::memset(request + received, 0, kPipeBufferBytes - received);

  const std::uint64_t length = ReadField<std::uint64_t>(request, offsetof(CommandMessage, length));
  Outcome outcome{0, 0};
  DWORD replyLength = 0;
  if (length >= kCommandMinLength && length <= kCommandMaxLength) {
    if (!LockOrStop()) return 0;  // stopping: the thread ends without replying
    replyLength = static_cast<DWORD>(length);
    bool locked = true;
    // A request's parts are bounded by what arrived, whatever length it declares.
    outcome = RunCommand(request, received, &locked);
    if (!locked) return 0;
    ReleaseMutex(monitorState.stateMutex);
    // The shared block shows the request's effect before the reply leaves.
    PublishStateBlock(nullptr, true);
  }
  WriteField<DWORD>(request, offsetof(CommandMessage, result), outcome.result);
  WriteField<DWORD>(request, offsetof(CommandMessage, detail), outcome.detail);
  std::memcpy(reply, request, replyLength);
  return replyLength;
}

void DispatchCommand(PipeInstance* instance) {
  instance->replyLength = DispatchRequest(instance->request, instance->bytesRead, instance->reply);
}
