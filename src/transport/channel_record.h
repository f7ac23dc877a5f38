// One control channel of a drive (HID collection, button filter driver
// interface or IEEE 1394 enclosure), as kept in the state block's channel
// array. The layout is read by the user-interface application; the handle
// fields mean something only inside the service.
#pragma once

#include <cstddef>
#include <cstdint>

#include "platform/win32.h"

// Channel kinds.
constexpr DWORD kChannelKindVendorControl =
    0;  // vendor class C interface, served as a driver channel
constexpr DWORD kChannelKindHid = 2;
constexpr DWORD kChannelKindDriver = 3;

// Channel modes: 1 and 2 select the storage-channel worker.
constexpr DWORD kChannelModePlain = 0;
constexpr DWORD kChannelModeGauge = 1;
constexpr DWORD kChannelModeEnclosure = 2;

struct ChannelRecord {
  DWORD kind;
  BYTE reserved4[4];
  LONG linkedDrive;  // index in the working drive array, -1 = none
  LONG ownIndex;     // this record's index in the channel array
  DWORD pendingPanelAction;
  DWORD mode;
  DWORD mayCreateDrive;
  DWORD gaugePercentSent;  // 0 = none yet
  DWORD lightPulseMarker;  // 120 after the event reply was sent
  WCHAR identityText[128];
  WCHAR deviceInstanceId[256];
  WCHAR instanceTail[256];
  WCHAR serialKey[128];
  BYTE volumeLetters[564];  // UTF-16 letters, at most 26, zero beyond them
  WCHAR diskPath[256];
  WCHAR devicePath[256];
  WCHAR controlPath[256];
  BYTE reserved3672[4];
  DWORD firstEventSeen;
  HANDLE deviceHandle;  // overlapped; null when closed
  HANDLE threadHandle;  // null when no worker runs
  DWORD driveGoneSent;
  BYTE reserved3700[4];
  HANDLE readyEvent;  // auto-reset; survives every clearing of the record
};

static_assert(sizeof(ChannelRecord) == 3712);
static_assert(offsetof(ChannelRecord, kind) == 0);
static_assert(offsetof(ChannelRecord, linkedDrive) == 8);
static_assert(offsetof(ChannelRecord, ownIndex) == 12);
static_assert(offsetof(ChannelRecord, pendingPanelAction) == 16);
static_assert(offsetof(ChannelRecord, mode) == 20);
static_assert(offsetof(ChannelRecord, mayCreateDrive) == 24);
static_assert(offsetof(ChannelRecord, gaugePercentSent) == 28);
static_assert(offsetof(ChannelRecord, lightPulseMarker) == 32);
static_assert(offsetof(ChannelRecord, identityText) == 36);
static_assert(offsetof(ChannelRecord, deviceInstanceId) == 292);
static_assert(offsetof(ChannelRecord, instanceTail) == 804);
static_assert(offsetof(ChannelRecord, serialKey) == 1316);
static_assert(offsetof(ChannelRecord, volumeLetters) == 1572);
static_assert(offsetof(ChannelRecord, diskPath) == 2136);
static_assert(offsetof(ChannelRecord, devicePath) == 2648);
static_assert(offsetof(ChannelRecord, controlPath) == 3160);
static_assert(offsetof(ChannelRecord, firstEventSeen) == 3676);
static_assert(offsetof(ChannelRecord, deviceHandle) == 3680);
static_assert(offsetof(ChannelRecord, threadHandle) == 3688);
static_assert(offsetof(ChannelRecord, driveGoneSent) == 3696);
static_assert(offsetof(ChannelRecord, readyEvent) == 3704);
