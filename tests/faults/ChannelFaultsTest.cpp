// Channels when memory ends: all or nothing.
#include "Faults.h"

#include "GeometryVolume/channels/Channel.h"
#include "channels/FakeTree.h"

#include <gtest/gtest.h>
#include <sstream>

namespace {

using namespace VLN;
using namespace VLN::TileTree3D;
using namespace VLN::Test;
using test::faults::After;
using test::faults::everyAllocation;

using Points = Channel<PowerOfTwoTraits, int, 4, 0>;
using Field = Channel<PowerOfTwoTraits, float, 4, 1>;

template <class C> std::string stateOf(C const& channel) {
  std::ostringstream os;
  os << channel.minDepth() << ' ' << channel.depth() << ' ' << channel.tileCount(-1) << ' ' << channel.size();
  for (int d = 0; d < kChannelDepths; ++d) {
    if (channel.tileCount(d) == 0 && channel.elementCount(d) == 0) continue;
    os << " [" << d << ": " << channel.tileCount(d) << ' ' << channel.elementCount(d);
    for (std::int64_t n = 0; n < channel.tileCount(d); ++n) {
      os << " {" << channel.elementCount(TreeIndex{n, d});
      for (auto const v : channel.tileData(n, d)) os << ' ' << v;
      os << '}';
    }
    os << ']';
  }
  return os.str();
}

FakeTree tiles(std::size_t shallow, std::size_t deep, int each = 3) {
  FakeTree tree;
  tree.set(3, shallow, each).set(20, deep, each);
  return tree;
}
template <class C> void number(C& channel) {
  int v = 0;
  for (int d : {3, 20})
    for (std::int64_t n = 0; n < channel.tileCount(d); ++n)
      for (auto& element : channel.tileData(n, d)) element = static_cast<typename C::value_type>(++v);
}

/// A channel, and perhaps another that shares what it holds.
template <class C> struct Held { Ostil::Ptr<C> channel, other; };
template <class C> Held<C> held(bool isStatic, bool shared = false, int first = 0, int last = 28) {
  Held<C> h;
  h.channel = Ostil::makePtr<C>("held", nullptr, kInitializeDefaultValue, isStatic, true, first, last);
  h.channel->update(tiles(6, 9));
  number(*h.channel);
  if (shared) h.other = Ostil::makePtr<C>(*h.channel);
  return h;
}
template <class C> std::string stateOfBoth(Held<C> const& h) {
  return stateOf(*h.channel) + (h.other ? " beside " + stateOf(*h.other) : "");
}

template <class C>
void tryOn(char const* name, bool isStatic, bool shared, std::function<void(C&)> const& act) {
  everyAllocation<Held<C>>(name, {[=] { return held<C>(isStatic, shared); },
                                  [&](Held<C>& h) { act(*h.channel); }, &stateOfBoth<C>});
}
template <class C> void tryEach(char const* name, std::function<void(C&)> const& act) {
  for (bool const isStatic : {false, true})
    for (bool const shared : {false, true}) {
      // A shared static channel whose copy finds no block is empty, and says nothing.
      if (isStatic && shared) continue;
      SCOPED_TRACE(std::string(isStatic ? "static" : "own") + (shared ? ", shared" : ""));
      tryOn<C>(name, isStatic, shared, act);
    }
}

TEST(ChannelFaults, RequirementGrowing) {
  FakeTree const more = tiles(8, 14);
  tryEach<Points>("points grow", [&](Points& c) { c.update(more); });
  tryEach<Field>("a field grows", [&](Field& c) { c.updateTilesAdded(more); });
}
TEST(ChannelFaults, RequirementGrowingByManyMegabytes) {
  FakeTree const more = tiles(8, 12000);
  auto const counts = [](Held<Field> const& h) {
    Field const& c = *h.channel;
    auto const last = c.tileData(c.tileCount(20) - 1, 20);
    return std::to_string(c.tileCount(-1)) + ' ' + std::to_string(c.size()) + ' ' + std::to_string(last[0]);
  };
  everyAllocation<Held<Field>>(
      "a large field grows",
      {[] { return held<Field>(true); }, [&](Held<Field>& h) { h.channel->update(more); }, counts});
}
TEST(ChannelFaults, RequirementShrinking) {
  FakeTree const fewer = tiles(1, 2), both = tiles(1, 30);
  tryEach<Points>("points shrink", [&](Points& c) { c.update(fewer); });
  tryEach<Points>("points shrink and grow", [&](Points& c) { c.update(both); });
}
TEST(ChannelFaults, RequirementRemovedTiles) {
  FakeTree const left = tiles(4, 7), grown = tiles(4, 12);
  TileRemovalList removed(kChannelDepths);
  removed[3] = {{0, 5}, {2, 4}};
  removed[20] = {{1, 8}, {3, 7}};
  tryEach<Points>("tiles go", [&](Points& c) { c.updateTilesRemoved(removed, left); });
  tryEach<Field>("tiles of a field go", [&](Field& c) { c.updateTilesRemoved(removed, left); });
}
TEST(ChannelFaults, RequirementPermutedTiles) {
  TilePermutation order(kChannelDepths);
  order[3] = {5, 4, 3, 2, 1, 0};
  order[20] = {8, 0, 1, 2, 3, 4, 5, 6, 7};
  // Done twice it is not what it was once: the state afterwards is compared with that of one run.
  tryEach<Points>("tiles in a new order", [&](Points& c) { c.updateTilesPermuted(order); });
}
TEST(ChannelFaults, RequirementElementMoves) {
  tryEach<Points>("elements move", [](Points& c) {
    ElementMoves moves(kChannelDepths);
    moves[3] = {{1, 0, 0, 3}, {2, 0, 1, 3}, {2, 3, 1, 20}};
    moves[20] = {{8, 1, 0, 3}, {0, 2, 2, 20}};
    c.update(moves, false);
  });
  tryEach<Points>("a record of moves", [](Points& c) {
    TileDataElementAccessor record;
    record.move(ElementTreeIndex(0, 3, 0), TreeIndex{1, 20});
    record.remove(ElementTreeIndex(4, 20, 1));
    c.update(record);
  });
}
TEST(ChannelFaults, RequirementSizesAndRanges) {
  FakeTree const more = tiles(8, 14);
  tryEach<Points>("a depth resized", [](Points& c) { c.resize(20, 30, 4); });
  tryEach<Points>("all depths resized", [](Points& c) {
    std::int64_t counts[kChannelDepths]{};
    counts[3] = 9, counts[20] = 4, counts[22] = 5;
    c.resize(counts, 4);
  });
  tryEach<Points>("depths removed", [](Points& c) { c.removeAll(); });
  tryEach<Points>("a shallower range", [&](Points& c) { c.setDepth(10, more); });
  tryEach<Points>("a range that begins deeper", [&](Points& c) { c.setMinDepth(10, more); });
  everyAllocation<Held<Points>>("a deeper range", {[] { return held<Points>(false, false, 0, 10); },
                                                   [&](Held<Points>& h) { h.channel->setDepth(28, more); },
                                                   &stateOfBoth<Points>});
}
TEST(ChannelFaults, RequirementWritingWhatIsShared) {
  for (bool const assigned : {false, true}) {
    everyAllocation<Held<Points>>(assigned ? "an assigned channel is written" : "a copied channel is written",
                                  {[=] {
                                     auto h = held<Points>(false, !assigned);
                                     if (assigned) {
                                       h.other = Ostil::makePtr<Points>("other", nullptr, kInitializeNone,
                                                                        false, true, 0, 28);
                                       *h.other = *h.channel;
                                     }
                                     return h;
                                   },
                                   [](Held<Points>& h) {
                                     h.channel->cloneData();
                                     h.channel->tileData(2, 20).set(-1);
                                   },
                                   &stateOfBoth<Points>});
  }
  tryEach<Points>("tiles filled", [](Points& c) { c.fillTiles(20, {0, 3, 8}); });
  tryEach<Points>("compacted", [](Points& c) { c.compactStorage(); });
}
TEST(ChannelFaults, RequirementCopiesAndArrays) {
  struct Copied {
    Held<Points> source = held<Points>(false); // a static copy without a block is empty
    Ostil::Ptr<VLN::Component> copy;
    Ostil::Ptr<void> flat, nested;
  };
  auto const state = [](Copied const& c) {
    return stateOf(*c.source.channel) + (c.copy ? stateOf(static_cast<Points const&>(*c.copy)) : "") +
           (c.nested ? " arrays" : "");
  };
  everyAllocation<Copied>(
      "a deep copy",
      {[] { return Copied(); }, [](Copied& c) { c.source.channel->copyTo(c.copy); }, state, After::kUsable});
  everyAllocation<Copied>("arrays and back", {[] { return Copied(); },
                                              [](Copied& c) {
                                                Ostil::Any const type(std::type_index(typeid(int)));
                                                auto flat = c.source.channel->channelData(0, type);
                                                auto nested = c.source.channel->channelData(3, type);
                                                c.source.channel->setChannelData(0, type, flat);
                                                c.source.channel->setChannelData(3, type, nested);
                                                c.flat = std::move(flat), c.nested = std::move(nested);
                                              },
                                              state});
}

} // namespace
