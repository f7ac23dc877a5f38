// The SCSI answers of the maker's drives: standard INQUIRY, vital product
// data, READ CAPACITY(10) and the vendor diagnostic pages 0x80 to 0x83.
#include <algorithm>
#include <cstring>
#include <utility>

#include "machine_state.h"

namespace sim {
namespace {

constexpr std::uint8_t kGood = 0x00;
constexpr std::uint8_t kCheckCondition = 0x02;

void PutText(std::vector<std::uint8_t>& data, std::size_t offset, std::size_t width,
             std::string_view text) {
  for (std::size_t i = 0; i < width; ++i) {
    data[offset + i] = i < text.size() ? static_cast<std::uint8_t>(text[i]) : ' ';
  }
}

std::vector<std::uint8_t> StandardInquiry(const DriveSpec& spec, bool enclosureDevice) {
  std::vector<std::uint8_t> data(std::max<std::size_t>(74, 5u + spec.additionalLength), 0);
  data[0] = enclosureDevice ? 0x0D : spec.peripheral;
  data[2] = 0x04;
  data[3] = 0x02;
  data[4] = spec.additionalLength;
  PutText(data, 8, 8, spec.vendor);
  PutText(data, 16, 16, enclosureDevice ? spec.product + " SES" : spec.product);
  PutText(data, 32, 4, spec.revision);
  PutText(data, 36, 4, spec.modelCode);
  PutText(data, 40, 18, spec.serial);
  PutText(data, 58, 16, spec.modelText);
  data.resize(5u + spec.additionalLength);
  return data;
}

bool VpdPage(const DriveSpec& spec, std::uint8_t page, std::vector<std::uint8_t>* out) {
  if (std::find(spec.vpdPages.begin(), spec.vpdPages.end(), page) == spec.vpdPages.end()) {
    return false;
  }
  std::vector<std::uint8_t>& data = *out;
  data.assign(4, 0);
  data[0] = spec.peripheral;
  data[1] = page;
  switch (page) {
    case 0x00:
      for (std::uint8_t p : spec.vpdPages) data.push_back(p);
      break;
    case 0x01:
    case 0x02: {
      const std::string& text = page == 0x01 ? spec.asciiInfo1 : spec.asciiInfo2;
      data.push_back(static_cast<std::uint8_t>(text.size()));
      data.insert(data.end(), text.begin(), text.end());
      break;
    }
    case 0x80: {
      std::string serial = UnitSerial(spec);
      data.insert(data.end(), serial.begin(), serial.end());
      break;
    }
    case 0xC0:
      data.resize(20, 0);
      if (spec.rcsIdentity) std::memcpy(&data[16], "RCS", 3);
      break;
    case 0xC1: {
      // Four 8-byte descriptors: a tag byte and seven characters each.
      std::uint8_t tags[4] = {0x01, 0x80, 0x81, 0x00};
      std::string texts[4] = {"BOOT001", spec.vendorCode, "PANEL01", ""};
      std::swap(tags[1], tags[spec.vendorCodeSlot & 3]);
      std::swap(texts[1], texts[spec.vendorCodeSlot & 3]);
      for (int d = 0; d < 4; ++d) {
        data.push_back(tags[d]);
        for (std::size_t i = 0; i < 7; ++i) {
          data.push_back(i < texts[d].size() ? static_cast<std::uint8_t>(texts[d][i]) : ' ');
        }
      }
      break;
    }
    default:
      break;
  }
  data[3] = static_cast<std::uint8_t>(data.size() - 4);
  return true;
}

}  // namespace

std::uint8_t ExecuteScsi(DriveState* drive, const DriveSpec& spec, bool enclosureDevice,
                         const std::uint8_t* cdb, std::size_t cdbLength,
                         const std::vector<std::uint8_t>& dataOut,
                         std::vector<std::uint8_t>* dataIn) {
  dataIn->clear();
  if (cdbLength == 0) return kCheckCondition;
  switch (cdb[0]) {
    case 0x12: {  // INQUIRY
      if (cdbLength < 6) return kCheckCondition;
      if ((cdb[1] & 0x01) == 0) {
        *dataIn = StandardInquiry(spec, enclosureDevice);
      } else if (!VpdPage(spec, cdb[2], dataIn)) {
        return kCheckCondition;
      }
      std::size_t allocation = (static_cast<std::size_t>(cdb[3]) << 8) | cdb[4];
      if (dataIn->size() > allocation) dataIn->resize(allocation);
      return kGood;
    }
    case 0x25: {  // READ CAPACITY(10)
      if (enclosureDevice) return kCheckCondition;
      const std::uint32_t words[2] = {spec.lastLba, spec.blockLength};
      for (std::uint32_t w : words) {
        for (int shift = 24; shift >= 0; shift -= 8) {
          dataIn->push_back(static_cast<std::uint8_t>(w >> shift));
        }
      }
      return kGood;
    }
    case 0x1C: {  // RECEIVE DIAGNOSTIC RESULTS
      if (cdbLength < 6 || (cdb[1] & 0x01) == 0) return kCheckCondition;
      const std::uint8_t page = cdb[2];
      std::vector<std::uint8_t>& data = *dataIn;
      switch (page) {
        case 0x80:
          data = {0x80, 0x00, 0x00, 0x01, 0x00};
          if (drive != nullptr) {
            data[4] = drive->enclosureBits;
            drive->enclosureBits = 0;
          }
          break;
        case 0x81:
          data = {0x81, 0x00, 0x00, 0x01, 0x00};
          break;
        case 0x82:
          data = {0x82,           0x00,           0x00,           0x04,
                  spec.status[0], spec.status[1], spec.status[2], spec.status[3]};
          break;
        case 0x83:
          data = {0x83, 0x00, 0x00, 0x01, static_cast<std::uint8_t>((spec.sleepState & 3) << 6)};
          break;
        default:
          return kCheckCondition;
      }
      std::size_t allocation = (static_cast<std::size_t>(cdb[3]) << 8) | cdb[4];
      if (data.size() > allocation) data.resize(allocation);
      return kGood;
    }
    case 0x1D:  // SEND DIAGNOSTIC: the page is recorded by the caller
      if (cdbLength < 6 || dataOut.empty()) return cdbLength < 6 ? kCheckCondition : kGood;
      return (dataOut[0] >= 0x80 && dataOut[0] <= 0x83) ? kGood : kCheckCondition;
    case 0x00:  // TEST UNIT READY
      return kGood;
    default:
      return kCheckCondition;
  }
}

}  // namespace sim
