// The emulation namespace: every named object, named pipe and mapping of the
// emulation lives in one shared region per namespace (a file in /dev/shm
// named from SKYVANE_NAMESPACE, default "skyvane-<uid>"), shared by the
// processes that use the same name.
#pragma once

namespace emu {

// Removes the shared region and the mapping files of this process's
// namespace (test teardown). Processes still attached keep their memory; new
// users start a fresh region.
void DestroyNamespace();

}  // namespace emu
