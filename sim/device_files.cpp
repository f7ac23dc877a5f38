// The I/O of the simulated devices: SCSI pass-through on disks and enclosure
// devices, the button filter driver's controls, HID reads, writes and class
// controls, and the storage and volume controls.
#include <algorithm>
#include <chrono>
#include <cstring>

#include "platform/diagnostics.h"
#include "sim_file.h"

namespace sim {
namespace {

constexpr DWORD kCtlWaitEvent = 0x223C04;
constexpr DWORD kCtlWaitGaugeEvent = 0x222048;
constexpr DWORD kCtlGetIdentity = 0x223C10;
constexpr DWORD kCtlClearEvent = 0x223C1C;
constexpr DWORD kCtlClearGaugeEvent = 0x222054;
// The other controls the button filter driver accepts (no output).
constexpr DWORD kDriverCommands[] = {0x222040, 0x222050, 0x222054, 0x223C08, 0x223C0C, 0x223C14,
                                     0x223C18, 0x223C1C, 0x223C20, 0x223C24, 0x223C28};
static_assert(kCtlWaitEvent ==
              CTL_CODE(FILE_DEVICE_UNKNOWN, 0xF01, METHOD_BUFFERED, FILE_ANY_ACCESS));
static_assert(kCtlWaitGaugeEvent ==
              CTL_CODE(FILE_DEVICE_UNKNOWN, 0x812, METHOD_BUFFERED, FILE_ANY_ACCESS));
constexpr DWORD kCheckVerify2 =
    CTL_CODE(FILE_DEVICE_MASS_STORAGE, 0x200, METHOD_BUFFERED, FILE_ANY_ACCESS);
constexpr DWORD kErrorNotLocked = 158;
constexpr DWORD kFileDeviceDisk = FILE_DEVICE_DISK;
constexpr DWORD kFileDeviceCdRom = FILE_DEVICE_CD_ROM;

// What a request is addressed to; copied into late completions so they do
// not depend on the file staying open.
struct Target {
  std::shared_ptr<Machine::State> state;
  int drive;
  Endpoint endpoint;
  char volume;
  std::uint32_t foreignDisk;
  const SimFile* file;  // identity only (volume locks), never dereferenced
};

emu::IoStart Done(DWORD error, DWORD bytes = 0) {
  emu::IoStart start;
  start.error = error;
  start.bytes = bytes;
  return start;
}

emu::IoStart Pending() {
  emu::IoStart start;
  start.pending = true;
  return start;
}

const DriveSpec* SpecOf(const Target& t) {
  if (t.drive >= 0) return &t.state->drives[static_cast<std::size_t>(t.drive)]->spec;
  if (t.foreignDisk > 0) return &t.state->foreignDisks[t.foreignDisk - 1];
  return nullptr;
}

emu::IoStart PassThrough(const Target& t, const void* input, DWORD inputLength, void* output,
                         DWORD outputLength) {
  const DriveSpec* spec = SpecOf(t);
  if (spec == nullptr || input == nullptr || output == nullptr ||
      inputLength < sizeof(SCSI_PASS_THROUGH_DIRECT) ||
      outputLength < sizeof(SCSI_PASS_THROUGH_DIRECT)) {
    return Done(ERROR_INVALID_PARAMETER);
  }
  SCSI_PASS_THROUGH_DIRECT sptd;
  std::memcpy(&sptd, input, sizeof sptd);
  if (sptd.Length != sizeof sptd || sptd.CdbLength == 0 || sptd.CdbLength > 16 ||
      (sptd.DataTransferLength > 0 && sptd.DataBuffer == nullptr)) {
    return Done(ERROR_INVALID_PARAMETER);
  }
  auto* buffer = static_cast<std::uint8_t*>(sptd.DataBuffer);
  std::vector<std::uint8_t> dataOut;
  if (sptd.DataIn == SCSI_IOCTL_DATA_OUT) dataOut.assign(buffer, buffer + sptd.DataTransferLength);
  std::vector<std::uint8_t> dataIn;
  DriveState* drive =
      t.drive >= 0 ? t.state->drives[static_cast<std::size_t>(t.drive)].get() : nullptr;
  std::uint8_t status = ExecuteScsi(drive, *spec, t.endpoint == Endpoint::Enclosure, sptd.Cdb,
                                    sptd.CdbLength, dataOut, &dataIn);
  if (sptd.DataIn == SCSI_IOCTL_DATA_IN) {
    DWORD n = std::min<DWORD>(static_cast<DWORD>(dataIn.size()), sptd.DataTransferLength);
    if (n > 0) std::memcpy(buffer, dataIn.data(), n);
    sptd.DataTransferLength = n;
  }
  DWORD bytes = sizeof sptd;
  if (status != 0) {
    // Fixed-format sense: ILLEGAL REQUEST, INVALID FIELD IN CDB.
    const std::uint8_t sense[18] = {0x70, 0, 0x05, 0, 0, 0, 0, 10, 0, 0, 0, 0, 0x24, 0, 0, 0, 0, 0};
    std::size_t n = std::min<std::size_t>(sptd.SenseInfoLength, sizeof sense);
    if (n > 0 && sptd.SenseInfoOffset >= sizeof sptd && sptd.SenseInfoOffset + n <= outputLength) {
      std::memcpy(static_cast<std::uint8_t*>(output) + sptd.SenseInfoOffset, sense, n);
      sptd.SenseInfoLength = static_cast<UCHAR>(n);
      bytes = static_cast<DWORD>(sptd.SenseInfoOffset + n);
    } else {
      sptd.SenseInfoLength = 0;
    }
    if (sptd.DataIn == SCSI_IOCTL_DATA_IN) sptd.DataTransferLength = 0;
  } else {
    sptd.SenseInfoLength = 0;
  }
  sptd.ScsiStatus = status;
  std::memmove(output, &sptd, sizeof sptd);
  return Done(ERROR_SUCCESS, bytes);
}

emu::IoStart DeviceNumber(DWORD type, DWORD number, DWORD partition, void* output,
                          DWORD outputLength) {
  if (output == nullptr || outputLength < sizeof(STORAGE_DEVICE_NUMBER)) {
    return Done(ERROR_INSUFFICIENT_BUFFER);
  }
  STORAGE_DEVICE_NUMBER result{type, number, partition};
  std::memcpy(output, &result, sizeof result);
  return Done(ERROR_SUCCESS, sizeof result);
}

emu::IoStart VolumeControl(const Target& t, DWORD code, void* output, DWORD outputLength) {
  VolumeState* v = t.state->FindVolume(t.volume);
  if (v == nullptr) return Done(ERROR_DEVICE_NOT_CONNECTED);
  // The file system mounts a dismounted volume again at its first access
  // once nobody holds it locked.
  if (v->lockOwner == nullptr) v->mounted = true;
  switch (code) {
    case IOCTL_STORAGE_GET_DEVICE_NUMBER:
      return DeviceNumber(v->spec.driveType == DRIVE_CDROM ? kFileDeviceCdRom : kFileDeviceDisk,
                          v->spec.diskNumber, v->spec.partition, output, outputLength);
    case IOCTL_STORAGE_CHECK_VERIFY:
    case kCheckVerify2:
      return Done(v->mediumError);
    case FSCTL_LOCK_VOLUME:
      if (v->lockError != 0) return Done(v->lockError);
      if (v->heldOpen || (v->lockOwner != nullptr && v->lockOwner != t.file)) {
        return Done(ERROR_ACCESS_DENIED);
      }
      v->lockOwner = t.file;
      return Done(ERROR_SUCCESS);
    case FSCTL_UNLOCK_VOLUME:
      if (v->lockOwner != t.file) return Done(kErrorNotLocked);
      v->lockOwner = nullptr;
      return Done(ERROR_SUCCESS);
    case FSCTL_DISMOUNT_VOLUME:
      if (v->dismountError != 0) return Done(v->dismountError);
      ++v->dismounts;
      v->mounted = false;
      return Done(ERROR_SUCCESS);
    default:
      return Done(ERROR_INVALID_FUNCTION);
  }
}

emu::IoStart DriverControl(const Target& t, DWORD code, DWORD inputLength, void* output,
                           DWORD outputLength) {
  DriveState& d = *t.state->drives[static_cast<std::size_t>(t.drive)];
  if (code == kCtlGetIdentity) {
    if (output == nullptr || outputLength < 8) return Done(ERROR_INSUFFICIENT_BUFFER);
    std::uint64_t identity = Identity(d.spec, d.index);
    auto* out = static_cast<std::uint8_t*>(output);
    for (int i = 0; i < 8; ++i) out[i] = static_cast<std::uint8_t>(identity >> (8 * i));
    return Done(ERROR_SUCCESS, 8);
  }
  if (std::find(std::begin(kDriverCommands), std::end(kDriverCommands), code) ==
      std::end(kDriverCommands)) {
    return Done(ERROR_INVALID_FUNCTION);
  }
  if (inputLength != 0 && inputLength < 4) return Done(ERROR_INVALID_PARAMETER);
  if (code == kCtlClearEvent || code == kCtlClearGaugeEvent) d.driverEvents.clear();
  return Done(ERROR_SUCCESS);
}

emu::IoStart HidControl(const Target& t, DWORD code, const void* input, DWORD inputLength,
                        void* output, DWORD outputLength) {
  const DriveSpec& spec = t.state->drives[static_cast<std::size_t>(t.drive)]->spec;
  if (output == nullptr || outputLength == 0) return Done(ERROR_INVALID_USER_BUFFER);
  if (code == emu::kHidIoctlGetSerialNumberString) {
    // As much of the string and its terminator as fits.
    std::u16string serial = Widen(UsbSerial(spec));
    std::size_t units = std::min<std::size_t>(outputLength / 2, serial.size() + 1);
    std::memcpy(output, serial.c_str(), units * 2);
    return Done(ERROR_SUCCESS, static_cast<DWORD>(units * 2));
  }
  if (code == emu::kHidIoctlGetInputReport) {
    if (input == nullptr || inputLength == 0) return Done(ERROR_INVALID_USER_BUFFER);
    const std::uint8_t id = *static_cast<const std::uint8_t*>(input);
    // A collection without input reports has none to give.
    if (spec.hidInputReportLength == 0) return Done(ERROR_INVALID_FUNCTION);
    std::vector<std::uint8_t> report(spec.hidInputReportLength, 0);
    report.front() = id;
    if (id == 2 && report.size() >= 5) {
      report[1] = spec.status[3];
      report[2] = spec.status[2];
      report[3] = spec.status[1];
      report[4] = spec.status[0];
    } else if (id == 3 && report.size() >= 2) {
      report[1] = spec.sleepState;
    } else {
      return Done(ERROR_GEN_FAILURE);
    }
    DWORD n = std::min<DWORD>(outputLength, static_cast<DWORD>(report.size()));
    std::memcpy(output, report.data(), n);
    return Done(ERROR_SUCCESS, n);
  }
  return Done(ERROR_INVALID_FUNCTION);
}

// The answer to a control that is not a wait, under the machine's mutex.
emu::IoStart Answer(const Target& t, DWORD code, const void* input, DWORD inputLength, void* output,
                    DWORD outputLength) {
  switch (t.endpoint) {
    case Endpoint::Disk:
      if (code == IOCTL_SCSI_PASS_THROUGH_DIRECT) {
        return PassThrough(t, input, inputLength, output, outputLength);
      }
      if (code == IOCTL_STORAGE_GET_DEVICE_NUMBER) {
        DWORD number = t.drive >= 0 ? t.state->drives[static_cast<std::size_t>(t.drive)]->diskNumber
                                    : t.state->foreignDiskNumbers[t.foreignDisk - 1];
        return DeviceNumber(kFileDeviceDisk, number, 0, output, outputLength);
      }
      if (code == IOCTL_STORAGE_CHECK_VERIFY || code == kCheckVerify2) return Done(ERROR_SUCCESS);
      return Done(ERROR_INVALID_FUNCTION);
    case Endpoint::Enclosure:
      if (code == IOCTL_SCSI_PASS_THROUGH_DIRECT) {
        return PassThrough(t, input, inputLength, output, outputLength);
      }
      return Done(ERROR_INVALID_FUNCTION);
    case Endpoint::Volume:
      return VolumeControl(t, code, output, outputLength);
    case Endpoint::Driver:
      return DriverControl(t, code, inputLength, output, outputLength);
    case Endpoint::Hid:
      return HidControl(t, code, input, inputLength, output, outputLength);
  }
  return Done(ERROR_INVALID_FUNCTION);
}

std::vector<std::uint8_t> Bytes(const void* data, DWORD length) {
  auto* p = static_cast<const std::uint8_t*>(data);
  return p != nullptr ? std::vector<std::uint8_t>(p, p + length) : std::vector<std::uint8_t>();
}

// Copies the oldest waiting HID report into a read's buffer.
DWORD TakeReport(SimFile* file, void* buffer, DWORD length) {
  if (file->reports.empty()) return 0;
  std::vector<std::uint8_t> report = std::move(file->reports.front());
  file->reports.pop_front();
  DWORD n = std::min<DWORD>(length, static_cast<DWORD>(report.size()));
  std::memcpy(buffer, report.data(), n);
  return n;
}

}  // namespace

// Constructed by Machine::Open with the machine's mutex held.
SimFile::SimFile(std::shared_ptr<Machine::State> state, int driveIndex, Endpoint endpointKind,
                 char volumeLetter, std::uint32_t foreign, DWORD accessRights)
    : drive(driveIndex),
      endpoint(endpointKind),
      volume(volumeLetter),
      foreignDisk(foreign),
      access(accessRights),
      state_(std::move(state)) {
  state_->files.push_back(this);
}

SimFile::~SimFile() {
  Unregister();
}

void SimFile::Closed() {
  Unregister();
}

void SimFile::Unregister() {
  std::vector<emu::IoRequestPtr> leftovers;
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    if (!registered_) return;
    registered_ = false;
    auto& files = state_->files;
    files.erase(std::remove(files.begin(), files.end(), this), files.end());
    auto& held = state_->held;
    for (auto it = held.begin(); it != held.end();) {
      if (it->file == this) {
        leftovers.push_back(it->request);
        it = held.erase(it);
      } else {
        ++it;
      }
    }
    for (auto& v : state_->volumes) {
      if (v.lockOwner == this) v.lockOwner = nullptr;
    }
    state_->changed.notify_all();
  }
  for (auto& r : leftovers) emu::CompleteIo(r, ERROR_OPERATION_ABORTED, 0);
}

bool SimFile::Precheck(DWORD code, emu::IoStart* start) {
  if (gone) {
    *start = Done(goneError);
    return true;
  }
  if (drive >= 0) {
    EndpointFaults& f = state_->drives[static_cast<std::size_t>(drive)]->Faults(endpoint);
    if (f.ioTimes != 0 && (f.ioCode == 0 || f.ioCode == code)) {
      if (f.ioTimes > 0) --f.ioTimes;
      *start = Done(f.ioError);
      return true;
    }
  }
  return false;
}

emu::IoStart SimFile::Control(DWORD code, const void* input, DWORD inputLength, void* output,
                              DWORD outputLength, const emu::IoRequestPtr& request) {
  const DWORD threadId = GetCurrentThreadId();
  std::lock_guard<std::mutex> lock(state_->mutex);
  Command command;
  command.threadId = threadId;
  command.endpoint = endpoint;
  command.drive = drive >= 0        ? state_->DriveName(drive)
                  : foreignDisk > 0 ? state_->foreignDisks[foreignDisk - 1].name
                  : volume != 0     ? std::string("volume ") + volume
                                    : std::string();
  command.code = code;
  DWORD matchCode = code;
  if (code == IOCTL_SCSI_PASS_THROUGH_DIRECT && input != nullptr &&
      inputLength >= sizeof(SCSI_PASS_THROUGH_DIRECT)) {
    SCSI_PASS_THROUGH_DIRECT sptd;
    std::memcpy(&sptd, input, sizeof sptd);
    command.kind = Command::Kind::Scsi;
    command.cdb.assign(sptd.Cdb, sptd.Cdb + std::min<int>(sptd.CdbLength, 16));
    command.code = sptd.Cdb[0];
    matchCode = sptd.Cdb[0];
    if (sptd.DataIn == SCSI_IOCTL_DATA_OUT && sptd.DataBuffer != nullptr) {
      command.data = Bytes(sptd.DataBuffer, sptd.DataTransferLength);
    }
  } else if (endpoint == Endpoint::Hid) {
    command.kind = code == emu::kHidIoctlGetSerialNumberString ? Command::Kind::HidSerial
                                                               : Command::Kind::HidInputReport;
    if (input != nullptr && inputLength > 0) command.data = Bytes(input, 1);
  } else if (endpoint == Endpoint::Volume) {
    command.kind = Command::Kind::Volume;
  } else {
    command.kind = Command::Kind::Control;
    command.data = Bytes(input, inputLength);
  }
  state_->Record(std::move(command));

  emu::IoStart start;
  if (Precheck(matchCode, &start)) return start;
  Target target{state_, drive, endpoint, volume, foreignDisk, this};
  if (endpoint == Endpoint::Driver && (code == kCtlWaitEvent || code == kCtlWaitGaugeEvent)) {
    if (output == nullptr || outputLength < 4) return Done(ERROR_INSUFFICIENT_BUFFER);
    DriveState& d = *state_->drives[static_cast<std::size_t>(drive)];
    auto finish = [state = state_, driveIndex = drive, output]() -> DWORD {
      DriveState& ds = *state->drives[static_cast<std::size_t>(driveIndex)];
      if (ds.driverEvents.empty()) return 0;
      auto* out = static_cast<std::uint8_t*>(output);
      out[0] = ds.driverEvents.front();
      out[1] = out[2] = out[3] = 0;
      ds.driverEvents.pop_front();
      return 4;
    };
    const bool hang = d.Faults(endpoint).hang;
    if (!d.driverEvents.empty() && !hang) return Done(ERROR_SUCCESS, finish());
    // A hung wait is not answered by presses either.
    state_->held.push_back(
        {request, this, hang ? HeldRequest::Kind::Hung : HeldRequest::Kind::DriverWait, finish});
    state_->changed.notify_all();
    return Pending();
  }
  if (drive >= 0 && state_->drives[static_cast<std::size_t>(drive)]->Faults(endpoint).hang) {
    std::vector<std::uint8_t> inputCopy = Bytes(input, inputLength);
    auto finish = [target, code, inputCopy, output, outputLength]() -> DWORD {
      return Answer(target, code, inputCopy.data(), static_cast<DWORD>(inputCopy.size()), output,
                    outputLength)
          .bytes;
    };
    state_->held.push_back({request, this, HeldRequest::Kind::Hung, finish});
    state_->changed.notify_all();
    return Pending();
  }
  return Answer(target, code, input, inputLength, output, outputLength);
}

emu::IoStart SimFile::Read(void* buffer, DWORD length, const emu::IoRequestPtr& request) {
  std::lock_guard<std::mutex> lock(state_->mutex);
  emu::IoStart start;
  if (Precheck(0, &start)) return start;
  if (endpoint != Endpoint::Hid) return Done(ERROR_INVALID_FUNCTION);
  if ((access & GENERIC_READ) == 0) return Done(ERROR_ACCESS_DENIED);
  const DriveSpec& spec = state_->drives[static_cast<std::size_t>(drive)]->spec;
  if (buffer == nullptr || length < spec.hidInputReportLength) {
    return Done(ERROR_INVALID_USER_BUFFER);
  }
  const bool hang = state_->drives[static_cast<std::size_t>(drive)]->Faults(endpoint).hang;
  if (!reports.empty() && !hang) return Done(ERROR_SUCCESS, TakeReport(this, buffer, length));
  auto finish = [this, buffer, length]() -> DWORD { return TakeReport(this, buffer, length); };
  state_->held.push_back(
      {request, this, hang ? HeldRequest::Kind::Hung : HeldRequest::Kind::HidRead, finish});
  state_->changed.notify_all();
  return Pending();
}

emu::IoStart SimFile::Write(const void* buffer, DWORD length, const emu::IoRequestPtr& request) {
  const DWORD threadId = GetCurrentThreadId();
  std::lock_guard<std::mutex> lock(state_->mutex);
  if (endpoint == Endpoint::Hid) {
    Command command;
    command.threadId = threadId;
    command.drive = state_->DriveName(drive);
    command.endpoint = endpoint;
    command.kind = Command::Kind::HidOutput;
    command.code = buffer != nullptr && length > 0 ? *static_cast<const std::uint8_t*>(buffer) : 0;
    command.data = Bytes(buffer, length);
    state_->Record(std::move(command));
  }
  emu::IoStart start;
  if (Precheck(0, &start)) return start;
  if (endpoint != Endpoint::Hid) return Done(ERROR_INVALID_FUNCTION);
  if ((access & GENERIC_WRITE) == 0) return Done(ERROR_ACCESS_DENIED);
  if (buffer == nullptr || length == 0) return Done(ERROR_INVALID_USER_BUFFER);
  if (state_->drives[static_cast<std::size_t>(drive)]->Faults(endpoint).hang) {
    state_->held.push_back({request, this, HeldRequest::Kind::Hung, [length] { return length; }});
    state_->changed.notify_all();
    return Pending();
  }
  return Done(ERROR_SUCCESS, length);
}

void SimFile::Cancel(const emu::IoRequestPtr& request) {
  {
    std::lock_guard<std::mutex> lock(state_->mutex);
    auto& held = state_->held;
    auto it = std::find_if(held.begin(), held.end(),
                           [&](const HeldRequest& h) { return h.request == request; });
    if (it != held.end()) {
      HeldRequest h = std::move(*it);
      held.erase(it);
      state_->changed.notify_all();
      const EndpointFaults* f =
          drive >= 0 ? &state_->drives[static_cast<std::size_t>(drive)]->Faults(endpoint) : nullptr;
      if (f != nullptr && f->cancelDelayed) {
        TimedCompletion late;
        late.request = h.request;
        // A request that had reached the device still delivers its reply.
        if (h.kind == HeldRequest::Kind::Hung && h.file == this && endpoint != Endpoint::Hid) {
          late.finish = h.finish;
        }
        if (f->cancelDelayMs == INFINITE) {
          state_->heldCancels.push_back(std::move(late));
        } else {
          auto scaled =
              std::chrono::duration<double, std::milli>(f->cancelDelayMs * platform::TimeScale());
          late.due = std::chrono::steady_clock::now() +
                     std::chrono::duration_cast<std::chrono::steady_clock::duration>(scaled);
          state_->ScheduleLateCompletion(std::move(late));
        }
        return;
      }
    }
    // A request whose cancellation is already under way is not hurried by
    // a second CancelIo.
    auto cancelling = [&](const TimedCompletion& c) { return c.request == request; };
    if (std::any_of(state_->heldCancels.begin(), state_->heldCancels.end(), cancelling) ||
        std::any_of(state_->timed.begin(), state_->timed.end(), cancelling)) {
      return;
    }
  }
  emu::CompleteIo(request, ERROR_OPERATION_ABORTED, 0);
}

}  // namespace sim
