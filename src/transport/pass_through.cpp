#include "transport/pass_through.h"

#include <cstring>

#include "service/process_locks.h"
#include "transport/io_block.h"

namespace {

constexpr BYTE kSenseInfoLength = 18;
constexpr ULONG kCommandTimeOutSeconds = 20;

enum class WaitOutcome { Completed, Failed, Aborted, WaitFailed };

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

// Waits for the pending request on the block or the abort event (may be
// null), at most the device time-out: a request the port driver has not
// completed by then is hung, and is given up like an aborted one (last error
// ERROR_SEM_TIMEOUT). After an abort, a time-out or a wait that failed, the
// block is given up (AbandonIoBlock) and must not be touched again.
WaitOutcome WaitForRequest(HANDLE device, IoBlock* block, HANDLE abortEvent, DWORD* bytes) {
  *bytes = 0;
  const HANDLE handles[2] = {block->event, abortEvent};
  const DWORD count = abortEvent != nullptr ? 2 : 1;
  const DWORD wait = WaitForMultipleObjects(count, handles, FALSE, kCommandTimeOutSeconds * 1000);
  if (wait == WAIT_TIMEOUT) {
    AbandonIoBlock(device, block);
    SetLastError(ERROR_SEM_TIMEOUT);
    return WaitOutcome::WaitFailed;
  }
  if (wait == WAIT_OBJECT_0) {
    if (GetOverlappedResult(device, &block->overlapped, bytes, TRUE)) return WaitOutcome::Completed;
    *bytes = 0;
    return WaitOutcome::Failed;
  }
  const DWORD waitError = GetLastError();
  AbandonIoBlock(device, block);
  if (wait == WAIT_OBJECT_0 + 1 && count == 2) {
    SetLastError(ERROR_OPERATION_ABORTED);
    return WaitOutcome::Aborted;
  }
  SetLastError(waitError != ERROR_SUCCESS ? waitError : ERROR_GEN_FAILURE);
  return WaitOutcome::WaitFailed;
}

// Issues a control on the block's record and waits for it (or the abort).
// True when it completed successfully. *pending tells that it went pending;
// *given that the block was given up (the caller must not touch it then).
bool IssueAndWait(HANDLE device, DWORD code, IoBlock* block, void* input, DWORD inputLength,
                  void* output, DWORD outputLength, HANDLE abortEvent, DWORD* bytes, bool* pending,
                  bool* given) {
  const BOOL started = DeviceIoControl(device, code, input, inputLength, output, outputLength,
                                       bytes, &block->overlapped);
  *pending = !started && GetLastError() == ERROR_IO_PENDING;
  return FinishBlockRequest(device, started, block, abortEvent, bytes, given);
}

// The SCSI request and its data, side by side in one heap block.
struct ScsiBlock {
  IoBlock* io = nullptr;
  PassThroughRequest* request = nullptr;
  BYTE* data = nullptr;
};

ScsiBlock NewScsiBlock(DWORD dataLength) {
  ScsiBlock block;
  block.io = NewIoBlock(sizeof(PassThroughRequest) + dataLength);
  if (block.io == nullptr) return block;
  block.request = reinterpret_cast<PassThroughRequest*>(block.io->Data());
  block.data = block.io->Data() + sizeof(PassThroughRequest);
  return block;
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

// Sends the filled request of the block and waits for it; data the drive
// returned is copied to `data`, zero-filled where it returned less. Frees
// the block unless it was given up. A diagnostic transfer that started but
// did not complete successfully reports ERROR_IO_PENDING; the others report
// the cause, which is also the thread's last error.
DWORD SendScsi(HANDLE device, const ScsiBlock& block, BYTE* data, DWORD dataLength,
               HANDLE abortEvent, bool diagnostic) {
  DWORD bytes = 0;
  bool pending = false;
  bool given = false;
  const bool done = IssueAndWait(device, IOCTL_SCSI_PASS_THROUGH_DIRECT, block.io, block.request,
                                 sizeof(PassThroughRequest), block.request,
                                 sizeof(PassThroughRequest), abortEvent, &bytes, &pending, &given);
  DWORD result;
  if (done) {
    SetLastError(ERROR_SUCCESS);
    result = CommandOutcome(block.request, dataLength);
    if (result == ERROR_SUCCESS && data != nullptr &&
        block.request->spt.DataIn == SCSI_IOCTL_DATA_IN) {
      std::memcpy(data, block.data, dataLength);
    }
  } else {
    const DWORD error = FailureCode();
    result = diagnostic && pending ? ERROR_IO_PENDING : error;
    SetLastError(error);
  }
  if (!given) {
    const DWORD error = GetLastError();
    FreeIoBlock(block.io);
    SetLastError(error);
  }
  return result;
}

DWORD NoMemory() {
  SetLastError(ERROR_NOT_ENOUGH_MEMORY);
  return ERROR_NOT_ENOUGH_MEMORY;
}

}  // namespace

bool FinishBlockRequest(HANDLE device, BOOL started, IoBlock* block, HANDLE abortEvent,
                        DWORD* bytes, bool* given) {
  *given = false;
  if (started) return true;
  if (GetLastError() != ERROR_IO_PENDING) {
    *bytes = 0;
    return false;
  }
  const WaitOutcome outcome = WaitForRequest(device, block, abortEvent, bytes);
  *given = outcome == WaitOutcome::Aborted || outcome == WaitOutcome::WaitFailed;
  return outcome == WaitOutcome::Completed;
}

bool IoControlWait(HANDLE device, DWORD controlCode, void* input, DWORD inputLength, void* output,
                   DWORD outputLength, DWORD* bytesReturned, HANDLE abortEvent) {
  if (bytesReturned != nullptr) *bytesReturned = 0;
  // The device reads and writes the block's copies of the buffers, so that
  // a request given up after an abort never writes into the caller's.
  IoBlock* block = NewIoBlock(std::size_t{inputLength} + outputLength);
  if (block == nullptr) return false;
  BYTE* blockInput = inputLength != 0 ? block->Data() : nullptr;
  BYTE* blockOutput = outputLength != 0 ? block->Data() + inputLength : nullptr;
  if (input != nullptr && inputLength != 0) std::memcpy(blockInput, input, inputLength);
  DWORD bytes = 0;
  bool pending = false;
  bool given = false;
  const bool ok = IssueAndWait(device, controlCode, block, blockInput, inputLength, blockOutput,
                               outputLength, abortEvent, &bytes, &pending, &given);
  const DWORD error = GetLastError();
  if (ok) {
    if (bytes > outputLength) bytes = outputLength;
    if (output != nullptr && bytes != 0) std::memcpy(output, blockOutput, bytes);
    if (bytesReturned != nullptr) *bytesReturned = bytes;
  }
  if (!given) FreeIoBlock(block);
  SetLastError(error);
  return ok;
}

DWORD ScsiReadCapacity(HANDLE device, DWORD* lastLba, DWORD* blockLength, HANDLE abortEvent) {
  BYTE reply[8] = {};
  ScsiBlock block = NewScsiBlock(sizeof(reply));
  if (block.io == nullptr) return NoMemory();
  const BYTE cdb[10] = {0x25, 0, 0, 0, 0, 0, 0, 0, 0, 0};
  FillRequest(block.request, sizeof(cdb), SCSI_IOCTL_DATA_IN, sizeof(reply), block.data, cdb);
  const DWORD result = SendScsi(device, block, reply, sizeof(reply), abortEvent, false);
  if (result == ERROR_SUCCESS) {
    *lastLba =
        (DWORD{reply[0]} << 24) | (DWORD{reply[1]} << 16) | (DWORD{reply[2]} << 8) | reply[3];
    *blockLength =
        (DWORD{reply[4]} << 24) | (DWORD{reply[5]} << 16) | (DWORD{reply[6]} << 8) | reply[7];
  }
  return result;
}

DWORD ScsiInquiry(HANDLE device, BYTE* buffer, HANDLE abortEvent) {
  SectionLock lock(&passThroughLock);
  ScsiBlock block = NewScsiBlock(kInquiryLength);
  if (block.io == nullptr) return NoMemory();
  const BYTE cdb[6] = {0x12, 0x00, 0x00, 0x00, kInquiryLength, 0x00};
  FillRequest(block.request, sizeof(cdb), SCSI_IOCTL_DATA_IN, kInquiryLength, block.data, cdb);
  return SendScsi(device, block, buffer, kInquiryLength, abortEvent, false);
}

DWORD ScsiInquiryPage(HANDLE device, BYTE pageCode, BYTE* buffer, BYTE length, HANDLE abortEvent) {
  SectionLock lock(&passThroughLock);
  ScsiBlock block = NewScsiBlock(length);
  if (block.io == nullptr) return NoMemory();
  const BYTE cdb[6] = {0x12, 0x01, pageCode, 0x00, length, 0x00};
  FillRequest(block.request, sizeof(cdb), SCSI_IOCTL_DATA_IN, length, block.data, cdb);
  return SendScsi(device, block, buffer, length, abortEvent, false);
}

// The caller's overlapped record says whether the handle is overlapped; the
// transfer itself runs on the block's own record, and the outcome is copied
// into the caller's.
DWORD ReceiveDiagnosticPage(HANDLE device, BYTE pageCode, BYTE* buffer, BYTE length,
                            OVERLAPPED* overlapped, HANDLE abortEvent) {
  if (overlapped == nullptr) return ERROR_INVALID_PARAMETER;
  SectionLock lock(&passThroughLock);
  ScsiBlock block = NewScsiBlock(length);
  if (block.io == nullptr) return NoMemory();
  const BYTE cdb[6] = {0x1C, 0x01, pageCode, 0x00, length, 0x00};
  FillRequest(block.request, sizeof(cdb), SCSI_IOCTL_DATA_IN, length, block.data, cdb);
  const DWORD result = SendScsi(device, block, buffer, length, abortEvent, true);
  return result;
}

DWORD SendDiagnosticPage(HANDLE device, const BYTE* buffer, BYTE length, OVERLAPPED* overlapped,
                         HANDLE abortEvent) {
  if (overlapped == nullptr) return ERROR_INVALID_PARAMETER;
  SectionLock lock(&passThroughLock);
  ScsiBlock block = NewScsiBlock(length);
  if (block.io == nullptr) return NoMemory();
  std::memcpy(block.data, buffer, length);
  const BYTE cdb[6] = {0x1D, 0x10, 0x00, 0x00, length, 0x00};
  FillRequest(block.request, sizeof(cdb), SCSI_IOCTL_DATA_OUT, length, block.data, cdb);
  const DWORD result = SendScsi(device, block, nullptr, length, abortEvent, true);
  return result;
}
