// Which code of this process is OpenVDB's: its library, and the copies of its templates in others.
#pragma once

#include <cstdint>
#include <vector>

namespace test::faults {

/// Made from the symbol tables of the files that are loaded: shared libraries need not export the names.
class OpenVdbCode {
public:
  OpenVdbCode();
  bool holds(void const* code) const;

private:
  struct Range {
    std::uintptr_t begin, end;
  };
  std::vector<Range> m_ranges; ///< sorted
};

} // namespace test::faults
