// libFuzzer target of one fuzzing entry, named by FUZZ_ENTRY (clang,
// -fsanitize=fuzzer).
#include "fuzz_support.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  return FUZZ_ENTRY(data, size);
}
