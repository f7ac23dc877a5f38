// Defines the process entry of a program whose real entry takes UTF-16
// arguments: wmain on Windows (linked with -municode), main elsewhere, where
// the UTF-8 arguments are converted first. Include in exactly one file:
//   SKYVANE_PROCESS_ENTRY(ServiceEntry)
#pragma once

#include "platform/win32.h"

#if defined(_WIN32)
#define SKYVANE_PROCESS_ENTRY(entry)    \
  int wmain(int argc, wchar_t** argv) { \
    return entry(argc, argv);           \
  }
#else
#include <vector>

#include "platform/wide.h"

namespace platform {
// Calls entry with the arguments as UTF-16 strings (null-terminated vector).
inline int RunWithWideArguments(int argc, char** argv, int (*entry)(int, LPWSTR*)) {
  std::vector<WideString> storage;
  storage.reserve(static_cast<std::size_t>(argc));
  for (int i = 0; i < argc; ++i) storage.push_back(Utf8ToWide(argv[i]));
  std::vector<LPWSTR> vector;
  vector.reserve(storage.size() + 1);
  for (WideString& text : storage) vector.push_back(text.data());
  vector.push_back(nullptr);
  return entry(argc, vector.data());
}
}  // namespace platform

#define SKYVANE_PROCESS_ENTRY(entry)                          \
  int main(int argc, char** argv) {                           \
    return platform::RunWithWideArguments(argc, argv, entry); \
  }
#endif
