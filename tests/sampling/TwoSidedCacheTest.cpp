// The cache of channels whose samples do not all lie on the low corners.
#include "sampling/SamplerVolume.h"
#include "support/Shapes.h"

#include <cmath>
#include <map>

namespace VLN::Test {
namespace {

float wavyField(double x, double y, double z) {
  return static_cast<float>(std::sin(0.7 * x) + std::cos(0.4 * y + 1) * std::sin(0.3 * z));
}

// The widened tile, element by element, without a cache.
template <class TraitsT> class TwoSidedModel {
public:
  static constexpr int D = TraitsT::kTDW;

  explicit TwoSidedModel(SamplerVolume<TraitsT> const& volume, float defaultValue)
      : m_volume(volume)
      , m_default(defaultValue) {}

  float at(TreeIndex const& index, int i, int j, int k) {
    auto const key = std::make_tuple(index.depth, index.index, i, j, k);
    auto const known = m_known.find(key);
    if (known != m_known.end()) return known->second;
    return m_known[key] = compute(index, i, j, k);
  }

private:
  static int side(int q) { return q < 0 ? -1 : q >= D ? 1 : 0; }

  float compute(TreeIndex const& index, int i, int j, int k) {
    auto const& tree = m_volume.tree;
    auto const& tile = tree.tile(index);
    auto const& core = std::as_const(*m_volume.core);
    int const type = m_volume.topology.offsetType();
    int const q[3] = {i, j, k};
    if (tile.isRoot() || tile.depth() <= core.minDepth()) {
      // From the last axis to the first, for the later ones see what the earlier ones wrote.
      for (int a = 2; a >= 0; --a) {
        int p[3] = {i, j, k};
        if (type & 1 << a) {
          if (q[a] <= 0 || q[a] == D) return m_default;
        } else if (q[a] < 0 || q[a] == D) {
          p[a] = q[a] < 0 ? 0 : D - 1;
          return 2.0f * m_default - at(index, p[0], p[1], p[2]);
        }
      }
      return core.tileData(index)(i, j, k);
    }
    int const s[3] = {side(i), side(j), side(k)};
    if (s[0] == 0 && s[1] == 0 && s[2] == 0) return core.tileData(index)(i, j, k);
    if (s[0] <= 0 && s[1] <= 0 && s[2] <= 0) {
      int3 const p{tile.ti() + 2 * s[0], tile.tj() + 2 * s[1], tile.tk() + 2 * s[2]};
      auto const beside = tree.tileAccessor().tile(p, tile.depth(), true).treeIndex();
      if (beside.valid()) return core.tileData(beside)(i - s[0] * D, j - s[1] * D, k - s[2] * D);
    }
    auto const& parent = tree.tile(tile.parentTreeIndex());
    int const s0 = tile.tileVoxelWidth();
    int low[3];
    float f[3];
    for (int a = 0; a < 3; ++a) {
      int const child = (tile.tijk()[a] - parent.tijk()[a]) / s0;
      float const o = type & 1 << a ? 0.0f : 0.5f;
      float const x = (float(child * D + q[a]) + o) / float(TraitsT::kTW) - o;
      low[a] = std::min(int(std::floor(x)), D - 1);
      f[a] = x - float(low[a]);
    }
    auto const lerp = [](float a, float b, float t) { return (b - a) * t + a; };
    float v[8];
    for (int n = 0; n < 8; ++n)
      v[n] = at(parent.treeIndex(), low[0] + n % 2, low[1] + n / 2 % 2, low[2] + n / 4);
    for (int a = 0; a < 3; ++a)
      for (int n = 0; n < 4 >> a; ++n) v[n] = lerp(v[2 * n], v[2 * n + 1], f[a]);
    return v[0];
  }

  SamplerVolume<TraitsT> const& m_volume;
  float m_default;
  std::map<std::tuple<int, std::int64_t, int, int, int>, float> m_known;
};

VLN_SHAPE_SUITE(TwoSidedCacheTest);

// requirement: against the definition, each element of each tile, every offset type
TYPED_TEST(TwoSidedCacheTest, EqualsTheModel) {
  using Traits = TypeParam;
  constexpr int D = Traits::kTDW;
  for (int type = 0; type < 7; ++type) {
    SamplerVolume<Traits> volume(static_cast<VoxelOffsetType>(type));
    int const from = Traits::kMaxDepth - 3;
    volume.addRandom(static_cast<std::uint32_t>(type) + 1, {3, -9, 70}, 25, from);
    volume.fill(wavyField, 0.75f, type % 3 == 0 ? from + 1 : 0);
    OpenSampler<Traits> const sampler(volume.tree, volume.topology, *volume.core);
    TwoSidedModel<Traits> model(volume, 0.75f);
    int bad = 0, tested = 0;
    for (int d = std::max(from, volume.core->minDepth()); d <= Traits::kMaxDepth; ++d)
      for (std::int64_t n = 0; n < volume.tree.tileCount(d); ++n) {
        ++tested;
        // A weight of 0 reads the low sample of a cell alone; of 1 the next one.
        for (int k = -1; k < D; ++k)
          for (int j = -1; j < D; ++j)
            for (int i = -1; i < D; ++i) {
              TreeIndex const at{n, d};
              float const low = sampler.sample(at, {i, j, k}, {0, 0, 0});
              float const high = sampler.sample(at, {i, j, k}, {1, 1, 1});
              bad += std::abs(low - model.at(at, i, j, k)) > 1e-5f;
              bad += std::abs(high - model.at(at, i + 1, j + 1, k + 1)) > 1e-5f;
            }
      }
    EXPECT_EQ(bad, 0) << "type " << type;
    EXPECT_GT(tested, 20);
  }
}

// requirement: closed form. A linear field at centred samples is exact where every halo sample has a source
TYPED_TEST(TwoSidedCacheTest, LinearFieldInTheMiddle) {
  using Traits = TypeParam;
  constexpr int deep = Traits::kMaxDepth, D = Traits::kTDW;
  SamplerVolume<Traits> volume(kVoxelOffsetCenter);
  volume.add({0, 0, 0}, deep - 2, deep - 2);
  int3 const root = std::as_const(volume.tree).tile(0, deep - 2).tijk();
  int const w2 = Traits::width(deep - 1), w = Traits::width(deep);
  volume.tree.tileAccessor().addTiles(
      root, {root.x + w2 * Traits::kTW, root.y + w2 * Traits::kTW, root.z + w2 * Traits::kTW}, deep - 1);
  // The tile at the far end of the first child, which is not at the root's edge.
  int3 const corner{root.x + w2 - w, root.y + w2 - w, root.z + w2 - w};
  volume.tree.tileAccessor().addTiles({corner.x - w, corner.y - w, corner.z - w},
                                      {corner.x + w, corner.y + w, corner.z + w}, deep);
  auto const field = [](double x, double y, double z) { return float(0.5 * x - 0.25 * y + 0.125 * z + 3); };
  volume.fill(field, 0.0f);
  OpenSampler<Traits> const sampler(volume.tree, volume.topology, *volume.core);
  double worst = 0;
  for (int k = 0; k < 8; ++k)
    for (int j = 0; j < 8; ++j)
      for (int i = 0; i < 8; ++i) {
        float3 const p{float(corner.x) + float(i * D) / 8, float(corner.y) + float(j * D) / 8,
                       float(corner.z) + float(k * D) / 8};
        worst = std::max(worst, std::abs(double(sampler.sample(p)) - double(field(p.x, p.y, p.z))));
      }
  EXPECT_LT(worst, 1e-4);
}

} // namespace
} // namespace VLN::Test
