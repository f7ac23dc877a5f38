// Helpers of the simulation tests.
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
#include "transport/pass_through.h"

namespace simtest {

// An INQUIRY of 74 bytes into `data`.
inline PassThroughRequest Inquiry(std::uint8_t (&data)[74]) {
  PassThroughRequest r{};
  r.spt.Length = sizeof(SCSI_PASS_THROUGH_DIRECT);
  r.spt.CdbLength = 6;
  r.spt.SenseInfoLength = 18;
  r.spt.DataIn = SCSI_IOCTL_DATA_IN;
  r.spt.DataTransferLength = sizeof data;
  r.spt.TimeOutValue = 20;
  r.spt.DataBuffer = data;
  r.spt.SenseInfoOffset = 60;
  r.spt.Cdb[0] = 0x12;
  r.spt.Cdb[4] = sizeof data;
  r.totalLength = 80;
  return r;
}

// Sends a pass-through command, synchronously unless `overlapped` is given.
inline bool Scsi(HANDLE device, PassThroughRequest* request, OVERLAPPED* overlapped = nullptr) {
  DWORD bytes = 0;
  return DeviceIoControl(device, IOCTL_SCSI_PASS_THROUGH_DIRECT, request, sizeof *request, request,
                         sizeof *request, &bytes, overlapped) != FALSE;
}

inline std::string Text(const WCHAR* text) {
  return WideToUtf8(WideView(text));
}

inline bool Contains(const std::string& text, const std::string& part) {
  return text.find(part) != std::string::npos;
}

struct Found {
  std::string path;
  DEVINST devInst = 0;
  std::string instanceId;
};

// Every interface of a class, read as the service reads it.
inline std::vector<Found> ListInterfaces(const GUID& interfaceClass) {
  std::vector<Found> found;
  HDEVINFO list = SetupDiGetClassDevsW(&interfaceClass, nullptr, nullptr,
                                       DIGCF_PRESENT | DIGCF_DEVICEINTERFACE);
  EXPECT_NE(list, INVALID_HANDLE_VALUE);
  SP_DEVICE_INTERFACE_DATA data{sizeof data, {}, 0, 0};
  for (DWORD index = 0; SetupDiEnumDeviceInterfaces(list, nullptr, &interfaceClass, index, &data);
       ++index) {
    DWORD needed = 0;
    SetupDiGetDeviceInterfaceDetailW(list, &data, nullptr, 0, &needed, nullptr);
    std::vector<std::uint8_t> buffer(needed);
    auto* detail = reinterpret_cast<SP_DEVICE_INTERFACE_DETAIL_DATA_W*>(buffer.data());
    detail->cbSize = sizeof(SP_DEVICE_INTERFACE_DETAIL_DATA_W);
    SP_DEVINFO_DATA info{sizeof info, {}, 0, 0};
    WCHAR id[512] = {};
    EXPECT_TRUE(SetupDiGetDeviceInterfaceDetailW(list, &data, detail, needed, nullptr, &info) &&
                SetupDiGetDeviceInstanceIdW(list, &info, id, 512, nullptr));
    found.push_back({Text(detail->DevicePath), info.DevInst, Text(id)});
  }
  EXPECT_EQ(GetLastError(), ERROR_NO_MORE_ITEMS);
  SetupDiDestroyDeviceInfoList(list);
  return found;
}

inline HANDLE OpenDevice(const std::string& path, bool overlapped = true) {
  WideString wide = Utf8ToWide(path);
  return CreateFileW(wide.c_str(), GENERIC_READ | GENERIC_WRITE, FILE_SHARE_READ | FILE_SHARE_WRITE,
                     nullptr, OPEN_EXISTING, overlapped ? FILE_FLAG_OVERLAPPED : 0, nullptr);
}

// The path of the first interface of a class whose path contains `part`.
inline std::string PathWith(const GUID& interfaceClass, const std::string& part = "") {
  for (const Found& f : ListInterfaces(interfaceClass)) {
    if (Contains(f.path, part)) return f.path;
  }
  ADD_FAILURE() << "no interface with " << part;
  return {};
}

// The default machine, installed for the case; its device events are recorded.
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
