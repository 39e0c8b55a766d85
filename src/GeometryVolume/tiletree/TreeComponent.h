// TileTree3D::Component: a component that counts tiles and elements of a tree, by depth and by tile.
#pragma once

#include "GeometryVolume/core/Component.h"
#include "GeometryVolume/core/LoggerHooks.h"
#include "GeometryVolume/tiletree/TreeIndex.h"

namespace VLN::TileTree3D {

/// Containers, topologies and channels. The order of the virtual operations is fixed:
/// destructor, dump, memUse, copyTo, size, empty, update, elementCount(depth), elementCount(tile), tileCount.
class VLN_API Component : public VLN::Component {
public:
  using VLN::Component::Component;
  Component() = default;
  Component(Component const&) = default;
  Component& operator=(Component const&) = default;
  ~Component() override;

  void dump(std::ostream& os) const override { VLN::Component::dump(os); }
  void memUse(std::uint64_t& used, std::uint64_t& allocated, bool notShared) const override {
    VLN::Component::memUse(used, allocated, notShared);
    used += sizeof(m_owner), allocated += sizeof(m_owner);
  }
  void copyTo(Ostil::Ptr<VLN::Component>& target) const override;
  std::uint64_t size() const override = 0;
  void update(VLN::Component const& source) override = 0;
  /// Elements of one depth; -1 gives the total. Depths that the tree does not have answer 0.
  virtual std::int64_t elementCount(int depth) const = 0;
  /// Elements of one tile. Unchecked.
  virtual int elementCount(TreeIndex const& tile) const = 0;
  /// Tiles of one depth; -1 gives the total. Depths that the tree does not have answer 0.
  virtual std::int64_t tileCount(int depth) const = 0;

  /// Name of the tree component that this component belongs to.
  Ostil::String const& owner() const { return m_owner; }
  void setOwner(Ostil::String const& name) { m_owner = name; }

protected:
  /// For classes whose memUse() follows pointers: a report that another thread writes leaves the object's size
  /// out until it is told that the object is complete.
  struct Incomplete {};
  Component(Ostil::String const& name, Incomplete)
      : VLN::Component(name) {
    objectIncomplete(this);
  }
  Component(Component const& other, Incomplete)
      : Component(other) {
    objectIncomplete(this);
  }

private:
  Ostil::String m_owner;
};

} // namespace VLN::TileTree3D
