// Service control manager, event log, device notifications, console control
// and system message texts for the POSIX emulation. Values and layouts are
// those of the Windows SDK (64-bit).
//
// The manager is an in-process stand-in: the dispatcher connects only while a
// test has opened a session (platform/posix/emu_scm.h); otherwise it fails
// with ERROR_FAILED_SERVICE_CONTROLLER_CONNECT as a console start does on
// Windows. Installed services are kept in the registry store under
// HKLM\SYSTEM\CurrentControlSet\Services\<name>.
#pragma once

#include <cstdarg>

#include "platform/posix/win32_base.h"

// ---- Service control manager ----------------------------------------------
struct SC_HANDLE__;
using SC_HANDLE = SC_HANDLE__*;
using LPSC_HANDLE = SC_HANDLE*;
struct SERVICE_STATUS_HANDLE__;
using SERVICE_STATUS_HANDLE = SERVICE_STATUS_HANDLE__*;

struct SERVICE_STATUS {
  DWORD dwServiceType;
  DWORD dwCurrentState;
  DWORD dwControlsAccepted;
  DWORD dwWin32ExitCode;
  DWORD dwServiceSpecificExitCode;
  DWORD dwCheckPoint;
  DWORD dwWaitHint;
};
using LPSERVICE_STATUS = SERVICE_STATUS*;
static_assert(sizeof(SERVICE_STATUS) == 28);

using LPSERVICE_MAIN_FUNCTIONW = void (*)(DWORD argumentCount, LPWSTR* arguments);
using LPHANDLER_FUNCTION_EX = DWORD (*)(DWORD control, DWORD eventType, LPVOID eventData,
                                        LPVOID context);

struct SERVICE_TABLE_ENTRYW {
  LPWSTR lpServiceName;
  LPSERVICE_MAIN_FUNCTIONW lpServiceProc;
};
using LPSERVICE_TABLE_ENTRYW = SERVICE_TABLE_ENTRYW*;
static_assert(sizeof(SERVICE_TABLE_ENTRYW) == 16);

struct SERVICE_DESCRIPTIONW {
  LPWSTR lpDescription;
};
using LPSERVICE_DESCRIPTIONW = SERVICE_DESCRIPTIONW*;

// Service types.
constexpr DWORD SERVICE_KERNEL_DRIVER = 0x00000001;
constexpr DWORD SERVICE_FILE_SYSTEM_DRIVER = 0x00000002;
constexpr DWORD SERVICE_WIN32_OWN_PROCESS = 0x00000010;
constexpr DWORD SERVICE_WIN32_SHARE_PROCESS = 0x00000020;
constexpr DWORD SERVICE_WIN32 = 0x00000030;
constexpr DWORD SERVICE_INTERACTIVE_PROCESS = 0x00000100;
// Start types.
constexpr DWORD SERVICE_BOOT_START = 0x00000000;
constexpr DWORD SERVICE_SYSTEM_START = 0x00000001;
constexpr DWORD SERVICE_AUTO_START = 0x00000002;
constexpr DWORD SERVICE_DEMAND_START = 0x00000003;
constexpr DWORD SERVICE_DISABLED = 0x00000004;
// Error control.
constexpr DWORD SERVICE_ERROR_IGNORE = 0x00000000;
constexpr DWORD SERVICE_ERROR_NORMAL = 0x00000001;
constexpr DWORD SERVICE_ERROR_SEVERE = 0x00000002;
constexpr DWORD SERVICE_ERROR_CRITICAL = 0x00000003;
constexpr DWORD SERVICE_NO_CHANGE = 0xFFFFFFFF;
// States.
constexpr DWORD SERVICE_STOPPED = 0x00000001;
constexpr DWORD SERVICE_START_PENDING = 0x00000002;
constexpr DWORD SERVICE_STOP_PENDING = 0x00000003;
constexpr DWORD SERVICE_RUNNING = 0x00000004;
constexpr DWORD SERVICE_CONTINUE_PENDING = 0x00000005;
constexpr DWORD SERVICE_PAUSE_PENDING = 0x00000006;
constexpr DWORD SERVICE_PAUSED = 0x00000007;
// Controls.
constexpr DWORD SERVICE_CONTROL_STOP = 0x00000001;
constexpr DWORD SERVICE_CONTROL_PAUSE = 0x00000002;
constexpr DWORD SERVICE_CONTROL_CONTINUE = 0x00000003;
constexpr DWORD SERVICE_CONTROL_INTERROGATE = 0x00000004;
constexpr DWORD SERVICE_CONTROL_SHUTDOWN = 0x00000005;
constexpr DWORD SERVICE_CONTROL_PARAMCHANGE = 0x00000006;
constexpr DWORD SERVICE_CONTROL_NETBINDADD = 0x00000007;
constexpr DWORD SERVICE_CONTROL_NETBINDREMOVE = 0x00000008;
constexpr DWORD SERVICE_CONTROL_NETBINDENABLE = 0x00000009;
constexpr DWORD SERVICE_CONTROL_NETBINDDISABLE = 0x0000000A;
constexpr DWORD SERVICE_CONTROL_DEVICEEVENT = 0x0000000B;
constexpr DWORD SERVICE_CONTROL_HARDWAREPROFILECHANGE = 0x0000000C;
constexpr DWORD SERVICE_CONTROL_POWEREVENT = 0x0000000D;
constexpr DWORD SERVICE_CONTROL_SESSIONCHANGE = 0x0000000E;
constexpr DWORD SERVICE_CONTROL_PRESHUTDOWN = 0x0000000F;
// Controls accepted.
constexpr DWORD SERVICE_ACCEPT_STOP = 0x00000001;
constexpr DWORD SERVICE_ACCEPT_PAUSE_CONTINUE = 0x00000002;
constexpr DWORD SERVICE_ACCEPT_SHUTDOWN = 0x00000004;
constexpr DWORD SERVICE_ACCEPT_PARAMCHANGE = 0x00000008;
constexpr DWORD SERVICE_ACCEPT_NETBINDCHANGE = 0x00000010;
constexpr DWORD SERVICE_ACCEPT_HARDWAREPROFILECHANGE = 0x00000020;
constexpr DWORD SERVICE_ACCEPT_POWEREVENT = 0x00000040;
constexpr DWORD SERVICE_ACCEPT_SESSIONCHANGE = 0x00000080;
constexpr DWORD SERVICE_ACCEPT_PRESHUTDOWN = 0x00000100;
// Manager and service access rights.
constexpr DWORD SC_MANAGER_CONNECT = 0x0001;
constexpr DWORD SC_MANAGER_CREATE_SERVICE = 0x0002;
constexpr DWORD SC_MANAGER_ENUMERATE_SERVICE = 0x0004;
constexpr DWORD SC_MANAGER_LOCK = 0x0008;
constexpr DWORD SC_MANAGER_QUERY_LOCK_STATUS = 0x0010;
constexpr DWORD SC_MANAGER_MODIFY_BOOT_CONFIG = 0x0020;
constexpr DWORD SC_MANAGER_ALL_ACCESS = 0x000F003F;
constexpr DWORD SERVICE_QUERY_CONFIG = 0x0001;
constexpr DWORD SERVICE_CHANGE_CONFIG = 0x0002;
constexpr DWORD SERVICE_QUERY_STATUS = 0x0004;
constexpr DWORD SERVICE_ENUMERATE_DEPENDENTS = 0x0008;
constexpr DWORD SERVICE_START = 0x0010;
constexpr DWORD SERVICE_STOP = 0x0020;
constexpr DWORD SERVICE_PAUSE_CONTINUE = 0x0040;
constexpr DWORD SERVICE_INTERROGATE = 0x0080;
constexpr DWORD SERVICE_USER_DEFINED_CONTROL = 0x0100;
constexpr DWORD SERVICE_ALL_ACCESS = 0x000F01FF;
// ChangeServiceConfig2W levels.
constexpr DWORD SERVICE_CONFIG_DESCRIPTION = 1;
constexpr DWORD SERVICE_CONFIG_FAILURE_ACTIONS = 2;
#define SERVICES_ACTIVE_DATABASEW u"ServicesActive"

BOOL StartServiceCtrlDispatcherW(const SERVICE_TABLE_ENTRYW* serviceTable);
SERVICE_STATUS_HANDLE RegisterServiceCtrlHandlerExW(LPCWSTR serviceName,
                                                    LPHANDLER_FUNCTION_EX handler, LPVOID context);
BOOL SetServiceStatus(SERVICE_STATUS_HANDLE statusHandle, LPSERVICE_STATUS status);

SC_HANDLE OpenSCManagerW(LPCWSTR machineName, LPCWSTR databaseName, DWORD desiredAccess);
SC_HANDLE CreateServiceW(SC_HANDLE manager, LPCWSTR serviceName, LPCWSTR displayName,
                         DWORD desiredAccess, DWORD serviceType, DWORD startType,
                         DWORD errorControl, LPCWSTR binaryPathName, LPCWSTR loadOrderGroup,
                         LPDWORD tagId, LPCWSTR dependencies, LPCWSTR serviceStartName,
                         LPCWSTR password);
SC_HANDLE OpenServiceW(SC_HANDLE manager, LPCWSTR serviceName, DWORD desiredAccess);
BOOL ChangeServiceConfig2W(SC_HANDLE service, DWORD infoLevel, LPVOID info);
// On the host no service process can be launched (the service runs with
// -debug instead): for an installed service this fails with
// ERROR_NOT_SUPPORTED.
BOOL StartServiceW(SC_HANDLE service, DWORD argumentCount, LPCWSTR* arguments);
BOOL ControlService(SC_HANDLE service, DWORD control, LPSERVICE_STATUS status);
BOOL QueryServiceStatus(SC_HANDLE service, LPSERVICE_STATUS status);
BOOL DeleteService(SC_HANDLE service);
BOOL CloseServiceHandle(SC_HANDLE handle);

// ---- Event log -------------------------------------------------------------
using PSID = void*;
constexpr WORD EVENTLOG_SUCCESS = 0x0000;
constexpr WORD EVENTLOG_ERROR_TYPE = 0x0001;
constexpr WORD EVENTLOG_WARNING_TYPE = 0x0002;
constexpr WORD EVENTLOG_INFORMATION_TYPE = 0x0004;
constexpr WORD EVENTLOG_AUDIT_SUCCESS = 0x0008;
constexpr WORD EVENTLOG_AUDIT_FAILURE = 0x0010;

HANDLE RegisterEventSourceW(LPCWSTR serverName, LPCWSTR sourceName);
BOOL ReportEventW(HANDLE eventLog, WORD type, WORD category, DWORD eventId, PSID userSid,
                  WORD stringCount, DWORD dataSize, LPCWSTR* strings, LPVOID rawData);
BOOL DeregisterEventSource(HANDLE eventLog);

// ---- Device notifications (dbt.h) ------------------------------------------
using HDEVNOTIFY = PVOID;
using PHDEVNOTIFY = HDEVNOTIFY*;
constexpr DWORD DEVICE_NOTIFY_WINDOW_HANDLE = 0x00000000;
constexpr DWORD DEVICE_NOTIFY_SERVICE_HANDLE = 0x00000001;
constexpr DWORD DEVICE_NOTIFY_ALL_INTERFACE_CLASSES = 0x00000004;

constexpr DWORD DBT_DEVNODES_CHANGED = 0x0007;
constexpr DWORD DBT_QUERYCHANGECONFIG = 0x0017;
constexpr DWORD DBT_CONFIGCHANGED = 0x0018;
constexpr DWORD DBT_CONFIGCHANGECANCELED = 0x0019;
constexpr DWORD DBT_DEVICEARRIVAL = 0x8000;
constexpr DWORD DBT_DEVICEQUERYREMOVE = 0x8001;
constexpr DWORD DBT_DEVICEQUERYREMOVEFAILED = 0x8002;
constexpr DWORD DBT_DEVICEREMOVEPENDING = 0x8003;
constexpr DWORD DBT_DEVICEREMOVECOMPLETE = 0x8004;
constexpr DWORD DBT_DEVICETYPESPECIFIC = 0x8005;
constexpr DWORD DBT_CUSTOMEVENT = 0x8006;
constexpr DWORD DBT_DEVTYP_OEM = 0x00000000;
constexpr DWORD DBT_DEVTYP_DEVNODE = 0x00000001;
constexpr DWORD DBT_DEVTYP_VOLUME = 0x00000002;
constexpr DWORD DBT_DEVTYP_PORT = 0x00000003;
constexpr DWORD DBT_DEVTYP_NET = 0x00000004;
constexpr DWORD DBT_DEVTYP_DEVICEINTERFACE = 0x00000005;
constexpr DWORD DBT_DEVTYP_HANDLE = 0x00000006;
constexpr WORD DBTF_MEDIA = 0x0001;
constexpr WORD DBTF_NET = 0x0002;
constexpr DWORD BROADCAST_QUERY_DENY = 0x424D5144;

// Window messages that carry these events (and power changes) when a
// windowed application forwards them.
constexpr UINT WM_POWERBROADCAST = 0x0218;
constexpr UINT WM_DEVICECHANGE = 0x0219;
constexpr WPARAM PBT_APMSUSPEND = 0x0004;
constexpr WPARAM PBT_APMRESUMECRITICAL = 0x0006;
constexpr WPARAM PBT_APMRESUMESUSPEND = 0x0007;
constexpr WPARAM PBT_APMRESUMEAUTOMATIC = 0x0012;

struct DEV_BROADCAST_HDR {
  DWORD dbch_size;
  DWORD dbch_devicetype;
  DWORD dbch_reserved;
};
using PDEV_BROADCAST_HDR = DEV_BROADCAST_HDR*;
static_assert(sizeof(DEV_BROADCAST_HDR) == 12);

struct DEV_BROADCAST_DEVICEINTERFACE_W {
  DWORD dbcc_size;
  DWORD dbcc_devicetype;
  DWORD dbcc_reserved;
  GUID dbcc_classguid;
  WCHAR dbcc_name[1];
};
using PDEV_BROADCAST_DEVICEINTERFACE_W = DEV_BROADCAST_DEVICEINTERFACE_W*;
static_assert(sizeof(DEV_BROADCAST_DEVICEINTERFACE_W) == 32);
static_assert(offsetof(DEV_BROADCAST_DEVICEINTERFACE_W, dbcc_devicetype) == 4);
static_assert(offsetof(DEV_BROADCAST_DEVICEINTERFACE_W, dbcc_reserved) == 8);
static_assert(offsetof(DEV_BROADCAST_DEVICEINTERFACE_W, dbcc_classguid) == 12);
static_assert(offsetof(DEV_BROADCAST_DEVICEINTERFACE_W, dbcc_name) == 28);

struct DEV_BROADCAST_VOLUME {
  DWORD dbcv_size;
  DWORD dbcv_devicetype;
  DWORD dbcv_reserved;
  DWORD dbcv_unitmask;
  WORD dbcv_flags;
};
using PDEV_BROADCAST_VOLUME = DEV_BROADCAST_VOLUME*;
static_assert(sizeof(DEV_BROADCAST_VOLUME) == 20);
static_assert(offsetof(DEV_BROADCAST_VOLUME, dbcv_unitmask) == 12);
static_assert(offsetof(DEV_BROADCAST_VOLUME, dbcv_flags) == 16);

// `recipient` is a SERVICE_STATUS_HANDLE with DEVICE_NOTIFY_SERVICE_HANDLE;
// `filter` a DEV_BROADCAST_DEVICEINTERFACE_W. Window recipients are accepted
// but never receive anything (the emulation has no windows).
HDEVNOTIFY RegisterDeviceNotificationW(HANDLE recipient, LPVOID filter, DWORD flags);
BOOL UnregisterDeviceNotification(HDEVNOTIFY notification);

// ---- Console control ---------------------------------------------------------
// On the host SIGINT is Ctrl+C, SIGQUIT (Ctrl+\) stands for Ctrl+Break and
// SIGHUP for closing the console; handlers run on a thread of their own.
using PHANDLER_ROUTINE = BOOL (*)(DWORD controlType);
constexpr DWORD CTRL_C_EVENT = 0;
constexpr DWORD CTRL_BREAK_EVENT = 1;
constexpr DWORD CTRL_CLOSE_EVENT = 2;
constexpr DWORD CTRL_LOGOFF_EVENT = 5;
constexpr DWORD CTRL_SHUTDOWN_EVENT = 6;

BOOL SetConsoleCtrlHandler(PHANDLER_ROUTINE handler, BOOL add);

// ---- System message texts ----------------------------------------------------
constexpr DWORD FORMAT_MESSAGE_ALLOCATE_BUFFER = 0x00000100;
constexpr DWORD FORMAT_MESSAGE_IGNORE_INSERTS = 0x00000200;
constexpr DWORD FORMAT_MESSAGE_FROM_STRING = 0x00000400;
constexpr DWORD FORMAT_MESSAGE_FROM_HMODULE = 0x00000800;
constexpr DWORD FORMAT_MESSAGE_FROM_SYSTEM = 0x00001000;
constexpr DWORD FORMAT_MESSAGE_ARGUMENT_ARRAY = 0x00002000;
constexpr DWORD FORMAT_MESSAGE_MAX_WIDTH_MASK = 0x000000FF;
constexpr WORD LANG_NEUTRAL = 0x00;
constexpr WORD LANG_ENGLISH = 0x09;
constexpr WORD SUBLANG_NEUTRAL = 0x00;
constexpr WORD SUBLANG_DEFAULT = 0x01;
#define MAKELANGID(primary, sub) \
  (static_cast<WORD>((static_cast<WORD>(sub) << 10) | static_cast<WORD>(primary)))
constexpr DWORD ERROR_MR_MID_NOT_FOUND = 317;

// Supports FORMAT_MESSAGE_FROM_SYSTEM (with or without ALLOCATE_BUFFER; the
// allocated text is released with LocalFree). Inserts are never expanded.
DWORD FormatMessageW(DWORD flags, LPCVOID source, DWORD messageId, DWORD languageId, LPWSTR buffer,
                     DWORD size, va_list* arguments);
