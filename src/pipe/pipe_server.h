// The named-pipe server thread that serves the user-interface application:
// fifteen overlapped message-mode instances of "\\.\pipe\QxSvcPipe", served
// one request at a time by a single thread.
#pragma once

#include "platform/win32.h"

// Started by the monitor once the state block, its mutex and its mapping
// exist; ends when monitorState.pipeStopEvent is signalled. Returns 0 on every
// path, also when the pipe cannot be created (the service then runs on
// without a command channel). The thread closes its pipes and events before it
// ends.
DWORD WINAPI PipeServerThread(LPVOID parameter);
