// Standard output with every write checked.
#pragma once

#include <streambuf>
#include <string>

namespace Vln {

/// Stands behind std::cout while it lives.
class StandardOutput : public std::streambuf {
public:
  StandardOutput();
  StandardOutput(StandardOutput const&) = delete;
  StandardOutput& operator=(StandardOutput const&) = delete;
  ~StandardOutput() override;

  /// Flushes and closes; what a disk in the net could not take is told here at the latest.
  /// @return 0, or the number of the first error.
  int close();
  int error() const { return m_error; }

protected:
  int overflow(int c) override;
  int sync() override;

private:
  void flushCollected();

  std::streambuf* m_old;
  std::string m_collected;
  int m_error = 0;
};

/// The stream for remarks that go beside an output file: standard error where the file is standard output
/// itself.
std::ostream& remarks(std::string const& output);

} // namespace Vln
