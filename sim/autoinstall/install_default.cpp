// Linked (as an object, so that it is never dropped) into programs that run on
// the simulated computer without building one: makes the default machine the
// one the emulation's device calls find first.
#include "machine.h"

namespace {
const bool registered = (sim::RegisterDefaultMachine(), true);
}  // namespace
