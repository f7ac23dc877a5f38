// SCSI pass-through to a disk or an enclosure-services device, and the
// generic device I/O control with an abortable overlapped wait. Every
// operation takes an open handle; none opens or closes devices.
//
// Abort: when the abort event is signalled while a request is pending, or
// the request is still pending after the device time-out (20 s), the
// handle's I/O is cancelled and 3000 ms are granted for the cancellation.
// Every request runs on a heap block of its own (OVERLAPPED record, event,
// request and data buffers; io_block.h), so a device that has not finished
// cancelling after the grace writes only into that block, which is set
// aside, never into the caller's buffers: the operation returns after the
// grace whatever the device does.
#pragma once

#include <cstddef>

#include "platform/win32.h"
#include "transport/io_block.h"

// The block handed to IOCTL_SCSI_PASS_THROUGH_DIRECT as both the input and
// the output buffer: the platform's structure, the block length and the
// sense buffer the port driver fills.
struct PassThroughRequest {
  SCSI_PASS_THROUGH_DIRECT spt;
  DWORD totalLength;  // sizeof(PassThroughRequest)
  BYTE sense[20];
};

static_assert(sizeof(PassThroughRequest) == 80);
static_assert(offsetof(PassThroughRequest, spt) == 0);
static_assert(sizeof(SCSI_PASS_THROUGH_DIRECT) == 56);
static_assert(offsetof(PassThroughRequest, totalLength) == 56);
static_assert(offsetof(PassThroughRequest, sense) == 60);

constexpr DWORD kCancelGraceMs = 3000;
// A command the drive answered with a SCSI status other than GOOD fails with
// this application-defined code plus the status (0x20000002 for CHECK
// CONDITION), as result and as the thread's last error.
constexpr DWORD kScsiStatusErrorBase = 0x20000000;
constexpr BYTE kInquiryLength = 74;

// Finishes a request started on the block's overlapped record (`started` is
// what the starting call returned; its last error is still the thread's):
// waits for it or for abortEvent (may be null), at most the device time-out.
// True when it completed successfully. *given tells that the block was given
// up (after an abort, a time-out or a failed wait): the caller must not touch
// it then, and frees it otherwise.
bool FinishBlockRequest(HANDLE device, BOOL started, IoBlock* block, HANDLE abortEvent,
                        DWORD* bytes, bool* given);

// Issues the control with an own overlapped record and waits for it or for
// abortEvent (may be null). bytesReturned (may be null) receives the count
// transferred, 0 after a failure or an abort. An abort sets last error 995, a
// time-out 121.
bool IoControlWait(HANDLE device, DWORD controlCode, void* input, DWORD inputLength, void* output,
                   DWORD outputLength, DWORD* bytesReturned, HANDLE abortEvent);

// The SCSI commands. Each returns a Win32 error code, 0 on success. Data the
// drive returned short of the length asked for is zero-filled to it.
// READ CAPACITY(10): both outputs in host order, written only on success.
DWORD ScsiReadCapacity(HANDLE device, DWORD* lastLba, DWORD* blockLength, HANDLE abortEvent);
// Standard INQUIRY into buffer[kInquiryLength].
DWORD ScsiInquiry(HANDLE device, BYTE* buffer, HANDLE abortEvent);
// INQUIRY of a vital-product-data page into buffer[length].
DWORD ScsiInquiryPage(HANDLE device, BYTE pageCode, BYTE* buffer, BYTE length, HANDLE abortEvent);

// The diagnostic pages. The caller's overlapped record must be given (its
// event may be null for a handle opened without overlapped I/O); the
// transfer runs on a record of its own. A transfer that was
// started but did not complete successfully reports ERROR_IO_PENDING (997);
// the thread's last error then tells the cause (995 after an abort, 121
// after the time-out).
DWORD ReceiveDiagnosticPage(HANDLE device, BYTE pageCode, BYTE* buffer, BYTE length,
                            OVERLAPPED* overlapped, HANDLE abortEvent);
// buffer holds the whole page, header included.
DWORD SendDiagnosticPage(HANDLE device, const BYTE* buffer, BYTE length, OVERLAPPED* overlapped,
                         HANDLE abortEvent);
