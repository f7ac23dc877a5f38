// The channel worker threads: one per channel record between two rescans.
#pragma once

#include "monitor/state_block.h"
#include "platform/win32.h"

struct WorkerState {
  HANDLE workerThreads[kMaxChannels];  // by start slot; closed slots hold INVALID_HANDLE_VALUE
  DWORD workerThreadIds[kMaxChannels];
  DWORD workerCount;        // started since the last stop; the next start slot
  DWORD workerHandleCount;  // thread handles to close at the next stop
  DWORD gaugeStatusFlag;    // statusWord 102 already set because every drive is counted
};
extern WorkerState workerState;

// Clears the bookkeeping; called at monitor start.
void ResetWorkerState();
// Opens the channel's device and starts its worker; true when a thread runs.
bool StartWorker(int channelIndex, DWORD slot);
// One worker per channel record below channelCount (mutex held).
void StartWorkers();
// Stops all workers and waits for them; statusWord 102. Returns the wait's
// result (0 when there was nothing to wait for). Called without the mutex.
DWORD StopWorkers();
// statusWord 100 while a drive is not counted, else 102 once; returns the
// flag (mutex held).
bool CountedDrivesCheck();

// The two worker procedures; the parameter is the channel record.
DWORD WINAPI ControlChannelWorker(LPVOID channelRecord);
DWORD WINAPI StorageChannelWorker(LPVOID channelRecord);
