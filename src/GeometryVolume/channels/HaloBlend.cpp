// Blends of a parent's samples, for floats: lanes along i, and for the common boxes constant counts.
#include "GeometryVolume/channels/ElementOpsImpl.h"
#include "GeometryVolume/core/detail/SimdLanes.h"

#include <array>
#include <cstring>
#include <type_traits>

namespace VLN::TileTree3D::Internal {

namespace {

// A box of a target tile.
struct FloatBox {
  float* target;        // its first element
  float const* parent;  // coordinate (0,0,0) of the parent's tile
  std::ptrdiff_t width; // of both tiles
  HaloAxis const* i;
  HaloAxis const* j;
  HaloAxis const* k;
  std::array<int, 3> count;
};

FloatBox boxOf(ParentBlend const& b, std::uint64_t regions) {
  HaloRegion const& r = b.table->regionOf(regions);
  return {static_cast<float*>(b.target) + r.target,
          static_cast<float const*>(b.parent),
          b.table->targetWidth,
          b.i + r.low[0],
          b.j + r.low[1],
          b.k + r.low[2],
          r.count};
}

// Columns of a box, V a number or lanes of them: `row` blends a parent's row along i, once for each row.
// Each blend is that of blendEight().
template <class V, class Row, class Store>
void blendColumns(FloatBox const& b, Row const& row, Store const& store) {
  constexpr std::size_t n = HaloTable::kLargestTileWidth;
  auto const lerp = [](V x, V y, float t) { return (y - x) * t + x; };
  int const firstJ = b.j[0].at, rows = b.j[b.count[1] - 1].at + 2 - firstJ;
  int const firstK = b.k[0].at, planes = b.k[b.count[2] - 1].at + 2 - firstK;
  auto const* low = b.parent + (firstJ + firstK * b.width) * b.width;
  V blended[n + 1][n];
  for (int k = 0; k < planes; ++k, low += b.width * b.width) {
    V line[n + 1];
    for (int j = 0; j < rows; ++j) line[j] = row(low + j * b.width);
    for (int j = 0; j < b.count[1]; ++j) {
      V const* const at = line + (b.j[j].at - firstJ);
      blended[k][j] = lerp(at[0], at[1], b.j[j].fraction);
    }
  }
  for (int k = 0; k < b.count[2]; ++k) {
    auto const* const at = blended + (b.k[k].at - firstK);
    auto* target = b.target + k * b.width * b.width;
    for (int j = 0; j < b.count[1]; ++j, target += b.width)
      store(target, lerp(at[0][j], at[1][j], b.k[k].fraction));
  }
}

void blendBox(FloatBox b) {
  auto* const target = b.target;
  for (int i = 0; i < b.count[0];) {
    HaloAxis const* const axis = b.i + i;
    b.target = target + i;
    if (b.count[0] - i < 4) {
      blendColumns<float>(
          b, [x = *axis](float const* row) { return (row[x.at + 1] - row[x.at]) * x.fraction + row[x.at]; },
          [](float* to, float v) { *to = v; });
      ++i;
    } else {
      int const at[4] = {axis[0].at, axis[1].at, axis[2].at, axis[3].at};
      FloatLanes const t{axis[0].fraction, axis[1].fraction, axis[2].fraction, axis[3].fraction};
      blendColumns<FloatLanes>(
          b,
          [&at, t](float const* row) {
            FloatLanes const low{row[at[0]], row[at[1]], row[at[2]], row[at[3]]};
            FloatLanes const high{row[at[0] + 1], row[at[1] + 1], row[at[2] + 1], row[at[3] + 1]};
            return lerpLanes(low, high, t);
          },
          [](float* to, FloatLanes const& v) { std::memcpy(to, &v, sizeof(v)); });
      i += 4;
    }
  }
}

// Along an axis a box of a halo is one sample wide, anywhere between two of the parent's, or as long as the
// core: four samples, each second one on one of the parent's and the others half way between.
template <class V> V blendTwo(V const& a, V const& b, float t) { return (b - a) * t + a; }

template <bool Long, class V> void blendAlong(V const* in, float fraction, V* out) {
  if constexpr (Long) {
    out[0] = blendTwo(in[0], in[1], 0.0f), out[1] = blendTwo(in[0], in[1], 0.5f);
    out[2] = blendTwo(in[1], in[2], 0.0f), out[3] = blendTwo(in[1], in[2], 0.5f);
  } else {
    out[0] = blendTwo(in[0], in[1], fraction);
  }
}

template <bool Long> auto blendRow(float const* row, float fraction) {
  if constexpr (Long) {
    FloatLanes const low{row[0], row[0], row[1], row[1]}, high{row[1], row[1], row[2], row[2]};
    return lerpLanes(low, high, FloatLanes{0.0f, 0.5f, 0.0f, 0.5f});
  } else {
    return blendTwo(row[0], row[1], fraction);
  }
}

template <bool I, bool J, bool K> void blendHalves(ParentBlend const& b, HaloRegion const& region) {
  using V = std::conditional_t<I, FloatLanes, float>;
  constexpr int kRows = J ? 3 : 2, kPlanes = K ? 3 : 2, kCountJ = J ? 4 : 1, kCountK = K ? 4 : 1;
  std::ptrdiff_t const w = b.table->targetWidth;
  HaloAxis const &i = b.i[region.low[0]], &j = b.j[region.low[1]], &k = b.k[region.low[2]];
  auto const* const low = static_cast<float const*>(b.parent) + i.at + (j.at + k.at * w) * w;
  auto* const target = static_cast<float*>(b.target) + region.target;
  V columns[kCountJ][kPlanes];
#pragma GCC unroll 4
  for (int z = 0; z < kPlanes; ++z) {
    V rows[kRows], blended[kCountJ];
#pragma GCC unroll 4
    for (int y = 0; y < kRows; ++y) rows[y] = blendRow<I>(low + (y + z * w) * w, i.fraction);
    blendAlong<J>(rows, j.fraction, blended);
#pragma GCC unroll 4
    for (int y = 0; y < kCountJ; ++y) columns[y][z] = blended[y];
  }
#pragma GCC unroll 4
  for (int y = 0; y < kCountJ; ++y) {
    V blended[kCountK];
    blendAlong<K>(columns[y], k.fraction, blended);
#pragma GCC unroll 4
    for (int z = 0; z < kCountK; ++z) std::memcpy(target + (y + z * w) * w, &blended[z], sizeof(V));
  }
}

template <bool I, bool J, bool K> std::uint64_t blendAll(ParentBlend const& b, std::uint64_t regions) {
  std::uint64_t const these = regions & b.table->aroundByLength[I + 2 * J + 4 * K];
  for (std::uint64_t left = these; left; left &= left - 1) blendHalves<I, J, K>(b, b.table->regionOf(left));
  return regions & ~these;
}

} // namespace

void blendFloats(ParentBlend const& b, std::uint64_t regions) {
  regions = blendAll<false, false, false>(b, regions);
  regions = blendAll<true, false, false>(b, regions);
  regions = blendAll<false, true, false>(b, regions);
  regions = blendAll<false, false, true>(b, regions);
  regions = blendAll<true, true, false>(b, regions);
  regions = blendAll<true, false, true>(b, regions);
  regions = blendAll<false, true, true>(b, regions);
  for (; regions; regions &= regions - 1) blendBox(boxOf(b, regions));
}

namespace {

// Along i for each row of samples, along j for each of their planes, along k for each element. The counts are
// constants, or else the box's own: 0.
template <int I, int J, int K> void blendCounts(BoxBlend const& b) {
  constexpr int kMostI = I ? I : kLargestBlend, kMostJ = J ? J : kLargestBlend;
  int const countI = I ? I : b.count[0], countJ = J ? J : b.count[1], countK = K ? K : b.count[2];
  int const sampleRows = J == 1 ? 2 : b.sampleCount[1], samplePlanes = K == 1 ? 2 : b.sampleCount[2];
  float columns[(K == 1 ? 1 : kLargestBlend) + 1][kMostJ][kMostI];
  auto const* samples = b.samples;
  for (int k = 0; k < samplePlanes; ++k) {
    float rows[(J == 1 ? 1 : kLargestBlend) + 1][kMostI];
    for (int j = 0; j < sampleRows; ++j, samples += b.sampleCount[0])
#pragma GCC unroll 4
      for (int i = 0; i < countI; ++i) {
        auto const value = [&](int at) { return *static_cast<float const*>(samples[at]); };
        int const at = I == 1 ? 0 : b.at[0][i];
        rows[j][i] = blendTwo(value(at), value(at + 1), static_cast<float>(b.fraction[0][i]));
      }
    for (int j = 0; j < countJ; ++j) {
      auto const* const low = rows + (J == 1 ? 0 : b.at[1][j]);
      auto const t = static_cast<float>(b.fraction[1][j]);
#pragma GCC unroll 4
      for (int i = 0; i < countI; ++i) columns[k][j][i] = blendTwo(low[0][i], low[1][i], t);
    }
  }
  for (int k = 0; k < countK; ++k) {
    auto const* const low = columns + (K == 1 ? 0 : b.at[2][k]);
    auto const t = static_cast<float>(b.fraction[2][k]);
    for (int j = 0; j < countJ; ++j) {
      auto* const target = static_cast<float*>(b.target) + (j + k * b.targetWidth) * b.targetWidth;
#pragma GCC unroll 4
      for (int i = 0; i < countI; ++i) target[i] = blendTwo(low[0][j][i], low[1][j][i], t);
    }
  }
}

} // namespace

void blendFloats(BoxBlend const& b) {
  // Edges and corners of one layer are the most.
  if (b.count[1] == 1 && b.count[2] == 1) {
    if (b.count[0] == 1) return blendCounts<1, 1, 1>(b);
    if (b.count[0] == 4) return blendCounts<4, 1, 1>(b);
  } else if (b.count[0] == 1 && b.count[2] == 1) {
    return blendCounts<1, 0, 1>(b);
  } else if (b.count[0] == 1 && b.count[1] == 1) {
    return blendCounts<1, 1, 0>(b);
  } else if (b.count[0] == 4) {
    return blendCounts<4, 0, 0>(b);
  }
  blendCounts<0, 0, 0>(b);
}

} // namespace VLN::TileTree3D::Internal
