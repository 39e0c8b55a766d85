// libFuzzer target: the bytes of .vti files.
#include "support/ArrayCase.h"

extern "C" int LLVMFuzzerTestOneInput(std::uint8_t const* data, std::size_t size) {
  Support::VtiCase(data, size).run();
  return 0;
}
