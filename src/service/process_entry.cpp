// Process entry: the process-wide locks, the three verbs, and otherwise the
// hand-over to the service control manager.
#include "service/process_locks.h"
#include "service/service_host.h"
#include "service/service_main.h"

Verb ParseVerb(int argc, LPWSTR* argv) {
  if (argc < 2 || argv[1] == nullptr) return Verb::None;
  const WCHAR* word = argv[1];
  if (word[0] != '-' && word[0] != '/') return Verb::None;
  if (WideEqualNoCase(word + 1, WSTR("install"))) return Verb::Install;
  if (WideEqualNoCase(word + 1, WSTR("remove"))) return Verb::Remove;
  if (WideEqualNoCase(word + 1, WSTR("debug"))) return Verb::Debug;
  return Verb::None;
}

static void PrintUsage() {
  const WideView name = SKYVANE_SERVICE_NAME;
  ConsolePrint(WideString(name) + WSTR(" -install          to install the service\r\n"));
  ConsolePrint(WideString(name) + WSTR(" -remove           to remove the service\r\n"));
  ConsolePrint(WideString(name) +
               WSTR(" -debug <params>   to run as a console app for debugging\r\n"));
  ConsolePrint(WSTR("\r\nStartServiceCtrlDispatcher being called.\r\n"));
  ConsolePrint(WSTR("This may take several seconds.  Please wait.\r\n"));
}

int ServiceEntry(int argc, LPWSTR* argv) {
  InitializeProcessLocks();
  switch (ParseVerb(argc, argv)) {
    case Verb::Install:
      InstallService();
      return 0;
    case Verb::Remove:
      RemoveService();
      return 0;
    case Verb::Debug:
      debugMode = true;
      CmdDebugService();
      return 0;
    case Verb::None:
      break;
  }
  PrintUsage();
  WCHAR serviceName[] = SKYVANE_SERVICE_NAME;
  SERVICE_TABLE_ENTRYW table[] = {{serviceName, RunService}, {nullptr, nullptr}};
  if (!StartServiceCtrlDispatcherW(table))
    LogServiceError(WSTR("StartServiceCtrlDispatcher failed."));
  return 0;
}
