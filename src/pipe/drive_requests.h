// The commands of the command channel that act on drives and channels. Each
// runs on the pipe server thread with the state mutex held, except
// ForwardMessageRequest, which runs with it released.
#pragma once

#include "platform/win32.h"

// Command 1: safe removal of the drive of the index-th linked channel.
// Result 1 removed, 0 not; detail 1 while monitoring is paused, else the last
// error on failure.
DWORD SafeRemoveRequest(DWORD index, DWORD* detail);
// Commands 2 and 3: the drive-gone command for the index-th linked channel.
// Result 1, or 0 (detail: the last error) when there is no such channel.
DWORD ReleaseDriveRequest(DWORD index, DWORD* detail);
// Command 6: hands a window message forwarded by the application to the
// monitor. resultSlot is 8 bytes; nothing writes it.
void ForwardMessageRequest(DWORD message, DWORD parameter, DWORD eventData, BYTE* resultSlot);
// Command 9: refreshes the capacity gauges, of all drives (low byte of
// letterArg 0) or up to the first plain channel showing that letter. Result 1.
DWORD RefreshGaugesRequest(DWORD letterArg, DWORD forceResend);
// Commands 11 and 12 read only the firmware serial of the client's drive
// image: they act on the service's own record of the drive with that serial,
// so no path a client sent is ever opened.
//
// Command 11: reads the status page of the drive named by the image's firmware
// serial into statusBlock[8]. The status code, or ERROR_INVALID_PARAMETER
// when no drive has that serial.
DWORD ReadStatusRequest(const BYTE* driveImage, BYTE* statusBlock);
// Command 12: sends controlBlock[8] to the drive named by the image's
// firmware serial. WriteDriveControl's result, or ERROR_INVALID_PARAMETER.
DWORD WriteControlRequest(const BYTE* driveImage, const BYTE* controlBlock);
