// Lines that the pools and the object logger write to standard output.
#pragma once

#include <iostream>
#include <sstream>

namespace VLN::TileTree3D::Internal {

/// Writes its arguments as one line, in one piece, so that lines of several threads do not mix.
template <class... Parts> void writeLine(Parts const&... parts) {
  std::ostringstream line;
  (line << ... << parts);
  line << '\n';
  std::cout << line.str() << std::flush;
}

} // namespace VLN::TileTree3D::Internal
