// The -debug verb: the monitor in the foreground, stopped with Ctrl+C.
#include "monitor/monitor_state.h"
#include "monitor/stop_request.h"
#include "service/service_host.h"

void CmdDebugService() {
  int argc = 0;
  LPWSTR* argv = CommandLineToArgvW(GetCommandLineW(), &argc);
  if (argv == nullptr) {
    ConsolePrint(WSTR("CmdDebugService CommandLineToArgvW returned NULL\r\n"));
    return;
  }
  ConsolePrint(WideString(WSTR("Debugging ")) + SKYVANE_DISPLAY_NAME + WSTR(".\r\n"));
  // Only a Ctrl+C from now on counts; one that comes before the monitor's
  // events exist is kept for it.
  monitorStopRequested = false;
  SetConsoleCtrlHandler(ConsoleControlHandler, TRUE);
  RunMonitor(argc, argv);
  LocalFree(argv);
}

BOOL WINAPI ConsoleControlHandler(DWORD controlType) {
  if (controlType != CTRL_C_EVENT && controlType != CTRL_BREAK_EVENT) return FALSE;
  ConsolePrint(WideString(WSTR("Stopping ")) + SKYVANE_DISPLAY_NAME + WSTR(".\r\n"));
  StopMonitor();
  return TRUE;
}
