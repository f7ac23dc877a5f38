#include "service_process.h"

#include <cstring>
#include <vector>

#include "figures.h"
#include "monitor/state_block.h"
#include "platform/wide.h"
#include "platform/win32.h"

#if defined(_WIN32)
#include <psapi.h>
#else
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
extern char** environ;
#endif

namespace bench {

bool ServiceProcess::WaitForStatus(std::uint32_t statusWord, std::uint32_t timeoutMs) const {
  const double deadline = NowMicros() + timeoutMs * 1000.0;
  while (NowMicros() < deadline) {
    HANDLE mapping = OpenFileMappingW(FILE_MAP_READ, FALSE, WSTR("Global\\SkyvaneFileMap"));
    if (mapping != nullptr) {
      const void* view = MapViewOfFile(mapping, FILE_MAP_READ, 0, 0, sizeof(StateBlock));
      std::uint32_t current = 0;
      if (view != nullptr) {
        std::memcpy(&current, static_cast<const char*>(view) + offsetof(StateBlock, statusWord),
                    sizeof(current));
        UnmapViewOfFile(view);
      }
      CloseHandle(mapping);
      if (current == statusWord) return true;
    }
    Sleep(20);
  }
  return false;
}

#if defined(_WIN32)

bool ServiceProcess::Start(const std::string& path) {
  WideString wide = Utf8ToWide(path);
  WideString commandLine = WSTR("\"") + wide + WSTR("\" -debug");
  STARTUPINFOW startup{};
  startup.cb = sizeof(startup);
  PROCESS_INFORMATION info{};
  if (!CreateProcessW(wide.c_str(), commandLine.data(), nullptr, nullptr, FALSE,
                      CREATE_NEW_PROCESS_GROUP, nullptr, nullptr, &startup, &info)) {
    return false;
  }
  CloseHandle(info.hThread);
  id_ = reinterpret_cast<std::intptr_t>(info.hProcess);
  return true;
}

double ServiceProcess::CpuMicros() const {
  FILETIME created, exited, kernel, user;
  if (!GetProcessTimes(reinterpret_cast<HANDLE>(id_), &created, &exited, &kernel, &user)) return -1;
  auto value = [](const FILETIME& t) {
    return static_cast<double>((static_cast<std::uint64_t>(t.dwHighDateTime) << 32) |
                               t.dwLowDateTime);
  };
  return (value(kernel) + value(user)) / 10.0;
}

double ServiceProcess::ResidentKiB() const {
  PROCESS_MEMORY_COUNTERS counters{};
  if (!K32GetProcessMemoryInfo(reinterpret_cast<HANDLE>(id_), &counters, sizeof(counters))) {
    return -1;
  }
  return static_cast<double>(counters.WorkingSetSize) / 1024.0;
}

void ServiceProcess::Stop() {
  if (id_ == 0) return;
  HANDLE process = reinterpret_cast<HANDLE>(id_);
  GenerateConsoleCtrlEvent(CTRL_BREAK_EVENT, GetProcessId(process));
  if (WaitForSingleObject(process, 10000) != WAIT_OBJECT_0) TerminateProcess(process, 1);
  CloseHandle(process);
  id_ = 0;
}

#else

bool ServiceProcess::Start(const std::string& path) {
  std::string self = path;
  std::string verb = "-debug";
  char* argv[] = {self.data(), verb.data(), nullptr};
  pid_t pid = 0;
  if (posix_spawn(&pid, path.c_str(), nullptr, nullptr, argv, environ) != 0) return false;
  id_ = pid;
  return true;
}

// The text of /proc/<pid>/<name> (empty when it cannot be read).
std::string ProcText(std::intptr_t pid, const char* name) {
  std::string path = "/proc/" + std::to_string(pid) + "/" + name;
  std::string text;
  if (FILE* file = std::fopen(path.c_str(), "re")) {
    char buffer[4096];
    std::size_t got;
    while ((got = std::fread(buffer, 1, sizeof(buffer), file)) > 0) text.append(buffer, got);
    std::fclose(file);
  }
  return text;
}

double ServiceProcess::CpuMicros() const {
  const std::string text = ProcText(id_, "stat");
  const std::size_t close = text.rfind(')');
  if (close == std::string::npos) return -1;
  // Fields 14 and 15 (user and system time in clock ticks), counted from the
  // state field, which is field 3.
  unsigned long long user = 0;
  unsigned long long system = 0;
  if (std::sscanf(text.c_str() + close + 2,
                  "%*c %*d %*d %*d %*d %*d %*u %*u %*u %*u %*u %llu %llu", &user, &system) != 2) {
    return -1;
  }
  return static_cast<double>(user + system) * 1e6 / static_cast<double>(sysconf(_SC_CLK_TCK));
}

double ServiceProcess::ResidentKiB() const {
  const std::string text = ProcText(id_, "status");
  const std::size_t at = text.find("VmRSS:");
  if (at == std::string::npos) return -1;
  return std::strtod(text.c_str() + at + 6, nullptr);
}

void ServiceProcess::Stop() {
  if (id_ == 0) return;
  auto pid = static_cast<pid_t>(id_);
  kill(pid, SIGINT);
  int status = 0;
  waitpid(pid, &status, 0);
  id_ = 0;
}

#endif

}  // namespace bench
