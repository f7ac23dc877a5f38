// One instance of the service's named pipe: its overlapped block, handle,
// request and reply buffers and where it stands in the request/reply cycle.
#pragma once

#include "monitor/null_dacl.h"
#include "pipe/pipe_name.h"
#include "platform/win32.h"

constexpr int kPipeInstanceCount = 15;
// Each buffer has room for 10920 UTF-16 units; a read asks for 10920 bytes.
constexpr DWORD kPipeReadSize = 10920;
constexpr DWORD kPipeBufferBytes = 2 * kPipeReadSize;

enum PipeState : DWORD { kPipeConnecting = 0, kPipeReading = 1, kPipeWriting = 2 };

struct PipeInstance {
  OVERLAPPED overlapped;  // hEvent is the instance's event
  HANDLE pipe;
  alignas(8) BYTE request[kPipeBufferBytes];
  DWORD bytesRead;  // bytes delivered by the last completed read
  alignas(8) BYTE reply[kPipeBufferBytes];
  DWORD replyLength;          // set by the dispatcher
  DWORD state;                // PipeState
  DWORD pending;              // an overlapped operation is in progress
  NullDaclSecurity security;  // for the instance's event
};
