// Console error texts and event-log error reports.
#include <cstdio>

#include "service/service_host.h"

bool debugMode = false;
DWORD lastError = 0;
WCHAR errorText[128];

// Line breaks are written as "\n" so that the C library's text mode gives
// the platform's own line ending.
void ConsolePrint(WideView text) {
  std::string utf8 = WideToUtf8(text);
  for (std::size_t at = utf8.find("\r\n"); at != std::string::npos; at = utf8.find("\r\n", at))
    utf8.erase(at, 1);
  std::fwrite(utf8.data(), 1, utf8.size(), stdout);
  std::fflush(stdout);
}

LPWSTR LastErrorText(LPWSTR buffer, DWORD bufferSizeInBytes) {
  const DWORD error = GetLastError();
  const std::size_t capacity = bufferSizeInBytes / sizeof(WCHAR);
  if (capacity == 0) return buffer;
  buffer[0] = 0;
  LPWSTR systemText = nullptr;
  const DWORD length = FormatMessageW(
      FORMAT_MESSAGE_ALLOCATE_BUFFER | FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS,
      nullptr, error, MAKELANGID(LANG_NEUTRAL, SUBLANG_DEFAULT),
      reinterpret_cast<LPWSTR>(&systemText), 0, nullptr);
  if (systemText != nullptr && length > 0 && length + 14 <= bufferSizeInBytes) {
    // Drop the line break that ends every system message (only line-break
    // characters, so a text without one is not cut).
    std::size_t kept = length;
    for (int i = 0;
         i < 2 && kept > 0 && (systemText[kept - 1] == '\r' || systemText[kept - 1] == '\n'); ++i)
      --kept;
    WideString text(systemText, kept);
    text += WSTR(" (0x");
    WideAppendHex(text, error, 1, false);
    text += WSTR(")");
    WideCopy(buffer, capacity, WideView(text));
  }
  if (systemText != nullptr) LocalFree(systemText);
  return buffer;
}

void LogServiceError(LPCWSTR message) {
  if (debugMode) return;
  lastError = GetLastError();
  HANDLE source = RegisterEventSourceW(nullptr, SKYVANE_SERVICE_NAME);
  WCHAR line[112];
  WideString text(SKYVANE_SERVICE_NAME);
  text += WSTR(" error: ");
  WideAppendDecimal(text, static_cast<std::int32_t>(lastError));
  WideCopy(line, 112, WideView(text));
  if (source != nullptr) {
    LPCWSTR strings[2] = {line, message};
    ReportEventW(source, EVENTLOG_ERROR_TYPE, 0, 0, nullptr, 2, 0, strings, nullptr);
    DeregisterEventSource(source);
  }
}
