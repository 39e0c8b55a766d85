// libFuzzer target: the bytes of .vdb files, the way that the program reads them.
#include "vdb_mutator.h"

extern "C" int LLVMFuzzerTestOneInput(std::uint8_t const* data, std::size_t size) {
  Support::VdbCase(data, size).run();
  return 0;
}
