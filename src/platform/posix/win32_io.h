// Win32 file, device and named-pipe I/O for the POSIX emulation: CreateFileW,
// ReadFile, WriteFile, DeviceIoControl, overlapped completion and
// cancellation, named pipes. Names, types and values are those of the
// Windows SDK. Device paths are answered by the installed DeviceProvider
// (device_provider.h); "\\.\pipe\NAME" paths are named pipes.
#pragma once

#include "platform/posix/win32_base.h"

// ---- Device I/O control codes (winioctl.h) -----------------------------------
#define CTL_CODE(DeviceType, Function, Method, Access)                           \
  ((static_cast<DWORD>(DeviceType) << 16) | (static_cast<DWORD>(Access) << 14) | \
   (static_cast<DWORD>(Function) << 2) | static_cast<DWORD>(Method))
#define DEVICE_TYPE_FROM_CTL_CODE(ctrlCode) ((static_cast<DWORD>(ctrlCode) & 0xffff0000) >> 16)
#define METHOD_FROM_CTL_CODE(ctrlCode) (static_cast<DWORD>(ctrlCode) & 3)

constexpr DWORD METHOD_BUFFERED = 0;
constexpr DWORD METHOD_IN_DIRECT = 1;
constexpr DWORD METHOD_OUT_DIRECT = 2;
constexpr DWORD METHOD_NEITHER = 3;
// FILE_ANY_ACCESS is in win32_base.h.
constexpr DWORD FILE_SPECIAL_ACCESS = 0;
constexpr DWORD FILE_READ_ACCESS = 0x0001;
constexpr DWORD FILE_WRITE_ACCESS = 0x0002;

constexpr DWORD FILE_DEVICE_BEEP = 0x00000001;
constexpr DWORD FILE_DEVICE_CD_ROM = 0x00000002;
constexpr DWORD FILE_DEVICE_CONTROLLER = 0x00000004;
constexpr DWORD FILE_DEVICE_DISK = 0x00000007;
constexpr DWORD FILE_DEVICE_FILE_SYSTEM = 0x00000009;
constexpr DWORD FILE_DEVICE_KEYBOARD = 0x0000000b;
constexpr DWORD FILE_DEVICE_MASS_STORAGE = 0x0000002d;
constexpr DWORD FILE_DEVICE_NAMED_PIPE = 0x00000011;
constexpr DWORD FILE_DEVICE_NETWORK = 0x00000012;
constexpr DWORD FILE_DEVICE_UNKNOWN = 0x00000022;
constexpr DWORD FILE_DEVICE_BUS_EXTENDER = 0x0000002a;

// ---- Files and devices -------------------------------------------------------
constexpr DWORD FILE_FLAG_WRITE_THROUGH = 0x80000000;
constexpr DWORD FILE_FLAG_NO_BUFFERING = 0x20000000;
constexpr DWORD FILE_ATTRIBUTE_READONLY = 0x00000001;
constexpr DWORD FILE_ATTRIBUTE_HIDDEN = 0x00000002;
constexpr DWORD FILE_ATTRIBUTE_SYSTEM = 0x00000004;

HANDLE CreateFileW(LPCWSTR fileName, DWORD desiredAccess, DWORD shareMode,
                   LPSECURITY_ATTRIBUTES securityAttributes, DWORD creationDisposition,
                   DWORD flagsAndAttributes, HANDLE templateFile);
BOOL ReadFile(HANDLE file, LPVOID buffer, DWORD numberOfBytesToRead, LPDWORD numberOfBytesRead,
              LPOVERLAPPED overlapped);
BOOL WriteFile(HANDLE file, LPCVOID buffer, DWORD numberOfBytesToWrite,
               LPDWORD numberOfBytesWritten, LPOVERLAPPED overlapped);
BOOL DeviceIoControl(HANDLE device, DWORD ioControlCode, LPVOID inBuffer, DWORD inBufferSize,
                     LPVOID outBuffer, DWORD outBufferSize, LPDWORD bytesReturned,
                     LPOVERLAPPED overlapped);
BOOL GetOverlappedResult(HANDLE file, LPOVERLAPPED overlapped, LPDWORD numberOfBytesTransferred,
                         BOOL wait);
// Cancels the calling thread's pending requests on `file`.
BOOL CancelIo(HANDLE file);
// Cancels every pending request on `file` (overlapped null) or just the one
// that uses `overlapped`; ERROR_NOT_FOUND when there is none.
BOOL CancelIoEx(HANDLE file, LPOVERLAPPED overlapped);
BOOL FlushFileBuffers(HANDLE file);

#define HasOverlappedIoCompleted(lpOverlapped) \
  ((lpOverlapped)->Internal != static_cast<ULONG_PTR>(STATUS_PENDING))

// ---- Named pipes ---------------------------------------------------------------
constexpr DWORD PIPE_ACCESS_INBOUND = 0x00000001;
constexpr DWORD PIPE_ACCESS_OUTBOUND = 0x00000002;
constexpr DWORD PIPE_ACCESS_DUPLEX = 0x00000003;
constexpr DWORD PIPE_CLIENT_END = 0x00000000;
constexpr DWORD PIPE_SERVER_END = 0x00000001;
constexpr DWORD PIPE_TYPE_BYTE = 0x00000000;
constexpr DWORD PIPE_TYPE_MESSAGE = 0x00000004;
constexpr DWORD PIPE_READMODE_BYTE = 0x00000000;
constexpr DWORD PIPE_READMODE_MESSAGE = 0x00000002;
constexpr DWORD PIPE_WAIT = 0x00000000;
constexpr DWORD PIPE_NOWAIT = 0x00000001;
constexpr DWORD PIPE_ACCEPT_REMOTE_CLIENTS = 0x00000000;
constexpr DWORD PIPE_REJECT_REMOTE_CLIENTS = 0x00000008;
constexpr DWORD PIPE_UNLIMITED_INSTANCES = 255;
constexpr DWORD NMPWAIT_WAIT_FOREVER = 0xFFFFFFFF;
constexpr DWORD NMPWAIT_NOWAIT = 0x00000001;
constexpr DWORD NMPWAIT_USE_DEFAULT_WAIT = 0x00000000;

HANDLE CreateNamedPipeW(LPCWSTR name, DWORD openMode, DWORD pipeMode, DWORD maxInstances,
                        DWORD outBufferSize, DWORD inBufferSize, DWORD defaultTimeOut,
                        LPSECURITY_ATTRIBUTES securityAttributes);
BOOL ConnectNamedPipe(HANDLE namedPipe, LPOVERLAPPED overlapped);
BOOL DisconnectNamedPipe(HANDLE namedPipe);
BOOL WaitNamedPipeW(LPCWSTR namedPipeName, DWORD timeOut);
BOOL SetNamedPipeHandleState(HANDLE namedPipe, LPDWORD mode, LPDWORD maxCollectionCount,
                             LPDWORD collectDataTimeout);
BOOL TransactNamedPipe(HANDLE namedPipe, LPVOID inBuffer, DWORD inBufferSize, LPVOID outBuffer,
                       DWORD outBufferSize, LPDWORD bytesRead, LPOVERLAPPED overlapped);
BOOL PeekNamedPipe(HANDLE namedPipe, LPVOID buffer, DWORD bufferSize, LPDWORD bytesRead,
                   LPDWORD totalBytesAvail, LPDWORD bytesLeftThisMessage);
