// libFuzzer target: validation of flat buffers and .nvtt files, and every lookup in what it accepts.
// scripts/fuzz.sh builds and runs it; tests/nanovtt/FlatFuzzTest.cpp makes its seeds and replays cases
// without it.
#include "support/FlatCase.h"

#include <cstddef>
#include <cstdint>
#include <random>

extern "C" int LLVMFuzzerTestOneInput(std::uint8_t const* data, std::size_t size) {
  Support::FlatCase::unpack(data, size).run();
  return 0;
}

extern "C" std::size_t LLVMFuzzerMutate(std::uint8_t* data, std::size_t size, std::size_t most);

extern "C" std::size_t LLVMFuzzerCustomMutator(std::uint8_t* data, std::size_t size, std::size_t most,
                                               unsigned seed) {
  std::mt19937_64 random(seed);
  // Now and then without any knowledge of the format.
  if (random() % 16 == 0) size = LLVMFuzzerMutate(data, size, most);
  auto c = Support::FlatCase::unpack(data, size);
  c.mutate(random);
  auto const packed = c.pack();
  if (packed.size() > most) return size;
  std::copy(packed.begin(), packed.end(), data);
  return packed.size();
}
