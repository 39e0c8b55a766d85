// SharedReadTables: made by the first of several readers of a channel for which they pay.
#pragma once

#include "GeometryVolume/channels/detail/ReadTables.h"

#include <atomic>
#include <memory>

namespace VLN::TileTree3D::Internal {

template <class TraitsT> struct SharedReadTables {
  std::atomic<ReadTables<TraitsT> const*> ready{nullptr};
  std::atomic<std::int64_t> tileChanges{0}; ///< reads that went to another tile than the one before
  std::atomic_flag begun{};
  std::unique_ptr<ReadTables<TraitsT> const> tables;
};

} // namespace VLN::TileTree3D::Internal
