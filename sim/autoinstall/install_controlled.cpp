// Linked into the host executable: the default machine (or the description
// named by SKYVANE_MACHINE), and its control channel served for `skyvane sim`.
#include "control_server.h"

namespace {
const bool registered = (sim::RegisterControlledDefaultMachine(), true);
}  // namespace
