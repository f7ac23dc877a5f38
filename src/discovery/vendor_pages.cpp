#include "discovery/vendor_pages.h"

#include <cstring>
#include <initializer_list>

#include "discovery/model_table.h"
#include "transport/pass_through.h"

namespace {

// Reads one page into a zeroed buffer; true when the command succeeded.
bool ReadPage(HANDLE disk, BYTE page, BYTE* buffer, BYTE length) {
  std::memset(buffer, 0, length);
  return ScsiInquiryPage(disk, page, buffer, length, nullptr) == ERROR_SUCCESS;
}

template <std::size_t N>
void SetText(WCHAR (&field)[N], const BYTE* source, DWORD maxChars) {
  std::memset(field, 0, sizeof(field));
  CopyAsciiToWide(field, N, source, maxChars);
}

}  // namespace

int ReadVendorPages(HANDLE disk, DriveRecord* slot) {
  BYTE reply[36];
  ReadPage(disk, 0x00, reply, 11);
  if (reply[4] != 0x00 || reply[5] != 0x01 || reply[6] != 0x02) return 0;
  if (ReadPage(disk, 0x01, reply, 26)) SetText(slot->asciiInfo1, reply + 5, 21);
  if (ReadPage(disk, 0x02, reply, 26)) SetText(slot->asciiInfo2, reply + 5, 21);
  // The unit serial number replaces the serial text of the standard inquiry.
  if (ReadPage(disk, 0x80, reply, 20)) SetText(slot->serialNumber, reply + 4, 16);
  ReadPage(disk, 0xC1, reply, 36);
  if (reply[1] == 0xC1) {
    for (const int offset : {4, 12, 20, 28}) {
      if (reply[offset] == 0x80) {
        SetText(slot->vendorCode, reply + offset + 1, 7);
        break;
      }
    }
  }
  return 1;
}
