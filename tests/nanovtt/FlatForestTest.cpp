// Random forests through every option, read again by the slow reader.
#include "support/FlatChecks.h"
#include "support/Threads.h"

#include <gtest/gtest.h>

namespace {

using namespace Support;

FlatVolume randomVolume(std::uint32_t seed, int maxTiles = 300) {
  FlatVolume volume;
  fillRandom(volume, seed, maxTiles);
  return volume;
}

/// With the table of roots at the depth of most roots: else a small forest is one level of a deep depth.
FlatOptions optionsFor(FlatVolume const& volume) {
  FlatOptions options;
  options.rootLevelLimit = 28 - volume.top;
  return options;
}

template <class BuildT = void>
void check(FlatVolume const& volume, FlatOptions const& options, std::string const& label) {
  expectFlat<BuildT>(volume, options, flatten<BuildT>(*volume.object, options),
                     label + ", " + options.text());
}

class FlatForest : public ::testing::TestWithParam<int> {
protected:
  std::uint32_t seed() const { return 7000u + static_cast<std::uint32_t>(GetParam()); }
};

TEST_P(FlatForest, RequirementEveryTileAndSampleIsFoundAgain) {
  auto const volume = randomVolume(seed());
  std::string const label = "seed " + std::to_string(seed());
  check(volume, {}, label);
  check(volume, optionsFor(volume), label);
  for (float const fraction : {0.3f, 1.0f}) {
    FlatOptions options = optionsFor(volume);
    options.haloFraction = fraction;
    check(volume, options, label);
  }
}

TEST_P(FlatForest, RequirementEachOptionAlone) {
  auto const volume = randomVolume(seed(), 150);
  std::string const label = "seed " + std::to_string(seed());
  std::vector<FlatOptions> all(9, optionsFor(volume));
  all[0].morton = true;
  all[1].coalesce = true;
  all[2].coalesce = true, all[2].haloFraction = 1;
  all[3].textures = true, all[3].haloFraction = 1;
  all[4].cubic = true;
  all[5].setCoarser = true;
  all[6].finestLevel = 2;
  all[7].rootLevelLimit = 0;
  all[8].checksum = nanovdb::ChecksumMode(2);
  for (auto const& options : all) check(volume, options, label);
}

TEST_P(FlatForest, RequirementQuantisedSamplesLieWithinTheirBounds) {
  auto const volume = randomVolume(seed(), 100);
  std::string const label = "seed " + std::to_string(seed());
  for (bool const dither : {false, true})
    for (float const fraction : {0.0f, 0.5f, 1.0f}) {
      FlatOptions options = optionsFor(volume);
      options.dither = dither, options.haloFraction = fraction;
      check<nanovdb::Fp4>(volume, options, label + " Fp4");
      check<nanovdb::Fp8>(volume, options, label + " Fp8");
      check<nanovdb::Fp16>(volume, options, label + " Fp16");
      for (float const tolerance : {-1.0f, 0.0f, 0.01f, 0.5f}) {
        options.tolerance = tolerance;
        check<nanovdb::FpN>(volume, options, label + " FpN");
      }
    }
}

FlatOptions randomOptions(FlatVolume const& volume, std::mt19937& random) {
  auto const chance = [&](unsigned n) { return random() % n == 0; };
  FlatOptions o = optionsFor(volume);
  o.checksum = static_cast<nanovdb::ChecksumMode>(random() % 3);
  o.haloFraction = chance(3) ? 0.0f : chance(3) ? 1.0f : static_cast<float>(random() % 100) / 100.0f;
  if (chance(3)) o.rootLevelLimit += static_cast<int>(random() % 7) - 3;
  if (chance(3)) o.finestLevel = o.rootLevelLimit - static_cast<int>(random() % 7);
  o.morton = chance(2), o.coalesce = chance(2), o.cubic = chance(3);
  int const sizes[] = {1, 2, 4, 12, 16};
  o.elementBytes = sizes[random() % 5];
  o.textures = !o.coalesce && o.haloFraction == 1 && chance(2);
  o.setCoarser = chance(3);
  o.coarserTolerance = chance(2) ? 0.0f : 0.5f;
  o.dither = chance(2);
  o.tolerance = chance(2) ? -1.0f : static_cast<float>(random() % 100) / 100.0f;
  return o;
}

TEST_P(FlatForest, RequirementOptionsInRandomCombinations) {
  std::mt19937 random(seed() * 31);
  for (int n = 0; n < 6; ++n) {
    auto const volumeSeed = seed() + 1000u * static_cast<unsigned>(n + 1);
    auto const volume = randomVolume(volumeSeed, 120);
    auto const options = randomOptions(volume, random);
    std::string const label = "seed " + std::to_string(volumeSeed);
    check(volume, options, label);
    auto quantised = options;
    quantised.coalesce = quantised.textures = false;
    switch (n % 4) {
    case 0:
      check<nanovdb::Fp4>(volume, quantised, label + " Fp4");
      break;
    case 1:
      check<nanovdb::Fp8>(volume, quantised, label + " Fp8");
      break;
    case 2:
      check<nanovdb::Fp16>(volume, quantised, label + " Fp16");
      break;
    default:
      quantised.setCoarser = false;
      check<nanovdb::FpN>(volume, quantised, label + " FpN");
    }
  }
}

INSTANTIATE_TEST_SUITE_P(Seeds, FlatForest, ::testing::Range(0, 12));

} // namespace
