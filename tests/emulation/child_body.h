// Cross-process cases of the emulation: the other process is this test
// program started again for the running case with a role. RunAsChild, at
// the top of a case, runs the child's body in that process and ends the
// process with the body's result, without gtest's checks of the child (a
// child may end holding handles on purpose, or be killed).
#pragma once

#include <cstdlib>
#include <cstring>

#include "support/child_process.h"
#include "support/test_support.h"

template <class Body>
void RunAsChild(const char* role, Body body) {
  const char* current = skytest::ChildRole();
  if (current != nullptr && std::strcmp(current, role) == 0) std::_Exit(body());
}

// Starts the child of `role` and waits for its exit code (-1 on time-out).
inline int RunChild(const char* role) {
  return skytest::RunChildSelf(role, skytest::kProcessGuardMs);
}
