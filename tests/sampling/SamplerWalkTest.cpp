// A sampler that walks through a volume against one that has seen nothing: what it remembers of tiles, voxels
// and cells never shows.
#include "sampling/SamplerVolume.h"
#include "support/Shapes.h"

#include <cmath>
#include <cstring>

namespace VLN::Test {
namespace {

template <class TraitsT> using Sampler = OpenSampler<TraitsT>;

float wavyField(double x, double y, double z) {
  return static_cast<float>(std::sin(0.7 * x) + std::cos(0.4 * y + 1) * std::sin(0.3 * z));
}
bool sameBits(float a, float b) { return std::memcmp(&a, &b, sizeof a) == 0; }

/// Short steps, turns, places on tiles' faces, jumps now and then, and back to where it was.
class Walk {
public:
  Walk(std::uint32_t seed, float3 const& centre, double reach, float pace)
      : m_random(seed)
      , m_centre(centre)
      , m_reach(reach)
      , m_pace(pace) {
    jump();
  }
  float3 next() {
    float3 const before = m_at;
    switch (m_random() % 32) {
    case 0:
      jump();
      break;
    case 1:
      m_step = {unit(), unit(), unit()};
      break;
    case 2:
      m_at = {std::floor(m_at.x), m_at.y, std::floor(m_at.z)};
      break;
    case 3:
      std::swap(m_at, m_other);
      break;
    default:
      m_at = m_at + m_step * m_pace;
      break;
    }
    if (m_random() % 8 == 0) m_other = before;
    return m_at;
  }
  std::uint32_t number() { return static_cast<std::uint32_t>(m_random()); }

private:
  float unit() { return std::uniform_real_distribution<float>(-1.0f, 1.0f)(m_random); }
  void jump() {
    auto const r = static_cast<float>(m_reach);
    m_at = m_centre + float3{unit() * r, unit() * r, unit() * r};
    m_step = {unit(), unit(), unit()};
  }

  std::mt19937 m_random;
  float3 m_centre, m_at{}, m_other{}, m_step{};
  double m_reach;
  float m_pace;
};

VLN_SHAPE_SUITE(SamplerWalkTest);

// requirement: sample and gradient at each place of a walk are those of a new sampler, bit for bit: for both
// kinds of channel, samples inside of voxels and on their corners, changing depths, before and after tables
// are made, and where single precision is coarser than a voxel
TYPED_TEST(SamplerWalkTest, WhatIsRememberedNeverShows) {
  using Traits = TypeParam;
  constexpr int kDeep = Traits::kMaxDepth;
  int const far = 1 << 25; // beyond it every fourth integer is a float
  for (int type : {0, 3, 7})
    for (int3 const& centre : {int3{0, 0, 0}, int3{-900, 17, 400}, int3{far + 20, 5, -far}}) {
      SamplerVolume<Traits> volume(static_cast<VoxelOffsetType>(type));
      volume.addRandom(static_cast<std::uint32_t>(50 + type), centre, 60, kDeep - 3);
      volume.fill(wavyField, -5.0f);
      double const reach = 1.5 * Traits::width(kDeep - 2);
      float3 const c{float(centre.x), float(centre.y), float(centre.z)};
      auto const check = [&](auto const& channel, char const* name, bool withTables) {
        SCOPED_TRACE(name + std::string(" channel, type ") + std::to_string(type) + " at " +
                     std::to_string(centre.x) + (withTables ? ", with tables" : ""));
        Sampler<Traits> const walker(volume.tree, volume.topology, channel);
        if (withTables) {
          std::vector<float3> const many(40000, c);
          std::vector<float> values(many.size());
          walker.sample(many.data(), values.data(), static_cast<std::int64_t>(many.size()), kDeep,
                        kSamplerTileSpace);
        }
        Walk walk(7, c, reach, centre.x < far ? 0.6f : 6.0f);
        int depth = kDeep, bad = 0, found = 0;
        for (int n = 0; n < 1500; ++n) {
          float3 const p = walk.next();
          if (walk.number() % 64 == 0) depth = kDeep + 1 - static_cast<int>(walk.number() % 4);
          Sampler<Traits> const fresh(volume.tree, volume.topology, channel);
          float3 wanted, gradient;
          float const value = fresh.sampleGradient(p, depth, kSamplerTileSpace, &wanted);
          bad += !sameBits(value, walker.sample(p, depth, kSamplerTileSpace));
          bad += !sameBits(value, walker.sampleGradient(p, depth, kSamplerTileSpace, &gradient));
          bad += !(gradient == wanted);
          found += !sameBits(value, -5.0f);
        }
        EXPECT_EQ(bad, 0);
        EXPECT_GT(found, 300); // the walk is in the volume
      };
      for (bool const withTables : {false, true}) {
        check(*volume.core, "core", withTables);
        check(*volume.wide, "wide", withTables);
      }
    }
}

// requirement: a gradient may be written over the position that it belongs to
TYPED_TEST(SamplerWalkTest, GradientOverThePosition) {
  using Traits = TypeParam;
  SamplerVolume<Traits> volume;
  volume.addRandom(5, {0, 0, 0}, 60, Traits::kMaxDepth - 2);
  volume.fill(wavyField);
  Sampler<Traits> const sampler(volume.tree, volume.topology, *volume.wide);
  for (float const x : {0.3f, 1.4f, 2.5f, 1.4f}) {
    float3 const p{x, 1.0f, 2.0f};
    float3 gradient, both = p;
    float const value = sampler.sampleGradient(p, kSamplerTileSpace, &gradient);
    EXPECT_TRUE(sameBits(sampler.sampleGradient(both, kSamplerTileSpace, &both), value));
    EXPECT_TRUE(both == gradient);
  }
}

} // namespace
} // namespace VLN::Test
