#include "GeometryVolume/core/ObjTextImpl.h"
#include "GeometryVolume/tiletree/Container.h"

#include <fstream>

namespace VLN::TileTree3D {

namespace {

// The names are those of the file format's users; the colours are three shades of one warm tone.
constexpr char const* kMaterials[] = {"newmtl RED",           "Ka 0.914 0.813 0.664", "Kd 0.914 0.813 0.664",
                                      "Ks 0.914 0.813 0.664", "newmtl GREEN",         "Ka 0.828 0.684 0.547",
                                      "Kd 0.828 0.684 0.547", "Ks 0.828 0.684 0.547", "newmtl BLUE",
                                      "Ka 0.719 0.461 0.297", "Kd 0.719 0.461 0.297", "Ks 0.719 0.461 0.297"};
constexpr char const* kUses[] = {"usemtl RED", "usemtl GREEN", "usemtl BLUE"};

} // namespace

template <class TraitsT> void Container<TraitsT>::dumpObj(Ostil::String const& filename, int depth) const {
  {
    std::ofstream file("tile_tree.mtl");
    VLN::Internal::ObjText text(file);
    for (char const* line : kMaterials) text.line(line);
  }
  std::ofstream file(filename);
  VLN::Internal::ObjText text(file);
  text.line("mtllib tile_tree.mtl");
  float const s = voxelSize();
  auto const onLiveTiles = [&](auto const& body) {
    for (std::int64_t n = 0; n < tileCount(depth); ++n) {
      if (tile(n, depth).valid()) body(tile(n, depth));
    }
  };
  onLiveTiles([&](TileType const& t) {
    auto const at = [s](int c) { return static_cast<float>(c) * s; };
    int const w = t.tileVoxelWidth();
    text.boxVertices({at(t.ti()), at(t.tj()), at(t.tk())}, {at(t.ti() + w), at(t.tj() + w), at(t.tk() + w)});
  });
  std::int64_t base = 1;
  onLiveTiles([&](TileType const& t) {
    // One step along any axis changes the sum by one: tiles that share a face differ.
    auto const position = [&](int c) { return TraitsT::quotient(TraitsT::offset(c), t.depth()); };
    text.line(kUses[(position(t.ti()) + position(t.tj()) + position(t.tk())) % 3]);
    text.boxFaces(base);
    base += 8;
  });
}

#define VLN_INSTANTIATE(TraitsT)                                                                             \
  template VLN_API void Container<TraitsT>::dumpObj(Ostil::String const&, int) const;
VLN_FOR_EACH_SHAPE(VLN_INSTANTIATE)

} // namespace VLN::TileTree3D
