// Positions of a command line, of a CSV file or of standard input.
#pragma once

#include "Velorn/Math.h"

#include <string>
#include <string_view>
#include <vector>

namespace Vln {

/// A finite number and nothing else.
bool parseNumber(std::string_view text, double& number);

/// Lines x,y,z of a file, or of standard input for "-", as they come. One line at the top that holds no
/// number is taken for a header.
class PositionLines {
public:
  /// @error FileError.
  explicit PositionLines(std::string path);
  PositionLines(PositionLines const&) = delete;
  PositionLines& operator=(PositionLines const&) = delete;
  ~PositionLines();

  /// Appends the positions of the lines that are there; waits where none is yet.
  /// @return false at the end.
  /// @error FileError that names the line.
  bool next(std::vector<Velorn::Math::double3>& positions);
  /// Whether lines may take their time.
  bool streams() const { return m_streams; }

private:
  void parseLine(std::string_view line, std::vector<Velorn::Math::double3>& positions);

  std::string m_name;
  int m_fd = -1;
  bool m_streams = false;
  std::string m_rest; ///< the begin of a line
  std::size_t m_line = 0;
};

} // namespace Vln
