// Loops over threads of their own: the renderer stands on the reader alone, which knows no scheduler.
#pragma once

#include "Render/Export.h"

#include <cstdint>
#include <functional>

namespace VLN::Render {

/// Hands [0, count) out in pieces of `grain` to that many threads, the caller among them; 0 takes one for
/// each processor. `watch`, when there is one, is called by the caller's thread between its pieces with the
/// share that was handed out.
/// @error What a body throws is thrown again, once all threads are done.
VLN_RENDER_API void forRanges(std::int64_t count, std::int64_t grain, int threads,
                              std::function<void(std::int64_t begin, std::int64_t end)> const& body,
                              std::function<void(double)> const& watch = {});

} // namespace VLN::Render
