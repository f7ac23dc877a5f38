// The running service: status reports, the service main function and the
// control handler.
#pragma once

#include "platform/win32.h"

extern SERVICE_STATUS serviceStatus;
extern SERVICE_STATUS_HANDLE serviceStatusHandle;
// Starts at 1 with the process and only grows.
extern DWORD nextCheckPoint;

VOID WINAPI RunService(DWORD argc, LPWSTR* argv);
DWORD WINAPI ServiceControlHandler(DWORD control, DWORD eventType, LPVOID eventData,
                                   LPVOID context);
bool ReportServiceStatus(DWORD state, DWORD exitCode, DWORD waitHintMs);
