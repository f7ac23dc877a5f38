// The process's command line and executable path, as Windows presents them:
// GetCommandLineW joins the arguments of /proc/self/cmdline into one line
// quoted so that CommandLineToArgvW gives them back; CommandLineToArgvW
// splits a line by the Windows rules; GetModuleFileNameW reports
// /proc/self/exe.
#include <unistd.h>

#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <string>
#include <vector>

#include "platform/posix/win32_base.h"
#include "platform/wide.h"

namespace {

// Quotes one argument so that the argument rules below give it back:
// quotes only when needed; backslashes doubled only before a quote.
void AppendQuoted(WideString& line, const WideString& argument) {
  if (!argument.empty() && argument.find_first_of(u" \t\n\v\"") == WideString::npos) {
    line += argument;
    return;
  }
  line += u'"';
  std::size_t backslashes = 0;
  for (char16_t c : argument) {
    if (c == u'\\') {
      ++backslashes;
      continue;
    }
    if (c == u'"') {
      line.append(backslashes * 2 + 1, u'\\');
    } else {
      line.append(backslashes, u'\\');
    }
    backslashes = 0;
    line += c;
  }
  line.append(backslashes * 2, u'\\');
  line += u'"';
}

// The program name is read up to the next quote when it starts with one,
// without backslash rules, so it is only ever wrapped in quotes.
void AppendProgramName(WideString& line, const WideString& name) {
  if (!name.empty() && name.find_first_of(u" \t") == WideString::npos) {
    line += name;
    return;
  }
  line += u'"';
  for (char16_t c : name) {
    if (c != u'"') line += c;
  }
  line += u'"';
}

WideString BuildCommandLine() {
  std::string raw;
  if (FILE* file = std::fopen("/proc/self/cmdline", "rbe")) {
    char buffer[4096];
    std::size_t got;
    while ((got = std::fread(buffer, 1, sizeof(buffer), file)) > 0) raw.append(buffer, got);
    std::fclose(file);
  }
  std::vector<std::string> arguments;
  std::size_t start = 0;
  while (start < raw.size()) {
    std::size_t end = raw.find('\0', start);
    if (end == std::string::npos) end = raw.size();
    arguments.push_back(raw.substr(start, end - start));
    start = end + 1;
  }
  WideString line;
  for (std::size_t i = 0; i < arguments.size(); ++i) {
    if (i == 0) {
      AppendProgramName(line, Utf8ToWide(arguments[i]));
    } else {
      line += u' ';
      AppendQuoted(line, Utf8ToWide(arguments[i]));
    }
  }
  return line;
}

WideString ExecutablePath() {
  char path[PATH_MAX];
  ssize_t length = readlink("/proc/self/exe", path, sizeof path - 1);
  if (length <= 0) return WideString();
  return Utf8ToWide(std::string_view(path, static_cast<std::size_t>(length)));
}

bool IsBlank(WCHAR c) {
  return c == u' ' || c == u'\t';
}

// Splits `line` by the rules of CommandLineToArgvW.
std::vector<WideString> SplitCommandLine(const WCHAR* line) {
  std::vector<WideString> arguments;
  const WCHAR* s = line;
  // The program name: up to the closing quote when quoted, else up to the
  // first blank; no backslash rules.
  WideString program;
  if (*s == u'"') {
    ++s;
    while (*s != 0 && *s != u'"') program += *s++;
    if (*s == u'"') ++s;
  } else {
    while (*s != 0 && !IsBlank(*s)) program += *s++;
  }
  arguments.push_back(program);
  while (IsBlank(*s)) ++s;

  // The other arguments: 2n backslashes and a quote give n backslashes and
  // toggle quoting, 2n+1 give n and a literal quote; inside quotes a doubled
  // quote gives a literal quote.
  while (*s != 0) {
    WideString argument;
    std::size_t backslashes = 0;
    int quotes = 0;
    while (*s != 0) {
      if (IsBlank(*s) && quotes == 0) break;
      if (*s == u'\\') {
        argument += *s++;
        ++backslashes;
        continue;
      }
      if (*s == u'"') {
        argument.resize(argument.size() - backslashes / 2);
        if (backslashes % 2 == 0) {
          ++quotes;
        } else {
          argument.back() = u'"';
        }
        ++s;
        backslashes = 0;
        while (*s == u'"') {
          if (++quotes == 3) {
            argument += u'"';
            quotes = 0;
          }
          ++s;
        }
        if (quotes == 2) quotes = 0;
        continue;
      }
      argument += *s++;
      backslashes = 0;
    }
    arguments.push_back(argument);
    while (IsBlank(*s)) ++s;
  }
  return arguments;
}

}  // namespace

LPWSTR GetCommandLineW() {
  // Built once and kept for the life of the process, as on Windows.
  static WideString* line = new WideString(BuildCommandLine());
  return line->data();
}

LPWSTR* CommandLineToArgvW(LPCWSTR commandLine, int* argumentCount) {
  if (commandLine == nullptr || argumentCount == nullptr) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return nullptr;
  }
  std::vector<WideString> arguments;
  if (commandLine[0] == 0) {
    arguments.push_back(ExecutablePath());
  } else {
    arguments = SplitCommandLine(commandLine);
  }
  // One block, freed with LocalFree: the pointer array (null-ended), then
  // the terminated strings.
  std::size_t pointerBytes = (arguments.size() + 1) * sizeof(LPWSTR);
  std::size_t textUnits = 0;
  for (const auto& argument : arguments) textUnits += argument.size() + 1;
  auto* block = static_cast<BYTE*>(std::malloc(pointerBytes + textUnits * sizeof(WCHAR)));
  if (block == nullptr) {
    SetLastError(ERROR_NOT_ENOUGH_MEMORY);
    return nullptr;
  }
  auto* vector = reinterpret_cast<LPWSTR*>(block);
  auto* text = reinterpret_cast<WCHAR*>(block + pointerBytes);
  for (std::size_t i = 0; i < arguments.size(); ++i) {
    vector[i] = text;
    std::memcpy(text, arguments[i].data(), arguments[i].size() * sizeof(WCHAR));
    text[arguments[i].size()] = 0;
    text += arguments[i].size() + 1;
  }
  vector[arguments.size()] = nullptr;
  *argumentCount = static_cast<int>(arguments.size());
  return vector;
}

DWORD GetModuleFileNameW(HMODULE module, LPWSTR fileName, DWORD size) {
  if (module != nullptr) {
    SetLastError(ERROR_MOD_NOT_FOUND);
    return 0;
  }
  WideString path = ExecutablePath();
  if (path.empty()) {
    SetLastError(ERROR_FILE_NOT_FOUND);
    return 0;
  }
  if (size == 0 || fileName == nullptr) {
    SetLastError(ERROR_INSUFFICIENT_BUFFER);
    return 0;
  }
  // Too small: cut to size - 1 characters and terminated, the full size
  // returned, ERROR_INSUFFICIENT_BUFFER (Windows Vista and later).
  if (path.size() >= size) {
    std::memcpy(fileName, path.data(), (size - 1) * sizeof(WCHAR));
    fileName[size - 1] = 0;
    SetLastError(ERROR_INSUFFICIENT_BUFFER);
    return size;
  }
  std::memcpy(fileName, path.data(), path.size() * sizeof(WCHAR));
  fileName[path.size()] = 0;
  return static_cast<DWORD>(path.size());
}
