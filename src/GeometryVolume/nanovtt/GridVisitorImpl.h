// The visitors that fill a grid, tile by tile: the samples, and the boxes of what is active.
//
// GridVisitor does all that needs no element type; nanovtt::Visitor adds the few operations that do. It
// exists for the nine element types in each of the five builds.
#pragma once

#include "GeometryVolume/channels/TileData.h"
#include "GeometryVolume/nanovtt/TileSamplesImpl.h"

namespace nanovdb {
class Fp4;
class Fp8;
class Fp16;
class FpN;
} // namespace nanovdb

namespace nanovtt {

namespace Internal {

class GridVisitor : public Tree::VisitorType {
public:
  ActiveBoxes const& boxes() const { return m_boxes; }
  void startFrom(ActiveBoxes const& boxes) { m_boxes = boxes; }

  using Tree::VisitorType::beginTile;
  void beginTile(TileType const& tile) override;
  /// Visits the live tiles with indices begin to end of a depth, in the order in which memory holds them: a
  /// tile's samples and its place in the grid follow from its own number, so the order is free.
  void visit(int depth, std::int64_t begin, std::int64_t end);
  void join(Tree::VisitorType const& other) override {
    m_boxes.join(static_cast<GridVisitor const&>(other).m_boxes);
  }

protected:
  explicit GridVisitor(GridTask const& task)
      : m_task(task)
      , m_accessor(task.layout.tree().tileAccessor())
      , m_samples(task, m_accessor) {
    setEndTileOverridden(false);
  }
  GridTask const& task() const { return m_task; }

  /// Bits of the 64 core samples, i fastest, that are active: below 0 in a level set, else those that differ
  /// from the default value by more than `threshold`.
  virtual std::uint64_t active(StoredTile const& tile, float threshold) const = 0;
  /// Writes a quantised tile to `out`.
  virtual void quantise(StoredTile const& tile, std::uint32_t number, std::uint8_t* out) const = 0;

private:
  void storeTile(TileType const& tile, std::uint32_t number);
  void storeInBlock(TileType const& bottom, TileType const& head, StoredTile const& tile) const;
  void storeBrick(std::uint32_t number, StoredTile const& tile) const;
  void grow(TileType const& tile, StoredTile const& stored);

  GridTask const& m_task;
  Tree::ConstTileAccessor m_accessor;
  TileSamples m_samples;
  ActiveBoxes m_boxes;
};

} // namespace Internal

/// @tparam BuildT void, or how float channels are quantised: nanovdb::Fp4, Fp8, Fp16, FpN.
/// @tparam ValueT What the grid's type calls a value: the build for quantised channels.
template <class BuildT, class ValueT, class ElementT, class ConstTile, class WorkTile, int kElementBytes>
class Visitor final : public Internal::GridVisitor {
public:
  static_assert(sizeof(ElementT) == kElementBytes);
  static_assert(ConstTile::kSize == kTileSamples && WorkTile::kSize == kHaloTileSamples);

  explicit Visitor(Internal::GridTask const& task)
      : GridVisitor(task) {}

  using GridVisitor::beginTile;
  void beginTile(Internal::TileType const& tile) override { GridVisitor::beginTile(tile); }
  void join(Internal::Tree::VisitorType const& other) override { GridVisitor::join(other); }
  Visitor* clone() const override { return new Visitor(task()); }

protected:
  std::uint64_t active(Internal::StoredTile const& tile, float threshold) const override;
  void quantise(Internal::StoredTile const& tile, std::uint32_t number, std::uint8_t* out) const override;
};

} // namespace nanovtt
