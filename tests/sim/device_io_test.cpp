// I/O on the simulated devices: pass-through SCSI, the button filter
// driver's waits, HID reports, enclosure pages, vanishing devices and the
// injected faults.
#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <thread>

#include "sim_helpers.h"

namespace {

using namespace simtest;

constexpr DWORD kWaitEvent = 0x223C04;
constexpr DWORD kWaitGaugeEvent = 0x222048;
constexpr DWORD kGetIdentity = 0x223C10;
constexpr DWORD kSetGauge = 0x222040;
constexpr DWORD kEventReply = 0x223C20;

std::string Field(const std::uint8_t* data, std::size_t offset, std::size_t width) {
  return std::string(reinterpret_cast<const char*>(data) + offset, width);
}

// One overlapped request in flight: its own event and record.
struct Overlapped {
  Overlapped() {
    event = CreateEventW(nullptr, TRUE, FALSE, nullptr);
    record.hEvent = event;
  }
  ~Overlapped() { CloseHandle(event); }
  Overlapped(const Overlapped&) = delete;
  Overlapped& operator=(const Overlapped&) = delete;
  HANDLE event;
  OVERLAPPED record{};
};

// Starts a pass-through command on an overlapped handle; true if it completed
// at once, false with the last error set otherwise.
bool StartScsi(HANDLE device, PassThroughRequest* request, Overlapped& ov) {
  DWORD bytes = 0;
  return DeviceIoControl(device, IOCTL_SCSI_PASS_THROUGH_DIRECT, request, sizeof *request, request,
                         sizeof *request, &bytes, &ov.record) != FALSE;
}

class DeviceIo : public DefaultMachineTest {
 protected:
  std::string PathOf(const GUID& cls, std::size_t index = 0) {
    auto found = ListInterfaces(cls);
    return index < found.size() ? found[index].path : std::string();
  }
  std::string HidPathOf(const std::string& pidPart) {
    GUID hid{};
    HidD_GetHidGuid(&hid);
    for (const Found& f : ListInterfaces(hid)) {
      if (Contains(f.path, pidPart)) return f.path;
    }
    return {};
  }
};

TEST_F(DeviceIo, InquiryReturnsTheDescribedIdentity) {
  Found disk = DiskWith("374b3241");
  // Overlapped handle, as the enumeration opens disks.
  HANDLE device = OpenDevice(disk.path, true);
  ASSERT_NE(device, INVALID_HANDLE_VALUE);
  std::uint8_t data[74];
  std::memset(data, 0xEE, sizeof data);
  PassThroughRequest request = MakeRequest({0x12, 0, 0, 0, 74, 0}, data, 74);
  Overlapped ov;
  DWORD bytes = 0;
  if (!StartScsi(device, &request, ov)) {
    ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
    ASSERT_TRUE(GetOverlappedResult(device, &ov.record, &bytes, TRUE));
  }
  EXPECT_EQ(request.sptd.ScsiStatus, 0);
  EXPECT_EQ(request.sptd.DataTransferLength, 74u);
  EXPECT_EQ(data[0] & 0x1F, 0);
  EXPECT_EQ(data[4], 69);
  EXPECT_EQ(Field(data, 8, 8), "QX      ");
  EXPECT_EQ(Field(data, 16, 16), "External HDD    ");
  EXPECT_EQ(Field(data, 32, 4), "0102");
  EXPECT_EQ(Field(data, 36, 4), "7B44");
  EXPECT_EQ(Field(data, 40, 18), "QX-7K2A9F31       ");
  EXPECT_EQ(Field(data, 58, 16), "QX Vantage 500  ");
  EXPECT_TRUE(CloseHandle(device));

  auto commands = machine->Commands("gauge");
  ASSERT_EQ(commands.size(), 1u);
  EXPECT_EQ(commands[0].kind, sim::Command::Kind::Scsi);
  EXPECT_EQ(commands[0].cdb, (std::vector<std::uint8_t>{0x12, 0, 0, 0, 74, 0}));
}

TEST_F(DeviceIo, VitalProductDataCapacityAndDiagnosticPages) {
  HANDLE device = OpenDevice(DiskWith("374b3241").path, false);
  ASSERT_NE(device, INVALID_HANDLE_VALUE);
  std::uint8_t page[36] = {};
  auto vpd = [&](UCHAR code, UCHAR length) {
    std::memset(page, 0, sizeof page);
    PassThroughRequest r = MakeRequest({0x12, 0x01, code, 0, length, 0}, page, length);
    EXPECT_TRUE(Scsi(device, &r));
    return r.sptd.ScsiStatus;
  };
  EXPECT_EQ(vpd(0x00, 11), 0);
  EXPECT_EQ(page[4], 0x00);
  EXPECT_EQ(page[5], 0x01);
  EXPECT_EQ(page[6], 0x02);
  EXPECT_EQ(vpd(0x80, 20), 0);
  EXPECT_EQ(Field(page, 4, 8), "7K2A9F31");
  EXPECT_EQ(vpd(0xC0, 20), 0);
  EXPECT_EQ(page[1], 0xC0);
  EXPECT_EQ(Field(page, 16, 3), "RCS");
  EXPECT_EQ(vpd(0xC1, 36), 0);
  EXPECT_EQ(page[1], 0xC1);
  bool vendorCode = false;
  for (int d = 4; d < 36; d += 8) {
    if (page[d] == 0x80) {
      EXPECT_EQ(Field(page, static_cast<std::size_t>(d) + 1, 7), "QXV7B44");
      vendorCode = true;
      break;
    }
  }
  EXPECT_TRUE(vendorCode);
  EXPECT_EQ(vpd(0x01, 26), 0);
  EXPECT_EQ(page[1], 0x01);
  // A page the drive does not have: check condition with sense, no data.
  PassThroughRequest missing = MakeRequest({0x12, 0x01, 0x83, 0, 20, 0}, page, 20);
  ASSERT_TRUE(Scsi(device, &missing));
  EXPECT_EQ(missing.sptd.ScsiStatus, 2);
  EXPECT_EQ(missing.sptd.DataTransferLength, 0u);
  EXPECT_EQ(missing.sense[2] & 0x0F, 0x05);

  std::uint8_t capacity[8] = {};
  PassThroughRequest rc = MakeRequest({0x25, 0, 0, 0, 0, 0, 0, 0, 0, 0}, capacity, 8);
  ASSERT_TRUE(Scsi(device, &rc));
  const std::uint32_t lastLba = 976773167;
  EXPECT_EQ(capacity[0], lastLba >> 24);
  EXPECT_EQ(capacity[3], lastLba & 0xFF);
  EXPECT_EQ(capacity[6], 0x02);  // 512 bytes per block
  EXPECT_EQ(capacity[7], 0x00);

  std::uint8_t status[8] = {};
  PassThroughRequest rs = MakeRequest({0x1C, 0x01, 0x82, 0, 8, 0}, status, 8);
  ASSERT_TRUE(Scsi(device, &rs));
  EXPECT_EQ(std::vector<std::uint8_t>(status, status + 8),
            (std::vector<std::uint8_t>{0x82, 0, 0, 4, 0x42, 0x10, 0x20, 0x30}));
  machine->SetSleepState("gauge", 2);
  std::uint8_t sleep[5] = {};
  PassThroughRequest rz = MakeRequest({0x1C, 0x01, 0x83, 0, 5, 0}, sleep, 5);
  ASSERT_TRUE(Scsi(device, &rz));
  EXPECT_EQ(sleep[0], 0x83);
  EXPECT_EQ(sleep[4], 0x80);

  std::uint8_t gauge[5] = {0x81, 0x00, 0x00, 0x01, 0x87};
  PassThroughRequest send = MakeRequest({0x1D, 0x10, 0, 0, 5, 0}, gauge, 5, SCSI_IOCTL_DATA_OUT);
  ASSERT_TRUE(Scsi(device, &send));
  EXPECT_EQ(send.sptd.ScsiStatus, 0);
  EXPECT_TRUE(CloseHandle(device));

  auto commands = machine->Commands("gauge");
  ASSERT_FALSE(commands.empty());
  EXPECT_EQ(commands.back().code, 0x1Du);
  EXPECT_EQ(commands.back().data, (std::vector<std::uint8_t>{0x81, 0, 0, 1, 0x87}));
  for (std::size_t i = 1; i < commands.size(); ++i) {
    EXPECT_LT(commands[i - 1].sequence, commands[i].sequence);
  }
  EXPECT_TRUE(
      Contains(machine->Transcript(),
               "SEND DIAGNOSTIC [1D 10 00 00 05 00] data 81 00 00 01 87 = gauge pattern 0x87"));
}

TEST_F(DeviceIo, DiskAndVolumesReportTheSameDiskNumber) {
  auto numberOf = [](const std::string& path, STORAGE_DEVICE_NUMBER* number) {
    HANDLE device = OpenDevice(path, false);
    if (device == INVALID_HANDLE_VALUE) return false;
    bool ok = Control(device, IOCTL_STORAGE_GET_DEVICE_NUMBER, nullptr, 0, number, sizeof *number);
    CloseHandle(device);
    return ok;
  };
  STORAGE_DEVICE_NUMBER disk{};
  ASSERT_TRUE(numberOf(DiskWith("354d3842").path, &disk));
  EXPECT_EQ(disk.DeviceNumber, machine->DiskNumber("plain"));
  STORAGE_DEVICE_NUMBER f{};
  STORAGE_DEVICE_NUMBER g{};
  ASSERT_TRUE(numberOf("\\\\.\\F:", &f));
  ASSERT_TRUE(numberOf("\\\\.\\g:", &g));
  EXPECT_EQ(f.DeviceNumber, disk.DeviceNumber);
  EXPECT_EQ(g.DeviceNumber, disk.DeviceNumber);
  EXPECT_EQ(f.PartitionNumber, 1u);
  EXPECT_EQ(g.PartitionNumber, 2u);
  STORAGE_DEVICE_NUMBER c{};
  ASSERT_TRUE(numberOf("\\\\.\\C:", &c));
  EXPECT_EQ(c.DeviceNumber, 0u);
  EXPECT_EQ(OpenDevice("\\\\.\\K:"), INVALID_HANDLE_VALUE);
  EXPECT_EQ(GetLastError(), ERROR_FILE_NOT_FOUND);
}

TEST_F(DeviceIo, DriverWaitPendsUntilPressAndCancelIoEndsIt) {
  HANDLE device = OpenDevice(PathOf(sim::kVendorClassA));
  ASSERT_NE(device, INVALID_HANDLE_VALUE);
  std::uint8_t out[4];
  std::memset(out, 0xFF, sizeof out);
  Overlapped ov;
  DWORD bytes = 0;
  ASSERT_FALSE(DeviceIoControl(device, kWaitEvent, nullptr, 0, out, 4, &bytes, &ov.record));
  ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
  EXPECT_EQ(WaitForSingleObject(ov.event, 0), WAIT_TIMEOUT);
  machine->Press("firewire", 0x05);
  ASSERT_EQ(WaitForSingleObject(ov.event, INFINITE), WAIT_OBJECT_0);
  ASSERT_TRUE(GetOverlappedResult(device, &ov.record, &bytes, FALSE));
  EXPECT_EQ(bytes, 4u);
  EXPECT_EQ(out[0], 0x05);
  EXPECT_EQ(out[1], 0x00);

  // A press that no wait takes is kept for the next wait.
  machine->Press("firewire", 0x02);
  Overlapped ov2;
  ASSERT_TRUE(DeviceIoControl(device, kWaitGaugeEvent, nullptr, 0, out, 4, &bytes, &ov2.record));
  EXPECT_EQ(out[0], 0x02);

  // A wait nobody answers ends with CancelIo.
  Overlapped ov3;
  ASSERT_FALSE(DeviceIoControl(device, kWaitEvent, nullptr, 0, out, 4, &bytes, &ov3.record));
  ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
  EXPECT_EQ(machine->PendingCount("firewire", sim::Endpoint::Driver), 1u);
  ASSERT_TRUE(CancelIo(device));
  EXPECT_FALSE(GetOverlappedResult(device, &ov3.record, &bytes, TRUE));
  EXPECT_EQ(GetLastError(), ERROR_OPERATION_ABORTED);
  EXPECT_EQ(machine->PendingCount("firewire", sim::Endpoint::Driver), 0u);

  // Identity and the commands of the command table.
  std::uint8_t identity[8] = {};
  HANDLE sync = OpenDevice(PathOf(sim::kVendorClassA), false);
  ASSERT_TRUE(Control(sync, kGetIdentity, nullptr, 0, identity, 8, &bytes));
  EXPECT_EQ(bytes, 8u);
  EXPECT_EQ(identity[0], 0xB3);
  EXPECT_EQ(identity[5], 0xE0);
  EXPECT_EQ(identity[6], 0x30);
  EXPECT_EQ(identity[7], 0x00);
  DWORD value = 0x8700;
  EXPECT_TRUE(Control(sync, kSetGauge, &value, 4, nullptr, 0));
  EXPECT_TRUE(Control(sync, kEventReply, nullptr, 0, nullptr, 0));
  DWORD error = 0;
  EXPECT_FALSE(Control(sync, kSetGauge, &value, 2, nullptr, 0, nullptr, &error));
  EXPECT_EQ(error, ERROR_INVALID_PARAMETER);
  EXPECT_FALSE(Control(sync, 0x223C2C, nullptr, 0, nullptr, 0, nullptr, &error));
  EXPECT_EQ(error, ERROR_INVALID_FUNCTION);
  EXPECT_TRUE(CloseHandle(sync));
  EXPECT_TRUE(CloseHandle(device));

  bool sawGauge = false;
  for (const auto& c : machine->Commands("firewire")) {
    if (c.code == kSetGauge && c.data == std::vector<std::uint8_t>{0x00, 0x87, 0, 0})
      sawGauge = true;
  }
  EXPECT_TRUE(sawGauge);
}

TEST_F(DeviceIo, WaitOnASynchronousHandleBlocksUntilThePress) {
  HANDLE device = OpenDevice(PathOf(sim::kVendorClassA), false);
  ASSERT_NE(device, INVALID_HANDLE_VALUE);
  std::uint8_t out[4] = {};
  DWORD bytes = 0;
  BOOL ok = FALSE;
  std::thread waiter(
      [&] { ok = DeviceIoControl(device, kWaitEvent, nullptr, 0, out, 4, &bytes, nullptr); });
  EXPECT_TRUE(machine->WaitForPending("firewire", sim::Endpoint::Driver, 1));
  machine->Press("firewire", 0x04);
  waiter.join();
  EXPECT_TRUE(ok);
  EXPECT_EQ(bytes, 4u);
  EXPECT_EQ(out[0], 0x04);
  EXPECT_TRUE(CloseHandle(device));
}

TEST_F(DeviceIo, HidReadsReceivePressesAndReportsAnswer) {
  const std::string path = HidPathOf("pid_7b44");
  HANDLE first = OpenDevice(path);
  HANDLE second = OpenDevice(path);
  ASSERT_NE(first, INVALID_HANDLE_VALUE);
  ASSERT_NE(second, INVALID_HANDLE_VALUE);
  std::uint8_t report[64] = {};
  Overlapped ov;
  DWORD bytes = 0;
  ASSERT_FALSE(ReadFile(first, report, 64, &bytes, &ov.record));
  ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
  machine->Press("gauge", 0x04);
  ASSERT_TRUE(GetOverlappedResult(first, &ov.record, &bytes, TRUE));
  EXPECT_EQ(bytes, 16u);
  EXPECT_EQ(report[0], 0x01);
  EXPECT_EQ(report[1], 0x04);
  // Every open handle gets its own copy of the report.
  std::uint8_t other[64] = {};
  Overlapped ov2;
  ASSERT_TRUE(ReadFile(second, other, 64, &bytes, &ov2.record));
  EXPECT_EQ(other[1], 0x04);
  // A buffer smaller than the report is refused.
  Overlapped ov3;
  EXPECT_FALSE(ReadFile(second, other, 8, &bytes, &ov3.record));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_USER_BUFFER);

  const std::uint8_t output[5] = {0x01, 0x02, 0x00, 0x00, 0x00};
  Overlapped ov4;
  ASSERT_TRUE(WriteFile(first, output, 5, &bytes, &ov4.record));
  EXPECT_EQ(bytes, 5u);
  EXPECT_TRUE(CloseHandle(first));
  EXPECT_TRUE(CloseHandle(second));

  HANDLE sync = OpenDevice(path, false);
  std::uint8_t input[16] = {0x02};
  ASSERT_TRUE(HidD_GetInputReport(sync, input, 16));
  EXPECT_EQ(std::vector<std::uint8_t>(input, input + 5),
            (std::vector<std::uint8_t>{0x02, 0x30, 0x20, 0x10, 0x42}));
  machine->SetSleepState("gauge", 3);
  std::uint8_t sleep[16] = {0x03};
  ASSERT_TRUE(HidD_GetInputReport(sync, sleep, 16));
  EXPECT_EQ(sleep[1], 3);
  std::uint8_t unknown[16] = {0x09};
  EXPECT_FALSE(HidD_GetInputReport(sync, unknown, 16));
  EXPECT_TRUE(CloseHandle(sync));

  auto commands = machine->Commands("gauge");
  bool sawOutput = false;
  for (const auto& c : commands) {
    if (c.kind == sim::Command::Kind::HidOutput) {
      EXPECT_EQ(c.data, std::vector<std::uint8_t>(output, output + 5));
      sawOutput = true;
    }
  }
  EXPECT_TRUE(sawOutput);
  EXPECT_TRUE(Contains(machine->Transcript(), "HID output report 01 02 00 00 00 = value 0x0002"));
}

TEST_F(DeviceIo, EnclosureLatchesPanelEventsInPage80) {
  HANDLE device = OpenDevice(PathOf(sim::kVendorClassC), false);
  ASSERT_NE(device, INVALID_HANDLE_VALUE);
  auto poll = [&] {
    std::uint8_t page[5] = {};
    PassThroughRequest r = MakeRequest({0x1C, 0x01, 0x80, 0, 5, 0}, page, 5);
    EXPECT_TRUE(Scsi(device, &r));
    EXPECT_EQ(page[0], 0x80);
    return page[4];
  };
  EXPECT_EQ(poll(), 0);
  machine->Press("enclosure", 0x04);
  machine->Press("enclosure", 0x01);
  EXPECT_EQ(poll(), 0x05);
  EXPECT_EQ(poll(), 0);
  EXPECT_TRUE(CloseHandle(device));
}

TEST_F(DeviceIo, VanishingDeviceFailsPendingAndLaterRequests) {
  HANDLE device = OpenDevice(PathOf(sim::kVendorClassA));
  ASSERT_NE(device, INVALID_HANDLE_VALUE);
  std::uint8_t out[4] = {};
  Overlapped ov;
  DWORD bytes = 0;
  ASSERT_FALSE(DeviceIoControl(device, kWaitEvent, nullptr, 0, out, 4, &bytes, &ov.record));
  ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
  machine->Detach("firewire");
  EXPECT_FALSE(GetOverlappedResult(device, &ov.record, &bytes, TRUE));
  EXPECT_EQ(GetLastError(), ERROR_DEVICE_NOT_CONNECTED);
  Overlapped ov2;
  EXPECT_FALSE(DeviceIoControl(device, kWaitEvent, nullptr, 0, out, 4, &bytes, &ov2.record));
  EXPECT_EQ(GetLastError(), ERROR_DEVICE_NOT_CONNECTED);
  EXPECT_TRUE(CloseHandle(device));

  // The drive's nodes, interfaces and volume went with it.
  EXPECT_TRUE(ListInterfaces(sim::kVendorClassA).empty());
  EXPECT_EQ(ListInterfaces(GUID_DEVINTERFACE_DISK).size(), 4u);
  EXPECT_EQ(GetLogicalDrives() & (1u << ('H' - 'A')), 0u);
  EXPECT_EQ(GetDriveTypeW(WSTR("H:\\")), DRIVE_NO_ROOT_DIR);

  // Remove-complete events named its interfaces, then arrival ones.
  machine->Attach("firewire");
  ASSERT_TRUE(machine->WaitForDeviceEvents());
  std::lock_guard<std::mutex> lock(eventsMutex);
  int removedDisks = 0;
  int arrivedDisks = 0;
  for (const auto& [type, record] : events) {
    DWORD deviceType = 0;
    std::memcpy(&deviceType, &record[4], 4);
    if (deviceType != 5) continue;
    GUID cls{};
    std::memcpy(&cls, &record[12], sizeof cls);
    if (cls != GUID_DEVINTERFACE_DISK) continue;
    std::u16string name(reinterpret_cast<const char16_t*>(&record[28]));
    EXPECT_NE(name.find(u"SBP2#QX&EXTERNAL_HDD"), std::u16string::npos)
        << "the instance ID's own case";
    (type == 0x8004 ? removedDisks : arrivedDisks) += 1;
  }
  EXPECT_EQ(removedDisks, 1);
  EXPECT_EQ(arrivedDisks, 1);
}

TEST_F(DeviceIo, AListTakenBeforeARemovalKeepsTheIdButNotTheNode) {
  HDEVINFO list = SetupDiGetClassDevsW(&sim::kVendorClassA, nullptr, nullptr,
                                       DIGCF_PRESENT | DIGCF_DEVICEINTERFACE);
  ASSERT_NE(list, INVALID_HANDLE_VALUE);
  SP_DEVICE_INTERFACE_DATA data{};
  data.cbSize = sizeof data;
  ASSERT_TRUE(SetupDiEnumDeviceInterfaces(list, nullptr, &sim::kVendorClassA, 0, &data));
  machine->Detach("firewire");
  DWORD needed = 0;
  SP_DEVINFO_DATA info{};
  info.cbSize = sizeof info;
  EXPECT_FALSE(SetupDiGetDeviceInterfaceDetailW(list, &data, nullptr, 0, &needed, &info));
  EXPECT_EQ(GetLastError(), ERROR_INSUFFICIENT_BUFFER);
  WCHAR id[256] = {};
  EXPECT_TRUE(SetupDiGetDeviceInstanceIdW(list, &info, id, 256, nullptr));
  EXPECT_TRUE(Contains(Text(id), "1394\\QX&EXTERNAL_HDD\\"));
  BYTE property[64];
  EXPECT_FALSE(SetupDiGetDeviceRegistryPropertyW(list, &info, SPDRP_DEVICEDESC, nullptr, property,
                                                 sizeof property, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_NO_SUCH_DEVINST);
  DEVINST parent = 0;
  EXPECT_EQ(CM_Get_Parent(&parent, info.DevInst, 0), CR_NO_SUCH_DEVNODE);
  EXPECT_TRUE(SetupDiDestroyDeviceInfoList(list));
}

TEST_F(DeviceIo, VanishingDeviceCanReportOtherErrors) {
  HANDLE device = OpenDevice(HidPathOf("pid_2a31"));
  ASSERT_NE(device, INVALID_HANDLE_VALUE);
  std::uint8_t report[64];
  Overlapped ov;
  DWORD bytes = 0;
  ASSERT_FALSE(ReadFile(device, report, 64, &bytes, &ov.record));
  machine->Detach("plain", ERROR_DEV_NOT_EXIST);
  EXPECT_FALSE(GetOverlappedResult(device, &ov.record, &bytes, TRUE));
  EXPECT_EQ(GetLastError(), ERROR_DEV_NOT_EXIST);
  EXPECT_TRUE(CloseHandle(device));
}

TEST_F(DeviceIo, InjectedOpenAndIoFailures) {
  Found disk = DiskWith("374b3241");
  machine->FailOpen("gauge", sim::Endpoint::Disk, ERROR_ACCESS_DENIED, 1);
  EXPECT_EQ(OpenDevice(disk.path), INVALID_HANDLE_VALUE);
  EXPECT_EQ(GetLastError(), ERROR_ACCESS_DENIED);
  HANDLE device = OpenDevice(disk.path, false);
  ASSERT_NE(device, INVALID_HANDLE_VALUE);
  // Only INQUIRY fails, twice.
  machine->FailIo("gauge", sim::Endpoint::Disk, ERROR_GEN_FAILURE, 2, 0x12);
  std::uint8_t data[74];
  for (int i = 0; i < 2; ++i) {
    PassThroughRequest r = MakeRequest({0x12, 0, 0, 0, 74, 0}, data, 74);
    EXPECT_FALSE(Scsi(device, &r));
    EXPECT_EQ(GetLastError(), ERROR_GEN_FAILURE);
  }
  std::uint8_t capacity[8];
  PassThroughRequest rc = MakeRequest({0x25, 0, 0, 0, 0, 0, 0, 0, 0, 0}, capacity, 8);
  EXPECT_TRUE(Scsi(device, &rc));
  PassThroughRequest r = MakeRequest({0x12, 0, 0, 0, 74, 0}, data, 74);
  EXPECT_TRUE(Scsi(device, &r));
  EXPECT_TRUE(CloseHandle(device));
}

TEST_F(DeviceIo, HungRequestIsCancelledAndASlowCancelStillWritesItsReply) {
  Found disk = DiskWith("374b3241");
  HANDLE device = OpenDevice(disk.path);
  ASSERT_NE(device, INVALID_HANDLE_VALUE);
  machine->HangIo("gauge", sim::Endpoint::Disk, true);
  std::uint8_t data[74] = {};
  PassThroughRequest request = MakeRequest({0x12, 0, 0, 0, 74, 0}, data, 74);
  Overlapped ov;
  DWORD bytes = 0;
  ASSERT_FALSE(StartScsi(device, &request, ov));
  ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
  EXPECT_EQ(WaitForSingleObject(ov.event, 0), WAIT_TIMEOUT);
  ASSERT_TRUE(CancelIo(device));
  EXPECT_FALSE(GetOverlappedResult(device, &ov.record, &bytes, TRUE));
  EXPECT_EQ(GetLastError(), ERROR_OPERATION_ABORTED);
  EXPECT_EQ(data[4], 0);  // an immediate cancel writes nothing

  // Slow to cancel: nothing completes until the device lets go, and then the
  // reply still lands in the caller's buffers.
  machine->SetCancelDelay("gauge", sim::Endpoint::Disk, INFINITE);
  Overlapped ov2;
  ASSERT_FALSE(StartScsi(device, &request, ov2));
  ASSERT_TRUE(CancelIo(device));
  EXPECT_EQ(WaitForSingleObject(ov2.event, 0), WAIT_TIMEOUT);
  machine->FinishHeldCancels();
  ASSERT_EQ(WaitForSingleObject(ov2.event, INFINITE), WAIT_OBJECT_0);
  EXPECT_FALSE(GetOverlappedResult(device, &ov2.record, &bytes, FALSE));
  EXPECT_EQ(GetLastError(), ERROR_OPERATION_ABORTED);
  EXPECT_EQ(data[4], 69);
  EXPECT_EQ(Field(data, 36, 4), "7B44");

  // A finite delay completes on the machine's own timer.
  machine->SetCancelDelay("gauge", sim::Endpoint::Disk, 20);
  Overlapped ov3;
  ASSERT_FALSE(StartScsi(device, &request, ov3));
  ASSERT_TRUE(CancelIo(device));
  EXPECT_FALSE(GetOverlappedResult(device, &ov3.record, &bytes, TRUE));
  EXPECT_EQ(GetLastError(), ERROR_OPERATION_ABORTED);
  EXPECT_TRUE(CloseHandle(device));
}

TEST_F(DeviceIo, VolumesLockDismountAndFailAsConfigured) {
  HANDLE volume = OpenDevice("\\\\.\\E:", false);
  ASSERT_NE(volume, INVALID_HANDLE_VALUE);
  EXPECT_TRUE(Control(volume, IOCTL_STORAGE_CHECK_VERIFY, nullptr, 0, nullptr, 0));
  EXPECT_TRUE(Control(volume, FSCTL_LOCK_VOLUME, nullptr, 0, nullptr, 0));
  EXPECT_TRUE(machine->VolumeLocked('E'));
  // A locked volume cannot be opened again.
  EXPECT_EQ(OpenDevice("\\\\.\\E:", false), INVALID_HANDLE_VALUE);
  EXPECT_EQ(GetLastError(), ERROR_ACCESS_DENIED);
  EXPECT_TRUE(Control(volume, FSCTL_DISMOUNT_VOLUME, nullptr, 0, nullptr, 0));
  EXPECT_FALSE(machine->VolumeMounted('E'));
  EXPECT_TRUE(Control(volume, FSCTL_UNLOCK_VOLUME, nullptr, 0, nullptr, 0));
  EXPECT_FALSE(machine->VolumeLocked('E'));
  EXPECT_EQ(machine->DismountCount('E'), 1);
  EXPECT_FALSE(machine->VolumeMounted('E')) << "mounted again only when next used";
  EXPECT_TRUE(CloseHandle(volume));
  volume = OpenDevice("\\\\.\\E:", false);
  EXPECT_TRUE(machine->VolumeMounted('E'));
  EXPECT_TRUE(CloseHandle(volume));

  // Lock, dismount and medium check fail as told.
  struct Failure {
    DWORD code;
    DWORD error;
  };
  for (const Failure& failure : {Failure{FSCTL_LOCK_VOLUME, ERROR_ACCESS_DENIED},
                                 Failure{FSCTL_DISMOUNT_VOLUME, ERROR_SHARING_VIOLATION},
                                 Failure{IOCTL_STORAGE_CHECK_VERIFY, 1117}}) {
    if (failure.code == IOCTL_STORAGE_CHECK_VERIFY) {
      machine->SetMediumCheckError('E', failure.error);
    } else {
      machine->SetVolumeControlError('E', failure.code, failure.error);
    }
    HANDLE e = OpenDevice("\\\\.\\E:", false);
    DWORD error = 0;
    EXPECT_TRUE(failure.code == FSCTL_LOCK_VOLUME ||
                Control(e, FSCTL_LOCK_VOLUME, nullptr, 0, nullptr, 0));
    EXPECT_FALSE(Control(e, failure.code, nullptr, 0, nullptr, 0, nullptr, &error));
    EXPECT_EQ(error, failure.error);
    EXPECT_TRUE(machine->VolumeMounted('E'));
    EXPECT_TRUE(CloseHandle(e));
    machine->SetVolumeControlError('E', failure.code, 0);
    machine->SetMediumCheckError('E', 0);
  }

  machine->SetVolumeHeldOpen('F', true);
  machine->SetMediumCheckFails('G', true);
  HANDLE f = OpenDevice("\\\\.\\F:", false);
  DWORD error = 0;
  EXPECT_FALSE(Control(f, FSCTL_LOCK_VOLUME, nullptr, 0, nullptr, 0, nullptr, &error));
  EXPECT_EQ(error, ERROR_ACCESS_DENIED);
  EXPECT_TRUE(CloseHandle(f));
  HANDLE g = OpenDevice("\\\\.\\G:", false);
  EXPECT_FALSE(Control(g, IOCTL_STORAGE_CHECK_VERIFY, nullptr, 0, nullptr, 0, nullptr, &error));
  EXPECT_EQ(error, ERROR_NOT_READY);
  EXPECT_TRUE(CloseHandle(g));
  // Closing a handle that holds a lock releases it.
  HANDLE h = OpenDevice("\\\\.\\H:", false);
  EXPECT_TRUE(Control(h, FSCTL_LOCK_VOLUME, nullptr, 0, nullptr, 0));
  EXPECT_TRUE(CloseHandle(h));
  EXPECT_FALSE(machine->VolumeLocked('H'));
}

TEST_F(DeviceIo, DriveLettersTypesAndFreeSpace) {
  DWORD mask = GetLogicalDrives();
  EXPECT_EQ(mask, 0x1FCu);  // C to I
  EXPECT_EQ(GetDriveTypeW(WSTR("C:\\")), DRIVE_FIXED);
  EXPECT_EQ(GetDriveTypeW(WSTR("D:\\")), DRIVE_CDROM);
  EXPECT_EQ(GetDriveTypeW(WSTR("e:\\")), DRIVE_FIXED);
  EXPECT_EQ(GetDriveTypeW(WSTR("I:\\")), DRIVE_REMOVABLE);
  EXPECT_EQ(GetDriveTypeW(WSTR("A:\\")), DRIVE_NO_ROOT_DIR);
  EXPECT_EQ(GetDriveTypeW(WSTR("E:\\dir")), DRIVE_NO_ROOT_DIR);
  ULARGE_INTEGER available{};
  ULARGE_INTEGER total{};
  ULARGE_INTEGER totalFree{};
  ASSERT_TRUE(GetDiskFreeSpaceExW(WSTR("E:\\"), &available, &total, &totalFree));
  EXPECT_EQ(total.QuadPart, 500ull << 30);
  EXPECT_EQ(totalFree.QuadPart, 312ull << 30);
  EXPECT_EQ(available.QuadPart, 312ull << 30);
  machine->SetFreeBytes('E', 1000);
  ASSERT_TRUE(GetDiskFreeSpaceExW(WSTR("E:\\"), &available, nullptr, nullptr));
  EXPECT_EQ(available.QuadPart, 1000u);
  EXPECT_FALSE(GetDiskFreeSpaceExW(WSTR("D:\\"), &available, nullptr, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_NOT_READY);
  EXPECT_FALSE(GetDiskFreeSpaceExW(WSTR("Q:\\"), &available, nullptr, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_PATH_NOT_FOUND);
}

}  // namespace
