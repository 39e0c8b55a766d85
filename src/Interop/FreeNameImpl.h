// freeName(): a name that nothing else has.
#pragma once

#include <set>
#include <string>

namespace VLN::Interop {

/// The name itself where nothing took it yet, else with "_2", "_3", ... behind it. It is taken from here on.
/// @edges An empty name becomes "unnamed".
inline std::string freeName(std::string const& wanted, std::set<std::string>& taken) {
  std::string const base = wanted.empty() ? "unnamed" : wanted;
  std::string name = base;
  for (int n = 2; !taken.insert(name).second; ++n) name = base + "_" + std::to_string(n);
  return name;
}

} // namespace VLN::Interop
