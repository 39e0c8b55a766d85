#include "GeometryVolume/core/Parallel.h"

#include <algorithm>

namespace VLN {

void parallelChunks(std::int64_t begin, std::int64_t end, std::int64_t grain,
                    FunctionRef<void(std::int64_t, std::int64_t, std::int64_t)> body,
                    Cancellation cancellation) {
  ParallelOptions options;
  options.cancellation = cancellation;
  parallelFor(
      0, chunkCount(begin, end, grain),
      [&](std::int64_t first, std::int64_t last) {
        for (std::int64_t c = first; c < last; ++c) {
          std::int64_t const b = begin + c * grain;
          body(c, b, std::min(end, b + grain));
        }
      },
      options);
}

} // namespace VLN
