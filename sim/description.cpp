// The machine description text (README.md) and the embedded default machine.
#include <cctype>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <sstream>

#include "machine_state.h"

namespace sim {
namespace {

std::string Lower(std::string text) {
  for (auto& c : text) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  return text;
}

bool ParseNumber(const std::string& text, std::uint64_t* value, bool allowSuffix = false) {
  if (text.empty()) return false;
  char* end = nullptr;
  int base = text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X') ? 16 : 10;
  *value = std::strtoull(text.c_str(), &end, base);
  std::string rest(end);
  if (rest.empty()) return true;
  if (!allowSuffix || rest.size() != 1) return false;
  switch (std::toupper(static_cast<unsigned char>(rest[0]))) {
    case 'K':
      *value <<= 10;
      return true;
    case 'M':
      *value <<= 20;
      return true;
    case 'G':
      *value <<= 30;
      return true;
    case 'T':
      *value <<= 40;
      return true;
    default:
      return false;
  }
}

bool ParseBool(const std::string& text, bool* value) {
  std::string t = Lower(text);
  if (t == "yes" || t == "true" || t == "1") {
    *value = true;
    return true;
  }
  if (t == "no" || t == "false" || t == "0") {
    *value = false;
    return true;
  }
  return false;
}

bool ParseHexBytes(const std::string& text, std::vector<std::uint8_t>* bytes) {
  std::istringstream in(text);
  std::string word;
  bytes->clear();
  while (in >> word) {
    char* end = nullptr;
    unsigned long v = std::strtoul(word.c_str(), &end, 16);
    if (*end != 0 || v > 0xFF) return false;
    bytes->push_back(static_cast<std::uint8_t>(v));
  }
  return true;
}

bool ParseDriveType(const std::string& text, UINT* type) {
  static const char* const names[] = {"unknown", "none",  "removable", "fixed",
                                      "remote",  "cdrom", "ramdisk"};
  for (UINT i = 0; i < 7; ++i) {
    if (Lower(text) == names[i]) {
      *type = i;
      return true;
    }
  }
  return false;
}

// "E fixed 500G 120G [partition=N] [disk=N]"
bool ParseVolume(const std::string& text, VolumeSpec* volume) {
  std::istringstream in(text);
  std::string letter, type, size, free, option;
  if (!(in >> letter >> type >> size >> free) || letter.size() != 1 ||
      !std::isalpha(static_cast<unsigned char>(letter[0]))) {
    return false;
  }
  volume->letter = static_cast<char>(std::toupper(static_cast<unsigned char>(letter[0])));
  if (!ParseDriveType(type, &volume->driveType) || !ParseNumber(size, &volume->sizeBytes, true) ||
      !ParseNumber(free, &volume->freeBytes, true)) {
    return false;
  }
  while (in >> option) {
    std::uint64_t n = 0;
    auto eq = option.find('=');
    if (eq == std::string::npos || !ParseNumber(option.substr(eq + 1), &n)) return false;
    std::string key = option.substr(0, eq);
    if (key == "partition") {
      volume->partition = static_cast<std::uint32_t>(n);
    } else if (key == "disk") {
      volume->diskNumber = static_cast<std::uint32_t>(n);
    } else {
      return false;
    }
  }
  return true;
}

int ParseClass(const std::string& text) {
  std::string t = Lower(text);
  return t == "a" ? 1 : t == "b" ? 2 : t == "c" ? 3 : 0;
}

struct Block {
  bool foreign = false;
  bool attached = true;
  std::uint32_t diskNumber = 0;
  DriveSpec spec;
};

// One "key value" line of a drive or disk block.
bool ParseDriveKey(const std::string& key, const std::string& value, Block* block) {
  DriveSpec& s = block->spec;
  std::uint64_t n = 0;
  bool b = false;
  if (key == "bus") {
    std::string v = Lower(value);
    if (v == "usb") {
      s.bus = Bus::Usb;
    } else if (v == "1394") {
      s.bus = Bus::Ieee1394;
    } else if (v == "other") {
      s.bus = Bus::Other;
    } else {
      return false;
    }
    return true;
  }
  if (key == "channel") {
    std::string v = Lower(value);
    if (v == "none") {
      s.channel = ChannelKind::None;
    } else if (v == "hid") {
      s.channel = ChannelKind::Hid;
    } else if (v == "driver") {
      s.channel = ChannelKind::Driver;
    } else if (v == "enclosure") {
      s.channel = ChannelKind::Enclosure;
    } else {
      return false;
    }
    return true;
  }
  struct TextKey {
    const char* name;
    std::string* field;
  };
  const TextKey texts[] = {{"vendor", &s.vendor},
                           {"product", &s.product},
                           {"revision", &s.revision},
                           {"model-code", &s.modelCode},
                           {"serial", &s.serial},
                           {"model-text", &s.modelText},
                           {"ascii-info-1", &s.asciiInfo1},
                           {"ascii-info-2", &s.asciiInfo2},
                           {"unit-serial", &s.unitSerial},
                           {"vendor-code", &s.vendorCode},
                           {"usb-vid", &s.usbVid},
                           {"usb-pid", &s.usbPid},
                           {"usb-serial", &s.usbSerial},
                           {"unit-id", &s.unitId},
                           {"unit-model", &s.unitModel},
                           {"friendly-name", &s.friendlyName},
                           {"parent-service", &s.parentService},
                           {"disk-instance-id", &s.diskInstanceId},
                           {"parent-instance-id", &s.parentInstanceId},
                           {"disk-path", &s.diskPath},
                           {"hid-instance-id", &s.hidInstanceId},
                           {"control-instance-id", &s.controlInstanceId}};
  for (const auto& t : texts) {
    if (key == t.name) {
      *t.field = value;
      return true;
    }
  }
  struct ByteKey {
    const char* name;
    std::uint8_t* field;
    std::uint64_t max;
  };
  const ByteKey byteKeys[] = {{"peripheral", &s.peripheral, 0xFF},
                              {"additional-length", &s.additionalLength, 0xFF},
                              {"sleep-state", &s.sleepState, 0xFF},
                              {"vendor-code-slot", &s.vendorCodeSlot, 3}};
  for (const auto& k : byteKeys) {
    if (key == k.name) {
      if (!ParseNumber(value, &n) || n > k.max) return false;
      *k.field = static_cast<std::uint8_t>(n);
      return true;
    }
  }
  if (key == "last-lba" || key == "block-length" || key == "bus-address" ||
      key == "parent-capabilities" || key == "hid-input-report-length" || key == "disk-number") {
    if (!ParseNumber(value, &n) || n > 0xFFFFFFFFu) return false;
    auto v = static_cast<std::uint32_t>(n);
    if (key == "last-lba") s.lastLba = v;
    if (key == "block-length") s.blockLength = v;
    if (key == "bus-address") s.busAddress = v;
    if (key == "parent-capabilities") s.parentCapabilities = v;
    if (key == "hid-input-report-length") {
      if (v < 2 || v > 64) return false;
      s.hidInputReportLength = static_cast<std::uint16_t>(v);
    }
    if (key == "disk-number") block->diskNumber = v;
    return true;
  }
  if (key == "identity") {
    if (!ParseNumber("0x" + value, &n)) return false;
    s.identity = n;
    return true;
  }
  if (key == "rcs" || key == "attached") {
    if (!ParseBool(value, &b)) return false;
    (key == "rcs" ? s.rcsIdentity : block->attached) = b;
    return true;
  }
  if (key == "vpd-pages") return ParseHexBytes(value, &s.vpdPages);
  if (key == "status") {
    std::vector<std::uint8_t> bytes;
    if (!ParseHexBytes(value, &bytes) || bytes.size() != 4) return false;
    for (int i = 0; i < 4; ++i) s.status[i] = bytes[static_cast<std::size_t>(i)];
    return true;
  }
  if (key == "driver-class" || key == "enclosure-class") {
    int c = ParseClass(value);
    if (c == 0) return false;
    (key == "driver-class" ? s.driverClass : s.enclosureClass) = c;
    return true;
  }
  if (key == "volume") {
    VolumeSpec v;
    if (!ParseVolume(value, &v)) return false;
    s.volumes.push_back(v);
    return true;
  }
  return false;
}

constexpr char kDefaultMachine[] =
    R"(# The embedded default machine of the host build: a system disk and a CD-ROM
# of other makers, and one drive of the maker for each kind of channel.
os 5.1 2600
volume C fixed 160G 48G disk=0
volume D cdrom 0 0 disk=0

disk system
  bus other
  disk-number 0
  vendor ATA
  product ST3160815AS
  revision 3.AA
  model-code
  serial 5RA1XQ0B
  model-text
  rcs no
  friendly-name ST3160815AS
  disk-instance-id IDE\DiskST3160815AS_____________________________3.AAD___\5&1F2E3D4C&0&0.0.0
  disk-path \\?\ide#diskst3160815as_____________________________3.aad___#5&1f2e3d4c&0&0.0.0#{53f56307-b6bf-11d0-94f2-00a0c91efb8b}
end

# USB drive of a standalone gauge model: HID channel in gauge mode.
drive gauge
  bus usb
  channel hid
  model-code 7B44
  revision 0102
  serial QX-7K2A9F31
  model-text QX Vantage 500
  vendor-code QXV7B44
  vendor-code-slot 0
  status 42 10 20 30
  volume E fixed 500G 312G
end

# USB drive of a listed model outside the channel list: plain HID channel.
drive plain
  bus usb
  channel hid
  model-code 2A31
  serial QX-5M8B2D07
  model-text QX Portable 250
  rcs no
  last-lba 488397167
  volume F fixed 180G 20G partition=1
  volume G fixed 70G 65G partition=2
end

# IEEE 1394 drive reached through the button filter driver.
drive firewire
  bus 1394
  channel driver
  model-code 5E22
  serial QX-9F1D0A55
  model-text QX Vantage FW
  unit-model EXTERNAL_HDD
  unit-id 0030E0000001A2B3
  last-lba 625142447
  volume H fixed 300G 150G
end

# IEEE 1394 drive with an enclosure-services device.
drive enclosure
  bus 1394
  channel enclosure
  model-code 3C13
  serial QX-3R7T0N21
  model-text QX Rambler 160
  unit-model QUARRY
  unit-id 0030E00000045D6F
  last-lba 312581807
  volume I removable 160G 10G
end
)";

}  // namespace

namespace {

// Reads a description into `machine`; with `drives` set instead, only drive
// blocks are allowed and they are collected there, the machine untouched.
bool ReadDescription(std::string_view text, Machine* machine, std::vector<DriveSpec>* drives,
                     std::string* error) {
  std::istringstream in{std::string(text)};
  std::string line;
  int number = 0;
  bool inBlock = false;
  Block block;
  std::vector<VolumeSpec> looseVolumes;
  auto fail = [&](const std::string& why) {
    if (error != nullptr) *error = "line " + std::to_string(number) + ": " + why;
    return false;
  };
  while (std::getline(in, line)) {
    ++number;
    if (!line.empty() && line.back() == '\r') line.pop_back();
    std::string trimmed = TrimAscii(line);
    if (trimmed.empty() || trimmed[0] == '#') continue;
    auto space = trimmed.find(' ');
    std::string key = trimmed.substr(0, space);
    std::string value = space == std::string::npos ? "" : TrimAscii(trimmed.substr(space + 1));
    if (inBlock) {
      if (key == "end") {
        inBlock = false;
        if (drives != nullptr) {
          if (block.spec.bus == Bus::Other) return fail("a drive of the maker is on usb or 1394");
          drives->push_back(block.spec);
          continue;
        }
        if (block.foreign) {
          if (block.spec.diskInstanceId.empty() || block.spec.diskPath.empty()) {
            return fail("a disk needs disk-instance-id and disk-path");
          }
          machine->AddForeignDisk(block.spec, block.spec.diskInstanceId, block.spec.diskPath,
                                  block.diskNumber);
        } else {
          if (block.spec.bus == Bus::Other) return fail("a drive of the maker is on usb or 1394");
          machine->AddDrive(block.spec, block.attached);
        }
        continue;
      }
      if (!ParseDriveKey(key, value, &block)) return fail("cannot use \"" + trimmed + "\"");
      continue;
    }
    if (drives != nullptr && key != "drive") return fail("only drive blocks can be added");
    if (key == "os") {
      std::istringstream v(value);
      std::string version;
      DWORD build = 2600;
      if (!(v >> version)) return fail("os needs a version such as 5.1");
      v >> build;
      auto dot = version.find('.');
      std::uint64_t major = 0;
      std::uint64_t minor = 0;
      if (dot == std::string::npos || !ParseNumber(version.substr(0, dot), &major) ||
          !ParseNumber(version.substr(dot + 1), &minor)) {
        return fail("os needs a version such as 5.1");
      }
      DWORD platform = major == 4 && minor > 0 ? VER_PLATFORM_WIN32_WINDOWS : VER_PLATFORM_WIN32_NT;
      machine->SetOsVersion(static_cast<DWORD>(major), static_cast<DWORD>(minor), build, platform);
    } else if (key == "language") {
      if (value == "en") {
        machine->SetLanguage(Language::English);
      } else if (value == "de") {
        machine->SetLanguage(Language::German);
      } else if (value == "ja") {
        machine->SetLanguage(Language::Japanese);
      } else {
        return fail("language is en, de or ja");
      }
    } else if (key == "volume") {
      VolumeSpec v;
      if (!ParseVolume(value, &v)) return fail("volume needs: letter type size free [options]");
      machine->AddVolume(v);
    } else if (key == "drive" || key == "disk") {
      if (value.empty()) return fail(key + " needs a name");
      block = Block{};
      block.foreign = key == "disk";
      block.spec.name = value;
      if (block.foreign) block.spec.bus = Bus::Other;
      inBlock = true;
    } else {
      return fail("unknown line \"" + trimmed + "\"");
    }
  }
  if (inBlock) return fail("missing \"end\"");
  return true;
}

}  // namespace

bool ReadDriveBlocks(std::string_view text, std::vector<DriveSpec>* drives, std::string* error) {
  return ReadDescription(text, nullptr, drives, error);
}

std::unique_ptr<Machine> LoadMachine(std::string_view text, std::string* error) {
  auto machine = std::make_unique<Machine>();
  if (!ReadDescription(text, machine.get(), nullptr, error)) return nullptr;
  return machine;
}

std::unique_ptr<Machine> LoadMachineFile(const std::string& path, std::string* error) {
  std::ifstream file(path);
  if (!file) {
    if (error != nullptr) *error = "cannot read " + path;
    return nullptr;
  }
  std::stringstream text;
  text << file.rdbuf();
  std::string why;
  auto machine = LoadMachine(text.str(), &why);
  if (!machine && error != nullptr) *error = path + ": " + why;
  return machine;
}

std::string_view DefaultMachineText() {
  return kDefaultMachine;
}

std::unique_ptr<Machine> CreateDefaultMachine() {
  if (const char* path = std::getenv("SKYVANE_MACHINE"); path != nullptr && *path != 0) {
    std::string error;
    if (auto machine = LoadMachineFile(path, &error)) return machine;
    std::fprintf(stderr, "SKYVANE_MACHINE: %s; using the embedded default machine\n",
                 error.c_str());
  }
  std::string error;
  auto machine = LoadMachine(kDefaultMachine, &error);
  if (!machine) {
    std::fprintf(stderr, "embedded default machine: %s\n", error.c_str());
    std::abort();
  }
  return machine;
}

}  // namespace sim
