// A program that links the default-machine registration and builds no
// machine of its own finds the embedded default machine, as the host
// executable does.
#include <gtest/gtest.h>

#include "sim_helpers.h"

namespace {

using namespace simtest;

TEST(DefaultInstall, DeviceCallsFindTheEmbeddedMachine) {
  EXPECT_EQ(ListInterfaces(GUID_DEVINTERFACE_DISK).size(), 5u);
  EXPECT_EQ(GetLogicalDrives(), 0x1FCu);
  GUID hid{};
  HidD_GetHidGuid(&hid);
  EXPECT_EQ(ListInterfaces(hid).size(), 2u);
  // The disk paths open through CreateFileW.
  for (const Found& disk : ListInterfaces(GUID_DEVINTERFACE_DISK)) {
    HANDLE device = OpenDevice(disk.path, true);
    EXPECT_NE(device, INVALID_HANDLE_VALUE) << disk.path;
    if (device != INVALID_HANDLE_VALUE) CloseHandle(device);
  }
}

}  // namespace
