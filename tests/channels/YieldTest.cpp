// The update protocol while threads give way at chosen places.
#include "support/YieldSeeds.h"

#ifdef VLN_YIELD_POINTS

#include "FakeTree.h"
#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/channels/UpdateDispatch.h"
#include "GeometryVolume/core/Object.h"

#include <atomic>
#include <gtest/gtest.h>
#include <random>
#include <thread>
#include <vector>

namespace {

using namespace VLN::TileTree3D;
using VLN::Test::FakeTree;
using Field = Channel<PowerOfTwoTraits, int, 4, 0>;

constexpr int kThreads = 3, kChannels = 4, kRounds = 15, kSeeds = 12;

std::string nameOf(int n) { return "channel_" + std::to_string(n); }

/// Objects that share their channels at first; each thread changes its own, while another measures them all.
TEST(UpdateYields, RequirementObjectsThatShareChannelsChangeOnTheirOwn) {
  Support::underYieldSeeds(kSeeds, [](std::uint64_t seed) {
    FakeTree first("tree");
    first.set(3, 4, 5);
    VLN::Object object;
    for (int n = 0; n < kChannels; ++n) {
      auto c = Ostil::makePtr<Field>(nameOf(n), nullptr, kInitializeDefaultValue, false, true, 0, 28);
      c->setTargetName("tree");
      c->update(first);
      for (int& v : *c) v = n;
      object.addComponent(std::move(c));
    }
    std::vector<VLN::Object> own(kThreads, object);
    std::atomic<int> running{kThreads}, wrong{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t)
      threads.emplace_back([&, t] {
        std::mt19937 random(static_cast<std::uint32_t>(seed + static_cast<std::uint64_t>(t)));
        for (int round = 0; round < kRounds; ++round) {
          FakeTree tree("tree");
          tree.set(3, 4 + random() % 20, 5);
          tree.set(9, random() % 20, 5);
          auto& mine = own[static_cast<std::size_t>(t)];
          updateTilesAdded(tree, mine);
          for (int n = 0; n < kChannels; ++n) {
            auto const c = mine.component<Field>(nameOf(n));
            if (!c || c->tileCount(-1) < tree.tileCount(-1)) {
              ++wrong;
              continue;
            }
            for (int i = 0; i < 4; ++i) // the tiles of the beginning keep what they held
              for (int const v : std::as_const(*c).tileData(i, 3)) wrong += v == n ? 0 : 1;
          }
        }
        --running;
      });
    while (running > 0)
      for (int n = 0; n < kChannels; ++n) {
        std::uint64_t used = 0, allocated = 0;
        object.component<Field>(nameOf(n))->memUse(used, allocated, false);
        if (used == 0) ++wrong;
      }
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(wrong, 0);
    for (int n = 0; n < kChannels; ++n) EXPECT_EQ(object.component<Field>(nameOf(n))->tileCount(-1), 4);
  });
}

} // namespace

#endif
