// A voxel channel in an object, and beside it every value that it must hold, by the place of its tile.
#pragma once

#include "GeometryVolume/channels/NonLeafValues.h"
#include "GeometryVolume/core/Object.h"
#include "GeometryVolume/topology/VoxelTopology.h"
#include "channels/HaloModel.h"
#include "support/Choices.h"
#include "support/TreeModel.h"

#include <map>
#include <memory>
#include <string>
#include <vector>

namespace Support {

/// Fields of all element types and layouts, as the walk over operations uses them.
template <class TraitsT> class AnyField {
public:
  using Tree = Container<TraitsT>;
  using Topology = VLN::TileTree3D::VoxelTopology<TraitsT>;
  using Set = typename TreeModel<TraitsT>::Set;

  virtual ~AnyField() = default;
  /// Tiles that went lose their values, new ones have the default value.
  virtual void follow(Set const& tiles) = 0;
  virtual void check(Tree const& tree, VLN::Object const& object) const = 0;
  virtual void write(Tree const& tree, VLN::Object& object, Choices& choices) = 0;
  virtual void setRange(Topology const& topology, VLN::Object& object, Set const& tiles,
                        Choices& choices) = 0;
  virtual void setNonLeafValues(Tree const& tree, VLN::Object& object, Choices& choices) = 0;
  virtual void checkHalo(Tree const& tree, VLN::Object const& object, Choices& choices) const = 0;
  /// Steps that must not change any value.
  virtual void tidy(VLN::Object& object, Choices& choices) = 0;
  /// A copy, the values that it had, and a test that it still has them.
  struct Copy {
    virtual ~Copy() = default;
    virtual void check() const = 0;
    virtual void write(Choices& choices) = 0;
  };
  virtual std::unique_ptr<Copy> copy(VLN::Object const& object, Choices& choices) const = 0;
};

template <class TraitsT, class T, int Extended, int H> class Field final : public AnyField<TraitsT> {
public:
  using Base = AnyField<TraitsT>;
  using typename Base::Copy;
  using typename Base::Set;
  using typename Base::Topology;
  using typename Base::Tree;
  static constexpr int W = TraitsT::kTDW;
  using C = VLN::TileTree3D::Channel<TraitsT, T, W + Extended, H>;

  Field(std::string name, Topology const& topology, VLN::Object& object, Set const& tiles, Choices& choices)
      : m_name(std::move(name))
      , m_default(VLN::Test::value<T>(static_cast<std::uint64_t>(choices.below(5)))) {
    m_low = choices.below(3) ? 0 : choices.below(TraitsT::kDepths);
    m_high = choices.below(3) ? 28 : choices.below(TraitsT::kDepths);
    auto channel = Ostil::makePtr<C>(m_name, &m_default, VLN::TileTree3D::kInitializeDefaultValue,
                                     choices.coin(), true, m_low, m_high);
    channel->setTargetName(topology.name());
    channel->update(topology);
    object.addComponent(channel);
    follow(tiles);
  }

  void follow(Set const& tiles) override {
    for (auto at = m_values.begin(); at != m_values.end();)
      at = tiles.count(at->first) && inRange(at->first) ? std::next(at) : m_values.erase(at);
    for (VoxelCoord const& at : tiles) {
      if (inRange(at)) m_values.try_emplace(at, std::size_t(C::kSize), m_default);
    }
  }

  void check(Tree const& tree, VLN::Object const& object) const override {
    auto const channel = object.template component<C>(m_name);
    ASSERT_TRUE(channel) << m_name;
    ASSERT_EQ(channel->minDepth(), m_low);
    ASSERT_EQ(channel->depth(), m_high);
    ASSERT_EQ(std::as_const(*channel).defaultValue(), m_default);
    std::int64_t total = 0;
    for (int d = 0; d <= TraitsT::kMaxDepth; ++d) {
      std::int64_t const expected = d >= m_low && d <= m_high ? tree.tileCount(d) : 0;
      ASSERT_EQ(channel->tileCount(d), expected) << m_name << " at depth " << d;
      ASSERT_EQ(channel->elementCount(d), expected * C::kSize);
      total += expected;
      for (std::int64_t n = 0; n < expected; ++n) {
        auto const data = std::as_const(*channel).tileData(n, d);
        VoxelCoord const at = tree.tile(n, d).voxelCoord();
        ASSERT_EQ(data.size(), C::kSize) << m_name << " at " << at;
        auto const& values = m_values.at(at);
        for (int e = 0; e < C::kSize; ++e) {
          if (VLN::Test::sameBytes(data(e), values[static_cast<std::size_t>(e)])) continue;
          FAIL() << m_name << ", element " << e << " of the tile at " << at << " differs";
        }
      }
    }
    ASSERT_EQ(channel->tileCount(-1), total);
    ASSERT_EQ(channel->elementCount(-1), total * C::kSize);
  }

  void write(Tree const& tree, VLN::Object& object, Choices& choices) override {
    auto channel = object.template extractComponent<C>(m_name);
    channel->cloneData();
    for (int n = choices.below(12); n >= 0 && !m_values.empty(); --n) {
      auto const tile = std::next(m_values.begin(), choices.below(static_cast<int>(m_values.size())));
      auto data = channel->tileData(tree.tileAccessor().tile(tile->first, true).treeIndex());
      // Whole tiles and single elements.
      int const first = choices.below(C::kSize + 1) % C::kSize,
                last = choices.below(2) ? first : C::kSize - 1;
      for (int e = first; e <= last; ++e)
        tile->second[static_cast<std::size_t>(e)] = data(e) = VLN::Test::value<T>(m_next++);
    }
    object.putComponent(std::move(channel));
  }

  void setRange(Topology const& topology, VLN::Object& object, Set const& tiles, Choices& choices) override {
    auto channel = object.template extractComponent<C>(m_name);
    if (choices.coin())
      channel->setMinDepth(m_low = choices.below(TraitsT::kDepths), topology);
    else
      channel->setDepth(m_high = choices.below(TraitsT::kDepths), topology);
    object.putComponent(std::move(channel));
    follow(tiles);
  }

  void setNonLeafValues(Tree const& tree, VLN::Object& object, Choices& choices) override {
    if constexpr (H <= 1) {
      using Tile = typename C::ConstTile;
      auto const type = static_cast<VLN::TileTree3D::VoxelOffsetType>(choices.below(8));
      int const first = choices.within(TraitsT::kMaxDepth), last = choices.below(TraitsT::kDepths + 1);
      auto channel = object.template extractComponent<C>(m_name);
      channel->cloneData();
      setNonLeafValueToChildValue(*channel, tree, type, first, last);
      EXPECT_FALSE(
          checkIfNonLeafValueIsSetToChildValue(std::as_const(*channel), tree, type, 0.0f, first, last));
      object.putComponent(std::move(channel));
      int const high = std::min({last, m_high - 1, TraitsT::kMaxDepth - 1});
      for (int d = high; d >= std::max(m_low, first); --d) {
        for (auto& [at, values] : m_values) {
          if (at.depth != d) continue;
          int const step = TraitsT::width(d) / W, perVoxel = W / TraitsT::kTW;
          for (int k = 0; k < W; ++k) {
            for (int j = 0; j < W; ++j) {
              for (int i = 0; i < W; ++i) {
                VoxelCoord const child{at.i + i / perVoxel * perVoxel * step,
                                       at.j + j / perVoxel * perVoxel * step,
                                       at.k + k / perVoxel * perVoxel * step, d + 1};
                auto const below = m_values.find(child);
                if (below == m_values.end()) continue;
                int const ijk[3] = {i, j, k};
                int c[3];
                for (int a = 0; a < 3; ++a) {
                  c[a] = type & (1 << a) ? 0 : Tile::kCore / 2;
                  if (TraitsT::kTW == 2) c[a] += ijk[a] % 2 * 2;
                }
                int from = Tile::index(c[0], c[1], c[2]);
                constexpr int end = Tile::kCore - 1;
                if (from >= C::kSize)
                  from = Tile::index(std::min(c[0], end), std::min(c[1], end), std::min(c[2], end));
                values[static_cast<std::size_t>(Tile::index(i, j, k))] =
                    below->second[static_cast<std::size_t>(from)];
              }
            }
          }
        }
      }
    }
  }

  void checkHalo(Tree const& tree, VLN::Object const& object, Choices& choices) const override {
    if constexpr (Extended == 0 && H == 0) {
      using namespace VLN::TileTree3D;
      auto const source = object.template component<C>(m_name);
      using Target = Channel<TraitsT, T, W, 1>;
      using Model = VLN::Test::HaloModel<TraitsT, C>;
      Target const before = VLN::Test::channelOn<Target>(tree, VLN::Test::value<T>(9));
      Target target(before);
      bool const plain = choices.coin();
      typename Model::Request const request{
          static_cast<HaloMode>(choices.below(7)), static_cast<HaloType>(choices.below(8)), 2.5f,
          choices.coin() ? 1.0f : 0.5f, static_cast<VoxelOffsetType>(choices.below(8))};
      if (plain)
        computeHalo<TraitsT, T, 0, 0, 0, 1>(*source, tree, target, -1, -1);
      else
        computeHalo<TraitsT, T, W, 0, 1>(request.mode, request.type, 0, TraitsT::kMaxDepth, *source, tree,
                                         target, request.scale, request.offsetType, request.constant);
      Model const model(tree, *source);
      int const low = std::max(m_low, 0), high = std::min(m_high, TraitsT::kMaxDepth);
      VLN::Test::forTiles(tree, 0, TraitsT::kMaxDepth, [&](auto const& tile) {
        auto const data = std::as_const(target).tileData(tile.treeIndex());
        auto const old = before.tileData(tile.treeIndex());
        auto const* parent =
            tile.isRoot() || tile.depth() == low ? nullptr : &tree.tile(tile.parentTreeIndex());
        auto const parentData =
            parent ? std::as_const(target).tileData(parent->treeIndex()) : typename Target::ConstTile();
        VLN::Test::forBox(-1, W, [&](int i, int j, int k) {
          T expected = old(i, j, k);
          auto const own = [&](int a, int b, int c) { return data(a, b, c); };
          if (tile.depth() < low || tile.depth() > high) {
            // Not touched.
          } else if (plain) {
            expected = model.plain(tile, i, j, k, kHaloModeReplicate, parent, &parentData);
          } else if (auto const filled = model.moded(tile, i, j, k, request, own)) {
            expected = *filled;
          }
          if (::testing::Test::HasFailure()) return;
          ASSERT_TRUE(VLN::Test::sameBytes(expected, data(i, j, k)))
              << m_name << (plain ? ", plain halo" : ", halo with mode ") << request.mode << " type "
              << request.type << " of the tile at " << tile.voxelCoord() << " at " << i << ' ' << j << ' '
              << k;
        });
      });
    }
  }

  void tidy(VLN::Object& object, Choices& choices) override {
    auto channel = object.template extractComponent<C>(m_name);
    auto const type = Ostil::Any(std::type_index(typeid(T)));
    switch (choices.below(5)) {
    case 0:
      channel->compactStorage();
      break;
    case 1:
      channel->cloneData();
      break;
    case 2:
      channel->setChannelData(0, type, channel->channelData(0, type));
      break;
    case 3:
      channel->setChannelData(3, type, channel->channelData(3, type));
      break;
    default: {
      Ostil::Ptr<VLN::Component> copy;
      channel->copyTo(copy);
      object.addComponent(copy);
      return;
    }
    }
    object.putComponent(std::move(channel));
  }

  std::unique_ptr<Copy> copy(VLN::Object const& object, Choices& choices) const override {
    return std::make_unique<Kept>(object.template component<C>(m_name), choices.below(3), *this);
  }

private:
  bool inRange(VoxelCoord const& at) const { return at.depth >= m_low && at.depth <= m_high; }

  /// Another channel with the same data. What happens to either must not be seen in the other.
  struct Kept final : Copy {
    Kept(Ostil::Ptr<C> const& from, int kind, Field const& field)
        : handle(kind == 2 ? from : Ostil::Ptr<C>())
        , channel(*from) {
      if (kind == 1) channel = *from;
      for (auto const& v : std::as_const(*from)) values.push_back(v);
      EXPECT_EQ(values.size(), field.m_values.size() * std::size_t(C::kSize));
    }
    void check() const override {
      std::size_t n = 0;
      if (handle) {
        ASSERT_EQ(handle->size(), values.size());
        for (auto const& v : std::as_const(*handle))
          ASSERT_TRUE(VLN::Test::sameBytes(v, values[n++])) << "a shared handle sees a write";
        return;
      }
      ASSERT_EQ(channel.size(), values.size());
      for (auto const& v : std::as_const(channel))
        ASSERT_TRUE(VLN::Test::sameBytes(v, values[n++])) << "a copy sees a write";
    }
    void write(Choices& choices) override {
      if (handle || values.empty()) return;
      channel.cloneData();
      std::size_t const n = static_cast<std::size_t>(choices.below(static_cast<int>(values.size())));
      values[n] = VLN::Test::value<T>(static_cast<std::uint64_t>(choices.byte()));
      channel[static_cast<std::int64_t>(n)] = values[n];
    }
    Ostil::Ptr<C> handle;
    C channel;
    std::vector<T> values;
  };

  std::string m_name;
  T m_default;
  int m_low = 0, m_high = 28;
  std::uint64_t m_next = 10;
  std::map<VoxelCoord, std::vector<T>, typename TreeModel<TraitsT>::Less> m_values;
};

} // namespace Support
