// The machine as a whole: libraries and their exports, ejects and vetoes,
// the OS version, description texts and machines built through the API.
#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <set>

#include "platform/diagnostics.h"
#include "sim_helpers.h"

namespace {

using namespace simtest;

using EjectFunction = CONFIGRET (*)(DEVINST, PPNP_VETO_TYPE, LPSTR, ULONG, ULONG);
using InputReportFunction = BOOLEAN (*)(HANDLE, PVOID, ULONG);

class MachineTest : public DefaultMachineTest {};

TEST_F(MachineTest, LibrariesLoadOnceAndExportsCanBeRemoved) {
  const long handlesBefore = platform::LiveHandleCount();
  HMODULE hid = LoadLibraryW(WSTR("hid.dll"));
  ASSERT_NE(hid, nullptr);
  EXPECT_EQ(LoadLibraryW(WSTR("HID")), hid);  // same module, counted twice
  auto report = reinterpret_cast<InputReportFunction>(
      reinterpret_cast<void (*)()>(GetProcAddress(hid, "HidD_GetInputReport")));
  ASSERT_NE(report, nullptr);
  EXPECT_EQ(report, &HidD_GetInputReport);
  EXPECT_EQ(GetProcAddress(hid, "HidD_NoSuchThing"), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_PROC_NOT_FOUND);

  machine->RemoveExport("hid.dll", "HidD_GetInputReport");
  EXPECT_EQ(GetProcAddress(hid, "HidD_GetInputReport"), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_PROC_NOT_FOUND);
  EXPECT_NE(GetProcAddress(hid, "HidD_GetSerialNumberString"), nullptr);
  EXPECT_TRUE(FreeLibrary(hid));
  EXPECT_TRUE(FreeLibrary(hid));
  EXPECT_FALSE(FreeLibrary(hid));
  EXPECT_EQ(platform::LiveHandleCount(), handlesBefore);

  machine->SetModuleLoadFails("setupapi.dll", true);
  EXPECT_EQ(LoadLibraryW(WSTR("setupapi.dll")), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_MOD_NOT_FOUND);
  machine->SetModuleLoadFails("setupapi.dll", false);
  EXPECT_EQ(LoadLibraryW(WSTR("kernel99.dll")), nullptr);
  EXPECT_EQ(GetLastError(), ERROR_MOD_NOT_FOUND);
  HMODULE setupapi = LoadLibraryW(WSTR("C:\\WINDOWS\\system32\\SETUPAPI.DLL"));
  ASSERT_NE(setupapi, nullptr);
  for (const char* name : {"CM_Request_Device_EjectA", "CM_Query_And_Remove_SubTreeA",
                           "CM_Query_And_Remove_SubTreeW"}) {
    EXPECT_NE(GetProcAddress(setupapi, name), nullptr) << name;
  }
  EXPECT_TRUE(FreeLibrary(setupapi));
}

TEST_F(MachineTest, EjectIsVetoedThenSucceedsAndTheDriveGoes) {
  Found disk = DiskWith("sbp2#qx&external_hdd");
  const std::string unitId = DeviceId(ParentOf(disk.devInst));
  machine->SetEjectVeto("firewire", PNP_VetoOutstandingOpen, "\\Device\\HarddiskVolume7", 1);

  HMODULE setupapi = LoadLibraryW(WSTR("setupapi.dll"));
  ASSERT_NE(setupapi, nullptr);
  auto eject = reinterpret_cast<EjectFunction>(
      reinterpret_cast<void (*)()>(GetProcAddress(setupapi, "CM_Request_Device_EjectA")));
  ASSERT_NE(eject, nullptr);
  WideString wideId = Utf8ToWide(unitId);
  DEVINST node = 0;
  ASSERT_EQ(CM_Locate_DevNodeW(&node, wideId.data(), CM_LOCATE_DEVNODE_NORMAL), CR_SUCCESS);
  PNP_VETO_TYPE vetoType = PNP_VetoTypeUnknown;
  char vetoName[520] = {};
  EXPECT_EQ(eject(node, &vetoType, vetoName, sizeof vetoName, 0), CR_REMOVE_VETOED);
  EXPECT_EQ(vetoType, PNP_VetoOutstandingOpen);
  EXPECT_STREQ(vetoName, "\\Device\\HarddiskVolume7");
  EXPECT_TRUE(machine->Attached("firewire"));

  EXPECT_EQ(eject(node, &vetoType, vetoName, sizeof vetoName, 0), CR_SUCCESS);
  EXPECT_EQ(vetoType, PNP_VetoTypeUnknown);
  EXPECT_FALSE(machine->Attached("firewire"));
  EXPECT_EQ(CM_Locate_DevNodeW(&node, wideId.data(), 0), CR_NO_SUCH_DEVNODE);
  auto ejects = machine->Ejects();
  ASSERT_EQ(ejects.size(), 2u);
  EXPECT_TRUE(ejects[0].vetoed);
  EXPECT_FALSE(ejects[1].vetoed);
  EXPECT_EQ(ejects[1].drive, "firewire");
  EXPECT_EQ(ejects[1].instanceId, unitId);

  // An empty ID, like none, names the root; the machine's own nodes cannot
  // be removed.
  DEVINST root = 0;
  ASSERT_EQ(CM_Locate_DevNodeW(&root, nullptr, 0), CR_SUCCESS);
  EXPECT_EQ(root, machine->RootNode());
  WCHAR empty[1] = {0};
  DEVINST located = 0;
  ASSERT_EQ(CM_Locate_DevNodeW(&located, empty, CM_LOCATE_DEVNODE_NORMAL), CR_SUCCESS);
  EXPECT_EQ(located, root);
  WCHAR wideName[260];
  EXPECT_EQ(CM_Query_And_Remove_SubTreeW(root, &vetoType, wideName, 260, 0), CR_REMOVE_VETOED);
  EXPECT_TRUE(FreeLibrary(setupapi));
}

TEST_F(MachineTest, AVolumeHeldOpenVetoesTheEject) {
  Found disk = DiskWith("354d3842");
  DEVINST function = ParentOf(disk.devInst);
  machine->SetVolumeHeldOpen('G', true);
  PNP_VETO_TYPE vetoType = PNP_VetoTypeUnknown;
  WCHAR name[260] = {};
  EXPECT_EQ(CM_Query_And_Remove_SubTreeW(function, &vetoType, name, 260, 0), CR_REMOVE_VETOED);
  EXPECT_EQ(vetoType, PNP_VetoOutstandingOpen);
  EXPECT_TRUE(Contains(Text(name), "STORAGE\\VOLUME"));
  machine->SetVolumeHeldOpen('G', false);
  EXPECT_EQ(CM_Query_And_Remove_SubTreeW(function, &vetoType, name, 260, 0), CR_SUCCESS);
  EXPECT_FALSE(machine->Attached("plain"));
  EXPECT_EQ(GetLogicalDrives() & ((1u << ('F' - 'A')) | (1u << ('G' - 'A'))), 0u);
}

// The interface names device events carry, in delivery order.
std::vector<std::string> EventNames(
    const std::vector<std::pair<DWORD, std::vector<std::uint8_t>>>& events) {
  std::vector<std::string> names;
  for (const auto& [type, record] : events) {
    if (record.size() <= 28 || record[4] != DBT_DEVTYP_DEVICEINTERFACE) continue;
    names.push_back(Text(reinterpret_cast<const WCHAR*>(record.data() + 28)));
  }
  return names;
}

TEST_F(MachineTest, EjectRemovesOnlyTheSubtreeOfItsNode) {
  Found disk = DiskWith("354d3842");  // the plain drive: volumes F and G
  const DEVINST function = ParentOf(disk.devInst);
  const DEVINST composite = ParentOf(function);
  auto hidOfPlain = [] {
    GUID hidClass;
    HidD_GetHidGuid(&hidClass);
    std::vector<Found> found;
    for (const Found& f : ListInterfaces(hidClass)) {
      if (Contains(f.instanceId, "PID_2A31")) found.push_back(f);
    }
    return found;
  };
  ASSERT_EQ(hidOfPlain().size(), 1u);
  HANDLE hid = OpenDevice(hidOfPlain()[0].path, false);
  ASSERT_NE(hid, INVALID_HANDLE_VALUE);

  PNP_VETO_TYPE vetoType = PNP_VetoTypeUnknown;
  WCHAR name[260] = {};
  ASSERT_EQ(CM_Query_And_Remove_SubTreeW(function, &vetoType, name, 260, 0), CR_SUCCESS);
  EXPECT_FALSE(machine->Attached("plain")) << "the disk went with its function";
  EXPECT_EQ(GetLogicalDrives() & ((1u << ('F' - 'A')) | (1u << ('G' - 'A'))), 0u);
  EXPECT_EQ(hidOfPlain().size(), 1u) << "the HID function stays";
  EXPECT_EQ(DeviceId(ParentOf(ParentOf(hidOfPlain()[0].devInst))), DeviceId(composite));
  BYTE report[16] = {2};
  EXPECT_TRUE(HidD_GetInputReport(hid, report, sizeof report)) << "its handle still works";

  // The events name the removed interfaces as Windows does: the instance ID
  // in its own case, the class in lower case.
  ASSERT_TRUE(machine->WaitForDeviceEvents());
  std::vector<std::string> names;
  {
    std::lock_guard<std::mutex> lock(eventsMutex);
    names = EventNames(events);
  }
  ASSERT_FALSE(names.empty());
  bool diskNamed = false;
  for (const std::string& n : names) {
    EXPECT_FALSE(Contains(n, "HID#")) << n;
    diskNamed = diskNamed || Contains(n, "USBSTOR#DISK&VEN_QX&PROD_");
  }
  EXPECT_TRUE(diskNamed);
  EXPECT_TRUE(Contains(names.back(), "#{53f56307-b6bf-11d0-94f2-00a0c91efb8b}")) << names.back();

  // The composite device takes the rest; attached again, the drive is whole.
  ASSERT_EQ(CM_Query_And_Remove_SubTreeW(composite, &vetoType, name, 260, 0), CR_SUCCESS);
  EXPECT_TRUE(hidOfPlain().empty());
  EXPECT_FALSE(HidD_GetInputReport(hid, report, sizeof report));
  EXPECT_TRUE(CloseHandle(hid));
  machine->Attach("plain");
  EXPECT_TRUE(machine->Attached("plain"));
  EXPECT_EQ(hidOfPlain().size(), 1u);
}

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
  // A handler that blocks holds up the next event.
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

TEST_F(MachineTest, OsVersionIsTheMachines) {
  DWORD version = GetVersion();
  EXPECT_EQ(LOBYTE(LOWORD(version)), 5);
  EXPECT_EQ(HIBYTE(LOWORD(version)), 1);
  EXPECT_EQ(version & 0x80000000u, 0u);
  OSVERSIONINFOW info{};
  info.dwOSVersionInfoSize = sizeof info;
  ASSERT_TRUE(GetVersionExW(&info));
  EXPECT_EQ(info.dwMajorVersion, 5u);
  EXPECT_EQ(info.dwMinorVersion, 1u);
  EXPECT_EQ(info.dwBuildNumber, 2600u);
  EXPECT_EQ(info.dwPlatformId, VER_PLATFORM_WIN32_NT);
  info.dwOSVersionInfoSize = 20;
  EXPECT_FALSE(GetVersionExW(&info));

  machine->SetOsVersion(5, 0, 2195);
  EXPECT_EQ(GetVersion(), 0x08930005u);
  machine->SetOsVersion(4, 10, 2222, VER_PLATFORM_WIN32_WINDOWS);
  EXPECT_NE(GetVersion() & 0x80000000u, 0u);
}

TEST_F(MachineTest, InterfaceListsCanBeMadeToFail) {
  machine->FailInterfaceList(sim::kVendorClassB, ERROR_NOT_ENOUGH_MEMORY);
  EXPECT_EQ(SetupDiGetClassDevsW(&sim::kVendorClassB, nullptr, nullptr,
                                 DIGCF_PRESENT | DIGCF_DEVICEINTERFACE),
            INVALID_HANDLE_VALUE);
  EXPECT_EQ(GetLastError(), ERROR_NOT_ENOUGH_MEMORY);
  machine->FailInterfaceList(sim::kVendorClassB, 0);
  EXPECT_TRUE(ListInterfaces(sim::kVendorClassB).empty());
}

TEST(MachineDescription, ErrorsNameTheLine) {
  std::string error;
  EXPECT_FALSE(sim::LoadMachine("os 5.1\ndrive x\n  bus usb\n  colour red\nend\n", &error));
  EXPECT_EQ(error, "line 4: cannot use \"colour red\"");
  EXPECT_FALSE(sim::LoadMachine("drive x\n  bus usb\n", &error));
  EXPECT_EQ(error, "line 2: missing \"end\"");
  EXPECT_FALSE(sim::LoadMachine("volume Q fixed lots 1G\n", &error));
  EXPECT_TRUE(Contains(error, "line 1"));
  EXPECT_FALSE(sim::LoadMachine("disk d\n  bus other\nend\n", &error));
  EXPECT_TRUE(Contains(error, "disk-instance-id"));
}

TEST(MachineDescription, DescribedDriveAnswersAsWritten) {
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
  PassThroughRequest r = MakeRequest({0x12, 0, 0, 0, 74, 0}, data, 74);
  ASSERT_TRUE(Scsi(device, &r));
  EXPECT_EQ(data[4], 31);
  EXPECT_EQ(r.sptd.DataTransferLength, 36u);
  // Page 0x80 of a serial that is only the prefix is empty.
  std::uint8_t page[20] = {};
  PassThroughRequest v = MakeRequest({0x12, 1, 0x80, 0, 20, 0}, page, 20);
  ASSERT_TRUE(Scsi(device, &v));
  EXPECT_EQ(page[3], 0);
  EXPECT_TRUE(CloseHandle(device));
  GUID hid{};
  HidD_GetHidGuid(&hid);
  EXPECT_TRUE(ListInterfaces(hid).empty());
  EXPECT_EQ(GetDriveTypeW(WSTR("K:\\")), DRIVE_REMOVABLE);
  machine->Uninstall();
}

TEST(MachineDescription, ADriveAddedDetachedArrivesLater) {
  std::string error;
  auto machine = sim::LoadMachine(
      "drive late\n  bus 1394\n  channel driver\n  attached no\n"
      "  volume M fixed 1G 1G\nend\n",
      &error);
  ASSERT_TRUE(machine) << error;
  machine->Install();
  EXPECT_TRUE(ListInterfaces(GUID_DEVINTERFACE_DISK).empty());
  EXPECT_EQ(GetLogicalDrives(), 0u);
  // Arrival events go to the emulated service manager (no service listens).
  machine->Attach("late");
  EXPECT_TRUE(machine->WaitForDeviceEvents());
  EXPECT_EQ(ListInterfaces(GUID_DEVINTERFACE_DISK).size(), 1u);
  EXPECT_EQ(ListInterfaces(sim::kVendorClassA).size(), 1u);
  EXPECT_EQ(GetLogicalDrives(), 1u << ('M' - 'A'));
  machine->Uninstall();
}

TEST(MachineDescription, SeventyDrivesAllEnumerate) {
  sim::Machine machine;
  for (int i = 0; i < 70; ++i) {
    sim::DriveSpec spec;
    spec.name = "d" + std::to_string(i);
    char serial[16];
    std::snprintf(serial, sizeof serial, "QX-S%04d", i);
    spec.serial = serial;
    machine.AddDrive(spec);
  }
  machine.Install();
  auto disks = ListInterfaces(GUID_DEVINTERFACE_DISK);
  EXPECT_EQ(disks.size(), 70u);
  std::set<std::string> ids;
  for (const auto& d : disks) ids.insert(d.instanceId);
  EXPECT_EQ(ids.size(), 70u);
  GUID hid{};
  HidD_GetHidGuid(&hid);
  EXPECT_EQ(ListInterfaces(hid).size(), 70u);
  EXPECT_EQ(machine.DiskNumber("d69"), 70u);
  machine.Uninstall();
}

TEST(MachineDescription, EnvironmentNamesAnotherMachine) {
  std::string path = ::testing::TempDir() + "sim-machine.txt";
  {
    std::ofstream file(path);
    file << "os 5.0 2195\nvolume Z fixed 1G 1G\n";
  }
  setenv("SKYVANE_MACHINE", path.c_str(), 1);
  auto machine = sim::CreateDefaultMachine();
  unsetenv("SKYVANE_MACHINE");
  std::remove(path.c_str());
  ASSERT_TRUE(machine);
  machine->Install();
  EXPECT_EQ(GetLogicalDrives(), 1u << 25);
  EXPECT_EQ(GetVersion() & 0xFFFF, 0x0005u);
  machine->Uninstall();

  setenv("SKYVANE_MACHINE", "/nonexistent/machine.txt", 1);
  auto fallback = sim::CreateDefaultMachine();
  unsetenv("SKYVANE_MACHINE");
  fallback->Install();
  EXPECT_EQ(ListInterfaces(GUID_DEVINTERFACE_DISK).size(), 5u);
  fallback->Uninstall();
}

}  // namespace
