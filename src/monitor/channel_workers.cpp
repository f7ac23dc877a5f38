// Starting and stopping the channel workers, and the counted-drives check.
#include "monitor/channel_workers.h"

#include "monitor/monitor_state.h"
#include "monitor/state_lock.h"
#include "service/process_locks.h"
#include "transport/drive_features.h"

WorkerState workerState;

void ResetWorkerState() {
  workerState = WorkerState{};
  for (HANDLE& slot : workerState.workerThreads) slot = INVALID_HANDLE_VALUE;
}

bool StartWorker(int channelIndex, DWORD slot) {
  ChannelRecord& channel = monitorState.stateBlock->channels[channelIndex];
  if (channel.threadHandle != nullptr || slot >= static_cast<DWORD>(kMaxChannels)) return false;
  const bool storage = channel.mode == kChannelModeGauge || channel.mode == kChannelModeEnclosure;
  const bool readWrite = channel.kind == kChannelKindHid || storage;
  const DWORD access = readWrite ? GENERIC_READ | GENERIC_WRITE : 0;
  const DWORD share = readWrite ? FILE_SHARE_READ | FILE_SHARE_WRITE : 0;
  HANDLE device = CreateFileW(channel.devicePath, access, share, nullptr, OPEN_EXISTING,
                              FILE_FLAG_OVERLAPPED, nullptr);
  if (device == INVALID_HANDLE_VALUE) return false;
  channel.deviceHandle = device;
  WithdrawChannelClose(&channel);  // one asked of an earlier worker
  DWORD threadId = 0;
  HANDLE thread = CreateThread(nullptr, 0, storage ? StorageChannelWorker : ControlChannelWorker,
                               &channel, 0, &threadId);
  if (thread == nullptr) {
    // No worker will own the device handle, so it is closed here.
    CloseHandle(device);
    channel.deviceHandle = nullptr;
    return false;
  }
  workerState.workerThreadIds[slot] = threadId;
  workerState.workerThreads[slot] = thread;
  channel.threadHandle = thread;
  return true;
}

void StartWorkers() {
  StateBlock* block = monitorState.stateBlock;
  for (int i = 0; i < block->channelCount && i < kMaxChannels; ++i) {
    ChannelRecord& channel = block->channels[i];
    ResetEvent(channel.readyEvent);
    if (StartWorker(i, workerState.workerCount)) {
      workerState.workerCount += 1;
      workerState.workerHandleCount += 1;
    } else {
      SetEvent(channel.readyEvent);
    }
  }
}

DWORD StopWorkers() {
  EnterCriticalSection(&workerStopLock);
  HANDLE threads[kMaxChannels];
  DWORD count = 0;
  {
    StateLock lock;
    count = workerState.workerCount;
    workerState.workerCount = 0;
    for (DWORD i = 0; i < count; ++i) threads[i] = workerState.workerThreads[i];
  }
  DWORD result = 0;
  if (count > 0) {
    SetEvent(monitorState.workerStopEvent);
    result = WaitForMultipleObjects(count, threads, TRUE, INFINITE);
    ResetEvent(monitorState.workerStopEvent);
    StateLock lock;
    for (DWORD i = 0; i < workerState.workerHandleCount; ++i) {
      CloseHandle(workerState.workerThreads[i]);
      workerState.workerThreads[i] = INVALID_HANDLE_VALUE;
    }
    workerState.workerHandleCount = 0;
  }
  {
    StateLock lock;
    if (monitorState.stateBlock != nullptr) monitorState.stateBlock->statusWord = kStatusRescanDone;
  }
  LeaveCriticalSection(&workerStopLock);
  return result;
}

bool CountedDrivesCheck() {
  StateBlock* block = monitorState.stateBlock;
  if (block->driveCount > block->countedDrives) {
    block->statusWord = kStatusUncountedDrive;
    workerState.gaugeStatusFlag = 0;
  } else if (workerState.gaugeStatusFlag == 0) {
    block->statusWord = kStatusRescanDone;
    workerState.gaugeStatusFlag = 1;
  }
  return workerState.gaugeStatusFlag != 0;
}
