#include "support/FlatChecks.h"

#include "support/Print.h"

namespace Support {

void expectFlatTree(FlatVolume const& volume, FlatOptions const& options, FlatExpectation const& expected,
                    FlatModel const& model, std::string const& label) {
  ASSERT_EQ(model.rootDepth, expected.rootDepth) << label;
  ASSERT_EQ(model.accum, expected.accum) << label;
  if (expected.tiles.empty()) return;
  for (int a = 0; a < 3; ++a) ASSERT_EQ(model.llc[a], expected.llc[a]) << label;
  ASSERT_EQ(model.tiles.size(), expected.tiles.size()) << label;
  for (std::size_t n = 0; n < expected.tiles.size(); ++n) {
    auto const& e = *expected.tiles[n];
    auto const& tile = model.tiles[n];
    ASSERT_EQ(tile.depth, e.depth) << label << ", tile " << n;
    for (int a = 0; a < 3; ++a) ASSERT_EQ(tile.corner[a], e.corner[a]) << label << ", tile " << n;
    auto const* const parent = expected.numberedParent(e);
    ASSERT_EQ(tile.parent, parent ? parent->number : FlatModel::kNone) << label << ", tile " << n;
    bool const complete = e.head && e.full == e.height;
    ASSERT_EQ(tile.levels, e.head && !complete ? e.full : 0) << label << ", tile " << n;
    ASSERT_TRUE(!complete || tile.isLeaf()) << label << ", tile " << n;
  }

  // From every tile, and from random points near them.
  std::mt19937 random(17);
  auto const accessor = volume.tree.tileAccessor();
  auto const expectAt = [&](int3 const& p, int depth) {
    auto const& tile = accessor.tile(p.x, p.y, p.z, depth, false);
    FlatExpectation::Entry const* e = tile.valid() && tile.depth() >= expected.rootDepth
                                          ? expected.find(tile.tijk(), tile.depth())
                                          : nullptr;
    while (e && e->marked) e = expected.parent(*e);
    ASSERT_EQ(model.find(p, depth), e ? e->number : FlatModel::kNone)
        << label << ", at " << p.x << ' ' << p.y << ' ' << p.z << ", depth " << depth;
  };
  for (auto const& [place, e] : expected.entries) {
    expectAt(e.corner, e.depth);
    int3 p;
    for (int a = 0; a < 3; ++a) {
      std::int64_t const w = FlatTraits::width(e.depth);
      std::int64_t const c =
          e.corner[a] - w / 2 + static_cast<std::int64_t>(random() % static_cast<std::uint64_t>(2 * w));
      p[a] =
          static_cast<int>(std::clamp<std::int64_t>(c, FlatTraits::kMinTileCoord, FlatTraits::kMaxTileCoord));
    }
    expectAt(p, options.maxDepth());
    expectAt(p, e.depth);
    if (::testing::Test::HasFatalFailure()) return;
  }
}

std::uint64_t flatBufferSize(FlatModel const& model, FlatOptions const& options) {
  std::uint64_t size = model.containerSize;
  for (auto const& grid : model.grids) size += grid.size;
  size = size / 32 * 32 + 32;
  auto const element = static_cast<std::uint64_t>(std::max(1, options.elementBytes));
  if (options.cubic) {
    std::uint64_t s = 0;
    while (s * s * s * element < size) ++s;
    return element * s * s * s;
  }
  std::uint64_t const unit = element * 16384;
  return (size + unit - 1) / unit * unit;
}

} // namespace Support
