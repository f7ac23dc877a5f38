// After every test case, checks that the emulation holds no live handles and
// no live threads of this process, and fails the case otherwise.
#pragma once

namespace skytest {

// Adds the check to gtest's listeners (after the result printer, so that a
// leak shows as the case's failure). Skipped where the counts are unknown
// (Windows reports -1).
void InstallLeakCheck();

}  // namespace skytest
