// The drive command sender: one control code and value, carried to the drive
// as a button-filter-driver control, a HID output report or a vendor
// diagnostic page of an IEEE 1394 enclosure.
#include "transport/drive_command.h"

#include "discovery/model_table.h"
#include "monitor/monitor_state.h"
#include "transport/button_events.h"
#include "transport/io_block.h"
#include "transport/pass_through.h"

namespace {

constexpr BYTE kCommandPage = 0x80;
constexpr BYTE kGaugePage = 0x81;
constexpr BYTE kEnclosurePageLength = 5;
constexpr BYTE kDrainWatchBit = 0x04;
constexpr int kMaxDrainReads = 4;
constexpr WORD kGaugePatternBit = 0x8000;

// Closes a handle on scope exit (null and INVALID_HANDLE_VALUE are no handle).
class ScopedHandle {
 public:
  explicit ScopedHandle(HANDLE handle) : handle_(handle) {}
  ~ScopedHandle() {
    if (Valid()) CloseHandle(handle_);
  }
  ScopedHandle(const ScopedHandle&) = delete;
  ScopedHandle& operator=(const ScopedHandle&) = delete;
  HANDLE Get() const { return handle_; }
  bool Valid() const { return handle_ != nullptr && handle_ != INVALID_HANDLE_VALUE; }

 private:
  HANDLE handle_;
};

// The channel's shared handle, as the channel array holds it at the record's
// own index (the record itself outside a running monitor).
HANDLE SharedHandle(const ChannelRecord* channel) {
  const StateBlock* block = monitorState.stateBlock;
  if (block != nullptr && channel->ownIndex >= 0 && channel->ownIndex < kMaxChannels) {
    return block->channels[channel->ownIndex].deviceHandle;
  }
  return channel->deviceHandle;
}

bool IsHidChannel(const ChannelRecord* channel) {
  return channel->kind == kChannelKindHid;
}

// Driver controls that carry no input buffer; every other code carries the
// value as a 4-byte little-endian input.
bool CarriesNoInput(DWORD code) {
  switch (code) {
    case CTL_QUIESCE:
    case CTL_CLEAR_GAUGE_EVENT:
    case CTL_EJECT_NOTICE:
    case CTL_NOTICE_2:
    case CTL_CLEAR_EVENT:
    case CTL_EVENT_REPLY:
    case CTL_WORKER_START:
      return true;
    default:
      return false;
  }
}

// Waits briefly for a HID write or driver control started on the block's
// record; a request that does not complete in time is given up.
bool AwaitCompletion(HANDLE device, BOOL startedOk, IoBlock* block) {
  if (startedOk) {
    FreeIoBlock(block);
    return true;
  }
  const DWORD error = GetLastError();
  if (error != ERROR_IO_PENDING) {
    FreeIoBlock(block);
    SetLastError(error);
    return false;
  }
  if (WaitForSingleObject(block->event, kCommandCompletionMs) == WAIT_OBJECT_0) {
    DWORD bytes = 0;
    const bool ok = GetOverlappedResult(device, &block->overlapped, &bytes, FALSE) != FALSE;
    const DWORD result = GetLastError();
    FreeIoBlock(block);
    SetLastError(result);
    return ok;
  }
  AbandonIoBlock(device, block);
  SetLastError(ERROR_OPERATION_ABORTED);
  return false;
}

enum class EnclosureAction { Nothing, SendPage, Drain };

EnclosureAction MapEnclosureCommand(DWORD code, WORD value, BYTE* page, BYTE* parameter) {
  switch (code) {
    case CTL_SET_GAUGE:
      if ((value & kGaugePatternBit) != 0) {
        *page = kGaugePage;
        *parameter = static_cast<BYTE>(value >> 8);
        return EnclosureAction::SendPage;
      }
      if (value == 1) {
        *page = kCommandPage;
        *parameter = 1;
        return EnclosureAction::SendPage;
      }
      return EnclosureAction::Nothing;
    case CTL_CLEAR_GAUGE_EVENT:
    case CTL_CLEAR_EVENT:
      return EnclosureAction::Drain;
    case CTL_EJECT_NOTICE:
      *page = kCommandPage;
      *parameter = 4;
      return EnclosureAction::SendPage;
    case CTL_NOTICE_2:
      *page = kCommandPage;
      *parameter = 2;
      return EnclosureAction::SendPage;
    case CTL_NOTICE_8:
      *page = kCommandPage;
      *parameter = 8;
      return EnclosureAction::SendPage;
    default:
      return EnclosureAction::Nothing;
  }
}

// Reads the event page until two reads in a row show the watched bit clear,
// at most four times; the first failed read ends the drain as a failure.
bool DrainEventPage(HANDLE device, HANDLE ownEvent, HANDLE abortEvent) {
  bool previousClear = false;  // the first read counts as preceded by a set bit
  for (int read = 0; read < kMaxDrainReads; ++read) {
    BYTE page[kEnclosurePageLength] = {};
    OVERLAPPED overlapped{};
    overlapped.hEvent = ownEvent;
    if (ReceiveDiagnosticPage(device, kCommandPage, page, kEnclosurePageLength, &overlapped,
                              abortEvent) != ERROR_SUCCESS) {
      return false;
    }
    const bool clear = (page[4] & kDrainWatchBit) == 0;
    if (clear && previousClear) break;
    previousClear = clear;
  }
  return true;
}

bool SendToEnclosure(HANDLE device, DWORD code, WORD value, HANDLE ownEvent, HANDLE abortEvent) {
  BYTE pageCode = 0;
  BYTE parameter = 0;
  switch (MapEnclosureCommand(code, value, &pageCode, &parameter)) {
    case EnclosureAction::Nothing:
      return true;
    case EnclosureAction::Drain:
      return DrainEventPage(device, ownEvent, abortEvent);
    case EnclosureAction::SendPage:
      break;
  }
  const BYTE page[kEnclosurePageLength] = {pageCode, 0x00, 0x00, 0x01, parameter};
  OVERLAPPED overlapped{};
  overlapped.hEvent = ownEvent;
  return SendDiagnosticPage(device, page, kEnclosurePageLength, &overlapped, abortEvent) ==
         ERROR_SUCCESS;
}

bool SendHidReport(const ChannelRecord* channel, HANDLE device, WORD value) {
  if (channel->mode == kChannelModeGauge) value = TranslateHidCommandValue(value);
  ModelRow row{};
  const bool withReportId =
      LookupModelRow(channel->devicePath, &row) && (row.flags & kModelFlagExtendedIdentity) != 0;
  IoBlock* block = NewIoBlock(5);
  if (block == nullptr) return false;
  BYTE* report = block->Data();
  report[0] = static_cast<BYTE>(withReportId ? 0x01 : 0x00);
  report[1] = static_cast<BYTE>(value & 0xFF);
  report[2] = static_cast<BYTE>(value >> 8);
  DWORD written = 0;
  const BOOL ok = WriteFile(device, report, withReportId ? 5 : 3, &written, &block->overlapped);
  return AwaitCompletion(device, ok, block);
}

bool SendDriverControl(HANDLE device, DWORD code, WORD value) {
  const bool noInput = CarriesNoInput(code);
  IoBlock* block = NewIoBlock(4);
  if (block == nullptr) return false;
  BYTE* input = block->Data();
  input[0] = static_cast<BYTE>(value & 0xFF);
  input[1] = static_cast<BYTE>(value >> 8);
  DWORD bytes = 0;
  const BOOL ok = DeviceIoControl(device, code, noInput ? nullptr : input, noInput ? 0 : 4, nullptr,
                                  0, &bytes, &block->overlapped);
  return AwaitCompletion(device, ok, block);
}

WORD ByteValue(const BYTE* buffer, DWORD length) {
  return buffer != nullptr && length >= 1 ? buffer[0] : 0;
}

WORD WordValue(const BYTE* buffer, DWORD length) {
  if (buffer == nullptr || length == 0) return 0;
  const WORD high = length >= 2 ? buffer[1] : 0;
  return static_cast<WORD>(buffer[0] | (high << 8));
}

}  // namespace

WORD TranslateHidCommandValue(WORD value) {
  switch (value) {
    case 2:
    case 3:
    case 32:
    case 64:
    case 128:
      return 0;
    case 4:
      return 1;
    case 8:
      return 2;
    case 16:
      return 4;
    default:
      return value;
  }
}

DWORD SendDriveCommand(ChannelRecord* channel, DWORD controlCode, WORD value, HANDLE abortEvent) {
  if (channel == nullptr) return 0;
  const bool hid = IsHidChannel(channel);
  if (hid && value == 0) return 1;
  const HANDLE shared = SharedHandle(channel);
  if (shared == nullptr || shared == INVALID_HANDLE_VALUE) {
    SetLastError(ERROR_INVALID_HANDLE);
    return 0;
  }
  const bool enclosure = channel->mode == kChannelModeEnclosure;
  // A HID channel writes its reports on a private handle of its own.
  HANDLE privateHandle = nullptr;
  if (hid && !enclosure) {
    privateHandle = CreateFileW(channel->devicePath, GENERIC_READ | GENERIC_WRITE,
                                FILE_SHARE_READ | FILE_SHARE_WRITE, nullptr, OPEN_EXISTING,
                                FILE_FLAG_OVERLAPPED, nullptr);
    if (privateHandle == INVALID_HANDLE_VALUE) return 0;
  }
  ScopedHandle privateHid(privateHandle);
  ScopedHandle ownEvent(CreateEventW(nullptr, FALSE, FALSE, nullptr));
  if (!ownEvent.Valid()) return 0;

  bool ok;
  if (enclosure) {
    ok = SendToEnclosure(shared, controlCode, value, ownEvent.Get(), abortEvent);
  } else if (hid) {
    ok = SendHidReport(channel, privateHid.Get(), value);
  } else {
    ok = SendDriverControl(shared, controlCode, value);
  }
  // The handles close in reverse order: the event, then the private HID handle.
  return ok ? 1 : 0;
}

DWORD DriveCommand(ChannelRecord* channel, DWORD controlCode, BYTE* buffer, DWORD length,
                   HANDLE abortEvent) {
  if (channel == nullptr) return 0;
  switch (controlCode) {
    case CTL_SET_GAUGE:
    case CTL_QUIESCE:
    case CTL_CLEAR_GAUGE_EVENT:
      return SendDriveCommand(channel, controlCode, WordValue(buffer, length), abortEvent);
    case CTL_SET_STATE_B:
    case CTL_SET_STATE:
    case CTL_EJECT_NOTICE:
    case CTL_CLEAR_EVENT:
    case CTL_EVENT_REPLY:
    case CTL_WORKER_START:
    case CTL_NOTICE_8:
      return SendDriveCommand(channel, controlCode, ByteValue(buffer, length), abortEvent);
    case CTL_WAIT_GAUGE_EVENT:
    case CTL_WAIT_EVENT: {
      const BYTE event = ReadButtonEvent(channel);
      if (buffer != nullptr && length >= 1) buffer[0] = event;
      return 1;
    }
    case CTL_GET_IDENTITY:
      return ReadDriveIdentity(channel, buffer, length);
    default:
      return 0;
  }
}
