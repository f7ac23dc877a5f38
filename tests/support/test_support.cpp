#include "test_support.h"

#include <cstdlib>

#include "child_process.h"
#include "platform/diagnostics.h"

namespace skytest {

namespace {
DWORD WINAPI RunBody(LPVOID body) {
  return (*static_cast<std::function<DWORD()>*>(body))();
}
}  // namespace

Thread::Thread(std::function<DWORD()> body)
    : body_(std::make_unique<std::function<DWORD()>>(std::move(body))),
      handle_(CreateThread(nullptr, 0, RunBody, body_.get(), 0, &id_)) {
  EXPECT_TRUE(handle_) << "CreateThread failed";
}

// The body must outlive the thread, so a thread that did not end is waited
// for without limit (a hang then ends through the test's time-out).
Thread::~Thread() {
  if (handle_) WaitForSingleObject(handle_.Get(), INFINITE);
}

DWORD Thread::Join() {
  DWORD code = kNotEnded;
  if (handle_ && WaitForSingleObject(handle_.Get(), kGuardMs) == WAIT_OBJECT_0) {
    GetExitCodeThread(handle_.Get(), &code);
  }
  return code;
}

DWORD ScaledGuardMs() {
  constexpr double kRealMs = 10000.0;
  double scale = platform::TimeScale();
  if (!(scale > 0.0)) return static_cast<DWORD>(kRealMs);
  double scaled = kRealMs / scale;
  return scaled >= 4.0e9 ? INFINITE - 1 : static_cast<DWORD>(scaled);
}

bool IsWine() {
#if defined(_WIN32)
  static const bool wine = [] {
    HMODULE ntdll = GetModuleHandleW(WSTR("ntdll.dll"));
    return ntdll != nullptr && GetProcAddress(ntdll, "wine_get_version") != nullptr;
  }();
  return wine;
#else
  return false;
#endif
}

DWORD OwnerProcessId() {
  const char* owner = std::getenv(kOwnerPidVariable);
  if (owner != nullptr && *owner != '\0') {
    return static_cast<DWORD>(std::strtoul(owner, nullptr, 10));
  }
  return GetCurrentProcessId();
}

std::string CurrentTestName() {
  const ::testing::TestInfo* info = ::testing::UnitTest::GetInstance()->current_test_info();
  if (info == nullptr) return "none";
  return std::string(info->test_suite_name()) + "." + info->name();
}

std::string UniqueStem(const char* tag) {
  return "SkyvaneTest-" + std::to_string(OwnerProcessId()) + "-" + CurrentTestName() + "-" + tag;
}

WideString UniqueName(const char* prefix, const char* tag) {
  return Utf8ToWide(std::string(prefix) + UniqueStem(tag));
}

}  // namespace skytest
