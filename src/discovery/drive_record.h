// One attached drive of the maker, as kept in the state block's working and
// published arrays. The layout is read by the user-interface application and
// carried whole in pipe replies, so every offset is fixed.
#pragma once

#include <cstddef>
#include <cstdint>

#include "platform/win32.h"

struct DriveRecord {
  DWORD busKind;          // 2 = USB mass-storage disk, 3 = IEEE 1394 (SBP-2) disk
  DWORD diskNumber;       // storage stack device number
  DWORD volumeDriveType;  // 2 removable, 3 fixed
  DWORD channelMode;      // copy of the bound channel's mode
  DWORD volumeCount;      // letters in volumeLetters
  BYTE reserved20[4];
  LONG recordIndex;    // own index in the working array
  LONG channelIndex;   // index of the bound channel record
  DWORD gaugePercent;  // capacity-used percentage last computed; 0 = none yet
  BYTE reserved36[4];
  DWORD busAddress;  // 0xFFFFFFFF when unreadable
  BYTE reserved44[4];
  // Copy of the matched model-table row; the references are meaningful only
  // inside the service.
  const WCHAR* modelSuffixRef;
  DWORD modelFlags;
  DWORD gaugeSegments;  // 0, 4 or 6
  const WCHAR* productLineRef;
  WCHAR instanceTail[128];
  WCHAR instanceKey[128];
  WCHAR firmwareSerial[128];  // the key by which pipe requests name a drive
  WCHAR firmwareSerialHex[128];
  WCHAR model[128];  // 256 bytes: the next field starts at 1352
  WCHAR deviceIdLower[256];
  WCHAR deviceIdUpper[256];
  WCHAR parentDeviceId[256];
  WCHAR volumeLetters[26];
  WCHAR friendlyName[256];
  WCHAR diskPath[256];
  WCHAR channelPath[256];
  BYTE reserved4476[4];
  DWORD extendedIdentity;  // nonzero: the monitor polls sleep state and status page
  DWORD fromChannel;       // 1: record made from a channel alone
  LONG statusLevel;        // bits 7-6 of status page byte 4, or -1
  DWORD statusCode;        // last ReadDriveStatus code
  BYTE reserved4496[4];
  BYTE peripheralType;
  BYTE reserved4501[3];
  DWORD lastLba;
  BYTE reserved4508[4];
  WCHAR controlPath[256];
  WCHAR hidPath[256];
  WCHAR asciiInfo1[256];
  WCHAR modelCode[256];
  WCHAR asciiInfo2[256];
  WCHAR serialNumber[256];
  WCHAR revision[8];
  WCHAR vendorCode[8];
  BYTE reserved7616[4];
  BYTE statusNibbleByte;  // low four bits must be below 10 to publish; never written
  BYTE reserved7621[11];
  DWORD powerState;     // last ReadSleepState result
  LONG publishedIndex;  // index of the copy in published; 0 in the copies
};

static_assert(sizeof(DriveRecord) == 7640);
static_assert(offsetof(DriveRecord, busKind) == 0);
static_assert(offsetof(DriveRecord, diskNumber) == 4);
static_assert(offsetof(DriveRecord, volumeDriveType) == 8);
static_assert(offsetof(DriveRecord, channelMode) == 12);
static_assert(offsetof(DriveRecord, volumeCount) == 16);
static_assert(offsetof(DriveRecord, recordIndex) == 24);
static_assert(offsetof(DriveRecord, channelIndex) == 28);
static_assert(offsetof(DriveRecord, gaugePercent) == 32);
static_assert(offsetof(DriveRecord, busAddress) == 40);
static_assert(offsetof(DriveRecord, modelSuffixRef) == 48);
static_assert(offsetof(DriveRecord, modelFlags) == 56);
static_assert(offsetof(DriveRecord, gaugeSegments) == 60);
static_assert(offsetof(DriveRecord, productLineRef) == 64);
static_assert(offsetof(DriveRecord, instanceTail) == 72);
static_assert(offsetof(DriveRecord, instanceKey) == 328);
static_assert(offsetof(DriveRecord, firmwareSerial) == 584);
static_assert(offsetof(DriveRecord, firmwareSerialHex) == 840);
static_assert(offsetof(DriveRecord, model) == 1096);
static_assert(offsetof(DriveRecord, deviceIdLower) == 1352);
static_assert(offsetof(DriveRecord, deviceIdUpper) == 1864);
static_assert(offsetof(DriveRecord, parentDeviceId) == 2376);
static_assert(offsetof(DriveRecord, volumeLetters) == 2888);
static_assert(offsetof(DriveRecord, friendlyName) == 2940);
static_assert(offsetof(DriveRecord, diskPath) == 3452);
static_assert(offsetof(DriveRecord, channelPath) == 3964);
static_assert(offsetof(DriveRecord, extendedIdentity) == 4480);
static_assert(offsetof(DriveRecord, fromChannel) == 4484);
static_assert(offsetof(DriveRecord, statusLevel) == 4488);
static_assert(offsetof(DriveRecord, statusCode) == 4492);
static_assert(offsetof(DriveRecord, peripheralType) == 4500);
static_assert(offsetof(DriveRecord, lastLba) == 4504);
static_assert(offsetof(DriveRecord, controlPath) == 4512);
static_assert(offsetof(DriveRecord, hidPath) == 5024);
static_assert(offsetof(DriveRecord, asciiInfo1) == 5536);
static_assert(offsetof(DriveRecord, modelCode) == 6048);
static_assert(offsetof(DriveRecord, asciiInfo2) == 6560);
static_assert(offsetof(DriveRecord, serialNumber) == 7072);
static_assert(offsetof(DriveRecord, revision) == 7584);
static_assert(offsetof(DriveRecord, vendorCode) == 7600);
static_assert(offsetof(DriveRecord, statusNibbleByte) == 7620);
static_assert(offsetof(DriveRecord, powerState) == 7632);
static_assert(offsetof(DriveRecord, publishedIndex) == 7636);
