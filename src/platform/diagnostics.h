// What the platform layer can tell tests about itself: live handles and
// threads of this process (to catch leaks) and the emulation's time scale.
#pragma once

namespace platform {

// Handles and threads of this process that are alive now. The POSIX emulation
// counts exactly the handles it issued and the threads created with
// CreateThread; on Windows the counts are not known and -1 is returned.
long LiveHandleCount();
long LiveThreadCount();

// The factor applied to every Sleep and wait time-out (SKYVANE_TIME_SCALE in
// the emulation; always 1.0 on Windows).
double TimeScale();

}  // namespace platform
