// Stands in for the pool: it is never enabled and hands out nothing.
#include "GeometryVolume/pools/ArrayPool.h"

#include "GeometryVolume/core/ElementTypes.h"

namespace VLN::TileTree3D::ArrayPool {

bool enabled() { return false; }

template <class T> Ostil::Ptr<Ostil::Array<T>> allocate(T, std::uint64_t) { return nullptr; }

#define VLN_INSTANTIATE(type, name)                                                                          \
  template VLN_API Ostil::Ptr<Ostil::Array<type>> allocate<type>(type, std::uint64_t);
VLN_FOR_EACH_ELEMENT_TYPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D::ArrayPool
