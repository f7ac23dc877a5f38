// The named-pipe server thread that serves the user-interface application:
// fifteen overlapped message-mode instances of "\\.\pipe\QxSvcPipe", served
// one request at a time by a single thread.
#pragma once

#include "platform/win32.h"

// Started by the monitor once the state block, its mutex and its mapping
// exist; ends when monitorState.pipeStopEvent is signalled, with exit code 0.
// An instance that cannot be created or connected (another process holds the
// name, or took one of the instances) is logged once and tried again with a
// growing pause; the others serve meanwhile. Each wait starts its scan after
// the instance served last. The thread closes its pipes and events before it
// ends.
DWORD WINAPI PipeServerThread(LPVOID parameter);
