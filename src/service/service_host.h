// The service host: identity, process-wide flags, the verbs and the service
// main function with its control handler.
#pragma once

#include "platform/wide.h"
#include "platform/win32.h"

#define SKYVANE_SERVICE_NAME WSTR("SkyvaneSvc")
#define SKYVANE_DISPLAY_NAME WSTR("Skyvane Service")
#define SKYVANE_DESCRIPTION WSTR("This service supports the Skyvane application.")

// Set once when the process runs with -debug: no status reports and no
// event-log writes while it is set.
extern bool debugMode;
// The last error recorded by LogServiceError; the stopped report's exit code.
extern DWORD lastError;
// The most recent console error text built by LastErrorText.
extern WCHAR errorText[128];

// The process entry behind wmain/main: verbs, usage lines, the dispatcher.
int ServiceEntry(int argc, LPWSTR* argv);

enum class Verb { None, Install, Remove, Debug };
// The verb of the first argument: "-" or "/" followed by install, remove or
// debug in any case; anything else is Verb::None.
Verb ParseVerb(int argc, LPWSTR* argv);

void InstallService();
void RemoveService();
void CmdDebugService();
BOOL WINAPI ConsoleControlHandler(DWORD controlType);

// Fills buffer with "<system text> (0x<code>)" for the thread's last error,
// or the empty string; returns buffer.
LPWSTR LastErrorText(LPWSTR buffer, DWORD bufferSizeInBytes);
// Records the last error and writes one error event for the service.
void LogServiceError(LPCWSTR message);

// Writes UTF-16 text to standard output.
void ConsolePrint(WideView text);
