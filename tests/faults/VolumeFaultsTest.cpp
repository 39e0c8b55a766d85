// Volumes, pools and the object logger when memory ends.
#include "Faults.h"

#include "GeometryVolume/channels/Halo.h"
#include "GeometryVolume/channels/UpdateDispatch.h"
#include "GeometryVolume/pools/ArrayPool.h"
#include "GeometryVolume/pools/BaseLogger.h"
#include "GeometryVolume/pools/ChannelPool.h"
#include "GeometryVolume/sampling/VoxelSamplerLinear.h"
#include "GeometryVolume/tiletree/TileAccessor.h"
#include "GeometryVolume/topology/Command.h"
#include "channels/FakeTree.h"

#include <gtest/gtest.h>
#include <iostream>
#include <memory>
#include <sstream>
#include <vector>

namespace {

using namespace VLN;
using namespace VLN::TileTree3D;
using namespace VLN::Test;
using test::faults::After;
using test::faults::everyAllocation;

using Shape = PowerOfTwoTraits;
using Tree = Container<Shape>;
using Topology = VoxelTopology<Shape>;
using Points = Channel<Shape, int, 4, 0>;

std::string stateOf(Points const& channel) {
  std::ostringstream os;
  os << channel.tileCount(-1) << ' ' << channel.size();
  for (int const v : channel) os << ' ' << v;
  return os.str();
}

/// An object with two channels of one tree, one of which another object holds as well.
struct Pair {
  VLN::Object object, other;
};
Pair pairOfChannels() {
  Pair p;
  FakeTree tree("tree");
  tree.set(3, 6, 2);
  for (auto const* name : {"a", "b"}) {
    auto c = Ostil::makePtr<Points>(name, nullptr, kInitializeDefaultValue, false, true, 0, 28);
    c->setTargetName("tree");
    c->update(tree);
    int v = 0;
    for (int& element : *c) element = ++v;
    if (*name == 'a') p.other.addComponent(c);
    p.object.addComponent(std::move(c));
  }
  return p;
}
std::string stateOfPair(Pair const& p) {
  std::string text;
  for (auto const* object : {&p.object, &p.other}) {
    auto const keys = object->keys();
    for (auto const& name : *keys) {
      auto const c = object->component<Points>(name);
      text += name + ": " + (c ? stateOf(*c) : "none") + "; ";
    }
  }
  return text;
}

TEST(ObjectFaults, RequirementComponentsComeBack) {
  // Channels are updated one after the other or side by side: each is as before or done.
  FakeTree tree("tree");
  tree.set(3, 9, 2);
  everyAllocation<Pair>(
      "a dispatched update",
      {&pairOfChannels, [&](Pair& p) { updateTilesAdded(tree, p.object); }, &stateOfPair, After::kUsable});
  everyAllocation<Pair>("a component is taken out",
                        {&pairOfChannels,
                         [](Pair& p) { auto const a = p.object.extractComponent<Points>("a"); },
                         &stateOfPair});
  everyAllocation<Pair>("a handle is written", {[] {
                                                  Pair p = pairOfChannels();
                                                  p.other = p.object;
                                                  return p;
                                                },
                                                [](Pair& p) { p.object.eraseProperty("a"); }, &stateOfPair});
}

struct Volume {
  Ostil::Ptr<Tree> tree = Ostil::makePtr<Tree>("tree", 1.0f);
  Ostil::Ptr<Topology> topology = Ostil::makePtr<Topology>("topology", kVoxelOffsetCorner);
  Volume() {
    for (int n = 0; n < 6; ++n) tree->tileAccessor().addTile({8 * n, 4 * n, 0}, 26);
    topology->update(*tree);
  }
};
std::string stateOfVolume(Volume const& v) {
  std::ostringstream os;
  os << v.tree->tileCount(-1) << ' ' << v.tree->checkConsistency(false) << " topology "
     << v.topology->tileCount(-1);
  for (int d = 0; d < Shape::kDepths; ++d)
    for (std::int64_t n = 0; n < v.topology->tileCount(d); ++n)
      os << ' ' << v.topology->elementCount(TreeIndex{n, d});
  return os.str();
}

TEST(TreeFaults, RequirementTopologiesAndCopies) {
  everyAllocation<Volume>("a topology follows",
                          {[] {
                             Volume v;
                             for (int n = 0; n < 40; ++n)
                               v.tree->tileAccessor().addTile({400 + 8 * n, 0, 0}, 27);
                             return v;
                           },
                           [](Volume& v) { v.topology->update(*v.tree); }, &stateOfVolume});
  struct Copied : Volume {
    Ostil::Ptr<VLN::Component> copy;
  };
  everyAllocation<Copied>("a tree is copied",
                          {[] { return Copied(); }, [](Copied& v) { v.tree->copyTo(v.copy); },
                           [](Copied const& v) { return stateOfVolume(v) + (v.copy ? "+" : ""); },
                           After::kUsable});
}

/// Text to nowhere: the pools and the logger write while things fail.
class Quiet {
public:
  Quiet()
      : m_out(std::cout.rdbuf(nullptr))
      , m_err(std::cerr.rdbuf(nullptr)) {}
  ~Quiet() {
    std::cout.rdbuf(m_out), std::cerr.rdbuf(m_err);
    std::cout.clear(), std::cerr.clear();
  }

private:
  std::streambuf *m_out, *m_err;
};

/// The pools on while it lives.
struct Pools {
  Pools() { ArrayPool::enable(), ChannelPool::enable(); }
  ~Pools() { ArrayPool::disable(), ChannelPool::disable(); }
};

TEST(PoolFaults, RegressionNothingIsLostWhenEntriesGo) {
  struct Holder {
    std::shared_ptr<Pools> pools = std::make_shared<Pools>();
    std::vector<Ostil::Ptr<Ostil::Array<float>>> held;
  };
  auto const make = [] {
    Holder h;
    for (int n = 0; n < 9; ++n) h.held.push_back(ArrayPool::allocate<float>(1, 100));
    for (std::size_t n : {7, 5, 2}) h.held[n].reset();
    return h;
  };
  auto const state = [](Holder const&) {
    return std::to_string(ArrayPool::usedStoreSize()) + " used " +
           std::to_string(ArrayPool::freeStoreSize()) + " free";
  };
  everyAllocation<Holder>(
      "idle arrays are freed",
      {make, [](Holder&) { ArrayPool::freeMemory(std::uint64_t(1) << 60); }, state, After::kUsable});
  // It needs no memory at all.
  Holder const h = make();
  test::faults::Armed const armed(1, test::faults::Mode::kFromThenOn);
  ArrayPool::freeMemoryNotUsedSinceCount(5);
  bool const none = test::faults::failures() == 0;
  EXPECT_TRUE(none);
}

TEST(PoolFaults, RequirementAllocation) {
  struct Holder {
    std::shared_ptr<Pools> pools = std::make_shared<Pools>();
    Ostil::Ptr<Ostil::Array<float>> array;
    Ostil::Ptr<Points> channel;
  };
  FakeTree tree;
  tree.set(3, 6, 2);
  auto const state = [](Holder const& h) {
    return std::to_string(h.array ? h.array->size() : 0) + ' ' + (h.channel ? stateOf(*h.channel) : "");
  };
  auto const act = [&](Holder& h) {
    auto array = ArrayPool::allocate<float>(1, 1000);
    auto channel = ChannelPool::allocate<Shape, int, 4, 0>(3, false, true, 0, 28, 6, nullptr);
    channel->update(tree);
    h.array = std::move(array), h.channel = std::move(channel);
  };
  everyAllocation<Holder>("from the pools", {[] { return Holder(); }, act, state});
  everyAllocation<Holder>("again from the pools", {[&] {
                                                     Holder h;
                                                     act(h);
                                                     h.array.reset(), h.channel.reset();
                                                     return h;
                                                   },
                                                   act, state});
}

TEST(LoggerFaults, RequirementNothingIsThrown) {
  Quiet const quiet;
  BaseLogger::enable();
  struct Named {
    std::shared_ptr<Base> base = std::make_shared<Base>("n");
    int done = 0;
  };
  everyAllocation<Named>("hooks", {[] { return Named(); },
                                   [](Named& n) {
                                     int block = 0;
                                     BaseLogger::pointerAllocated(&block, n.base.get());
                                     BaseLogger::pointerReAllocated(&block, &block + 1);
                                     BaseLogger::pointerDeAllocated(&block + 1, n.base.get());
                                     n.done = 1;
                                   },
                                   [](Named const& n) { return std::to_string(n.done); }});
  BaseLogger::clear();
  BaseLogger::disable();
}

} // namespace
