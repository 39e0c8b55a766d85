// Random sequences of every change of a tree, against the set of coordinates that it should hold.
#include "support/Shapes.h"
#include "support/TreeModel.h"

using namespace Support;
using namespace VLN::TileTree3D;

namespace {

template <class TraitsT> class Walk {
public:
  using Tree = Container<TraitsT>;
  using Lists = typename Tree::TileLists;

  explicit Walk(std::uint32_t seed)
      : m_places(seed) {}

  void step() {
    switch (m_places.below(11)) {
    case 0:
    case 1:
      addOne();
      break;
    case 2:
      addInBulk();
      break;
    case 3:
    case 4:
      refine();
      break;
    case 5:
      removeOne();
      break;
    case 6:
      removeMany();
      break;
    case 7:
      m_tree.compact(), followed();
      break;
    case 8:
      permute();
      break;
    case 9:
      m_tree.sortIntoMortonOrder(), followed();
      break;
    case 10:
      m_tree.setCompactOnRemoval(m_places.below(4) != 0);
      break;
    }
  }
  void check() {
    m_model.compare(m_tree, m_dead);
    ASSERT_TRUE(m_tree.checkBranchSizes(false));
    m_model.compareLookups(m_tree, m_places.some(40));
  }
  std::string const& log() const { return m_log; }

private:
  void note(std::string const& what) { m_log += what + '\n'; }
  static std::string show(VoxelCoord const& at) { return ::testing::PrintToString(at); }

  VoxelCoord existing() {
    if (m_model.tiles().empty()) return m_places.next();
    auto at = m_model.tiles().begin();
    std::advance(at, m_places.below(static_cast<int>(m_model.tiles().size())));
    return *at;
  }
  TreeIndex find(VoxelCoord const& at) { return m_tree.tileAccessor().tile(at, true).treeIndex(); }
  void fixBranchSizes() { m_tree.tileAccessor().addTiles(Lists{}); }

  void addOne() {
    VoxelCoord const at = m_places.next();
    note("add " + show(at));
    auto accessor = m_tree.tileAccessor();
    if (m_places.coin()) accessor.tile(existing(), false);
    EXPECT_EQ(accessor.addTile(at).voxelCoord(), at);
    m_model.add(at);
    fixBranchSizes();
  }
  void addInBulk() {
    Lists lists;
    typename TreeModel<TraitsT>::Set set;
    for (int n = m_places.below(300); n >= 0; --n) {
      VoxelCoord const at = m_places.next();
      set.insert(at);
      // Any point of a tile names it.
      std::int64_t const last = TraitsT::width(at.depth) - 1;
      lists[static_cast<std::size_t>(at.depth)].append(
          m_places.coin() ? at.ijk()
                          : int3{static_cast<int>(at.i + last), at.j, static_cast<int>(at.k + last)});
    }
    note("add in bulk " + std::to_string(set.size()));
    Lists made;
    auto const before = m_model.tiles();
    m_tree.tileAccessor().addTiles(lists, &made);
    m_model.add(set);
    checkMade(before, made);
  }
  void refine() {
    std::vector<Tree> trees(static_cast<std::size_t>(1 + m_places.below(3)));
    std::vector<Tree const*> sources;
    auto const before = m_model.tiles();
    for (Tree& tree : trees) {
      auto accessor = tree.tileAccessor();
      TreeModel<TraitsT> model;
      for (int n = m_places.below(150); n >= 0; --n) {
        VoxelCoord const at = m_places.next();
        accessor.addTile(at);
        model.add(at);
      }
      if (m_places.coin()) { // dead tiles of a source are none
        VoxelCoord const gone = m_places.next();
        tree.setCompactOnRemoval(false);
        accessor.removeTile(accessor.tile(gone, true).treeIndex(), true);
        model.remove(gone, true);
      }
      m_model.add(model.tiles());
      sources.push_back(&tree);
    }
    note("refine");
    Lists made;
    m_tree.refine(sources, &made, true);
    checkMade(before, made);
    auto const contents = treeContents(m_tree);
    Lists none;
    m_tree.refine(sources, &none, true);
    EXPECT_EQ(treeContents(m_tree), contents) << "refining again changed the tree";
    EXPECT_EQ(none, Lists{});
  }
  void removeOne() {
    VoxelCoord const at = m_places.below(4) ? existing() : m_places.next();
    bool const withBranch = m_places.coin();
    note("remove " + show(at) + (withBranch ? " with branch" : ""));
    auto const shadow = arrays();
    TileMoves moves;
    auto accessor = m_tree.tileAccessor();
    accessor.removeTile(find(at), withBranch, &moves);
    removed(m_model.remove(at, withBranch) ? 1 : 0, shadow, moves);
  }
  void removeMany() {
    TileIndexLists lists(static_cast<std::size_t>(TraitsT::kDepths));
    bool const withBranch = m_places.coin();
    // The order of removal is by depth, then as listed: refusal depends on it.
    std::vector<std::vector<VoxelCoord>> asked(lists.size());
    for (int n = m_places.below(20); n >= 0; --n) {
      VoxelCoord const at = existing();
      TreeIndex const index = find(at);
      if (!index.valid()) continue;
      for (int times = m_places.below(2); times >= 0; --times) {
        lists[static_cast<std::size_t>(at.depth)].push_back(index.index);
        asked[static_cast<std::size_t>(at.depth)].push_back(at);
      }
    }
    note(std::string("remove many") + (withBranch ? " with branch" : ""));
    auto const shadow = arrays();
    TileMoves moves;
    m_tree.tileAccessor().removeTiles(lists, withBranch, &moves);
    int gone = 0;
    for (auto const& depth : asked) {
      for (VoxelCoord const& at : depth) gone += m_model.remove(at, withBranch);
    }
    removed(gone, shadow, moves);
  }
  void permute() {
    std::vector<std::vector<std::int64_t>> perms(static_cast<std::size_t>(TraitsT::kDepths));
    for (int d = 0; d <= TraitsT::kMaxDepth; ++d) {
      if (m_places.below(4) == 0) continue;
      auto& perm = perms[static_cast<std::size_t>(d)];
      for (std::int64_t n = 0; n < m_tree.tileCount(d); ++n) perm.push_back(n);
      std::shuffle(perm.begin(), perm.end(), m_places.random());
    }
    note("permute");
    auto const shadow = arrays();
    m_tree.permute(perms.data());
    for (std::size_t d = 0; d < perms.size(); ++d) {
      for (std::size_t n = 0; n < shadow[d].size(); ++n) {
        std::int64_t const to = perms[d].empty() ? static_cast<std::int64_t>(n) : perms[d][n];
        auto const& t = m_tree.tile(to, static_cast<int>(d));
        EXPECT_EQ(t.valid() ? t.voxelCoord() : VoxelCoord{}, shadow[d][n]);
      }
    }
  }
  void followed() {
    note("compact or sort");
    m_dead = false;
    for (int d = 0; d <= TraitsT::kMaxDepth; ++d) {
      for (std::int64_t n = 0; n < m_tree.tileCount(d); ++n) m_dead |= !m_tree.tile(n, d).valid();
    }
  }

  /// What lies where; a dead tile is the invalid coordinate.
  std::vector<std::vector<VoxelCoord>> arrays() const {
    std::vector<std::vector<VoxelCoord>> result(static_cast<std::size_t>(TraitsT::kDepths));
    for (int d = 0; d <= TraitsT::kMaxDepth; ++d) {
      for (std::int64_t n = 0; n < m_tree.tileCount(d); ++n) {
        auto const& t = m_tree.tile(n, d);
        result[static_cast<std::size_t>(d)].push_back(t.valid() ? t.voxelCoord() : VoxelCoord{});
      }
    }
    return result;
  }
  /// The moves, applied to what followed the old arrays, must give the new ones.
  void removed(int gone, std::vector<std::vector<VoxelCoord>> shadow, TileMoves const& moves) {
    EXPECT_EQ(moves.size(), shadow.size());
    for (std::size_t d = 0; d < shadow.size(); ++d) {
      auto const count = static_cast<std::size_t>(m_tree.tileCount(static_cast<int>(d)));
      for (auto const& [to, from] : moves[d]) {
        EXPECT_LT(to, from);
        EXPECT_LT(to, static_cast<std::int64_t>(count));
        EXPECT_GE(from, static_cast<std::int64_t>(count));
        shadow[d][static_cast<std::size_t>(to)] = shadow[d][static_cast<std::size_t>(from)];
      }
      if (!m_tree.compactOnRemoval()) {
        EXPECT_TRUE(moves[d].empty());
        EXPECT_EQ(count, shadow[d].size());
        continue;
      }
      shadow[d].resize(count);
      for (std::size_t n = 0; n < count; ++n) {
        auto const& t = m_tree.tile(static_cast<std::int64_t>(n), static_cast<int>(d));
        if (t.valid()) { EXPECT_EQ(t.voxelCoord(), shadow[d][n]); }
      }
    }
    if (gone > 0 && !m_tree.compactOnRemoval()) m_dead = true;
  }
  void checkMade(typename TreeModel<TraitsT>::Set const& before, Lists const& made) {
    typename TreeModel<TraitsT>::Set listed;
    std::size_t count = 0;
    for (std::size_t d = 0; d < made.size(); ++d) {
      for (int3 const& p : made[d]) listed.insert({p.x, p.y, p.z, static_cast<int>(d)}), ++count;
    }
    EXPECT_EQ(count, listed.size()) << "a new tile is listed twice";
    EXPECT_EQ(listed.size() + before.size(), m_model.tiles().size());
    for (VoxelCoord const& at : listed) EXPECT_TRUE(m_model.has(at) && before.count(at) == 0) << at;
  }

  TilePlaces<TraitsT> m_places;
  Tree m_tree;
  TreeModel<TraitsT> m_model;
  bool m_dead = false;
  std::string m_log;
};

VLN_SHAPE_SUITE(TreeChange);

TYPED_TEST(TreeChange, RandomSequencesMatchTheSetOfCoordinates) {
  for (std::uint32_t seed = 1; seed <= 12; ++seed) {
    Walk<TypeParam> walk(seed);
    for (int step = 0; step < 80; ++step) {
      walk.step();
      walk.check();
      ASSERT_FALSE(this->HasFailure()) << "seed " << seed << ", step " << step << '\n' << walk.log();
    }
  }
}

} // namespace
