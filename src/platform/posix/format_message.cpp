// FormatMessageW for system messages: the English texts Windows gives for the
// error codes the emulation uses, each ending in "\r\n" as the system's do.
#include <cstdlib>
#include <cstring>
#include <string>

#include "platform/posix/win32_service.h"

namespace {

struct SystemMessage {
  DWORD code;
  const char16_t* text;
};

// Sorted by code.
constexpr SystemMessage kMessages[] = {
    {0, u"The operation completed successfully.\r\n"},
    {1, u"Incorrect function.\r\n"},
    {2, u"The system cannot find the file specified.\r\n"},
    {3, u"The system cannot find the path specified.\r\n"},
    {5, u"Access is denied.\r\n"},
    {6, u"The handle is invalid.\r\n"},
    {8, u"Not enough memory resources are available to process this command.\r\n"},
    {11, u"An attempt was made to load a program with an incorrect format.\r\n"},
    {13, u"The data is invalid.\r\n"},
    {14, u"Not enough memory resources are available to complete this operation.\r\n"},
    {21, u"The device is not ready.\r\n"},
    {31, u"A device attached to the system is not functioning.\r\n"},
    {32, u"The process cannot access the file because it is being used by another process.\r\n"},
    {33,
     u"The process cannot access the file because another process has locked a portion of the "
     u"file.\r\n"},
    {38, u"Reached the end of the file.\r\n"},
    {50, u"The request is not supported.\r\n"},
    {55, u"The specified network resource or device is no longer available.\r\n"},
    {80, u"The file exists.\r\n"},
    {87, u"The parameter is incorrect.\r\n"},
    {109, u"The pipe has been ended.\r\n"},
    {120, u"This function is not supported on this system.\r\n"},
    {121, u"The semaphore timeout period has expired.\r\n"},
    {122, u"The data area passed to a system call is too small.\r\n"},
    {123, u"The filename, directory name, or volume label syntax is incorrect.\r\n"},
    {124, u"The system call level is not correct.\r\n"},
    {126, u"The specified module could not be found.\r\n"},
    {127, u"The specified procedure could not be found.\r\n"},
    {131, u"An attempt was made to move the file pointer before the beginning of the file.\r\n"},
    {161, u"The specified path is invalid.\r\n"},
    {170, u"The requested resource is in use.\r\n"},
    {183, u"Cannot create a file when that file already exists.\r\n"},
    {203, u"The system could not find the environment option that was entered.\r\n"},
    {206, u"The filename or extension is too long.\r\n"},
    {230, u"The pipe state is invalid.\r\n"},
    {231, u"All pipe instances are busy.\r\n"},
    {232, u"The pipe is being closed.\r\n"},
    {233, u"No process is on the other end of the pipe.\r\n"},
    {234, u"More data is available.\r\n"},
    {258, u"The wait operation timed out.\r\n"},
    {259, u"No more data is available.\r\n"},
    {288, u"Attempt to release mutex not owned by caller.\r\n"},
    {299, u"Only part of a ReadProcessMemory or WriteProcessMemory request was completed.\r\n"},
    {317,
     u"The system cannot find message text for message number 0x%1 in the message file for "
     u"%2.\r\n"},
    {487, u"Attempt to access invalid address.\r\n"},
    {535, u"There is a process on other end of the pipe.\r\n"},
    {536, u"Waiting for a process to open the other end of the pipe.\r\n"},
    {995,
     u"The I/O operation has been aborted because of either a thread exit or an application "
     u"request.\r\n"},
    {996, u"Overlapped I/O event is not in a signaled state.\r\n"},
    {997, u"Overlapped I/O operation is in progress.\r\n"},
    {998, u"Invalid access to memory location.\r\n"},
    {1011, u"The configuration registry key could not be opened.\r\n"},
    {1012, u"The configuration registry key could not be read.\r\n"},
    {1013, u"The configuration registry key could not be written.\r\n"},
    {1015,
     u"The registry is corrupted. The structure of one of the files containing registry data "
     u"is corrupted, or the system's memory image of the file is corrupted, or the file could "
     u"not be recovered because the alternate copy or log was absent or corrupted.\r\n"},
    {1018, u"Illegal operation attempted on a registry key that has been marked for deletion.\r\n"},
    {1052, u"The requested control is not valid for this service.\r\n"},
    {1053, u"The service did not respond to the start or control request in a timely fashion.\r\n"},
    {1054, u"A thread could not be created for the service.\r\n"},
    {1056, u"An instance of the service is already running.\r\n"},
    {1057,
     u"The account name is invalid or does not exist, or the password is invalid for the "
     u"account name specified.\r\n"},
    {1058,
     u"The service cannot be started, either because it is disabled or because it has no "
     u"enabled devices associated with it.\r\n"},
    {1060, u"The specified service does not exist as an installed service.\r\n"},
    {1061, u"The service cannot accept control messages at this time.\r\n"},
    {1062, u"The service has not been started.\r\n"},
    {1063, u"The service process could not connect to the service controller.\r\n"},
    {1072, u"The specified service has been marked for deletion.\r\n"},
    {1073, u"The specified service already exists.\r\n"},
    {1132,
     u"The base address or the file offset specified does not have the proper alignment.\r\n"},
    {1167, u"The device is not connected.\r\n"},
    {1168, u"Element not found.\r\n"},
    {1305, u"The revision level is unknown.\r\n"},
    {1306, u"Indicates two revision levels are incompatible.\r\n"},
    {1336, u"The access control list (ACL) structure is invalid.\r\n"},
    {1337, u"The security ID structure is invalid.\r\n"},
    {1344, u"No more memory is available for security information updates.\r\n"},
    {1460, u"This operation returned because the timeout period expired.\r\n"},
    {1784, u"The supplied user buffer is not valid for the requested operation.\r\n"},
    {1804, u"The specified datatype is invalid.\r\n"},
    {1816, u"Not enough quota is available to process this command.\r\n"},
};

const char16_t* FindMessage(DWORD code) {
  std::size_t low = 0;
  std::size_t high = sizeof kMessages / sizeof kMessages[0];
  while (low < high) {
    std::size_t middle = (low + high) / 2;
    if (kMessages[middle].code == code) return kMessages[middle].text;
    if (kMessages[middle].code < code) {
      low = middle + 1;
    } else {
      high = middle;
    }
  }
  return nullptr;
}

constexpr bool SortedByCode() {
  for (std::size_t i = 1; i < sizeof kMessages / sizeof kMessages[0]; ++i) {
    if (kMessages[i - 1].code >= kMessages[i].code) return false;
  }
  return true;
}
static_assert(SortedByCode(), "the message table is searched by halving");

}  // namespace

DWORD FormatMessageW(DWORD flags, LPCVOID source, DWORD messageId, DWORD languageId, LPWSTR buffer,
                     DWORD size, va_list* arguments) {
  (void)source;
  (void)languageId;
  (void)arguments;
  // Only the system table is kept; messages from strings or modules are not.
  if ((flags & FORMAT_MESSAGE_FROM_SYSTEM) == 0 ||
      (flags & (FORMAT_MESSAGE_FROM_STRING | FORMAT_MESSAGE_FROM_HMODULE)) != 0) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return 0;
  }
  if (buffer == nullptr) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return 0;
  }
  const char16_t* text = FindMessage(messageId);
  if (text == nullptr) {
    SetLastError(ERROR_MR_MID_NOT_FOUND);
    return 0;
  }
  std::size_t length = std::char_traits<char16_t>::length(text);
  if ((flags & FORMAT_MESSAGE_ALLOCATE_BUFFER) != 0) {
    // `buffer` receives a pointer to a block freed with LocalFree; `size`
    // is the least number of characters to allocate.
    std::size_t units = length + 1 > size ? length + 1 : size;
    auto* block = static_cast<WCHAR*>(std::malloc(units * sizeof(WCHAR)));
    if (block == nullptr) {
      SetLastError(ERROR_NOT_ENOUGH_MEMORY);
      return 0;
    }
    std::memcpy(block, text, (length + 1) * sizeof(WCHAR));
    *reinterpret_cast<LPWSTR*>(buffer) = block;
    return static_cast<DWORD>(length);
  }
  if (size < length + 1) {
    SetLastError(ERROR_INSUFFICIENT_BUFFER);
    return 0;
  }
  std::memcpy(buffer, text, (length + 1) * sizeof(WCHAR));
  return static_cast<DWORD>(length);
}
