#include "Interop/VdbMaskImpl.h"

namespace VLN::Interop {

std::string valueTypeOf(openvdb::GridBase const& grid) {
  return grid.isType<openvdb::MaskGrid>() ? kMaskType : grid.valueType();
}

openvdb::GridBase::Ptr withoutMask(openvdb::GridBase::Ptr const& grid) {
  auto const mask = openvdb::gridPtrCast<openvdb::MaskGrid>(grid);
  if (!mask) return grid;
  auto bools = openvdb::BoolGrid::create(
      std::make_shared<openvdb::BoolTree>(mask->tree(), false, true, openvdb::TopologyCopy()));
  bools->insertMeta(*mask);
  bools->setTransform(mask->transform().copy());
  return bools;
}

openvdb::GridBase::Ptr maskOf(openvdb::GridBase const& bools) {
  auto const& tree = static_cast<openvdb::BoolGrid const&>(bools).tree();
  return openvdb::MaskGrid::create(
      std::make_shared<openvdb::MaskTree>(tree, false, true, openvdb::TopologyCopy()));
}

} // namespace VLN::Interop
