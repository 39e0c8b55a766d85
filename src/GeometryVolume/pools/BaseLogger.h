// BaseLogger: accounts for objects and their blocks of data, and prints a report.
//
//   baseMap      object -> when it was registered      from constructors and destructors of Base
//   pointerMap   block  -> objects that own it         from what holds bulk data
//
// An object that owns n distinct blocks under one name has n - 1 deep copies; objects that own the same block
// are shallow copies of each other.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "Ostil/String.h"

#include <cstdint>

namespace VLN {

class Base;

/// Off at load; while it is off every hook costs one test. Anomalies are counters of the report, and some are
/// lines on standard output; nothing is thrown.
/// @threads Any thread. Hooks run side by side; what walks the maps waits for them and keeps them out.
class VLN_API BaseLogger {
public:
  static void enable();
  /// Clears nothing.
  static void disable();
  static bool enabled();
  /// Forgets all objects, blocks and counters. No effect while the logger is off, as clearCounters().
  static void clear();
  static void clearCounters();
  /// Whether dump() runs; false while the logger is off.
  static bool isDumpInProgress();

  /// `owner` owns the block from now on, beside those that own it already.
  static void pointerAllocated(void const* block, Base const* owner);
  static void pointerDeAllocated(void const* block, Base const* owner);
  /// The owners of one block now own another.
  static void pointerReAllocated(void const* from, void const* to);

  /// Extra deep copies that pointerAllocated() has seen appear; 0 while the logger is off.
  static std::int32_t numberOfCopies();
  /// Deep copies of all objects whose names begin with one of the letters of "voxel_", the tree itself left
  /// out.
  /// @cost Walks both maps.
  static std::int32_t numberOfActiveCopies();
  /// Distinct blocks that objects of this name own, less one; 0 while the logger is off, for names that
  /// nobody bears, for channels of the pool and for scratch containers.
  static std::int32_t numberOfActiveCopies(Ostil::String const& name);
  /// What happens to objects of this name is told on standard output; empty for none.
  static void setTracedName(Ostil::String const& name);

  /// Writes the report to standard output; docs/memory.md explains its lines.
  /// @pre Objects may be made and destroyed meanwhile, yet not changed. What is left out of the sizes:
  /// objects that are being made or destroyed at that moment.
  static void dump();
};

} // namespace VLN
