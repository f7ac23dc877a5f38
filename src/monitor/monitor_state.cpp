// The monitor's global state, its stop switch and the refresh request.
#include "monitor/monitor_state.h"

#include <atomic>
#include <initializer_list>

#include "monitor/state_lock.h"
#include "monitor/stop_request.h"

MonitorState monitorState;
MonitorHooks monitorHooks;
std::atomic<bool> monitorStopRequested{false};

void RequestRefresh() {
  StateLock lock;
  monitorState.refreshRequests += 1;
  monitorState.burstRequested = 1;
  monitorState.gaugePassRequested = 1;
  monitorState.sleepPassRequested = 1;
}

void StopMonitor() {
  monitorStopRequested = true;
  // Runs on console-control and service-control threads while the monitor
  // creates and closes these handles, hence the atomic reads.
  for (HANDLE* field :
       {&monitorState.uiStopEvent, &monitorState.pipeStopEvent, &monitorState.stopEvent}) {
    const HANDLE event = std::atomic_ref<HANDLE>(*field).load();
    if (event != nullptr) SetEvent(event);
  }
}
