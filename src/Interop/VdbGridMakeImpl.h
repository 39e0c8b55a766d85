// The way back: grids of a file, made of a volume's channels.
#pragma once

#include "Interop/VdbRecord.h"
#include "Interop/VdbTreeImpl.h"

#include <span>
#include <string>

namespace VLN::Interop {

/// What export reads of one grid.
struct GridToWrite {
  VdbContainer const& container;
  TileTree3D::ChannelBase const& channel;
  StateChannel const* state; ///< null unless the rule is kChannel
  VdbActiveRule rule;
  std::span<Velorn::Math::int3 const> alsoActive; ///< whatever the rule says
  /// The channel once more where its tiles go when they have been read; else null.
  TileTree3D::ChannelBase* released = nullptr;
};

// A grid with the values and the active states of a channel; null for a type name that is none of the half's.
// Two halves, compiled apart.
openvdb::GridBase::Ptr makeScalarGrid(std::string const& type, GridToWrite const& from);
openvdb::GridBase::Ptr makeVectorGrid(std::string const& type, GridToWrite const& from);

} // namespace VLN::Interop
