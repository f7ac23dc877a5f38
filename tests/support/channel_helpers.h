// Helpers for tests that drive channel records of a state block directly.
#pragma once

#include <gtest/gtest.h>

#include <string>

#include "monitor/state_block.h"
#include "platform/wide.h"

namespace testsupport {

inline std::string Narrow(const WCHAR* text) {
  return WideToUtf8(WideView(text, WideLength(text)));
}

inline void OpenSharedChannelHandle(ChannelRecord* channel) {
  const bool readWrite = channel->kind == kChannelKindHid || channel->mode != 0;
  channel->deviceHandle =
      CreateFileW(channel->devicePath, readWrite ? GENERIC_READ | GENERIC_WRITE : 0,
                  readWrite ? FILE_SHARE_READ | FILE_SHARE_WRITE : 0, nullptr, OPEN_EXISTING,
                  FILE_FLAG_OVERLAPPED, nullptr);
  ASSERT_NE(channel->deviceHandle, INVALID_HANDLE_VALUE) << Narrow(channel->devicePath);
}

inline void CloseChannelHandles(StateBlock& block) {
  for (ChannelRecord& channel : block.channels) {
    if (channel.deviceHandle != nullptr) CloseHandle(channel.deviceHandle);
    channel.deviceHandle = nullptr;
  }
}

// The channel whose device path contains `part` (lower case).
inline ChannelRecord* FindChannel(StateBlock& block, const std::string& part) {
  for (int i = 0; i < block.channelCount; ++i) {
    if (Narrow(block.channels[i].devicePath).find(part) != std::string::npos) {
      return &block.channels[i];
    }
  }
  ADD_FAILURE() << "no channel with " << part;
  return &block.channels[kMaxChannels - 1];
}

}  // namespace testsupport
