// Memory figures of a container.
#include "support/ContainerAccess.h"
#include "support/Shapes.h"

#include <gtest/gtest.h>

using namespace VLN::TileTree3D;
using Support::Access;

VLN_SHAPE_SUITE(ContainerMemory);

namespace {

template <class T> std::uint64_t usedBy(Container<T> const& tree, bool notShared = true) {
  std::uint64_t used = 0, allocated = 0;
  tree.memUse(used, allocated, notShared);
  EXPECT_GE(allocated, used);
  return used;
}

} // namespace

// requirement: a record, and its table above the deepest depth
TYPED_TEST(ContainerMemory, EachTileAddsItsRecordAndItsTable) {
  using T = TypeParam;
  using TileT = typename Container<T>::TileType;
  Container<T> tree;
  std::uint64_t const empty = usedBy(tree);
  EXPECT_GT(empty, sizeof(ContainerData<T>));
  Access::addTile(tree, {0, 0, 0}, 4);
  std::uint64_t const one = usedBy(tree);
  EXPECT_EQ(one - empty, sizeof(TileT) + 8 * T::kTileSize);
  Access::addTile(tree, {T::kMaxTileCoord, 0, 0}, T::kMaxDepth);
  EXPECT_EQ(usedBy(tree) - one, sizeof(TileT));
}

// requirement
TYPED_TEST(ContainerMemory, SpareCapacityIsAllocatedButNotUsed) {
  using T = TypeParam;
  using TileT = typename Container<T>::TileType;
  Container<T> tree;
  Access::allocateTiles(tree, 3, 100);
  Access::allocateTiles(tree, 3, 1);
  std::uint64_t used = 0, allocated = 0;
  tree.memUse(used, allocated, true);
  auto const room = static_cast<std::uint64_t>(Access::tileCapacity(tree, 3) - tree.tileCount(3));
  EXPECT_GT(room, 0u);
  EXPECT_EQ(allocated - used, room * sizeof(TileT));
}

// requirement: 8 bytes for each cell of the grid
TYPED_TEST(ContainerMemory, GridCountsEightBytesACell) {
  using T = TypeParam;
  Container<T> tree;
  auto accessor = tree.tileAccessor();
  int const w = T::width(T::kMaxDepth);
  accessor.addTile(0, 0, 0, T::kMaxDepth);
  accessor.addTile(2 * w, 3 * w, 0, T::kMaxDepth);
  std::uint64_t const before = usedBy(tree);
  tree.buildAccessorAccelerationStructure(T::kMaxDepth);
  EXPECT_EQ(usedBy(tree) - before, 8u * 3 * 4 * 1);
}

// requirement
TYPED_TEST(ContainerMemory, ScratchContainersAndTheirBookkeepingCount) {
  using T = TypeParam;
  Container<T> tree;
  std::uint64_t const before = usedBy(tree);
  auto* scratch = tree.threadLocalContainer(0);
  std::uint64_t const scratchUsed = usedBy(*scratch);
  EXPECT_EQ(usedBy(tree) - before, 16 + scratchUsed + 232);
  tree.freeThreadLocalContainer(scratch);
  EXPECT_EQ(usedBy(tree) - before, 16 + scratchUsed);
}
