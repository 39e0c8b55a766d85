// Random sequences of every change of a tree that carries voxels and points. After each, the tree is held
// against a set of coordinates, and every element of every channel against what it was when its tile was
// made.
#include "support/PointCloud.h"
#include "support/Shapes.h"

#include "GeometryVolume/core/Parallel.h"
#include <numeric>

using namespace Support;
using namespace VLN::TileTree3D;

namespace {

template <class TraitsT> class Follow {
public:
  using Tree = Container<TraitsT>;
  using Cloud = PointCloud<TraitsT>;
  using Model = TreeModel<TraitsT>;

  explicit Follow(std::uint32_t seed)
      : m_cloud(1.0f)
      , m_places(seed) {}

  void step() {
    switch (m_places.below(9)) {
    case 0:
      m_log += "add\n";
      m_cloud.addTiles(m_places.some(1 + m_places.below(4)));
      break;
    case 1:
      addInBulk();
      break;
    case 2:
    case 3:
      refine();
      break;
    case 4:
    case 5:
      remove();
      break;
    case 6:
      permute();
      break;
    case 7:
      sort();
      break;
    case 8:
      reTile();
      break;
    }
    addPoints();
  }
  void check() const { m_cloud.check(); }
  std::vector<std::int64_t> contents() const { return m_cloud.contents(); }
  std::string const& log() const { return m_log; }

private:
  void addInBulk() {
    m_log += "add in bulk\n";
    typename Tree::TileLists lists;
    typename Model::Set set;
    for (VoxelCoord const& at : m_places.some(1 + m_places.below(150))) {
      lists[static_cast<std::size_t>(at.depth)].append(at.ijk());
      set.insert(at);
    }
    m_cloud.tree.tileAccessor().addTiles(lists);
    m_cloud.model.add(set);
    m_cloud.grew();
  }
  void refine() {
    m_log += "refine\n";
    std::vector<Tree> trees(static_cast<std::size_t>(1 + m_places.below(3)));
    std::vector<Tree const*> sources;
    for (Tree& tree : trees) {
      auto accessor = tree.tileAccessor();
      Model model;
      for (VoxelCoord const& at : m_places.some(1 + m_places.below(120))) accessor.addTile(at), model.add(at);
      m_cloud.model.add(model.tiles());
      sources.push_back(&tree);
    }
    m_cloud.tree.refine(sources, nullptr, true);
    m_cloud.grew();
  }
  /// At once, or by dead tiles that a compaction takes out later.
  void remove() {
    bool const withBranch = m_places.coin(), later = m_places.coin();
    m_log +=
        std::string("remove") + (withBranch ? " with branch" : "") + (later ? ", compact later\n" : "\n");
    std::vector<VoxelCoord> asked;
    for (int n = m_places.below(25); n >= 0 && !m_cloud.model.tiles().empty(); --n) {
      auto const& tiles = m_cloud.model.tiles();
      asked.push_back(*std::next(tiles.begin(), m_places.below(static_cast<int>(tiles.size()))));
    }
    m_cloud.remove(asked, withBranch, later);
  }
  void permute() {
    m_log += "permute\n";
    std::vector<std::vector<std::int64_t>> perms(static_cast<std::size_t>(TraitsT::kDepths));
    for (int d = 0; d <= TraitsT::kMaxDepth; ++d) {
      auto& perm = perms[static_cast<std::size_t>(d)];
      perm.resize(static_cast<std::size_t>(m_cloud.tree.tileCount(d)));
      std::iota(perm.begin(), perm.end(), 0);
      std::shuffle(perm.begin(), perm.end(), m_places.random());
    }
    m_cloud.tree.permute(perms.data());
    m_cloud.permuted(perms);
  }
  void sort() {
    m_log += "sort\n";
    std::vector<std::vector<std::int64_t>> perms;
    m_cloud.tree.sortIntoMortonOrder(&perms);
    m_cloud.permuted(perms);
  }
  void reTile() {
    bool const prune = m_places.coin();
    m_log += prune ? "move and prune\n" : "move\n";
    float const far = m_places.below(3) ? 3.0f : 500.0f;
    std::uniform_real_distribution<float> along(-far, far);
    float3 const by{along(m_places.random()), along(m_places.random()), along(m_places.random())};
    m_cloud.move([&](float3 const& p) { return float3{p.x + by.x, p.y + by.y, p.z + by.z}; });
    m_cloud.reTile(prune);
  }
  void addPoints() {
    auto const& tiles = m_cloud.model.tiles();
    if (tiles.empty()) return;
    for (int n = m_places.below(40); n > 0; --n) {
      VoxelCoord const at = *std::next(tiles.begin(), m_places.below(static_cast<int>(tiles.size())));
      m_cloud.addPoint(at, Cloud::placeIn(at, 1.0f, m_places.random()));
    }
    m_cloud.counted();
  }

  Cloud m_cloud;
  TilePlaces<TraitsT> m_places;
  std::string m_log;
};

template <class TraitsT> class TreeFollow : public ::testing::Test {};
TYPED_TEST_SUITE(TreeFollow, Shapes, ShapeNames);

TYPED_TEST(TreeFollow, ChannelsStayInStepThroughRandomSequences) {
  for (std::uint32_t seed = 1; seed <= 6; ++seed) {
    Follow<TypeParam> follow(seed);
    for (int step = 0; step < 30; ++step) {
      follow.step();
      follow.check();
      ASSERT_FALSE(this->HasFailure()) << "seed " << seed << ", step " << step << '\n' << follow.log();
    }
  }
}

TYPED_TEST(TreeFollow, BytesAreEqualAtAnyNumberOfThreads) {
  std::vector<std::int64_t> first;
  for (int const threads : {1, 2, 8}) {
    Follow<TypeParam> follow(99);
    VLN::withThreads(threads, [&] {
      for (int step = 0; step < 20; ++step) follow.step();
    });
    follow.check();
    if (first.empty()) first = follow.contents();
    EXPECT_EQ(follow.contents(), first) << threads;
  }
}

} // namespace
