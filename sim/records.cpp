// Readable lines for the record of what the drives were sent.
#include <cstdio>

#include "machine_state.h"

namespace sim {
namespace {

std::string HexBytes(const std::vector<std::uint8_t>& bytes) {
  std::string text;
  char two[4];
  for (std::size_t i = 0; i < bytes.size(); ++i) {
    std::snprintf(two, sizeof two, i == 0 ? "%02X" : " %02X", bytes[i]);
    text += two;
  }
  return text;
}

const char* ScsiName(DWORD op, const std::vector<std::uint8_t>& cdb) {
  switch (op) {
    case 0x12:
      return cdb.size() > 1 && (cdb[1] & 1) ? "INQUIRY (VPD)" : "INQUIRY";
    case 0x25:
      return "READ CAPACITY(10)";
    case 0x1C:
      return "RECEIVE DIAGNOSTIC";
    case 0x1D:
      return "SEND DIAGNOSTIC";
    default:
      return "SCSI";
  }
}

const char* ControlName(DWORD code) {
  switch (code) {
    case 0x222040:
      return "set gauge";
    case 0x222048:
      return "wait gauge event";
    case 0x222050:
      return "quiesce";
    case 0x222054:
      return "clear gauge event";
    case 0x223C04:
      return "wait event";
    case 0x223C08:
      return "set state B";
    case 0x223C0C:
      return "set state";
    case 0x223C10:
      return "get identity";
    case 0x223C14:
      return "eject notice";
    case 0x223C18:
      return "notice 2";
    case 0x223C1C:
      return "clear event";
    case 0x223C20:
      return "event reply";
    case 0x223C24:
      return "worker start";
    case 0x223C28:
      return "notice 8";
    case IOCTL_STORAGE_GET_DEVICE_NUMBER:
      return "get device number";
    case IOCTL_STORAGE_CHECK_VERIFY:
      return "check verify";
    case FSCTL_LOCK_VOLUME:
      return "lock volume";
    case FSCTL_UNLOCK_VOLUME:
      return "unlock volume";
    case FSCTL_DISMOUNT_VOLUME:
      return "dismount volume";
    default:
      return "control";
  }
}

}  // namespace

std::string Describe(const Command& c) {
  char head[96];
  std::snprintf(head, sizeof head, "#%llu %s/%s: ", static_cast<unsigned long long>(c.sequence),
                c.drive.empty() ? "-" : c.drive.c_str(), EndpointName(c.endpoint));
  std::string text = head;
  char code[32];
  switch (c.kind) {
    case Command::Kind::Scsi:
      text += ScsiName(c.code, c.cdb);
      text += " [" + HexBytes(c.cdb) + "]";
      if (!c.data.empty()) text += " data " + HexBytes(c.data);
      // What an enclosure's command pages mean to the drive.
      if (c.code == 0x1D && c.data.size() >= 5 && (c.data[0] == 0x80 || c.data[0] == 0x81)) {
        if (c.data[0] == 0x81) {
          std::snprintf(code, sizeof code, " = gauge pattern 0x%02X", c.data[4]);
        } else {
          std::snprintf(code, sizeof code, " = notice %u", c.data[4]);
        }
        text += code;
      }
      break;
    case Command::Kind::Control:
    case Command::Kind::Volume:
      std::snprintf(code, sizeof code, " (0x%06X)", static_cast<unsigned>(c.code));
      text += ControlName(c.code);
      text += code;
      if (!c.data.empty()) text += " input " + HexBytes(c.data);
      break;
    case Command::Kind::HidOutput:
      text += "HID output report " + HexBytes(c.data);
      // Reports 0 and 1 carry a command value, report 2 a control block.
      if (c.data.size() >= 3 && c.data[0] <= 1) {
        std::snprintf(code, sizeof code, " = value 0x%04X",
                      static_cast<unsigned>(c.data[1] | (c.data[2] << 8)));
        text += code;
      }
      break;
    case Command::Kind::HidInputReport:
      text += "HID get input report " + HexBytes(c.data);
      break;
    case Command::Kind::HidSerial:
      text += "HID get serial number";
      break;
  }
  return text;
}

}  // namespace sim
