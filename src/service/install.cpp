// The -install and -remove verbs. Every outcome is reported on the console.
#include "service/service_host.h"

static WideString WithErrorText(WideView prefix) {
  WideString line(prefix);
  line += LastErrorText(errorText, sizeof(errorText));
  line += WSTR("\r\n");
  return line;
}

void InstallService() {
  WCHAR path[512];
  if (GetModuleFileNameW(nullptr, path, 512) == 0) {
    WideString line(WSTR("Unable to install "));
    line += SKYVANE_DISPLAY_NAME;
    ConsolePrint(WithErrorText(line + WSTR(" - ")));
    return;
  }
  // Quoted, so that a path with blanks cannot be read as a shorter program
  // followed by arguments.
  const WideString image = WideString(WSTR("\"")) + path + WSTR("\"");
  SC_HANDLE manager =
      OpenSCManagerW(nullptr, nullptr, SC_MANAGER_CONNECT | SC_MANAGER_CREATE_SERVICE);
  if (manager == nullptr) {
    ConsolePrint(WithErrorText(WSTR("OpenSCManager failed - ")));
    return;
  }
  SC_HANDLE service =
      CreateServiceW(manager, SKYVANE_SERVICE_NAME, SKYVANE_DISPLAY_NAME, SERVICE_ALL_ACCESS,
                     SERVICE_WIN32_OWN_PROCESS, SERVICE_AUTO_START, SERVICE_ERROR_NORMAL,
                     image.c_str(), nullptr, nullptr, WSTR("\0\0"), nullptr, nullptr);
  if (service == nullptr) {
    ConsolePrint(WithErrorText(WSTR("CreateService failed - ")));
    CloseServiceHandle(manager);
    return;
  }
  WCHAR description[] = SKYVANE_DESCRIPTION;
  SERVICE_DESCRIPTIONW info = {description};
  const bool described = ChangeServiceConfig2W(service, SERVICE_CONFIG_DESCRIPTION, &info) != 0;
  ConsolePrint(WideString(SKYVANE_DISPLAY_NAME) + WSTR(" installed.\r\n"));
  if (described)
    ConsolePrint(WideString(WSTR("Added description for ")) + SKYVANE_DISPLAY_NAME + WSTR(".\r\n"));
  if (StartServiceW(service, 0, nullptr)) {
    ConsolePrint(WideString(WSTR("Started service: ")) + SKYVANE_DISPLAY_NAME + WSTR("\r\n"));
  }
  CloseServiceHandle(service);
  CloseServiceHandle(manager);
}

void RemoveService() {
  SC_HANDLE manager = OpenSCManagerW(nullptr, nullptr, SC_MANAGER_CONNECT);
  if (manager == nullptr) {
    ConsolePrint(WithErrorText(WSTR("OpenSCManager failed - ")));
    return;
  }
  SC_HANDLE service =
      OpenServiceW(manager, SKYVANE_SERVICE_NAME, DELETE | SERVICE_STOP | SERVICE_QUERY_STATUS);
  if (service == nullptr) {
    ConsolePrint(WithErrorText(WSTR("OpenService failed - ")));
    CloseServiceHandle(manager);
    return;
  }
  // A record of its own: in this process the service's record is not in use,
  // and in a test the service may run in the same process.
  SERVICE_STATUS status = {};
  if (ControlService(service, SERVICE_CONTROL_STOP, &status)) {
    ConsolePrint(WideString(WSTR("Stopping ")) + SKYVANE_DISPLAY_NAME + WSTR("."));
    Sleep(1000);
    while (QueryServiceStatus(service, &status) && status.dwCurrentState == SERVICE_STOP_PENDING) {
      ConsolePrint(WSTR("."));
      Sleep(1000);
    }
    if (status.dwCurrentState == SERVICE_STOPPED) {
      ConsolePrint(WideString(WSTR("\r\n")) + SKYVANE_DISPLAY_NAME + WSTR(" stopped.\r\n"));
    } else {
      ConsolePrint(WideString(WSTR("\r\n")) + SKYVANE_DISPLAY_NAME + WSTR(" failed to stop.\r\n"));
    }
  }
  if (DeleteService(service)) {
    ConsolePrint(WideString(SKYVANE_DISPLAY_NAME) + WSTR(" removed.\r\n"));
  } else {
    ConsolePrint(WithErrorText(WSTR("DeleteService failed - ")));
  }
  CloseServiceHandle(service);
  CloseServiceHandle(manager);
}
