// libFuzzer target: the bytes of .vdb files, the way that the program reads them.
#include "support/VdbCase.h"

extern "C" int LLVMFuzzerTestOneInput(std::uint8_t const* data, std::size_t size) {
  Support::VdbCase(data, size).run();
  return 0;
}

extern "C" std::size_t LLVMFuzzerMutate(std::uint8_t* data, std::size_t size, std::size_t most);

extern "C" std::size_t LLVMFuzzerCustomMutator(std::uint8_t* data, std::size_t size, std::size_t most,
                                               unsigned seed) {
  // Now and then without any knowledge of the format.
  if (seed % 8 == 0) return LLVMFuzzerMutate(data, size, most);
  Support::VdbCase::mutate(data, size, seed);
  return size;
}
