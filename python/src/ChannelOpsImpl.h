// Definitions of ChannelOps for an element type. Only the generated sources include this.
#pragma once

#include "ChannelOps.h"

#include "GeometryVolume/channels/ChannelReader.h"
#include "GeometryVolume/core/Numeric.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/sampling/VoxelSamplerLinear.h"
#include "Interop/ElementScalar.h"

#include <algorithm>
#include <cmath>
#include <cstring>
#include <limits>
#include <mutex>
#include <type_traits>
#include <utility>

namespace VLN::Python {

using Interop::ScalarOf;

template <class T> struct ElementShape {
  static std::vector<int> of() {
    using S = typename ScalarOf<T>::type;
    if constexpr (std::is_same_v<T, S>) return {};
    return {static_cast<int>(sizeof(T) / sizeof(S))};
  }
};
template <class S, int R, int C> struct ElementShape<Velorn::Math::Matrix<S, R, C>> {
  static std::vector<int> of() { return {R, C}; }
};

template <class T> ElementInfo elementInfo(char const* name) {
  using S = typename ScalarOf<T>::type;
  ElementInfo info;
  info.name = name;
  info.kind = std::is_floating_point_v<S> ? 'f' : std::is_signed_v<S> ? 'i' : 'u';
  info.scalarBytes = sizeof(S);
  info.shape = ElementShape<T>::of();
  info.bytes = sizeof(T);
  return info;
}

template <class T> class TypedOps final : public ChannelOps {
  using S = typename ScalarOf<T>::type;
  using ChannelT = TileTree3D::Channel<Shape, T, 4, 0>;
  static constexpr int kComponents = sizeof(T) / sizeof(S);
  static constexpr std::size_t kElements = 64;
  static constexpr std::int64_t kGrain = 4096;

public:
  TypedOps(Volume const& volume, TileTree3D::Field<T> field, ElementInfo info)
      : m_volume(volume)
      , m_field(std::move(field))
      , m_info(std::move(info)) {}

  ElementInfo const& element() const override { return m_info; }
  void background(void* out) const override { std::memcpy(out, &m_field.background(), sizeof(T)); }

  /// From coarse to fine: each tile paints those of its samples below which there is no finer tile, so that
  /// every element is written once at most.
  void dense(int3 const& low, int3 const& count, int depth, void* out,
             FunctionRef<void()> between) const override {
    auto const& tree = m_volume.tree();
    auto const& tiles = *m_field.channel().tileArrays();
    Dense const dense{static_cast<T*>(out), sampleWidth(depth), low, count};
    T const background = m_field.background();
    std::int64_t const slice = std::int64_t(count.x) * count.y;
    parallelFor(0, count.z, [&](std::int64_t begin, std::int64_t end) {
      std::fill(dense.values + begin * slice, dense.values + end * slice, background);
    });
    constexpr std::int64_t kPart = 1 << 18;
    for (int d = 0; d <= depth; ++d)
      for (std::int64_t part = 0; part < tree.tileCount(d); part += kPart) {
        parallelFor(part, std::min(tree.tileCount(d), part + kPart),
                    [&](std::int64_t begin, std::int64_t end) {
                      for (auto n = begin; n < end; ++n) {
                        auto const& tile = tree.tile(n, d);
                        auto const& values = tiles[static_cast<std::size_t>(d)][static_cast<std::size_t>(n)];
                        if (!tile.valid() || values.size() < kElements) continue;
                        if (d == depth)
                          dense.copy(tile.tijk(), values.data());
                        else
                          dense.paint(tile, sampleWidth(d), values.data(), background);
                      }
                    },
                    {.grain = 256});
        between();
      }
  }

  void sample(double3 const* positions, std::int64_t count, void* out, float3* gradients) const override {
    auto* const values = static_cast<T*>(out);
    if constexpr (std::is_same_v<T, float>) {
      auto const blender = makeBlender();
      float const perSample = m_volume.voxelSize();
      parallelFor(0, count,
                  [&](std::int64_t begin, std::int64_t end) {
                    auto const own = *blender;
                    for (auto n = begin; n < end; ++n)
                      values[n] = own.at(positions[n], perSample, gradients ? &gradients[n] : nullptr);
                  },
                  {.grain = 8 * kGrain});
    } else {
      TileTree3D::ChannelReader<ChannelT> const reader(m_volume.tree(), m_field.channel());
      parallelFor(0, count,
                  [&](std::int64_t begin, std::int64_t end) {
                    auto const own = reader;
                    for (auto n = begin; n < end; ++n) values[n] = blend(own, positions[n]);
                  },
                  {.grain = kGrain});
    }
  }

  void get(int3 const* positions, std::int64_t count, void* out) const override {
    auto const n = static_cast<std::size_t>(count);
    m_field.get(std::span(positions, n), std::span(static_cast<T*>(out), n));
  }

  ActiveSamples active(ActiveRule const& rule, bool positions) const override {
    ActiveSamples result;
    T const background = m_field.background();
    if (rule.kind == ActiveRule::Kind::kStates) {
      auto const states = m_volume.field<unsigned char>(rule.states);
      auto const& channel = states.channel();
      auto const isOn = [](unsigned char s) { return (s & 1) != 0; };
      for (int const depth : {kFinest, 16, 21, 25}) collect(channel, depth, positions, result, isOn);
    } else if (rule.kind == ActiveRule::Kind::kInsideBand) {
      collectByValue(rule.also, positions, result,
                     [&](T const& value) { return insideBand(value, background); });
    } else {
      collectByValue(rule.also, positions, result,
                     [&](T const& value) { return std::memcmp(&value, &background, sizeof(T)) != 0; });
    }
    return result;
  }

  void set(int3 const* positions, std::int64_t count, void const* values) override {
    auto const n = static_cast<std::size_t>(count);
    m_field.set(std::span(positions, n), std::span(static_cast<T const*>(values), n));
  }

  void fromDense(StridedArray const& array, int3 const& low, double tolerance,
                 FunctionRef<void()> between) override {
    T const background = m_field.background();
    int3 const first{low.x >> 2, low.y >> 2, low.z >> 2};
    std::int64_t blocks[3];
    for (int a = 0; a < 3; ++a)
      blocks[a] = array.count[a] > 0 ? ((low[a] + array.count[a] - 1) >> 2) - first[a] + 1 : 0;
    // The tiles that are needed, layer by layer, each with a value of its own to make it by.
    std::vector<int3> corners;
    std::vector<T> values;
    std::int64_t const layersAtOnce =
        std::max<std::int64_t>(1, (1 << 16) / std::max<std::int64_t>(1, blocks[0] * blocks[1]));
    for (std::int64_t layer = 0; layer < blocks[2]; layer += layersAtOnce) {
      std::int64_t const lastLayer = std::min(blocks[2], layer + layersAtOnce);
      auto part = parallelReduce(
          layer * blocks[1], lastLayer * blocks[1], 8, std::vector<int3>(),
          [&](std::int64_t begin, std::int64_t end) {
            std::vector<int3> found;
            for (auto row = begin; row < end; ++row)
              for (std::int64_t x = 0; x < blocks[0]; ++x) {
                int3 const corner = blockCorner(first, x, row % blocks[1], row / blocks[1]);
                if (forEachFar(array, low, corner, tolerance, background,
                               [](std::int64_t, T const&) { return true; }))
                  found.push_back(corner);
              }
            return found;
          },
          [](std::vector<int3> a, std::vector<int3> const& b) {
            a.insert(a.end(), b.begin(), b.end());
            return a;
          });
      corners.insert(corners.end(), part.begin(), part.end());
      between();
    }
    values.assign(corners.size(), background);
    m_field.set(corners, values);
    auto& channel = m_field.editChannel();
    auto const& tree = std::as_const(m_volume).tree();
    auto const count = static_cast<std::int64_t>(corners.size());
    constexpr std::int64_t kPart = 1 << 16;
    for (std::int64_t part = 0; part < count; part += kPart) {
      parallelFor(part, std::min(count, part + kPart),
                  [&](std::int64_t begin, std::int64_t end) {
                    auto const accessor = tree.tileAccessor();
                    for (auto n = begin; n < end; ++n) {
                      int3 const& c = corners[static_cast<std::size_t>(n)];
                      T block[kElements];
                      readBlock(array, low, c, tolerance, background, block);
                      auto const at = accessor.treeIndex(c.x, c.y, c.z, kFinest, true);
                      if (at.valid()) std::copy_n(block, kElements, &*channel.tileData(at).begin());
                    }
                  },
                  {.grain = 256});
      between();
    }
  }

  TileBlockView block(int depth) const override {
    TileBlockView view;
    auto const& tiles = (*m_field.channel().tileArrays())[static_cast<std::size_t>(depth)];
    view.tiles = static_cast<std::int64_t>(tiles.size());
    view.regular = true;
    if (tiles.empty()) return view;
    T const* const base = tiles.front().data();
    view.data = const_cast<T*>(base);
    for (std::size_t n = 0; n < tiles.size() && view.regular; ++n)
      view.regular = tiles[n].size() == kElements && tiles[n].data() == base + n * kElements;
    return view;
  }

  Ostil::Ptr<TileTree3D::ChannelBase> packed() const override {
    auto const& source = m_field.channel();
    auto channel = Ostil::makeMutable<ChannelT>(source.name(), &source.defaultValue(),
                                                source.dataElementInitializerType(), true, true, 0, kFinest);
    channel->setTargetName(source.getTargetName());
    channel->setOwner(m_volume.tree().name());
    channel->update(m_volume.topology());
    for (int depth = 0; depth <= kFinest; ++depth)
      parallelFor(0, std::min(source.tileCount(depth), channel->tileCount(depth)),
                  [&](std::int64_t begin, std::int64_t end) {
                    for (auto n = begin; n < end; ++n) {
                      auto const from = std::as_const(source).tileData(n, depth);
                      auto to = channel->tileData(n, depth);
                      if (from.size() == to.size() && from.size() > 0)
                        std::copy_n(&*from.begin(), from.size(), &*to.begin());
                    }
                  },
                  {.grain = 256});
    return Ostil::Ptr<TileTree3D::ChannelBase>(std::move(channel));
  }

  void prepareWrite() override { m_field.editChannel(); }

private:
  static float3 toFloat(double3 const& p) { return {float(p.x), float(p.y), float(p.z)}; }

  /// A dense array that is filled: `low` and `count` in samples of its depth, which are `width` indices wide.
  struct Dense {
    T* values;
    int width;
    int3 low, count;

    /// Cuts [from, to) of samples to the array. @return Whether anything is left.
    bool cut(std::int64_t (&from)[3], std::int64_t (&to)[3]) const {
      for (int a = 0; a < 3; ++a) {
        from[a] = std::max<std::int64_t>(from[a] - low[a], 0);
        to[a] = std::min<std::int64_t>(to[a] - low[a], count[a]);
        if (from[a] >= to[a]) return false;
      }
      return true;
    }
    T* row(std::int64_t y, std::int64_t z) const {
      return values + std::int64_t(count.x) * (y + count.y * z);
    }

    /// A tile of the array's own depth.
    void copy(int3 const& corner, T const* elements) const {
      std::int64_t const at[3] = {corner.x / width, corner.y / width, corner.z / width};
      std::int64_t from[3] = {at[0], at[1], at[2]}, to[3] = {at[0] + 4, at[1] + 4, at[2] + 4};
      if (!cut(from, to)) return;
      std::int64_t const x = at[0] - low.x, y = at[1] - low.y, z = at[2] - low.z;
      for (auto k = from[2]; k < to[2]; ++k)
        for (auto j = from[1]; j < to[1]; ++j)
          std::copy(elements + (from[0] - x) + 4 * ((j - y) + 4 * (k - z)),
                    elements + (to[0] - x) + 4 * ((j - y) + 4 * (k - z)), row(j, k) + from[0]);
    }
    /// Samples of a coarser tile, each `wide` indices, below which there is no child.
    template <class Tile>
    void paint(Tile const& tile, int wide, T const* elements, T const& background) const {
      int3 const corner = tile.tijk();
      std::int64_t const step = wide / width;
      std::int64_t from[3], to[3];
      for (int a = 0; a < 3; ++a) from[a] = corner[a] / width, to[a] = from[a] + 4 * step;
      if (!cut(from, to)) return;
      for (int e = 0; e < int(kElements); ++e) {
        int const i = e & 3, j = e >> 2 & 3, k = e >> 4;
        if (tile.childIndex(i >> 1, j >> 1, k >> 1) >= 0) continue;
        T const& value = elements[e];
        if (std::memcmp(&value, &background, sizeof(T)) == 0) continue;
        std::int64_t const at[3] = {corner.x / width + i * step, corner.y / width + j * step,
                                    corner.z / width + k * step};
        for (int a = 0; a < 3; ++a) from[a] = at[a], to[a] = at[a] + step;
        if (!cut(from, to)) continue;
        for (auto z = from[2]; z < to[2]; ++z)
          for (auto y = from[1]; y < to[1]; ++y) std::fill(row(y, z) + from[0], row(y, z) + to[0], value);
      }
    }
  };

  /// Blends of a float channel. Where there is a tile of the deepest depth the eight samples are read one by
  /// one, which needs no cache and so takes positions in any order; elsewhere the sampler blends coarser
  /// ones.
  struct Blender {
    TileTree3D::ChannelReader<ChannelT> reader;
    TileTree3D::FloatVoxelSamplerLinear<Shape> sampler;

    /// Whether there is a tile of the deepest depth: the first two of its row are two elements then. A
    /// coarser sample is wide enough to be both, and so is the background.
    bool finest(int3 const& p) const {
      return &reader.value(p.x & ~3, p.y, p.z) != &reader.value((p.x & ~3) | 1, p.y, p.z);
    }
    float at(double3 const& p, float perSample, float3* gradient) const {
      int3 const low{toIntFloor(p.x), toIntFloor(p.y), toIntFloor(p.z)};
      bool inside = true;
      for (int a = 0; a < 3; ++a)
        inside = inside && low[a] > Shape::kMinTileCoord && low[a] < Shape::kMaxTileCoord;
      if (!inside || !finest(low)) {
        if (!gradient) return sampler.sample(toFloat(p), TileTree3D::kSamplerTileSpace);
        float const value = sampler.sampleGradient(toFloat(p), TileTree3D::kSamplerTileSpace, gradient);
        *gradient *= perSample;
        return value;
      }
      double const x = p.x - low.x, y = p.y - low.y, z = p.z - low.z;
      double edge[4], slope[4]; // along x, in the order (0,0) (1,0) (0,1) (1,1) of y and z
      for (int n = 0; n < 4; ++n) {
        int const j = low.y + (n & 1), k = low.z + (n >> 1);
        double const a = reader.value(low.x, j, k), b = reader.value(low.x + 1, j, k);
        slope[n] = b - a;
        edge[n] = a + (x > 0 ? x * slope[n] : 0);
      }
      auto const lerp = [](double a, double b, double t) { return t > 0 ? a + t * (b - a) : a; };
      double const front = lerp(edge[0], edge[1], y), back = lerp(edge[2], edge[3], y);
      if (gradient)
        *gradient = {float(lerp(lerp(slope[0], slope[1], y), lerp(slope[2], slope[3], y), z)),
                     float(lerp(edge[1] - edge[0], edge[3] - edge[2], z)), float(back - front)};
      return float(lerp(front, back, z));
    }
  };

  /// Apart, as the compiler takes what an accessor has not visited yet for an oversight where it sees all of
  /// it.
  [[gnu::noinline]] std::unique_ptr<Blender> makeBlender() const {
    return std::unique_ptr<Blender>(new Blender{{m_volume.tree(), m_field.channel()},
                                                {m_volume.tree(), m_volume.topology(), m_field.channel()}});
  }

  static T blend(TileTree3D::ChannelReader<ChannelT> const& reader, double3 const& p) {
    if constexpr (std::is_integral_v<S>) {
      return reader.value(toIntFloor(p.x + 0.5), toIntFloor(p.y + 0.5), toIntFloor(p.z + 0.5));
    } else {
      int3 low{0, 0, 0};
      double weight[3];
      for (int a = 0; a < 3; ++a) {
        low[a] = toIntFloor(p[a]);
        weight[a] = p[a] - low[a];
        if (low[a] <= Shape::kMinTileCoord || low[a] >= Shape::kMaxTileCoord)
          return reader.value(toIntFloor(p.x), toIntFloor(p.y), toIntFloor(p.z));
      }
      double sums[kComponents] = {};
      for (int n = 0; n < 8; ++n) {
        double share = 1;
        int3 at = low;
        for (int a = 0; a < 3; ++a) {
          bool const high = n >> a & 1;
          at[a] += high;
          share *= high ? weight[a] : 1 - weight[a];
        }
        if (share == 0) continue;
        T const& value = reader.value(at);
        for (int c = 0; c < kComponents; ++c) sums[c] += share * double(Interop::componentOf(value, c));
      }
      S scalars[kComponents];
      for (int c = 0; c < kComponents; ++c) scalars[c] = static_cast<S>(sums[c]);
      T result;
      std::memcpy(&result, scalars, sizeof result);
      return result;
    }
  }

  static bool insideBand(T const& value, T const& background) {
    if constexpr (std::is_arithmetic_v<T>) return std::abs(double(value)) < std::abs(double(background));
    return false;
  }

  /// Active samples of a depth.
  struct Found {
    std::vector<int3> samples;
    std::int64_t count = 0;
    std::int64_t low[3], high[3];

    void add(int3 const& p, std::int64_t width) {
      for (int a = 0; a < 3; ++a) {
        low[a] = count ? std::min<std::int64_t>(low[a], p[a]) : p[a];
        high[a] = count ? std::max<std::int64_t>(high[a], p[a] + width) : p[a] + width;
      }
      ++count;
    }
    void join(Found const& b) {
      if (b.count == 0) return;
      for (int a = 0; a < 3; ++a) {
        low[a] = count ? std::min(low[a], b.low[a]) : b.low[a];
        high[a] = count ? std::max(high[a], b.high[a]) : b.high[a];
      }
      count += b.count;
      samples.insert(samples.end(), b.samples.begin(), b.samples.end());
    }
    void addTo(ActiveSamples& result, int width) && {
      if (count == 0) return;
      auto const clip = [](std::int64_t v) { return int(std::min<std::int64_t>(v, Shape::kMaxTileCoord)); };
      for (int a = 0; a < 3; ++a) {
        result.low[a] = result.count ? std::min(result.low[a], int(low[a])) : int(low[a]);
        result.high[a] = result.count ? std::max(result.high[a], clip(high[a])) : clip(high[a]);
      }
      result.count += count * std::int64_t(width) * width * width;
      if (width > 1)
        for (int3 const& p : samples) result.wide.push_back({p, width});
      else
        result.voxels = std::move(samples);
    }
  };

  template <class U, class Rule>
  void collect(TileTree3D::Channel<Shape, U, 4, 0> const& channel, int depth, bool positions,
               ActiveSamples& result, Rule const& rule) const {
    find(channel, depth, positions, rule).addTo(result, sampleWidth(depth));
  }
  /// Voxels whose values pass the rule, and those of `also` that have a tile.
  template <class Rule>
  void collectByValue(std::vector<int3> const& also, bool positions, ActiveSamples& result,
                      Rule const& rule) const {
    Found all = find(m_field.channel(), kFinest, positions, rule);
    auto const tiles = m_volume.tree().tileAccessor();
    for (int3 const& p : also) {
      auto const at = tiles.treeIndex(p.x, p.y, p.z, kFinest, true);
      if (!at.valid()) continue;
      auto const values = m_field.channel().tileData(at);
      if (values.size() < int(kElements) || rule(values(p.x & 3, p.y & 3, p.z & 3))) continue;
      all.add(p, 1);
      if (positions) all.samples.push_back(p);
    }
    std::move(all).addTo(result, 1);
  }

  template <class U, class Rule>
  Found find(TileTree3D::Channel<Shape, U, 4, 0> const& channel, int depth, bool positions,
             Rule const& rule) const {
    auto const& tree = m_volume.tree();
    int const width = sampleWidth(depth);
    bool const keep = positions || width > 1;
    return parallelReduce(
        0, tree.tileCount(depth), 1024, Found(),
        [&](std::int64_t begin, std::int64_t end) {
          Found part;
          for (auto n = begin; n < end; ++n) {
            auto const& tile = tree.tile(n, depth);
            auto const values = channel.tileData(n, depth);
            if (!tile.valid() || values.size() < int(kElements)) continue;
            auto const corner = tile.tijk();
            for (int e = 0; e < int(kElements); ++e) {
              if (!rule(values[e])) continue;
              int3 const p{corner.x + (e & 3) * width, corner.y + (e >> 2 & 3) * width,
                           corner.z + (e >> 4) * width};
              part.add(p, width);
              if (keep) part.samples.push_back(p);
            }
          }
          return part;
        },
        [](Found a, Found const& b) {
          a.join(b);
          return a;
        });
  }

  static int3 blockCorner(int3 const& first, std::int64_t x, std::int64_t y, std::int64_t z) {
    return {int((first.x + x) * 4), int((first.y + y) * 4), int((first.z + z) * 4)};
  }

  /// Calls `body` for each element of a block of 4 x 4 x 4 that is not near the background, until it says
  /// true.
  /// @return Whether it did.
  template <class Body>
  static bool forEachFar(StridedArray const& array, int3 const& low, int3 const& corner, double tolerance,
                         T const& background, Body const& body) {
    std::int64_t from[3], to[3];
    for (int a = 0; a < 3; ++a) {
      from[a] = std::max<std::int64_t>(0, std::int64_t(low[a]) - corner[a]);
      to[a] = std::min<std::int64_t>(4, std::int64_t(low[a]) + array.count[a] - corner[a]);
    }
    for (auto k = from[2]; k < to[2]; ++k)
      for (auto j = from[1]; j < to[1]; ++j) {
        char const* at = array.data + (corner.x + from[0] - low.x) * array.step[0] +
                         (corner.y + j - low.y) * array.step[1] + (corner.z + k - low.z) * array.step[2];
        for (auto i = from[0]; i < to[0]; ++i, at += array.step[0]) {
          T const value = readElement(array, at);
          if (!near(value, background, tolerance) && body(i + 4 * (j + 4 * k), value)) return true;
        }
      }
    return false;
  }
  /// The elements of a block, the background where they are near it and beyond the array.
  static void readBlock(StridedArray const& array, int3 const& low, int3 const& corner, double tolerance,
                        T const& background, T* block) {
    std::fill_n(block, kElements, background);
    forEachFar(array, low, corner, tolerance, background, [&](std::int64_t n, T const& value) {
      block[n] = value;
      return false;
    });
  }
  static T readElement(StridedArray const& array, char const* at) {
    T value{};
    auto* const to = reinterpret_cast<char*>(&value);
    if constexpr (kComponents == 1) {
      std::memcpy(to, at, sizeof(S));
      return value;
    }
    if (array.innerCount.empty()) {
      std::memcpy(to, at, sizeof(S));
    } else if (array.innerCount.size() == 1) {
      for (std::int64_t c = 0; c < array.innerCount[0]; ++c)
        std::memcpy(to + c * std::int64_t(sizeof(S)), at + c * array.innerStep[0], sizeof(S));
    } else {
      for (std::int64_t r = 0; r < array.innerCount[0]; ++r)
        for (std::int64_t c = 0; c < array.innerCount[1]; ++c)
          std::memcpy(to + (r * array.innerCount[1] + c) * std::int64_t(sizeof(S)),
                      at + r * array.innerStep[0] + c * array.innerStep[1], sizeof(S));
    }
    return value;
  }
  static bool near(T const& a, T const& b, double tolerance) {
    if (std::memcmp(&a, &b, sizeof(T)) == 0) return true;
    for (int c = 0; c < kComponents; ++c) {
      S const x = Interop::componentOf(a, c), y = Interop::componentOf(b, c);
      if constexpr (std::is_floating_point_v<S>) {
        if (!(x == y || std::abs(double(x) - double(y)) <= tolerance)) return false;
      } else {
        if (x != y && !(std::abs(double(x) - double(y)) <= tolerance)) return false;
      }
    }
    return true;
  }

  Volume const& m_volume;
  TileTree3D::Field<T> m_field;
  ElementInfo m_info;
};

} // namespace VLN::Python
