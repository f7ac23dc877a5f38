// The simulated computer's public face: building machines, Plug and Play,
// the front panel, volumes, libraries, faults and what tests observe.
#include "machine.h"

#include <algorithm>
#include <cstring>

#include "machine_state.h"
#include "platform/posix/emu_scm.h"
#include "sim_file.h"

namespace sim {

const GUID kVendorClassA = {
    0x6B1E0C27, 0x5A94, 0x4D3B, {0x9F, 0x10, 0x2C, 0x7E, 0x8A, 0x41, 0xD5, 0xB3}};
const GUID kVendorClassB = {
    0xA37F52D9, 0x0E6C, 0x4B81, {0x8D, 0x24, 0xF9, 0x1B, 0x6C, 0x3E, 0x7A, 0x05}};
const GUID kVendorClassC = {
    0x1D9C4E6A, 0x73B2, 0x4F05, {0xA6, 0xE8, 0x5B, 0x20, 0xC9, 0xD4, 0x1F, 0x7E}};

const char* EndpointName(Endpoint endpoint) {
  switch (endpoint) {
    case Endpoint::Disk:
      return "disk";
    case Endpoint::Hid:
      return "hid";
    case Endpoint::Driver:
      return "driver";
    case Endpoint::Enclosure:
      return "enclosure";
    case Endpoint::Volume:
      return "volume";
  }
  return "?";
}

// ---- Machine: building ---------------------------------------------------------

Machine::Machine() : state_(std::make_shared<State>()) {
  State& s = *state_;
  s.eventSink = [](DWORD type, const void* record) { emu::DeliverDeviceEvent(type, record); };
  s.root = s.NewNode(0, u"HTREE\\ROOT\\0", u"Computer", -1);
  DEVINST pci = s.NewNode(s.root, u"ACPI\\PNP0A03\\0", u"PCI bus", -1);
  DEVINST usbController =
      s.NewNode(pci, u"PCI\\VEN_8086&DEV_293C&SUBSYS_00000000&REV_02\\3&21436425&0&EF",
                u"Standard Enhanced PCI to USB Host Controller", -1);
  s.usbHub = s.NewNode(usbController, u"USB\\ROOT_HUB20\\4&2851D18A&0", u"USB Root Hub", -1);
  s.fireWireController =
      s.NewNode(pci, u"PCI\\VEN_104C&DEV_8023&SUBSYS_00000000&REV_00\\4&1F4A9C6B&0&00F0",
                u"OHCI Compliant IEEE 1394 Host Controller", -1);
  s.storageController =
      s.NewNode(pci, u"PCI\\VEN_8086&DEV_2922&SUBSYS_00000000&REV_02\\3&21436425&0&FA",
                u"Standard AHCI 1.0 Serial ATA Controller", -1);
  s.volumeManager = s.NewNode(s.root, u"ROOT\\FTDISK\\0000", u"Volume Manager", -1);
  for (DEVINST id : {s.usbHub, s.fireWireController, s.storageController}) {
    Node& n = s.nodes[id];
    n.hasCapabilities = true;
    n.capabilities = 0;
  }
}

Machine::~Machine() {
  Uninstall();
  std::vector<HeldRequest> orphans;
  std::vector<TimedCompletion> late;
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    state_->stopping = true;
    for (SimFile* f : state_->files) {
      f->gone = true;
      f->goneError = ERROR_DEVICE_NOT_CONNECTED;
    }
    orphans.swap(state_->held);
    late.swap(state_->heldCancels);
    for (auto& t : state_->timed) late.push_back(std::move(t));
    state_->timed.clear();
  }
  state_->timerWake.notify_all();
  state_->eventWake.notify_all();
  if (state_->timer.joinable()) state_->timer.join();
  if (state_->eventThread.joinable()) state_->eventThread.join();
  for (auto& h : orphans) emu::CompleteIo(h.request, ERROR_DEVICE_NOT_CONNECTED, 0);
  for (auto& t : late) emu::CompleteIo(t.request, t.error, 0);
}

void Machine::SetLanguage(Language language) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  state_->language = language;
}

void Machine::SetOsVersion(DWORD major, DWORD minor, DWORD build, DWORD platformId) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  state_->os.major = major;
  state_->os.minor = minor;
  state_->os.build = build;
  state_->os.platformId = platformId;
  state_->os.servicePack = major == 5 && minor == 0 ? u"Service Pack 4" : u"Service Pack 3";
}

void Machine::AddDrive(const DriveSpec& spec, bool attached) {
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    auto d = std::make_unique<DriveState>();
    d->spec = spec;
    d->index = static_cast<int>(state_->drives.size());
    d->diskNumber = state_->nextDiskNumber++;
    for (const VolumeSpec& v : spec.volumes) {
      VolumeState vol;
      vol.spec = v;
      vol.spec.diskNumber = d->diskNumber;
      vol.drive = d->index;
      state_->volumes.push_back(vol);
    }
    // A drive added attached was there from the start: no arrival events.
    if (attached) {
      d->attached = true;
      state_->BuildDriveNodes(*d);
    }
    state_->drives.push_back(std::move(d));
  }
}

void Machine::AddVolume(const VolumeSpec& volume) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  VolumeState vol;
  vol.spec = volume;
  state_->volumes.push_back(vol);
}

void Machine::AddForeignDisk(const DriveSpec& spec, const std::string& instanceId,
                             const std::string& path, std::uint32_t diskNumber) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  State& s = *state_;
  s.foreignDisks.push_back(spec);
  DEVINST node = s.NewNode(s.storageController, Widen(instanceId), u"Disk drive", -1);
  Node& n = s.nodes[node];
  n.friendlyName = Widen(spec.friendlyName.empty() ? TrimAscii(spec.product) : spec.friendlyName);
  n.service = u"disk";
  n.hasAddress = true;
  n.address = diskNumber;
  n.setupClass = kSetupClassDisk;
  s.AddInterfaceLocked(node, GUID_DEVINTERFACE_DISK, Widen(path), -1, true, Endpoint::Disk);
  s.interfaces.back().foreignDisk = static_cast<std::uint32_t>(s.foreignDisks.size());
  s.foreignDiskNumbers.push_back(diskNumber);
}

DEVINST Machine::AddNode(DEVINST parent, const std::string& instanceId,
                         const std::string& description, const std::string& friendlyName,
                         const std::string& service) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  DEVINST id = state_->NewNode(parent, Widen(instanceId), Widen(description), -1);
  state_->nodes[id].friendlyName = Widen(friendlyName);
  state_->nodes[id].service = Widen(service);
  return id;
}

DEVINST Machine::RootNode() const {
  return state_->root;
}

void Machine::AddInterface(DEVINST node, const GUID& interfaceClass, const std::string& path) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  state_->AddInterfaceLocked(node, interfaceClass, Widen(path), -1, false, Endpoint::Disk);
}

std::uint32_t Machine::DiskNumber(const std::string& drive) const {
  std::lock_guard<std::mutex> lock(state_->mutex);
  const DriveState* d = state_->FindDrive(drive);
  return d != nullptr ? d->diskNumber : 0xFFFFFFFF;
}

void Machine::Install() {
  emu::SetDeviceModel(this);
}

void Machine::Uninstall() {
  if (emu::ActiveDeviceModelIfAny() == this) emu::SetDeviceModel(nullptr);
}

// ---- Plug and Play -------------------------------------------------------------

void Machine::Attach(const std::string& drive) {
  std::vector<HeldRequest> taken;
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    DriveState* d = state_->FindDrive(drive);
    if (d == nullptr || state_->DiskPresent(*d)) return;
    if (d->attached) {
      // What an eject of one function left of the drive goes before the
      // drive comes back whole.
      taken = state_->TakeDriveRequests(d->index, ERROR_DEVICE_NOT_CONNECTED);
      state_->RemoveDriveNodes(*d);
    }
    d->attached = true;
    d->goneError = 0;
    d->driverEvents.clear();
    d->enclosureBits = 0;
    state_->BuildDriveNodes(*d);
    state_->QueueEvents(state_->DriveEvents(d->index, kArrival));
  }
  for (auto& h : taken) emu::CompleteIo(h.request, ERROR_DEVICE_NOT_CONNECTED, 0);
}

void Machine::Detach(const std::string& drive, DWORD error) {
  std::vector<HeldRequest> taken;
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    DriveState* d = state_->FindDrive(drive);
    if (d == nullptr || !d->attached) return;
    state_->QueueEvents(state_->DriveEvents(d->index, kRemoveComplete));
    d->attached = false;
    d->goneError = error;
    taken = state_->TakeDriveRequests(d->index, error);
    state_->RemoveDriveNodes(*d);
  }
  for (auto& h : taken) emu::CompleteIo(h.request, error, 0);
}

bool Machine::WaitForDeviceEvents(DWORD timeoutMs) const {
  std::unique_lock<std::mutex> lock(state_->mutex);
  return state_->changed.wait_for(lock, std::chrono::milliseconds(timeoutMs),
                                  [&] { return state_->events.empty() && !state_->delivering; });
}

bool Machine::Attached(const std::string& drive) const {
  std::lock_guard<std::mutex> lock(state_->mutex);
  const DriveState* d = state_->FindDrive(drive);
  return d != nullptr && state_->DiskPresent(*d);
}

void Machine::SetEjectVeto(const std::string& drive, PNP_VETO_TYPE type,
                           const std::string& vetoName, int times) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  if (DriveState* d = state_->FindDrive(drive)) {
    d->vetoType = type;
    d->vetoName = Widen(vetoName);
    d->vetoTimes = times;
  }
}

std::vector<Machine::EjectRequest> Machine::Ejects() const {
  std::lock_guard<std::mutex> lock(state_->mutex);
  return state_->ejects;
}

void Machine::SetDeviceEventSink(std::function<void(DWORD, const void*)> sink) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  state_->eventSink = std::move(sink);
}

// ---- Front panel and drive state -------------------------------------------------

void Machine::Press(const std::string& drive, std::uint8_t eventBits) {
  std::vector<std::pair<emu::IoRequestPtr, DWORD>> completions;
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    State& s = *state_;
    DriveState* d = s.FindDrive(drive);
    if (d == nullptr || !d->attached) return;
    switch (d->spec.channel) {
      case ChannelKind::Hid: {
        // The HID class driver gives every open handle its own copy of each
        // input report (up to 32 kept per handle).
        if (d->spec.hidInputReportLength == 0) break;  // no input reports to carry it
        std::vector<std::uint8_t> report(d->spec.hidInputReportLength, 0);
        report.front() = 0x01;
        if (report.size() > 1) report[1] = eventBits;
        for (SimFile* f : s.files) {
          if (f->drive != d->index || f->endpoint != Endpoint::Hid || f->gone) continue;
          auto waiting = std::find_if(s.held.begin(), s.held.end(), [&](const HeldRequest& h) {
            return h.file == f && h.kind == HeldRequest::Kind::HidRead;
          });
          if (waiting != s.held.end()) {
            HeldRequest h = std::move(*waiting);
            s.held.erase(waiting);
            f->reports.push_back(report);
            completions.emplace_back(h.request, h.finish());
          } else {
            f->reports.push_back(report);
            if (f->reports.size() > 32) f->reports.pop_front();
          }
        }
        break;
      }
      case ChannelKind::Driver: {
        d->driverEvents.push_back(eventBits);
        auto waiting = std::find_if(s.held.begin(), s.held.end(), [&](const HeldRequest& h) {
          return h.file->drive == d->index && h.kind == HeldRequest::Kind::DriverWait;
        });
        if (waiting != s.held.end()) {
          HeldRequest h = std::move(*waiting);
          s.held.erase(waiting);
          completions.emplace_back(h.request, h.finish());
        }
        if (d->driverEvents.size() > 32) d->driverEvents.pop_front();
        break;
      }
      case ChannelKind::Enclosure:
        d->enclosureBits = static_cast<std::uint8_t>(d->enclosureBits | eventBits);
        break;
      case ChannelKind::None:
        break;
    }
    s.changed.notify_all();
  }
  for (auto& [request, bytes] : completions) emu::CompleteIo(request, ERROR_SUCCESS, bytes);
}

void Machine::SetStatus(const std::string& drive, const std::uint8_t bytes4to7[4]) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  if (DriveState* d = state_->FindDrive(drive)) std::memcpy(d->spec.status, bytes4to7, 4);
}

void Machine::SetSleepState(const std::string& drive, std::uint8_t sleepState) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  if (DriveState* d = state_->FindDrive(drive)) d->spec.sleepState = sleepState;
}

// ---- Volumes ---------------------------------------------------------------------

namespace {
VolumeState* AnyVolume(Machine::State& s, char letter) {
  for (auto& v : s.volumes) {
    if (v.spec.letter == letter) return &v;
  }
  return nullptr;
}
}  // namespace

void Machine::SetVolumeHeldOpen(char letter, bool held) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  if (VolumeState* v = AnyVolume(*state_, letter)) v->heldOpen = held;
}

void Machine::SetMediumCheckFails(char letter, bool fails) {
  SetMediumCheckError(letter, fails ? ERROR_NOT_READY : 0);
}

void Machine::SetMediumCheckError(char letter, DWORD error) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  if (VolumeState* v = AnyVolume(*state_, letter)) v->mediumError = error;
}

void Machine::SetVolumeControlError(char letter, DWORD code, DWORD error) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  VolumeState* v = AnyVolume(*state_, letter);
  if (v == nullptr) return;
  if (code == FSCTL_LOCK_VOLUME) v->lockError = error;
  if (code == FSCTL_DISMOUNT_VOLUME) v->dismountError = error;
}

bool Machine::VolumeMounted(char letter) const {
  std::lock_guard<std::mutex> lock(state_->mutex);
  const VolumeState* v = AnyVolume(*state_, letter);
  return v != nullptr && v->mounted;
}

void Machine::SetFreeBytes(char letter, std::uint64_t freeBytes) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  if (VolumeState* v = AnyVolume(*state_, letter)) v->spec.freeBytes = freeBytes;
}

int Machine::DismountCount(char letter) const {
  std::lock_guard<std::mutex> lock(state_->mutex);
  const VolumeState* v = AnyVolume(*state_, letter);
  return v != nullptr ? v->dismounts : 0;
}

bool Machine::VolumeLocked(char letter) const {
  std::lock_guard<std::mutex> lock(state_->mutex);
  const VolumeState* v = AnyVolume(*state_, letter);
  return v != nullptr && v->lockOwner != nullptr;
}

// ---- Libraries -------------------------------------------------------------------

void Machine::RemoveExport(const std::string& module, const std::string& name) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  state_->removedExports.insert(Narrow(LowerAscii(Widen(module))) + "!" + name);
}

void Machine::SetModuleLoadFails(const std::string& module, bool fails) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  std::string key = Narrow(LowerAscii(Widen(module)));
  if (fails) {
    state_->failingModules.insert(key);
  } else {
    state_->failingModules.erase(key);
  }
}

void Machine::FailInterfaceList(const GUID& interfaceClass, DWORD error) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  auto& lists = state_->failingLists;
  lists.erase(std::remove_if(lists.begin(), lists.end(),
                             [&](const auto& f) { return f.first == interfaceClass; }),
              lists.end());
  if (error != 0) lists.emplace_back(interfaceClass, error);
}

// ---- Faults ------------------------------------------------------------------------

void Machine::FailOpen(const std::string& drive, Endpoint endpoint, DWORD error, int times) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  if (DriveState* d = state_->FindDrive(drive)) {
    d->Faults(endpoint).openError = error;
    d->Faults(endpoint).openTimes = times;
  }
}

void Machine::FailIo(const std::string& drive, Endpoint endpoint, DWORD error, int times,
                     DWORD code) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  if (DriveState* d = state_->FindDrive(drive)) {
    d->Faults(endpoint).ioError = error;
    d->Faults(endpoint).ioTimes = times;
    d->Faults(endpoint).ioCode = code;
  }
}

void Machine::HangIo(const std::string& drive, Endpoint endpoint, bool hang) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  if (DriveState* d = state_->FindDrive(drive)) d->Faults(endpoint).hang = hang;
}

void Machine::SetCancelDelay(const std::string& drive, Endpoint endpoint, DWORD delayMs) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  if (DriveState* d = state_->FindDrive(drive)) {
    d->Faults(endpoint).cancelDelayed = true;
    d->Faults(endpoint).cancelDelayMs = delayMs;
  }
}

void Machine::FinishHeldCancels() {
  std::vector<std::pair<TimedCompletion, DWORD>> done;
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    for (auto& t : state_->heldCancels) {
      DWORD bytes = t.finish ? t.finish() : 0;
      done.emplace_back(std::move(t), bytes);
    }
    state_->heldCancels.clear();
  }
  for (auto& [t, bytes] : done) emu::CompleteIo(t.request, t.error, bytes);
}

void Machine::ClearFaults() {
  std::lock_guard<std::mutex> lock(state_->mutex);
  for (auto& d : state_->drives) {
    for (auto& f : d->faults) f = EndpointFaults{};
    d->vetoTimes = 0;
  }
  state_->failingLists.clear();
  state_->failingModules.clear();
  state_->removedExports.clear();
}

// ---- Observation ---------------------------------------------------------------------

namespace {
std::size_t CountPending(const Machine::State& s, int drive, Endpoint endpoint) {
  return static_cast<std::size_t>(
      std::count_if(s.held.begin(), s.held.end(), [&](const HeldRequest& h) {
        return h.file->drive == drive && h.file->endpoint == endpoint;
      }));
}
}  // namespace

std::size_t Machine::PendingCount(const std::string& drive, Endpoint endpoint) const {
  std::lock_guard<std::mutex> lock(state_->mutex);
  const DriveState* d = state_->FindDrive(drive);
  return d != nullptr ? CountPending(*state_, d->index, endpoint) : 0;
}

bool Machine::WaitForPending(const std::string& drive, Endpoint endpoint, std::size_t count,
                             DWORD timeoutMs) const {
  std::unique_lock<std::mutex> lock(state_->mutex);
  const DriveState* d = state_->FindDrive(drive);
  if (d == nullptr) return false;
  const int index = d->index;
  return state_->changed.wait_for(lock, std::chrono::milliseconds(timeoutMs),
                                  [&] { return CountPending(*state_, index, endpoint) >= count; });
}

std::size_t Machine::OpenCount(const std::string& drive, Endpoint endpoint) const {
  std::lock_guard<std::mutex> lock(state_->mutex);
  const DriveState* d = state_->FindDrive(drive);
  if (d == nullptr) return 0;
  return static_cast<std::size_t>(std::count_if(
      state_->files.begin(), state_->files.end(),
      [&](const SimFile* f) { return f->drive == d->index && f->endpoint == endpoint; }));
}

std::vector<Command> Machine::Commands(const std::string& drive) const {
  std::lock_guard<std::mutex> lock(state_->mutex);
  std::vector<Command> out;
  for (const auto& c : state_->commands) {
    if (drive.empty() || c.drive == drive) out.push_back(c);
  }
  return out;
}

void Machine::ClearCommands() {
  std::lock_guard<std::mutex> lock(state_->mutex);
  state_->commands.clear();
}

std::string Machine::Transcript() const {
  std::string text;
  for (const auto& c : Commands()) text += Describe(c) + "\n";
  return text;
}

}  // namespace sim
