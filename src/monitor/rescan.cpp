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

// Holds the rescan lock for a scope (the lock is recursive).
class RescanGuard {
 public:
  RescanGuard() { EnterCriticalSection(&rescanLock); }
  ~RescanGuard() { LeaveCriticalSection(&rescanLock); }
  RescanGuard(const RescanGuard&) = delete;
  RescanGuard& operator=(const RescanGuard&) = delete;
};

}  // namespace

void RescanDrives() {
  RescanGuard guard;
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
  // Every worker takes the mutex before it signals, so wait without it.
  if (readyCount > 0) WaitForMultipleObjects(readyCount, readyEvents, TRUE, INFINITE);
  StateLock lock;
  BuildPublishedList(monitorState.stateBlock);
  monitorState.stateBlock->statusWord = kStatusRescanDone;
  monitorState.publishNeeded = 1;
  monitorState.rescanInProgress = 0;
  monitorState.rescanCount += 1;
}

void QuiesceChannels() {
  RescanGuard guard;
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
  RescanGuard guard;
  QuiesceChannels();
  RescanDrives();
}

int CheckRemovedDrives() {
  // Gives the system time to finish the removal; a stop cuts it short.
  WaitForSingleObject(monitorState.stopEvent, 2000);
  StateLock lock;
  StateBlock* block = monitorState.stateBlock;
  EnumerateDrives(monitorState.stopEvent);
  AssignVolumeLetters();
  monitorState.driveListStale = 0;
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
