// The registry store file.
//
// Format (text, one record per line, '\n' ends every line):
//   SKYVANE-REGISTRY 1
//   K <flags> <path>            a key; flags: 1 = read-only
//   V <type> <name> <data>      a value of the key above it
//   END
// <path> and <name> are UTF-16 code units, printable ASCII except '%' and '@'
// written as themselves and every other unit as %XXXX (four hex digits); an
// empty name is "@". <data> is the bytes in hex, or "-" when empty. A file
// that is missing, unreadable or not exactly of this form (a torn or foreign
// file) is taken as an empty registry, and the next write replaces it.
//
// Concurrency: every operation takes an exclusive flock() on "<store>.lock",
// reads the store, and, when it changed something, writes "<store>.tmp.<pid>"
// and renames it over the store, so a reader never sees a half-written file.
#include "platform/posix/registry_store.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <mutex>

namespace emu::registry {
namespace {

constexpr std::string_view kHeader = "SKYVANE-REGISTRY 1";
constexpr std::string_view kEnd = "END";
constexpr DWORD kFlagReadOnly = 1;

const TextView kRoots[] = {u"HKEY_CLASSES_ROOT", u"HKEY_CURRENT_USER", u"HKEY_LOCAL_MACHINE",
                           u"HKEY_USERS", u"HKEY_CURRENT_CONFIG"};

char16_t FoldUnit(char16_t c) {
  return (c >= u'A' && c <= u'Z') ? static_cast<char16_t>(c + 32) : c;
}

// Keys every Windows installation has, so that programs (and the service's
// registry requests) find the usual places to keep their values.
const TextView kStandardKeys[] = {u"HKEY_CURRENT_USER\\Software", u"HKEY_LOCAL_MACHINE\\SOFTWARE",
                                  u"HKEY_LOCAL_MACHINE\\SYSTEM\\CurrentControlSet\\Services"};

void EnsureRoots(Store& store) {
  for (TextView root : kRoots) store.Create(root);
  for (TextView key : kStandardKeys) store.Create(key);
}

const char kHex[] = "0123456789ABCDEF";

void AppendEscaped(std::string& out, TextView text) {
  if (text.empty()) {
    out += '@';
    return;
  }
  for (char16_t c : text) {
    if (c > 0x20 && c < 0x7F && c != u'%' && c != u'@') {
      out += static_cast<char>(c);
    } else {
      out += '%';
      for (int shift = 12; shift >= 0; shift -= 4) out += kHex[(c >> shift) & 0xF];
    }
  }
}

int HexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  return -1;
}

bool ParseEscaped(std::string_view token, Text& out) {
  out.clear();
  if (token == "@") return true;
  if (token.empty()) return false;
  for (std::size_t i = 0; i < token.size();) {
    char c = token[i];
    if (c == '%') {
      if (i + 5 > token.size()) return false;
      unsigned unit = 0;
      for (std::size_t k = 1; k <= 4; ++k) {
        int digit = HexDigit(token[i + k]);
        if (digit < 0) return false;
        unit = (unit << 4) | static_cast<unsigned>(digit);
      }
      out += static_cast<char16_t>(unit);
      i += 5;
    } else if (c > 0x20 && c < 0x7F && c != '@') {
      out += static_cast<char16_t>(c);
      ++i;
    } else {
      return false;
    }
  }
  return true;
}

bool ParseNumber(std::string_view token, DWORD& out) {
  if (token.empty() || token.size() > 10) return false;
  std::uint64_t value = 0;
  for (char c : token) {
    if (c < '0' || c > '9') return false;
    value = value * 10 + static_cast<std::uint64_t>(c - '0');
  }
  if (value > 0xFFFFFFFFu) return false;
  out = static_cast<DWORD>(value);
  return true;
}

bool ParseData(std::string_view token, std::vector<BYTE>& out) {
  out.clear();
  if (token == "-") return true;
  if (token.empty() || token.size() % 2 != 0) return false;
  out.reserve(token.size() / 2);
  for (std::size_t i = 0; i < token.size(); i += 2) {
    int high = HexDigit(token[i]);
    int low = HexDigit(token[i + 1]);
    if (high < 0 || low < 0) return false;
    out.push_back(static_cast<BYTE>((high << 4) | low));
  }
  return true;
}

// Splits a line into exactly `count` space-separated tokens.
bool SplitTokens(std::string_view line, std::string_view* tokens, std::size_t count) {
  for (std::size_t i = 0; i < count; ++i) {
    if (i + 1 == count) {
      if (line.empty() || line.find(' ') != std::string_view::npos) return false;
      tokens[i] = line;
      return true;
    }
    std::size_t space = line.find(' ');
    if (space == std::string_view::npos || space == 0) return false;
    tokens[i] = line.substr(0, space);
    line.remove_prefix(space + 1);
  }
  return false;
}

// Parent of a full path ("" for a root).
TextView ParentOf(TextView path) {
  std::size_t slash = path.rfind(u'\\');
  return slash == TextView::npos ? TextView() : path.substr(0, slash);
}

bool IsRootName(TextView path) {
  for (TextView root : kRoots) {
    if (EqualNoCase(root, path)) return true;
  }
  return false;
}

std::string DefaultStorePath() {
  const char* state = std::getenv("XDG_STATE_HOME");
  std::string base;
  if (state != nullptr && state[0] == '/') {
    base = state;
  } else {
    const char* home = std::getenv("HOME");
    base = std::string(home != nullptr && home[0] != '\0' ? home : "/tmp") + "/.local/state";
  }
  return base + "/skyvane/registry.dat";
}

void MakeParentDirectories(const std::string& file) {
  for (std::size_t slash = file.find('/', 1); slash != std::string::npos;
       slash = file.find('/', slash + 1)) {
    std::string dir = file.substr(0, slash);
    if (mkdir(dir.c_str(), 0700) != 0 && errno != EEXIST) return;
  }
}

bool ReadWholeFile(const std::string& path, std::string& out) {
  out.clear();
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  char buffer[16384];
  for (;;) {
    ssize_t got = read(fd, buffer, sizeof buffer);
    if (got < 0 && errno == EINTR) continue;
    if (got <= 0) break;
    out.append(buffer, static_cast<std::size_t>(got));
  }
  close(fd);
  return true;
}

bool WriteWholeFile(const std::string& path, const std::string& text) {
  std::string temp = path + ".tmp." + std::to_string(getpid());
  int fd = open(temp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
  if (fd < 0) return false;
  std::size_t done = 0;
  while (done < text.size()) {
    ssize_t put = write(fd, text.data() + done, text.size() - done);
    if (put < 0 && errno == EINTR) continue;
    if (put <= 0) break;
    done += static_cast<std::size_t>(put);
  }
  bool ok = done == text.size();
  if (close(fd) != 0) ok = false;
  if (ok && rename(temp.c_str(), path.c_str()) == 0) return true;
  unlink(temp.c_str());
  return false;
}

}  // namespace

Text Fold(TextView text) {
  Text folded(text);
  for (char16_t& c : folded) c = FoldUnit(c);
  return folded;
}

bool EqualNoCase(TextView a, TextView b) {
  if (a.size() != b.size()) return false;
  for (std::size_t i = 0; i < a.size(); ++i) {
    if (FoldUnit(a[i]) != FoldUnit(b[i])) return false;
  }
  return true;
}

Key* Store::Find(TextView path) {
  auto it = keys.find(Fold(path));
  return it == keys.end() ? nullptr : &it->second;
}

Value* Store::FindValue(Key& key, TextView name) {
  for (Value& value : key.values) {
    if (EqualNoCase(value.name, name)) return &value;
  }
  return nullptr;
}

Key& Store::Create(TextView path) {
  Text folded = Fold(path);
  auto it = keys.find(folded);
  if (it != keys.end()) return it->second;
  TextView parent = ParentOf(path);
  if (!parent.empty()) Create(parent);
  Key& key = keys[folded];
  key.path = Text(path);
  return key;
}

bool Store::HasSubKeys(TextView path) const {
  Text prefix = Fold(path) + u'\\';
  auto it = keys.lower_bound(prefix);
  return it != keys.end() && it->first.compare(0, prefix.size(), prefix) == 0;
}

std::vector<Text> Store::SubKeyNames(TextView path) const {
  Text prefix = Fold(path) + u'\\';
  std::vector<Text> names;
  for (auto it = keys.lower_bound(prefix);
       it != keys.end() && it->first.compare(0, prefix.size(), prefix) == 0; ++it) {
    if (it->first.find(u'\\', prefix.size()) == Text::npos) {
      names.push_back(it->second.path.substr(prefix.size()));
    }
  }
  // The map orders by folded path already; the folded order is the
  // case-insensitive order of the names.
  return names;
}

void Store::EraseTree(TextView path) {
  Text folded = Fold(path);
  Text prefix = folded + u'\\';
  keys.erase(folded);
  auto it = keys.lower_bound(prefix);
  while (it != keys.end() && it->first.compare(0, prefix.size(), prefix) == 0) it = keys.erase(it);
}

TextView RootName(HKEY key) {
  auto value = reinterpret_cast<ULONG_PTR>(key);
  if (value == reinterpret_cast<ULONG_PTR>(HKEY_CLASSES_ROOT)) return kRoots[0];
  if (value == reinterpret_cast<ULONG_PTR>(HKEY_CURRENT_USER)) return kRoots[1];
  if (value == reinterpret_cast<ULONG_PTR>(HKEY_LOCAL_MACHINE)) return kRoots[2];
  if (value == reinterpret_cast<ULONG_PTR>(HKEY_USERS)) return kRoots[3];
  if (value == reinterpret_cast<ULONG_PTR>(HKEY_CURRENT_CONFIG)) return kRoots[4];
  return TextView();
}

bool JoinPath(TextView base, const WCHAR* subKey, Text& out) {
  out = Text(base);
  if (subKey == nullptr) return true;
  if (subKey[0] == u'\\') return false;
  Text component;
  for (const WCHAR* p = subKey;; ++p) {
    if (*p == u'\\' || *p == 0) {
      if (!component.empty()) {
        out += u'\\';
        out += component;
        component.clear();
      }
      if (*p == 0) break;
    } else {
      component += *p;
    }
  }
  return true;
}

std::string Serialize(const Store& store) {
  std::string out;
  out += kHeader;
  out += '\n';
  for (const auto& [folded, key] : store.keys) {
    out += "K ";
    out += std::to_string(key.readOnly ? kFlagReadOnly : 0);
    out += ' ';
    AppendEscaped(out, key.path);
    out += '\n';
    for (const Value& value : key.values) {
      out += "V ";
      out += std::to_string(value.type);
      out += ' ';
      AppendEscaped(out, value.name);
      out += ' ';
      if (value.data.empty()) out += '-';
      for (BYTE b : value.data) {
        out += kHex[b >> 4];
        out += kHex[b & 0xF];
      }
      out += '\n';
    }
  }
  out += kEnd;
  out += '\n';
  return out;
}

bool Parse(std::string_view text, Store& store) {
  store.keys.clear();
  Store parsed;
  bool complete = false;
  bool first = true;
  Key* current = nullptr;
  while (!text.empty()) {
    std::size_t newline = text.find('\n');
    if (newline == std::string_view::npos) break;  // torn last line
    std::string_view line = text.substr(0, newline);
    text.remove_prefix(newline + 1);
    if (first) {
      if (line != kHeader) break;
      first = false;
      continue;
    }
    if (line == kEnd) {
      complete = text.empty();
      break;
    }
    std::string_view tokens[4];
    if (line.size() > 2 && line[0] == 'K' && line[1] == ' ') {
      DWORD flags = 0;
      Text path;
      if (!SplitTokens(line.substr(2), tokens, 2) || !ParseNumber(tokens[0], flags) ||
          !ParseEscaped(tokens[1], path) || path.empty() || path.front() == u'\\' ||
          path.back() == u'\\' || path.find(u"\\\\") != Text::npos) {
        break;
      }
      TextView parent = ParentOf(path);
      if (parent.empty() ? !IsRootName(path) : parsed.Find(parent) == nullptr) break;
      if (parsed.Find(path) != nullptr) break;
      current = &parsed.Create(path);
      current->readOnly = (flags & kFlagReadOnly) != 0;
    } else if (line.size() > 2 && line[0] == 'V' && line[1] == ' ' && current != nullptr) {
      Value value;
      if (!SplitTokens(line.substr(2), tokens, 3) || !ParseNumber(tokens[0], value.type) ||
          !ParseEscaped(tokens[1], value.name) || !ParseData(tokens[2], value.data)) {
        break;
      }
      if (parsed.FindValue(*current, value.name) != nullptr) break;
      current->values.push_back(std::move(value));
    } else {
      break;
    }
  }
  if (complete) store = std::move(parsed);
  EnsureRoots(store);
  return complete;
}

std::string StorePath() {
  const char* configured = std::getenv("SKYVANE_REGISTRY");
  if (configured != nullptr && configured[0] != '\0') return configured;
  return DefaultStorePath();
}

DWORD Transact(const std::function<bool(Store&)>& operation) {
  // Threads of this process are kept apart here; processes by the flock.
  static std::mutex processLock;
  std::lock_guard<std::mutex> guard(processLock);

  std::string path = StorePath();
  MakeParentDirectories(path);
  std::string lockPath = path + ".lock";
  int lockFd = open(lockPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
  if (lockFd < 0) return ERROR_CANTOPEN;
  while (flock(lockFd, LOCK_EX) != 0) {
    if (errno != EINTR) {
      close(lockFd);
      return ERROR_CANTOPEN;
    }
  }

  Store store;
  std::string text;
  if (ReadWholeFile(path, text)) {
    Parse(text, store);
  } else {
    EnsureRoots(store);
  }
  DWORD result = ERROR_SUCCESS;
  if (operation(store) && !WriteWholeFile(path, Serialize(store))) result = ERROR_CANTWRITE;

  flock(lockFd, LOCK_UN);
  close(lockFd);
  return result;
}

}  // namespace emu::registry
