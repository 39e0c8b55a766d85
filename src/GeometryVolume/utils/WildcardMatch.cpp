#include "GeometryVolume/utils/WildcardMatch.h"

#include <cstddef>
#include <vector>

namespace VLN::Utils {

namespace {

/// Where the first occurrence of `part` in `text` ends, or npos. Knuth, Morris and Pratt's search: no
/// character of the text is read again after a mismatch.
std::size_t endOfFirst(std::string_view part, std::string_view text) {
  std::vector<std::size_t> border(part.size(), 0);
  std::size_t matched = 0;
  for (std::size_t n = 1; n < part.size(); ++n) {
    while (matched && part[n] != part[matched]) matched = border[matched - 1];
    if (part[n] == part[matched]) ++matched;
    border[n] = matched;
  }
  matched = 0;
  for (std::size_t n = 0; n < text.size(); ++n) {
    while (matched && text[n] != part[matched]) matched = border[matched - 1];
    if (text[n] == part[matched]) ++matched;
    if (matched == part.size()) return n + 1;
  }
  return std::string_view::npos;
}

} // namespace

bool wildcardMatch(std::string_view pattern, std::string_view name) {
  auto const first = pattern.find('*');
  if (first == std::string_view::npos) return pattern == name;
  if (pattern.find_first_not_of('*') == std::string_view::npos) return true;
  if (name.find_first_of("\n\r") != std::string_view::npos) return false;

  auto const last = pattern.rfind('*');
  std::string_view const head = pattern.substr(0, first), tail = pattern.substr(last + 1);
  if (name.size() < head.size() + tail.size() || !name.starts_with(head) || !name.ends_with(tail))
    return false;
  name.remove_prefix(head.size());
  name.remove_suffix(tail.size());

  // What lies between the stars: each part at its first occurrence leaves the most for the parts that follow.
  pattern = pattern.substr(first, last - first);
  while (!pattern.empty()) {
    pattern.remove_prefix(1);
    std::string_view const part = pattern.substr(0, pattern.find('*'));
    pattern.remove_prefix(part.size());
    if (part.empty()) continue;
    auto const end = endOfFirst(part, name);
    if (end == std::string_view::npos) return false;
    name.remove_prefix(end);
  }
  return true;
}

} // namespace VLN::Utils
