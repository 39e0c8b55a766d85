// OutputFile: a file that appears under its name only when it is whole.
//
//   OutputFile file(path);       what stands in the way is told here
//   file.write(bytes, count);    as often as wanted
//   file.commit();               now, and only now, the name holds the new content
//
//   path names                           what is written
//   nothing yet, or a file of its own    a temporary file beside it, renamed at the commit
//   a symbolic link                      the same, where the link points to; the link stays
//   a file with further names, or one    a temporary file beside it, whose content is put into the old
//   whose owner cannot be given on       file at the commit, or the old content back where that fails
//   a pipe, a device, /dev/stdout        itself, at once
#pragma once

#include "GeometryVolume/core/Export.h"

#include <cstddef>
#include <string>
#include <string_view>

namespace VLN::Interop {

/// Without a commit the temporary file is removed and what was there before stays untouched. A file that is
/// replaced keeps its mode and its owner; a new one gets the mode that the process gives new files.
/// @threads One thread at a time.
class VLN_API OutputFile {
public:
  /// @error FileError when the folder or the file cannot be written to.
  explicit OutputFile(std::string path);
  OutputFile(OutputFile const&) = delete;
  OutputFile& operator=(OutputFile const&) = delete;
  ~OutputFile();

  std::string const& path() const { return m_path; }
  /// Whether it goes to a pipe or a device, beside which no other file can lie.
  bool straight() const { return m_way == Way::kStraight; }

  /// Appends. Small pieces are collected, large ones go to the system as they are.
  /// @error FileError, for instance on a full disk; the file cannot be committed any more then.
  void write(void const* bytes, std::size_t count);
  void write(std::string_view text) { write(text.data(), text.size()); }

  /// Hands all data to the disk, so that hardly anything is left that could fail in commit(). For two files
  /// that belong together: finish both, then commit both.
  /// @error FileError.
  void finish();
  /// finish(), and gives the content its name.
  /// @error FileError; the content under the name is the old one then.
  void commit();

private:
  enum class Way { kReplace, kRefill, kStraight };

  void put(char const* bytes, std::size_t count);
  [[noreturn]] void fail(int error);

  std::string m_path;
  std::string m_target;    ///< where links lead to
  std::string m_temporary; ///< empty while there is none
  std::string m_collected;
  Way m_way = Way::kReplace;
  int m_fd = -1;
  bool m_failed = false;
};

/// Tells whether a file of that name could be written, before the work that leads to it.
/// @error FileError when it could not.
VLN_API void checkOutput(std::string const& path);

/// Removes the temporary files and folders that are being written, if there are any. Made for signal
/// handlers: it makes system calls alone.
VLN_API void removeUnfinishedOutput() noexcept;

} // namespace VLN::Interop
