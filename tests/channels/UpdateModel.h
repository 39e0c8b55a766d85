// A map of vectors that does what a channel does, one obvious step at a time.
#pragma once

#include "FakeTree.h"
#include "GeometryVolume/channels/ChannelTypes.h"
#include "ProbeChannel.h"
#include "TestValues.h"

#include <algorithm>
#include <map>
#include <numeric>
#include <optional>
#include <random>
#include <set>
#include <sstream>
#include <tuple>
#include <utility>

namespace VLN::Test {

using TileTree3D::TreeIndex;

/// Elements by tile, for one channel. Unwritten elements are nullopt until a test writes them.
template <class T> class UpdateModel {
public:
  using Elements = std::vector<std::optional<T>>;

  TileTree3D::ChannelLayout layout;
  bool construct = true, empty = false;
  int minDepth = 0, depth = 28;
  T defaultValue{};
  std::map<int, std::vector<Elements>> tiles;

  void resizeTiles(FakeTree const& tree) {
    for (int d = minDepth; d <= depth; ++d) {
      auto& list = tiles[d];
      auto const n = static_cast<std::size_t>(tree.tileCount(d));
      while (list.size() > n) list.pop_back();
      while (list.size() < n) {
        auto const size = layout.fixedSize() ? layout.size : tree.elements[std::size_t(d)][list.size()];
        list.emplace_back(empty ? 0 : size, construct ? std::optional<T>(defaultValue) : std::nullopt);
      }
    }
  }
  void removeTiles(TileTree3D::TileRemovalList const& removed, FakeTree const& tree) {
    for (std::size_t d = 0; d < removed.size(); ++d)
      for (auto const& [to, from] : removed[d])
        if (auto& list = tiles[int(d)]; from < std::int64_t(list.size()))
          list[std::size_t(to)] = Elements(list[std::size_t(from)]);
    resizeTiles(tree);
  }
  void permute(TileTree3D::TilePermutation const& newToOld) {
    for (std::size_t d = 0; d < newToOld.size(); ++d) {
      auto& list = tiles[int(d)];
      if (list.empty()) continue;
      std::vector<Elements> fresh;
      for (auto old : newToOld[d]) fresh.push_back(list[std::size_t(old)]);
      if (!fresh.empty()) list = fresh;
    }
  }
  void setRange(int low, int high, FakeTree const& tree) {
    for (auto& [d, list] : tiles)
      if (d < low || d > high) list.clear();
    minDepth = low, depth = high;
    resizeTiles(tree);
  }
  /// All arrivals in source order, then the removals of each tile.
  void move(TileTree3D::ElementMoves lists) {
    using TileTree3D::ElementToFrom;
    std::map<std::pair<int, std::int64_t>, std::set<int>> leaving;
    auto const before = tiles;
    for (std::size_t d = 0; d < lists.size(); ++d) {
      std::stable_sort(lists[d].begin(), lists[d].end(), [](ElementToFrom const& a, ElementToFrom const& b) {
        return std::tie(a.fromDepth, a.from, a.fromElement) < std::tie(b.fromDepth, b.from, b.fromElement);
      });
      for (ElementToFrom const& m : lists[d]) {
        leaving[{m.fromDepth, m.from}].insert(m.fromElement);
        if (m.to < 0) continue;
        tiles[int(d)][std::size_t(m.to)].push_back(
            before.at(m.fromDepth)[std::size_t(m.from)][std::size_t(m.fromElement)]);
      }
    }
    for (auto const& [tile, positions] : leaving) {
      auto& list = tiles[tile.first][std::size_t(tile.second)];
      std::set<int> left = positions;
      while (!left.empty()) {
        int const last = int(list.size()) - 1;
        if (left.count(last)) {
          left.erase(last);
        } else {
          list[std::size_t(*left.begin())] = list.back();
          left.erase(left.begin());
        }
        list.pop_back();
      }
    }
  }
  void growElements(FakeTree const& tree) {
    for (auto& [d, list] : tiles)
      for (std::size_t i = 0; i < list.size(); ++i)
        if (int const n = tree.elements[std::size_t(d)][i]; n > int(list[i].size()))
          list[i].resize(std::size_t(n), T{});
  }

  std::int64_t tileCount(int d) const {
    auto const at = tiles.find(d);
    return at == tiles.end() ? 0 : std::int64_t(at->second.size());
  }
};

/// First difference between a channel and its model, as text; empty when there is none.
template <class C, class T> std::string difference(C const& channel, UpdateModel<T> const& model) {
  std::ostringstream os;
  std::int64_t total = 0, elements = 0;
  for (int d = 0; d < TileTree3D::kChannelDepths; ++d) {
    if (channel.tileCount(d) != model.tileCount(d)) {
      os << "depth " << d << " has " << channel.tileCount(d) << " tiles, not " << model.tileCount(d);
      return os.str();
    }
    total += channel.tileCount(d);
    for (std::int64_t i = 0; i < channel.tileCount(d); ++i) {
      auto const& wanted = model.tiles.at(d)[std::size_t(i)];
      auto const tile = channel.tileData(i, d);
      elements += std::int64_t(wanted.size());
      if (tile.size() != int(wanted.size())) {
        os << "tile " << i << " of depth " << d << " has " << tile.size() << " elements, not "
           << wanted.size();
        return os.str();
      }
      for (int n = 0; n < tile.size(); ++n)
        if (wanted[std::size_t(n)] && !(tile[n] == *wanted[std::size_t(n)])) {
          os << "element " << n << " of tile " << i << " of depth " << d << " differs";
          return os.str();
        }
    }
  }
  if (channel.tileCount(-1) != total) return "the total of tiles is wrong";
  if (channel.elementCount(-1) != elements) return "the total of elements is wrong";
  return "";
}

} // namespace VLN::Test
