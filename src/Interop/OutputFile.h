// OutputFile: a file that appears under its name only when it is whole.
#pragma once

#include "GeometryVolume/core/Export.h"

#include <string>

namespace VLN::Interop {

/// Content is written to temporaryPath(), a name beside the wanted one; commit() renames it over the wanted
/// one. Without a commit the temporary file is removed and what was there before stays untouched.
class VLN_API OutputFile {
public:
  /// @error FileError when the folder cannot be written to, or when `path` names something other than a
  /// regular file.
  explicit OutputFile(std::string path);
  OutputFile(OutputFile const&) = delete;
  OutputFile& operator=(OutputFile const&) = delete;
  ~OutputFile();

  std::string const& path() const { return m_path; }
  std::string const& temporaryPath() const { return m_temporaryPath; }

  /// Writes all of the content at once.
  /// @error FileError, for instance on a full disk.
  void write(void const* bytes, std::size_t count);
  /// Hands the data to the disk and gives the file its name.
  /// @error FileError; nothing has changed then.
  void commit();

private:
  std::string m_path;
  std::string m_temporaryPath;
  bool m_committed = false;
};

/// Tells whether a file of that name could be written, before the work that leads to it.
/// @error FileError when it could not.
VLN_API void checkOutput(std::string const& path);

/// Removes the temporary file that is being written, if there is one. Made for signal handlers: it calls
/// nothing but unlink.
VLN_API void removeUnfinishedOutput() noexcept;

} // namespace VLN::Interop
