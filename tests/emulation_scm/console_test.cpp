// Console control: terminal signals become console control events whose
// handlers run on a thread of their own, last registered first. (The
// end-to-end run stops the debug-mode service with SIGINT.)
#include <gtest/gtest.h>
#include <signal.h>

#include <condition_variable>
#include <mutex>
#include <vector>

#include "platform/posix/emu_scm.h"
#include "platform/win32.h"

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

// The calls once `count` have come (or after ten seconds).
std::vector<Call> TakeCalls(std::size_t count) {
  std::unique_lock<std::mutex> guard(g_lock);
  g_changed.wait_for(guard, std::chrono::seconds(10), [&] { return g_calls.size() >= count; });
  std::vector<Call> calls;
  calls.swap(g_calls);
  return calls;
}

TEST(ConsoleControl, HandlersRunLastRegisteredFirstOnAnotherThreadUntilOneHandles) {
  ASSERT_TRUE(SetConsoleCtrlHandler(FirstHandler, TRUE));
  ASSERT_TRUE(SetConsoleCtrlHandler(SecondHandler, TRUE));
  ASSERT_EQ(raise(SIGINT), 0);
  std::vector<Call> calls = TakeCalls(2);
  ASSERT_EQ(calls.size(), 2u);
  EXPECT_EQ(calls[0].handler, 2);
  EXPECT_EQ(calls[1].handler, 1);
  EXPECT_EQ(calls[0].type, CTRL_C_EVENT);
  EXPECT_NE(calls[0].threadId, GetCurrentThreadId());
  EXPECT_EQ(calls[0].threadId, calls[1].threadId);

  // SIGQUIT stands for Ctrl+Break; a handler returning TRUE ends the chain.
  g_secondHandles = true;
  ASSERT_EQ(raise(SIGQUIT), 0);
  calls = TakeCalls(1);
  ASSERT_EQ(calls.size(), 1u);
  EXPECT_EQ(calls[0].handler, 2);
  EXPECT_EQ(calls[0].type, CTRL_BREAK_EVENT);

  // Removed handlers are not called; a null handler ignores Ctrl+C only.
  ASSERT_TRUE(SetConsoleCtrlHandler(SecondHandler, FALSE));
  EXPECT_FALSE(SetConsoleCtrlHandler(SecondHandler, FALSE));
  EXPECT_EQ(GetLastError(), ERROR_INVALID_PARAMETER);
  ASSERT_TRUE(SetConsoleCtrlHandler(nullptr, TRUE));
  EXPECT_TRUE(emu::RaiseConsoleControl(CTRL_C_EVENT));
  EXPECT_TRUE(emu::RaiseConsoleControl(CTRL_BREAK_EVENT));
  calls = TakeCalls(1);
  ASSERT_EQ(calls.size(), 1u);
  EXPECT_EQ(calls[0].handler, 1);
  EXPECT_EQ(calls[0].type, CTRL_BREAK_EVENT);
  ASSERT_TRUE(SetConsoleCtrlHandler(nullptr, FALSE));
  ASSERT_TRUE(SetConsoleCtrlHandler(FirstHandler, FALSE));
}

}  // namespace
