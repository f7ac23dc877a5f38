// Description texts, the machine the environment names, and device events.
#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <fstream>

#include "sim_helpers.h"

namespace {

using namespace simtest;

TEST(MachineDescription, ErrorsNameTheLine) {
  const struct {
    const char* text;
    const char* error;  // the whole message, or a part of it
  } rows[] = {
      {"os 5.1\ndrive x\n  bus usb\n  colour red\nend\n", "line 4: cannot use \"colour red\""},
      {"drive x\n  bus usb\n", "line 2: missing \"end\""},
      {"volume Q fixed lots 1G\n", "line 1"},
      {"disk d\n  bus other\nend\n", "disk-instance-id"},
      {"language xx\n", "line 1"},
  };
  for (const auto& row : rows) {
    std::string error;
    EXPECT_FALSE(sim::LoadMachine(row.text, &error)) << row.text;
    EXPECT_TRUE(Contains(error, row.error)) << row.text << " gave " << error;
  }
}

TEST(MachineDescription, DescribedDriveAnswersAsWrittenAndArrivesWhenAttached) {
  std::string error;
  auto machine = sim::LoadMachine(R"(# one odd drive
os 5.0 2195
drive odd
  bus usb
  channel none
  vendor ACME
  product Box
  model-code 2A30
  serial QX-
  additional-length 31
  usb-serial 0000AB
  volume K removable 1G 512M
end
drive late
  bus 1394
  channel driver
  attached no
  volume M fixed 1G 1G
end
)",
                                  &error);
  ASSERT_TRUE(machine) << error;
  machine->Install();
  EXPECT_EQ(GetVersion() & 0xFFFF, 0x0005u);
  auto disks = ListInterfaces(GUID_DEVINTERFACE_DISK);
  ASSERT_EQ(disks.size(), 1u);
  EXPECT_TRUE(Contains(disks[0].instanceId, "VEN_ACME&PROD_BOX"));
  EXPECT_TRUE(Contains(disks[0].instanceId, "\\0000AB&0"));
  HANDLE device = OpenDevice(disks[0].path, false);
  ASSERT_NE(device, INVALID_HANDLE_VALUE);
  std::uint8_t data[74] = {};
  PassThroughRequest r = Inquiry(data);
  ASSERT_TRUE(Scsi(device, &r));
  EXPECT_EQ(data[4], 31);
  EXPECT_EQ(r.spt.DataTransferLength, 36u);
  EXPECT_TRUE(CloseHandle(device));
  GUID hid{};
  HidD_GetHidGuid(&hid);
  EXPECT_TRUE(ListInterfaces(hid).empty());
  EXPECT_EQ(GetDriveTypeW(WSTR("K:\\")), DRIVE_REMOVABLE);
  EXPECT_EQ(GetLogicalDrives(), 1u << ('K' - 'A'));

  machine->Attach("late");  // events go to the emulated manager; no service listens
  EXPECT_TRUE(machine->WaitForDeviceEvents());
  EXPECT_EQ(ListInterfaces(GUID_DEVINTERFACE_DISK).size(), 2u);
  EXPECT_EQ(ListInterfaces(sim::kVendorClassA).size(), 1u);
  EXPECT_EQ(GetLogicalDrives(), (1u << ('K' - 'A')) | (1u << ('M' - 'A')));
  machine->Uninstall();
}

TEST(MachineDescription, EnvironmentNamesAnotherMachineAndAMissingFileGivesTheDefault) {
  std::string path = ::testing::TempDir() + "sim-machine.txt";
  std::ofstream(path) << "os 5.0 2195\nvolume Z fixed 1G 1G\n";
  for (const std::string& named : {path, std::string("/nonexistent/machine.txt")}) {
    setenv("SKYVANE_MACHINE", named.c_str(), 1);
    auto machine = sim::CreateDefaultMachine();
    unsetenv("SKYVANE_MACHINE");
    ASSERT_TRUE(machine);
    machine->Install();
    if (named == path) {
      EXPECT_EQ(GetLogicalDrives(), 1u << 25);
    } else {
      EXPECT_EQ(ListInterfaces(GUID_DEVINTERFACE_DISK).size(), 5u);
    }
    machine->Uninstall();
  }
  std::remove(path.c_str());
}

class MachineTest : public DefaultMachineTest {};

// A handler that blocks holds up the next event: events reach the service
// one at a time, in order.
TEST_F(MachineTest, DeviceEventsAreDeliveredOneAtATime) {
  std::mutex gate;
  std::condition_variable wake;
  int delivered = 0;
  bool release = false;
  machine->SetDeviceEventSink([&](DWORD, const void*) {
    std::unique_lock<std::mutex> lock(gate);
    ++delivered;
    wake.notify_all();
    wake.wait(lock, [&] { return release; });
  });
  machine->Detach("plain");  // several interfaces and a volume record
  {
    std::unique_lock<std::mutex> lock(gate);
    ASSERT_TRUE(wake.wait_for(lock, std::chrono::seconds(10), [&] { return delivered == 1; }));
  }
  EXPECT_FALSE(machine->WaitForDeviceEvents(200));
  {
    std::lock_guard<std::mutex> lock(gate);
    EXPECT_EQ(delivered, 1);
    release = true;
  }
  wake.notify_all();
  ASSERT_TRUE(machine->WaitForDeviceEvents());
  std::lock_guard<std::mutex> lock(gate);
  EXPECT_GT(delivered, 2);
}

}  // namespace
