#include "platform/wide.h"

#include <algorithm>

namespace {

bool IsSpace(WCHAR ch) {
  return ch == u' ' || ch == u'\t' || ch == u'\r' || ch == u'\n' || ch == u'\v' || ch == u'\f';
}

WCHAR LowerAscii(WCHAR ch) {
  return (ch >= u'A' && ch <= u'Z') ? static_cast<WCHAR>(ch + (u'a' - u'A')) : ch;
}

WCHAR UpperAscii(WCHAR ch) {
  return (ch >= u'a' && ch <= u'z') ? static_cast<WCHAR>(ch - (u'a' - u'A')) : ch;
}

}  // namespace

std::size_t WideLength(const WCHAR* text, std::size_t capacity) {
  if (text == nullptr) return 0;
  std::size_t n = 0;
  while (n < capacity && text[n] != 0) ++n;
  return n;
}

bool WideEqual(const WCHAR* a, const WCHAR* b) {
  return WideView(a, WideLength(a)) == WideView(b, WideLength(b));
}

bool WideEqualNoCase(const WCHAR* a, const WCHAR* b) {
  const std::size_t n = WideLength(a);
  if (n != WideLength(b)) return false;
  for (std::size_t i = 0; i < n; ++i) {
    if (LowerAscii(a[i]) != LowerAscii(b[i])) return false;
  }
  return true;
}

bool WideContains(const WCHAR* haystack, const WCHAR* needle) {
  const WideView h(haystack, WideLength(haystack));
  const WideView n(needle, WideLength(needle));
  return h.find(n) != WideView::npos;
}

std::size_t WideCopy(WCHAR* dest, std::size_t capacity, WideView source) {
  if (dest == nullptr || capacity == 0) return 0;
  const std::size_t n = std::min(source.size(), capacity - 1);
  std::copy_n(source.data(), n, dest);
  dest[n] = 0;
  return n;
}

std::size_t WideCopy(WCHAR* dest, std::size_t capacity, const WCHAR* source) {
  return WideCopy(dest, capacity, WideView(source, WideLength(source)));
}

std::size_t WideAppend(WCHAR* dest, std::size_t capacity, WideView source) {
  const std::size_t used = WideLength(dest, capacity);
  if (used >= capacity) return 0;
  return WideCopy(dest + used, capacity - used, source);
}

void WideToLower(WCHAR* text) {
  for (; text != nullptr && *text != 0; ++text) *text = LowerAscii(*text);
}

void WideToUpper(WCHAR* text) {
  for (; text != nullptr && *text != 0; ++text) *text = UpperAscii(*text);
}

void WideTrim(WCHAR* text) {
  if (text == nullptr) return;
  std::size_t n = WideLength(text);
  std::size_t start = 0;
  while (start < n && IsSpace(text[start])) ++start;
  while (n > start && IsSpace(text[n - 1])) --n;
  std::copy(text + start, text + n, text);
  text[n - start] = 0;
}

void WideRemoveAll(WCHAR* text, WideView pattern) {
  if (text == nullptr || pattern.empty()) return;
  WideString s(text, WideLength(text));
  for (std::size_t at = s.find(pattern); at != WideString::npos; at = s.find(pattern, at)) {
    s.erase(at, pattern.size());
  }
  std::copy(s.begin(), s.end(), text);
  text[s.size()] = 0;
}

std::size_t WideAfterLast(const WCHAR* text, WCHAR ch) {
  const WideView v(text, WideLength(text));
  const std::size_t at = v.rfind(ch);
  return at == WideView::npos ? 0 : at + 1;
}

std::string WideToUtf8(WideView text) {
  std::string out;
  out.reserve(text.size());
  for (std::size_t i = 0; i < text.size(); ++i) {
    std::uint32_t cp = text[i];
    if (cp >= 0xD800 && cp <= 0xDBFF && i + 1 < text.size() && text[i + 1] >= 0xDC00 &&
        text[i + 1] <= 0xDFFF) {
      cp = 0x10000 + ((cp - 0xD800) << 10) + (static_cast<std::uint32_t>(text[i + 1]) - 0xDC00);
      ++i;
    }
    if (cp < 0x80) {
      out += static_cast<char>(cp);
    } else if (cp < 0x800) {
      out += static_cast<char>(0xC0 | (cp >> 6));
      out += static_cast<char>(0x80 | (cp & 0x3F));
    } else if (cp < 0x10000) {
      out += static_cast<char>(0xE0 | (cp >> 12));
      out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
      out += static_cast<char>(0x80 | (cp & 0x3F));
    } else {
      out += static_cast<char>(0xF0 | (cp >> 18));
      out += static_cast<char>(0x80 | ((cp >> 12) & 0x3F));
      out += static_cast<char>(0x80 | ((cp >> 6) & 0x3F));
      out += static_cast<char>(0x80 | (cp & 0x3F));
    }
  }
  return out;
}

WideString Utf8ToWide(std::string_view text) {
  WideString out;
  out.reserve(text.size());
  for (std::size_t i = 0; i < text.size();) {
    const auto b = static_cast<unsigned char>(text[i]);
    std::uint32_t cp = b;
    std::size_t extra = 0;
    if (b >= 0xF0) {
      cp = b & 0x07u;
      extra = 3;
    } else if (b >= 0xE0) {
      cp = b & 0x0Fu;
      extra = 2;
    } else if (b >= 0xC0) {
      cp = b & 0x1Fu;
      extra = 1;
    }
    ++i;
    for (std::size_t k = 0; k < extra && i < text.size(); ++k, ++i) {
      cp = (cp << 6) | (static_cast<unsigned char>(text[i]) & 0x3Fu);
    }
    if (cp >= 0x10000) {
      cp -= 0x10000;
      out += static_cast<WCHAR>(0xD800 + (cp >> 10));
      out += static_cast<WCHAR>(0xDC00 + (cp & 0x3FF));
    } else {
      out += static_cast<WCHAR>(cp);
    }
  }
  return out;
}

void WideAppendHex(WideString& out, std::uint64_t value, int digits, bool upper) {
  const char* set = upper ? "0123456789ABCDEF" : "0123456789abcdef";
  WCHAR buf[32];
  int n = 0;
  do {
    buf[n++] = static_cast<WCHAR>(set[value & 0xF]);
    value >>= 4;
  } while (value != 0 && n < 32);
  while (n < digits && n < 32) buf[n++] = u'0';
  while (n > 0) out += buf[--n];
}

void WideAppendDecimal(WideString& out, std::int64_t value) {
  std::uint64_t magnitude =
      value < 0 ? static_cast<std::uint64_t>(-(value + 1)) + 1 : static_cast<std::uint64_t>(value);
  if (value < 0) out += u'-';
  WCHAR buf[24];
  int n = 0;
  do {
    buf[n++] = static_cast<WCHAR>(u'0' + magnitude % 10);
    magnitude /= 10;
  } while (magnitude != 0);
  while (n > 0) out += buf[--n];
}
