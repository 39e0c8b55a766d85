// OutputFolder: a folder of files that appears whole or not at all.
#pragma once

#include "GeometryVolume/core/Export.h"

#include <cstddef>
#include <string>

namespace VLN::Interop {

/// Files are collected in a new folder beside the target. commit() puts it into the target's place at once;
/// what was there is whole until then. Where a process ends before, removeUnfinishedOutput() removes the
/// folder.
class VLN_API OutputFolder {
public:
  /// @param mark A file that tells folders of this kind. Other folders are not replaced, but empty ones.
  /// @error FileError, here and below, for what the system refuses, and for a target that is a file or a
  /// folder of another kind.
  OutputFolder(std::string path, std::string const& mark);
  OutputFolder(OutputFolder const&) = delete;
  OutputFolder& operator=(OutputFolder const&) = delete;
  /// Without commit() nothing stays.
  ~OutputFolder();

  /// Writes a file; folders on the way to it are made.
  /// @param name Within the folder, with '/' between the parts.
  /// @threads Safe for different names.
  void write(std::string const& name, void const* bytes, std::size_t count) const;
  void write(std::string const& name, std::string const& bytes) const {
    write(name, bytes.data(), bytes.size());
  }
  void commit();

private:
  std::string m_path;      ///< as it was said
  std::string m_target;    ///< where links lead to
  std::string m_temporary; ///< empty when there is none
};

/// Tells whether a folder could be put at that name, before the work that leads to it.
/// @error FileError when it could not.
VLN_API void checkOutputFolder(std::string const& path, std::string const& mark);

/// For removeUnfinishedOutput().
void removeUnfinishedFolders() noexcept;

} // namespace VLN::Interop
