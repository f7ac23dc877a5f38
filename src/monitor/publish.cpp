// Copying the working copy into the shared mapping, and the published list.
#include <cstring>

#include "monitor/monitor_state.h"
#include "monitor/state_lock.h"
#include "transport/status_pages.h"

void PublishStateBlock(HANDLE mapping, bool force) {
  StateLock lock;
  StateBlock* block = monitorState.stateBlock;
  if (block == nullptr || (monitorState.publishNeeded == 0 && !force)) return;
  monitorState.publishNeeded = 0;
  void* view = MapViewOfFile(mapping, FILE_MAP_WRITE, 0, 0, kStateBlockSize);
  if (view == nullptr) return;  // the next forced publish carries the change
  block->sequence += 1;
  std::memcpy(view, block, kStateBlockSize);
  UnmapViewOfFile(view);
  monitorState.publishCount += 1;
  if (monitorHooks.afterPublish != nullptr) monitorHooks.afterPublish(block);
}

// A drive is published only with an allowed status code and, unless it was
// made from a channel, a valid nibble byte and all four identity strings.
static bool Publishable(const DriveRecord& drive, DWORD statusCode) {
  if (statusCode == 4 || statusCode > 8) return false;
  if (drive.fromChannel == 1) return true;
  if ((drive.statusNibbleByte & 0x0F) >= 10) return false;
  return drive.firmwareSerial[0] != 0 && drive.model[0] != 0 && drive.friendlyName[0] != 0 &&
         drive.serialNumber[0] != 0;
}

void BuildPublishedList(StateBlock* block) {
  block->publishedCount = 0;
  std::memset(block->published, 0, sizeof(block->published));
  const int count = block->driveCount < kMaxDrives ? block->driveCount : kMaxDrives;
  for (int i = 0; i < count; ++i) {
    DriveRecord& drive = block->drives[i];
    if (drive.extendedIdentity == 0) continue;
    BYTE page[8];
    const DWORD statusCode = ReadDriveStatus(&drive, page);
    drive.statusCode = statusCode;
    if (page[0] != 0x82) {
      drive.statusLevel = -1;
      continue;
    }
    drive.statusLevel = (page[4] >> 6) & 0x03;
    if (!Publishable(drive, statusCode)) continue;
    const LONG index = block->publishedCount;
    block->published[index] = drive;
    block->published[index].publishedIndex = 0;
    drive.publishedIndex = index;
    block->publishedCount = index + 1;
  }
}
