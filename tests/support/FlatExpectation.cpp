#include "support/FlatExpectation.h"

#include <algorithm>

namespace Support {

namespace {

/// Bits of the three coordinates, x lowest, from the most significant down.
bool mortonLess(int3 const& a, int3 const& b) {
  for (int bit = 31; bit >= 0; --bit)
    for (int axis = 2; axis >= 0; --axis) {
      auto const u = [&](int3 const& p) { return (std::int64_t(p[axis]) + 536870912) >> bit & 1; };
      if (u(a) != u(b)) return u(a) < u(b);
    }
  return false;
}

} // namespace

FlatExpectation::FlatExpectation(FlatTree const& tree, FlatOptions const& options,
                                 std::optional<int> contentDepth)
    : maxDepth(options.maxDepth()) {
  chooseRootDepth(tree, options, contentDepth);
  for (int d = rootDepth + 1; d <= 28; ++d)
    for (std::int64_t n = 0; n < tree.tileCount(d); ++n) refused |= tree.tile(n, d).isRoot();
  if (refused) return;
  for (int d = rootDepth; d <= maxDepth; ++d)
    for (std::int64_t n = 0; n < tree.tileCount(d); ++n) {
      auto const& tile = tree.tile(n, d);
      Entry e;
      e.index = n, e.depth = d, e.corner = tile.tijk();
      entries[{d, tile.ti(), tile.tj(), tile.tk()}] = e;
    }
  if (options.coalesce) findBlocks();
  number(options);
  placeHalos(tree, options);
  for (Entry const* e : tiles) ++(e->halo ? haloTiles : nonHaloTiles);
}

void FlatExpectation::chooseRootDepth(FlatTree const& tree, FlatOptions const& options,
                                      std::optional<int> contentDepth) {
  // Root entries that the tiles of a depth span, and their lowest corner.
  auto const span = [&](int d) {
    std::int64_t most = 0;
    for (int a = 0; a < 3; ++a) {
      std::int64_t low = INT64_MAX, high = INT64_MIN;
      for (std::int64_t n = 0; n < tree.tileCount(d); ++n) {
        std::int64_t const c = tree.tile(n, d).tijk()[a];
        low = std::min(low, c), high = std::max(high, c + FlatTraits::width(d));
      }
      if (tree.tileCount(d))
        llc[a] = static_cast<int>(low), most = std::max(most, (high - low) / FlatTraits::width(d));
    }
    return most;
  };
  rootDepth = 0;
  for (int d = 28 - std::clamp(std::max(options.rootLevelLimit, options.finestLevel), 0, 28); d >= 0; --d)
    if (tree.tileCount(d) && span(d) <= 64) {
      rootDepth = d;
      break;
    }
  if (contentDepth) rootDepth = std::min(rootDepth, *contentDepth);
  while (rootDepth > 0 && span(rootDepth) > 64) --rootDepth;
  span(rootDepth);
}

void FlatExpectation::findBlocks() {
  for (int d = maxDepth - 1; d >= rootDepth; --d)
    for (auto& [place, e] : entries) {
      if (e.depth != d) continue;
      int const count = [&] {
        int n = 0;
        for (int slot = 0; slot < 8; ++slot)
          if (Entry const* c = child(e, slot)) e.height = std::max(e.height, c->height + 1), ++n;
        return n;
      }();
      if (count < 8) continue;
      if (d == maxDepth - 1) {
        e.full = 1;
      } else {
        int const f = child(e, 0)->full;
        bool same = f < 3;
        for (int slot = 0; slot < 8; ++slot) same &= child(e, slot)->full == f;
        if (same) e.full = f + 1;
      }
      if (e.full)
        for (int slot = 0; slot < 8; ++slot) const_cast<Entry*>(child(e, slot))->marked = true;
    }
  for (auto& [place, e] : entries) e.head = e.full > 0 && (e.depth == rootDepth || !parent(e)->full);
}

void FlatExpectation::number(FlatOptions const& options) {
  for (int d = rootDepth; d <= maxDepth; ++d) {
    std::vector<Entry*> list;
    for (auto& [place, e] : entries)
      if (e.depth == d) list.push_back(&e);
    std::sort(list.begin(), list.end(), [&](Entry const* a, Entry const* b) {
      return options.morton ? mortonLess(a->corner, b->corner) : a->index < b->index;
    });
    for (Entry* e : list)
      if (!e->marked) {
        e->number = static_cast<std::uint32_t>(tiles.size());
        tiles.push_back(e);
      }
    accum[static_cast<std::size_t>(d) + 1] = static_cast<std::uint32_t>(tiles.size());
  }
  for (std::size_t d = static_cast<std::size_t>(std::max(maxDepth, rootDepth)) + 1; d < 30; ++d)
    accum[d] = static_cast<std::uint32_t>(tiles.size());
}

void FlatExpectation::placeHalos(FlatTree const& tree, FlatOptions const& options) {
  float const fraction = options.haloFraction;
  if (!(fraction > 0) || entries.empty()) return;
  auto const total = static_cast<float>(entries.size());
  int d = rootDepth + 1;
  for (float share = 0; share < fraction && d <= maxDepth; ++d)
    share = static_cast<float>(accum[static_cast<std::size_t>(d) + 1]) / total;
  int const depth = std::max(rootDepth + 1, d - 1);
  float const a = static_cast<float>(accum[static_cast<std::size_t>(depth)]) / total;
  auto const budget = static_cast<std::int64_t>((fraction - std::min(a, fraction)) * total);

  auto const accessor = tree.tileAccessor();
  for (auto& [place, e] : entries) {
    if (e.marked) continue;
    if (e.depth == rootDepth) {
      e.halo = true;
      continue;
    }
    bool ok = true;
    int c = 0;
    std::int64_t const w = FlatTraits::width(e.depth);
    for (int n = 1; n < 8 && ok; ++n) {
      int const di = n >> 2, dj = n >> 1 & 1, dk = n & 1;
      std::int64_t const at[3] = {e.corner.x + di * w, e.corner.y + dj * w, e.corner.z + dk * w};
      if (*std::max_element(at, at + 3) > FlatTraits::kMaxTileCoord) continue;
      auto const& tile = accessor.tile(static_cast<int>(at[0]), static_cast<int>(at[1]),
                                       static_cast<int>(at[2]), e.depth, false);
      if (!tile.valid()) continue;
      int const weight = di + dj + dk == 1 ? 4 : di + dj + dk == 2 ? 2 : 1;
      if (tile.depth() < e.depth) c += weight;
      if (tile.depth() < e.depth - 1) ok = false;
    }
    bool const past = e.depth > depth || (e.depth == depth && e.index >= budget);
    bool const edge = e.depth == maxDepth || tree.tile(e.index, e.depth).hasLeaves();
    e.halo = !(ok && fraction < 1 && (past || (!edge && c == 0)));
  }
}

} // namespace Support
