// FileError: a file that cannot be read or written, with a message fit for one line.
#pragma once

#include "GeometryVolume/core/Export.h"

#include <stdexcept>
#include <string>
#include <utility>

namespace VLN::Interop {

/// what() is "<file>: <reason>".
class VLN_API FileError : public std::runtime_error {
public:
  FileError(std::string file, std::string reason);
  ~FileError() override;

  std::string const& file() const { return m_file; }
  std::string const& reason() const { return m_reason; }

private:
  std::string m_file;
  std::string m_reason;
};

/// The text on one line: UTF-8 stays, line ends become spaces, what else is no text becomes \xNN, and what is
/// over `longest` characters is cut. Text out of a foreign file goes through here before it is shown.
VLN_API std::string oneLine(std::string const& text, std::size_t longest = 300);

} // namespace VLN::Interop
