// Random sequences of updates over all combinations of flags, against a map of vectors. The result must not
// depend on the number of threads, and no copy may see a write to another.
#include "UpdateModel.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Parallel.h"

#include <gtest/gtest.h>
#include <memory>

namespace {

using namespace VLN;
using namespace VLN::TileTree3D;
using namespace VLN::Test;

template <class C> class Sequence {
public:
  using T = typename C::value_type;
  static constexpr int kDeepest = C::Traits::kMaxDepth;

  Sequence(Flags const& flags, unsigned seed)
      : m_random(seed)
      , m_channel(std::make_unique<C>(flags, value<T>(1))) {
    m_model.layout = C::kLayout;
    m_model.construct = flags.construct;
    m_model.empty = flags.empty;
    m_model.minDepth = flags.minDepth;
    m_model.depth = flags.depth;
    m_model.defaultValue = value<T>(1);
  }

  /// Runs `steps` random steps; returns the first difference.
  std::string run(int steps) {
    for (int n = 0; n < steps; ++n) {
      std::string const what = step();
      for (auto const& [channel, model, name] : {std::tie(*m_channel, m_model, "channel")})
        if (auto const d = difference(channel, model); !d.empty()) return report(n, what, name, d);
      for (auto const& [copy, model] : m_copies)
        if (auto const d = difference(std::as_const(*copy), model); !d.empty())
          return report(n, what, "copy", d);
    }
    return "";
  }
  std::vector<T> flat() {
    auto const array =
        Ostil::staticCast<Ostil::Array<T>>(m_channel->channelData(0, std::type_index(typeid(T))));
    return {array->begin(), array->end()};
  }

private:
  static std::string report(int n, std::string const& what, std::string const& who, std::string const& d) {
    return "step " + std::to_string(n) + " (" + what + "), " + who + ": " + d;
  }
  int pick(int n) { return int(m_random() % unsigned(n)); }
  int somewhere() { return pick(3) == 0 ? pick(kDeepest + 1) : kDeepest - pick(3); }
  int someSize() { return C::kLayout.fixedSize() ? C::kSize : pick(4) == 0 ? 0 : pick(C::kSize + 30); }

  std::string step() {
    switch (pick(13)) {
    case 0:
    case 1:
    case 2:
      return grow();
    case 3:
      return shrink();
    case 4:
      return removeTiles();
    case 5:
      return permute();
    case 6:
      return moveElements();
    case 7:
      return growElements();
    case 8:
      return setRange();
    case 9:
      m_channel->compactStorage();
      return "compact";
    case 10:
      return copy();
    case 11:
      return import();
    default:
      return writeSome();
    }
  }

  std::string grow() {
    for (int n = pick(3); n >= 0; --n)
      for (int d = somewhere(), added = pick(12); added > 0; --added)
        m_tree.elements[std::size_t(d)].push_back(someSize());
    m_channel->update(m_tree);
    m_model.resizeTiles(m_tree);
    writeUnwritten();
    return "grow";
  }
  std::string shrink() {
    auto& list = m_tree.elements[std::size_t(somewhere())];
    list.resize(list.size() - std::min(list.size(), std::size_t(pick(10))));
    m_channel->updateTilesAdded(m_tree);
    m_model.resizeTiles(m_tree);
    return "shrink";
  }
  std::string removeTiles() {
    TileRemovalList moves(kChannelDepths);
    for (std::size_t d = 0; d < m_tree.elements.size(); ++d) {
      auto& list = m_tree.elements[d];
      // Holes are filled from the end, so that each tile moves once at most.
      std::set<std::int64_t> gone;
      for (std::size_t i = 0; i < list.size(); ++i)
        if (pick(4) == 0) gone.insert(std::int64_t(i));
      std::size_t const left = list.size() - gone.size();
      std::int64_t last = std::int64_t(list.size()) - 1;
      for (std::int64_t hole : gone) {
        while (last > hole && gone.count(last)) --last;
        if (hole >= last || std::size_t(hole) >= left) break;
        moves[d].push_back({hole, last});
        list[std::size_t(hole)] = list[std::size_t(last)];
        --last;
      }
      list.resize(left);
    }
    m_channel->updateTilesRemoved(moves, m_tree);
    m_model.removeTiles(moves, m_tree);
    return "remove tiles";
  }
  std::string permute() {
    TilePermutation p(kChannelDepths);
    for (std::size_t d = 0; d < p.size(); ++d) {
      auto& list = m_tree.elements[d];
      if (pick(2) == 0) continue;
      p[d].resize(list.size());
      std::iota(p[d].begin(), p[d].end(), 0);
      std::shuffle(p[d].begin(), p[d].end(), m_random);
      std::vector<int> fresh;
      for (auto old : p[d]) fresh.push_back(list[std::size_t(old)]);
      list = fresh;
    }
    m_channel->updateTilesPermuted(p);
    m_model.permute(p);
    return "permute";
  }
  std::string moveElements() {
    if (C::kLayout.fixedSize()) return "nothing";
    ElementMoves moves(kChannelDepths);
    for (auto const& [d, list] : m_model.tiles)
      for (std::size_t i = 0; i < list.size(); ++i)
        for (std::size_t n = 0; n < list[i].size(); ++n) {
          if (pick(6) != 0) continue;
          int const to = pick(4) == 0 ? somewhere() : d;
          std::int64_t const tiles = m_model.tileCount(to);
          moves[std::size_t(to)].push_back(
              {tiles == 0 || pick(5) == 0 ? -1 : pick(int(tiles)), std::int64_t(i), int(n), d});
        }
    for (auto& list : moves) std::shuffle(list.begin(), list.end(), m_random);
    m_model.move(moves);
    if (pick(2) == 0) {
      m_channel->update(moves, false);
    } else {
      TileDataElementAccessor recorded;
      for (std::size_t d = 0; d < moves.size(); ++d)
        for (auto const& m : moves[d]) {
          ElementTreeIndex const from(m.from, m.fromDepth, m.fromElement);
          if (m.to < 0)
            recorded.remove(from);
          else
            recorded.move(from, TreeIndex{m.to, int(d)});
        }
      m_channel->update(recorded);
    }
    takeCounts();
    return "move elements";
  }
  std::string growElements() {
    if (C::kLayout.fixedSize()) return "nothing";
    FakeTree wanted = m_tree;
    for (auto& list : wanted.elements)
      for (int& n : list) n = pick(3) == 0 ? pick(2 * C::kSize) : n;
    m_channel->updateElementResizeNoDispatch(wanted);
    m_model.growElements(wanted);
    takeCounts();
    return "grow elements";
  }
  std::string setRange() {
    int low = pick(4), high = kDeepest - pick(4);
    if (pick(3) > 0) low = 0, high = kDeepest;
    m_channel->setMinDepth(low, m_tree);
    m_channel->setDepth(high, m_tree);
    // One end at a time, as the channel has it.
    m_model.setRange(low, m_model.depth, m_tree);
    m_model.setRange(low, high, m_tree);
    writeUnwritten();
    return "set range";
  }
  std::string copy() {
    bool const assigned = pick(2) == 0;
    auto other = std::make_unique<C>(*m_channel);
    if (assigned) *other = *m_channel;
    if (pick(3) == 0) {
      // Go on with the copy, whose flags have their defaults once it stands alone.
      other.swap(m_channel);
      m_channel->cloneData();
      takeDefaultFlags();
    }
    if (m_copies.size() < 3)
      m_copies.emplace_back(std::move(other), m_model);
    else
      m_copies[std::size_t(pick(3))] = {std::move(other), m_model};
    if (assigned) {
      // The next write of this channel gives it flags of its own.
      m_channel->cloneData();
      takeDefaultFlags();
    }
    return assigned ? "assign" : "copy";
  }
  std::string import() {
    unsigned const kind = pick(2) == 0 ? 0 : 3;
    auto const type = Ostil::Any(std::type_index(typeid(T)));
    auto array = Ostil::makePtr<Ostil::Array<T>>(m_channel->size());
    std::uint64_t n = 0;
    for (int d = 0; d < kChannelDepths; ++d)
      if (auto const at = m_model.tiles.find(d); at != m_model.tiles.end())
        for (auto& tile : at->second)
          for (auto& e : tile) (*array)[n++] = *(e = value<T>(m_next++));
    if (kind == 0) {
      m_channel->setChannelData(0, type, array);
    } else {
      C other(*m_channel);
      other.setChannelData(0, type, array);
      m_channel->setChannelData(3, type, other.channelData(3, type));
    }
    return "import";
  }
  std::string writeSome() {
    m_channel->cloneData();
    for (auto& [d, list] : m_model.tiles)
      for (std::size_t i = 0; i < list.size(); ++i)
        for (std::size_t n = 0; n < list[i].size(); ++n)
          if (pick(10) == 0) set(d, i, n);
    return "write";
  }
  void writeUnwritten() {
    m_channel->cloneData();
    for (auto& [d, list] : m_model.tiles)
      for (std::size_t i = 0; i < list.size(); ++i)
        for (std::size_t n = 0; n < list[i].size(); ++n)
          if (!list[i][n]) set(d, i, n);
  }
  void set(int d, std::size_t i, std::size_t n) {
    T const v = value<T>(m_next++);
    m_model.tiles[d][i][n] = v;
    (*m_channel)[ElementTreeIndex(std::int64_t(i), d, int(n))] = v;
  }
  void takeDefaultFlags() {
    m_model.construct = true;
    m_model.empty = false;
    EXPECT_TRUE(m_channel->callElementConstructor());
    EXPECT_FALSE(m_channel->getData()->allocateEmptyTileData());
  }
  void takeCounts() {
    for (auto const& [d, list] : m_model.tiles)
      for (std::size_t i = 0; i < list.size(); ++i) m_tree.elements[std::size_t(d)][i] = int(list[i].size());
  }

  std::mt19937 m_random;
  std::uint64_t m_next = 1000;
  FakeTree m_tree;
  std::unique_ptr<C> m_channel;
  UpdateModel<T> m_model;
  std::vector<std::pair<std::unique_ptr<C>, UpdateModel<T>>> m_copies;
};

Flags flagsOf(int n) {
  return {(n & 1) != 0, (n & 2) == 0, (n & 4) != 0, (n & 8) ? 2 : 0, (n & 16) ? 26 : 28};
}

template <class C> void checkAllFlags(unsigned seeds, int steps) {
  for (int f = 0; f < 32; ++f) {
    Flags flags = flagsOf(f);
    if (C::Traits::kMaxDepth == 12) flags.depth = (f & 16) ? 11 : 28;
    for (unsigned seed = 1; seed <= seeds; ++seed)
      ASSERT_EQ(Sequence<C>(flags, seed).run(steps), "")
          << typeid(C).name() << " flags " << f << " seed " << seed;
  }
}

TEST(UpdateModel, RequirementPoints) {
  checkAllFlags<ProbeChannel<PowerOfTwoTraits, float, 4, 0>>(4, 60);
  checkAllFlags<ProbeChannel<OddTraits, float, 5, 0>>(2, 60);
}
TEST(UpdateModel, RequirementHalos) {
  checkAllFlags<ProbeChannel<PowerOfTwoTraits, float, 4, 1>>(1, 50);
  checkAllFlags<ProbeChannel<OddTraits, float, 5, 2>>(1, 40);
}
TEST(UpdateModel, RequirementExtendedTiles) {
  checkAllFlags<ProbeChannel<PowerOfTwoTraits, float, 5, 0>>(1, 50);
  checkAllFlags<ProbeChannel<OddTraits, float, 6, 0>>(1, 40);
}
/// Every enabled element type, with static and heap tiles.
TEST(UpdateModel, RequirementEveryElementType) {
#define VLN_CHECK(type, name)                                                                                \
  for (int f : {0, 1, 3})                                                                                    \
    ASSERT_EQ((Sequence<ProbeChannel<PowerOfTwoTraits, type, 4, 0>>(flagsOf(f), 5).run(60)), "")             \
        << #name << " flags " << f << " seed 5";
  VLN_FOR_EACH_ELEMENT_TYPE(VLN_CHECK)
}

TEST(UpdateModel, RequirementSameBytesAtAnyNumberOfThreads) {
  using C = ProbeChannel<PowerOfTwoTraits, float, 4, 0>;
  for (int f : {0, 1}) {
    for (unsigned seed = 20; seed < 24; ++seed) {
      std::vector<float> first;
      for (int threads : {1, 2, 8}) {
        withThreads(threads, [&] {
          Sequence<C> sequence(flagsOf(f), seed);
          ASSERT_EQ(sequence.run(60), "") << "flags " << f << " seed " << seed << " threads " << threads;
          if (threads == 1)
            first = sequence.flat();
          else
            ASSERT_EQ(sequence.flat(), first) << "flags " << f << " seed " << seed << " threads " << threads;
        });
      }
    }
  }
}

} // namespace
