// The default machine seen through SetupAPI and the configuration manager,
// judged by the service's own acceptance rules (written out here from the
// rules, not taken from the simulation's code).
#include <gtest/gtest.h>

#include <cctype>
#include <cstdio>

#include "sim_helpers.h"

namespace {

using namespace simtest;

// Disk interface path → bus kind (2 USB, 3 IEEE 1394, 0 not the maker's).
int DiskBusKind(const std::string& path) {
  if (Contains(path, "usbstor") && Contains(path, "qx") && Contains(path, "disk")) return 2;
  if (Contains(path, "sbp2") && (Contains(path, "qx") || Contains(path, "orvanel")) &&
      (Contains(path, "external") || Contains(path, "quarry") || Contains(path, "rambler"))) {
    return 3;
  }
  return 0;
}

const char* const kSuffixes[] = {"_2A30", "_2A31", "_2A34", "_2A35", "_2A37", "_2A39", "_5E21",
                                 "_5E22", "_5E23", "_5E24", "_5E25", "_7B41", "_7B42", "_7B43",
                                 "_7B44", "_7B45", "_3C12", "_3C13", "_3C14"};
// Model-table row (1-based) whose suffix a long text contains; 0 for none.
int ModelRow(const std::string& text) {
  for (int i = 0; i < 19; ++i) {
    if (Contains(text, kSuffixes[i])) return i + 1;
  }
  return 0;
}

bool IsChannelModel(const std::string& text) {
  for (const char* e :
       {"C12", "C13", "C14", "E21", "E22", "E23", "E24", "E25", "7B41", "7B42", "7B43", "7B44",
        "7B45", "1394\\QX______&EXTERNAL_HDD", "1394\\QX&EXTERNAL_HDD", "1394\\QX&QUARRY"}) {
    if (Contains(text, e)) return true;
  }
  return false;
}

bool IsStandaloneModel(const std::string& text) {
  return Contains(text, "E24") || Contains(text, "7B44") || Contains(text, "7B45");
}

// The channel classification of an interface's instance ID: the channel
// mode, or -1 when the interface is skipped.
int ChannelMode(const std::string& id) {
  if (Contains(id, "SBP2") && Contains(id, "QX") &&
      (Contains(id, "SES") || Contains(id, "QUARRY") || Contains(id, "EXTERNAL_DEVICE"))) {
    return 2;
  }
  if (Contains(id, "HID") && ModelRow(id) != 0) return IsChannelModel(id) ? 1 : 0;
  if (Contains(id, "1394") && Contains(id, "QX")) return Contains(id, "LIGHTS") ? 1 : 0;
  if (Contains(id, "1394") && (Contains(id, "30E0") || Contains(id, "6D1F"))) return 1;
  return -1;
}

std::string Tail(const std::string& id) {
  return id.substr(id.rfind('\\') + 1);
}

std::string Upper(std::string text) {
  for (auto& c : text) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  return text;
}

class Enumeration : public DefaultMachineTest {};

TEST_F(Enumeration, DisksOfTheMakerPassThePathRulesAndOthersDoNot) {
  auto disks = ListInterfaces(GUID_DEVINTERFACE_DISK);
  ASSERT_EQ(disks.size(), 5u);
  int usb = 0;
  int fireWire = 0;
  for (const Found& disk : disks) {
    int kind = DiskBusKind(disk.path);
    if (Contains(disk.instanceId, "IDE\\")) {
      EXPECT_EQ(kind, 0) << disk.path;
      continue;
    }
    DEVINST parent = ParentOf(disk.devInst);
    std::string parentId = DeviceId(parent);
    if (kind == 2) {
      ++usb;
      // A USB candidate is accepted only when its parent names a model row.
      EXPECT_NE(ModelRow(parentId), 0) << parentId;
      EXPECT_TRUE(Contains(disk.instanceId, "USBSTOR\\DISK&VEN_QX&PROD_EXTERNAL_HDD"));
      EXPECT_EQ(NodeText(disk.devInst, CM_DRP_FRIENDLYNAME), "QX External HDD USB Device");
    } else {
      ASSERT_EQ(kind, 3) << disk.path;
      ++fireWire;
      EXPECT_TRUE(IsChannelModel(parentId)) << parentId;
      // The 1394 name carries the 8-character vendor field.
      EXPECT_EQ(NodeText(disk.devInst, CM_DRP_FRIENDLYNAME).substr(0, 9), "QX       ");
    }
    EXPECT_EQ(NodeText(disk.devInst, CM_DRP_DEVICEDESC), "Disk drive");
  }
  EXPECT_EQ(usb, 2);
  EXPECT_EQ(fireWire, 2);
}

TEST_F(Enumeration, UsbDisksCarryTheSerialOfTheirCompositeDevice) {
  struct Case {
    const char* serialText;  // drive serial without "QX-"
    const char* suffix;
    bool channelModel;
  } cases[] = {{"7K2A9F31", "_7B44", true}, {"5M8B2D07", "_2A31", false}};
  for (const Case& c : cases) {
    const std::string usbSerial = [&] {
      std::string hex;
      char two[3];
      for (const char* p = c.serialText; *p != 0; ++p) {
        std::snprintf(two, sizeof two, "%02X", static_cast<unsigned char>(*p));
        hex += two;
      }
      return hex;
    }();
    Found disk = DiskWith(c.suffix == std::string("_7B44") ? "374b3241" : "354d3842");
    ASSERT_NE(disk.devInst, 0u);
    // The instance tail is "<serial>&0"; the serial key is the text before
    // the ampersand.
    EXPECT_EQ(Tail(disk.instanceId), usbSerial + "&0");
    DEVINST function = ParentOf(disk.devInst);
    EXPECT_EQ(ModelRow(DeviceId(function)), ModelRow(std::string("X") + c.suffix));
    EXPECT_EQ(IsChannelModel(DeviceId(function)), c.channelModel);
    DEVINST composite = ParentOf(function);
    EXPECT_EQ(NodeText(composite, CM_DRP_DEVICEDESC), "USB Composite Device");
    EXPECT_EQ(Tail(DeviceId(composite)), usbSerial);
    DWORD caps = 0;
    ULONG length = sizeof caps;
    ASSERT_EQ(CM_Get_DevNode_Registry_PropertyW(composite, CM_DRP_CAPABILITIES, nullptr, &caps,
                                                &length, 0),
              CR_SUCCESS);
    EXPECT_NE(caps & CM_DEVCAP_SURPRISEREMOVALOK, 0u);
  }
}

// Descriptions follow the system's language; the composite device is known
// by its service whatever the text says.
TEST(LocalisedMachine, DescriptionsAreInTheSystemsLanguage) {
  const struct {
    const char* language;
    const char* composite;
  } cases[] = {
      {"de", "USB-Verbundger\xC3\xA4t"},
      {"ja", "USB \xE8\xA4\x87\xE5\x90\x88\xE3\x83\x87\xE3\x83\x90\xE3\x82\xA4\xE3\x82\xB9"}};
  for (const auto& c : cases) {
    std::string error;
    auto machine = sim::LoadMachine(
        std::string("language ") + c.language + "\ndrive one\n  bus usb\n  channel hid\nend\n",
        &error);
    ASSERT_TRUE(machine) << error;
    machine->Install();
    Found disk = DiskWith("usbstor");
    const DEVINST composite = ParentOf(ParentOf(disk.devInst));
    EXPECT_EQ(NodeText(composite, CM_DRP_DEVICEDESC), c.composite) << c.language;
    EXPECT_EQ(NodeText(composite, CM_DRP_SERVICE), "usbccgp");
    EXPECT_NE(NodeText(disk.devInst, CM_DRP_DEVICEDESC), "Disk drive") << c.language;
    machine->Uninstall();
  }
  std::string error;
  EXPECT_FALSE(sim::LoadMachine("language xx\n", &error));
}

TEST_F(Enumeration, HidCollectionsClassifyAndLeadToTheirDisk) {
  GUID hidClass{};
  HidD_GetHidGuid(&hidClass);
  auto hids = ListInterfaces(hidClass);
  ASSERT_EQ(hids.size(), 2u);
  int gaugeChannels = 0;
  for (const Found& hid : hids) {
    int mode = ChannelMode(hid.instanceId);
    ASSERT_GE(mode, 0) << hid.instanceId;
    if (mode == 1) {
      ++gaugeChannels;
      EXPECT_TRUE(IsStandaloneModel(hid.instanceId));
    } else {
      EXPECT_FALSE(IsChannelModel(hid.instanceId)) << hid.instanceId;
    }
    // Serial key: the first ancestor described as a USB composite device.
    DEVINST node = ParentOf(hid.devInst);
    while (!(Contains(NodeText(node, CM_DRP_DEVICEDESC), "USB") &&
             Contains(NodeText(node, CM_DRP_DEVICEDESC), "Composite Device"))) {
      node = ParentOf(node);
      ASSERT_NE(node, 0u);
    }
    std::string serialKey = Tail(DeviceId(node));
    // Identity: the HID serial string, read on a handle without access rights.
    HANDLE device = OpenDevice(hid.path, false, 0);
    ASSERT_NE(device, INVALID_HANDLE_VALUE);
    WCHAR serial[256] = {};
    ASSERT_TRUE(HidD_GetSerialNumberString(device, serial, sizeof serial));
    EXPECT_TRUE(CloseHandle(device));
    EXPECT_EQ(Text(serial), serialKey);
    // The drive record made from the disk matches it in upper case.
    bool matched = false;
    for (const Found& d : ListInterfaces(GUID_DEVINTERFACE_DISK)) {
      if (Contains(Upper(d.instanceId), Text(serial))) matched = true;
    }
    EXPECT_TRUE(matched) << Text(serial);
  }
  EXPECT_EQ(gaugeChannels, 1);
}

TEST_F(Enumeration, VendorInterfacesBindToTheFireWireDrives) {
  auto classA = ListInterfaces(sim::kVendorClassA);
  auto classB = ListInterfaces(sim::kVendorClassB);
  auto classC = ListInterfaces(sim::kVendorClassC);
  ASSERT_EQ(classA.size(), 1u);
  EXPECT_EQ(classB.size(), 0u);
  ASSERT_EQ(classC.size(), 1u);

  // Driver channel: rule 3, bound through the disk's parent ID.
  const Found& driver = classA[0];
  EXPECT_EQ(ChannelMode(driver.instanceId), 0);
  Found fireWireDisk = DiskWith("sbp2#qx&external_hdd");
  EXPECT_TRUE(Contains(DeviceId(ParentOf(fireWireDisk.devInst)), Tail(driver.instanceId)));

  // Enclosure device: rule 1, bound through the disk's instance tail.
  const Found& enclosure = classC[0];
  EXPECT_EQ(ChannelMode(enclosure.instanceId), 2);
  Found enclosureDisk = DiskWith("quarry&lun0");
  EXPECT_EQ(Tail(enclosure.instanceId), Tail(enclosureDisk.instanceId));
  // On Windows 2000 the control interface is found by path and serial key.
  std::string key = Tail(enclosureDisk.instanceId);
  for (auto& ch : key) ch = static_cast<char>(std::tolower(static_cast<unsigned char>(ch)));
  EXPECT_TRUE(Contains(enclosure.path, "qx") && Contains(enclosure.path, "quarry") &&
              Contains(enclosure.path, key) && Contains(enclosure.path, "sbp2"));
}

TEST_F(Enumeration, OtherClassesListTheUsbDevicesAndVolumes) {
  EXPECT_EQ(ListInterfaces(GUID_DEVINTERFACE_USB_DEVICE).size(), 2u);
  EXPECT_EQ(ListInterfaces(GUID_DEVINTERFACE_VOLUME).size(), 5u);
}

TEST_F(Enumeration, SetupApiRejectsMisuseAsWindowsDoes) {
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
  // A property the node lacks, and an instance ID buffer one unit short.
  SP_DEVINFO_DATA info{};
  info.cbSize = sizeof info;
  ASSERT_TRUE(SetupDiGetDeviceInterfaceDetailW(list, &data, detail, needed, nullptr, &info));
  BYTE property[8];
  EXPECT_FALSE(SetupDiGetDeviceRegistryPropertyW(list, &info, SPDRP_CAPABILITIES + 100, nullptr,
                                                 property, sizeof property, nullptr));
  DWORD idLength = 0;
  EXPECT_FALSE(SetupDiGetDeviceInstanceIdW(list, &info, nullptr, 0, &idLength));
  EXPECT_EQ(GetLastError(), ERROR_INSUFFICIENT_BUFFER);
  std::vector<WCHAR> id(idLength);
  EXPECT_FALSE(SetupDiGetDeviceInstanceIdW(list, &info, id.data(), idLength - 1, nullptr));
  EXPECT_TRUE(SetupDiGetDeviceInstanceIdW(list, &info, id.data(), idLength, nullptr));
  EXPECT_TRUE(SetupDiDestroyDeviceInfoList(list));
  EXPECT_FALSE(SetupDiDestroyDeviceInfoList(list));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_HANDLE);
}

TEST_F(Enumeration, ConfigurationManagerFindsNodesAndReportsSizes) {
  Found disk = DiskWith("sbp2#qx&external_hdd");
  std::string parentId = DeviceId(ParentOf(disk.devInst));
  // Located by ID whatever the case.
  std::string lower = parentId;
  for (auto& c : lower) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  WideString wide = Utf8ToWide(lower);
  DEVINST node = 0;
  ASSERT_EQ(CM_Locate_DevNodeW(&node, wide.data(), CM_LOCATE_DEVNODE_NORMAL), CR_SUCCESS);
  EXPECT_EQ(node, ParentOf(disk.devInst));
  WideString missing = Utf8ToWide("USB\\VID_0000&PID_0000\\0");
  EXPECT_EQ(CM_Locate_DevNodeW(&node, missing.data(), 0), CR_NO_SUCH_DEVNODE);

  ULONG size = 0;
  ASSERT_EQ(CM_Get_Device_ID_Size(&size, disk.devInst, 0), CR_SUCCESS);
  EXPECT_EQ(size, disk.instanceId.size());
  std::vector<WCHAR> id(size);
  EXPECT_EQ(CM_Get_Device_IDW(disk.devInst, id.data(), size, 0), CR_BUFFER_SMALL);
  id.resize(size + 1);
  EXPECT_EQ(CM_Get_Device_IDW(disk.devInst, id.data(), size + 1, 0), CR_SUCCESS);
  EXPECT_EQ(Text(id.data()), disk.instanceId);

  // A 1394 unit cannot be surprise-removed; its service is the SBP-2 port.
  DWORD caps = 0;
  ULONG length = sizeof caps;
  DEVINST unit = ParentOf(disk.devInst);
  ASSERT_EQ(
      CM_Get_DevNode_Registry_PropertyW(unit, CM_DRP_CAPABILITIES, nullptr, &caps, &length, 0),
      CR_SUCCESS);
  EXPECT_EQ(caps & CM_DEVCAP_SURPRISEREMOVALOK, 0u);
  EXPECT_EQ(NodeText(unit, CM_DRP_SERVICE), "sbp2port");
  ULONG tiny = 2;
  WCHAR small[1];
  EXPECT_EQ(CM_Get_DevNode_Registry_PropertyW(unit, CM_DRP_SERVICE, nullptr, small, &tiny, 0),
            CR_BUFFER_SMALL);
  EXPECT_EQ(tiny, 18u);  // "sbp2port" and its terminator
  EXPECT_EQ(NodeText(disk.devInst, CM_DRP_SERVICE), "disk");
  // The root has no parent.
  DEVINST root = 0;
  ASSERT_EQ(CM_Locate_DevNodeW(&root, nullptr, 0), CR_SUCCESS);
  DEVINST above = 0;
  EXPECT_EQ(CM_Get_Parent(&above, root, 0), CR_NO_SUCH_DEVNODE);
}

}  // namespace
