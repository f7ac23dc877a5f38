// The two fuzzing entries of the command channel, shared by the libFuzzer
// targets and the plain corpus replay, and what they share: a private emulated
// namespace and registry, a computer that records every path the service
// opens, and the checks every reply must pass. A violation aborts.
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

// The first byte selects the target, the rest is its input.
//   even: a pipe message as the server would have read it, fed to the
//         dispatcher with the count of bytes received;
//   odd:  a registry request (fixed part and texts) of exactly that many
//         bytes delivered, fed to the registry access alone.
// The dispatcher runs on a computer without drives, so no path may be opened
// at all; a refused registry request stays unchanged.
int PipeFuzzOneInput(const std::uint8_t* data, std::size_t size);

// The commands that reach drives and channels (1, 2, 3, 9, 11 and 12) on the
// embedded default machine. The first byte selects the command (low three
// bits, modulo six), whether monitoring is paused (0x08), and which of the
// service's drives the image's key names (high four bits; beyond the last
// drive the key is left as it arrived). The rest is the message as the server
// would have read it. No path may be opened that the service did not find.
int DriveFuzzOneInput(const std::uint8_t* data, std::size_t size);

namespace fuzzsupport {

// Aborts with `what` unless `condition` holds.
void Check(bool condition, const char* what);

// Gives this process an emulated namespace, registry store and time scale of
// its own (unless the environment names them), so that random requests land
// nowhere else and waits are short.
void UsePrivateEmulation(const char* tag);

// The surroundings the monitor gives the dispatcher: the process locks, the
// monitor's state with a zeroed block (returned), its mutex and events, and a
// mapping only when `withMapping`.
StateBlock* SetUpMonitor(bool withMapping);

// Removes the emulated registry store once random requests have made it
// large: every registry call reads the whole store, so a growing store would
// slow each execution down.
void KeepRegistrySmall();

// Installs `machine` as the computer and answers every open as it does,
// recording the path.
class RecordingComputer : public emu::DeviceProvider {
 public:
  explicit RecordingComputer(std::unique_ptr<sim::Machine> machine);
  sim::Machine& Inner() { return *machine_; }
  // The paths opened since the last call, in order.
  std::vector<std::u16string> TakeOpened();
  std::unique_ptr<emu::DeviceFile> Open(const WCHAR* path, DWORD access, DWORD share, DWORD flags,
                                        DWORD* error) override;

 private:
  std::unique_ptr<sim::Machine> machine_;
  std::mutex mutex_;
  std::vector<std::u16string> opened_;
};

// The checks on one dispatched request. `original` is the message as it
// arrived (`received` bytes), `reply` the `length` bytes sent back.
//   - the reply length is the declared length when it is in range, else 0;
//   - result and detail are ones the command's table row allows (`noDrives`:
//     the block holds no drive and no channel, so drive commands must fail);
//   - every byte the command does not write is the byte that arrived, and
//     zero where nothing arrived.
void CheckReply(const std::uint8_t* original, std::size_t received, const std::uint8_t* reply,
                std::size_t length, bool paused, bool noDrives);

}  // namespace fuzzsupport
