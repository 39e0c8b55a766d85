// writeNvtt(): flat buffers as .nvtt files. Reader/NvttFile.h and docs/flat_buffer.md describe them.
#pragma once

#include "GeometryVolume/core/Export.h"

#include <cstdint>
#include <string>
#include <vector>

namespace VLN::Interop {

/// What goes into a file: a buffer, and the structures beside it where they were made.
struct NvttContent {
  void const* buffer = nullptr;
  std::uint64_t bufferLength = 0;
  void const* traversal = nullptr;
  std::uint64_t traversalLength = 0;
  void const* neighbors = nullptr;
  std::uint64_t neighborsLength = 0;
  /// Bounds of a grid's tiles, as Reader/NanoVTTBounds.h has them.
  struct Bounds {
    std::uint32_t grid = 0;
    void const* bytes = nullptr;
    std::uint64_t length = 0;
  };
  std::vector<Bounds> bounds = {};
};

/// Writes the file whole or not at all.
/// @error FileError; also for a buffer that is none, and for bounds that are not those of its tiles.
/// @numeric The same bytes for any number of threads.
/// @cost Reads the content twice, for the hashes of pages and of sections, in parallel.
VLN_API void writeNvtt(std::string const& path, NvttContent const& content);

} // namespace VLN::Interop
