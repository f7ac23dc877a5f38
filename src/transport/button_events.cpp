// Button events of a channel and the drive identity behind it.
#include "transport/button_events.h"

#include <cstring>

#include "discovery/drive_enumeration.h"
#include "monitor/monitor_state.h"
#include "monitor/state_lock.h"
#include "platform/wide.h"
#include "transport/drive_command.h"
#include "transport/drive_features.h"
#include "transport/io_block.h"
#include "transport/pass_through.h"
#include "volume/volume_letters.h"

namespace {

constexpr BYTE kEventPage = 0x80;
constexpr BYTE kEventPageLength = 5;
constexpr DWORD kHidEventReportLength = 64;
constexpr DWORD kEnclosurePollPauseMs = 250;
// A close request is a flag, not an object: the wait looks at it this often.
constexpr DWORD kCloseRequestPollMs = 1000;
constexpr DWORD kSerialBufferBytes = 512;
constexpr std::size_t kIdentityUnits = 128;

bool Signalled(HANDLE event) {
  return event != nullptr && WaitForSingleObject(event, 0) == WAIT_OBJECT_0;
}

HANDLE DeviceHandleOf(const ChannelRecord* channel) {
  StateLock lock;
  return channel->deviceHandle;
}

// A drive list that no longer matches the system is read again before the
// event is acted on, unless the workers are stopping.
void RefreshStaleDriveList(HANDLE stopEvent) {
  if (Signalled(stopEvent)) return;
  StateLock lock;
  if (monitorState.driveListStale == 0) return;
  EnumerateDrives(stopEvent);
  AssignVolumeLetters();
  monitorState.driveListStale = 0;
}

}  // namespace

BYTE ReadButtonEvent(ChannelRecord* channel) {
  if (channel == nullptr) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return kNoButtonEvent;
  }
  const HANDLE stopEvent = monitorState.workerStopEvent;
  const HANDLE device = DeviceHandleOf(channel);
  BYTE report[kHidEventReportLength] = {};
  DWORD controlOutput = 0xFFFFFFFF;
  BYTE page[kEventPageLength] = {};
  const HANDLE ownEvent = CreateEventW(nullptr, FALSE, FALSE, nullptr);
  if (ownEvent == nullptr) return kNoButtonEvent;
  OVERLAPPED overlapped{};
  overlapped.hEvent = ownEvent;

  const bool enclosure = channel->mode == kChannelModeEnclosure;
  const bool hid = channel->kind == kChannelKindHid;
  BYTE result = kNoButtonEvent;
  DWORD error = ERROR_SUCCESS;
  bool completed = false;  // a read finished: the result comes from its buffer
  bool pending = false;    // a read is still outstanding on the handle
  IoBlock* block = nullptr;

  if (enclosure) {
    const DWORD status =
        ReceiveDiagnosticPage(device, kEventPage, page, kEventPageLength, &overlapped, stopEvent);
    error = status == ERROR_SUCCESS ? ERROR_SUCCESS : GetLastError();
    if (status != ERROR_SUCCESS && error == ERROR_SUCCESS) error = status;
    Sleep(kEnclosurePollPauseMs);
    if (status == ERROR_SUCCESS) {
      if (Signalled(stopEvent)) {
        result = page[4];
      } else {
        completed = true;
      }
    }
  } else {
    // The read runs on a heap block of its own: a stop gives it up after the
    // cancellation grace, and a device that completes it later writes into
    // the block, never into this frame.
    block = NewIoBlock(kHidEventReportLength);
    if (block == nullptr) {
      CloseHandle(ownEvent);
      return kNoButtonEvent;
    }
    DWORD bytes = 0;
    BOOL started;
    if (hid) {
      started = ReadFile(device, block->Data(), kHidEventReportLength, &bytes, &block->overlapped);
    } else {
      const DWORD code = channel->mode == kChannelModeGauge ? CTL_WAIT_GAUGE_EVENT : CTL_WAIT_EVENT;
      std::memcpy(block->Data(), &controlOutput, sizeof(controlOutput));
      started = DeviceIoControl(device, code, nullptr, 0, block->Data(), sizeof(controlOutput),
                                &bytes, &block->overlapped);
    }
    if (started) {
      completed = true;
    } else {
      error = GetLastError();
      pending = error == ERROR_IO_PENDING;
    }
    while (pending) {
      // A stop, or another thread asking for the handle to be closed, gives
      // the read up; only this thread may close the handle it runs on.
      // The wait ends on the read or on the stop itself, so an idle worker
      // sleeps instead of waking to look at the stop event.
      if (Signalled(stopEvent) || ChannelCloseRequested(channel)) break;
      const HANDLE waits[2] = {block->event, stopEvent};
      const DWORD wait =
          WaitForMultipleObjects(stopEvent != nullptr ? 2 : 1, waits, FALSE, kCloseRequestPollMs);
      if (wait == WAIT_TIMEOUT || wait == WAIT_OBJECT_0 + 1) continue;
      if (wait == WAIT_OBJECT_0) {
        // The byte comes from the buffer whatever the outcome; the outcome
        // only tells the caller whether the device is still there.
        pending = false;
        completed = true;
        error = GetOverlappedResult(device, &block->overlapped, &bytes, FALSE) ? ERROR_SUCCESS
                                                                               : GetLastError();
        break;
      }
      error = GetLastError();
      break;  // the wait itself failed: the read is given up below
    }
    if (completed) {
      std::memcpy(report, block->Data(), kHidEventReportLength);
      std::memcpy(&controlOutput, block->Data(), sizeof(controlOutput));
    }
  }

  if (completed) {
    RefreshStaleDriveList(stopEvent);
    if (enclosure) {
      result = page[4];
    } else if (hid) {
      result = report[1];
    } else {
      result = static_cast<BYTE>(controlOutput & 0xFF);
    }
  }
  // A stop, a close request or a failed wait leaves the read outstanding: it
  // is given up.
  if (block != nullptr) {
    if (pending) {
      AbandonIoBlock(device, block);
    } else {
      FreeIoBlock(block);
    }
  }
  CloseHandle(ownEvent);
  SetLastError(error);
  return result;
}

DWORD ReadDriveIdentity(ChannelRecord* channel, BYTE* buffer, DWORD length) {
  if (channel == nullptr) return 0;
  if (channel->kind == kChannelKindHid) {
    // The serial string is asked for as HidD_GetSerialNumberString asks,
    // but overlapped, so that a collection that never answers is given up
    // at the device time-out or when the workers stop.
    const HANDLE device = CreateFileW(channel->devicePath, 0, FILE_SHARE_READ | FILE_SHARE_WRITE,
                                      nullptr, OPEN_EXISTING, FILE_FLAG_OVERLAPPED, nullptr);
    if (device == INVALID_HANDLE_VALUE) return 0;
    WCHAR serial[kSerialBufferBytes / sizeof(WCHAR) + 1] = {};
    DWORD bytes = 0;
    const bool ok = IoControlWait(device, IOCTL_HID_GET_SERIALNUMBER_STRING, nullptr, 0, serial,
                                  kSerialBufferBytes, &bytes, monitorState.workerStopEvent);
    const DWORD error = GetLastError();
    CloseHandle(device);
    if (!ok) {
      SetLastError(error);
      return 0;
    }
    // The identity field and the caller's buffer hold 128 units each.
    WCHAR text[kIdentityUnits] = {};
    const std::size_t units = WideCopy(text, kIdentityUnits, serial);
    if (buffer != nullptr) std::memcpy(buffer, text, (units + 1) * sizeof(WCHAR));
    StateLock lock;
    std::memset(channel->identityText, 0, sizeof(channel->identityText));
    std::memcpy(channel->identityText, text, (units + 1) * sizeof(WCHAR));
    return 1;
  }
  if (channel->kind == kChannelKindDriver && channel->mode != kChannelModeEnclosure) {
    BYTE reply[8] = {};
    DWORD bytes = 0;
    if (!IoControlWait(DeviceHandleOf(channel), CTL_GET_IDENTITY, nullptr, 0, reply, sizeof(reply),
                       &bytes, monitorState.workerStopEvent)) {
      return 0;
    }
    std::uint64_t identity = 0;
    for (int i = 7; i >= 0; --i) identity = (identity << 8) | reply[i];
    WideString text;
    WideAppendHex(text, identity, 16);
    const DWORD capacity = length / DWORD{sizeof(WCHAR)};  // units, terminator included
    if (buffer != nullptr && capacity >= 1) {
      const std::size_t units = text.size() < capacity - 1 ? text.size() : capacity - 1;
      text.resize(units);
      std::memcpy(buffer, text.c_str(), (units + 1) * sizeof(WCHAR));
    }
    return 0;
  }
  return 0;
}
