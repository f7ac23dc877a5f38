// What a person controlling the running machine sees of it: the drives with
// their volumes and state, and drives plugged in from a description text.
#include <cstring>

#include "machine.h"
#include "machine_state.h"

namespace sim {

std::vector<Machine::DriveSummary> Machine::Drives() const {
  std::lock_guard<std::mutex> lock(state_->mutex);
  std::vector<DriveSummary> out;
  for (const auto& d : state_->drives) {
    DriveSummary summary;
    summary.name = d->spec.name;
    summary.index = d->index;
    summary.bus = d->spec.bus;
    summary.channel = d->spec.channel;
    summary.attached = state_->DiskPresent(*d);
    summary.connected = d->attached;
    std::memcpy(summary.status, d->spec.status, 4);
    summary.sleepState = d->spec.sleepState;
    for (const VolumeState& v : state_->volumes) {
      if (v.drive != d->index) continue;
      summary.volumes.push_back({v.spec.letter, v.spec.sizeBytes, v.spec.freeBytes, v.heldOpen,
                                 state_->VolumePresent(v)});
    }
    out.push_back(std::move(summary));
  }
  return out;
}

bool Machine::FindVolume(char letter, VolumeSummary* volume) const {
  std::lock_guard<std::mutex> lock(state_->mutex);
  for (const VolumeState& v : state_->volumes) {
    if (v.spec.letter != letter) continue;
    *volume = {v.spec.letter, v.spec.sizeBytes, v.spec.freeBytes, v.heldOpen,
               state_->VolumePresent(v)};
    return true;
  }
  return false;
}

void Machine::ClearFaults(const std::string& drive) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  if (DriveState* d = state_->FindDrive(drive)) {
    for (auto& f : d->faults) f = EndpointFaults{};
  }
}

bool Machine::PlugDrives(std::string_view text, std::vector<std::string>* names,
                         std::string* error) {
  std::vector<DriveSpec> specs;
  if (!ReadDriveBlocks(text, &specs, error)) return false;
  if (specs.empty()) {
    *error = "the description has no drive";
    return false;
  }
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    for (std::size_t i = 0; i < specs.size(); ++i) {
      bool taken = state_->FindDrive(specs[i].name) != nullptr;
      for (std::size_t j = 0; j < i; ++j) taken = taken || specs[j].name == specs[i].name;
      if (taken) {
        *error = "a drive named \"" + specs[i].name + "\" exists already";
        return false;
      }
      for (const VolumeSpec& v : specs[i].volumes) {
        for (const VolumeState& existing : state_->volumes) {
          if (existing.spec.letter == v.letter) {
            *error = std::string("volume letter ") + v.letter + " is in use";
            return false;
          }
        }
      }
    }
  }
  for (const DriveSpec& spec : specs) {
    AddDrive(spec, false);
    Attach(spec.name);
    names->push_back(spec.name);
  }
  return true;
}

}  // namespace sim
