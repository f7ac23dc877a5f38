// The application event log: sources are checked handles, every reported
// event is kept in this process for tests and, when env SKYVANE_EVENTLOG
// names a file, appended to it as one line:
//   <UTC time> <TAB> <pid> <TAB> <source> <TAB> <type> <TAB> <category>
//   <TAB> <event id> [<TAB> <insertion string>]...
// with TAB, CR, LF and backslash inside the texts written as \t \r \n \\.
#include <errno.h>
#include <fcntl.h>
#include <unistd.h>

#include <cstdlib>
#include <ctime>
#include <memory>
#include <mutex>
#include <string>

#include "platform/posix/emu_scm.h"
#include "platform/posix/handle_table.h"
#include "platform/posix/win32_service.h"
#include "platform/wide.h"

namespace emu::eventlog {
namespace {

class Source : public KernelObject {
 public:
  explicit Source(std::u16string sourceName) : name(std::move(sourceName)) {}
  bool ClosableByCloseHandle() const override { return false; }
  const std::u16string name;
};

struct Log {
  std::mutex lock;
  std::vector<EventLogEntry> entries;
  DWORD failRegisterError = 0;
};

Log& L() {
  static Log* log = new Log();
  return *log;
}

const char* TypeName(WORD type) {
  switch (type) {
    case EVENTLOG_SUCCESS:
      return "SUCCESS";
    case EVENTLOG_ERROR_TYPE:
      return "ERROR";
    case EVENTLOG_WARNING_TYPE:
      return "WARNING";
    case EVENTLOG_INFORMATION_TYPE:
      return "INFORMATION";
    case EVENTLOG_AUDIT_SUCCESS:
      return "AUDIT_SUCCESS";
    case EVENTLOG_AUDIT_FAILURE:
      return "AUDIT_FAILURE";
    default:
      return nullptr;
  }
}

void AppendField(std::string& line, const std::u16string& text) {
  line += '\t';
  for (char c : WideToUtf8(text)) {
    switch (c) {
      case '\t':
        line += "\\t";
        break;
      case '\r':
        line += "\\r";
        break;
      case '\n':
        line += "\\n";
        break;
      case '\\':
        line += "\\\\";
        break;
      default:
        line += c;
    }
  }
}

void AppendToFile(const EventLogEntry& entry) {
  const char* path = std::getenv("SKYVANE_EVENTLOG");
  if (path == nullptr || path[0] == '\0') return;
  std::time_t now = std::time(nullptr);
  std::tm utc{};
  gmtime_r(&now, &utc);
  char stamp[32];
  std::strftime(stamp, sizeof stamp, "%Y-%m-%dT%H:%M:%SZ", &utc);
  std::string line = stamp;
  line += '\t' + std::to_string(getpid());
  AppendField(line, entry.source);
  line += '\t';
  line += TypeName(entry.type);
  line += '\t' + std::to_string(entry.category) + '\t' + std::to_string(entry.eventId);
  for (const auto& text : entry.strings) AppendField(line, text);
  line += '\n';
  // One write of the whole line with O_APPEND keeps lines of several
  // processes whole.
  int fd = open(path, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
  if (fd < 0) return;
  while (write(fd, line.data(), line.size()) < 0 && errno == EINTR) {
  }
  close(fd);
}

}  // namespace
}  // namespace emu::eventlog

using emu::eventlog::L;

HANDLE RegisterEventSourceW(LPCWSTR serverName, LPCWSTR sourceName) {
  (void)serverName;
  if (sourceName == nullptr) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return nullptr;
  }
  {
    std::lock_guard<std::mutex> guard(L().lock);
    if (L().failRegisterError != 0) {
      SetLastError(L().failRegisterError);
      return nullptr;
    }
  }
  return emu::AllocateHandle(std::make_shared<emu::eventlog::Source>(sourceName));
}

BOOL ReportEventW(HANDLE eventLog, WORD type, WORD category, DWORD eventId, PSID userSid,
                  WORD stringCount, DWORD dataSize, LPCWSTR* strings, LPVOID rawData) {
  (void)userSid;
  auto source = emu::LookupHandleAs<emu::eventlog::Source>(eventLog);
  if (source == nullptr) {
    SetLastError(ERROR_INVALID_HANDLE);
    return FALSE;
  }
  if (emu::eventlog::TypeName(type) == nullptr || (stringCount != 0 && strings == nullptr) ||
      (dataSize != 0 && rawData == nullptr)) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return FALSE;
  }
  emu::EventLogEntry entry;
  entry.source = source->name;
  entry.type = type;
  entry.category = category;
  entry.eventId = eventId;
  for (WORD i = 0; i < stringCount; ++i) {
    if (strings[i] == nullptr) {
      SetLastError(ERROR_INVALID_PARAMETER);
      return FALSE;
    }
    entry.strings.emplace_back(strings[i]);
  }
  const auto* bytes = static_cast<const BYTE*>(rawData);
  if (dataSize != 0) entry.data.assign(bytes, bytes + dataSize);
  emu::eventlog::AppendToFile(entry);
  std::lock_guard<std::mutex> guard(L().lock);
  L().entries.push_back(std::move(entry));
  return TRUE;
}

BOOL DeregisterEventSource(HANDLE eventLog) {
  if (emu::LookupHandleAs<emu::eventlog::Source>(eventLog) == nullptr ||
      !emu::ReleaseHandle(eventLog)) {
    SetLastError(ERROR_INVALID_HANDLE);
    return FALSE;
  }
  return TRUE;
}

namespace emu {

std::vector<EventLogEntry> EventLogEntries() {
  std::lock_guard<std::mutex> guard(L().lock);
  return L().entries;
}

void ClearEventLog() {
  std::lock_guard<std::mutex> guard(L().lock);
  L().entries.clear();
}

void FailRegisterEventSource(DWORD error) {
  std::lock_guard<std::mutex> guard(L().lock);
  L().failRegisterError = error;
}

}  // namespace emu
