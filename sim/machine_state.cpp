// Inside the simulated computer: the device tree a drive brings with it, the
// record, and the machine's threads for device events and late completions.
#include "machine_state.h"

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "sim_file.h"

namespace sim {

// Setup classes reported in SP_DEVINFO_DATA.
// Setup classes reported in SP_DEVINFO_DATA.
const GUID kSetupClassDisk = {
    0x4D36E967, 0xE325, 0x11CE, {0xBF, 0xC1, 0x08, 0x00, 0x2B, 0xE1, 0x03, 0x18}};
const GUID kSetupClassUsb = {
    0x36FC9E60, 0xC465, 0x11CF, {0x80, 0x56, 0x44, 0x45, 0x53, 0x54, 0x00, 0x00}};
const GUID kSetupClassHid = {
    0x745A17A0, 0x74D3, 0x11D0, {0xB6, 0xFE, 0x00, 0xA0, 0xC9, 0x0F, 0x57, 0xDA}};
const GUID kSetupClass1394 = {
    0x6BDD1FC1, 0x810F, 0x11D0, {0xBE, 0xC7, 0x08, 0x00, 0x2B, 0xE2, 0x09, 0x2F}};
const GUID kSetupClassVolume = {
    0x71A27CDD, 0x812A, 0x11D0, {0xBE, 0xC7, 0x08, 0x00, 0x2B, 0xE2, 0x09, 0x2F}};

namespace {

// A device description in the machine's language.
std::u16string Described(Language language, std::u16string_view english) {
  struct Row {
    std::u16string_view english, german, japanese;
  };
  static const Row kRows[] = {
      {u"USB Composite Device", u"USB-Verbundger\u00E4t",
       u"USB \u8907\u5408\u30C7\u30D0\u30A4\u30B9"},
      {u"USB Mass Storage Device", u"USB-Massenspeicherger\u00E4t",
       u"USB \u5927\u5BB9\u91CF\u8A18\u61B6\u88C5\u7F6E"},
      {u"Disk drive", u"Laufwerk", u"\u30C7\u30A3\u30B9\u30AF \u30C9\u30E9\u30A4\u30D6"},
      {u"USB Input Device", u"USB-Eingabeger\u00E4t", u"USB \u5165\u529B\u30C7\u30D0\u30A4\u30B9"},
      {u"HID-compliant device", u"HID-konformes Ger\u00E4t",
       u"HID \u6E96\u62E0\u30C7\u30D0\u30A4\u30B9"},
  };
  for (const Row& row : kRows) {
    if (row.english != english) continue;
    if (language == Language::German) return std::u16string(row.german);
    if (language == Language::Japanese) return std::u16string(row.japanese);
  }
  return std::u16string(english);
}

const GUID& VendorClass(int which) {
  return which == 2 ? kVendorClassB : which == 3 ? kVendorClassC : kVendorClassA;
}

std::string UpperUnderscored(std::string text) {
  for (auto& c : text) {
    if (c == ' ') c = '_';
    if (c >= 'a' && c <= 'z') c = static_cast<char>(c - 'a' + 'A');
  }
  return text;
}

// A decimal-digit stand-in for the hash part of generated instance IDs, so
// generated IDs never contain a model-list entry by accident.
std::string HashPart(int index, int salt) {
  char text[16];
  std::snprintf(text, sizeof text, "%08d", 31410000 + salt * 1000 + index);
  return text;
}

// A DEV_BROADCAST_DEVICEINTERFACE_W record for one interface.
std::vector<std::uint8_t> InterfaceRecord(const Interface& iface) {
  const std::size_t nameBytes = (iface.eventName.size() + 1) * 2;
  const DWORD size = static_cast<DWORD>(28 + nameBytes);
  const DWORD type = 5;  // DBT_DEVTYP_DEVICEINTERFACE
  const DWORD reserved = 0;
  std::vector<std::uint8_t> record;
  record.reserve(size);
  auto append = [&record](const void* data, std::size_t length) {
    for (std::size_t i = 0; i < length; ++i) {
      record.push_back(static_cast<const std::uint8_t*>(data)[i]);
    }
  };
  append(&size, 4);
  append(&type, 4);
  append(&reserved, 4);
  append(&iface.interfaceClass, 16);
  append(iface.eventName.c_str(), nameBytes);
  return record;
}

// A DEV_BROADCAST_VOLUME record for a set of letters.
std::vector<std::uint8_t> VolumeRecord(DWORD unitMask) {
  std::vector<std::uint8_t> record(20, 0);
  const DWORD size = 20;
  const DWORD type = 2;  // DBT_DEVTYP_VOLUME
  std::memcpy(&record[0], &size, 4);
  std::memcpy(&record[4], &type, 4);
  std::memcpy(&record[12], &unitMask, 4);
  return record;
}

}  // namespace

// ---- State -------------------------------------------------------------------------

DriveState* Machine::State::FindDrive(const std::string& name) {
  for (auto& d : drives) {
    if (d->spec.name == name) return d.get();
  }
  return nullptr;
}

const DriveState* Machine::State::FindDrive(const std::string& name) const {
  for (const auto& d : drives) {
    if (d->spec.name == name) return d.get();
  }
  return nullptr;
}

Node* Machine::State::FindNode(DEVINST id) {
  auto it = nodes.find(id);
  return it == nodes.end() ? nullptr : &it->second;
}

bool Machine::State::VolumePresent(const VolumeState& volume) const {
  return volume.drive < 0 ||
         (drives[static_cast<std::size_t>(volume.drive)]->attached && volume.node != 0);
}

bool Machine::State::DiskPresent(const DriveState& drive) const {
  if (!drive.attached) return false;
  for (const Interface& i : interfaces) {
    if (i.drive == drive.index && i.endpoint == Endpoint::Disk && i.openable) return true;
  }
  return false;
}

VolumeState* Machine::State::FindVolume(char letter) {
  for (auto& v : volumes) {
    if (v.spec.letter == letter && VolumePresent(v)) return &v;
  }
  return nullptr;
}

DEVINST Machine::State::NewNode(DEVINST parent, std::u16string instanceId,
                                std::u16string description, int drive) {
  Node node;
  node.id = nextDevInst++;
  node.parent = parent;
  node.instanceId = std::move(instanceId);
  node.description = std::move(description);
  node.drive = drive;
  DEVINST id = node.id;
  nodes.emplace(id, std::move(node));
  return id;
}

void Machine::State::AddInterfaceLocked(DEVINST node, const GUID& interfaceClass,
                                        std::u16string path, int drive, bool openable,
                                        Endpoint endpoint) {
  Interface iface;
  iface.interfaceClass = interfaceClass;
  iface.node = node;
  iface.eventName =
      path.empty() ? InterfaceEventName(nodes[node].instanceId, interfaceClass) : path;
  iface.path = path.empty() ? InterfacePath(nodes[node].instanceId, interfaceClass) : path;
  iface.drive = drive;
  iface.openable = openable;
  iface.endpoint = endpoint;
  interfaces.push_back(std::move(iface));
}

std::string Machine::State::DriveName(int drive) const {
  return drive >= 0 ? drives[static_cast<std::size_t>(drive)]->spec.name : std::string();
}

void Machine::State::Record(Command command) {
  command.sequence = nextSequence++;
  commands.push_back(std::move(command));
  if (commands.size() > kCommandRecordLimit) commands.pop_front();
  static const bool traced = [] {
    const char* trace = std::getenv("SKYVANE_SIM_TRACE");
    return trace != nullptr && *trace != 0;
  }();
  if (traced) {
    std::fprintf(stderr, "[sim] %s\n", Describe(commands.back()).c_str());
  }
}

void Machine::State::BuildDriveNodes(DriveState& d) {
  const DriveSpec& s = d.spec;
  const int di = d.index;
  auto idOr = [](const std::string& given, const std::string& derived) {
    return Widen(given.empty() ? derived : given);
  };
  const std::string vendorUpper = UpperUnderscored(TrimAscii(s.vendor));
  DEVINST controlNode = 0;  // where the driver channel's interface lives
  d.nodes.clear();

  if (s.bus == Bus::Usb) {
    const std::string pid = s.usbPid.empty() ? s.modelCode : s.usbPid;
    const std::string usbSerial = UsbSerial(s);
    const std::string base = "USB\\VID_" + s.usbVid + "&PID_" + pid;
    DEVINST composite = NewNode(usbHub, Widen(base + "\\" + usbSerial),
                                Described(language, u"USB Composite Device"), di);
    Node& c = nodes[composite];
    c.service = u"usbccgp";
    c.hasAddress = true;
    c.address = s.busAddress;
    c.hasCapabilities = true;
    c.capabilities = s.parentCapabilities != 0 ? s.parentCapabilities : 0x84;
    c.setupClass = kSetupClassUsb;
    AddInterfaceLocked(composite, GUID_DEVINTERFACE_USB_DEVICE, u"", di, false, Endpoint::Disk);
    DEVINST storageParent = NewNode(
        composite, idOr(s.parentInstanceId, base + "&MI_00\\6&" + HashPart(di, 1) + "&0&0000"),
        Described(language, u"USB Mass Storage Device"), di);
    Node& m = nodes[storageParent];
    m.service = Widen(s.parentService.empty() ? "USBSTOR" : s.parentService);
    m.hasAddress = true;
    m.address = 0;
    m.hasCapabilities = true;
    m.capabilities = 0x84;
    m.setupClass = kSetupClassUsb;
    controlNode = storageParent;
    DEVINST disk =
        NewNode(storageParent,
                idOr(s.diskInstanceId, "USBSTOR\\DISK&VEN_" + vendorUpper + "&PROD_" +
                                           UpperUnderscored(TrimAscii(s.product)) + "&REV_" +
                                           UpperUnderscored(s.revision) + "\\" + usbSerial + "&0"),
                Described(language, u"Disk drive"), di);
    Node& n = nodes[disk];
    n.friendlyName = Widen(s.friendlyName.empty()
                               ? TrimAscii(s.vendor) + " " + TrimAscii(s.product) + " USB Device"
                               : s.friendlyName);
    n.service = u"disk";
    n.hasAddress = true;
    n.address = s.busAddress;
    n.hasCapabilities = true;
    n.capabilities = 0x10;
    n.setupClass = kSetupClassDisk;
    AddInterfaceLocked(disk, GUID_DEVINTERFACE_DISK, Widen(s.diskPath), di, true, Endpoint::Disk);
    if (s.channel == ChannelKind::Hid) {
      DEVINST function =
          NewNode(composite, Widen(base + "&MI_01\\6&" + HashPart(di, 2) + "&0&0001"),
                  Described(language, u"USB Input Device"), di);
      nodes[function].service = u"HidUsb";
      nodes[function].setupClass = kSetupClassHid;
      DEVINST hid = NewNode(function,
                            idOr(s.hidInstanceId, "HID\\VID_" + s.usbVid + "&PID_" + pid +
                                                      "&MI_01\\7&" + HashPart(di, 3) + "&0&0000"),
                            Described(language, u"HID-compliant device"), di);
      nodes[hid].setupClass = kSetupClassHid;
      AddInterfaceLocked(hid, emu::kHidInterfaceClass, u"", di, true, Endpoint::Hid);
    }
  } else {
    const std::string unitId = UnitId(s, di);
    const std::string unitModel = UpperUnderscored(s.unitModel);
    DEVINST unit =
        NewNode(fireWireController,
                idOr(s.parentInstanceId, "1394\\" + vendorUpper + "&" + unitModel + "\\" + unitId),
                u"SBP2 Compliant IEEE 1394 Device", di);
    Node& u = nodes[unit];
    u.service = Widen(s.parentService.empty() ? "sbp2port" : s.parentService);
    u.hasAddress = true;
    u.address = s.busAddress;
    u.hasCapabilities = true;
    u.capabilities = s.parentCapabilities != 0 ? s.parentCapabilities : 0x04;
    u.setupClass = kSetupClass1394;
    controlNode = unit;
    DEVINST disk = NewNode(
        unit, idOr(s.diskInstanceId, "SBP2\\" + vendorUpper + "&" + unitModel + "&LUN0\\" + unitId),
        Described(language, u"Disk drive"), di);
    Node& n = nodes[disk];
    std::string vendorField = s.vendor;
    vendorField.resize(8, ' ');
    n.friendlyName = Widen(s.friendlyName.empty()
                               ? vendorField + " " + TrimAscii(s.product) + " IEEE 1394 SBP2 Device"
                               : s.friendlyName);
    n.service = u"disk";
    n.hasAddress = true;
    n.address = 0;
    n.hasCapabilities = true;
    n.capabilities = 0x10;
    n.setupClass = kSetupClassDisk;
    AddInterfaceLocked(disk, GUID_DEVINTERFACE_DISK, Widen(s.diskPath), di, true, Endpoint::Disk);
    if (s.channel == ChannelKind::Enclosure) {
      DEVINST ses = NewNode(unit,
                            idOr(s.controlInstanceId,
                                 "SBP2\\" + vendorUpper + "&" + unitModel + "_SES&LUN1\\" + unitId),
                            u"Enclosure Services Device", di);
      nodes[ses].setupClass = kSetupClass1394;
      AddInterfaceLocked(ses, VendorClass(s.enclosureClass), u"", di, true, Endpoint::Enclosure);
    }
  }
  if (s.channel == ChannelKind::Driver) {
    DEVINST target = controlNode;
    if (!s.controlInstanceId.empty()) {
      target = NewNode(controlNode, Widen(s.controlInstanceId), u"Button Filter Device", di);
    }
    AddInterfaceLocked(target, VendorClass(s.driverClass), u"", di, true, Endpoint::Driver);
  }
  for (std::size_t v = 0; v < volumes.size(); ++v) {
    VolumeState& vol = volumes[v];
    if (vol.drive != di) continue;
    vol.node = NewNode(volumeManager,
                       Widen("STORAGE\\VOLUME\\1&30A96598&0&SIGNATURE" + HashPart(di, 5) +
                             "OFFSET7E00LENGTH" + std::to_string(vol.spec.partition)),
                       u"Generic volume", di);
    nodes[vol.node].setupClass = kSetupClassVolume;
    AddInterfaceLocked(vol.node, GUID_DEVINTERFACE_VOLUME, u"", di, false, Endpoint::Volume);
  }
  for (auto& [id, node] : nodes) {
    if (node.drive == di) d.nodes.push_back(id);
  }
}

void Machine::State::RemoveDriveNodes(DriveState& d) {
  interfaces.erase(std::remove_if(interfaces.begin(), interfaces.end(),
                                  [&](const Interface& i) { return i.drive == d.index; }),
                   interfaces.end());
  for (DEVINST id : d.nodes) nodes.erase(id);
  d.nodes.clear();
  for (auto& v : volumes) {
    if (v.drive == d.index) {
      v.node = 0;
      v.lockOwner = nullptr;
    }
  }
}

std::vector<HeldRequest> Machine::State::RemoveSubtree(DriveState& d, DEVINST top) {
  std::set<DEVINST> gone;
  for (DEVINST id : d.nodes) {
    for (DEVINST n = id; n != 0;) {
      if (n == top) {
        gone.insert(id);
        break;
      }
      const Node* node = FindNode(n);
      n = node != nullptr ? node->parent : 0;
    }
  }
  std::set<Endpoint> goneEndpoints;
  std::vector<QueuedEvent> queued;
  for (const Interface& i : interfaces) {
    if (i.drive != d.index || gone.count(i.node) == 0) continue;
    if (i.openable) goneEndpoints.insert(i.endpoint);
    queued.push_back({kRemoveComplete, InterfaceRecord(i)});
  }
  // The volumes of a disk that goes go with it.
  DWORD mask = 0;
  if (goneEndpoints.count(Endpoint::Disk) != 0) {
    goneEndpoints.insert(Endpoint::Volume);
    for (VolumeState& v : volumes) {
      if (v.drive != d.index || v.node == 0) continue;
      for (const Interface& i : interfaces) {
        if (i.node == v.node) queued.push_back({kRemoveComplete, InterfaceRecord(i)});
      }
      gone.insert(v.node);
      v.node = 0;
      v.lockOwner = nullptr;
      if (v.spec.letter >= 'A' && v.spec.letter <= 'Z') mask |= 1u << (v.spec.letter - 'A');
    }
  }
  if (mask != 0) queued.push_back({kRemoveComplete, VolumeRecord(mask)});
  std::reverse(queued.begin(), queued.end());
  QueueEvents(std::move(queued));

  interfaces.erase(std::remove_if(interfaces.begin(), interfaces.end(),
                                  [&](const Interface& i) { return gone.count(i.node) != 0; }),
                   interfaces.end());
  for (DEVINST id : gone) nodes.erase(id);
  d.nodes.erase(std::remove_if(d.nodes.begin(), d.nodes.end(),
                               [&](DEVINST id) { return gone.count(id) != 0; }),
                d.nodes.end());
  for (SimFile* f : files) {
    if (f->drive == d.index && goneEndpoints.count(f->endpoint) != 0) {
      f->gone = true;
      f->goneError = ERROR_DEVICE_NOT_CONNECTED;
    }
  }
  auto keep = std::stable_partition(held.begin(), held.end(), [&](const HeldRequest& h) {
    return h.file->drive != d.index || goneEndpoints.count(h.file->endpoint) == 0;
  });
  std::vector<HeldRequest> taken(std::make_move_iterator(keep),
                                 std::make_move_iterator(held.end()));
  held.erase(keep, held.end());
  changed.notify_all();
  return taken;
}

std::vector<HeldRequest> Machine::State::TakeDriveRequests(int drive, DWORD error) {
  std::vector<HeldRequest> taken;
  for (SimFile* f : files) {
    if (f->drive == drive) {
      f->gone = true;
      f->goneError = error;
    }
  }
  auto keep = std::stable_partition(held.begin(), held.end(),
                                    [&](const HeldRequest& h) { return h.file->drive != drive; });
  taken.assign(std::make_move_iterator(keep), std::make_move_iterator(held.end()));
  held.erase(keep, held.end());
  changed.notify_all();
  return taken;
}

void Machine::State::ScheduleLateCompletion(TimedCompletion completion) {
  timed.push_back(std::move(completion));
  if (!timer.joinable()) timer = std::thread([this] { TimerLoop(); });
  timerWake.notify_all();
}

void Machine::State::QueueEvents(std::vector<QueuedEvent> queued) {
  if (queued.empty() || stopping) return;
  for (auto& e : queued) events.push_back(std::move(e));
  if (!eventThread.joinable()) eventThread = std::thread([this] { EventLoop(); });
  eventWake.notify_all();
}

void Machine::State::EventLoop() {
  std::unique_lock<std::mutex> lock(mutex);
  while (!stopping) {
    if (events.empty()) {
      eventWake.wait(lock);
      continue;
    }
    QueuedEvent event = std::move(events.front());
    events.pop_front();
    delivering = true;
    auto sink = eventSink;
    lock.unlock();
    if (sink) sink(event.type, event.record.data());
    lock.lock();
    delivering = false;
    changed.notify_all();
  }
}

void Machine::State::TimerLoop() {
  std::unique_lock<std::mutex> lock(mutex);
  while (!stopping) {
    if (timed.empty()) {
      timerWake.wait(lock);
      continue;
    }
    auto next = std::min_element(timed.begin(), timed.end(),
                                 [](const auto& a, const auto& b) { return a.due < b.due; });
    if (next->due > std::chrono::steady_clock::now()) {
      // A copy: the wait releases the lock, and a completion scheduled
      // meanwhile may move the vector's elements.
      const auto due = next->due;
      timerWake.wait_until(lock, due);
      continue;
    }
    TimedCompletion due = std::move(*next);
    timed.erase(next);
    DWORD bytes = due.finish ? due.finish() : 0;
    lock.unlock();
    emu::CompleteIo(due.request, due.error, bytes);
    lock.lock();
  }
}

// Event records of a drive's interfaces and volumes, in arrival order.
std::vector<QueuedEvent> Machine::State::DriveEvents(int drive, DWORD type) const {
  const Machine::State& s = *this;
  std::vector<QueuedEvent> found;
  for (const Interface& i : s.interfaces) {
    if (i.drive == drive) found.push_back({type, InterfaceRecord(i)});
  }
  DWORD mask = 0;
  for (const VolumeState& v : s.volumes) {
    if (v.drive == drive && v.spec.letter >= 'A' && v.spec.letter <= 'Z') {
      mask |= 1u << (v.spec.letter - 'A');
    }
  }
  if (mask != 0) found.push_back({type, VolumeRecord(mask)});
  if (type == kRemoveComplete) std::reverse(found.begin(), found.end());
  return found;
}

}  // namespace sim
