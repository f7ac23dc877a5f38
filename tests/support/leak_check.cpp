#include "leak_check.h"

#include <gtest/gtest.h>

#include <chrono>
#include <thread>

#include "platform/diagnostics.h"

namespace skytest {
namespace {

// A thread signals its handle when its procedure returns, but the emulation
// may count it as alive for a moment longer while it unwinds; a handle the
// thread itself held goes away at the same time. So a case that joined all its
// threads can still see a count above zero for a short while. The check polls
// (real time, not the emulation's scaled time) until the counts reach zero or
// the bound passes; a genuine leak never reaches zero and fails the case.
// The counts are absolute: run as one program, a leak also fails the cases
// after it (under CTest on the host every case is a process of its own).
constexpr int kPolls = 2000;
constexpr auto kPollInterval = std::chrono::milliseconds(5);

class LeakCheck : public ::testing::EmptyTestEventListener {
 public:
  void OnTestEnd(const ::testing::TestInfo& /*info*/) override {
    long handles = platform::LiveHandleCount();
    long threads = platform::LiveThreadCount();
    if (handles < 0 || threads < 0) return;  // not known on this platform
    for (int poll = 0; poll < kPolls && (handles != 0 || threads != 0); ++poll) {
      std::this_thread::sleep_for(kPollInterval);
      handles = platform::LiveHandleCount();
      threads = platform::LiveThreadCount();
    }
    if (handles != 0 || threads != 0) {
      ADD_FAILURE() << "the case left " << handles << " live handle(s) and " << threads
                    << " live thread(s) in the emulation";
    }
  }
};

}  // namespace

void InstallLeakCheck() {
  // Listeners see the end of a case in reverse order, so one appended after the
  // default printer runs before it and its failure is printed with the case.
  ::testing::UnitTest::GetInstance()->listeners().Append(new LeakCheck);
}

}  // namespace skytest
