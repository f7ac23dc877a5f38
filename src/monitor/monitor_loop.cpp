// RunMonitor: start-up, the once-a-second loop, and the teardown.
#include <atomic>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <initializer_list>

#include "discovery/channel_scan.h"
#include "monitor/channel_workers.h"
#include "monitor/monitor_state.h"
#include "monitor/null_dacl.h"
#include "monitor/rescan.h"
#include "monitor/state_lock.h"
#include "monitor/stop_request.h"
#include "pipe/pipe_server.h"
#include "service/service_main.h"
#include "transport/drive_features.h"
#include "transport/io_block.h"
#include "transport/status_pages.h"

namespace {

constexpr DWORD kTickWrap = 3000;
constexpr DWORD kPassMs = 1000;
constexpr DWORD kPauseLimit = 60;

// Handles that StopMonitor reads from other threads are stored atomically.
void StoreShared(HANDLE* field, HANDLE value) {
  std::atomic_ref<HANDLE>(*field).store(value);
}

void CloseIfOpen(HANDLE* field) {
  if (*field != nullptr) {
    const HANDLE handle = *field;
    StoreShared(field, nullptr);
    CloseHandle(handle);
  }
}

DWORD ClassifyOs() {
  const DWORD version = GetVersion();
  const DWORD major = version & 0xFF;
  const DWORD minor = (version >> 8) & 0xFF;
  if (major == 5 && minor == 0) return kOsWindows2000;
  if (major == 4 && minor == 90) return kOsMe;
  if (major == 4 && minor < 90) return kOs9x;
  return kOsXpOrLater;
}

// Stores an event that StopMonitor signals; a stop that came before the
// event existed signals it at once.
void StoreStopSignal(HANDLE* field, HANDLE event) {
  StoreShared(field, event);
  if (event != nullptr && monitorStopRequested) SetEvent(event);
}

// Everything is reset; the handles from stopEvent to stateMutex, which other
// threads read atomically, are stored atomically and left out of the copy.
void ResetMonitorState() {
  static_assert(offsetof(MonitorState, stateMutex) ==
                offsetof(MonitorState, stopEvent) + 4 * sizeof(HANDLE));
  for (HANDLE* field :
       {&monitorState.stopEvent, &monitorState.workerStopEvent, &monitorState.pipeStopEvent,
        &monitorState.uiStopEvent, &monitorState.stateMutex}) {
    StoreShared(field, nullptr);
  }
  const MonitorState fresh{};
  auto* to = reinterpret_cast<unsigned char*>(&monitorState);
  const auto* from = reinterpret_cast<const unsigned char*>(&fresh);
  const std::size_t first = offsetof(MonitorState, stopEvent);
  const std::size_t last = offsetof(MonitorState, stateMutex) + sizeof(HANDLE);
  std::memcpy(to, from, first);
  std::memcpy(to + last, from + last, sizeof(MonitorState) - last);
  monitorState.tick = 1;
  monitorState.burstCounter = 1;
  monitorState.osKind = kOsXpOrLater;
  ResetWorkerState();
}

// Sleeps one pass; a stop cuts the sleep short (it is noticed at the top of
// the next pass either way).
void SleepPass() {
  WaitForSingleObject(monitorState.stopEvent, kPassMs);
}

void AfterPass(PassKind kind) {
  if (monitorHooks.afterPass != nullptr) monitorHooks.afterPass(kind);
}

// Reads the sleep state of every polled drive (mutex held).
void SleepStatePass(StateBlock* block) {
  MonitorState& m = monitorState;
  if (m.tick % 30 != 0 && m.sleepPassRequested == 0 && m.sleepRepeat == 0) return;
  m.sleepPassRequested = 0;
  m.sleepRepeat = 0;
  const int count = block->driveCount < kMaxDrives ? block->driveCount : kMaxDrives;
  for (int i = 0; i < count; ++i) {
    DriveRecord& drive = block->drives[i];
    if (drive.extendedIdentity == 0) continue;
    BYTE page[5];
    drive.powerState = ReadSleepState(&drive, page, m.stopEvent);
    if (drive.powerState != 0 && drive.powerState != 3) m.sleepRepeat = 1;
  }
}

// Reads the status page of every polled drive, on schedule or in a burst
// (mutex held).
void StatusPass(StateBlock* block) {
  MonitorState& m = monitorState;
  if (m.rescanInProgress != 0 || block->publishedCount < 1) return;
  const bool inBurst = m.burstCounter >= 1 && m.burstCounter <= 15;
  if (m.tick % 5 != 0 && m.burstRequested == 0 && !inBurst && m.statusRepeat == 0) return;
  m.statusRepeat = 0;
  bool advance = m.burstCounter >= 1;
  if (m.burstRequested != 0) {
    m.burstRequested = 0;
    m.burstCounter = 1;
    advance = true;
  }
  if (advance) {
    m.burstCounter += 1;
    if (m.burstCounter >= 15) m.burstCounter = 0;
  }
  const int count = block->driveCount < kMaxDrives ? block->driveCount : kMaxDrives;
  for (int i = 0; i < count; ++i) {
    DriveRecord& drive = block->drives[i];
    if (drive.extendedIdentity == 0) continue;
    const LONG p = drive.publishedIndex;
    BYTE page[8] = {};
    const DWORD code = ReadDriveStatus(&drive, page, m.stopEvent);
    const LONG level = page[0] == 0x82 ? (page[4] >> 6) & 0x03 : -1;
    drive.statusCode = code;
    drive.statusLevel = level;
    // A drive that is not published keeps index 0 from its enumeration:
    // only the copy made from this very record is updated.
    if (p >= 0 && p < block->publishedCount && block->published[p].recordIndex == i) {
      block->published[p].statusCode = code;
      block->published[p].statusLevel = level;
    }
    if (code != 0 && code != 2) m.statusRepeat = 1;
  }
}

// One pass of the loop; returns how it ended.
PassKind RunPass() {
  MonitorState& m = monitorState;
  StateBlock* block = m.stateBlock;
  PublishStateBlock(nullptr, m.tick % 5 == 0);
  if (!TakeStateMutex(m.stateMutex)) return PassKind::Skipped;  // kept past a stop
  m.passCount += 1;
  if (m.paused != 0) {
    m.pauseTicks += 1;
    if (m.pauseTicks >= kPauseLimit) {
      m.paused = 0;
      m.pauseTicks = 0;
      RequestRefresh();
    }
    SleepPass();
    ReleaseMutex(m.stateMutex);
    return PassKind::Paused;
  }
  if (m.skipTicks > 0) {
    m.skipTicks -= 1;
    SleepPass();
    ReleaseMutex(m.stateMutex);
    return PassKind::Skipped;
  }
  if (m.deviceChangePending != 0 || m.driveListStale != 0) {
    m.deviceChangePending = 0;
    m.driveListStale = 0;
    RequestRefresh();
    ReleaseMutex(m.stateMutex);
    return PassKind::DeviceChange;
  }
  if (m.tick % 30 == 0 || m.gaugePassRequested != 0) {
    m.gaugePassRequested = 0;
    for (int i = 0; i < block->channelCount && i < kMaxChannels; ++i)
      RefreshChannelGauge(i, m.stopEvent);
  }
  if (m.workersRestartRequested != 0) {
    m.workersRestartRequested = 0;
    ReleaseMutex(m.stateMutex);
    RestartWorkers();
    return PassKind::WorkersRestart;
  }
  if (m.removalCheckRequested != 0) {
    m.removalCheckRequested = 0;
    m.gaugePassRequested = 1;
    ReleaseMutex(m.stateMutex);
    // paused is read under the mutex: it is the pipe thread's to change.
    bool paused;
    {
      StateLock lock;
      paused = m.paused != 0;
    }
    if (!paused) {
      CheckRemovedDrives();
      RequestRefresh();
    }
    return PassKind::RemovalCheck;
  }

  SleepStatePass(block);
  StatusPass(block);
  ReleaseMutex(m.stateMutex);
  bool rescanDue = false;
  if (!TakeStateMutex(m.stateMutex)) return PassKind::Skipped;  // kept past a stop
  if (m.refreshRequests > 0) {
    m.refreshRequests = 0;
    block->statusWord = kStatusRescanStarting;
    m.publishNeeded = 1;
    rescanDue = true;
  }
  ReleaseMutex(m.stateMutex);
  PublishStateBlock(nullptr, false);
  if (rescanDue) QuiesceAndRescan();
  {
    StateLock lock;
    m.tick = m.tick >= kTickWrap ? 1 : m.tick + 1;
    m.regularTickCount += 1;
  }
  SleepPass();
  return PassKind::Regular;
}

// Allocates the block and creates every object in start-up order; false at
// the first failure (the teardown then closes what exists). `*started` tells
// whether the session's start succeeded.
bool StartUp(NullDaclSecurity* security, const MonitorSession* session, bool* started) {
  MonitorState& m = monitorState;
  m.stateBlock = static_cast<StateBlock*>(std::calloc(1, sizeof(StateBlock)));
  if (m.stateBlock == nullptr) return false;
  ReportServiceStatus(SERVICE_START_PENDING, 0, 3000);
  StoreStopSignal(&m.stopEvent, CreateEventW(nullptr, TRUE, FALSE, nullptr));
  if (m.stopEvent == nullptr) return false;
  m.workerStopEvent = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  if (m.workerStopEvent == nullptr) return false;
  for (ChannelRecord& channel : m.stateBlock->channels) {
    channel.readyEvent = CreateEventW(nullptr, FALSE, FALSE, nullptr);
    if (channel.readyEvent == nullptr) return false;
  }
  if (!InitNullDaclSecurity(security)) return false;
  StoreStopSignal(&m.uiStopEvent,
                  CreateEventW(&security->attributes, FALSE, FALSE, kUiStopEventName));
  if (m.uiStopEvent == nullptr) return false;
  StoreShared(&m.stateMutex, CreateMutexW(&security->attributes, FALSE, kStateMutexName));
  if (m.stateMutex == nullptr) return false;
  m.fileMapping = OpenStateMapping(&security->attributes);
  if (m.fileMapping == nullptr) return false;
  // Manual reset: it also aborts command 9's transfers, which must not
  // consume it.
  StoreStopSignal(&m.pipeStopEvent, CreateEventW(nullptr, TRUE, FALSE, nullptr));
  if (m.pipeStopEvent == nullptr) return false;
  if (session != nullptr && session->started != nullptr && !session->started()) return false;
  *started = true;
  ReportServiceStatus(SERVICE_RUNNING, 0, 0);
  // Default security: no other account may open the thread.
  m.pipeThread = CreateThread(nullptr, 0, PipeServerThread, nullptr, 0, nullptr);
  return m.pipeThread != nullptr;
}

void StopPipeServer() {
  MonitorState& m = monitorState;
  if (m.pipeStopEvent != nullptr) SetEvent(m.pipeStopEvent);
  if (m.pipeThread != nullptr) {
    WaitForSingleObject(m.pipeThread, INFINITE);
    CloseHandle(m.pipeThread);
    m.pipeThread = nullptr;
  }
  CloseIfOpen(&m.pipeStopEvent);
}

void TearDown(const MonitorSession* session, bool started) {
  MonitorState& m = monitorState;
  // Only after a failed start-up can the pipe server still be running.
  StopPipeServer();
  if (started && session != nullptr && session->ending != nullptr) session->ending();
  if (m.stateBlock != nullptr) {
    StopWorkers();
    for (ChannelRecord& channel : m.stateBlock->channels) {
      if (channel.readyEvent != nullptr) CloseHandle(channel.readyEvent);
      channel.readyEvent = nullptr;
    }
  }
  // With the workers gone, requests set aside that have completed since are
  // freed; one still pending stays to the end of the process.
  FreeSetAsideIoBlocks();
  CloseIfOpen(&m.workerStopEvent);
  CloseIfOpen(&m.uiStopEvent);
  CloseIfOpen(&m.stopEvent);
  CloseIfOpen(&m.stateMutex);
  CloseStateMapping();
  std::free(m.stateBlock);
  m.stateBlock = nullptr;
}

}  // namespace

void RunMonitor(int, LPWSTR*, const MonitorSession* session) {
  ResetMonitorState();
  stateMutexKept = false;
  NullDaclSecurity security;
  bool started = false;
  if (StartUp(&security, session, &started)) {
    MonitorState& m = monitorState;
    m.osKind = ClassifyOs();
    PublishStateBlock(nullptr, true);
    RescanDrives();
    while (WaitForSingleObject(m.stopEvent, 0) != WAIT_OBJECT_0) AfterPass(RunPass());

    ReportServiceStatus(SERVICE_STOP_PENDING, 0, 0);
    // The pipe thread ends first, so that no command publishes after the
    // final 500.
    StopPipeServer();
    {
      // One hold for both: a worker whose removal the stop cut short must
      // not put its 600 + n between the 500 and its publish.
      StateLock lock;
      if (lock.Owned()) {
        m.stateBlock->statusWord = kStatusStopping;
        PublishStateBlock(nullptr, true);
      }
    }
  }
  TearDown(session, started);
  monitorStopRequested = false;
}
