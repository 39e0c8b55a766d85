// What a volume holds, and what its fields share. For Volume and Field alone.
//
// A write makes elements at once, and tiles later: the tree grows when it is next asked for, by all new tiles
// together, and everything else follows where it is needed.
//
//   Field a: set() -- makes elements --> a holds pending tiles
//   tree(), sample(), a.get() far off -- flush() --> tree, version n+1
//                                          |------> a, version n+1: pending tiles become the channel's
//                                          '------> topology, b, c: still at n; they follow when asked for
//
// What a handle remembers of a field holds as long as the epoch stays: it rises when elements move in memory,
// and when they begin to be shared.
#pragma once

#include "GeometryVolume/channels/ChannelBase.h"
#include "GeometryVolume/core/Object.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/topology/VoxelTopology.h"
#include "GeometryVolume/volume/detail/FieldBlocks.h"

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <span>
#include <vector>

namespace VLN::TileTree3D::Internal {

using VolumeShape = PowerOfTwoTraits;
using VolumeTree = Container<VolumeShape>;
using VolumeTopology = VoxelTopology<VolumeShape>;

struct VolumeData;
struct ChunkTiles;

/// Fewer tiles are made one by one; more are worth a pass over lists, in parallel.
inline constexpr std::int64_t kFewTiles = 256;

/// One field of a volume, without its element type.
struct VLN_API FieldSlot {
  virtual ~FieldSlot();
  virtual Ostil::Ptr<ChannelBase> channel() const = 0;
  virtual char const* typeName() const = 0;
  virtual std::unique_ptr<FieldSlot> share() const = 0;
  /// Takes in the tiles that are new in the tree, with the values that were read there before, and completes
  /// `blocks`. The caller holds the lock or is the only user of the volume.
  /// @pre The tree has all pending tiles.
  virtual void follow(VolumeData& volume) = 0;
  virtual bool hasPending() const = 0;
  /// Makes elements for tiles that neither the tree nor another write has made yet, with the values that are
  /// read there. In parallel.
  /// @param tiles In the domain; some may come more than once, or have elements. Gets the blocks, and which
  /// tiles were made.
  /// @pre The slot is in step and exclusive.
  /// @error What is thrown leaves all as it was.
  virtual void makePending(VolumeData& volume, std::span<BlockTiles> tiles) = 0;
  /// Takes tiles over from chunks. They are pending as soon as the caller has entered them in `blocks`.
  /// @error What is thrown leaves all as it was.
  virtual void adopt(VolumeData& volume, std::span<std::unique_ptr<ChunkTiles>> chunks) = 0;
  /// How many groups of pending tiles there are, to go back to.
  virtual std::size_t pendingGroups() const = 0;
  /// Of the groups from `first` on, drops tiles that `blocks` does not lead to.
  virtual void dropUnentered(std::size_t first) = 0;
  /// Drops the groups from `first` on, and takes their tiles out of `blocks`.
  virtual void dropGroups(std::size_t first) noexcept = 0;
  /// Appends the corners of tiles that have elements, but are not in the tree yet.
  virtual void listPending(Ostil::Array<int3>& corners) const = 0;
  /// Makes the channel and its elements the volume's alone.
  virtual void detach(VolumeData& volume) = 0;
  virtual void tilesRemoved(VolumeData& volume, TileRemovalList const& moves) = 0;
  virtual void fillCoarse(VolumeData& volume) = 0;
  virtual void fillHalo(VolumeData& volume) = 0;

  std::string name;
  FieldBlocks blocks;
  bool blocksBuilt = false;
  std::atomic<std::uint64_t> version{0}; ///< of the tree that the field has followed to
  std::atomic<bool> exclusive{false};    ///< whether nobody else sees the elements
  std::atomic<bool> written{false};      ///< since a sampler asked last
  std::atomic<std::uint64_t> values{1};  ///< rises when a sampler finds that the field was written
};

struct VLN_API VolumeData {
  VolumeData() = default;
  VolumeData(VolumeData const&) = delete;
  VolumeData& operator=(VolumeData const&) = delete;

  /// A volume of its own on the same components.
  std::unique_ptr<VolumeData> share();
  /// Brings the whole volume into step.
  void sync();
  /// Brings one field into step.
  void sync(FieldSlot& slot) {
    if (hasPending() || slot.version.load(std::memory_order_acquire) != version) follow(slot);
  }
  /// Brings the tree into step.
  void syncTree() {
    if (hasPending()) flush();
  }
  /// Whether fields hold tiles that the tree lacks. While they do, `version` is nobody's but the lock's.
  bool hasPending() const { return pending.load(std::memory_order_acquire); }
  /// Before elements are written. Pending tiles stay.
  void prepareWrite(FieldSlot& slot) {
    if (slot.version.load(std::memory_order_acquire) != version ||
        !slot.exclusive.load(std::memory_order_relaxed)) [[unlikely]]
      separate(slot);
  }
  /// Tells that elements of the field were or may be written.
  void valuesChanged(FieldSlot& slot) { slot.written.store(true, std::memory_order_relaxed); }
  /// A cursor on the tree for whoever writes.
  VolumeTree::ConstTileAccessor const& reader();
  /// Makes the finest tiles of many positions, and roots above them.
  void makeTiles(VolumeTree::TileLists& lists);
  /// Lets `change` grow the tree.
  void growTree(FunctionRef<void(VolumeTree&)> change);
  /// Removes branches.
  void removeTiles(TileIndexLists const& lists);
  void updateTopology();
  FieldSlot* find(std::string const& name) const;
  /// The depth of the roots that a new tile gets.
  int rootDepth() const;
  /// From here on others see the components.
  void beginSharing();

  Ostil::Ptr<VolumeTree> tree;
  Ostil::Ptr<VolumeTopology> topology;
  VLN::Object rest; ///< all else: plain properties, channels of other layouts, other topologies
  std::vector<std::unique_ptr<FieldSlot>> slots;
  std::uint64_t version = 1; ///< of the tree
  std::uint64_t topologyVersion = 0, restVersion = 0;
  std::atomic<bool> pending{false};
  std::atomic<std::uint64_t> syncedVersion{0};
  std::atomic<std::uint64_t> epoch{1};
  std::mutex mutex;

private:
  void follow(FieldSlot& slot);
  void separate(FieldSlot& slot);
  void flush();
  /// The caller holds the lock.
  void flushLocked();
  void updateRest(TileRemovalList const* removed);

  VolumeTree& editTree();
  /// Adds tiles of the deepest depth and of the depths below the roots', and the roots above them.
  void addTiles(VolumeTree& edited, VolumeTree::TileLists& lists);

  // Cursors that survive growth.
  VolumeTree::TileAccessor m_accessor;
  VolumeTree::ConstTileAccessor m_reader;
  VolumeTree const* m_accessorTree = nullptr;
  VolumeTree const* m_readerTree = nullptr;
};

/// @error std::out_of_range, always.
[[noreturn]] void throwOutside(int3 const& position);

/// Makes the elements of `component` and itself the holder's alone.
template <class T> void makeUnique(Ostil::Ptr<T>& component) {
  if (component.unique()) return;
  Ostil::MutablePtr<T> copy{Ostil::Ptr<T>(component)};
  component = std::move(copy);
}

} // namespace VLN::TileTree3D::Internal
