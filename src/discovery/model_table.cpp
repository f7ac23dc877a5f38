#include "discovery/model_table.h"

#include "platform/wide.h"

namespace {

const WCHAR kRambler[] = WSTR("Rambler");
constexpr std::size_t kMaxMatchedText = 1024;

// Each list ends with an empty entry.
const WCHAR* const kChannelModels[] = {WSTR("C12"),
                                       WSTR("C13"),
                                       WSTR("C14"),
                                       WSTR("E21"),
                                       WSTR("E22"),
                                       WSTR("E23"),
                                       WSTR("E24"),
                                       WSTR("E25"),
                                       WSTR("7B41"),
                                       WSTR("7B42"),
                                       WSTR("7B43"),
                                       WSTR("7B44"),
                                       WSTR("7B45"),
                                       WSTR("1394\\QX______&EXTERNAL_HDD"),
                                       WSTR("1394\\QX&EXTERNAL_HDD"),
                                       WSTR("1394\\QX&QUARRY"),
                                       WSTR("")};
const WCHAR* const kStandaloneModels[] = {WSTR("E24"), WSTR("7B44"), WSTR("7B45"), WSTR("")};

bool ContainsListEntry(const WCHAR* const* list, const WCHAR* text) {
  if (text == nullptr) return false;
  for (; (*list)[0] != 0; ++list) {
    if (WideContains(text, *list)) return true;
  }
  return false;
}

}  // namespace

const ModelRow kModelTable[kModelRowCount + 1] = {
    {WSTR("_2A30"), 0, 0, nullptr},    {WSTR("_2A31"), 0, 0, nullptr},
    {WSTR("_2A34"), 0, 0, nullptr},    {WSTR("_2A35"), 0, 0, nullptr},
    {WSTR("_2A37"), 0, 0, nullptr},    {WSTR("_2A39"), 0, 0, nullptr},
    {WSTR("_5E21"), 0, 6, nullptr},    {WSTR("_5E22"), 0, 6, nullptr},
    {WSTR("_5E23"), 0, 6, nullptr},    {WSTR("_5E24"), 0x10, 6, nullptr},
    {WSTR("_5E25"), 0, 6, nullptr},    {WSTR("_7B41"), 0, 4, nullptr},
    {WSTR("_7B42"), 0, 4, nullptr},    {WSTR("_7B43"), 0, 6, nullptr},
    {WSTR("_7B44"), 0x30, 4, nullptr}, {WSTR("_7B45"), 0x30, 6, nullptr},
    {WSTR("_3C12"), 0, 4, kRambler},   {WSTR("_3C13"), 0, 4, kRambler},
    {WSTR("_3C14"), 0, 4, kRambler},   {WSTR(""), 0, 0, nullptr}};

bool LookupModelRow(const WCHAR* text, ModelRow* row) {
  if (text == nullptr) return false;
  const bool bareCode = WideLength(text) < 5;
  // A longer text is a device ID or interface path; Windows spells paths in
  // lower case and IDs in upper case, and means the same by both, so the
  // text is matched in upper case, as the suffixes are written.
  WCHAR upper[kMaxMatchedText] = {};
  if (!bareCode) {
    WideCopy(upper, kMaxMatchedText, text);
    WideToUpper(upper);
  }
  for (const ModelRow* candidate = kModelTable; candidate->suffix[0] != 0; ++candidate) {
    const bool match =
        bareCode ? WideContains(candidate->suffix, text) : WideContains(upper, candidate->suffix);
    if (match) {
      *row = *candidate;
      return true;
    }
  }
  return false;
}

bool ContainsComponent(const WCHAR* text, const WCHAR* key) {
  if (text == nullptr || key == nullptr || key[0] == 0) return false;
  const std::size_t keyLength = WideLength(key);
  auto separator = [](WCHAR ch) { return ch == WSTR('\\') || ch == WSTR('#') || ch == WSTR('&'); };
  for (std::size_t start = 0;;) {
    std::size_t end = start;
    while (text[end] != 0 && !separator(text[end])) ++end;
    if (end - start == keyLength) {
      std::size_t i = 0;
      while (i < keyLength && text[start + i] == key[i]) ++i;
      if (i == keyLength) return true;
    }
    if (text[end] == 0) return false;
    start = end + 1;
  }
}

bool IsChannelModel(const WCHAR* text) {
  return ContainsListEntry(kChannelModels, text);
}

bool IsStandaloneChannelModel(const WCHAR* text) {
  return ContainsListEntry(kStandaloneModels, text);
}

DWORD CopyAsciiToWide(WCHAR* dest, DWORD capacity, const BYTE* source, DWORD maxChars) {
  if (dest == nullptr || capacity == 0) return 0;
  DWORD count = 0;
  while (count + 1 < capacity && count < maxChars && source[count] != 0) {
    // Sign extension: bytes 0x80-0xFF become U+FF80-U+FFFF.
    dest[count] = static_cast<WCHAR>(static_cast<short>(static_cast<signed char>(source[count])));
    ++count;
  }
  dest[count] = 0;
  return count;
}
