// Fuzzing entries of the command channel, shared by the libFuzzer targets and
// the corpus replay. A violated check aborts.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "machine.h"
#include "monitor/state_block.h"
#include "platform/posix/device_provider.h"

// First byte even: the rest is a pipe message for the dispatcher; odd: a
// registry request for the registry access alone. No drives: no path may open.
int PipeFuzzOneInput(const std::uint8_t* data, std::size_t size);

// Commands 1, 2, 3, 9, 11 and 12 on the default machine. First byte: command
// (low three bits, modulo six), paused (0x08), drive whose key the image names
// (high four bits). No path may be opened that the service did not find.
int DriveFuzzOneInput(const std::uint8_t* data, std::size_t size);

namespace fuzzsupport {

void Check(bool condition, const char* what);

// A namespace, registry store and time scale of this process's own.
void UsePrivateEmulation(const char* tag);

// The monitor's locks, state, mutex and events; returns the zeroed block.
StateBlock* SetUpMonitor(bool withMapping);

// Every registry call reads the whole store: drop it once it grows large.
void KeepRegistrySmall();

// Installs `machine` as the computer, recording every path opened.
class RecordingComputer : public emu::DeviceProvider {
 public:
  explicit RecordingComputer(std::unique_ptr<sim::Machine> machine);
  sim::Machine& Inner() { return *machine_; }
  std::vector<std::u16string> TakeOpened();
  std::unique_ptr<emu::DeviceFile> Open(const WCHAR* path, DWORD access, DWORD share, DWORD flags,
                                        DWORD* error) override;

 private:
  std::unique_ptr<sim::Machine> machine_;
  std::mutex mutex_;
  std::vector<std::u16string> opened_;
};

// Reply length is the declared one in range, else 0; result and detail are
// allowed by the command's row (`noDrives`: drive commands must fail); bytes the
// command does not write are those that arrived, zero where nothing did.
void CheckReply(const std::uint8_t* original, std::size_t received, const std::uint8_t* reply,
                std::size_t length, bool paused, bool noDrives);

}  // namespace fuzzsupport
