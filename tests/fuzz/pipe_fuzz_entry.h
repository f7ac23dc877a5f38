// The fuzzing entry of the command channel, shared by the libFuzzer target and
// the plain corpus replay.
//
// Input: the first byte selects the target, the rest is its input.
//   even: a pipe message as the server would have read it, fed to the
//         dispatcher with the count of bytes received;
//   odd:  a registry request (fixed part and texts) of exactly that many
//         bytes delivered, fed to the registry access alone.
// The dispatcher runs on a computer without drives. Every reply must pass the
// checks of fuzz_support.h, and no path may be opened at all; a refused
// registry request stays unchanged. A violation aborts.
#pragma once

#include <cstddef>
#include <cstdint>

int PipeFuzzOneInput(const std::uint8_t* data, std::size_t size);
