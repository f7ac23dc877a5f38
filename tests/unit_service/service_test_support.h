// Shared pieces of the host service cases: a scaled clock, the entry run on a
// thread of its own, and captured console output.
#pragma once

#include <gtest/gtest.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "platform/posix/emu_scm.h"
#include "platform/wide.h"
#include "service/service_host.h"

namespace servicetest {

// The loop's one-second passes take 10 ms; set before the first wait.
inline const bool kTimeScaled = [] {
  setenv("SKYVANE_TIME_SCALE", "0.01", 0);
  return true;
}();

// Runs ServiceEntry with the given words after the program name.
inline int RunEntry(std::vector<std::string> words) {
  std::vector<WideString> storage{WSTR("SkyvaneSvc")};
  for (const std::string& word : words) storage.push_back(Utf8ToWide(word));
  std::vector<LPWSTR> argv;
  for (WideString& text : storage) argv.push_back(text.data());
  argv.push_back(nullptr);
  return ServiceEntry(static_cast<int>(storage.size()), argv.data());
}

// ServiceEntry's console output for the given words.
inline std::string EntryOutput(std::vector<std::string> words) {
  ::testing::internal::CaptureStdout();
  EXPECT_EQ(RunEntry(std::move(words)), 0);
  return ::testing::internal::GetCapturedStdout();
}

inline std::vector<DWORD> States(const std::vector<SERVICE_STATUS>& reports) {
  std::vector<DWORD> states;
  for (const SERVICE_STATUS& report : reports) states.push_back(report.dwCurrentState);
  return states;
}

inline std::string Utf8(const std::u16string& text) {
  return WideToUtf8(WideView(text.data(), text.size()));
}

}  // namespace servicetest
