// The time scale shortens every Sleep and wait time-out of a process that
// starts with SKYVANE_TIME_SCALE set (the factor is read once per process,
// so the check runs in a child started with its own value).
#include <gtest/gtest.h>
#include <stdlib.h>

#include <string>

#include "platform/diagnostics.h"
#include "platform/win32.h"
#include "support/child_process.h"

namespace {

TEST(TimeScale, HoursOfWaitingPassQuicklyWithATinyScale) {
  if (skytest::ChildRole() != nullptr) {
    EXPECT_DOUBLE_EQ(platform::TimeScale(), 0.0001);
    HANDLE event = CreateEventW(nullptr, FALSE, FALSE, nullptr);
    ULONGLONG start = GetTickCount64();
    EXPECT_EQ(WaitForSingleObject(event, 10000000), WAIT_TIMEOUT);  // ~1 s real
    Sleep(5000000);                                                 // ~0.5 s real
    // The emulated clock ran as far as the waits asked.
    EXPECT_GE(GetTickCount64() - start, 15000000u);
    HANDLE pair[2] = {event, event};
    EXPECT_EQ(WaitForMultipleObjects(2, pair, FALSE, 1), WAIT_TIMEOUT);  // at least 1 ms
    CloseHandle(event);
    return;
  }
  const char* previous = getenv("SKYVANE_TIME_SCALE");
  std::string saved = previous != nullptr ? previous : "";
  setenv("SKYVANE_TIME_SCALE", "0.0001", 1);
  // Unscaled, the child would wait for hours; the guard is real time.
  int code = skytest::RunChildSelf("scaled", 120000);
  if (previous != nullptr) {
    setenv("SKYVANE_TIME_SCALE", saved.c_str(), 1);
  } else {
    unsetenv("SKYVANE_TIME_SCALE");
  }
  EXPECT_EQ(code, 0);
}

}  // namespace
