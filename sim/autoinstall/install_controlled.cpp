// Linked into the host executable: the default machine, as install_default.cpp
// gives it, and its control channel served for `skyvane sim`.
#include "control_server.h"

namespace {
const bool registered = (sim::RegisterControlledDefaultMachine(), true);
}  // namespace
