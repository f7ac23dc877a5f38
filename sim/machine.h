// The simulated computer: a Plug and Play tree with the maker's drives on it,
// their disks, HID collections, button-filter-driver interfaces and enclosure
// devices, volumes with drive letters, the OS version, fault injection and a
// record of everything the drives were sent.
//
// Tests build a Machine through this API (or from a description text, see
// README.md), install it, and run the service against it; the emulation's
// device calls (SetupDi*, CM_*, HidD_*, CreateFileW on device paths, ...) are
// answered from it. Every member is safe to call from any thread.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/posix/device_model.h"
#include "platform/win32.h"

namespace sim {

enum class Bus { Usb, Ieee1394, Other };
// How a drive's front panel reaches the service.
enum class ChannelKind {
  None,       // no control channel
  Hid,        // HID collection of the USB device (input report 1 carries events)
  Driver,     // interface of the button filter driver (event-wait controls)
  Enclosure,  // IEEE 1394 enclosure-services device (diagnostic page 0x80)
};
// The display language of the system: device descriptions are written in it.
enum class Language { English, German, Japanese };

// The parts of a drive that can be opened, for fault injection and records.
enum class Endpoint { Disk, Hid, Driver, Enclosure, Volume };

const char* EndpointName(Endpoint endpoint);

struct VolumeSpec {
  char letter = 'E';
  UINT driveType = DRIVE_FIXED;
  std::uint64_t sizeBytes = 500ull << 30;
  std::uint64_t freeBytes = 100ull << 30;
  std::uint32_t partition = 1;
  // For volumes that belong to no drive (system disk, CD-ROM): the disk
  // number the volume reports; ignored for a drive's volumes.
  std::uint32_t diskNumber = 0;
};

// Everything a drive is. Empty identifiers are derived from the rest (see
// README.md for the derivations); set them to test odd devices.
struct DriveSpec {
  std::string name;  // key for tests and the record, e.g. "gauge"
  Bus bus = Bus::Usb;
  ChannelKind channel = ChannelKind::Hid;

  // Standard INQUIRY data (74 bytes).
  std::uint8_t peripheral = 0x00;
  std::uint8_t additionalLength = 69;
  std::string vendor = "QX";             // bytes 8-15
  std::string product = "External HDD";  // bytes 16-31
  std::string revision = "0100";         // bytes 32-35
  std::string modelCode = "7B44";        // bytes 36-39
  std::string serial = "QX-7K2A9F31";    // bytes 40-57
  std::string modelText = "QX Vantage";  // bytes 58-73

  // Vital product data.
  std::vector<std::uint8_t> vpdPages = {0x00, 0x01, 0x02, 0x80, 0xC0, 0xC1};
  std::string asciiInfo1 = "FW 1.00 2004-11-02";
  std::string asciiInfo2 = "BRIDGE 2.10";
  std::string unitSerial;              // page 0x80; empty: the serial text without "QX-"
  bool rcsIdentity = true;             // page 0xC0 bytes 16-18 "RCS"
  std::string vendorCode = "QXD0001";  // page 0xC1, descriptor tagged 0x80
  std::uint8_t vendorCodeSlot = 1;     // which of the page's four descriptors it is

  // READ CAPACITY(10).
  std::uint32_t lastLba = 976773167;
  std::uint32_t blockLength = 512;

  // Status page 0x82 bytes 4-7 and sleep state (page 0x83 byte 4 bits 6-7).
  std::uint8_t status[4] = {0x40, 0x00, 0x00, 0x00};
  std::uint8_t sleepState = 0;

  // Bus identity.
  std::string usbVid = "1A2B";
  std::string usbPid;                      // empty: the model code
  std::string usbSerial;                   // empty: the unit serial as hexadecimal digit pairs
  std::string unitId;                      // IEEE 1394 unique ID, 16 hexadecimal digits
  std::string unitModel = "EXTERNAL_HDD";  // IEEE 1394 unit model text
  std::uint64_t identity = 0;              // filter-driver identity; 0: the unit ID's value
  std::uint32_t busAddress = 1;
  std::string friendlyName;      // empty: derived as Windows names the disk
  DWORD parentCapabilities = 0;  // 0: derived (USB 0x84, IEEE 1394 0x04)
  std::string parentService;     // empty: derived ("usbccgp", "sbp2port")
  // Vendor interface class (1 = A, 2 = B, 3 = C) of the driver channel and of
  // the enclosure device.
  int driverClass = 1;
  int enclosureClass = 3;
  // HID report IDs: true for models whose output report carries ID 1.
  std::uint16_t hidInputReportLength = 16;

  // Identifier overrides.
  std::string diskInstanceId;
  std::string parentInstanceId;  // the disk's parent (USB function or 1394 unit)
  std::string diskPath;
  std::string hidInstanceId;
  std::string controlInstanceId;  // driver channel or enclosure device node

  std::vector<VolumeSpec> volumes;
};

// One thing a drive was sent, in time order across the machine.
struct Command {
  std::uint64_t sequence = 0;
  std::string drive;
  Endpoint endpoint = Endpoint::Disk;
  enum class Kind { Scsi, Control, HidOutput, HidInputReport, HidSerial, Volume } kind = Kind::Scsi;
  DWORD code = 0;                  // control code; SCSI: the CDB's operation code
  std::vector<std::uint8_t> cdb;   // SCSI only
  std::vector<std::uint8_t> data;  // data out (SCSI), control input, HID report
  DWORD threadId = 0;
};
std::string Describe(const Command& command);

class Machine : public emu::DeviceModel {
 public:
  Machine();
  ~Machine() override;

  // ---- Building ----
  void SetOsVersion(DWORD major, DWORD minor, DWORD build = 2195,
                    DWORD platformId = VER_PLATFORM_WIN32_NT);
  // Applies to device nodes built after the call (drives attached later).
  void SetLanguage(Language language);
  // Adds a drive; it is present from the start (no arrival events) unless
  // `attached` is false.
  void AddDrive(const DriveSpec& spec, bool attached = true);
  // A volume on no drive of the maker (system disk, CD-ROM, network...).
  void AddVolume(const VolumeSpec& volume);
  // A disk of another maker (answers INQUIRY from `spec`), attached under
  // the machine's storage controller with the given instance ID and path.
  void AddForeignDisk(const DriveSpec& spec, const std::string& instanceId, const std::string& path,
                      std::uint32_t diskNumber);
  // Free-form nodes and interfaces (a mouse's HID collection, ...).
  DEVINST AddNode(DEVINST parent, const std::string& instanceId, const std::string& description,
                  const std::string& friendlyName = "", const std::string& service = "");
  DEVINST RootNode() const;
  void AddInterface(DEVINST node, const GUID& interfaceClass, const std::string& path = "");
  // The disk number given to a drive's disk (in the order drives are added,
  // after the foreign disks' numbers).
  std::uint32_t DiskNumber(const std::string& drive) const;

  // ---- Installation as the computer the emulation runs on ----
  void Install();
  void Uninstall();

  // ---- Plug and Play ----
  void Attach(const std::string& drive);
  // The drive disappears: its nodes, interfaces and volumes go, and pending
  // requests on its devices complete with `error` (6, 1167 or 55); later I/O
  // on handles still open fails with it too.
  void Detach(const std::string& drive, DWORD error = ERROR_DEVICE_NOT_CONNECTED);
  bool Attached(const std::string& drive) const;
  // The next `times` eject or query-and-remove requests of the drive are
  // vetoed (-1: every one).
  void SetEjectVeto(const std::string& drive, PNP_VETO_TYPE type, const std::string& vetoName,
                    int times = -1);
  struct EjectRequest {
    std::string drive;
    std::string instanceId;  // of the node the request named
    bool queryAndRemove = false;
    bool vetoed = false;
  };
  std::vector<EjectRequest> Ejects() const;
  // Device events (arrival, remove-complete) go here, in order, one at a
  // time on a thread of the machine: an event is handed over only once the
  // sink returned from the one before. By default to the emulated service
  // manager's DeliverDeviceEvent.
  void SetDeviceEventSink(std::function<void(DWORD eventType, const void* record)> sink);
  // Waits (real time) until every event queued so far was delivered.
  bool WaitForDeviceEvents(DWORD timeoutMs = 10000) const;

  // ---- Front panel and drive state ----
  // Presses buttons: the drive's channel delivers `eventBits` as its event.
  void Press(const std::string& drive, std::uint8_t eventBits);
  void SetStatus(const std::string& drive, const std::uint8_t bytes4to7[4]);
  void SetSleepState(const std::string& drive, std::uint8_t state);

  // ---- Volumes ----
  void SetVolumeHeldOpen(char letter, bool held);     // another program: lock fails
  void SetMediumCheckFails(char letter, bool fails);  // IOCTL_STORAGE_CHECK_VERIFY: not ready
  // IOCTL_STORAGE_CHECK_VERIFY fails with `error` (0: succeeds again).
  void SetMediumCheckError(char letter, DWORD error);
  // FSCTL_LOCK_VOLUME or FSCTL_DISMOUNT_VOLUME of the volume fails with
  // `error` (0: succeeds again).
  void SetVolumeControlError(char letter, DWORD code, DWORD error);
  // A dismounted volume mounts again on its first access after it is unlocked.
  bool VolumeMounted(char letter) const;
  void SetFreeBytes(char letter, std::uint64_t freeBytes);
  int DismountCount(char letter) const;
  bool VolumeLocked(char letter) const;

  // ---- Libraries ----
  void RemoveExport(const std::string& module, const std::string& name);
  void SetModuleLoadFails(const std::string& module, bool fails);
  // SetupDiGetClassDevsW for the class fails with `error` (0: works again).
  void FailInterfaceList(const GUID& interfaceClass, DWORD error);

  // ---- Faults on a drive's endpoints (`times` -1: until turned off) ----
  void FailOpen(const std::string& drive, Endpoint endpoint, DWORD error, int times = -1);
  // Requests fail with `error`; `code` narrows it to one control code or SCSI
  // operation code (0: every request).
  void FailIo(const std::string& drive, Endpoint endpoint, DWORD error, int times = -1,
              DWORD code = 0);
  // Requests stay pending until cancelled (or the device goes).
  void HangIo(const std::string& drive, Endpoint endpoint, bool hang);
  // CancelIo takes `delayMs` (scaled by the time scale; INFINITE: until
  // FinishHeldCancels) before the request completes; the late completion
  // still writes the reply into the caller's buffers, as a request that had
  // already reached the device does.
  void SetCancelDelay(const std::string& drive, Endpoint endpoint, DWORD delayMs);
  void FinishHeldCancels();
  void ClearFaults();
  // Turns off the open, I/O, hang and cancel-delay faults of one drive.
  void ClearFaults(const std::string& drive);

  // ---- Observation ----
  // Requests pending now on the drive's endpoint.
  std::size_t PendingCount(const std::string& drive, Endpoint endpoint) const;
  // Waits (real time, at most `timeoutMs`) until at least `count` requests
  // are pending there; false on time-out.
  bool WaitForPending(const std::string& drive, Endpoint endpoint, std::size_t count,
                      DWORD timeoutMs = 10000) const;
  // Handles open on the drive's endpoint.
  std::size_t OpenCount(const std::string& drive, Endpoint endpoint) const;
  std::vector<Command> Commands(const std::string& drive = "") const;
  void ClearCommands();
  // Readable transcript of every command, one line each.
  std::string Transcript() const;

  // ---- Inventory (what a person controlling the machine sees) ----
  struct VolumeSummary {
    char letter = 0;
    std::uint64_t sizeBytes = 0;
    std::uint64_t freeBytes = 0;
    bool heldOpen = false;
    bool present = false;
  };
  struct DriveSummary {
    std::string name;
    int index = 0;  // in the order the drives were added
    Bus bus = Bus::Usb;
    ChannelKind channel = ChannelKind::Hid;
    bool attached = false;   // its disk is present
    bool connected = false;  // on the bus at all (an eject may leave its HID function)
    std::uint8_t status[4] = {};
    std::uint8_t sleepState = 0;
    std::vector<VolumeSummary> volumes;
  };
  std::vector<DriveSummary> Drives() const;
  // The volume with that letter (present or on a detached drive); false
  // when the machine has none.
  bool FindVolume(char letter, VolumeSummary* volume) const;
  // Adds the drives of a description text (drive blocks only, README.md)
  // detached and then plugs each in, as a person connects a new drive.
  // Nothing is added when the text is not valid or names a drive the machine
  // already has; *error says why.
  bool PlugDrives(std::string_view text, std::vector<std::string>* names, std::string* error);

  // ---- emu::DeviceModel ----
  bool ListInterfaces(const GUID& interfaceClass, std::vector<emu::InterfaceEntry>* out,
                      DWORD* error) override;
  CONFIGRET Parent(DEVINST node, DEVINST* parent) override;
  CONFIGRET InstanceId(DEVINST node, std::u16string* id) override;
  CONFIGRET Locate(std::u16string_view instanceId, DEVINST* node) override;
  CONFIGRET Property(DEVINST node, DWORD spdrp, DWORD* regType, std::vector<BYTE>* data) override;
  CONFIGRET Eject(DEVINST node, bool queryAndRemove, PNP_VETO_TYPE* vetoType,
                  std::u16string* vetoName) override;
  bool ModuleLoads(std::u16string_view module, DWORD* error) override;
  bool ExportPresent(std::u16string_view module, std::string_view name) override;
  DWORD LogicalDrives() override;
  UINT DriveType(WCHAR letter) override;
  bool FreeSpace(WCHAR letter, ULONGLONG* availableToCaller, ULONGLONG* total, ULONGLONG* totalFree,
                 DWORD* error) override;
  emu::OsVersion Version() override;
  std::unique_ptr<emu::DeviceFile> Open(const WCHAR* path, DWORD access, DWORD share, DWORD flags,
                                        DWORD* error) override;

  struct State;  // internal

 private:
  std::shared_ptr<State> state_;
};

// Vendor interface classes A, B and C of the maker's drivers.
extern const GUID kVendorClassA;
extern const GUID kVendorClassB;
extern const GUID kVendorClassC;

// Builds a machine from a description text (README.md). Null with *error
// (line number and reason) when the text is not valid.
std::unique_ptr<Machine> LoadMachine(std::string_view text, std::string* error);
std::unique_ptr<Machine> LoadMachineFile(const std::string& path, std::string* error);

// The embedded default machine's description.
std::string_view DefaultMachineText();
// The machine named by env SKYVANE_MACHINE (a description file), else the
// embedded default. Never null: a file that cannot be used is reported on
// standard error and the embedded default is used instead.
std::unique_ptr<Machine> CreateDefaultMachine();

}  // namespace sim
