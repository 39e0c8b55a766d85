// libFuzzer target: filters of channel names, judged a second time by a naive reading of them.
#include "support/FilterCase.h"

extern "C" int LLVMFuzzerTestOneInput(std::uint8_t const* data, std::size_t size) {
  Support::FilterCase(data, size).run();
  return 0;
}
