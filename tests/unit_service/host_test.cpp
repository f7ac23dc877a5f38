#include <gtest/gtest.h>

#include <utility>
#include <vector>

#include "platform/wide.h"
#include "service/process_locks.h"
#include "service/service_host.h"
#include "service/service_main.h"
#include "unit_monitor/lock_probe.h"

namespace {

Verb Parse(std::vector<WideString> words) {
  std::vector<LPWSTR> argv;
  for (WideString& word : words) argv.push_back(word.data());
  argv.push_back(nullptr);
  return ParseVerb(static_cast<int>(words.size()), argv.data());
}

TEST(Verbs, OnlyAWholePrefixedFirstWordIsAVerb) {
  const std::pair<std::vector<WideString>, Verb> cases[] = {
      {{WSTR("-install")}, Verb::Install},
      {{WSTR("/INSTALL")}, Verb::Install},
      {{WSTR("/Remove")}, Verb::Remove},
      {{WSTR("-DeBuG"), WSTR("extra")}, Verb::Debug},
      {{}, Verb::None},
      {{WSTR("install")}, Verb::None},
      {{WSTR("-inst")}, Verb::None},
      {{WSTR("--install")}, Verb::None},
      {{WSTR("-installx")}, Verb::None},
      {{WSTR("-")}, Verb::None},
      {{WSTR("")}, Verb::None},
      {{WSTR("x"), WSTR("-install")}, Verb::None},
  };
  for (const auto& [words, verb] : cases) {
    std::vector<WideString> argv{WSTR("SkyvaneSvc")};
    argv.insert(argv.end(), words.begin(), words.end());
    EXPECT_EQ(Parse(argv), verb) << words.size();
  }
}

std::string TextFor(DWORD error, DWORD bufferBytes) {
  WCHAR buffer[128];
  buffer[0] = 'x';
  SetLastError(error);
  const WCHAR* result = LastErrorText(buffer, bufferBytes);
  EXPECT_EQ(result, buffer);
  return WideToUtf8(WideView(buffer));
}

// The system text without its line break, then the code in hex; empty when
// there is no text or it does not fit in the buffer's bytes less 14.
TEST(LastErrorText, SystemTextThenHexCodeWithinTheBuffer) {
  const std::string text = TextFor(ERROR_SERVICE_EXISTS, 256);
  ASSERT_GT(text.size(), 8u);
  EXPECT_EQ(text.substr(text.size() - 8), " (0x431)");
  EXPECT_EQ(text.find_first_of("\r\n"), std::string::npos);
  EXPECT_NE(text[0], ' ');
  EXPECT_EQ(TextFor(0x20001234, 256), "");
  // The system text with its line break is the result less " (0x431)" plus 2.
  const std::size_t textLength = text.size() - 8 + 2;
  EXPECT_EQ(TextFor(ERROR_SERVICE_EXISTS, static_cast<DWORD>(textLength + 13)), "");
  EXPECT_NE(TextFor(ERROR_SERVICE_EXISTS, static_cast<DWORD>(textLength + 14)), "");
  WCHAR buffer[128];
  for (WCHAR& unit : buffer) unit = 'x';
  SetLastError(ERROR_SERVICE_EXISTS);
  LastErrorText(buffer, static_cast<DWORD>(text.size() * sizeof(WCHAR)));
  EXPECT_EQ(WideLength(buffer, 128), text.size() - 1);
  EXPECT_EQ(buffer[text.size()], 'x') << "wrote beyond the stated buffer size";
}

// Device events pass under the lock whose holder ends the notifications.
TEST(ServiceControlHandler, EventsAndReportsWaitForTheirLocks) {
  InitializeProcessLocks();
  const bool saved = debugMode;
  debugMode = true;
  const DWORD checkPoint = nextCheckPoint;
  EXPECT_TRUE(ReportServiceStatus(SERVICE_START_PENDING, 0, 3000));
  EXPECT_EQ(nextCheckPoint, checkPoint) << "reported in debug mode";
  EXPECT_TRUE(lockprobe::WaitsForTheSection(&deviceEventLock, [] {
    ServiceControlHandler(SERVICE_CONTROL_DEVICEEVENT, DBT_DEVICEARRIVAL, nullptr, nullptr);
  }));
  debugMode = false;
  serviceStatus.dwCurrentState = SERVICE_RUNNING;
  EnterCriticalSection(&serviceStatusLock);
  EXPECT_TRUE(lockprobe::WaitsForTheHeldLock(
      [] { ServiceControlHandler(SERVICE_CONTROL_INTERROGATE, 0, nullptr, nullptr); },
      [] {
        serviceStatus.dwCurrentState = SERVICE_STOP_PENDING;
        LeaveCriticalSection(&serviceStatusLock);
      }));
  EXPECT_EQ(serviceStatus.dwCurrentState, static_cast<DWORD>(SERVICE_STOP_PENDING));
  debugMode = saved;
}

}  // namespace
