// Helpers of the simulation tests: a machine installed for one case, device
// lists read through SetupAPI, and pass-through requests as the service
// builds them.
#pragma once

#include <gtest/gtest.h>

#include <cstddef>
#include <cstring>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "machine.h"
#include "platform/wide.h"
#include "platform/win32.h"

namespace simtest {

// The 80-byte pass-through request of the service.
struct PassThroughRequest {
  SCSI_PASS_THROUGH_DIRECT sptd;
  ULONG totalLength;
  UCHAR sense[20];
};
static_assert(sizeof(PassThroughRequest) == 80);
static_assert(offsetof(PassThroughRequest, totalLength) == 56);
static_assert(offsetof(PassThroughRequest, sense) == 60);

inline PassThroughRequest MakeRequest(std::initializer_list<UCHAR> cdb, void* buffer, ULONG length,
                                      UCHAR direction = SCSI_IOCTL_DATA_IN) {
  PassThroughRequest r{};
  r.sptd.Length = sizeof(SCSI_PASS_THROUGH_DIRECT);
  r.sptd.CdbLength = static_cast<UCHAR>(cdb.size());
  r.sptd.SenseInfoLength = 18;
  r.sptd.DataIn = direction;
  r.sptd.DataTransferLength = length;
  r.sptd.TimeOutValue = 20;
  r.sptd.DataBuffer = buffer;
  r.sptd.SenseInfoOffset = 60;
  std::size_t i = 0;
  for (UCHAR b : cdb) r.sptd.Cdb[i++] = b;
  r.totalLength = 80;
  return r;
}

// Sends a pass-through command on a synchronous handle.
inline bool Scsi(HANDLE device, PassThroughRequest* request) {
  DWORD bytes = 0;
  return DeviceIoControl(device, IOCTL_SCSI_PASS_THROUGH_DIRECT, request, sizeof *request, request,
                         sizeof *request, &bytes, nullptr) != FALSE;
}

struct Found {
  std::string path;
  DEVINST devInst = 0;
  std::string instanceId;
};

inline std::string Text(const WCHAR* text) {
  return WideToUtf8(WideView(text));
}

// Every interface of a class, read as the service reads it (size query,
// then the detail and the device's instance ID).
inline std::vector<Found> ListInterfaces(const GUID& interfaceClass) {
  std::vector<Found> found;
  HDEVINFO list = SetupDiGetClassDevsW(&interfaceClass, nullptr, nullptr,
                                       DIGCF_PRESENT | DIGCF_DEVICEINTERFACE);
  EXPECT_NE(list, INVALID_HANDLE_VALUE);
  if (list == INVALID_HANDLE_VALUE) return found;
  for (DWORD index = 0;; ++index) {
    SP_DEVICE_INTERFACE_DATA data{};
    data.cbSize = sizeof data;
    if (!SetupDiEnumDeviceInterfaces(list, nullptr, &interfaceClass, index, &data)) {
      EXPECT_EQ(GetLastError(), ERROR_NO_MORE_ITEMS);
      break;
    }
    DWORD needed = 0;
    EXPECT_FALSE(SetupDiGetDeviceInterfaceDetailW(list, &data, nullptr, 0, &needed, nullptr));
    EXPECT_EQ(GetLastError(), ERROR_INSUFFICIENT_BUFFER);
    std::vector<std::uint8_t> buffer(needed);
    auto* detail = reinterpret_cast<SP_DEVICE_INTERFACE_DETAIL_DATA_W*>(buffer.data());
    detail->cbSize = sizeof(SP_DEVICE_INTERFACE_DETAIL_DATA_W);
    SP_DEVINFO_DATA info{};
    info.cbSize = sizeof info;
    EXPECT_TRUE(SetupDiGetDeviceInterfaceDetailW(list, &data, detail, needed, nullptr, &info));
    WCHAR id[512] = {};
    EXPECT_TRUE(SetupDiGetDeviceInstanceIdW(list, &info, id, 512, nullptr));
    found.push_back({Text(detail->DevicePath), info.DevInst, Text(id)});
  }
  EXPECT_TRUE(SetupDiDestroyDeviceInfoList(list));
  return found;
}

inline std::string DeviceId(DEVINST node) {
  WCHAR id[MAX_DEVICE_ID_LEN + 1] = {};
  EXPECT_EQ(CM_Get_Device_IDW(node, id, MAX_DEVICE_ID_LEN + 1, 0), CR_SUCCESS);
  return Text(id);
}

inline DEVINST ParentOf(DEVINST node) {
  DEVINST parent = 0;
  EXPECT_EQ(CM_Get_Parent(&parent, node, 0), CR_SUCCESS);
  return parent;
}

inline std::string NodeText(DEVINST node, ULONG property) {
  WCHAR text[256] = {};
  ULONG length = sizeof text;
  if (CM_Get_DevNode_Registry_PropertyW(node, property, nullptr, text, &length, 0) != CR_SUCCESS) {
    return "<none>";
  }
  return Text(text);
}

inline bool Contains(const std::string& text, const std::string& part) {
  return text.find(part) != std::string::npos;
}

inline HANDLE OpenDevice(const std::string& path, bool overlapped = true,
                         DWORD access = GENERIC_READ | GENERIC_WRITE) {
  WideString wide = Utf8ToWide(path);
  return CreateFileW(wide.c_str(), access, FILE_SHARE_READ | FILE_SHARE_WRITE, nullptr,
                     OPEN_EXISTING, overlapped ? FILE_FLAG_OVERLAPPED : 0, nullptr);
}

// A control on a synchronous handle; false with the error in *error.
inline bool Control(HANDLE device, DWORD code, void* in, DWORD inLength, void* out, DWORD outLength,
                    DWORD* bytes = nullptr, DWORD* error = nullptr) {
  DWORD count = 0;
  BOOL ok = DeviceIoControl(device, code, in, inLength, out, outLength, &count, nullptr);
  if (bytes != nullptr) *bytes = count;
  if (error != nullptr) *error = ok ? ERROR_SUCCESS : GetLastError();
  return ok != FALSE;
}

// Finds the disk interface whose path contains `part`.
inline Found DiskWith(const std::string& part) {
  for (const Found& f : ListInterfaces(GUID_DEVINTERFACE_DISK)) {
    if (Contains(f.path, part) || Contains(f.instanceId, part)) return f;
  }
  ADD_FAILURE() << "no disk with " << part;
  return {};
}

// A machine built from the embedded default description, installed for the
// test case; events go to a list instead of the service manager.
class DefaultMachineTest : public ::testing::Test {
 protected:
  void SetUp() override {
    std::string error;
    machine = sim::LoadMachine(sim::DefaultMachineText(), &error);
    ASSERT_TRUE(machine) << error;
    machine->SetDeviceEventSink([this](DWORD type, const void* record) {
      DWORD size = 0;
      std::memcpy(&size, record, 4);
      std::lock_guard<std::mutex> lock(eventsMutex);
      auto* bytes = static_cast<const std::uint8_t*>(record);
      events.emplace_back(type, std::vector<std::uint8_t>(bytes, bytes + size));
    });
    machine->Install();
  }
  void TearDown() override {
    if (machine) {
      machine->WaitForDeviceEvents();
      machine->Uninstall();
    }
  }

  std::unique_ptr<sim::Machine> machine;
  std::mutex eventsMutex;
  std::vector<std::pair<DWORD, std::vector<std::uint8_t>>> events;
};

}  // namespace simtest
