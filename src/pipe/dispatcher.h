// The dispatcher of the command channel: checks a request's length, carries
// out its command under the state mutex, publishes the block and builds the
// reply.
#pragma once

#include "pipe/pipe_instance.h"
#include "platform/win32.h"

// Builds the reply to the request in instance->request (instance->bytesRead
// bytes of it delivered by the client) into instance->reply and
// instance->replyLength.
void DispatchCommand(PipeInstance* instance);

// The same on plain buffers: `request` and `reply` hold kPipeBufferBytes
// bytes each, of which `received` bytes of the request arrived. The request
// buffer beyond them is zeroed first, so the reply never carries an earlier
// request's bytes. Returns the reply length (0: empty reply).
DWORD DispatchRequest(BYTE* request, DWORD received, BYTE* reply);
