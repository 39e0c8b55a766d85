// libFuzzer target: sequences of operations on a tree, its topologies and channels, held against models.
#include "support/OperationsCase.h"

#include "GeometryVolume/core/Parallel.h"

extern "C" int LLVMFuzzerTestOneInput(std::uint8_t const* data, std::size_t size) {
  // A difference ends the run; one thread gives the same coverage for the same input.
  testing::FLAGS_gtest_throw_on_failure = true;
  VLN::withThreads(1, [&] { Support::OperationsCase(data, size).run(); });
  return 0;
}
