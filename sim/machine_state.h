// Inside the simulated computer: the state every part of it shares, guarded
// by one mutex. Never call back into the emulation (CompleteIo, event
// delivery) while holding it.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "machine.h"

namespace sim {

class SimFile;

struct Node {
  DEVINST id = 0;
  DEVINST parent = 0;
  std::u16string instanceId;
  std::u16string description;
  std::u16string friendlyName;
  std::u16string service;
  bool hasAddress = false;
  DWORD address = 0;
  bool hasCapabilities = false;
  DWORD capabilities = 0;
  GUID setupClass{};
  int drive = -1;  // owning drive, -1 for the machine's own nodes
};

struct Interface {
  GUID interfaceClass{};
  std::u16string path;
  // The name a device event carries: the instance ID in its own case (the
  // list's path is lower case), as Windows writes dbcc_name.
  std::u16string eventName;
  DEVINST node = 0;
  int drive = -1;
  bool openable = false;
  Endpoint endpoint = Endpoint::Disk;
  std::uint32_t foreignDisk = 0;  // index+1 into State::foreignDisks for foreign disks
};

struct EndpointFaults {
  DWORD openError = 0;
  int openTimes = 0;
  DWORD ioError = 0;
  int ioTimes = 0;
  DWORD ioCode = 0;
  bool hang = false;
  bool cancelDelayed = false;
  DWORD cancelDelayMs = 0;
};

struct DriveState {
  DriveSpec spec;
  int index = 0;
  bool attached = false;
  std::uint32_t diskNumber = 0;
  DWORD goneError = 0;  // error of handles left open when the drive went
  std::vector<DEVINST> nodes;
  std::deque<std::uint8_t> driverEvents;  // presses no wait has taken yet
  std::uint8_t enclosureBits = 0;         // latched until page 0x80 is read
  PNP_VETO_TYPE vetoType = PNP_VetoTypeUnknown;
  std::u16string vetoName;
  int vetoTimes = 0;
  EndpointFaults faults[5];
  EndpointFaults& Faults(Endpoint e) { return faults[static_cast<int>(e)]; }
};

struct VolumeState {
  VolumeSpec spec;
  int drive = -1;  // -1: a volume of no drive of the maker
  bool heldOpen = false;
  DWORD mediumError = 0;  // IOCTL_STORAGE_CHECK_VERIFY fails with it
  DWORD lockError = 0;    // FSCTL_LOCK_VOLUME fails with it
  DWORD dismountError = 0;
  bool mounted = true;
  int dismounts = 0;
  const SimFile* lockOwner = nullptr;
  DEVINST node = 0;
};

// A request held by the machine: a wait for an event, a hung request, or a
// cancel that completes late. `finish` writes the reply into the caller's
// buffers (under the machine's mutex) and returns the byte count.
struct HeldRequest {
  emu::IoRequestPtr request;
  SimFile* file = nullptr;
  enum class Kind { HidRead, DriverWait, Hung } kind = Kind::Hung;
  std::function<DWORD()> finish;
};

struct TimedCompletion {
  std::chrono::steady_clock::time_point due;
  emu::IoRequestPtr request;
  std::function<DWORD()> finish;
  DWORD error = ERROR_OPERATION_ABORTED;
};

struct QueuedEvent {
  DWORD type = 0;
  std::vector<std::uint8_t> record;
};

struct Machine::State {
  mutable std::mutex mutex;
  mutable std::condition_variable changed;
  emu::OsVersion os;
  DEVINST nextDevInst = 1;
  DEVINST root = 0;
  DEVINST usbHub = 0;
  DEVINST fireWireController = 0;
  DEVINST storageController = 0;
  DEVINST volumeManager = 0;
  std::map<DEVINST, Node> nodes;  // present nodes
  std::vector<Interface> interfaces;
  std::vector<std::unique_ptr<DriveState>> drives;
  std::vector<DriveSpec> foreignDisks;
  std::vector<std::uint32_t> foreignDiskNumbers;
  Language language = Language::English;
  std::vector<VolumeState> volumes;
  std::uint32_t nextDiskNumber = 1;
  // The most recent commands, at most kCommandRecordLimit: a machine that
  // runs for days (the demo service) must not grow without end.
  std::deque<Command> commands;
  static constexpr std::size_t kCommandRecordLimit = 1 << 16;
  std::uint64_t nextSequence = 1;
  std::vector<Machine::EjectRequest> ejects;
  std::set<std::string> removedExports;  // "module!name"
  std::set<std::string> failingModules;
  std::vector<std::pair<GUID, DWORD>> failingLists;
  std::function<void(DWORD, const void*)> eventSink;
  std::vector<SimFile*> files;
  std::vector<HeldRequest> held;
  std::vector<TimedCompletion> heldCancels;  // INFINITE delay
  // Timer for cancels that complete late.
  std::vector<TimedCompletion> timed;
  std::condition_variable timerWake;
  std::thread timer;
  // Device events go out on their own thread, as Plug and Play delivers
  // them: an eject requested with a lock held must not wait for handlers
  // that need the same lock.
  std::deque<QueuedEvent> events;
  bool delivering = false;
  std::condition_variable eventWake;
  std::thread eventThread;
  bool stopping = false;

  DriveState* FindDrive(const std::string& name);
  const DriveState* FindDrive(const std::string& name) const;
  Node* FindNode(DEVINST id);
  VolumeState* FindVolume(char letter);  // present volumes only
  bool VolumePresent(const VolumeState& volume) const;
  DEVINST NewNode(DEVINST parent, std::u16string instanceId, std::u16string description, int drive);
  void AddInterfaceLocked(DEVINST node, const GUID& interfaceClass, std::u16string path, int drive,
                          bool openable, Endpoint endpoint);
  void Record(Command command);
  std::string DriveName(int drive) const;
  // Builds a drive's nodes and interfaces (on attach).
  void BuildDriveNodes(DriveState& drive);
  void RemoveDriveNodes(DriveState& drive);
  // Removes the node and everything below it (the drive's volumes go with
  // its disk); the drive stays attached when something of it is left.
  // Returns the requests to complete with ERROR_DEVICE_NOT_CONNECTED.
  std::vector<HeldRequest> RemoveSubtree(DriveState& drive, DEVINST top);
  bool DiskPresent(const DriveState& drive) const;
  // Moves every held request of the drive's files out, marking them gone.
  std::vector<HeldRequest> TakeDriveRequests(int drive, DWORD error);
  void ScheduleLateCompletion(TimedCompletion completion);
  void TimerLoop();
  std::vector<QueuedEvent> DriveEvents(int drive, DWORD type) const;
  void QueueEvents(std::vector<QueuedEvent> queued);
  void EventLoop();
};

// Setup classes of the machine's nodes.
extern const GUID kSetupClassDisk;
extern const GUID kSetupClassUsb;
extern const GUID kSetupClassHid;
extern const GUID kSetupClass1394;
extern const GUID kSetupClassVolume;

constexpr DWORD kArrival = 0x8000;         // DBT_DEVICEARRIVAL
constexpr DWORD kRemoveComplete = 0x8004;  // DBT_DEVICEREMOVECOMPLETE

// Text helpers.
std::u16string Widen(std::string_view text);
std::string Narrow(std::u16string_view text);
std::u16string UpperAscii(std::u16string text);
std::u16string LowerAscii(std::u16string text);
bool EqualNoCase(std::u16string_view a, std::u16string_view b);
std::string GuidText(const GUID& guid);  // "{53F56307-B6BF-11D0-94F2-00A0C91EFB8B}"
// "\\?\" + the instance ID with '\' as '#', lower case, + "#" + class, lower case.
std::u16string InterfacePath(std::u16string_view instanceId, const GUID& interfaceClass);
// The same path with the instance ID in its own case, as device events carry it.
std::u16string InterfaceEventName(std::u16string_view instanceId, const GUID& interfaceClass);
std::string HexOfText(std::string_view text);
std::string TrimAscii(std::string_view text);
// The unit serial of a drive (page 0x80 and the USB serial's source).
std::string UnitSerial(const DriveSpec& spec);
// The USB serial number (the HID serial string and the instance IDs' tail).
std::string UsbSerial(const DriveSpec& spec);
// The 1394 unique ID of the drive's unit, 16 hexadecimal digits.
std::string UnitId(const DriveSpec& spec, int index);
// The 64-bit identity the button filter driver reports.
std::uint64_t Identity(const DriveSpec& spec, int index);

// The drive blocks of a description text (description.cpp); false with
// *error when the text is not valid or has anything but drive blocks.
bool ReadDriveBlocks(std::string_view text, std::vector<DriveSpec>* drives, std::string* error);

// SCSI answers of a drive (scsi.cpp). `dataIn` receives the data the command
// returns; the result is the SCSI status (0 good, 2 check condition).
std::uint8_t ExecuteScsi(DriveState* drive, const DriveSpec& spec, bool enclosureDevice,
                         const std::uint8_t* cdb, std::size_t cdbLength,
                         const std::vector<std::uint8_t>& dataOut,
                         std::vector<std::uint8_t>* dataIn);

}  // namespace sim
