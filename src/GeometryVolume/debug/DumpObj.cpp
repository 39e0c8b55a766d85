#include "GeometryVolume/debug/DumpObj.h"

#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/ObjTextImpl.h"

#if VLN_HAS_ELEMENT_FLOAT3

#include <fstream>

namespace Test {

using Velorn::Math::float3;
using VLN::TileTree3D::Channel;

template <class TraitsT>
void dumpObj(Channel<TraitsT, float3, TraitsT::kTileDataWidth, 0> const& channel, float size,
             Ostil::String const& filename) {
  std::ofstream file(filename);
  VLN::Internal::ObjText text(file);
  std::int64_t base = 1;
  float3 const half{size, size, size};
  for (auto p = channel.cbegin(); p != channel.cend(); ++p, base += 8) {
    text.boxVertices(*p - half, *p + half);
    text.boxFaces(base);
  }
}

#define VLN_INSTANTIATE(TraitsT)                                                                             \
  template VLN_API void dumpObj(Channel<TraitsT, float3, TraitsT::kTileDataWidth, 0> const&, float,          \
                                Ostil::String const&);
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace Test

#endif
