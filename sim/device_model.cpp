// The simulated computer's answers to the emulation's device calls.
#include <cstring>

#include "machine_state.h"
#include "sim_file.h"

namespace sim {
namespace {

constexpr CONFIGRET kCrInvalidProperty = 0x00000035;

std::vector<std::uint8_t> StringProperty(const std::u16string& text) {
  std::vector<std::uint8_t> data((text.size() + 1) * 2, 0);
  std::memcpy(data.data(), text.c_str(), data.size());
  return data;
}

}  // namespace

// ---- emu::DeviceModel ----------------------------------------------------------------

bool Machine::ListInterfaces(const GUID& interfaceClass, std::vector<emu::InterfaceEntry>* out,
                             DWORD* error) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  for (const auto& [cls, failure] : state_->failingLists) {
    if (cls == interfaceClass) {
      *error = failure;
      return false;
    }
  }
  for (const Interface& i : state_->interfaces) {
    if (i.interfaceClass != interfaceClass) continue;
    emu::InterfaceEntry entry;
    entry.path = i.path;
    entry.devInst = i.node;
    entry.instanceId = state_->nodes[i.node].instanceId;
    entry.setupClass = state_->nodes[i.node].setupClass;
    out->push_back(std::move(entry));
  }
  return true;
}

CONFIGRET Machine::Parent(DEVINST node, DEVINST* parent) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  const Node* n = state_->FindNode(node);
  if (n == nullptr) return CR_NO_SUCH_DEVNODE;
  if (n->parent == 0 || state_->FindNode(n->parent) == nullptr) return CR_NO_SUCH_DEVNODE;
  *parent = n->parent;
  return CR_SUCCESS;
}

CONFIGRET Machine::InstanceId(DEVINST node, std::u16string* id) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  const Node* n = state_->FindNode(node);
  if (n == nullptr) return CR_NO_SUCH_DEVNODE;
  *id = n->instanceId;
  return CR_SUCCESS;
}

CONFIGRET Machine::Locate(std::u16string_view instanceId, DEVINST* node) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  if (instanceId.empty()) {
    *node = state_->root;
    return CR_SUCCESS;
  }
  for (const auto& [id, n] : state_->nodes) {
    if (EqualNoCase(n.instanceId, instanceId)) {
      *node = id;
      return CR_SUCCESS;
    }
  }
  return CR_NO_SUCH_DEVNODE;
}

CONFIGRET Machine::Property(DEVINST node, DWORD spdrp, DWORD* regType, std::vector<BYTE>* data) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  const Node* n = state_->FindNode(node);
  if (n == nullptr) return CR_NO_SUCH_DEVNODE;
  auto text = [&](const std::u16string& value) {
    if (value.empty()) return CR_NO_SUCH_VALUE;
    *regType = REG_SZ;
    *data = StringProperty(value);
    return CR_SUCCESS;
  };
  auto number = [&](bool present, DWORD value) {
    if (!present) return CR_NO_SUCH_VALUE;
    *regType = REG_DWORD;
    data->resize(4);
    std::memcpy(data->data(), &value, 4);
    return CR_SUCCESS;
  };
  switch (spdrp) {
    case SPDRP_DEVICEDESC:
      return text(n->description);
    case SPDRP_FRIENDLYNAME:
      return text(n->friendlyName);
    case SPDRP_SERVICE:
      return text(n->service);
    case SPDRP_CAPABILITIES:
      return number(n->hasCapabilities, n->capabilities);
    case SPDRP_ADDRESS:
      return number(n->hasAddress, n->address);
    default:
      return spdrp <= 0x25 ? CR_NO_SUCH_VALUE : kCrInvalidProperty;
  }
}

CONFIGRET Machine::Eject(DEVINST node, bool queryAndRemove, PNP_VETO_TYPE* vetoType,
                         std::u16string* vetoName) {
  std::string driveName;
  std::vector<HeldRequest> taken;
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    State& s = *state_;
    const Node* n = s.FindNode(node);
    if (n == nullptr) return CR_NO_SUCH_DEVNODE;
    EjectRequest request;
    request.instanceId = Narrow(n->instanceId);
    request.queryAndRemove = queryAndRemove;
    if (n->drive < 0) {
      // The machine's own controllers, hubs and disks cannot be removed.
      request.vetoed = true;
      s.ejects.push_back(request);
      *vetoType = PNP_VetoIllegalDeviceRequest;
      *vetoName = n->instanceId;
      return CR_REMOVE_VETOED;
    }
    DriveState& d = *s.drives[static_cast<std::size_t>(n->drive)];
    request.drive = d.spec.name;
    const VolumeState* held = nullptr;
    for (const auto& v : s.volumes) {
      if (v.drive == d.index && v.heldOpen) held = &v;
    }
    if (d.vetoTimes != 0) {
      if (d.vetoTimes > 0) --d.vetoTimes;
      request.vetoed = true;
      *vetoType = d.vetoType;
      *vetoName = d.vetoName;
    } else if (held != nullptr) {
      request.vetoed = true;
      *vetoType = PNP_VetoOutstandingOpen;
      *vetoName = s.nodes[held->node].instanceId;
    }
    s.ejects.push_back(request);
    if (request.vetoed) return CR_REMOVE_VETOED;
    // Only the subtree of the node goes: ejecting the storage function
    // leaves the drive's HID function in place. The topmost node takes all.
    const Node* above = s.FindNode(n->parent);
    if (above == nullptr || above->drive != d.index) {
      driveName = d.spec.name;
    } else {
      taken = s.RemoveSubtree(d, node);
    }
  }
  for (auto& h : taken) emu::CompleteIo(h.request, ERROR_DEVICE_NOT_CONNECTED, 0);
  if (!driveName.empty()) Detach(driveName, ERROR_DEVICE_NOT_CONNECTED);
  return CR_SUCCESS;
}

bool Machine::ModuleLoads(std::u16string_view module, DWORD* error) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  if (state_->failingModules.count(Narrow(module)) != 0) {
    *error = ERROR_MOD_NOT_FOUND;
    return false;
  }
  return true;
}

bool Machine::ExportPresent(std::u16string_view module, std::string_view name) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  return state_->removedExports.count(Narrow(module) + "!" + std::string(name)) == 0;
}

DWORD Machine::LogicalDrives() {
  std::lock_guard<std::mutex> lock(state_->mutex);
  DWORD mask = 0;
  for (const auto& v : state_->volumes) {
    if (v.spec.letter >= 'A' && v.spec.letter <= 'Z' && state_->VolumePresent(v)) {
      mask |= 1u << (v.spec.letter - 'A');
    }
  }
  return mask;
}

UINT Machine::DriveType(WCHAR letter) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  const VolumeState* v = state_->FindVolume(static_cast<char>(letter));
  return v != nullptr ? v->spec.driveType : DRIVE_NO_ROOT_DIR;
}

bool Machine::FreeSpace(WCHAR letter, ULONGLONG* availableToCaller, ULONGLONG* total,
                        ULONGLONG* totalFree, DWORD* error) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  const VolumeState* v = state_->FindVolume(static_cast<char>(letter));
  if (v == nullptr) {
    *error = ERROR_PATH_NOT_FOUND;
    return false;
  }
  if (v->spec.driveType == DRIVE_CDROM && v->spec.sizeBytes == 0) {
    *error = ERROR_NOT_READY;
    return false;
  }
  *availableToCaller = v->spec.freeBytes;
  *total = v->spec.sizeBytes;
  *totalFree = v->spec.freeBytes;
  return true;
}

emu::OsVersion Machine::Version() {
  std::lock_guard<std::mutex> lock(state_->mutex);
  return state_->os;
}

std::unique_ptr<emu::DeviceFile> Machine::Open(const WCHAR* path, DWORD access, DWORD /*share*/,
                                               DWORD /*flags*/, DWORD* error) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  State& s = *state_;
  std::u16string wanted(path);
  // "\\.\X:" names a volume.
  if (wanted.size() == 6 && wanted.compare(0, 4, u"\\\\.\\") == 0 && wanted[5] == u':') {
    char letter = static_cast<char>(UpperAscii(wanted.substr(4, 1))[0]);
    VolumeState* v = s.FindVolume(letter);
    if (v == nullptr) {
      *error = ERROR_FILE_NOT_FOUND;
      return nullptr;
    }
    if (v->drive >= 0) {
      EndpointFaults& f = s.drives[static_cast<std::size_t>(v->drive)]->Faults(Endpoint::Volume);
      if (f.openTimes != 0) {
        if (f.openTimes > 0) --f.openTimes;
        *error = f.openError;
        return nullptr;
      }
    }
    if (v->lockOwner != nullptr) {
      *error = ERROR_ACCESS_DENIED;
      return nullptr;
    }
    v->mounted = true;
    return std::make_unique<SimFile>(state_, v->drive, Endpoint::Volume, letter, 0, access);
  }
  // Interface paths: "\\?\" and "\\.\" name the same device; case is ignored.
  if (wanted.size() > 4 && wanted.compare(0, 4, u"\\\\.\\") == 0) wanted[2] = u'?';
  for (const Interface& i : s.interfaces) {
    if (!i.openable || !EqualNoCase(i.path, wanted)) continue;
    if (i.drive >= 0) {
      EndpointFaults& f = s.drives[static_cast<std::size_t>(i.drive)]->Faults(i.endpoint);
      if (f.openTimes != 0) {
        if (f.openTimes > 0) --f.openTimes;
        *error = f.openError;
        return nullptr;
      }
    }
    return std::make_unique<SimFile>(state_, i.drive, i.endpoint, 0, i.foreignDisk, access);
  }
  *error = ERROR_FILE_NOT_FOUND;
  return nullptr;
}

}  // namespace sim
