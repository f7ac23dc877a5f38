// An open device of the simulated computer: a drive's disk, HID collection,
// button-filter-driver interface or enclosure device, or a volume.
#pragma once

#include <deque>
#include <memory>
#include <vector>

#include "machine_state.h"

namespace sim {

class SimFile : public emu::DeviceFile {
 public:
  SimFile(std::shared_ptr<Machine::State> state, int drive, Endpoint endpoint, char volume,
          std::uint32_t foreignDisk, DWORD access);
  ~SimFile() override;

  emu::IoStart Control(DWORD code, const void* input, DWORD inputLength, void* output,
                       DWORD outputLength, const emu::IoRequestPtr& request) override;
  emu::IoStart Read(void* buffer, DWORD length, const emu::IoRequestPtr& request) override;
  emu::IoStart Write(const void* buffer, DWORD length, const emu::IoRequestPtr& request) override;
  void Cancel(const emu::IoRequestPtr& request) override;
  void Closed() override;

  // Fields below are guarded by the machine's mutex.
  const int drive;  // -1 for volumes and disks of no drive of the maker
  const Endpoint endpoint;
  const char volume;  // drive letter of a volume, else 0
  const std::uint32_t foreignDisk;
  const DWORD access;
  bool gone = false;
  DWORD goneError = 0;
  std::deque<std::vector<std::uint8_t>> reports;  // HID input reports not yet read

 private:
  // The common checks of every request: a vanished device, injected
  // failures. Sets *start and returns true when the request ends there.
  bool Precheck(DWORD code, emu::IoStart* start);
  emu::IoStart ControlLocked(DWORD code, const void* input, DWORD inputLength, void* output,
                             DWORD outputLength, const emu::IoRequestPtr& request);
  emu::IoStart PassThrough(const void* input, DWORD inputLength, void* output, DWORD outputLength,
                           const emu::IoRequestPtr& request);
  void Unregister();

  std::shared_ptr<Machine::State> state_;
  bool registered_ = true;
};

}  // namespace sim
