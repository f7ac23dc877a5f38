// What the simulated devices do that the service's own tests only meet as
// outcomes: removal, injected faults, and refused device-list misuse.
#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "service/process_locks.h"
#include "sim_helpers.h"
#include "support/test_support.h"

namespace {

using namespace simtest;
using skytest::Overlapped;

constexpr DWORD kWaitEvent = 0x223C04;  // the button filter driver's event wait

class DeviceIo : public DefaultMachineTest {};

// A vanished drive fails its pending and later requests with the given error;
// a list taken before the removal keeps the ID but not the node.
TEST_F(DeviceIo, VanishingDeviceCompletesPendingAndLaterRequestsWithItsError) {
  HDEVINFO list = SetupDiGetClassDevsW(&sim::kVendorClassA, nullptr, nullptr,
                                       DIGCF_PRESENT | DIGCF_DEVICEINTERFACE);
  ASSERT_NE(list, INVALID_HANDLE_VALUE);
  SP_DEVICE_INTERFACE_DATA data{sizeof data, {}, 0, 0};
  ASSERT_TRUE(SetupDiEnumDeviceInterfaces(list, nullptr, &sim::kVendorClassA, 0, &data));
  GUID hid{};
  HidD_GetHidGuid(&hid);
  const struct {
    const char* drive;
    std::string path;
    bool read;  // ReadFile, else the driver's event wait
    DWORD error;
  } rows[] = {{"firewire", PathWith(sim::kVendorClassA), false, ERROR_DEVICE_NOT_CONNECTED},
              {"plain", PathWith(hid, "pid_2a31"), true, ERROR_DEV_NOT_EXIST}};
  for (const auto& row : rows) {
    SCOPED_TRACE(row.drive);
    HANDLE device = OpenDevice(row.path);
    ASSERT_NE(device, INVALID_HANDLE_VALUE);
    std::uint8_t buffer[64] = {};
    auto start = [&](Overlapped& ov) {
      DWORD bytes = 0;
      return row.read
                 ? ReadFile(device, buffer, sizeof buffer, &bytes, &ov.record)
                 : DeviceIoControl(device, kWaitEvent, nullptr, 0, buffer, 4, &bytes, &ov.record);
    };
    Overlapped pending;
    ASSERT_FALSE(start(pending));
    ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
    if (row.error == ERROR_DEVICE_NOT_CONNECTED) {
      machine->Detach(row.drive);  // the default error
    } else {
      machine->Detach(row.drive, row.error);
    }
    DWORD bytes = 0;
    EXPECT_FALSE(GetOverlappedResult(device, &pending.record, &bytes, TRUE));
    EXPECT_EQ(GetLastError(), row.error);
    Overlapped later;
    EXPECT_FALSE(start(later));
    EXPECT_EQ(GetLastError(), row.error);
    EXPECT_TRUE(CloseHandle(device));
  }
  DWORD needed = 0;
  SP_DEVINFO_DATA info{sizeof info, {}, 0, 0};
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
  // The drive's nodes, interfaces and volume went with it.
  EXPECT_TRUE(ListInterfaces(sim::kVendorClassA).empty());
  EXPECT_EQ(ListInterfaces(GUID_DEVINTERFACE_DISK).size(), 3u);
  EXPECT_EQ(GetLogicalDrives() & (1u << ('H' - 'A')), 0u);
  EXPECT_EQ(GetDriveTypeW(WSTR("H:\\")), DRIVE_NO_ROOT_DIR);

  // Attached again: remove-complete then arrival events named its disk
  // interface, in the instance ID's own case.
  machine->Attach("firewire");
  ASSERT_TRUE(machine->WaitForDeviceEvents());
  std::lock_guard<std::mutex> lock(eventsMutex);
  std::string seen;
  for (const auto& [type, record] : events) {
    if (record.size() <= 28 || record[4] != DBT_DEVTYP_DEVICEINTERFACE) continue;
    GUID cls{};
    std::memcpy(&cls, &record[12], sizeof cls);
    if (cls != GUID_DEVINTERFACE_DISK) continue;
    std::string name = Text(reinterpret_cast<const WCHAR*>(&record[28]));
    if (Contains(name, "SBP2#QX&EXTERNAL_HDD")) seen += type == DBT_DEVICEARRIVAL ? "+" : "-";
  }
  EXPECT_EQ(seen, "-+");
}

// Faults fail as many times as told; CancelIo cancels only its own thread's
// hung request, and a slow cancel still writes the reply.
TEST_F(DeviceIo, InjectedFaultsComeAndGoAsTold) {
  InitializeProcessLocks();  // the service's transfers take the pass-through lock
  const std::string disk = PathWith(GUID_DEVINTERFACE_DISK, "374b3241");
  machine->FailOpen("gauge", sim::Endpoint::Disk, ERROR_ACCESS_DENIED, 1);
  EXPECT_EQ(OpenDevice(disk), INVALID_HANDLE_VALUE);
  EXPECT_EQ(GetLastError(), ERROR_ACCESS_DENIED);
  HANDLE device = OpenDevice(disk);
  ASSERT_NE(device, INVALID_HANDLE_VALUE);
  machine->FailIo("gauge", sim::Endpoint::Disk, ERROR_GEN_FAILURE, 2, 0x12);
  DWORD lastBlock = 0;
  DWORD blockLength = 0;
  EXPECT_EQ(ScsiReadCapacity(device, &lastBlock, &blockLength, nullptr), 0u);  // not failed
  std::uint8_t data[74] = {};
  for (DWORD expected : {ERROR_GEN_FAILURE, ERROR_GEN_FAILURE, DWORD{0}}) {
    EXPECT_EQ(ScsiInquiry(device, data, nullptr), expected);
  }
  EXPECT_TRUE(CloseHandle(device));

  device = OpenDevice(disk);
  ASSERT_NE(device, INVALID_HANDLE_VALUE);
  machine->HangIo("gauge", sim::Endpoint::Disk, true);
  std::memset(data, 0, sizeof data);
  PassThroughRequest request = Inquiry(data);
  std::uint8_t otherData[74] = {};
  PassThroughRequest otherRequest = Inquiry(otherData);
  Overlapped other;
  skytest::Thread otherThread(
      [&]() -> DWORD { return Scsi(device, &otherRequest, &other.record) ? 0 : GetLastError(); });
  EXPECT_EQ(otherThread.Join(), ERROR_IO_PENDING);
  DWORD bytes = 0;
  Overlapped ov;
  ASSERT_FALSE(Scsi(device, &request, &ov.record));
  ASSERT_EQ(GetLastError(), ERROR_IO_PENDING);
  EXPECT_EQ(WaitForSingleObject(ov.event.Get(), 0), WAIT_TIMEOUT);
  ASSERT_TRUE(CancelIo(device));
  EXPECT_FALSE(GetOverlappedResult(device, &ov.record, &bytes, TRUE));
  EXPECT_EQ(GetLastError(), ERROR_OPERATION_ABORTED);
  EXPECT_EQ(data[4], 0);  // an immediate cancel writes nothing
  EXPECT_FALSE(other.Signalled());

  machine->SetCancelDelay("gauge", sim::Endpoint::Disk, INFINITE);
  Overlapped slow;
  ASSERT_FALSE(Scsi(device, &request, &slow.record));
  ASSERT_TRUE(CancelIo(device));
  EXPECT_EQ(WaitForSingleObject(slow.event.Get(), 0), WAIT_TIMEOUT);
  machine->FinishHeldCancels();
  ASSERT_EQ(WaitForSingleObject(slow.event.Get(), INFINITE), WAIT_OBJECT_0);
  EXPECT_FALSE(GetOverlappedResult(device, &slow.record, &bytes, FALSE));
  EXPECT_EQ(GetLastError(), ERROR_OPERATION_ABORTED);
  EXPECT_EQ(data[4], 69);
  EXPECT_EQ(std::string(reinterpret_cast<char*>(data) + 36, 4), "7B44");
  machine->SetCancelDelay("gauge", sim::Endpoint::Disk, 0);
  EXPECT_TRUE(CloseHandle(device));
  ASSERT_EQ(WaitForSingleObject(other.event.Get(), skytest::kGuardMs), WAIT_OBJECT_0);
  EXPECT_EQ(other.record.Internal, 0xC0000120u);  // STATUS_CANCELLED
}

TEST_F(DeviceIo, SetupApiAndConfigurationManagerRefuseMisuseAsWindowsDoes) {
  HDEVINFO list = SetupDiGetClassDevsW(&GUID_DEVINTERFACE_DISK, nullptr, nullptr,
                                       DIGCF_PRESENT | DIGCF_DEVICEINTERFACE);
  ASSERT_NE(list, INVALID_HANDLE_VALUE);
  SP_DEVICE_INTERFACE_DATA data{};
  data.cbSize = 8;
  EXPECT_FALSE(SetupDiEnumDeviceInterfaces(list, nullptr, &GUID_DEVINTERFACE_DISK, 0, &data));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_USER_BUFFER);
  data.cbSize = sizeof data;
  ASSERT_TRUE(SetupDiEnumDeviceInterfaces(list, nullptr, &GUID_DEVINTERFACE_DISK, 0, &data));
  DWORD needed = 0;
  EXPECT_FALSE(SetupDiGetDeviceInterfaceDetailW(list, &data, nullptr, 0, &needed, nullptr));
  ASSERT_EQ(GetLastError(), ERROR_INSUFFICIENT_BUFFER);
  std::vector<std::uint8_t> buffer(needed);
  auto* detail = reinterpret_cast<SP_DEVICE_INTERFACE_DETAIL_DATA_W*>(buffer.data());
  detail->cbSize = 6;  // the 32-bit value is wrong on 64-bit
  EXPECT_FALSE(SetupDiGetDeviceInterfaceDetailW(list, &data, detail, needed, nullptr, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_USER_BUFFER);
  detail->cbSize = 8;
  EXPECT_FALSE(SetupDiGetDeviceInterfaceDetailW(list, &data, detail, needed - 2, nullptr, nullptr));
  EXPECT_EQ(GetLastError(), ERROR_INSUFFICIENT_BUFFER);
  SP_DEVINFO_DATA info{sizeof info, {}, 0, 0};
  ASSERT_TRUE(SetupDiGetDeviceInterfaceDetailW(list, &data, detail, needed, nullptr, &info));
  // An instance ID buffer one unit short.
  DWORD idLength = 0;
  EXPECT_FALSE(SetupDiGetDeviceInstanceIdW(list, &info, nullptr, 0, &idLength));
  EXPECT_EQ(GetLastError(), ERROR_INSUFFICIENT_BUFFER);
  std::vector<WCHAR> id(idLength);
  EXPECT_FALSE(SetupDiGetDeviceInstanceIdW(list, &info, id.data(), idLength - 1, nullptr));
  EXPECT_TRUE(SetupDiGetDeviceInstanceIdW(list, &info, id.data(), idLength, nullptr));
  EXPECT_TRUE(SetupDiDestroyDeviceInfoList(list));
  EXPECT_FALSE(SetupDiDestroyDeviceInfoList(list));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
  // Nodes located by ID whatever its case; the root has no parent.
  WideString missing = Utf8ToWide("USB\\VID_0000&PID_0000\\0");
  DEVINST node = 0;
  EXPECT_EQ(CM_Locate_DevNodeW(&node, missing.data(), 0), CR_NO_SUCH_DEVNODE);
  std::u16string lower(id.data());
  for (auto& c : lower) c = (c >= u'A' && c <= u'Z') ? static_cast<char16_t>(c + 32) : c;
  ASSERT_EQ(CM_Locate_DevNodeW(&node, lower.data(), CM_LOCATE_DEVNODE_NORMAL), CR_SUCCESS);
  EXPECT_EQ(node, info.DevInst);
  DEVINST root = 0;
  ASSERT_EQ(CM_Locate_DevNodeW(&root, nullptr, 0), CR_SUCCESS);
  EXPECT_EQ(CM_Get_Parent(&node, root, 0), CR_NO_SUCH_DEVNODE);
}

}  // namespace
