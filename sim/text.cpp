// Small text helpers of the simulated computer.
#include <cstdio>
#include <cstdlib>

#include "machine_state.h"

namespace sim {

std::u16string Widen(std::string_view text) {
  std::u16string out;
  out.reserve(text.size());
  for (char c : text) out.push_back(static_cast<char16_t>(static_cast<unsigned char>(c)));
  return out;
}

std::string Narrow(std::u16string_view text) {
  std::string out;
  out.reserve(text.size());
  for (char16_t c : text) out.push_back(c < 0x80 ? static_cast<char>(c) : '?');
  return out;
}

std::u16string UpperAscii(std::u16string text) {
  for (auto& c : text) {
    if (c >= u'a' && c <= u'z') c = static_cast<char16_t>(c - u'a' + u'A');
  }
  return text;
}

std::u16string LowerAscii(std::u16string text) {
  for (auto& c : text) {
    if (c >= u'A' && c <= u'Z') c = static_cast<char16_t>(c - u'A' + u'a');
  }
  return text;
}

bool EqualNoCase(std::u16string_view a, std::u16string_view b) {
  return a.size() == b.size() && LowerAscii(std::u16string(a)) == LowerAscii(std::u16string(b));
}

std::string GuidText(const GUID& g) {
  char text[40];
  std::snprintf(text, sizeof text, "{%08X-%04X-%04X-%02X%02X-%02X%02X%02X%02X%02X%02X}",
                static_cast<unsigned>(g.Data1), static_cast<unsigned>(g.Data2),
                static_cast<unsigned>(g.Data3), g.Data4[0], g.Data4[1], g.Data4[2], g.Data4[3],
                g.Data4[4], g.Data4[5], g.Data4[6], g.Data4[7]);
  return text;
}

std::u16string InterfacePath(std::u16string_view instanceId, const GUID& interfaceClass) {
  std::u16string path = u"\\\\?\\";
  for (char16_t c : instanceId) path.push_back(c == u'\\' ? u'#' : c);
  path += u"#";
  path += Widen(GuidText(interfaceClass));
  return LowerAscii(path);
}

std::u16string InterfaceEventName(std::u16string_view instanceId, const GUID& interfaceClass) {
  std::u16string name = u"\\\\?\\";
  for (char16_t c : instanceId) name.push_back(c == u'\\' ? u'#' : c);
  name += u"#";
  name += LowerAscii(Widen(GuidText(interfaceClass)));
  return name;
}

std::string HexOfText(std::string_view text) {
  std::string out;
  char pair[3];
  for (char c : text) {
    std::snprintf(pair, sizeof pair, "%02X", static_cast<unsigned char>(c));
    out += pair;
  }
  return out;
}

std::string TrimAscii(std::string_view text) {
  std::size_t begin = 0;
  std::size_t end = text.size();
  while (begin < end && (text[begin] == ' ' || text[begin] == '\t')) ++begin;
  while (end > begin && (text[end - 1] == ' ' || text[end - 1] == '\t')) --end;
  return std::string(text.substr(begin, end - begin));
}

std::string UnitSerial(const DriveSpec& spec) {
  if (!spec.unitSerial.empty()) return spec.unitSerial;
  std::string serial = spec.serial.substr(0, 16);
  for (std::size_t at; (at = serial.find("QX-")) != std::string::npos;) serial.erase(at, 3);
  return TrimAscii(serial);
}

std::string UsbSerial(const DriveSpec& spec) {
  return spec.usbSerial.empty() ? HexOfText(UnitSerial(spec)) : spec.usbSerial;
}

std::string UnitId(const DriveSpec& spec, int index) {
  if (!spec.unitId.empty()) return spec.unitId;
  char text[24];
  std::snprintf(text, sizeof text, "0030E0%08d00", 31410000 + 4000 + index);
  return text;
}

std::uint64_t Identity(const DriveSpec& spec, int index) {
  if (spec.identity != 0) return spec.identity;
  return std::strtoull(UnitId(spec, index).c_str(), nullptr, 16);
}

}  // namespace sim
