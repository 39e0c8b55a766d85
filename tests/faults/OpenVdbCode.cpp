#include "OpenVdbCode.h"

#include <algorithm>
#include <cstddef>
#include <fstream>
#include <iterator>
#include <link.h>
#include <span>
#include <string>
#include <string_view>

namespace test::faults {

namespace {

std::string contentOf(std::string const& path) {
  std::ifstream file(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(file), {}};
}
template <class T>
std::span<T const> tableIn(std::string const& file, std::size_t offset, std::size_t bytes) {
  return {reinterpret_cast<T const*>(file.data() + offset), bytes / sizeof(T)};
}

/// Calls `f(address, size, name)` for each function of an ELF file that its full symbol table names.
template <class F> void forEachFunction(std::string const& file, F const& f) {
  if (file.size() < sizeof(ElfW(Ehdr))) return;
  auto const& header = tableIn<ElfW(Ehdr)>(file, 0, sizeof(ElfW(Ehdr)))[0];
  auto const sections = tableIn<ElfW(Shdr)>(file, header.e_shoff, header.e_shnum * sizeof(ElfW(Shdr)));
  for (auto const& section : sections) {
    if (section.sh_type != SHT_SYMTAB) continue;
    char const* const names = file.data() + sections[section.sh_link].sh_offset;
    for (auto const& symbol : tableIn<ElfW(Sym)>(file, section.sh_offset, section.sh_size))
      if ((symbol.st_info & 0xf) == STT_FUNC && symbol.st_size > 0)
        f(symbol.st_value, symbol.st_size, std::string_view(names + symbol.st_name));
  }
}

} // namespace

OpenVdbCode::OpenVdbCode() {
  auto const look = [](dl_phdr_info* info, std::size_t, void* data) {
    auto& ranges = *static_cast<std::vector<Range>*>(data);
    std::string_view const path = info->dlpi_name;
    if (path.find("libopenvdb") != path.npos) {
      for (auto const& segment : std::span(info->dlpi_phdr, info->dlpi_phnum))
        if (segment.p_type == PT_LOAD)
          ranges.push_back(
              {info->dlpi_addr + segment.p_vaddr, info->dlpi_addr + segment.p_vaddr + segment.p_memsz});
      return 0;
    }
    forEachFunction(contentOf(path.empty() ? "/proc/self/exe" : std::string(path)),
                    [&](std::uintptr_t at, std::size_t size, std::string_view name) {
                      if (name.starts_with("_ZN7openvdb") || name.starts_with("_ZNK7openvdb"))
                        ranges.push_back({info->dlpi_addr + at, info->dlpi_addr + at + size});
                    });
    return 0;
  };
  dl_iterate_phdr(look, &m_ranges);
  std::sort(m_ranges.begin(), m_ranges.end(),
            [](Range const& a, Range const& b) { return a.begin < b.begin; });
}

bool OpenVdbCode::holds(void const* code) const {
  auto const at = reinterpret_cast<std::uintptr_t>(code) - 1; // where a call returns may be another's begin
  auto const next = std::upper_bound(m_ranges.begin(), m_ranges.end(), at,
                                     [](std::uintptr_t value, Range const& r) { return value < r.begin; });
  return next != m_ranges.begin() && at < (next - 1)->end;
}

} // namespace test::faults
