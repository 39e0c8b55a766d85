// MappedNvtt: a .nvtt file used in place.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "Reader/NanoVTTReader.h"
#include "Reader/NvttFile.h"

#include <cstddef>
#include <string>

namespace VLN::Interop {

/// How much of a file is compared with its hashes before it is used.
enum class NvttCheck {
  kTables, ///< the envelope; the buffer's tables are validated, its samples taken as they are
  kPages,  ///< all bytes
};

/// A file mapped into memory, for as long as this lives. Its buffer has been validated: no lookup leaves it.
/// @threads Reading is free. Who else shortens the file meanwhile ends this process.
class VLN_API MappedNvtt {
public:
  /// @error FileError that names the file and what is wrong with it, and at which byte. Length and header are
  /// looked at before anything else, so that a file that is cut, or larger than what can be mapped, is
  /// refused at once.
  explicit MappedNvtt(std::string const& path, NvttCheck check = NvttCheck::kTables);
  MappedNvtt(MappedNvtt const&) = delete;
  MappedNvtt& operator=(MappedNvtt const&) = delete;
  ~MappedNvtt();

  nanovtt::NvttFile const& file() const { return m_file; }
  nanovtt::BufferReader const& reader() const { return m_reader; }
  /// The bounds of a grid's tiles, for Reader/NanoVTTBounds.h; null where the file has none. They have been
  /// checked, with their hash.
  void const* bounds(std::uint32_t grid) const;
  std::uint64_t bufferLength() const { return m_file.bufferLength(); }

private:
  void* m_bytes = nullptr;
  std::size_t m_length = 0;
  nanovtt::NvttFile m_file;
  nanovtt::BufferReader m_reader;
};

/// Whether the file begins as a .nvtt file does. False when it cannot be read.
VLN_API bool isNvttFile(std::string const& path);

} // namespace VLN::Interop
