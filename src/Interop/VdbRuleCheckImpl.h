// RuleCheck: whether a rule tells which voxels of a grid are active.
#pragma once

#include "Interop/VdbLeafImpl.h"
#include "Interop/VdbStoredGridImpl.h"

#include <cstdint>
#include <vector>

namespace VLN::Interop {

/// Looks at a part of a grid. A rule may take a few active voxels for inactive ones, as those of a band that
/// was rounded to half precision: they are listed. It takes no inactive one for active.
template <class TreeT> class RuleCheck {
public:
  using Leaf = typename TreeT::LeafNodeType;
  using Value = typename TreeT::ValueType;

  /// @param mostAlso The most voxels that are listed in the whole grid.
  RuleCheck(VdbActiveRule rule, std::size_t mostAlso)
      : m_rule(rule)
      , m_mostAlso(mostAlso) {}

  VdbActiveRule rule() const { return m_rule; }
  bool holds() const { return m_holds; }
  /// Voxels that are active though the rule says that they are not.
  std::vector<int3> const& alsoActive() const { return m_alsoActive; }

  void look(Leaf const& leaf, Value const* values, Value const& background) {
    for (int i = 0; m_holds && i < kLeafWidth; ++i) {
      std::uint64_t const active = maskWord(leaf, i),
                          byRule = wordByRule<Value>(m_rule, values + 64 * i, background);
      if (active != byRule) [[unlikely]]
        list(leaf.origin().offsetBy(i, 0, 0), active, byRule);
    }
  }
  void look(WideTile<Value> const& tile, Value const& background) {
    if (tile.active || followsRule<Value>(m_rule, tile.value, background)) fail();
  }
  /// Takes what was found of another part.
  void join(RuleCheck const& other) {
    if (!other.m_holds) fail();
    if (!m_holds) return;
    m_alsoActive.insert(m_alsoActive.end(), other.m_alsoActive.begin(), other.m_alsoActive.end());
    if (m_alsoActive.size() > m_mostAlso) fail();
  }

private:
  void list(Coord const& first, std::uint64_t active, std::uint64_t byRule) {
    if (byRule & ~active) return fail();
    for (std::uint64_t also = active & ~byRule; also != 0; also &= also - 1) {
      int const n = std::countr_zero(also);
      m_alsoActive.push_back(toInt3(first.offsetBy(0, n / 8, n % 8)));
    }
    if (m_alsoActive.size() > m_mostAlso) fail();
  }
  void fail() {
    m_holds = false;
    m_alsoActive.clear();
  }

  VdbActiveRule m_rule;
  std::size_t m_mostAlso;
  bool m_holds = true;
  std::vector<int3> m_alsoActive;
};

} // namespace VLN::Interop
