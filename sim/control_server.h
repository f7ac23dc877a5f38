// Serves the control channel (control_protocol.h) of a machine installed as
// the computer of the running process, so that `skyvane sim` in another
// process of the same emulation namespace can press buttons, plug and
// unplug drives, inject faults and change volumes and drive state.
#pragma once

#include <string>
#include <vector>

#include "machine.h"

namespace sim {

// Carries out one request on the machine and returns the reply message.
// Validates everything: bad input gets "error\n..." and changes nothing.
std::string HandleControlRequest(Machine& machine, const std::vector<std::string>& words);

// Starts the thread that serves the channel for `machine` (which must live
// until the process ends). The thread is stopped and joined at process exit.
void StartControlServer(Machine* machine);

// Makes CreateDefaultMachine the emulation's default device model, and the
// machine it creates serves the control channel (used by the host executable).
void RegisterControlledDefaultMachine();

}  // namespace sim
