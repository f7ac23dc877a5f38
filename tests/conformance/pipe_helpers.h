// Named-pipe set-up shared by the overlapped I/O and pipe cases: a message-mode
// server instance opened for overlapped I/O, as the service's pipe server
// creates it, and plain clients.
#pragma once

#include <gtest/gtest.h>

#include <string>
#include <string_view>

#include "support/test_support.h"

namespace conformance {

using skytest::Handle;
using skytest::kGuardMs;

constexpr DWORD kPipeBufferBytes = 10920;

inline WideString PipeName(const char* tag = "pipe") {
  return skytest::UniqueName("\\\\.\\pipe\\", tag);
}

// One server instance: duplex, overlapped, message type and read mode.
inline Handle CreateServer(const WideString& name, DWORD maxInstances = 16, DWORD extraFlags = 0) {
  return Handle(CreateNamedPipeW(name.c_str(),
                                 PIPE_ACCESS_DUPLEX | FILE_FLAG_OVERLAPPED | extraFlags,
                                 PIPE_TYPE_MESSAGE | PIPE_READMODE_MESSAGE | PIPE_WAIT,
                                 maxInstances, kPipeBufferBytes, kPipeBufferBytes, 5000, nullptr));
}

// A client end, synchronous unless `overlapped`.
inline Handle OpenClient(const WideString& name, bool overlapped = false) {
  return Handle(CreateFileW(name.c_str(), GENERIC_READ | GENERIC_WRITE, 0, nullptr, OPEN_EXISTING,
                            overlapped ? FILE_FLAG_OVERLAPPED : 0, nullptr));
}

// An OVERLAPPED record with its own manual-reset event, as the service uses.
struct Overlapped {
  OVERLAPPED record{};
  Handle event;
  Overlapped() : event(CreateEventW(nullptr, TRUE, FALSE, nullptr)) { record.hEvent = event.Get(); }
  OVERLAPPED* Get() { return &record; }
  bool Signalled() const { return WaitForSingleObject(event.Get(), 0) == WAIT_OBJECT_0; }
};

// Writes one message on a synchronous (client) handle; true if all of it went.
inline bool WriteMessage(HANDLE pipe, std::string_view text) {
  DWORD written = 0;
  return WriteFile(pipe, text.data(), static_cast<DWORD>(text.size()), &written, nullptr) &&
         written == text.size();
}

// Writes one message on an overlapped handle and waits for the write; true if
// all of it went.
inline bool WriteOverlapped(HANDLE pipe, std::string_view text) {
  Overlapped write;
  DWORD written = 0;
  if (!WriteFile(pipe, text.data(), static_cast<DWORD>(text.size()), &written, write.Get()) &&
      GetLastError() != ERROR_IO_PENDING) {
    return false;
  }
  return GetOverlappedResult(pipe, write.Get(), &written, TRUE) && written == text.size();
}

// Issues an overlapped connect and returns the error it left (0 on success).
inline DWORD ConnectOverlapped(HANDLE server, Overlapped& overlapped) {
  SetLastError(0);
  if (ConnectNamedPipe(server, overlapped.Get())) return 0;
  return GetLastError();
}

}  // namespace conformance
