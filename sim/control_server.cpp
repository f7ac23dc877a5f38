#include "control_server.h"

#include <cctype>
#include <cstdio>
#include <cstdlib>
#include <mutex>
#include <thread>

#include "control_protocol.h"

namespace sim {
namespace {

std::string Error(const std::string& why) {
  return "error\n" + why;
}

bool ParseUnsigned(const std::string& text, unsigned long long limit, unsigned long long* value) {
  if (text.empty() || text.size() > 12) return false;
  for (const char c : text) {
    if (std::isdigit(static_cast<unsigned char>(c)) == 0) return false;
  }
  *value = std::strtoull(text.c_str(), nullptr, 10);
  return *value <= limit;
}

// DRIVE: the drive's name in the machine description, or its index.
const Machine::DriveSummary* FindDrive(const std::vector<Machine::DriveSummary>& drives,
                                       const std::string& text) {
  for (const auto& d : drives) {
    if (d.name == text) return &d;
  }
  unsigned long long index = 0;
  if (ParseUnsigned(text, 1000, &index)) {
    for (const auto& d : drives) {
      if (static_cast<unsigned long long>(d.index) == index) return &d;
    }
  }
  return nullptr;
}

// LETTER: "E" or "E:", either case.
bool ParseLetter(const std::string& text, char* letter) {
  if (text.empty() || text.size() > 2 || (text.size() == 2 && text[1] != ':')) return false;
  const int c = std::toupper(static_cast<unsigned char>(text[0]));
  if (c < 'A' || c > 'Z') return false;
  *letter = static_cast<char>(c);
  return true;
}

// Status page bytes 4-7: eight hexadecimal digits, blanks between them allowed.
bool ParseStatusHex(const std::string& text, std::uint8_t bytes[4]) {
  std::string digits;
  for (const char c : text) {
    if (c == ' ') continue;
    if (std::isxdigit(static_cast<unsigned char>(c)) == 0) return false;
    digits += c;
  }
  if (digits.size() != 8) return false;
  for (std::size_t i = 0; i < 4; ++i) {
    bytes[i] =
        static_cast<std::uint8_t>(std::strtoul(digits.substr(2 * i, 2).c_str(), nullptr, 16));
  }
  return true;
}

const char* BusName(Bus bus) {
  return bus == Bus::Usb ? "usb" : bus == Bus::Ieee1394 ? "1394" : "other";
}

const char* ChannelName(ChannelKind kind) {
  switch (kind) {
    case ChannelKind::Hid:
      return "hid";
    case ChannelKind::Driver:
      return "driver";
    case ChannelKind::Enclosure:
      return "enclosure";
    case ChannelKind::None:
      break;
  }
  return "none";
}

// The buttons a drive's front panel has: eject on every channel, and the two
// panel events where the channel carries them (an enclosure device reports
// the removal request only).
struct Button {
  const char* name;
  std::uint8_t bits;
};
constexpr Button kButtons[] = {{"eject", 0x04}, {"panel1", 0x01}, {"panel2", 0x02}};

bool HasButton(ChannelKind channel, const Button& button) {
  if (channel == ChannelKind::None) return false;
  return channel != ChannelKind::Enclosure || button.bits == 0x04;
}

// One line per drive, tab-separated: index, name, bus, channel, attached
// (disk present), connected, status bytes 4-7, sleep state, then one field
// per volume "E:size:free:held:present".
std::string List(const std::vector<Machine::DriveSummary>& drives) {
  std::string out;
  char status[16];
  for (const auto& d : drives) {
    std::snprintf(status, sizeof(status), "%02X%02X%02X%02X", d.status[0], d.status[1], d.status[2],
                  d.status[3]);
    out += std::to_string(d.index) + '\t' + d.name + '\t' + BusName(d.bus) + '\t' +
           ChannelName(d.channel) + '\t' + (d.attached ? "1" : "0") + '\t' +
           (d.connected ? "1" : "0") + '\t' + status + '\t' + std::to_string(d.sleepState);
    for (const auto& v : d.volumes) {
      out += '\t';
      out += v.letter;
      out += ':' + std::to_string(v.sizeBytes) + ':' + std::to_string(v.freeBytes) + ':' +
             (v.heldOpen ? "1" : "0") + ':' + (v.present ? "1" : "0");
    }
    out += '\n';
  }
  return out;
}

// A fault acts on the drive's devices (disk, HID collection, filter-driver
// interface, enclosure), not on the file system's volumes.
constexpr Endpoint kEndpoints[] = {Endpoint::Disk, Endpoint::Hid, Endpoint::Driver,
                                   Endpoint::Enclosure};

}  // namespace

std::string HandleControlRequest(Machine& machine, const std::vector<std::string>& words) {
  if (words.empty() || words[0].empty()) return Error("empty request");
  const std::string& verb = words[0];
  const std::size_t args = words.size() - 1;
  auto arity = [&](std::size_t wanted) { return args == wanted; };
  const auto drives = machine.Drives();

  if (verb == "list" && arity(0)) return "ok\n" + List(drives);
  if (verb == "add" && arity(1)) {
    std::vector<std::string> names;
    std::string why;
    if (!machine.PlugDrives(words[1], &names, &why)) return Error("cannot add: " + why);
    std::string out = "ok\n";
    for (const auto& name : names) out += "added " + name + '\n';
    return out;
  }
  if ((verb == "hold" || verb == "release" || verb == "fill") && args >= 1) {
    char letter = 0;
    Machine::VolumeSummary volume;
    if (!ParseLetter(words[1], &letter) || !machine.FindVolume(letter, &volume)) {
      return Error("unknown volume \"" + words[1] + "\"");
    }
    if (verb == "fill") {
      unsigned long long percent = 0;
      if (!arity(2) || !ParseUnsigned(words[2], 100, &percent)) {
        return Error("fill needs a percent from 0 to 100");
      }
      if (volume.sizeBytes == 0) return Error(std::string("volume ") + letter + " has no medium");
      const std::uint64_t used =
          volume.sizeBytes / 100 * percent + volume.sizeBytes % 100 * percent / 100;
      machine.SetFreeBytes(letter, volume.sizeBytes - used);
      return "ok\n";
    }
    if (!arity(1)) return Error(verb + " takes one volume letter");
    machine.SetVolumeHeldOpen(letter, verb == "hold");
    return "ok\n";
  }

  const bool driveVerb = verb == "press" || verb == "unplug" || verb == "plug" || verb == "fault" ||
                         verb == "status" || verb == "sleep";
  if (!driveVerb) return Error("unknown request \"" + verb + "\" or wrong number of arguments");
  if (args < 1) return Error(verb + " needs a drive");
  const Machine::DriveSummary* drive = FindDrive(drives, words[1]);
  if (drive == nullptr) return Error("unknown drive \"" + words[1] + "\"");
  const std::string& name = drive->name;

  if (verb == "press" && arity(2)) {
    for (const Button& button : kButtons) {
      if (words[2] != button.name) continue;
      if (!HasButton(drive->channel, button)) break;
      if (!drive->connected) return Error("drive " + name + " is unplugged");
      machine.Press(name, button.bits);
      return "ok\n";
    }
    return Error("drive " + name + " has no button \"" + words[2] + "\"");
  }
  if (verb == "unplug" && arity(1)) {
    if (!drive->connected) return Error("drive " + name + " is not plugged in");
    machine.Detach(name, ERROR_DEVICE_NOT_CONNECTED);
    return "ok\n";
  }
  if (verb == "plug" && arity(1)) {
    if (drive->attached) return Error("drive " + name + " is plugged in already");
    machine.Attach(name);
    return "ok\n";
  }
  if (verb == "status" && arity(2)) {
    std::uint8_t bytes[4];
    if (!ParseStatusHex(words[2], bytes)) {
      return Error("status needs bytes 4-7 as 8 hexadecimal digits, not \"" + words[2] + "\"");
    }
    machine.SetStatus(name, bytes);
    return "ok\n";
  }
  if (verb == "sleep" && arity(2)) {
    unsigned long long state = 0;
    if (!ParseUnsigned(words[2], 3, &state)) return Error("sleep state is 0, 1, 2 or 3");
    machine.SetSleepState(name, static_cast<std::uint8_t>(state));
    return "ok\n";
  }
  if (verb == "fault" && args >= 2) {
    const std::string& kind = words[2];
    if (kind == "slow-cancel") {
      unsigned long long ms = 0;
      if (!arity(3) || !ParseUnsigned(words[3], 3600000, &ms)) {
        return Error("slow-cancel needs a delay of 0 to 3600000 ms");
      }
      for (Endpoint e : kEndpoints) machine.SetCancelDelay(name, e, static_cast<DWORD>(ms));
      return "ok\n";
    }
    if (!arity(2)) return Error("fault " + kind + " takes no value");
    if (kind == "open") {
      for (Endpoint e : kEndpoints) machine.FailOpen(name, e, ERROR_GEN_FAILURE);
    } else if (kind == "io") {
      for (Endpoint e : kEndpoints) machine.FailIo(name, e, ERROR_GEN_FAILURE);
    } else if (kind == "hang") {
      for (Endpoint e : kEndpoints) machine.HangIo(name, e, true);
    } else if (kind == "clear") {
      machine.ClearFaults(name);
    } else {
      return Error("unknown fault \"" + kind + "\" (open, io, hang, slow-cancel MS, clear)");
    }
    return "ok\n";
  }
  return Error("wrong number of arguments for " + verb);
}

namespace {

// The server: one pipe instance, one client at a time; every wait also ends
// on the stop event, which the exit handler signals before joining.
struct Server {
  Machine* machine = nullptr;
  HANDLE stop = nullptr;
  std::thread thread;
};
Server* server = nullptr;

// A client gets this long (real time) for each step of its exchange.
constexpr DWORD kClientWaitMs = 10000;

// Waits for the overlapped operation or the stop; false on stop, failure or
// (for reads and writes) a client that takes longer than `timeoutMs`.
bool Finish(HANDLE pipe, OVERLAPPED* overlapped, BOOL started, DWORD* count, DWORD timeoutMs) {
  if (!started && GetLastError() != ERROR_IO_PENDING) {
    return GetLastError() == ERROR_PIPE_CONNECTED;
  }
  if (started) return GetOverlappedResult(pipe, overlapped, count, FALSE) != 0;
  HANDLE waits[2] = {server->stop, overlapped->hEvent};
  const DWORD woke = WaitForMultipleObjects(2, waits, FALSE, timeoutMs);
  if (woke != WAIT_OBJECT_0 + 1) {
    CancelIo(pipe);
    GetOverlappedResult(pipe, overlapped, count, TRUE);
    return false;
  }
  return GetOverlappedResult(pipe, overlapped, count, FALSE) != 0;
}

void Serve() {
  HANDLE pipe = CreateNamedPipeW(
      kControlPipeName, PIPE_ACCESS_DUPLEX | FILE_FLAG_OVERLAPPED | FILE_FLAG_FIRST_PIPE_INSTANCE,
      PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_WAIT, 1, kControlMessageMax,
      kControlMessageMax, 0, nullptr);
  if (pipe == INVALID_HANDLE_VALUE) {
    std::fprintf(stderr, "sim: the control channel cannot be served (error %lu)\n",
                 static_cast<unsigned long>(GetLastError()));
    return;
  }
  OVERLAPPED overlapped{};
  overlapped.hEvent = CreateEventW(nullptr, TRUE, FALSE, nullptr);
  std::vector<char> buffer(kControlMessageMax);
  while (overlapped.hEvent != nullptr && WaitForSingleObject(server->stop, 0) != WAIT_OBJECT_0) {
    DWORD count = 0;
    ResetEvent(overlapped.hEvent);
    BOOL started = ConnectNamedPipe(pipe, &overlapped);
    if (!Finish(pipe, &overlapped, started, &count, INFINITE)) {
      DisconnectNamedPipe(pipe);
      continue;
    }
    ResetEvent(overlapped.hEvent);
    started = ReadFile(pipe, buffer.data(), kControlMessageMax, &count, &overlapped);
    if (Finish(pipe, &overlapped, started, &count, kClientWaitMs)) {
      const std::string reply =
          HandleControlRequest(*server->machine, SplitRequest(std::string(buffer.data(), count)));
      ResetEvent(overlapped.hEvent);
      DWORD written = 0;
      started =
          WriteFile(pipe, reply.data(), static_cast<DWORD>(reply.size()), &written, &overlapped);
      // Disconnecting drops what the client has not read yet: wait until
      // it closes its end (the read ends with ERROR_BROKEN_PIPE).
      if (Finish(pipe, &overlapped, started, &written, kClientWaitMs)) {
        ResetEvent(overlapped.hEvent);
        started = ReadFile(pipe, buffer.data(), kControlMessageMax, &count, &overlapped);
        Finish(pipe, &overlapped, started, &count, kClientWaitMs);
      }
    }
    DisconnectNamedPipe(pipe);
  }
  if (overlapped.hEvent != nullptr) CloseHandle(overlapped.hEvent);
  CloseHandle(pipe);
}

void StopServer() {
  SetEvent(server->stop);
  if (server->thread.joinable()) server->thread.join();
  CloseHandle(server->stop);
  server->stop = nullptr;
}

}  // namespace

void StartControlServer(Machine* machine) {
  static std::once_flag once;
  std::call_once(once, [machine] {
    server = new Server;  // lives as long as the process, like the machine
    server->machine = machine;
    server->stop = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    if (server->stop == nullptr) return;
    server->thread = std::thread(Serve);
    std::atexit(StopServer);
  });
}

void RegisterControlledDefaultMachine() {
  emu::SetDefaultDeviceModelFactory([]() -> emu::DeviceModel* {
    // Lives as long as the process: device handles may outlive any owner.
    Machine* machine = CreateDefaultMachine().release();
    StartControlServer(machine);
    return machine;
  });
}

}  // namespace sim
