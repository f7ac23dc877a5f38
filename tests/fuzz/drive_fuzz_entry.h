// The fuzzing entry of the commands that reach drives and channels (1, 2, 3,
// 9, 11 and 12) on the embedded default machine, shared by the libFuzzer
// target and the plain corpus replay.
//
// Input: the first byte selects the command (low three bits, modulo six),
// whether monitoring is paused (0x08), and which of the service's drives the
// image's key names (high four bits; beyond the last drive the key is left as
// it arrived). The rest is the message as the server would have read it.
// Besides the checks of every reply, no path may be opened that the service
// did not find itself. A violation aborts.
#pragma once

#include <cstddef>
#include <cstdint>

int DriveFuzzOneInput(const std::uint8_t* data, std::size_t size);
