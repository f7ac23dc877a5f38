// libFuzzer target of the command channel (clang, -fsanitize=fuzzer).
#include <cstddef>
#include <cstdint>

#include "pipe_fuzz_entry.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  return PipeFuzzOneInput(data, size);
}
