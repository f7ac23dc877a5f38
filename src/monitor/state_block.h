// The shared state block: everything the service knows about the attached
// drives, in one flat block of 1,215,512 bytes that the service copies whole
// into the global file mapping "Global\SkyvaneFileMap".
//
// A user-interface application may include this header. To read the block:
// open the mapping and the mutex by the names below (or create them, the
// service accepts objects that already exist), wait on the mutex without
// time-out, copy or read the mapped view, release the mutex. The service
// increments `sequence` immediately before every copy, so a reader sees a
// whole block from one publish. Handle fields inside the records are the
// service's own and are opaque to other processes.
#pragma once

#include <cstddef>
#include <cstdint>

#include "discovery/drive_record.h"
#include "platform/win32.h"
#include "transport/channel_record.h"

constexpr int kMaxDrives = 64;
constexpr int kMaxChannels = 64;

// Values of StateBlock::statusWord.
constexpr DWORD kStatusUncountedDrive = 100;     // an attached drive is not of a channel model
constexpr DWORD kStatusRescanStarting = 101;     // a full rescan is about to start
constexpr DWORD kStatusRescanDone = 102;         // rescan finished, workers stopped, or command 2/3
constexpr DWORD kStatusStopping = 500;           // the service is stopping
constexpr DWORD kStatusRemovalFailedBase = 600;  // plus the drive index: safe removal failed

// Names of the shared kernel objects (all created with a null DACL).
#define SKYVANE_FILE_MAP_NAME WSTR("Global\\SkyvaneFileMap")
#define SKYVANE_MUTEX_NAME WSTR("Global\\SkyvaneMutex")
#define SKYVANE_UI_STOP_EVENT_NAME WSTR("Global\\SkyvaneUIStopEvent")
inline constexpr const WCHAR* kFileMapName = SKYVANE_FILE_MAP_NAME;
inline constexpr const WCHAR* kStateMutexName = SKYVANE_MUTEX_NAME;
inline constexpr const WCHAR* kUiStopEventName = SKYVANE_UI_STOP_EVENT_NAME;

struct StateBlock {
  DWORD sequence;      // incremented before every copy into the mapping
  LONG channelCount;   // channel records in use, 0 to 64
  LONG driveCount;     // drive records in use
  LONG countedDrives;  // drives whose parent matches the channel-model list
  DriveRecord drives[kMaxDrives];
  ChannelRecord channels[kMaxChannels];
  DriveRecord published[kMaxDrives];
  LONG publishedCount;
  DWORD statusWord;
};

constexpr DWORD kStateBlockSize = 1215512;

static_assert(sizeof(StateBlock) == kStateBlockSize);
static_assert(offsetof(StateBlock, sequence) == 0);
static_assert(offsetof(StateBlock, channelCount) == 4);
static_assert(offsetof(StateBlock, driveCount) == 8);
static_assert(offsetof(StateBlock, countedDrives) == 12);
static_assert(offsetof(StateBlock, drives) == 16);
static_assert(offsetof(StateBlock, channels) == 488976);
static_assert(offsetof(StateBlock, published) == 726544);
static_assert(offsetof(StateBlock, publishedCount) == 1215504);
static_assert(offsetof(StateBlock, statusWord) == 1215508);
