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
#include <fstream>
#include <sstream>
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

double ServiceProcess::CpuMicros() const {
  std::ifstream stat("/proc/" + std::to_string(id_) + "/stat");
  std::string text((std::istreambuf_iterator<char>(stat)), std::istreambuf_iterator<char>());
  std::size_t close = text.rfind(')');
  if (close == std::string::npos) return -1;
  std::istringstream fields(text.substr(close + 2));
  std::string field;
  double ticks = 0;
  for (int index = 3; fields >> field; ++index) {
    if (index == 14 || index == 15) ticks += std::stod(field);
    if (index == 15) break;
  }
  return ticks * 1e6 / static_cast<double>(sysconf(_SC_CLK_TCK));
}

double ServiceProcess::ResidentKiB() const {
  std::ifstream status("/proc/" + std::to_string(id_) + "/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind("VmRSS:", 0) == 0) return std::stod(line.substr(6));
  }
  return -1;
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
