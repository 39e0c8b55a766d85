// ConversionSettings: what one conversion was asked for, after the rules between its options.
#pragma once

#include "GeometryVolume/core/FunctionRef.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/tiletree/Container.h"

#include <chrono>
#include <cstdint>
#include <iostream>

namespace nanovtt::Internal {

using Traits = VLN::TileTree3D::PowerOfTwoTraits;
using Tree = VLN::TileTree3D::Container<Traits>;
using TileType = Tree::TileType;
using VLN::TileTree3D::int3;
using VLN::TileTree3D::TreeIndex;

/// How float channels are stored; all others are stored as they are.
enum class Build : std::uint8_t { kPlain, kFp4, kFp8, kFp16, kFpN };

/// The buffers that a conversion makes, in the order in which they are drawn.
enum class BufferRole : std::uint8_t { kTraversal, kNeighbors, kMain };

/// Makes the buffer of a role and returns its first byte.
using BufferMaker = VLN::FunctionRef<std::uint8_t*(BufferRole role, std::uint64_t size)>;

struct ConversionSettings {
  Build build = Build::kPlain;
  bool coalescingBuiltIn = true; ///< else coalescing is asked for in vain
  std::uint32_t checksumMode = 0;
  bool log = false;
  float tolerance = -1;
  bool dither = false;
  float haloFraction = 0;
  int rootLevelLimit = 0;
  int finestLevel = 0;
  bool morton = false;
  bool coalesce = false;
  bool cubic = false;
  std::uint64_t elementBytes = 1; ///< of what the buffer is bound as; at least 1
  bool textures = false;
  bool fogFix = false;
  float coarserTolerance = 0;
  bool coarserLevels = false;
  bool traversal = false;
  bool neighbors = false;

  bool quantised() const { return build != Build::kPlain; }
  int maxDepth() const;
};

/// What the caller passed, as far as the rules between the options ask for it.
struct OptionRequest {
  bool traversalBuffer = false; ///< whether there is somewhere to put the structure
  bool neighborBuffer = false;
};

/// Turns off what cannot be had together, and says so on standard error. `settings.coalesce` becomes whether
/// tiles are really merged.
void applyOptionRules(ConversionSettings& settings, OptionRequest const& request);

/// The smallest s with s * s * s >= n.
std::uint64_t cubeRootUp(std::uint64_t n);
/// Bytes of a buffer that is bound as a cube of whole elements.
std::uint64_t cubicSize(std::uint64_t size, std::uint64_t elementBytes);
/// The next multiple of 16384 elements.
std::uint64_t blockSize(std::uint64_t size, std::uint64_t elementBytes);

/// Seconds since it was made or last asked.
class Stopwatch {
public:
  double lap() {
    auto const now = std::chrono::high_resolution_clock::now();
    double const seconds = std::chrono::duration<double>(now - m_start).count();
    m_start = now;
    return seconds;
  }

private:
  std::chrono::high_resolution_clock::time_point m_start = std::chrono::high_resolution_clock::now();
};

/// Lines on standard output, when they are wanted.
class Log {
public:
  explicit Log(bool on)
      : m_on(on) {}
  explicit operator bool() const { return m_on; }
  template <class... Parts> void line(Parts const&... parts) const {
    if (m_on) (std::cout << ... << parts) << '\n';
  }
  /// A stage and the seconds that it took.
  template <class... Label> void stage(Stopwatch& watch, Label const&... label) const {
    double const seconds = watch.lap();
    line(label..., seconds, " seconds");
  }

private:
  bool m_on;
};

/// Fills a range with zeros, in parallel: the first touch of fresh memory costs more than its writing.
void fillZeros(std::uint8_t* first, std::uint64_t size);

/// Runs `body(tile, index)` for the live tiles of a depth, in parallel.
template <class Body> void forEachTile(Tree const& tree, int depth, Body const& body) {
  VLN::parallelFor(0, tree.tileCount(depth),
                   [&](std::int64_t begin, std::int64_t end) {
                     for (std::int64_t n = begin; n < end; ++n) {
                       TileType const& tile = tree.tile(n, depth);
                       if (tile.valid()) body(tile, n);
                     }
                   },
                   {.grain = 1024});
}

/// The same with an accessor for each thread: `body(tile, index, accessor)`.
template <class Body> void forEachTileWithAccessor(Tree const& tree, int depth, Body const& body) {
  VLN::parallelFor(0, tree.tileCount(depth),
                   [&](std::int64_t begin, std::int64_t end) {
                     auto const accessor = tree.tileAccessor();
                     for (std::int64_t n = begin; n < end; ++n) {
                       TileType const& tile = tree.tile(n, depth);
                       if (tile.valid()) body(tile, n, accessor);
                     }
                   },
                   {.grain = 256});
}

} // namespace nanovtt::Internal
