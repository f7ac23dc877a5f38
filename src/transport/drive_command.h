// The one command entry for every drive command, whatever the channel's
// transport, and the control codes of the maker's button filter driver.
#pragma once

#include "platform/win32.h"
#include "transport/channel_record.h"

constexpr DWORD CTL_SET_GAUGE = 0x222040;
constexpr DWORD CTL_WAIT_GAUGE_EVENT = 0x222048;
constexpr DWORD CTL_QUIESCE = 0x222050;
constexpr DWORD CTL_CLEAR_GAUGE_EVENT = 0x222054;
constexpr DWORD CTL_WAIT_EVENT = 0x223C04;
constexpr DWORD CTL_SET_STATE_B = 0x223C08;
constexpr DWORD CTL_SET_STATE = 0x223C0C;
constexpr DWORD CTL_GET_IDENTITY = 0x223C10;
constexpr DWORD CTL_EJECT_NOTICE = 0x223C14;
constexpr DWORD CTL_CLEAR_EVENT = 0x223C1C;
constexpr DWORD CTL_EVENT_REPLY = 0x223C20;
constexpr DWORD CTL_WORKER_START = 0x223C24;

// 1 on success, 0 on failure. abortEvent may be null.
DWORD SendDriveCommand(ChannelRecord* channel, DWORD controlCode, WORD value, HANDLE abortEvent);
// The general form: buffer may be null (value 0).
DWORD DriveCommand(ChannelRecord* channel, DWORD controlCode, BYTE* buffer, DWORD length,
                   HANDLE abortEvent);
