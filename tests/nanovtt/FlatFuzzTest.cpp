// Replays the fuzzer's cases without the fuzzer: seeds made from volumes, and mutations of them. With
// FUZZ_SEEDS naming a folder, the seeds are also written there for scripts/fuzz.sh.
#include "support/FlatCase.h"
#include "support/FlatVolume.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <fstream>

namespace {

using namespace Support;

std::vector<FlatCase> seeds() {
  std::vector<FlatCase> cases;
  auto const add = [&](auto const& handle) {
    if (handle.empty() || handle.size() > FlatCase::kMost - 8192) return;
    for (bool const file : {false, true}) cases.push_back(FlatCase::of(handle.data(), handle.size(), file));
    if (cases.back().tail.size() > FlatCase::kTailMost) cases.resize(cases.size() - 2);
  };
  for (std::uint32_t seed = 0; seed < 6; ++seed) {
    FlatVolume volume;
    if (seed == 0) {
      volume.complete({0, 0, 0}, 20, 2);
      volume.complete({4096, 0, 0}, 20, 1);
      volume.add({0, 0, 0}, 22, 25);
      volume.finish();
      volume.channel<float>("a", 0.5f, [](auto const&, int k) { return static_cast<float>(k); });
      volume.channel<std::int32_t>("b", 1, [](auto const&, int k) { return k; });
    } else if (seed == 1) {
      volume.finish();
      volume.channel<float>("a", 0.5f, [](auto const&, int k) { return static_cast<float>(k); });
    } else {
      fillRandom(volume, seed, 8);
    }
    FlatOptions options;
    options.rootLevelLimit = seed < 2 ? 8 : 28 - volume.top;
    options.elementBytes = 1;
    options.haloFraction = seed % 2 ? 1.0f : 0.3f;
    add(flatten(*volume.object, options));
    options.coalesce = true;
    add(flatten(*volume.object, options));
    options.coalesce = false;
    options.filter = "a c0";
    add(flatten<nanovdb::Fp4>(*volume.object, options));
    add(flatten<nanovdb::FpN>(*volume.object, options));
    options.haloFraction = 1, options.textures = true;
    add(flatten(*volume.object, options));
  }
  return cases;
}

TEST(FlatFuzz, RequirementSeedsAreAcceptedAndPackedWithoutLoss) {
  auto const cases = seeds();
  EXPECT_GE(cases.size(), 40u);
  char const* const folder = std::getenv("FUZZ_SEEDS");
  int n = 0;
  for (auto const& c : cases) {
    EXPECT_TRUE(c.run());
    auto const packed = c.pack();
    auto const again = FlatCase::unpack(packed.data(), packed.size());
    EXPECT_TRUE(again.run());
    EXPECT_EQ(again.pack(), packed);
    if (folder)
      std::ofstream(std::string(folder) + "/seed" + std::to_string(n++), std::ios::binary)
          .write(reinterpret_cast<char const*>(packed.data()), static_cast<std::streamsize>(packed.size()));
  }
}

TEST(FlatFuzz, RequirementMutatedCasesDoNoHarm) {
  std::mt19937_64 random(11);
  int accepted = 0, refused = 0;
  auto const cases = seeds();
  for (int n = 0; n < 4000; ++n) {
    auto c = cases[random() % cases.size()];
    for (auto k = random() % 3 + 1; k; --k) c.mutate(random);
    ++(c.run() ? accepted : refused);
  }
  EXPECT_GT(accepted, 100);
  EXPECT_GT(refused, 1000);
}

TEST(FlatFuzz, NegativeAnyBytesAreACase) {
  std::mt19937_64 random(12);
  for (std::size_t size = 0; size < 3000; size += 1 + size / 8) {
    std::vector<std::uint8_t> bytes(size);
    for (auto& b : bytes) b = static_cast<std::uint8_t>(random());
    EXPECT_FALSE(FlatCase::unpack(bytes.data(), bytes.size()).run());
  }
}

} // namespace
