#pragma once

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "platform/posix/emu_scm.h"
#include "platform/wide.h"
#include "service/service_host.h"

namespace servicetest {

inline int RunEntry(std::vector<std::string> words) {
  std::vector<WideString> storage{WSTR("SkyvaneSvc")};
  for (const std::string& word : words) storage.push_back(Utf8ToWide(word));
  std::vector<LPWSTR> argv;
  for (WideString& text : storage) argv.push_back(text.data());
  argv.push_back(nullptr);
  return ServiceEntry(static_cast<int>(storage.size()), argv.data());
}

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
