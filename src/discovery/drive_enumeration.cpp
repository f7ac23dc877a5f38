// Enumeration of the maker's drives: every present disk interface whose path
// names the maker's USB or IEEE 1394 drive is opened, identified with SCSI
// commands and the model table, and filled into the next drive record.
#include "discovery/drive_enumeration.h"

#include <cstring>

#include "discovery/control_interface.h"
#include "discovery/device_interfaces.h"
#include "discovery/disk_number.h"
#include "discovery/model_table.h"
#include "discovery/vendor_pages.h"
#include "monitor/monitor_state.h"
#include "platform/wide.h"
#include "service/interface_classes.h"
#include "transport/pass_through.h"

namespace {

// The disk numbers read, per working record, and the block they belong to.
struct DiskNumbersRead {
  const StateBlock* block = nullptr;
  bool read[kMaxDrives] = {};
};
DiskNumbersRead diskNumbersRead;

constexpr LONG kCountedDriveLimit = kMaxDrives - 1;  // the 64th slot is scratch
constexpr DWORD kBusUsb = 2;
constexpr DWORD kBusIeee1394 = 3;

// Closes the disk handle on every path out of a candidate.
class DiskHandle {
 public:
  explicit DiskHandle(HANDLE handle) : handle_(handle) {}
  ~DiskHandle() {
    if (Valid()) CloseHandle(handle_);
  }
  DiskHandle(const DiskHandle&) = delete;
  DiskHandle& operator=(const DiskHandle&) = delete;
  bool Valid() const { return handle_ != INVALID_HANDLE_VALUE && handle_ != nullptr; }
  HANDLE Get() const { return handle_; }

 private:
  HANDLE handle_;
};

// busKind of a disk interface path, or 0 when it is not one of the maker's.
DWORD ClassifyDiskPath(const WCHAR* path) {
  if (WideContains(path, WSTR("usbstor")) && WideContains(path, WSTR("qx")) &&
      WideContains(path, WSTR("disk"))) {
    return kBusUsb;
  }
  if (WideContains(path, WSTR("sbp2")) &&
      (WideContains(path, WSTR("qx")) || WideContains(path, WSTR("orvanel"))) &&
      (WideContains(path, WSTR("external")) || WideContains(path, WSTR("quarry")) ||
       WideContains(path, WSTR("rambler")))) {
    return kBusIeee1394;
  }
  return 0;
}

// The serial key of a disk's instance tail, as the control interfaces carry it.
void DeriveSerialKey(const WCHAR* tail, WCHAR* key, std::size_t capacity) {
  const WideView text(tail, WideLength(tail));
  WideView part = text;
  if (!WideContains(tail, WSTR("SBP2"))) {
    const std::size_t last = text.rfind(WSTR('&'));
    if (last != WideView::npos) {
      const std::size_t previous = last == 0 ? WideView::npos : text.rfind(WSTR('&'), last - 1);
      part = previous == WideView::npos ? text.substr(0, last)
                                        : text.substr(previous + 1, last - previous - 1);
    }
  } else {
    part = text.substr(WideAfterLast(tail, WSTR('\\')));
  }
  WideCopy(key, capacity, part);
}

// "vendor product", each field trimmed.
void JoinVendorProduct(WCHAR* model, std::size_t capacity, const BYTE* inquiry) {
  WCHAR vendor[9] = {};
  WCHAR product[17] = {};
  CopyAsciiToWide(vendor, 9, inquiry + 8, 8);
  CopyAsciiToWide(product, 17, inquiry + 16, 16);
  WideTrim(vendor);
  WideTrim(product);
  std::memset(model, 0, capacity * sizeof(WCHAR));
  WideCopy(model, capacity, vendor);
  WideAppend(model, capacity, WSTR(" "));
  WideAppend(model, capacity, WideView(product, WideLength(product)));
}

// Zeroes what in-place editing (trimming, removals) left behind a text
// field's terminator, so that no stale characters travel in the record.
template <std::size_t N>
void ZeroAfterText(WCHAR (&field)[N]) {
  const std::size_t length = WideLength(field, N);
  std::memset(field + length, 0, (N - length) * sizeof(WCHAR));
}

void CopyRow(DriveRecord* slot, const ModelRow& row) {
  slot->modelSuffixRef = row.suffix;
  slot->modelFlags = row.flags;
  slot->gaugeSegments = row.gaugeSegments;
  slot->productLineRef = row.productLine;
}

// The identity part of a candidate (steps from the standard INQUIRY on);
// false when the disk does not answer as a drive of the maker may.
bool IdentifyDisk(HANDLE disk, DriveRecord* slot, HANDLE cancelEvent) {
  BYTE inquiry[kInquiryLength] = {};
  if (ScsiInquiry(disk, inquiry, cancelEvent) != ERROR_SUCCESS || inquiry[4] < 32) return false;

  CopyAsciiToWide(slot->model, 128, inquiry + 58, 16);
  if (!WideContains(slot->model, WSTR("QX"))) JoinVendorProduct(slot->model, 128, inquiry);

  WCHAR modelKey[5] = {};
  CopyAsciiToWide(modelKey, 5, inquiry + 36, 4);
  WideRemoveAll(modelKey, WSTR(" "));
  ModelRow row{};
  if (LookupModelRow(modelKey, &row)) {
    CopyRow(slot, row);
    if (row.productLine != nullptr && row.productLine[0] != 0 &&
        !WideContains(slot->friendlyName, row.productLine)) {
      std::memset(slot->friendlyName, 0, sizeof(slot->friendlyName));
      WideCopy(slot->friendlyName, 256, row.productLine);
    }
  }

  BYTE identity[20] = {};
  ScsiInquiryPage(disk, 0xC0, identity, sizeof(identity), cancelEvent);
  const bool rcs =
      identity[1] == 0xC0 && identity[16] == 'R' && identity[17] == 'C' && identity[18] == 'S';
  slot->extendedIdentity = (rcs || (slot->modelFlags & kModelFlagExtendedIdentity) != 0) ? 1 : 0;
  slot->fromChannel = 0;

  const bool makerVendor = inquiry[8] == 'Q' && inquiry[9] == 'X';
  if (!makerVendor && !WideContains(slot->model, WSTR("QX"))) {
    std::memset(slot->model, 0, sizeof(slot->model));
    CopyAsciiToWide(slot->model, 128, inquiry + 16, 16);
    CopyAsciiToWide(slot->firmwareSerial, 128, inquiry + 32, 4);
    return true;
  }

  const bool extended = slot->extendedIdentity != 0;
  CopyAsciiToWide(slot->firmwareSerial, 128, inquiry + 40, 18);
  if (extended) slot->firmwareSerial[16] = 0;
  WideTrim(slot->firmwareSerial);
  ZeroAfterText(slot->firmwareSerial);
  if (extended) slot->firmwareSerial[16] = 0;

  if (extended) {
    JoinVendorProduct(slot->model, 128, inquiry);
    CopyAsciiToWide(slot->serialNumber, 256, inquiry + 40, 16);
    WideTrim(slot->serialNumber);
    WideRemoveAll(slot->serialNumber, WSTR("QX-"));
    ZeroAfterText(slot->serialNumber);
    if (slot->serialNumber[0] == 0) WideCopy(slot->serialNumber, 256, WSTR("NA"));
    CopyAsciiToWide(slot->modelCode, 256, inquiry + 36, 4);
    CopyAsciiToWide(slot->revision, 8, inquiry + 32, 4);
    slot->peripheralType = static_cast<BYTE>(inquiry[0] & 0x1F);
    DWORD lastLba = 0;
    DWORD blockLength = 0;
    slot->lastLba =
        ScsiReadCapacity(disk, &lastLba, &blockLength, cancelEvent) == ERROR_SUCCESS ? lastLba : 0;
    ReadVendorPages(disk, slot);
  }
  return true;
}

// Examines one disk interface into the slot; true when it was accepted.
bool ReadCandidate(HDEVINFO list, const WideString& path, SP_DEVINFO_DATA* devInfo, LONG count,
                   DriveRecord* slot, HANDLE cancelEvent, bool* counted, bool* numbered) {
  const DWORD busKind = ClassifyDiskPath(path.c_str());
  if (busKind == 0) return false;
  slot->busKind = busKind;

  DWORD address = 0;
  slot->busAddress =
      SetupDiGetDeviceRegistryPropertyW(list, devInfo, SPDRP_ADDRESS, nullptr,
                                        reinterpret_cast<PBYTE>(&address), sizeof(address), nullptr)
          ? address
          : 0xFFFFFFFF;

  WCHAR name[257] = {};
  const bool nameRead =
      SetupDiGetDeviceRegistryPropertyW(list, devInfo, SPDRP_FRIENDLYNAME, nullptr,
                                        reinterpret_cast<PBYTE>(name), 512, nullptr) != FALSE;
  if (!nameRead) name[0] = 0;
  WCHAR id[257] = {};
  if (nameRead && SetupDiGetDeviceInstanceIdW(list, devInfo, id, 256, nullptr)) {
    WideCopy(slot->deviceIdLower, 256, id);
    WideToLower(slot->deviceIdLower);
    const WCHAR* tail = id + WideAfterLast(id, WSTR('\\'));
    WideCopy(slot->instanceTail, 128, tail);
    WideCopy(slot->instanceKey, 128, tail);
  }

  if (monitorState.osKind == kOsWindows2000) {
    WCHAR key[128] = {};
    DeriveSerialKey(slot->instanceTail, key, 128);
    FindControlInterfacePath(kVendorClassC, key, slot->controlPath, 256);
  }

  WideCopy(slot->diskPath, 256, path);

  if (busKind == kBusIeee1394 && WideView(name, WideLength(name)).starts_with(WSTR("QX      "))) {
    WideString shortened(name, WideLength(name));
    shortened.erase(2, 6);
    WideCopy(name, 257, shortened);
  }
  WideCopy(slot->friendlyName, 256, name);

  DiskHandle disk(CreateFileW(path.c_str(), GENERIC_READ | GENERIC_WRITE,
                              FILE_SHARE_READ | FILE_SHARE_WRITE, nullptr, OPEN_EXISTING,
                              FILE_FLAG_OVERLAPPED, nullptr));
  if (!disk.Valid()) return false;

  STORAGE_DEVICE_NUMBER number{};
  DWORD bytes = 0;
  const bool numberRead = IoControlWait(disk.Get(), IOCTL_STORAGE_GET_DEVICE_NUMBER, nullptr, 0,
                                        &number, sizeof(number), &bytes, cancelEvent) &&
                          bytes >= sizeof(number);
  slot->diskNumber = numberRead ? number.DeviceNumber : kUnknownDiskNumber;
  *numbered = numberRead;
  slot->volumeCount = 0;

  if (!IdentifyDisk(disk.Get(), slot, cancelEvent)) return false;

  slot->recordIndex = count;
  WideString hex;
  for (std::size_t i = 0; slot->firmwareSerial[i] != 0; ++i)
    WideAppendHex(hex, slot->firmwareSerial[i], 2);
  WideCopy(slot->firmwareSerialHex, 128, hex);
  WideCopy(slot->deviceIdUpper, 256, slot->deviceIdLower);
  WideToUpper(slot->deviceIdUpper);

  DEVINST parent = 0;
  if (CM_Get_Parent(&parent, devInfo->DevInst, 0) == CR_SUCCESS &&
      ReadNodeInstanceId(parent, slot->parentDeviceId, 256)) {
    if (busKind == kBusUsb) {
      ModelRow row{};
      if (!LookupModelRow(slot->parentDeviceId, &row)) return false;
      CopyRow(slot, row);
    }
  }
  *counted = IsChannelModel(slot->parentDeviceId);
  return true;
}

}  // namespace

void SetDiskNumberRead(LONG index, bool read) {
  if (index < 0 || index >= kMaxDrives) return;
  if (diskNumbersRead.block != monitorState.stateBlock) {
    diskNumbersRead = DiskNumbersRead{};
    diskNumbersRead.block = monitorState.stateBlock;
  }
  diskNumbersRead.read[index] = read;
}

bool DiskNumberRead(LONG index) {
  return index >= 0 && index < kMaxDrives && diskNumbersRead.block == monitorState.stateBlock &&
         diskNumbersRead.read[index];
}

LONG EnumerateDrives(HANDLE cancelEvent) {
  StateBlock* block = monitorState.stateBlock;
  if (block == nullptr) return -1;
  std::memset(block->drives, 0, sizeof(block->drives));
  std::memset(block->published, 0, sizeof(block->published));
  block->driveCount = 0;
  block->countedDrives = 0;
  block->publishedCount = 0;
  for (LONG i = 0; i < kMaxDrives; ++i) SetDiskNumberRead(i, false);

  InterfaceList list(kDiskInterfaceClass);
  if (!list.Opened()) return kEnumerationFailed;
  LONG result = -1;
  WideString path;
  for (DWORD index = 0;; ++index) {
    SP_DEVINFO_DATA devInfo{};
    const InterfaceList::Fetch fetch = list.Member(index, &path, &devInfo);
    if (fetch == InterfaceList::Fetch::End) break;
    if (fetch == InterfaceList::Fetch::Skip) continue;
    // The candidate is read into a record of its own: nothing of a rejected
    // disk shows anywhere, and the 64th slot keeps the last one accepted.
    const LONG count = block->driveCount;
    DriveRecord candidate{};
    bool counted = false;
    bool numbered = false;
    if (!ReadCandidate(list.Get(), path, &devInfo, count, &candidate, cancelEvent, &counted,
                       &numbered))
      continue;
    block->drives[count] = candidate;
    SetDiskNumberRead(count, numbered);
    if (counted) block->countedDrives += 1;
    if (block->driveCount < kCountedDriveLimit) block->driveCount += 1;
    result = 0;
  }
  return result;
}
