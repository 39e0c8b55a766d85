// How libFuzzer changes the bytes of .vdb files. For one source of a fuzzer each.
#pragma once

#include "support/VdbCase.h"

#include <cstddef>
#include <cstdint>

extern "C" std::size_t LLVMFuzzerMutate(std::uint8_t* data, std::size_t size, std::size_t most);

extern "C" std::size_t LLVMFuzzerCustomMutator(std::uint8_t* data, std::size_t size, std::size_t most,
                                               unsigned seed) {
  // Now and then without any knowledge of the format.
  if (seed % 8 == 0) return LLVMFuzzerMutate(data, size, most);
  Support::VdbCase::mutate(data, size, seed);
  return size;
}
