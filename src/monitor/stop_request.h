// A stop asked for while RunMonitor starts, before its stop event exists
// (Ctrl+C during start-up), must not be lost: StopMonitor also records it
// here, and RunMonitor signals its stop event for it once the event exists.
// RunMonitor clears it when it ends; the service host clears it before it
// installs its control handler.
#pragma once

#include <atomic>

extern std::atomic<bool> monitorStopRequested;
