// Standard output with every write checked, for the program alone.
#pragma once

#include <ostream>
#include <streambuf>
#include <string>

namespace Vln {

/// What the commands print. std::cout is not for them: libraries log there.
std::ostream& out();

/// Flushes and closes standard output; what a disk in the net could not take is told here at the latest.
/// @return 0, or the number of the first error.
int closeOutput();

/// The stream for remarks that go beside an output file: standard error where the file is standard output
/// itself.
std::ostream& remarks(std::string const& output);

/// While it lives, lines that libraries print to std::cout are notes on standard error. OpenVDB's log would
/// lie between our own lines, and in the middle of JSON and CSV.
class ForeignLines : public std::streambuf {
public:
  ForeignLines();
  ForeignLines(ForeignLines const&) = delete;
  ForeignLines& operator=(ForeignLines const&) = delete;
  ~ForeignLines() override;

protected:
  int overflow(int c) override;

private:
  void tell();

  std::streambuf* m_old;
  std::string m_line;
};

/// While it lives, what is printed to std::cout is the program's own.
class OwnLines {
public:
  OwnLines();
  OwnLines(OwnLines const&) = delete;
  OwnLines& operator=(OwnLines const&) = delete;
  ~OwnLines();

private:
  std::streambuf* m_old;
};

} // namespace Vln
