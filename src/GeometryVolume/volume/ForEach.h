// Loops over the samples of fields, in parallel, with their neighbours at hand.
//
//   forEachSample(heat, [](int3 const& p, float& value) { ... });            in place
//   forEachSample(heat, next, [](Neighbors<float> const& n) {                from one field to another
//     return n(0, 0, 0) + 0.1f * (n(-1, 0, 0) + n(1, 0, 0) + ... );
//   });
#pragma once

#include "GeometryVolume/volume/Volume.h"

#include <stdexcept>

namespace VLN::TileTree3D {

/// A sample and those up to one step away on each axis.
template <class T> class Neighbors {
public:
  Neighbors(Stencil<T> const& tile, int i, int j, int k)
      : m_tile(&tile)
      , m_at{i, j, k} {}

  /// Steps from the sample, each in -1..1.
  T const& operator()(int di, int dj, int dk) const {
    return m_tile->value(m_at.x + di, m_at.y + dj, m_at.z + dk);
  }
  int3 position() const {
    return {m_tile->corner.x + m_at.x, m_tile->corner.y + m_at.y, m_tile->corner.z + m_at.z};
  }

private:
  Stencil<T> const* m_tile;
  int3 m_at;
};

namespace Internal {
inline void checkFields(VolumeData const* a, VolumeData const* b, std::string const& from,
                        std::string const& to) {
  if (a != b || from == to)
    throw std::invalid_argument("\"" + from + "\" and \"" + to + "\" are not two fields of one volume");
}
} // namespace Internal

/// Calls `body(TileBlock<T> const&)` for each tile of the deepest depth, in parallel.
template <class T, class Body> void forEachTile(Field<T>& field, Body const& body) {
  field.forEachTileRange([&](std::int64_t begin, std::int64_t end) {
    for (auto n = begin; n < end; ++n)
      if (TileBlock<T> const tile = field.tileBlock(n); tile.values) body(tile);
  });
}

/// Calls `body(Stencil<T> const&, TileBlock<U> const&)` for each tile of the deepest depth, in parallel: the
/// elements of `from` with a layer of those around them, and the elements of `to`.
/// @error std::invalid_argument unless these are two fields of one volume.
template <class T, class U, class Body>
void forEachTile(Field<T> const& from, Field<U>& to, Body const& body) {
  Internal::checkFields(from.volumeData(), to.volumeData(), from.name(), to.name());
  to.forEachTileRange([&](std::int64_t begin, std::int64_t end) {
    Field<T> const reader(from);
    Stencil<T> stencil;
    for (auto n = begin; n < end; ++n) {
      TileBlock<U> const tile = to.tileBlock(n);
      if (!tile.values) continue;
      reader.gather(n, stencil);
      body(static_cast<Stencil<T> const&>(stencil), tile);
    }
  });
}

/// Calls `body(int3 const& position, T& value)` for each sample of the deepest depth, in parallel.
template <class T, class Body> void forEachSample(Field<T>& field, Body const& body) {
  forEachTile(field, [&](TileBlock<T> const& tile) {
    for (int k = 0; k < 4; ++k)
      for (int j = 0; j < 4; ++j)
        for (int i = 0; i < 4; ++i) body(tile.position(i, j, k), tile(i, j, k));
  });
}

/// Writes `body(Neighbors<T> const&)` of `from` to the same sample of `to`, in parallel.
/// @error As forEachTile().
template <class T, class U, class Body>
void forEachSample(Field<T> const& from, Field<U>& to, Body const& body) {
  forEachTile(from, to, [&](Stencil<T> const& stencil, TileBlock<U> const& tile) {
    for (int k = 0; k < 4; ++k)
      for (int j = 0; j < 4; ++j)
        for (int i = 0; i < 4; ++i) tile(i, j, k) = body(Neighbors<T>(stencil, i, j, k));
  });
}

} // namespace VLN::TileTree3D
