// Cross-process cases: the test program starts itself again, filtered to the
// running case, with a role in the environment (and the parent's emulation
// namespace), so one case body holds both sides. Host only.
#pragma once

#include <cstdint>
#include <cstdlib>
#include <cstring>

#include "platform/win32.h"

namespace skytest {

inline constexpr const char* kChildRoleVariable = "SKYVANE_TEST_CHILD";
inline constexpr const char* kOwnerPidVariable = "SKYVANE_TEST_OWNER_PID";

// The role this process was started with, or nullptr in a normal run.
const char* ChildRole();

// A running child; killed and reaped if it is destroyed before being waited for.
class ChildProcess {
 public:
  ChildProcess() = default;
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;
  ~ChildProcess();

  // Starts this program again for the running case with `role`.
  bool Start(const char* role);
  // The child's exit code; on time-out (real time) it is killed and -1 returned.
  int Wait(DWORD timeoutMs);
  // Ends the child at once; Wait then gives 128 + 9 on POSIX.
  void Kill();
  bool Running() const { return id_ != 0; }

 private:
  std::intptr_t id_ = 0;  // process handle on Windows, pid elsewhere
};

// Start + Wait: the child's exit code, -1 on time-out, -2 if it did not start.
int RunChildSelf(const char* role, DWORD timeoutMs);

// In the child of `role`, runs `body` and exits with its result, skipping
// gtest's leak checks (a child may end holding handles on purpose).
template <class Body>
void RunAsChild(const char* role, Body body) {
  const char* current = ChildRole();
  if (current != nullptr && std::strcmp(current, role) == 0) std::_Exit(body());
}

}  // namespace skytest
