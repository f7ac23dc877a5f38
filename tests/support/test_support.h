// Helpers shared by the test programs of both platforms.
#pragma once

#include <gtest/gtest.h>

#include <functional>
#include <memory>
#include <string>

#include "platform/wide.h"
#include "platform/win32.h"

namespace skytest {

// Failure guard for waits: about ten real seconds (divided by
// SKYVANE_TIME_SCALE, which the emulation applies to every wait).
DWORD ScaledGuardMs();
inline const DWORD kGuardMs = ScaledGuardMs();
// Failure guard for waiting on a child process (real time, never scaled).
constexpr DWORD kProcessGuardMs = 30000;

// Owns one handle and closes it; null and INVALID_HANDLE_VALUE are "none".
class Handle {
 public:
  Handle() = default;
  explicit Handle(HANDLE handle) : handle_(handle) {}
  Handle(const Handle&) = delete;
  Handle& operator=(const Handle&) = delete;
  Handle(Handle&& other) noexcept : handle_(other.Release()) {}
  Handle& operator=(Handle&& other) noexcept {
    if (this != &other) Reset(other.Release());
    return *this;
  }
  ~Handle() { Reset(); }

  HANDLE Get() const { return handle_; }
  bool Valid() const { return handle_ != nullptr && handle_ != INVALID_HANDLE_VALUE; }
  explicit operator bool() const { return Valid(); }
  HANDLE Release() {
    HANDLE handle = handle_;
    handle_ = nullptr;
    return handle;
  }
  void Reset(HANDLE handle = nullptr) {
    if (Valid()) CloseHandle(handle_);
    handle_ = handle;
  }

 private:
  HANDLE handle_ = nullptr;
};

// An unnamed event.
inline Handle NewEvent(bool manualReset = true, bool signalled = false) {
  return Handle(CreateEventW(nullptr, manualReset, signalled, nullptr));
}

// An OVERLAPPED record with its own manual-reset event, as the service uses.
struct Overlapped {
  OVERLAPPED record{};
  Handle event = NewEvent(true, false);
  Overlapped() { record.hEvent = event.Get(); }
  Overlapped(const Overlapped&) = delete;
  Overlapped& operator=(const Overlapped&) = delete;
  OVERLAPPED* Get() { return &record; }
  bool Signalled() const { return WaitForSingleObject(event.Get(), 0) == WAIT_OBJECT_0; }
};

// An open registry key, closed at the end of its scope.
class RegKey {
 public:
  RegKey() = default;
  RegKey(const RegKey&) = delete;
  RegKey& operator=(const RegKey&) = delete;
  ~RegKey() {
    if (key_ != nullptr) RegCloseKey(key_);
  }
  HKEY* Out() { return &key_; }
  HKEY Get() const { return key_; }

 private:
  HKEY key_ = nullptr;
};

// A thread that runs `body`; the object waits for it to end when it goes.
class Thread {
 public:
  static constexpr DWORD kNotEnded = 0xFFFFFFF0;
  explicit Thread(std::function<DWORD()> body);
  Thread(const Thread&) = delete;
  Thread& operator=(const Thread&) = delete;
  ~Thread();
  HANDLE Get() const { return handle_.Get(); }
  DWORD Id() const { return id_; }
  // Waits up to kGuardMs for the thread to end: its exit code, or kNotEnded.
  DWORD Join();

 private:
  std::unique_ptr<std::function<DWORD()>> body_;
  DWORD id_ = 0;
  Handle handle_;
};

// True when the Windows build runs under Wine (never on the host build).
bool IsWine();

// Process id that names this case's objects: the parent's id inside a child
// started by RunChildSelf, so that parent and child agree on the names.
DWORD OwnerProcessId();

// "<prefix>SkyvaneTest-<owner pid>-<Suite>.<Case>-<tag>": unique per process
// and case (Wine shares named objects across the prefix), the same in a child.
WideString UniqueName(const char* prefix, const char* tag);
// The same without the prefix, as narrow text (for registry key paths).
std::string UniqueStem(const char* tag);

// Name of the running case, "Suite.Case".
std::string CurrentTestName();

}  // namespace skytest

// Marks a case that Wine itself gets wrong: it is skipped under Wine with the
// reason and still runs against the emulation (and on Windows proper).
#define SKIP_ON_WINE(reason) \
  if (::skytest::IsWine()) GTEST_SKIP() << "known Wine gap: " << (reason)
