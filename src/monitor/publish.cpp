// Copying the working copy into the shared mapping, and the published list.
#include <cstring>

#include "monitor/monitor_state.h"
#include "monitor/null_dacl.h"
#include "monitor/state_lock.h"
#include "service/service_host.h"
#include "transport/status_pages.h"

namespace {

// Row references are addresses inside the service: no copy that leaves it
// carries them.
void ClearRowReferences(StateBlock* shared) {
  for (DriveRecord* list : {shared->drives, shared->published}) {
    for (int i = 0; i < kMaxDrives; ++i) {
      list[i].modelSuffixRef = nullptr;
      list[i].productLineRef = nullptr;
    }
  }
}

// Logs once per episode that the named mapping cannot hold the block (any
// account may create it first, and smaller).
void ReportSmallMapping() {
  if (monitorState.mappingTooSmall != 0) return;
  monitorState.mappingTooSmall = 1;
  LogServiceError(WSTR("The shared state mapping is smaller than the state block; not published."));
}

bool HoldsWholeBlock(HANDLE mapping) {
  void* view = MapViewOfFile(mapping, FILE_MAP_WRITE, 0, 0, kStateBlockSize);
  if (view == nullptr) return false;
  UnmapViewOfFile(view);
  return true;
}

HANDLE CreateStateMapping(SECURITY_ATTRIBUTES* attributes) {
  return CreateFileMappingW(INVALID_HANDLE_VALUE, attributes, PAGE_READWRITE, 0, kStateBlockSize,
                            kFileMapName);
}

// The service's own mapping could not be mapped whole: lets go of it and
// opens the name again, which gives a new mapping of the right size once the
// other owners of a planted one have closed it (mutex held).
void RemapOwnMapping() {
  NullDaclSecurity security;
  if (!InitNullDaclSecurity(&security)) return;
  if (monitorState.fileMapping != nullptr) CloseHandle(monitorState.fileMapping);
  monitorState.fileMapping = CreateStateMapping(&security.attributes);
  if (monitorState.fileMapping == nullptr) return;
  monitorState.mappingView =
      MapViewOfFile(monitorState.fileMapping, FILE_MAP_WRITE, 0, 0, kStateBlockSize);
}

// The view of the service's own mapping, mapped once and kept, so that a
// publish is one copy and its pages stay in place (mutex held). Null when the
// mapping cannot hold the block; the next publish tries again.
void* OwnView() {
  if (monitorState.mappingView == nullptr && monitorState.fileMapping != nullptr) {
    monitorState.mappingView =
        MapViewOfFile(monitorState.fileMapping, FILE_MAP_WRITE, 0, 0, kStateBlockSize);
  }
  if (monitorState.mappingView == nullptr) RemapOwnMapping();
  return monitorState.mappingView;
}

}  // namespace

void CloseStateMapping() {
  if (monitorState.mappingView != nullptr) UnmapViewOfFile(monitorState.mappingView);
  monitorState.mappingView = nullptr;
  if (monitorState.fileMapping != nullptr) CloseHandle(monitorState.fileMapping);
  monitorState.fileMapping = nullptr;
}

HANDLE OpenStateMapping(SECURITY_ATTRIBUTES* attributes) {
  const HANDLE mapping = CreateStateMapping(attributes);
  if (mapping != nullptr && !HoldsWholeBlock(mapping)) ReportSmallMapping();
  return mapping;
}

void PublishStateBlock(HANDLE mapping, bool force) {
  StateLock lock;
  StateBlock* block = monitorState.stateBlock;
  if (lock.Lost() || block == nullptr || (monitorState.publishNeeded == 0 && !force)) return;
  monitorState.publishNeeded = 0;
  const bool own = mapping == nullptr;
  void* view = own ? OwnView() : MapViewOfFile(mapping, FILE_MAP_WRITE, 0, 0, kStateBlockSize);
  if (view == nullptr && own) ReportSmallMapping();
  if (view == nullptr) return;  // the next forced publish carries the change
  if (own) monitorState.mappingTooSmall = 0;
  block->sequence += 1;
  std::memcpy(view, block, kStateBlockSize);
  ClearRowReferences(static_cast<StateBlock*>(view));
  if (!own) UnmapViewOfFile(view);
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
    const DWORD statusCode = ReadDriveStatus(&drive, page, monitorState.stopEvent);
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
