// libFuzzer target of the commands that reach drives (clang, -fsanitize=fuzzer).
#include <cstddef>
#include <cstdint>

#include "drive_fuzz_entry.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  return DriveFuzzOneInput(data, size);
}
