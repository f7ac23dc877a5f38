// The control channel of a running simulated machine: a named pipe of the
// emulation namespace that the machine's process serves (see
// control_server.h), and the one exchange a client makes over it.
//
// A request is one message: the verb and its arguments separated by NUL
// bytes ("press\0gauge\0eject"). The reply is one message: "ok\n" followed
// by the verb's output, or "error\n" followed by a one-line reason.
#pragma once

#include <string>
#include <vector>

#include "pipe/pipe_client.h"
#include "platform/win32.h"

namespace sim {

#define SKYVANE_SIM_PIPE_NAME WSTR("\\\\.\\pipe\\SkyvaneSimControl")
inline constexpr const WCHAR* kControlPipeName = SKYVANE_SIM_PIPE_NAME;
inline constexpr DWORD kControlMessageMax = 64 * 1024;

inline std::string JoinRequest(const std::vector<std::string>& words) {
  std::string message;
  for (std::size_t i = 0; i < words.size(); ++i) {
    if (i != 0) message += '\0';
    message += words[i];
  }
  return message;
}

inline std::vector<std::string> SplitRequest(const std::string& message) {
  std::vector<std::string> words(1);
  for (const char c : message) {
    if (c == '\0') {
      words.emplace_back();
    } else {
      words.back() += c;
    }
  }
  return words;
}

// Sends one request and reads the reply. False (with *error set to the
// Win32 error) when no machine serves the channel or the exchange fails.
inline bool ControlExchange(const std::vector<std::string>& words, std::string* reply,
                            DWORD* error) {
  const std::string request = JoinRequest(words);
  if (request.size() > kControlMessageMax) {
    *error = ERROR_INVALID_DATA;
    return false;
  }
  const HANDLE pipe = OpenMessagePipe(kControlPipeName, 5000);
  if (pipe == INVALID_HANDLE_VALUE) {
    *error = GetLastError();
    return false;
  }
  std::vector<char> buffer(kControlMessageMax);
  DWORD received = 0;
  const bool ok = ExchangeCommand(pipe, request.data(), static_cast<DWORD>(request.size()),
                                  buffer.data(), kControlMessageMax, &received);
  *error = ok ? 0 : GetLastError();
  CloseHandle(pipe);
  if (ok) reply->assign(buffer.data(), received);
  return ok;
}

}  // namespace sim
