// Status page 0x82, sleep-state page 0x83 and the control block, read and
// written through diagnostic pages or the equivalent HID reports.
#include "transport/status_pages.h"

#include <cstring>

#include "monitor/monitor_state.h"
#include "platform/wide.h"
#include "transport/io_block.h"
#include "transport/pass_through.h"
#include "transport/refresh_on_change.h"

namespace {

constexpr BYTE kStatusPage = 0x82;
constexpr BYTE kStatusPageLength = 8;
constexpr BYTE kSleepPage = 0x83;
constexpr BYTE kSleepPageLength = 5;
constexpr BYTE kStatusReportId = 2;
constexpr BYTE kSleepReportId = 3;
constexpr BYTE kControlReportId = 2;
constexpr ULONG kInputReportLength = 16;
constexpr DWORD kFailedReadPauseMs = 200;
constexpr DWORD kBusUsb = 2;
constexpr DWORD kNotOpened = 0xFFFFFFFF;
constexpr std::size_t kPathUnits = 256;

// Status codes by the page's status nibble.
constexpr DWORD kStatusCodes[16] = {0, 5, 1, 6, 1, 3, 2, 1, 7, 8, 4, 4, 4, 4, 4, 4};

enum class Transport { Diagnostic, Hid };

struct OpenedDrive {
  HANDLE handle = INVALID_HANDLE_VALUE;
  Transport transport = Transport::Diagnostic;
  DWORD error = ERROR_SUCCESS;     // why it did not open
  bool noStatusInterface = false;  // bound drive that offers neither path
};

DWORD FailureCode(DWORD error) {
  return error != ERROR_SUCCESS ? error : ERROR_GEN_FAILURE;
}

// Opens the drive's control interface, or its HID collection for a USB drive,
// synchronously. A drive that cannot be opened asks for a rescan (once, while
// it stays so), except a
// drive already bound to its channel that simply has neither interface (an
// IEEE 1394 drive reached through the button filter driver): a rescan would
// find it the same way, so asking would only rescan for ever.
OpenedDrive OpenDrive(const DriveRecord* drive) {
  OpenedDrive opened;
  // The record may come from the user-interface application: the path is
  // copied into a buffer that is terminated whatever the record holds.
  WCHAR path[kPathUnits + 1] = {};
  if (drive->controlPath[0] != 0) {
    std::memcpy(path, drive->controlPath, sizeof(drive->controlPath));
    opened.transport = Transport::Diagnostic;
  } else if (drive->busKind == kBusUsb) {
    std::memcpy(path, drive->hidPath, sizeof(drive->hidPath));
    opened.transport = Transport::Hid;
  } else if (drive->channelPath[0] != 0) {
    opened.noStatusInterface = true;
    opened.error = ERROR_NOT_SUPPORTED;
    return opened;
  } else {
    opened.error = GetLastError();
    NoteRefreshConditions(drive, kRefreshNoStatusPath, true);
    return opened;
  }
  // Overlapped on both paths, so that a wait for a device that does not
  // answer can be given up.
  opened.handle =
      CreateFileW(path, GENERIC_READ | GENERIC_WRITE, FILE_SHARE_READ | FILE_SHARE_WRITE, nullptr,
                  OPEN_EXISTING, FILE_FLAG_OVERLAPPED, nullptr);
  if (opened.handle == INVALID_HANDLE_VALUE) {
    opened.error = FailureCode(GetLastError());
    NoteRefreshConditions(drive, kRefreshOpenFails, true);
    SetLastError(opened.error);
  } else {
    NoteRefreshConditions(drive, kRefreshNoStatusPath | kRefreshOpenFails, false);
  }
  return opened;
}

// Runs one HID transfer on a heap block: the input report named by data[0]
// (read into data) or the output report in data (written). Waits at most the
// device time-out, and gives up on abortEvent (may be null). 0 or the error.
DWORD HidTransfer(HANDLE device, bool read, BYTE* data, DWORD length, HANDLE abortEvent) {
  IoBlock* block = NewIoBlock(length);
  if (block == nullptr) return FailureCode(GetLastError());
  std::memcpy(block->Data(), data, length);
  DWORD bytes = 0;
  // The input report is asked for as HidD_GetInputReport asks for it, with
  // the report number in the buffer's first byte.
  const BOOL started =
      read ? DeviceIoControl(device, IOCTL_HID_GET_INPUT_REPORT, block->Data(), length,
                             block->Data(), length, &bytes, &block->overlapped)
           : WriteFile(device, block->Data(), length, &bytes, &block->overlapped);
  bool given = false;
  const bool ok = FinishBlockRequest(device, started, block, abortEvent, &bytes, &given);
  const DWORD error = ok ? ERROR_SUCCESS : FailureCode(GetLastError());
  if (!given) {
    if (ok && read) std::memcpy(data, block->Data(), length);
    FreeIoBlock(block);
  }
  return error;
}

// Reads one page, from the diagnostic page or from the HID input report that
// stands for it. Returns 0 or the error; pauses after a failed read.
DWORD ReadPage(const DriveRecord* drive, BYTE pageCode, BYTE* page, BYTE pageLength,
               HANDLE abortEvent) {
  OpenedDrive opened = OpenDrive(drive);
  if (opened.noStatusInterface) return opened.error;
  DWORD error = opened.error;
  if (opened.handle != INVALID_HANDLE_VALUE) {
    if (opened.transport == Transport::Diagnostic) {
      OVERLAPPED overlapped{};
      error =
          ReceiveDiagnosticPage(opened.handle, pageCode, page, pageLength, &overlapped, abortEvent);
    } else {
      BYTE report[kInputReportLength] = {};
      report[0] = pageCode == kStatusPage ? kStatusReportId : kSleepReportId;
      error = HidTransfer(opened.handle, true, report, kInputReportLength, abortEvent);
      if (error == ERROR_SUCCESS && pageCode == kStatusPage) {
        page[0] = kStatusPage;
        page[4] = static_cast<BYTE>(report[4] & 0xCF);
        page[5] = report[3];
        page[6] = report[2];
        page[7] = report[1];
      } else if (error == ERROR_SUCCESS) {
        page[0] = kSleepPage;
        page[4] = static_cast<BYTE>(report[1] << 6);
      }
    }
    CloseHandle(opened.handle);
  }
  if (error != ERROR_SUCCESS) {
    if (abortEvent != nullptr) {
      WaitForSingleObject(abortEvent, kFailedReadPauseMs);
    } else {
      Sleep(kFailedReadPauseMs);
    }
  }
  return error;
}

}  // namespace

DWORD StatusCodeOfPage(const BYTE* page) {
  if (page[0] != kStatusPage) return 0;
  return kStatusCodes[page[4] & 0x0F];
}

DWORD ReadDriveStatus(const DriveRecord* drive, BYTE* page, HANDLE abortEvent) {
  std::memset(page, 0, kStatusPageLength);
  if (ReadPage(drive, kStatusPage, page, kStatusPageLength, abortEvent) != ERROR_SUCCESS) return 0;
  return StatusCodeOfPage(page);
}

DWORD ReadSleepState(const DriveRecord* drive, BYTE* page, HANDLE abortEvent) {
  std::memset(page, 0, kSleepPageLength);
  if (ReadPage(drive, kSleepPage, page, kSleepPageLength, abortEvent) != ERROR_SUCCESS) return 3;
  switch (page[4] >> 6) {
    case 2:
      return 2;
    case 3:
      return 3;
    default:
      return 0;
  }
}

DWORD WriteDriveControl(const DriveRecord* drive, const BYTE* control, HANDLE abortEvent) {
  OpenedDrive opened = OpenDrive(drive);
  if (opened.handle == INVALID_HANDLE_VALUE) return kNotOpened;
  DWORD result;
  if (opened.transport == Transport::Diagnostic) {
    OVERLAPPED overlapped{};
    result = SendDiagnosticPage(opened.handle, control, kStatusPageLength, &overlapped, abortEvent);
  } else {
    BYTE report[5] = {kControlReportId, control[7], control[6], 0x00, control[4]};
    result = HidTransfer(opened.handle, false, report, sizeof(report), abortEvent);
  }
  CloseHandle(opened.handle);
  return result;
}
