// libFuzzer target: the bytes of .npz files.
#include "support/ArrayCase.h"

extern "C" int LLVMFuzzerTestOneInput(std::uint8_t const* data, std::size_t size) {
  Support::NpzCase(data, size).run();
  return 0;
}
