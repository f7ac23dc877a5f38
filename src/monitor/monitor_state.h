// The monitor's process-wide state: request flags, counters, the kernel
// objects it owns and the working copy of the state block. One instance,
// reset at every start of RunMonitor so that the service can run many times
// in one process. The flags are 32-bit integers used as Booleans and are read
// and written with the state mutex held.
#pragma once

#include <cstdint>

#include "monitor/state_block.h"
#include "platform/win32.h"

// osKind values.
constexpr DWORD kOsWindows2000 = 0;
constexpr DWORD kOsXpOrLater = 1;
constexpr DWORD kOsMe = 2;
constexpr DWORD kOs9x = 3;

struct MonitorState {
  DWORD tick;                     // 1 to 3000; advances at the end of a regular tick
  DWORD burstCounter;             // position in a status-polling burst; 0 = none
  DWORD sleepRepeat;              // last sleep pass saw a drive in a changing state
  DWORD statusRepeat;             // last status pass saw a status code other than 0 and 2
  DWORD refreshRequests;          // full rescans requested since the last one started
  DWORD burstRequested;           // start a status burst at the next status pass
  DWORD gaugePassRequested;       // run the capacity-gauge pass at the next tick
  DWORD sleepPassRequested;       // run the sleep-state pass at the next regular tick
  DWORD deviceChangePending;      // a device change needs a rescan at once
  DWORD driveListStale;           // drive records no longer match the system
  DWORD workersRestartRequested;  // restart the channel workers
  DWORD removalCheckRequested;    // check which channels lost their drive
  DWORD paused;                   // polling paused by the user-interface application
  DWORD pauseTicks;               // passes spent paused
  DWORD skipTicks;                // passes still to idle
  DWORD rescanInProgress;         // a full rescan runs
  DWORD osKind;                   // kOsWindows2000 ... kOs9x
  DWORD publishNeeded;            // the block changed since the last publish
  DWORD mappingTooSmall;          // the named mapping cannot hold the block (logged once)

  HANDLE stopEvent;        // manual-reset; StopMonitor
  HANDLE workerStopEvent;  // manual-reset; stops the workers, aborts their I/O
  HANDLE pipeStopEvent;    // manual-reset; stops the pipe server thread and aborts its transfers
  HANDLE uiStopEvent;      // "Global\SkyvaneUIStopEvent"
  HANDLE stateMutex;       // "Global\SkyvaneMutex"
  HANDLE fileMapping;      // "Global\SkyvaneFileMap"
  HANDLE pipeThread;

  StateBlock* stateBlock;  // the working copy; null outside RunMonitor
  void* mappingView;       // the writable view of fileMapping, kept from its creation

  // Observation counters, written under the mutex: loop passes begun,
  // regular ticks completed, rescans completed, copies into the mapping.
  DWORD passCount;
  DWORD regularTickCount;
  DWORD rescanCount;
  DWORD publishCount;
};

extern MonitorState monitorState;

// How a loop pass ended, for the observer hook.
enum class PassKind { Paused, Skipped, DeviceChange, WorkersRestart, RemovalCheck, Regular };

// Hooks for tests; not reset by RunMonitor. afterPass runs on the monitor
// thread at the end of every pass, with the mutex released; afterPublish runs
// after every copy into the mapping, with the mutex held.
struct MonitorHooks {
  void (*afterPass)(PassKind kind);
  void (*afterPublish)(const StateBlock* block);
};
extern MonitorHooks monitorHooks;

// Copies the working copy into the mapping when publishNeeded is set or force
// is true, incrementing sequence first; the row references of every drive
// record in the copy are zero. A null mapping is the service's own named
// mapping, written through the view it keeps; it is opened again while it is
// too small to hold the block.
void PublishStateBlock(HANDLE mapping, bool force);
// Creates or opens the named mapping; logs an event when an existing one is
// too small to hold the block.
HANDLE OpenStateMapping(SECURITY_ATTRIBUTES* attributes);
// Unmaps the kept view and closes the service's own mapping.
void CloseStateMapping();
// Rebuilds published and publishedCount from drives (mutex held).
void BuildPublishedList(StateBlock* block);
// Marks a full rescan as wanted (burst, gauge and sleep passes with it).
void RequestRefresh();
// What the host does around the run: `started` once the state is initialised
// and every shared object exists, before the service reports running (false
// ends the run); `ending` after the loop and the pipe server have ended and
// before any object is closed (only when `started` succeeded). Either may be
// null.
struct MonitorSession {
  bool (*started)();
  void (*ending)();
};
// The service's work: runs until StopMonitor; the arguments are not used. A
// stop asked for before the run began ends it at once.
void RunMonitor(int argc, LPWSTR* argv, const MonitorSession* session = nullptr);
// Signals the UI stop event, the pipe stop event and the stop event (each if
// it exists). Safe to call from any thread.
void StopMonitor();
