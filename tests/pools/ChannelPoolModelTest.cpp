// The pool against a list that is searched from end to end, under random operations; every channel handed out
// is filled with a value of its own and read back before it goes.
#include "ChannelPoolFixture.h"
#include "ControlGroup.h"

#include <algorithm>
#include <map>
#include <random>
#include <string>

namespace {

using namespace test;

struct Known {
  void* address;
  std::int64_t tiles; ///< At depth 28; an eighth more at depth 27.
  bool used;

  std::uint64_t all() const { return static_cast<std::uint64_t>(tiles + tiles / 8); }
};

struct Model {
  std::vector<Known> store;
  std::map<void*, std::uint64_t> lastHandOut;
  std::uint64_t clock = 0, required = 0, free = 0;
  bool requiring = false;

  void dropIdle(void* except = nullptr) {
    std::erase_if(store, [&](Known const& k) {
      bool const drop = !k.used && k.address != except;
      if (drop) lastHandOut.erase(k.address);
      return drop;
    });
  }
  void keepRequiredFree() {
    if (requiring && free < required) dropIdle();
  }
  std::uint64_t count(bool used) const {
    return static_cast<std::uint64_t>(
        std::count_if(store.begin(), store.end(), [&](Known const& k) { return k.used == used; }));
  }

  struct Expected {
    void* address; ///< Null for a new channel.
    bool inPool;
  };
  Expected allocate(std::uint64_t n, std::uint64_t tileBytes) {
    Known const* best = nullptr;
    for (Known const& k : store) {
      if (k.used) continue;
      bool const sufficient = best && best->all() >= n;
      if (!best || (!sufficient && (k.all() >= n || k.all() > best->all())) ||
          (best->all() > n && k.all() > n && k.all() < best->all()))
        best = &k;
    }
    void* const address = best ? best->address : nullptr;
    std::uint64_t const held = best ? best->all() : 0;
    bool const inPool = !requiring || free >= required + (n - std::min(n, held)) * tileBytes;
    if (!inPool) dropIdle(address);
    return {address, inPool};
  }
  void handedOut(Expected const& expected, void* address, std::int64_t tiles) {
    lastHandOut[address] = ++clock;
    auto const known =
        std::find_if(store.begin(), store.end(), [&](Known const& k) { return k.address == address; });
    if (!expected.inPool) {
      if (known == store.end()) return;
      *known = store.back();
      store.pop_back();
    } else if (known == store.end()) {
      store.push_back({address, tiles, true});
    } else {
      *known = {address, tiles, true};
    }
  }
  void letGo(void* address) {
    for (Known& k : store)
      if (k.address == address) k.used = false;
  }
  void age(std::uint64_t since) {
    std::erase_if(store, [&](Known const& k) {
      auto const known = lastHandOut.find(k.address);
      if (known != lastHandOut.end() && known->second >= since) return false;
      if (known != lastHandOut.end()) lastHandOut.erase(known);
      return true;
    });
  }
};

class ChannelPoolModel : public ChannelPoolTest, public ::testing::WithParamInterface<unsigned> {};

TEST_P(ChannelPoolModel, FollowsTheModel) {
  SCOPED_TRACE("seed " + std::to_string(GetParam()));
  std::mt19937_64 random(GetParam());
  auto const below = [&](std::uint64_t n) { return random() % n; };
  ArrayPool::disable();
  ControlGroup group;
  Model model;
  model.free = ControlGroup::kLimit;
  using Channel = Floats<4, 0>;
  struct Held {
    Channel channel;
    float value;
    std::int64_t tiles;
  };
  std::vector<Held> held;

  auto const allocate = [&] {
    std::int64_t const tiles = std::int64_t(below(std::uint64_t(1) << below(7)));
    std::uint64_t const n = std::uint64_t(tiles + tiles / 8);
    float const value = float(below(1000));
    auto const expected = model.allocate(n, 64 * sizeof(float));
    auto channel =
        ChannelPool::allocate<PowerOfTwoTraits, float, 4, 0>(value, false, true, 0, 28, n, nullptr);
    ASSERT_TRUE(channel);
    ASSERT_TRUE(!expected.address || channel.get() == expected.address);
    ASSERT_EQ(channel.useCount(), expected.inPool ? 2 : 1);
    ASSERT_EQ(channel->name(), "channel_pool");
    channel->update(Tiles(tiles));
    ASSERT_EQ(channel->tileCount(28), tiles);
    model.handedOut(expected, channel.get(), tiles);
    held.push_back({std::move(channel), value, tiles});
  };
  auto const letGo = [&] {
    if (held.empty()) return;
    std::size_t const i = below(held.size());
    for (std::int64_t t = 0; t < held[i].tiles; ++t)
      for (int e : {0, 31, 63}) ASSERT_EQ(held[i].channel->tileData(t, 28)[e], held[i].value);
    model.letGo(held[i].channel.get());
    held[i] = held.back();
    held.pop_back();
  };

  for (int step = 0; step < 25000; ++step) {
    SCOPED_TRACE("step " + std::to_string(step));
    auto const what = below(1000);
    if (what < 450) {
      allocate();
    } else if (what < 950) {
      letGo();
    } else if (what < 965) {
      std::uint64_t const since = model.clock - std::min(model.clock, below(40));
      ChannelPool::freeMemoryNotUsedSinceCount(since);
      model.age(since);
    } else if (what < 975) {
      model.free = below(100000) + 1000;
      group.setFree(model.free);
    } else if (what < 983) {
      std::uint64_t const size = below(110000);
      ChannelPool::setRequiredFreeSize(size);
      if (model.requiring) model.required = size, model.keepRequiredFree();
    } else if (what < 990) {
      bool const was = model.requiring;
      model.requiring = below(2) == 1;
      model.requiring ? ChannelPool::enableRequiredFreeSize() : ChannelPool::disableRequiredFreeSize();
      if (!was) model.keepRequiredFree();
    } else if (what < 992) {
      ChannelPool::freeMemory(1 + below(5000));
      model.dropIdle();
    } else if (what < 994) {
      ChannelPool::resetAllocationCount();
      model.clock = 0;
      model.lastHandOut.clear();
    } else if (what == 999) {
      ChannelPool::freeAllMemory();
      model.store.clear();
      model.lastHandOut.clear();
    }
    if (HasFatalFailure()) return;
    ASSERT_EQ(ChannelPool::freeStoreSize(), model.count(false));
    ASSERT_EQ(ChannelPool::usedStoreSize(), model.count(true));
    ASSERT_EQ(ChannelPool::allocationCount(), model.clock);
    ASSERT_EQ(ChannelPool::requiredFreeSize(), model.required);
  }
}

INSTANTIATE_TEST_SUITE_P(Seeds, ChannelPoolModel, ::testing::Values(21u, 22u, 23u, 24u));

} // namespace
