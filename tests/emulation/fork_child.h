// A forked child of the test program for cross-process cases: it runs a few
// Win32 calls and leaves with _exit (no gtest in the child).
#pragma once

#include <sys/wait.h>
#include <unistd.h>

// Runs `body` in a child process; returns its pid. The child's exit code is
// the body's result.
template <class Body>
pid_t Fork(Body body) {
  pid_t pid = fork();
  if (pid == 0) _exit(body());
  return pid;
}

// The child's exit code, or 128 + the signal that ended it.
inline int ExitCodeOf(pid_t pid) {
  int status = 0;
  if (waitpid(pid, &status, 0) != pid) return -1;
  return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}
