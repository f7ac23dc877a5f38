// The full rescan, quiescing, the removal check and forwarded messages.
#include "monitor/rescan.h"

#include "discovery/channel_binding.h"
#include "discovery/channel_scan.h"
#include "discovery/drive_enumeration.h"
#include "monitor/channel_workers.h"
#include "monitor/monitor_state.h"
#include "monitor/state_lock.h"
#include "service/process_locks.h"
#include "transport/drive_command.h"
#include "transport/drive_features.h"
#include "volume/device_events.h"
#include "volume/volume_letters.h"

namespace {

constexpr DWORD kPowerBroadcast = 0x218;
constexpr DWORD kDeviceChange = 0x219;
constexpr ULONG_PTR kPowerSuspend = 4;
constexpr ULONG_PTR kPowerResumeCritical = 6;
constexpr ULONG_PTR kPowerResumeSuspend = 7;
constexpr ULONG_PTR kPowerResumeAutomatic = 0x12;

// Waits until every ready event has been signalled once, or the service
// stops; false on a stop. The events are auto-reset, so each one is waited
// for until it comes and then left out; the list never holds more than the
// wait allows, with the stop event first.
bool WaitForReadyEvents(HANDLE* events, DWORD count) {
  const HANDLE stop = monitorState.stopEvent;
  const DWORD first = stop != nullptr ? 1 : 0;
  while (count > 0) {
    HANDLE list[MAXIMUM_WAIT_OBJECTS];
    if (first == 1) list[0] = stop;
    const DWORD room = MAXIMUM_WAIT_OBJECTS - first;
    const DWORD listed = count < room ? count : room;
    for (DWORD i = 0; i < listed; ++i) list[first + i] = events[i];
    const DWORD wait = WaitForMultipleObjects(first + listed, list, FALSE, INFINITE);
    if (first == 1 && wait == WAIT_OBJECT_0) return false;
    const DWORD index = wait - WAIT_OBJECT_0 - first;
    if (index >= listed) return false;  // failed wait: nothing else would end it
    events[index] = events[count - 1];
    --count;
  }
  return true;
}

}  // namespace

void RescanDrives() {
  SectionLock guard(&rescanLock);  // recursive
  bool running;
  {
    StateLock lock;
    running = workerState.workerCount != 0;
  }
  // The channel table is rebuilt below: workers that a rescan on another
  // thread started meanwhile (a forwarded resume before the start-up rescan)
  // are stopped first.
  if (running) QuiesceChannels();
  HANDLE readyEvents[kMaxChannels];
  DWORD readyCount = 0;
  {
    StateLock lock;
    StateBlock* block = monitorState.stateBlock;
    monitorState.rescanInProgress = 1;
    EnumerateDrives(monitorState.stopEvent);
    AssignVolumeLetters();
    RebuildChannelTable();
    StartWorkers();
    for (int i = 0; i < block->channelCount && i < kMaxChannels; ++i) {
      readyEvents[readyCount++] = block->channels[i].readyEvent;
    }
  }
  // Every worker takes the mutex before it signals, so wait without it. A
  // stop ends the wait and stops the workers, whatever they are blocked in.
  const bool ready = WaitForReadyEvents(readyEvents, readyCount);
  if (!ready) SetEvent(monitorState.workerStopEvent);
  StateLock lock;
  if (ready) {
    BuildPublishedList(monitorState.stateBlock);
    monitorState.stateBlock->statusWord = kStatusRescanDone;
    monitorState.publishNeeded = 1;
    monitorState.rescanCount += 1;
  }
  monitorState.rescanInProgress = 0;
}

void RestartWorkers() {
  // The same locks as a quiesce on the pipe thread, so that a restart never
  // meets workers that are still being stopped.
  SectionLock guard(&rescanLock);  // recursive
  EnterCriticalSection(&workerStopLock);
  {
    StateLock lock;
    if (workerState.workerCount == 0 && workerState.workerHandleCount == 0) {
      RebuildChannelTable();
      StartWorkers();
    }
  }
  LeaveCriticalSection(&workerStopLock);
}

void QuiesceChannels() {
  SectionLock guard(&rescanLock);  // recursive
  {
    StateLock lock;
    StateBlock* block = monitorState.stateBlock;
    for (int i = 0; i < block->channelCount && i < kMaxChannels; ++i) {
      ChannelRecord& channel = block->channels[i];
      if (channel.deviceHandle != nullptr && channel.kind == kChannelKindDriver &&
          channel.mode == kChannelModeGauge) {
        SendDriveCommand(&channel, CTL_QUIESCE, 0, nullptr);
      }
    }
    monitorState.publishNeeded = 1;
  }
  StopWorkers();
}

void QuiesceAndRescan() {
  SectionLock guard(&rescanLock);  // recursive
  QuiesceChannels();
  RescanDrives();
}

int CheckRemovedDrives() {
  // Gives the system time to finish the removal; a stop cuts it short.
  WaitForSingleObject(monitorState.stopEvent, 2000);
  StateLock lock;
  StateBlock* block = monitorState.stateBlock;
  const LONG listed = EnumerateDrives(monitorState.stopEvent);
  AssignVolumeLetters();
  monitorState.driveListStale = 0;
  // An enumeration that failed, or was cut short by a stop, found nothing:
  // that is no removal.
  if (listed == kEnumerationFailed) return 0;
  if (WaitForSingleObject(monitorState.stopEvent, 0) == WAIT_OBJECT_0) return 0;
  int sent = 0;
  for (int i = 0; i < block->channelCount && i < kMaxChannels; ++i) {
    ChannelRecord& channel = block->channels[i];
    if (channel.gaugePercentSent == 0) continue;
    DriveRecord scratch{};
    if (BindChannelToDrive(&channel, &scratch, 0) < 0 && SendDriveGone(&channel) != 0) ++sent;
  }
  return sent;
}

void HandleForwardedMessage(DWORD message, ULONG_PTR parameter, ULONG_PTR, void* resultSlot) {
  if (message == kPowerBroadcast) {
    if (parameter == kPowerResumeCritical || parameter == kPowerResumeSuspend ||
        parameter == kPowerResumeAutomatic) {
      QuiesceAndRescan();
    } else if (parameter == kPowerSuspend) {
      {
        StateLock lock;
        StateBlock* block = monitorState.stateBlock;
        for (int i = 0; i < block->driveCount && i < kMaxDrives; ++i)
          block->drives[i].gaugePercent = 0;
      }
      QuiesceChannels();
    }
  } else if (message == kDeviceChange) {
    // The event record lives in the application's address space and cannot
    // be read here; the event is classified without it.
    HandleDeviceEvent(static_cast<DWORD>(parameter), nullptr, resultSlot);
  }
}
