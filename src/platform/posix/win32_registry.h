// Placeholder; filled in by the emulation.
#pragma once
#include "platform/posix/win32_base.h"
