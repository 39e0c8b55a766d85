// ArrayPool: recycles arrays that channels export to, while it is enabled.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "Ostil/Array.h"
#include "Ostil/Ptr.h"

#include <cstdint>

namespace VLN::TileTree3D::ArrayPool {

/// Whether exports take their arrays from the pool. Off for as long as the library has no pool.
VLN_API bool enabled();
/// An array of `elementCount` times `defaultValue` that nobody else holds; null while the pool is off.
/// Exists for the enabled element types.
template <class T> VLN_API Ostil::Ptr<Ostil::Array<T>> allocate(T defaultValue, std::uint64_t elementCount);

} // namespace VLN::TileTree3D::ArrayPool
