// Cross-process cases: the test program starts ITSELF again, filtered to the
// running case, with a role in the environment, so one case body holds both
// sides. The child inherits the whole environment, including the emulation's
// namespace and registry store, so it shares the parent's named objects.
//
//   TEST(Shared, Mapping) {
//     if (skytest::ChildRole() != nullptr) { ...child side...; return; }
//     ...parent side...;
//     EXPECT_EQ(skytest::RunChildSelf("reader", skytest::kProcessGuardMs), 0);
//   }
//
// The child's exit code is 0 only when exactly that one case ran and passed.
// Host only: the Windows build declares these but never starts a child.
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

  // Starts this program again for the running case with `role`; false if the
  // process could not be started.
  bool Start(const char* role);
  // Waits up to `timeoutMs` (real time) for the child to end and returns its
  // exit code; on time-out the child is killed and -1 is returned.
  int Wait(DWORD timeoutMs);
  // Ends the child at once; Wait then gives 128 + 9 on POSIX.
  void Kill();
  bool Running() const { return id_ != 0; }

 private:
  std::intptr_t id_ = 0;  // process handle on Windows, pid elsewhere
};

// Start + Wait: the child's exit code, -1 on time-out, -2 if it did not start.
int RunChildSelf(const char* role, DWORD timeoutMs);

// At the top of a case: in the child of `role`, runs `body` and ends the
// process with its result, without gtest's checks (a child may end holding
// handles on purpose, or be killed).
template <class Body>
void RunAsChild(const char* role, Body body) {
  const char* current = ChildRole();
  if (current != nullptr && std::strcmp(current, role) == 0) std::_Exit(body());
}

}  // namespace skytest
