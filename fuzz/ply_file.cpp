// libFuzzer target: the bytes of .ply files.
#include "support/PlyCase.h"

extern "C" int LLVMFuzzerTestOneInput(std::uint8_t const* data, std::size_t size) {
  Support::PlyCase(data, size).run();
  return 0;
}
