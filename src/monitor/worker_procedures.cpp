// The two channel worker procedures. Each introduces its channel to the drive,
// links the channel to its drive record, signals its ready event and then
// waits for button events until the channel's device goes or the workers are
// stopped: a removal request leads to a safe removal of the drive, the two
// panel events of a control channel to a light reply and a pending action.
#include "discovery/channel_binding.h"
#include "discovery/drive_enumeration.h"
#include "discovery/model_table.h"
#include "monitor/channel_workers.h"
#include "monitor/monitor_state.h"
#include "monitor/state_lock.h"
#include "platform/wide.h"
#include "transport/button_events.h"
#include "transport/drive_command.h"
#include "transport/drive_features.h"
#include "transport/pass_through.h"
#include "volume/safe_removal.h"
#include "volume/volume_letters.h"

namespace {

constexpr DWORD kLinkFailurePauseMs = 2000;
constexpr DWORD kAfterEventPauseMs = 100;
constexpr DWORD kFailedWaitPauseMs = 100;
constexpr DWORD kLightPulseMarker = 120;
constexpr DWORD kLightPulseInterval = 10;
constexpr DWORD kPanelActionPending = 5;
constexpr BYTE kLightReplyValue = 0x40;
constexpr std::size_t kInquirySerialOffset = 40;
constexpr DWORD kInquirySerialLength = 16;
constexpr std::size_t kIdentityBufferBytes = 256;

enum class WorkerKind { Control, Storage };

struct WorkerRun {
  ChannelRecord* channel;
  WorkerKind kind;
  HANDLE stopEvent;
  bool failed = false;   // ends the event loop and asks for a refresh on exit
  LONG lastLinked = -1;  // the drive the channel was last linked to
};

void NoteLink(WorkerRun& run) {
  if (run.channel->linkedDrive >= 0) run.lastLinked = run.channel->linkedDrive;
}

bool Signalled(HANDLE event) {
  return event != nullptr && WaitForSingleObject(event, 0) == WAIT_OBJECT_0;
}

bool DeviceGone(DWORD error) {
  return error == ERROR_INVALID_HANDLE || error == ERROR_DEVICE_NOT_CONNECTED ||
         error == ERROR_DEV_NOT_EXIST;
}

// Enumerates the drives again (mutex held).
void ReenumerateDrives(HANDLE stopEvent) {
  EnumerateDrives(stopEvent);
  AssignVolumeLetters();
  monitorState.driveListStale = 0;
}

// The linking step after an event (mutex held): a channel that matches no
// drive at its first event re-reads the drive list once.
void LinkAfterEvent(WorkerRun& run, DriveRecord* scratch) {
  ChannelRecord* channel = run.channel;
  if (BindChannelToDrive(channel, scratch, 1) < 0 && channel->firstEventSeen == 0) {
    ReenumerateDrives(run.stopEvent);
    BindChannelToDrive(channel, scratch, 1);
    monitorState.gaugePassRequested = 1;
  }
  channel->firstEventSeen = 1;
  NoteLink(run);
}

// Links the channel at start and tells the rescan that the worker is ready.
void LinkAtStart(WorkerRun& run) {
  StateLock lock;
  DriveRecord scratch{};
  if (BindChannelToDrive(run.channel, &scratch, 1) < 0) {
    run.failed = true;
    Sleep(kLinkFailurePauseMs);
  } else {
    NoteLink(run);
    monitorState.gaugePassRequested = 1;
    monitorState.sleepPassRequested = 1;
    monitorState.burstRequested = 1;
  }
  SetEvent(run.channel->readyEvent);
}

bool HasVolumeLetters(const ChannelRecord* channel) {
  return channel->volumeLetters[0] != 0 || channel->volumeLetters[1] != 0;
}

// The panel events of a control channel (mutex held).
void HandlePanelEvent(ChannelRecord* channel, BYTE event) {
  if ((event & kButtonPanelEvent1) != 0) {
    if (kLightPulseMarker - channel->lightPulseMarker >= kLightPulseInterval) {
      BYTE reply = kLightReplyValue;
      DriveCommand(channel, CTL_EVENT_REPLY, &reply, 1, nullptr);
      channel->lightPulseMarker = kLightPulseMarker;
    }
  } else if ((event & kButtonPanelEvent2) != 0) {
    if (channel->pendingPanelAction == 0) channel->pendingPanelAction = kPanelActionPending;
  }
}

// One button event (mutex held).
void HandleEvent(WorkerRun& run, BYTE event) {
  ChannelRecord* channel = run.channel;
  StateBlock* block = monitorState.stateBlock;
  DriveRecord scratch{};
  LinkAfterEvent(run, &scratch);
  const bool counted = run.kind == WorkerKind::Control && CountedDrivesCheck();
  if ((event & kButtonRemovalRequest) != 0) {
    DriveRecord copy = scratch;
    if (SafeRemoveDrive(&copy, channel) == 0) {
      // An earlier removal may have unlinked the channel: the drive it was
      // last linked to is the one named.
      const LONG drive = channel->linkedDrive >= 0 ? channel->linkedDrive : run.lastLinked;
      block->statusWord = kStatusRemovalFailedBase + static_cast<DWORD>(drive);
      if (run.kind == WorkerKind::Storage) monitorState.publishNeeded = 1;
    }
    if (run.kind == WorkerKind::Control) {
      monitorState.workersRestartRequested = 1;
    } else {
      ReenumerateDrives(run.stopEvent);
    }
  } else if (run.kind == WorkerKind::Control && HasVolumeLetters(channel) && counted) {
    HandlePanelEvent(channel, event);
  }
  if (!Signalled(run.stopEvent)) Sleep(kAfterEventPauseMs);
}

HANDLE CurrentDeviceHandle(const ChannelRecord* channel) {
  StateLock lock;
  return channel->deviceHandle;
}

// Closes the channel's handle when another thread asked for it and has not
// withdrawn the request meanwhile; true when it was closed.
bool CloseIfAsked(ChannelRecord* channel) {
  if (!ChannelCloseRequested(channel)) return false;
  StateLock lock;
  if (!WithdrawChannelClose(channel)) return false;
  CloseChannelDevice(channel);
  return true;
}

// Waits for button events and acts on them until the device goes, the link
// failed or the workers are stopped.
void EventLoop(WorkerRun& run) {
  if (Signalled(run.stopEvent)) return;
  while (!run.failed && CurrentDeviceHandle(run.channel) != nullptr) {
    const BYTE event = ReadButtonEvent(run.channel);
    const DWORD error = GetLastError();
    if (CloseIfAsked(run.channel)) break;
    if (DeviceGone(error)) {
      run.failed = true;
      break;
    }
    if (Signalled(run.stopEvent)) break;
    {
      StateLock lock;
      if (event != 0 && event != kNoButtonEvent && monitorState.stateBlock->driveCount >= 1) {
        HandleEvent(run, event);
      }
    }
    if (Signalled(run.stopEvent)) break;
    // A wait that keeps failing at once must not spin: pause before the next.
    if (event == kNoButtonEvent && error != ERROR_SUCCESS && error != ERROR_IO_PENDING) {
      WaitForSingleObject(run.stopEvent, kFailedWaitPauseMs);
    }
  }
}

// Requests the refresh if asked and closes the channel's device handle.
DWORD FinishWorker(WorkerRun& run) {
  if (run.failed) RequestRefresh();
  StateLock lock;
  ChannelRecord* channel = run.channel;
  CloseChannelDevice(channel);
  // No worker runs on the channel any more: a close asked from now on is
  // done at once.
  channel->threadHandle = nullptr;
  return 0;
}

// The drive's serial text from its standard inquiry data: trimmed, without
// any "QX-", "NA" when nothing is left.
void InquiryIdentity(ChannelRecord* channel, HANDLE stopEvent) {
  const HANDLE device = CreateFileW(channel->devicePath, GENERIC_READ | GENERIC_WRITE,
                                    FILE_SHARE_READ | FILE_SHARE_WRITE, nullptr, OPEN_EXISTING,
                                    FILE_FLAG_OVERLAPPED, nullptr);
  if (device == INVALID_HANDLE_VALUE) return;
  BYTE inquiry[kInquiryLength] = {};
  ScsiInquiry(device, inquiry, stopEvent);
  WCHAR text[kInquirySerialLength + 1] = {};
  CopyAsciiToWide(text, kInquirySerialLength + 1, inquiry + kInquirySerialOffset,
                  kInquirySerialLength);
  WideTrim(text);
  WideRemoveAll(text, WSTR("QX-"));
  if (text[0] == 0) WideCopy(text, kInquirySerialLength + 1, WSTR("NA"));
  {
    StateLock lock;
    WideCopy(channel->identityText, 128, text);
  }
  CloseHandle(device);
}

}  // namespace

DWORD WINAPI ControlChannelWorker(LPVOID channelRecord) {
  WorkerRun run{static_cast<ChannelRecord*>(channelRecord), WorkerKind::Control,
                monitorState.workerStopEvent};
  ClaimChannelDevice(run.channel);
  BYTE start = 0;
  DriveCommand(run.channel, CTL_WORKER_START, &start, 1, run.stopEvent);
  // A driver channel writes nothing for a stated length of 1; a HID channel
  // stores its serial-number text in the record whatever the length.
  BYTE identity[kIdentityBufferBytes] = {};
  DriveCommand(run.channel, CTL_GET_IDENTITY, identity, 1, run.stopEvent);
  LinkAtStart(run);
  if (run.channel->kind == kChannelKindDriver) {
    DriveCommand(run.channel, CTL_CLEAR_EVENT, nullptr, 0, nullptr);
  }
  EventLoop(run);
  return FinishWorker(run);
}

DWORD WINAPI StorageChannelWorker(LPVOID channelRecord) {
  WorkerRun run{static_cast<ChannelRecord*>(channelRecord), WorkerKind::Storage,
                monitorState.workerStopEvent};
  ClaimChannelDevice(run.channel);
  if (run.channel->kind == kChannelKindHid) {
    BYTE identity[kIdentityBufferBytes] = {};
    DriveCommand(run.channel, CTL_GET_IDENTITY, identity, sizeof(identity), run.stopEvent);
  } else {
    InquiryIdentity(run.channel, run.stopEvent);
    SendDriveCommand(run.channel, CTL_QUIESCE, 0, run.stopEvent);
    SendDriveCommand(run.channel, CTL_CLEAR_GAUGE_EVENT, 0, run.stopEvent);
  }
  LinkAtStart(run);
  EventLoop(run);
  return FinishWorker(run);
}
