// Console control handlers. The terminal's keys arrive as signals: SIGINT is
// Ctrl+C (CTRL_C_EVENT), SIGQUIT (Ctrl+\) stands for Ctrl+Break
// (CTRL_BREAK_EVENT), SIGHUP for closing the console (CTRL_CLOSE_EVENT). The
// signal handler only writes the event to a pipe; a console thread of the
// emulation reads it and calls the handlers there, last registered first,
// until one returns TRUE, as Windows does on a thread of its own. When none
// handles the event the default action ends the process by the signal itself.
#include <fcntl.h>
#include <pthread.h>
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <condition_variable>
#include <deque>
#include <iterator>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/posix/emu_scm.h"
#include "platform/posix/win32_service.h"

namespace emu::console {
namespace {

// A control raised by RaiseConsoleControl, answered by the console thread.
struct Raised {
  DWORD type = 0;
  bool done = false;
  bool handled = false;
};

constexpr unsigned char kRaisedMarker = 0xFF;

struct Console {
  std::mutex lock;
  std::condition_variable answered;
  std::vector<PHANDLER_ROUTINE> handlers;
  bool ignoreCtrlC = false;
  bool signalsInstalled = false;
  bool threadRunning = false;
  std::deque<std::shared_ptr<Raised>> raised;
};

Console& C() {
  static Console* console = new Console();
  return *console;
}

// Written by the signal handler; set before the handlers are installed.
volatile int g_writeFd = -1;
int g_readFd = -1;

void OnSignal(int signalNumber) {
  int saved = errno;
  unsigned char type = signalNumber == SIGINT    ? static_cast<unsigned char>(CTRL_C_EVENT)
                       : signalNumber == SIGQUIT ? static_cast<unsigned char>(CTRL_BREAK_EVENT)
                                                 : static_cast<unsigned char>(CTRL_CLOSE_EVENT);
  while (write(g_writeFd, &type, 1) < 0 && errno == EINTR) {
  }
  errno = saved;
}

int SignalFor(DWORD type) {
  switch (type) {
    case CTRL_C_EVENT:
      return SIGINT;
    case CTRL_BREAK_EVENT:
      return SIGQUIT;
    case CTRL_CLOSE_EVENT:
      return SIGHUP;
    default:
      return SIGTERM;
  }
}

// The default handler: the process ends the way the key would end it.
[[noreturn]] void DefaultAction(DWORD type) {
  int signalNumber = SignalFor(type);
  struct sigaction action {};
  action.sa_handler = SIG_DFL;
  sigemptyset(&action.sa_mask);
  sigaction(signalNumber, &action, nullptr);
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, signalNumber);
  pthread_sigmask(SIG_UNBLOCK, &set, nullptr);
  raise(signalNumber);
  _exit(128 + signalNumber);
}

// Runs the handlers for one event; true when one of them handled it.
bool Dispatch(DWORD type) {
  std::vector<PHANDLER_ROUTINE> handlers;
  {
    std::lock_guard<std::mutex> guard(C().lock);
    if (type == CTRL_C_EVENT && C().ignoreCtrlC) return true;
    handlers = C().handlers;
  }
  for (auto it = handlers.rbegin(); it != handlers.rend(); ++it) {
    if ((*it)(type) != FALSE) return true;
  }
  return false;
}

void ConsoleThread(int readFd) {
  for (;;) {
    unsigned char byte = 0;
    ssize_t got = read(readFd, &byte, 1);
    if (got < 0 && errno == EINTR) continue;
    if (got <= 0) return;
    if (byte != kRaisedMarker) {
      if (!Dispatch(byte)) DefaultAction(byte);
      continue;
    }
    std::shared_ptr<Raised> request;
    {
      std::lock_guard<std::mutex> guard(C().lock);
      if (C().raised.empty()) continue;
      request = C().raised.front();
      C().raised.pop_front();
    }
    if (!Dispatch(request->type)) DefaultAction(request->type);
    std::lock_guard<std::mutex> guard(C().lock);
    request->done = true;
    request->handled = true;
    C().answered.notify_all();
  }
}

// A forked child is a new process: it starts without handlers, console
// thread or pipe, with the signals' default actions, until it registers a
// handler itself (which also keeps its signals away from the parent).
void AfterForkInChild() {
  if (g_readFd >= 0) close(g_readFd);
  if (g_writeFd >= 0) close(g_writeFd);
  g_readFd = -1;
  g_writeFd = -1;
  Console& c = C();
  if (c.signalsInstalled) {
    struct sigaction action {};
    action.sa_handler = SIG_DFL;
    sigemptyset(&action.sa_mask);
    for (int signalNumber : {SIGINT, SIGQUIT, SIGHUP}) sigaction(signalNumber, &action, nullptr);
  }
  c.signalsInstalled = false;
  c.threadRunning = false;
  c.handlers.clear();
  c.ignoreCtrlC = false;
  c.raised.clear();
  c.lock.unlock();
}

void BeforeFork() {
  C().lock.lock();
}
void AfterForkInParent() {
  C().lock.unlock();
}

// Creates the pipe, the console thread and the signal handlers once.
// Called with C().lock held.
bool EnsureStarted() {
  Console& c = C();
  static bool forkHandlersRegistered = false;
  if (!forkHandlersRegistered) {
    pthread_atfork(BeforeFork, AfterForkInParent, AfterForkInChild);
    forkHandlersRegistered = true;
  }
  if (g_readFd < 0) {
    int fds[2];
    if (pipe2(fds, O_CLOEXEC) != 0) return false;
    g_readFd = fds[0];
    g_writeFd = fds[1];
  }
  if (!c.threadRunning) {
    std::thread(ConsoleThread, g_readFd).detach();
    c.threadRunning = true;
  }
  if (!c.signalsInstalled) {
    struct sigaction action {};
    action.sa_handler = OnSignal;
    sigemptyset(&action.sa_mask);
    action.sa_flags = SA_RESTART;
    for (int signalNumber : {SIGINT, SIGQUIT, SIGHUP}) sigaction(signalNumber, &action, nullptr);
    c.signalsInstalled = true;
  }
  return true;
}

}  // namespace
}  // namespace emu::console

using emu::console::C;

BOOL SetConsoleCtrlHandler(PHANDLER_ROUTINE handler, BOOL add) {
  std::lock_guard<std::mutex> guard(C().lock);
  if (handler == nullptr) {
    C().ignoreCtrlC = add != FALSE;
  } else if (add != FALSE) {
    C().handlers.push_back(handler);
  } else {
    auto& handlers = C().handlers;
    auto it = std::find(handlers.rbegin(), handlers.rend(), handler);
    if (it == handlers.rend()) {
      SetLastError(ERROR_INVALID_PARAMETER);
      return FALSE;
    }
    handlers.erase(std::next(it).base());
    return TRUE;
  }
  if (!emu::console::EnsureStarted()) {
    SetLastError(ERROR_NOT_ENOUGH_MEMORY);
    return FALSE;
  }
  return TRUE;
}

namespace emu {

bool RaiseConsoleControl(DWORD controlType) {
  auto request = std::make_shared<console::Raised>();
  request->type = controlType;
  std::unique_lock<std::mutex> guard(C().lock);
  if (!console::EnsureStarted()) return false;
  C().raised.push_back(request);
  unsigned char marker = console::kRaisedMarker;
  while (write(console::g_writeFd, &marker, 1) < 0 && errno == EINTR) {
  }
  C().answered.wait(guard, [&] { return request->done; });
  return request->handled;
}

}  // namespace emu
