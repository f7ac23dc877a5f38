// The command channel's surroundings as the monitor sets them up: a zeroed
// state block, its mutex and mapping, and the pipe stop event; optionally the
// pipe server thread itself. Plus client helpers for the tests.
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

// The monitor's state with the pipe stop event (no server thread).
class MonitorFixture : public ::MonitorFixture {
 protected:
  void SetUp() override;
  void TearDown() override;
  StateBlock& Block() { return *monitorState.stateBlock; }
};

// The same with the pipe server thread running.
class ServerFixture : public MonitorFixture {
 protected:
  void SetUp() override;
  void TearDown() override;

  // Signals the stop event and waits for the thread; true when it ended with
  // exit code 0.
  bool StopServer();
  // A connected client; waits for the server to listen (guarded).
  Handle Connect();

 private:
  Handle thread_;
};

// One exchange on a connected client. `sent` bytes of `request` go out as one
// message; the reply (possibly empty) comes back. ok is false when the write
// or the read failed (error then holds the last error).
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

// A fresh full-length request on the heap.
std::unique_ptr<CommandMessage> NewCommand(DWORD command, DWORD arg1 = 0, DWORD arg2 = 0,
                                           DWORD arg3 = 0);

}  // namespace pipetest
