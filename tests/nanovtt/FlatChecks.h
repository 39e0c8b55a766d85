// Compares a flat buffer with the volume that it was made from, by the slow reader and the slow model.
#pragma once

#include "FlatExpectation.h"
#include "FlatModel.h"
#include "FlatVolume.h"

#include "GeometryVolume/channels/Halo.h"
#include "GeometryVolume/channels/NonLeafValues.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <cstring>
#include <limits>
#include <utility>
#include <vector>

namespace Support {

template <class T> struct FlatType;
#define FLAT_TYPE(type, value)                                                                               \
  template <> struct FlatType<type> { static constexpr std::uint32_t kValue = value; };
FLAT_TYPE(float, 1)
FLAT_TYPE(double, 2)
FLAT_TYPE(std::int16_t, 3)
FLAT_TYPE(std::int32_t, 4)
FLAT_TYPE(std::int64_t, 5)
FLAT_TYPE(Velorn::Math::float3, 6)
FLAT_TYPE(Velorn::Math::double3, 7)
FLAT_TYPE(std::uint32_t, 10)
FLAT_TYPE(Velorn::Math::float4, 17)
#undef FLAT_TYPE

template <class BuildT> constexpr std::uint32_t flatFloatType() {
  if constexpr (std::is_same_v<BuildT, nanovdb::Fp4>)
    return 13;
  else if constexpr (std::is_same_v<BuildT, nanovdb::Fp8>)
    return 14;
  else if constexpr (std::is_same_v<BuildT, nanovdb::Fp16>)
    return 15;
  else if constexpr (std::is_same_v<BuildT, nanovdb::FpN>)
    return 16;
  else
    return 1;
}

/// How many codes a tile of the build has at most, less one.
constexpr double flatLastCode(std::uint32_t type) { return type == 13 ? 15 : type == 14 ? 255 : 65535; }

template <class T> class FlatGridCheck {
public:
  using Samples = std::vector<T>;

  FlatGridCheck(FlatVolume const& volume, FlatOptions const& options, FlatExpectation const& expected,
                FlatModel const& model, FlatModel::Grid const& grid, std::string const& label)
      : m_volume(volume)
      , m_options(options)
      , m_expected(expected)
      , m_model(model)
      , m_grid(grid)
      , m_label(label + ", grid " + grid.name)
      , m_channel(volume.object->template component<FlatChannel<T>>(grid.name)) {
    if (options.setCoarser && grid.type != 16) setCoarserLevels();
  }

  void run(float tolerance) {
    checkHeader();
    auto accessor = m_volume.tree.tileAccessor();
    for (std::size_t n = 0; n < m_expected.tiles.size() && !::testing::Test::HasFatalFailure(); ++n) {
      auto const& e = *m_expected.tiles[n];
      if (FlatModel::isQuantised(m_grid.type))
        checkQuantised(n, e, tolerance);
      else if (m_options.textures)
        checkBytes(
            n, samples(e, true),
            m_model.template brick<T>(m_grid, textureDim(), brickAt(n, 0), brickAt(n, 1), brickAt(n, 2)));
      else
        checkBlock(n, e);
    }
    checkBox();
  }

private:
  using Entry = FlatExpectation::Entry;

  void setCoarserLevels() {
    auto const type = VLN::TileTree3D::kVoxelOffsetCorner;
    if (!checkIfNonLeafValueIsSetToChildValue(*m_channel, m_volume.tree, type, m_options.coarserTolerance,
                                              m_expected.rootDepth, 28))
      return;
    Ostil::Ptr<VLN::Component> copy;
    m_channel->copyTo(copy);
    m_channel = Ostil::dynamicCast<FlatChannel<T>>(copy);
    setNonLeafValueToChildValue(const_cast<FlatChannel<T>&>(*m_channel), m_volume.tree, type,
                                m_expected.rootDepth, m_channel->depth());
  }

  void checkHeader() {
    bool const isFloat = std::is_same_v<T, float>;
    std::string const& name = m_grid.name;
    bool levelSet = false, fog = false;
    if constexpr (std::is_same_v<T, float>) {
      levelSet = m_channel->defaultValue() > 0 &&
                 (name == "voxel_signed_distance" || name == "voxel_flame_level_set" || name == "surface");
      fog = !levelSet && name == "voxel_fog_density";
    }
    m_levelSet = levelSet;
    EXPECT_EQ(m_grid.gridClass, levelSet ? 1u : fog ? 2u : 0u) << m_label;
    EXPECT_TRUE(isFloat || m_grid.type == FlatType<T>::kValue) << m_label << ": type " << m_grid.type;
    EXPECT_EQ(m_grid.voxelSize, static_cast<double>(m_volume.tree.voxelSize())) << m_label;
    T const value = m_channel->defaultValue();
    EXPECT_EQ(std::memcmp(&value, m_grid.defaultValue.data(), sizeof(T)), 0) << m_label;
    EXPECT_EQ(m_grid.checksum, m_model.checksum(m_grid, static_cast<int>(m_options.checksum))) << m_label;
  }

  /// What is to be stored of one tile: 64 samples, or 125 with the halo.
  Samples samples(Entry const& e, bool halo) const {
    auto const& channel = *m_channel;
    int const w = halo ? 5 : 4;
    Samples result(static_cast<std::size_t>(w * w * w), channel.defaultValue());
    if (e.depth < channel.minDepth()) return result;
    if (halo) {
      VLN::TileTree3D::TileData<T, 5, 0> data(125, channel.defaultValue());
      auto accessor = m_volume.tree.tileAccessor();
      VLN::TileTree3D::setHaloTile<FlatTraits, T, 0, 0, 0, 1>(
          {e.index, e.depth}, channel, VLN::TileTree3D::HaloMode(4), VLN::TileTree3D::HaloType(15), accessor,
          data, 0.0f, 1.0f, VLN::TileTree3D::kVoxelOffsetCorner);
      std::copy_n(std::as_const(data).begin(), 125, result.begin());
      if constexpr (std::is_same_v<T, float>) {
        if (m_options.fogFix && m_grid.name == "voxel_fog_density") fixFog(result);
      }
      return result;
    }
    int const depth = std::min(e.depth, channel.depth());
    auto accessor = m_volume.tree.tileAccessor();
    auto const at = accessor.treeIndex(e.corner.x, e.corner.y, e.corner.z, depth, true);
    if (at.depth < 0) return result; // a root below the channel's last depth
    auto const data = channel.tileData(at);
    std::copy_n(data.begin(), 64, result.begin());
    return result;
  }

  /// Raises what borders on fog to just above the threshold.
  void fixFog(Samples& block) const {
    Samples const before = block;
    float const threshold = m_options.coarserTolerance;
    auto const at = [](int i, int j, int k) {
      return static_cast<std::size_t>(std::clamp(i, 0, 4) +
                                      5 * (std::clamp(j, 0, 4) + 5 * std::clamp(k, 0, 4)));
    };
    for (int k = 0; k < 5; ++k)
      for (int j = 0; j < 5; ++j)
        for (int i = 0; i < 5; ++i) {
          bool borders = false;
          for (int step : {-1, 1})
            borders |= before[at(i + step, j, k)] > threshold || before[at(i, j + step, k)] > threshold ||
                       before[at(i, j, k + step)] > threshold;
          if (before[at(i, j, k)] <= threshold && borders) block[at(i, j, k)] = threshold + 1.1920929e-7f;
        }
  }

  void checkBytes(std::size_t n, Samples const& wanted, Samples const& found) const {
    ASSERT_EQ(wanted.size(), found.size()) << m_label << ", tile " << n;
    ASSERT_EQ(std::memcmp(wanted.data(), found.data(), wanted.size() * sizeof(T)), 0)
        << m_label << ", tile " << n;
  }

  void checkBlock(std::size_t n, Entry const& e) const {
    int const levels = e.blockLevels(), core = 4 << levels, w = core + (e.halo ? 1 : 0);
    ASSERT_EQ(m_grid.levels(n), levels) << m_label << ", tile " << n;
    ASSERT_EQ(m_grid.width(n), w) << m_label << ", tile " << n;
    if (!levels) return checkBytes(n, samples(e, e.halo), m_model.template block<T>(m_grid, n));
    // Each tile of the block's bottom, at its place.
    auto const block = m_model.template block<T>(m_grid, n);
    int const across = 1 << levels, tileWidth = FlatTraits::width(e.depth + levels);
    for (int z = 0; z < across; ++z)
      for (int y = 0; y < across; ++y)
        for (int x = 0; x < across; ++x) {
          Entry const* const bottom = m_expected.find(
              {e.corner.x + x * tileWidth, e.corner.y + y * tileWidth, e.corner.z + z * tileWidth},
              e.depth + levels);
          ASSERT_NE(bottom, nullptr);
          auto const wanted = samples(*bottom, e.halo);
          int const stride = e.halo ? 5 : 4;
          auto const extent = [&](int t) { return e.halo && t == across - 1 ? 5 : 4; };
          for (int k = 0; k < extent(z); ++k)
            for (int j = 0; j < extent(y); ++j)
              for (int i = 0; i < extent(x); ++i) {
                auto const& a = wanted[static_cast<std::size_t>(i + stride * (j + stride * k))];
                auto const& b =
                    block[static_cast<std::size_t>(4 * x + i + w * (4 * y + j + w * (4 * z + k)))];
                ASSERT_EQ(std::memcmp(&a, &b, sizeof(T)), 0)
                    << m_label << ", tile " << n << ", block sample " << 4 * x + i << ' ' << 4 * y + j << ' '
                    << 4 * z + k;
              }
        }
  }

  void checkQuantised(std::size_t n, Entry const& e, float tolerance) const {
    if constexpr (std::is_same_v<T, float>) {
      auto const q = m_model.quantised(m_grid, n);
      auto const wanted = samples(e, e.halo);
      ASSERT_EQ(q.codes.size(), wanted.size()) << m_label << ", tile " << n;
      auto const [low, high] = std::minmax_element(wanted.begin(), wanted.end());
      ASSERT_EQ(q.minimum, *low) << m_label << ", tile " << n;
      double const range = double(*high) - double(*low);
      double const last = q.bits == 16 ? 65535 : (1 << q.bits) - 1;
      EXPECT_NEAR(q.quantum, range / last, range / last * 1e-6) << m_label << ", tile " << n;
      if (range == 0) {
        EXPECT_EQ(q.quantum, 0.0f);
        EXPECT_EQ(*std::max_element(q.codes.begin(), q.codes.end()), 0u) << m_label << ", tile " << n;
      }
      double const rounding = 4e-7 * std::max(std::abs(double(*low)), std::abs(double(*high)));
      double bound = q.quantum * (m_options.dither ? 1.5 : 0.5);
      if (m_grid.type == 16 && q.bits < 16) bound = tolerance;
      if (m_grid.type == 16 && q.bits == 16) bound = std::max<double>(bound, tolerance);
      for (std::size_t k = 0; k < wanted.size(); ++k)
        ASSERT_NEAR(q.value(k), wanted[k], bound + rounding)
            << m_label << ", tile " << n << ", sample " << k << ", bits " << q.bits;
    }
  }

  int textureDim() const {
    std::uint64_t q = 1;
    while (q * q * q < m_expected.tiles.size() + 1) ++q;
    EXPECT_EQ(m_grid.end(), m_grid.table.size() * 8 + 125 * q * q * q * sizeof(T)) << m_label;
    return static_cast<int>(5 * q);
  }
  /// The brick of a tile along an axis, which its entry must name.
  int brickAt(std::size_t n, int axis) const {
    auto const q = static_cast<std::size_t>(textureDim() / 5), c = n + 1;
    std::size_t const at = axis == 0 ? c % q : axis == 1 ? c % (q * q) / q : c / (q * q);
    EXPECT_EQ(m_grid.table[n] >> (16 * axis) & 0xFFFF, at * 5) << m_label << ", tile " << n;
    return static_cast<int>(at);
  }

  bool isActive(T const& value) const {
    using Traits = VLN::TileTree3D::ElementTraits<T>;
    if constexpr (std::is_same_v<T, float>) {
      if (m_levelSet) return value < 0;
    }
    T const d = m_channel->defaultValue();
    for (int c = 0; c < Traits::kComponents; ++c)
      if (Traits::component(d, c) != Traits::component(value, c)) return true;
    return false;
  }

  void checkBox() const {
    std::int64_t low[3] = {INT64_MAX, INT64_MAX, INT64_MAX}, high[3] = {INT64_MIN, INT64_MIN, INT64_MIN};
    for (auto const& [place, e] : m_expected.entries) {
      auto const data = samples(e, false);
      auto const& tile = m_volume.tree.tile(e.index, e.depth);
      // With a halo, the core goes through the halo computation, too: it matters below the channel's last
      // depth.
      auto const core = e.halo ? samples(e, true) : Samples();
      std::int64_t const w = FlatTraits::width(e.depth) / 4;
      for (int k = 0; k < 4; ++k)
        for (int j = 0; j < 4; ++j)
          for (int i = 0; i < 4; ++i) {
            bool const leaf = tile.isLeaf(i / 2, j / 2, k / 2);
            if (!leaf && e.depth != m_expected.rootDepth) continue;
            auto const& value = e.halo ? core[static_cast<std::size_t>(i + 5 * (j + 5 * k))]
                                       : data[static_cast<std::size_t>(i + 4 * (j + 4 * k))];
            if (!isActive(value)) continue;
            int const at[3] = {i, j, k};
            for (int a = 0; a < 3; ++a) {
              low[a] = std::min(low[a], e.corner[a] + (at[a] - 2) * w);
              high[a] = std::max(high[a], e.corner[a] + (at[a] + 2) * w);
            }
          }
    }
    for (std::size_t a = 0; a < 3; ++a) {
      if (low[0] > high[0]) {
        EXPECT_GT(m_grid.box[a], m_grid.box[a + 3]) << m_label << ": nothing is active";
        EXPECT_GT(m_grid.worldBox[a], m_grid.worldBox[a + 3]) << m_label;
        continue;
      }
      EXPECT_EQ(m_grid.box[a], low[a]) << m_label << ", axis " << a;
      EXPECT_EQ(m_grid.box[a + 3], high[a]) << m_label << ", axis " << a;
      double const v = m_grid.voxelSize;
      EXPECT_DOUBLE_EQ(m_grid.worldBox[a], v * static_cast<double>(low[a])) << m_label;
      EXPECT_DOUBLE_EQ(m_grid.worldBox[a + 3], v * static_cast<double>(high[a])) << m_label;
    }
  }

  FlatVolume const& m_volume;
  FlatOptions const& m_options;
  FlatExpectation const& m_expected;
  FlatModel const& m_model;
  FlatModel::Grid const& m_grid;
  std::string m_label;
  Ostil::Ptr<FlatChannel<T>> m_channel;
  bool m_levelSet = false;
};

/// The tree: counts, numbers, corners, parents, children, and lookups by root slot and child tables.
void expectFlatTree(FlatVolume const& volume, FlatOptions const& options, FlatExpectation const& expected,
                    FlatModel const& model, std::string const& label);

/// The buffer's size as the options ask for it.
std::uint64_t flatBufferSize(FlatModel const& model, FlatOptions const& options);

/// The whole buffer. The grids are those of all channels, in the order of types and names.
template <class BuildT = void, class HandleT>
void expectFlat(FlatVolume const& volume, FlatOptions const& options, HandleT const& handle,
                std::string const& label, std::optional<int> contentDepth = {}) {
  FlatExpectation const expected(volume.tree, options, contentDepth);
  if (expected.refused) {
    EXPECT_TRUE(handle.empty()) << label;
    return;
  }
  ASSERT_FALSE(handle.empty()) << label;
  std::optional<FlatModel> read;
  try {
    read.emplace(handle.data(), handle.size());
  } catch (std::exception const& error) { FAIL() << label << ": " << error.what(); }
  FlatModel const& model = *read;
  expectFlatTree(volume, options, expected, model, label);
  if (::testing::Test::HasFatalFailure()) return;
  EXPECT_EQ(handle.size(), flatBufferSize(model, options)) << label;

  std::size_t next = 0;
  float tolerance = options.tolerance;
  auto const names = volume.object->componentRange();
  auto const expectType = [&]<class T>() {
    for (auto const& name : names) {
      if (!volume.object->template component<FlatChannel<T>>(name)) continue;
      ASSERT_LT(next, model.grids.size()) << label << ": no grid for " << name;
      FlatModel::Grid const& grid = model.grids[next++];
      ASSERT_EQ(grid.name, name) << label;
      if (std::is_same_v<T, float>) {
        EXPECT_EQ(grid.type, flatFloatType<BuildT>()) << label;
        if (tolerance < 0)
          tolerance = grid.gridClass == 1   ? 0.1f * volume.tree.voxelSize()
                      : grid.gridClass == 2 ? 0.01f
                                            : 0.0f;
      }
      FlatGridCheck<T>(volume, options, expected, model, grid, label).run(tolerance);
    }
  };
#define FLAT_EXPECT(type) expectType.template operator()<type>();
  FLAT_FOR_EACH_TYPE(FLAT_EXPECT)
#undef FLAT_EXPECT
  EXPECT_EQ(next, model.grids.size()) << label << ": more grids than channels";
}

} // namespace Support
