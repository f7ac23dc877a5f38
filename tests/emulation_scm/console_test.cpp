// Console control: terminal signals become console control events whose
// handlers run on a thread of their own, last registered first.
#include <gtest/gtest.h>
#include <signal.h>
#include <unistd.h>

#include <condition_variable>
#include <mutex>
#include <vector>

#include "platform/posix/emu_scm.h"
#include "platform/win32.h"
#include "support/child_process.h"
#include "support/test_support.h"

namespace {

struct Call {
  int handler;
  DWORD type;
  DWORD threadId;
};

std::mutex g_lock;
std::condition_variable g_changed;
std::vector<Call> g_calls;
bool g_secondHandles = false;

BOOL Record(int handler, DWORD type) {
  std::lock_guard<std::mutex> guard(g_lock);
  g_calls.push_back({handler, type, GetCurrentThreadId()});
  g_changed.notify_all();
  return handler == 1 || g_secondHandles ? TRUE : FALSE;
}
BOOL WINAPI FirstHandler(DWORD type) {
  return Record(1, type);
}
BOOL WINAPI SecondHandler(DWORD type) {
  return Record(2, type);
}

std::vector<Call> WaitForCalls(std::size_t count) {
  std::unique_lock<std::mutex> guard(g_lock);
  g_changed.wait_for(guard, std::chrono::seconds(10), [&] { return g_calls.size() >= count; });
  std::vector<Call> calls = g_calls;
  g_calls.clear();
  return calls;
}

class ConsoleControl : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(SetConsoleCtrlHandler(FirstHandler, TRUE));
    ASSERT_TRUE(SetConsoleCtrlHandler(SecondHandler, TRUE));
    g_secondHandles = false;
    std::lock_guard<std::mutex> guard(g_lock);
    g_calls.clear();
  }
  void TearDown() override {
    SetConsoleCtrlHandler(SecondHandler, FALSE);
    SetConsoleCtrlHandler(FirstHandler, FALSE);
  }
};

TEST_F(ConsoleControl, SignalsRunHandlersLastRegisteredFirstOnAnotherThread) {
  ASSERT_EQ(raise(SIGINT), 0);
  std::vector<Call> calls = WaitForCalls(2);
  ASSERT_EQ(calls.size(), 2u);
  EXPECT_EQ(calls[0].handler, 2);
  EXPECT_EQ(calls[1].handler, 1);
  EXPECT_EQ(calls[0].type, CTRL_C_EVENT);
  EXPECT_NE(calls[0].threadId, GetCurrentThreadId());
  EXPECT_EQ(calls[0].threadId, calls[1].threadId);

  // SIGQUIT stands for Ctrl+Break; a handler returning TRUE ends the chain.
  g_secondHandles = true;
  ASSERT_EQ(raise(SIGQUIT), 0);
  calls = WaitForCalls(1);
  ASSERT_EQ(calls.size(), 1u);
  EXPECT_EQ(calls[0].handler, 2);
  EXPECT_EQ(calls[0].type, CTRL_BREAK_EVENT);
}

TEST_F(ConsoleControl, RemovingAndIgnoring) {
  ASSERT_TRUE(SetConsoleCtrlHandler(SecondHandler, FALSE));
  EXPECT_FALSE(SetConsoleCtrlHandler(SecondHandler, FALSE));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_PARAMETER);
  EXPECT_TRUE(emu::RaiseConsoleControl(CTRL_BREAK_EVENT));
  std::vector<Call> calls = WaitForCalls(1);
  ASSERT_EQ(calls.size(), 1u);
  EXPECT_EQ(calls[0].handler, 1);

  // A null handler makes the process ignore Ctrl+C, not Ctrl+Break.
  ASSERT_TRUE(SetConsoleCtrlHandler(nullptr, TRUE));
  EXPECT_TRUE(emu::RaiseConsoleControl(CTRL_C_EVENT));
  EXPECT_TRUE(emu::RaiseConsoleControl(CTRL_BREAK_EVENT));
  calls = WaitForCalls(1);
  ASSERT_EQ(calls.size(), 1u);
  EXPECT_EQ(calls[0].type, CTRL_BREAK_EVENT);
  ASSERT_TRUE(SetConsoleCtrlHandler(nullptr, FALSE));
  ASSERT_TRUE(SetConsoleCtrlHandler(SecondHandler, TRUE));
}

// Unhandled, the event ends the process the way the signal would. The
// child is a fresh run of this program (see tests/support/child_process.h).
TEST(ConsoleDefault, UnhandledControlEndsTheProcess) {
  if (skytest::ChildRole() != nullptr) {
    alarm(20);                                   // a broken default action must not hang the case
    SetConsoleCtrlHandler(SecondHandler, TRUE);  // returns FALSE: not handled
    raise(SIGINT);
    for (;;) pause();
  }
  EXPECT_EQ(skytest::RunChildSelf("unhandled", skytest::kGuardMs * 3), 128 + SIGINT);
}

}  // namespace
