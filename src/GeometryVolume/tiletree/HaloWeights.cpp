#include "GeometryVolume/tiletree/HaloWeights.h"

#include <cmath>

namespace VLN::TileTree3D {

namespace {

constexpr int kUnit = 4096; // every weight is a whole number of 1/4096

/// Numerators over kUnit in table order.
constexpr std::array<int, kHaloWeightCount> makeNumerators() {
  std::array<int, kHaloWeightCount> table{};
  std::array<bool, kUnit + 1> taken{};
  int n = 0;
  auto const take = [&](int numerator) {
    taken[numerator] = true;
    table[n++] = numerator;
  };
  constexpr int kLast = 175 * kUnit / 1024;
  taken[kLast] = true;
  for (int first : {1024, 512, 2048, 256, 4096, 128, 768, 384}) take(first);

  // Simplest first: by reduced denominator, then by numerator, which for one denominator is by value.
  auto const appendMarked = [&](std::array<bool, kUnit + 1> const& marked) {
    for (int denominator = 1; denominator <= kUnit; denominator *= 2) {
      int const step = kUnit / denominator;
      for (int numerator = step; numerator <= kUnit; numerator += step) {
        bool const reduced = denominator == 1 || (numerator / step) % 2 == 1;
        auto const at = static_cast<std::size_t>(numerator);
        if (reduced && marked[at] && !taken[at] && n < kHaloWeightCount - 1) take(numerator);
      }
    }
  };

  std::array<bool, kUnit + 1> readable{}, products{};
  for (int level = 1; level <= 3; ++level) {
    int const corner = 16 >> level; // one step of j / 2^L, in sixteenths
    int const centred = corner / 2; // one step of j / 2^(L+1)
    for (int a = 1; a <= 16; ++a) {
      for (int b = 1; b <= 16; ++b) {
        for (int c = 1; c <= 16; ++c) {
          auto const each = [&](auto passes) { return passes(a) && passes(b) && passes(c); };
          auto const at = static_cast<std::size_t>(a * b * c);
          products[at] = true;
          if (each([&](int f) { return f % corner == 0; })) readable[at] = true;
          if (each([&](int f) { return f % centred == 0 && f / centred % 2 == 1; })) readable[at] = true;
        }
      }
    }
  }
  appendMarked(readable);
  appendMarked(products);
  take(kLast);
  return table;
}

} // namespace

std::array<float, kHaloWeightCount> const& haloWeights() {
  static std::array<float, kHaloWeightCount> const weights = [] {
    constexpr auto numerators = makeNumerators();
    static_assert(numerators.back() == 175 * kUnit / 1024);
    std::array<float, kHaloWeightCount> w{};
    for (std::size_t n = 0; n < w.size(); ++n) w[n] = static_cast<float>(numerators[n]) / kUnit;
    return w;
  }();
  return weights;
}

int nearestHaloWeight(float w) {
  auto const& weights = haloWeights();
  int best = 0;
  for (int n = 1; n < kHaloWeightCount; ++n) {
    if (std::abs(weights[n] - w) < std::abs(weights[best] - w)) best = n;
  }
  return best;
}

HaloCompression::HaloCompression()
    : weights(haloWeights()) {}

} // namespace VLN::TileTree3D
