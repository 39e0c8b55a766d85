// Places where another thread may come in between: after a check and before what it decides, before a lock,
// after something has become visible. Tests let threads give way there, by a seed, so that rare interleavings
// are met.
//
// Only builds that define VLN_YIELD_POINTS have them; in others nothing of it remains.
#pragma once

#ifdef VLN_YIELD_POINTS
#include "GeometryVolume/core/Export.h"

#include <cstdint>

namespace VLN::Internal {

/// Whether and when threads give way follows from the seed, and from the order in which they begin. 0: never.
VLN_API void setYieldSeed(std::uint64_t seed);
VLN_API void yieldPoint();
/// How often a thread has given way.
VLN_API std::uint64_t yieldCount();

} // namespace VLN::Internal
#define VLN_YIELD_POINT() ::VLN::Internal::yieldPoint()
#else
#define VLN_YIELD_POINT() static_cast<void>(0)
#endif
