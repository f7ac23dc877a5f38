// The client side of the command channel, as the user-interface application
// uses it: open the pipe, exchange one message, lay out a registry request.
// Used by the command-line client and the tests; the service does not call it.
// Header-only, so that a client needs nothing but the platform layer.
//
// OpenMessagePipe(name, busyWaitMs): opens the pipe for reading and writing
//   in message mode, letting the server identify the caller but not
//   impersonate it; while every instance is busy it waits up to busyWaitMs
//   for one to free up. INVALID_HANDLE_VALUE (last error set) on failure.
// OpenCommandPipe(busyWaitMs): the same for "\\.\pipe\QxSvcPipe".
// ExchangeCommand: writes `length` bytes of `request` as one message and reads
//   the reply message into reply[capacity]. False (last error set) when either
//   fails; an empty reply is a success with *replyLength 0.
// InitCommand: a request of the full length with every other byte zero.
// LayOutRegistryRequest: fills the registry request of a command 13 message:
//   path and name terminated one after the other, the data area right after
//   the name, of dataLength bytes (copied from `data` when not null). False
//   when they do not fit in the message.
// RegistryData: the data area of a registry request laid out so.
// RootKeyValue: the 64-bit value of a predefined root key as requests carry it.
#pragma once

#include <cstdint>
#include <cstring>

#include "pipe/command_message.h"
#include "pipe/pipe_name.h"
#include "platform/wide.h"
#include "platform/win32.h"

// Quality of service for the open: whoever serves the name may identify the
// client but never impersonate it (SECURITY_SQOS_PRESENT |
// SECURITY_IDENTIFICATION, as the system headers define them).
inline constexpr DWORD kPipeClientSecurityFlags = 0x00100000 | 0x00010000;

inline HANDLE OpenMessagePipe(const WCHAR* name, DWORD busyWaitMs) {
  for (int attempt = 0; attempt < 2; ++attempt) {
    HANDLE pipe = CreateFileW(name, GENERIC_READ | GENERIC_WRITE, 0, nullptr, OPEN_EXISTING,
                              kPipeClientSecurityFlags, nullptr);
    if (pipe != INVALID_HANDLE_VALUE) {
      DWORD mode = PIPE_READMODE_MESSAGE;
      if (!SetNamedPipeHandleState(pipe, &mode, nullptr, nullptr)) {
        const DWORD error = GetLastError();
        CloseHandle(pipe);
        SetLastError(error);
        return INVALID_HANDLE_VALUE;
      }
      return pipe;
    }
    if (GetLastError() != ERROR_PIPE_BUSY || attempt == 1) break;
    if (!WaitNamedPipeW(name, busyWaitMs)) break;
  }
  return INVALID_HANDLE_VALUE;
}

inline HANDLE OpenCommandPipe(DWORD busyWaitMs) {
  return OpenMessagePipe(kPipeName, busyWaitMs);
}

inline bool ExchangeCommand(HANDLE pipe, const void* request, DWORD length, void* reply,
                            DWORD capacity, DWORD* replyLength) {
  *replyLength = 0;
  DWORD written = 0;
  if (!WriteFile(pipe, request, length, &written, nullptr)) return false;
  return ReadFile(pipe, reply, capacity, replyLength, nullptr) != 0;
}

inline void InitCommand(CommandMessage* message, DWORD command, DWORD arg1 = 0, DWORD arg2 = 0,
                        DWORD arg3 = 0) {
  std::memset(static_cast<void*>(message), 0, sizeof(*message));
  message->length = sizeof(*message);
  message->command = command;
  message->arg1 = arg1;
  message->arg2 = arg2;
  message->arg3 = arg3;
}

inline bool LayOutRegistryRequest(CommandMessage* message, std::uint64_t rootKey, const WCHAR* path,
                                  const WCHAR* name, DWORD operation, DWORD valueType,
                                  const void* data, DWORD dataLength) {
  const std::size_t pathBytes = (WideLength(path) + 1) * sizeof(WCHAR);
  const std::size_t nameBytes = (WideLength(name) + 1) * sizeof(WCHAR);
  const std::size_t room = sizeof(message->registryText);
  if (pathBytes > room || nameBytes > room - pathBytes ||
      dataLength > room - pathBytes - nameBytes) {
    return false;
  }
  RegistryRequest& request = message->registry;
  request.rootKey = rootKey;
  request.nameOffset = pathBytes;
  request.dataOffset = nameBytes;
  request.dataLength = dataLength;
  request.dataLengthHigh = 0;
  request.valueType = valueType;
  request.operation = operation;
  BYTE* text = message->registryText;
  std::memcpy(text, path, pathBytes);
  std::memcpy(text + pathBytes, name, nameBytes);
  if (data != nullptr) std::memcpy(text + pathBytes + nameBytes, data, dataLength);
  return true;
}

inline BYTE* RegistryData(CommandMessage* message) {
  const RegistryRequest& request = message->registry;
  return message->registryText + request.nameOffset + request.dataOffset;
}

inline std::uint64_t RootKeyValue(HKEY root) {
  return static_cast<std::uint64_t>(reinterpret_cast<std::uintptr_t>(root));
}
