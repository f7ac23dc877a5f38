#include "child_process.h"

#include <cstdlib>
#include <string>
#include <vector>

#include "test_support.h"

#if !defined(_WIN32)
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

extern char** environ;
#endif

namespace skytest {

const char* ChildRole() {
  const char* role = std::getenv(kChildRoleVariable);
  return (role != nullptr && *role != '\0') ? role : nullptr;
}

// Only the host's test programs start children.
#if !defined(_WIN32)
namespace {

bool IsOwnVariable(const std::string& entry) {
  for (const char* name : {kChildRoleVariable, kOwnerPidVariable}) {
    std::string prefix = std::string(name) + "=";
    if (entry.compare(0, prefix.size(), prefix) == 0) return true;
  }
  return false;
}

}  // namespace

bool ChildProcess::Start(const char* role) {
  if (Running()) return false;
  std::string filter = "--gtest_filter=" + CurrentTestName();
  std::string self = "/proc/self/exe";
  std::vector<char*> argv = {self.data(), filter.data(), nullptr};

  std::vector<std::string> variables;
  for (char** entry = environ; *entry != nullptr; ++entry) {
    if (!IsOwnVariable(*entry)) variables.emplace_back(*entry);
  }
  variables.push_back(std::string(kChildRoleVariable) + "=" + role);
  variables.push_back(std::string(kOwnerPidVariable) + "=" + std::to_string(OwnerProcessId()));
  std::vector<char*> envp;
  for (std::string& variable : variables) envp.push_back(variable.data());
  envp.push_back(nullptr);

  pid_t pid = 0;
  if (posix_spawn(&pid, self.c_str(), nullptr, nullptr, argv.data(), envp.data()) != 0) {
    return false;
  }
  id_ = pid;
  return true;
}

int ChildProcess::Wait(DWORD timeoutMs) {
  if (!Running()) return -2;
  const pid_t pid = static_cast<pid_t>(id_);
  id_ = 0;
  int status = 0;
  // Polled in real time; a child that does not end in time is killed.
  for (DWORD waited = 0; waitpid(pid, &status, WNOHANG) != pid; waited += 2) {
    if (timeoutMs != INFINITE && waited >= timeoutMs) {
      kill(pid, SIGKILL);
      waitpid(pid, &status, 0);
      return -1;
    }
    usleep(2000);
  }
  if (WIFEXITED(status)) return WEXITSTATUS(status);
  if (WIFSIGNALED(status)) return 128 + WTERMSIG(status);
  return -1;
}

void ChildProcess::Kill() {
  if (Running()) kill(static_cast<pid_t>(id_), SIGKILL);
}

ChildProcess::~ChildProcess() {
  if (Running()) Wait(0);
}

int RunChildSelf(const char* role, DWORD timeoutMs) {
  ChildProcess child;
  if (!child.Start(role)) return -2;
  return child.Wait(timeoutMs);
}

#endif

}  // namespace skytest
