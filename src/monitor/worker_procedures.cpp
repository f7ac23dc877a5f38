// The two worker procedures in their minimal form: each links its channel to
// a drive, signals its ready event and waits until the workers are stopped.
// The button-event loop joins them with the button event channel.
#include "discovery/channel_binding.h"
#include "monitor/channel_workers.h"
#include "monitor/monitor_state.h"
#include "monitor/state_lock.h"

namespace {

DWORD RunWorker(ChannelRecord* channel) {
  bool failed = false;
  {
    StateLock lock;
    DriveRecord scratch{};
    if (BindChannelToDrive(channel, &scratch, 1) < 0) {
      failed = true;
      Sleep(2000);
    } else {
      monitorState.gaugePassRequested = 1;
      monitorState.sleepPassRequested = 1;
      monitorState.burstRequested = 1;
    }
    SetEvent(channel->readyEvent);
  }
  if (!failed) WaitForSingleObject(monitorState.workerStopEvent, INFINITE);
  if (failed) RequestRefresh();
  StateLock lock;
  if (channel->deviceHandle != nullptr) {
    CloseHandle(channel->deviceHandle);
    channel->deviceHandle = nullptr;
    channel->threadHandle = nullptr;
  }
  return 0;
}

}  // namespace

DWORD WINAPI ControlChannelWorker(LPVOID channelRecord) {
  return RunWorker(static_cast<ChannelRecord*>(channelRecord));
}

DWORD WINAPI StorageChannelWorker(LPVOID channelRecord) {
  return RunWorker(static_cast<ChannelRecord*>(channelRecord));
}
