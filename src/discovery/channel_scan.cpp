// The scan of control interfaces: the drives' HID collections, the maker's
// button filter driver interfaces and IEEE 1394 enclosures, one channel
// record each, classified into kind and mode with the keys that later tie
// the channel to its drive.
#include "discovery/channel_scan.h"

#include <cstring>
#include <initializer_list>

#include "discovery/device_interfaces.h"
#include "discovery/model_table.h"
#include "monitor/monitor_state.h"
#include "platform/wide.h"
#include "service/interface_classes.h"

namespace {

constexpr LONG kCountedChannelLimit = kMaxChannels - 1;  // the 64th record is scratch
constexpr std::size_t kVendorKeyWidth = 16;
constexpr std::size_t kVendorKeyLength = 8;

struct Classification {
  DWORD kind = 0;
  DWORD mode = 0;
  DWORD mayCreateDrive = 0;
};

// The classification rules over a device's instance ID; false when the
// interface is not a channel.
bool Classify(const WCHAR* id, Classification* out) {
  if (WideContains(id, WSTR("SBP2")) && WideContains(id, WSTR("QX")) &&
      (WideContains(id, WSTR("SES")) || WideContains(id, WSTR("QUARRY")) ||
       WideContains(id, WSTR("EXTERNAL_DEVICE")))) {
    out->mode = kChannelModeEnclosure;
    out->kind = kChannelKindDriver;
    return true;
  }
  ModelRow row{};
  if (WideContains(id, WSTR("HID")) && LookupModelRow(id, &row)) {
    if (IsChannelModel(id)) {
      out->mode = kChannelModeGauge;
      out->mayCreateDrive = IsStandaloneChannelModel(id) ? 1 : 0;
    }
    return true;
  }
  if (WideContains(id, WSTR("1394")) && WideContains(id, WSTR("QX"))) {
    out->mode = WideContains(id, WSTR("LIGHTS")) ? kChannelModeGauge : kChannelModePlain;
    return true;
  }
  if (WideContains(id, WSTR("1394")) &&
      (WideContains(id, WSTR("30E0")) || WideContains(id, WSTR("6D1F")))) {
    out->mode = kChannelModeGauge;
    return true;
  }
  return false;
}

// A node property as text; empty when it cannot be read.
void NodeText(DEVINST node, ULONG property, WCHAR (&text)[257]) {
  ULONG length = 512;
  if (CM_Get_DevNode_Registry_PropertyW(node, property, nullptr, text, &length, 0) != CR_SUCCESS) {
    text[0] = 0;
  }
  text[256] = 0;
}

// The composite USB device: described so in English, or, since descriptions
// follow the system's language, served by the composite device driver.
bool IsCompositeDevice(DEVINST node) {
  WCHAR text[257] = {};
  NodeText(node, CM_DRP_DEVICEDESC, text);
  if (WideContains(text, WSTR("USB")) && WideContains(text, WSTR("Composite Device"))) return true;
  NodeText(node, CM_DRP_SERVICE, text);
  return WideEqualNoCase(text, WSTR("usbccgp"));
}

// The serial number of the composite USB device above an HID collection:
// the tail of the first ancestor that is a USB composite device, or of the
// topmost ancestor when none is.
void HidSerialKey(DEVINST device, WCHAR* key, std::size_t capacity) {
  DEVINST node = 0;
  if (CM_Get_Parent(&node, device, 0) != CR_SUCCESS) return;
  for (;;) {
    if (IsCompositeDevice(node)) break;
    DEVINST parent = 0;
    if (CM_Get_Parent(&parent, node, 0) != CR_SUCCESS) break;
    node = parent;
  }
  WCHAR id[512] = {};
  if (ReadNodeInstanceId(node, id, 512))
    WideCopy(key, capacity, id + WideAfterLast(id, WSTR('\\')));
}

// The key of a vendor-class channel: the instance tail left-padded with 0 to
// 16 units, its first eight units in reverse order.
void VendorSerialKey(const WCHAR* tail, WCHAR* key) {
  const std::size_t length = WideLength(tail);
  WideString padded;
  if (length < kVendorKeyWidth) padded.assign(kVendorKeyWidth - length, WSTR('0'));
  padded.append(tail, length);
  for (std::size_t i = 0; i < kVendorKeyLength; ++i) key[i] = padded[kVendorKeyLength - 1 - i];
  key[kVendorKeyLength] = 0;
}

bool IsHidClass(const GUID& interfaceClass) {
  GUID hidClass;
  return GetHidClassGuid(&hidClass) && hidClass == interfaceClass;
}

void ClearChannel(ChannelRecord* channel) {
  const HANDLE readyEvent = channel->readyEvent;
  std::memset(channel, 0, sizeof(*channel));
  channel->readyEvent = readyEvent;
  channel->linkedDrive = -1;
}

}  // namespace

LONG ScanControlInterfaces(const GUID& interfaceClass) {
  StateBlock* block = monitorState.stateBlock;
  if (block == nullptr) return -1;
  InterfaceList list(interfaceClass);
  if (!list.Opened()) return -1;
  const bool hidClass = IsHidClass(interfaceClass);
  const bool controlClass = interfaceClass == kVendorClassC;

  LONG result = -1;
  WideString path;
  for (DWORD index = 0;; ++index) {
    SP_DEVINFO_DATA devInfo{};
    const InterfaceList::Fetch fetch = list.Member(index, &path, &devInfo);
    if (fetch == InterfaceList::Fetch::End) break;
    if (fetch == InterfaceList::Fetch::Skip) continue;
    WCHAR id[513] = {};
    if (!SetupDiGetDeviceInstanceIdW(list.Get(), &devInfo, id, 512, nullptr)) continue;
    Classification classification;
    if (!Classify(id, &classification)) continue;

    // Once 63 records are counted the 64th is rewritten by every further
    // channel, so it is cleared first.
    const LONG count = block->channelCount;
    ChannelRecord* channel = &block->channels[count];
    ClearChannel(channel);
    channel->kind = classification.kind;
    channel->mode = classification.mode;
    channel->mayCreateDrive = classification.mayCreateDrive;
    WideCopy(channel->devicePath, 256, path);
    WideCopy(channel->deviceInstanceId, 256, id);
    channel->ownIndex = count;
    channel->linkedDrive = -1;
    if (hidClass) {
      channel->kind = kChannelKindHid;
      HidSerialKey(devInfo.DevInst, channel->serialKey, 128);
    } else {
      if (controlClass) {
        WideCopy(channel->controlPath, 256, path);
      } else {
        channel->kind = kChannelKindDriver;
      }
      WideCopy(channel->instanceTail, 256, id + WideAfterLast(id, WSTR('\\')));
      VendorSerialKey(channel->instanceTail, channel->serialKey);
      channel->mayCreateDrive = 1;
    }
    if (block->channelCount < kCountedChannelLimit) block->channelCount += 1;
    result = 0;
  }
  return result;
}

LONG RebuildChannelTable() {
  StateBlock* block = monitorState.stateBlock;
  if (block == nullptr) return -1;
  for (ChannelRecord& channel : block->channels) ClearChannel(&channel);
  block->channelCount = 0;
  LONG result = -1;
  GUID hidClass;
  // Without the HID class library there are no HID channels to scan.
  if (GetHidClassGuid(&hidClass)) result = ScanControlInterfaces(hidClass);
  for (const GUID& vendorClass : {kVendorClassA, kVendorClassB, kVendorClassC}) {
    result = ScanControlInterfaces(vendorClass);
  }
  return result;
}
