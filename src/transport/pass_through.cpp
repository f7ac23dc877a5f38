#include "transport/pass_through.h"

#include <cstring>

#include "service/process_locks.h"

namespace {

constexpr BYTE kSenseInfoLength = 18;
constexpr ULONG kCommandTimeOutSeconds = 20;

enum class WaitOutcome { Completed, Failed, Aborted, WaitFailed };

// Holds passThroughLock for one transfer.
class PassThroughLockHolder {
 public:
  PassThroughLockHolder() { EnterCriticalSection(&passThroughLock); }
  ~PassThroughLockHolder() { LeaveCriticalSection(&passThroughLock); }
  PassThroughLockHolder(const PassThroughLockHolder&) = delete;
  PassThroughLockHolder& operator=(const PassThroughLockHolder&) = delete;
};

// A zero-filled request block from the process heap, freed on scope exit.
class RequestBlock {
 public:
  RequestBlock()
      : request_(static_cast<PassThroughRequest*>(
            HeapAlloc(GetProcessHeap(), HEAP_ZERO_MEMORY, sizeof(PassThroughRequest)))) {}
  ~RequestBlock() {
    if (request_ != nullptr) HeapFree(GetProcessHeap(), 0, request_);
  }
  RequestBlock(const RequestBlock&) = delete;
  RequestBlock& operator=(const RequestBlock&) = delete;
  PassThroughRequest* Get() const { return request_; }

 private:
  PassThroughRequest* request_;
};

void FillRequest(PassThroughRequest* request, BYTE cdbLength, BYTE dataIn, DWORD dataLength,
                 void* data, const BYTE* cdb) {
  SCSI_PASS_THROUGH_DIRECT& spt = request->spt;
  spt.Length = sizeof(SCSI_PASS_THROUGH_DIRECT);
  spt.CdbLength = cdbLength;
  spt.SenseInfoLength = kSenseInfoLength;
  spt.DataIn = dataIn;
  spt.DataTransferLength = dataLength;
  spt.TimeOutValue = kCommandTimeOutSeconds;
  spt.DataBuffer = data;
  spt.SenseInfoOffset = offsetof(PassThroughRequest, sense);
  for (BYTE i = 0; i < cdbLength; ++i) spt.Cdb[i] = cdb[i];
  request->totalLength = sizeof(PassThroughRequest);
}

// Waits for a pending request or the abort event (may be null). Leaves the
// request completed in every outcome.
WaitOutcome WaitForRequest(HANDLE device, OVERLAPPED* overlapped, HANDLE abortEvent, DWORD* bytes) {
  *bytes = 0;
  if (overlapped->hEvent == nullptr) {
    // Nothing to wait on beside the handle itself: no abort is possible.
    return GetOverlappedResult(device, overlapped, bytes, TRUE) ? WaitOutcome::Completed
                                                                : WaitOutcome::Failed;
  }
  const HANDLE handles[2] = {overlapped->hEvent, abortEvent};
  const DWORD count = abortEvent != nullptr ? 2 : 1;
  const DWORD wait = WaitForMultipleObjects(count, handles, FALSE, INFINITE);
  if (wait == WAIT_OBJECT_0) {
    if (GetOverlappedResult(device, overlapped, bytes, TRUE)) return WaitOutcome::Completed;
    *bytes = 0;
    return WaitOutcome::Failed;
  }
  const DWORD waitError = GetLastError();
  SettleCancelledRequest(device, overlapped);
  if (wait == WAIT_OBJECT_0 + 1 && count == 2) {
    SetLastError(ERROR_OPERATION_ABORTED);
    return WaitOutcome::Aborted;
  }
  SetLastError(waitError != ERROR_SUCCESS ? waitError : ERROR_GEN_FAILURE);
  return WaitOutcome::WaitFailed;
}

// The thread's last error as a result code that is never 0 after a failure.
DWORD FailureCode() {
  const DWORD error = GetLastError();
  return error != ERROR_SUCCESS ? error : ERROR_GEN_FAILURE;
}

// The outcome of a transfer the port driver completed: a SCSI status other
// than GOOD fails, and data-in the drive returned short is zero-filled up to
// the length asked for.
DWORD CommandOutcome(const PassThroughRequest* request, DWORD askedLength) {
  const SCSI_PASS_THROUGH_DIRECT& spt = request->spt;
  if (spt.ScsiStatus != 0) {
    const DWORD code = kScsiStatusErrorBase | spt.ScsiStatus;
    SetLastError(code);
    return code;
  }
  if (spt.DataIn == SCSI_IOCTL_DATA_IN && spt.DataTransferLength < askedLength &&
      spt.DataBuffer != nullptr) {
    std::memset(static_cast<BYTE*>(spt.DataBuffer) + spt.DataTransferLength, 0,
                askedLength - spt.DataTransferLength);
  }
  return ERROR_SUCCESS;
}

// Sends a filled request through IoControlWait (READ CAPACITY and INQUIRY).
DWORD SendThroughIoControlWait(HANDLE device, PassThroughRequest* request, HANDLE abortEvent) {
  const DWORD asked = request->spt.DataTransferLength;
  DWORD bytes = 0;
  if (!IoControlWait(device, IOCTL_SCSI_PASS_THROUGH_DIRECT, request, sizeof(PassThroughRequest),
                     request, sizeof(PassThroughRequest), &bytes, abortEvent)) {
    return FailureCode();
  }
  return CommandOutcome(request, asked);
}

// Sends a filled diagnostic request on the caller's overlapped record.
DWORD SendDiagnostic(HANDLE device, PassThroughRequest* request, OVERLAPPED* overlapped,
                     HANDLE abortEvent) {
  const DWORD asked = request->spt.DataTransferLength;
  DWORD bytes = 0;
  if (DeviceIoControl(device, IOCTL_SCSI_PASS_THROUGH_DIRECT, request, sizeof(PassThroughRequest),
                      request, sizeof(PassThroughRequest), &bytes, overlapped)) {
    return CommandOutcome(request, asked);
  }
  const DWORD error = GetLastError();
  if (error != ERROR_IO_PENDING) return error != ERROR_SUCCESS ? error : ERROR_GEN_FAILURE;
  if (WaitForRequest(device, overlapped, abortEvent, &bytes) == WaitOutcome::Completed) {
    SetLastError(ERROR_SUCCESS);
    return CommandOutcome(request, asked);
  }
  return ERROR_IO_PENDING;
}

DWORD NoMemory() {
  SetLastError(ERROR_NOT_ENOUGH_MEMORY);
  return ERROR_NOT_ENOUGH_MEMORY;
}

}  // namespace

bool IoControlWait(HANDLE device, DWORD controlCode, void* input, DWORD inputLength, void* output,
                   DWORD outputLength, DWORD* bytesReturned, HANDLE abortEvent) {
  if (bytesReturned != nullptr) *bytesReturned = 0;
  const HANDLE ownEvent = CreateEventW(nullptr, FALSE, FALSE, nullptr);
  if (ownEvent == nullptr) return false;
  OVERLAPPED overlapped{};
  overlapped.hEvent = ownEvent;
  DWORD bytes = 0;
  bool ok = true;
  if (!DeviceIoControl(device, controlCode, input, inputLength, output, outputLength, &bytes,
                       &overlapped)) {
    ok = GetLastError() == ERROR_IO_PENDING &&
         WaitForRequest(device, &overlapped, abortEvent, &bytes) == WaitOutcome::Completed;
  }
  if (!ok) bytes = 0;
  if (bytesReturned != nullptr) *bytesReturned = bytes;
  const DWORD error = GetLastError();
  CloseHandle(ownEvent);
  SetLastError(error);
  return ok;
}

DWORD ScsiReadCapacity(HANDLE device, DWORD* lastLba, DWORD* blockLength, HANDLE abortEvent) {
  RequestBlock block;
  if (block.Get() == nullptr) return NoMemory();
  BYTE reply[8] = {};
  const BYTE cdb[10] = {0x25, 0, 0, 0, 0, 0, 0, 0, 0, 0};
  FillRequest(block.Get(), sizeof(cdb), SCSI_IOCTL_DATA_IN, sizeof(reply), reply, cdb);
  const DWORD result = SendThroughIoControlWait(device, block.Get(), abortEvent);
  if (result == ERROR_SUCCESS) {
    *lastLba =
        (DWORD{reply[0]} << 24) | (DWORD{reply[1]} << 16) | (DWORD{reply[2]} << 8) | reply[3];
    *blockLength =
        (DWORD{reply[4]} << 24) | (DWORD{reply[5]} << 16) | (DWORD{reply[6]} << 8) | reply[7];
  }
  return result;
}

DWORD ScsiInquiry(HANDLE device, BYTE* buffer, HANDLE abortEvent) {
  PassThroughLockHolder lock;
  RequestBlock block;
  if (block.Get() == nullptr) return NoMemory();
  const BYTE cdb[6] = {0x12, 0x00, 0x00, 0x00, kInquiryLength, 0x00};
  FillRequest(block.Get(), sizeof(cdb), SCSI_IOCTL_DATA_IN, kInquiryLength, buffer, cdb);
  return SendThroughIoControlWait(device, block.Get(), abortEvent);
}

DWORD ScsiInquiryPage(HANDLE device, BYTE pageCode, BYTE* buffer, BYTE length, HANDLE abortEvent) {
  PassThroughLockHolder lock;
  RequestBlock block;
  if (block.Get() == nullptr) return NoMemory();
  const BYTE cdb[6] = {0x12, 0x01, pageCode, 0x00, length, 0x00};
  FillRequest(block.Get(), sizeof(cdb), SCSI_IOCTL_DATA_IN, length, buffer, cdb);
  return SendThroughIoControlWait(device, block.Get(), abortEvent);
}

DWORD ReceiveDiagnosticPage(HANDLE device, BYTE pageCode, BYTE* buffer, BYTE length,
                            OVERLAPPED* overlapped, HANDLE abortEvent) {
  if (overlapped == nullptr) return ERROR_INVALID_PARAMETER;
  PassThroughLockHolder lock;
  RequestBlock block;
  if (block.Get() == nullptr) return NoMemory();
  const BYTE cdb[6] = {0x1C, 0x01, pageCode, 0x00, length, 0x00};
  FillRequest(block.Get(), sizeof(cdb), SCSI_IOCTL_DATA_IN, length, buffer, cdb);
  return SendDiagnostic(device, block.Get(), overlapped, abortEvent);
}

DWORD SendDiagnosticPage(HANDLE device, const BYTE* buffer, BYTE length, OVERLAPPED* overlapped,
                         HANDLE abortEvent) {
  if (overlapped == nullptr) return ERROR_INVALID_PARAMETER;
  PassThroughLockHolder lock;
  RequestBlock block;
  if (block.Get() == nullptr) return NoMemory();
  const BYTE cdb[6] = {0x1D, 0x10, 0x00, 0x00, length, 0x00};
  // The structure's data pointer is not const; the device only reads it.
  FillRequest(block.Get(), sizeof(cdb), SCSI_IOCTL_DATA_OUT, length, const_cast<BYTE*>(buffer),
              cdb);
  return SendDiagnostic(device, block.Get(), overlapped, abortEvent);
}

void SettleCancelledRequest(HANDLE device, OVERLAPPED* overlapped) {
  CancelIo(device);
  if (overlapped->hEvent != nullptr &&
      WaitForSingleObject(overlapped->hEvent, kCancelGraceMs) == WAIT_OBJECT_0) {
    return;
  }
  DWORD ignored = 0;
  GetOverlappedResult(device, overlapped, &ignored, TRUE);
}
