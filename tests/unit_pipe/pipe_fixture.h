#pragma once

#include <gtest/gtest.h>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <vector>

#include "monitor/monitor_state.h"
#include "pipe/command_message.h"
#include "pipe/pipe_client.h"
#include "platform/wide.h"
#include "support/test_support.h"
#include "unit_monitor/monitor_fixture.h"

namespace pipetest {

using skytest::Handle;
using skytest::kGuardMs;

class MonitorFixture : public ::MonitorFixture {
 protected:
  void SetUp() override;
  void TearDown() override;
  StateBlock& Block() { return *monitorState.stateBlock; }
};

class ServerFixture : public MonitorFixture {
 protected:
  void SetUp() override;
  void TearDown() override;
  void StartServer();
  // True when the thread ended on the stop event with exit code 0.
  bool StopServer();
  // A connected client; waits for the server to listen (guarded).
  Handle Connect();

  Handle thread_;
};

// One message of `sent` bytes out, the reply (possibly empty) back; error is
// the last error when ok is false.
struct Exchange {
  bool ok = false;
  DWORD error = 0;
  std::vector<BYTE> reply;
  DWORD Result() const { return Field(offsetof(CommandMessage, result)); }
  DWORD Detail() const { return Field(offsetof(CommandMessage, detail)); }
  DWORD Field(std::size_t offset) const;
};
Exchange Send(HANDLE client, const void* request, DWORD sent);
Exchange Send(HANDLE client, const CommandMessage& message);

std::unique_ptr<CommandMessage> NewCommand(DWORD command, DWORD arg1 = 0, DWORD arg2 = 0,
                                           DWORD arg3 = 0);

}  // namespace pipetest
