// A tree component that reports any counts a test wants.
#pragma once

#include "GeometryVolume/tiletree/Traits.h"
#include "GeometryVolume/tiletree/TreeComponent.h"

#include <array>
#include <vector>

namespace VLN::Test {

class FakeTree final : public TileTree3D::Component {
public:
  explicit FakeTree(Ostil::String const& name = "tree")
      : TileTree3D::Component(name) {}

  std::uint64_t size() const override { return static_cast<std::uint64_t>(elementCount(-1)); }
  void update(VLN::Component const&) override {}
  std::int64_t elementCount(int depth) const override {
    std::int64_t sum = 0;
    forEach(depth, [&](auto const& tiles) {
      for (int n : tiles) sum += n;
    });
    return sum;
  }
  int elementCount(TileTree3D::TreeIndex const& t) const override {
    return elements[static_cast<std::size_t>(t.depth)][static_cast<std::size_t>(t.index)];
  }
  std::int64_t tileCount(int depth) const override {
    std::int64_t sum = 0;
    forEach(depth, [&](auto const& tiles) { sum += static_cast<std::int64_t>(tiles.size()); });
    return sum;
  }

  /// `n` tiles of `each` elements at a depth.
  FakeTree& set(int depth, std::size_t n, int each = 0) {
    elements[static_cast<std::size_t>(depth)].assign(n, each);
    return *this;
  }

  /// Elements of each tile, by depth.
  std::array<std::vector<int>, TileTree3D::kChannelDepths> elements;

private:
  template <class F> void forEach(int depth, F const& f) const {
    for (int d = 0; d < TileTree3D::kChannelDepths; ++d)
      if (depth == -1 || depth == d) f(elements[static_cast<std::size_t>(d)]);
  }
};

/// A component that counts nothing.
class Stranger final : public VLN::Component {
public:
  std::uint64_t size() const override { return 0; }
  void update(VLN::Component const&) override {}
};

} // namespace VLN::Test
