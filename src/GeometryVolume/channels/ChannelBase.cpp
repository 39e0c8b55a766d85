#include "GeometryVolume/channels/ChannelBase.h"

#include "GeometryVolume/channels/ElementExchangeImpl.h"
#include "GeometryVolume/core/LoggerHooks.h"
#include "GeometryVolume/core/Streaming.h"
#include "GeometryVolume/core/YieldPointImpl.h"
#include "GeometryVolume/tiletree/Traits.h"

#include <algorithm>
#include <iostream>
#include <vector>

namespace VLN::TileTree3D {

ChannelBase::~ChannelBase() = default;

ChannelBase::Change::Change(ChannelBase const& channel)
    : m_channel(&channel) {
  VLN_YIELD_POINT();
  channel.m_gate.beginChange();
  VLN_YIELD_POINT(); // the gate is shut, the logger does not know yet
  objectIncomplete(m_channel);
}
ChannelBase::Change::~Change() {
  if (!m_channel) return;
  objectComplete(m_channel);
  VLN_YIELD_POINT();
  m_channel->m_gate.endChange();
}

void ChannelBase::memUse(std::uint64_t& used, std::uint64_t& allocated, bool notShared) const {
  // Not TileTree3D::Component's, which counts the owner's name. NOLINTNEXTLINE(bugprone-parent-virtual-call)
  VLN::Component::memUse(used, allocated, notShared);
}

void ChannelBase::dumpCounts(std::ostream& os) const {
  auto const pad = Streaming::pad(os);
  auto const line = [&](char const* what, auto const& countOf) {
    os << pad << what << " {" << kChannelDepths - 1 << "} =";
    for (int d = 0; d < kChannelDepths; ++d) os << (d == 0 ? "" : ", ") << countOf(d);
    os << '\n';
  };
  line("tileCount", [&](int d) { return tileCount(d); });
  line("elementCount", [&](int d) { return elementCount(d); });
}

void ChannelBase::announceCopy(ChannelBase const& copy) const {
  if (loggingEnabled())
    std::cout << "ERROR: Copying " << name() << " from ptr " << static_cast<void const*>(this) << " to ptr "
              << static_cast<void const*>(&copy) << '\n';
}

void ChannelBase::addShared(std::uint64_t& used, std::uint64_t& allocated, std::uint64_t dataUsed,
                            std::uint64_t dataAllocated, std::int64_t sharers, bool notShared,
                            void const* storage) {
  auto const divisor = static_cast<std::uint64_t>(notShared ? 1 : std::max<std::int64_t>(1, sharers));
  used += dataUsed / divisor;
  allocated += dataAllocated / divisor;
  if (!loggerDumpInProgress() || sharers <= 1) return;
  auto const megabytes = [](std::uint64_t bytes) {
    return static_cast<float>(static_cast<double>(bytes) / 1e6);
  };
  std::cout << " Data shared by " << sharers << " channels, raw data ptr = " << storage << '\n'
            << " Total shared data = " << megabytes(dataUsed)
            << "MB (total shared data allocated = " << megabytes(dataAllocated) << "MB)";
}

void ChannelBase::computePermutation(std::vector<ElementToFrom>& moves, std::vector<std::uint64_t>& order,
                                     std::vector<std::uint64_t>& tiles, TileArrivals& arrivals, int depth,
                                     bool sorted) const {
  if (!sorted) Internal::sortMoves(moves);
  Internal::groupByDestination(moves, order, tiles, arrivals, [&](std::int64_t tile) {
    return tile < tileCount(depth) ? elementCount(TreeIndex{tile, depth}) : 0;
  });
}

void ChannelBase::computePermutation(ElementMoves& moves, ElementOrder& order, DestinationTiles& tiles,
                                     ArrivalMap& arrivals, bool sorted) const {
  moves.resize(kChannelDepths);
  order.resize(kChannelDepths);
  tiles.resize(kChannelDepths);
  arrivals.resize(kChannelDepths);
  for (std::size_t d = 0; d < kChannelDepths; ++d)
    computePermutation(moves[d], order[d], tiles[d], arrivals[d], static_cast<int>(d), sorted);
}

void ChannelBase::updateElementsNoDispatch(std::vector<ElementToFrom> const& moves,
                                           std::vector<std::uint64_t> const& order,
                                           std::vector<std::uint64_t> const& tiles,
                                           TileArrivals const& arrivals, int depth) {
  updateElementsNoDispatch(ElementPermutation{ElementPermutation::kOneDepth, &moves, &order, &tiles,
                                              &arrivals, depth, depth, nullptr, nullptr, nullptr, nullptr,
                                              nullptr});
}

namespace {

/// Calls `body(moves, order, tiles, arrivals, depth)` for each destination depth.
template <class Body> void forEachList(ElementPermutation const& p, Body const& body) {
  if (p.kind == ElementPermutation::kOneDepth) {
    body(*p.moves, *p.order, *p.tiles, *p.arrivals, p.firstDepth);
    return;
  }
  std::size_t const n = std::min({p.allMoves->size(), p.allOrders->size(), p.allTiles->size(),
                                  p.allArrivals->size(), std::size_t(kChannelDepths)});
  for (std::size_t d = 0; d < n; ++d)
    body((*p.allMoves)[d], (*p.allOrders)[d], (*p.allTiles)[d], (*p.allArrivals)[d], static_cast<int>(d));
}

} // namespace

void ChannelBase::updateElementsNoDispatch(ElementPermutation const& p) {
  if (layout().fixedSize()) return;
  {
    Change const change(*this);
    if (Internal::exchangeElements(*this, p)) return;
  }
  bool canFollow = true;
  forEachList(p, [&](auto const& moves, auto const&, auto const&, auto const&, int d) {
    canFollow = canFollow && holdsAll(moves, d);
  });
  if (canFollow)
    applyMoves(p);
  else
    applyHeldMoves(p);
}

void ChannelBase::applyHeldMoves(ElementPermutation const& p) {
  ElementMoves moves(kChannelDepths);
  ElementRemovals ignored;
  forEachList(p, [&](auto const& all, auto const&, auto const&, auto const&, int d) {
    if (d < 0 || d >= kChannelDepths) return;
    std::vector<ElementToFrom> others;
    for (ElementToFrom const& move : all) (holdsAll({move}, d) ? moves[d] : others).push_back(move);
    Internal::addSources(others, ignored);
  });
  ElementOrder order;
  DestinationTiles tiles;
  ArrivalMap arrivals;
  computePermutation(moves, order, tiles, arrivals, true);
  ElementPermutation held{ElementPermutation::kAllDepths};
  held.allMoves = &moves, held.allOrders = &order, held.allTiles = &tiles, held.allArrivals = &arrivals;
  ElementRemovals removals;
  if (p.kind == ElementPermutation::kRecorded) {
    // The record lists the sources of its moves as well: those of moves that are ignored stay.
    Internal::finishRemovals(ignored);
    removals = *p.removals;
    for (std::size_t d = 0; d < std::min(removals.size(), ignored.size()); ++d)
      std::erase_if(removals[d], [&](ElementInTile const& e) {
        return std::binary_search(ignored[d].begin(), ignored[d].end(), e);
      });
    held.kind = ElementPermutation::kRecorded;
    held.removals = &removals;
  }
  applyMoves(held);
}

void ChannelBase::applyMoves(ElementPermutation const& p) {
  // What may fail comes first.
  ElementRemovals collected;
  ElementRemovals const* removals = p.removals;
  if (p.kind != ElementPermutation::kRecorded) {
    forEachList(p, [&](auto const& moves, auto const&, auto const&, auto const&, int) {
      Internal::addSources(moves, collected);
    });
    Internal::finishRemovals(collected);
    removals = &collected;
  }
  forEachList(p, [&](auto const& moves, auto const&, auto const& tiles, auto const& arrivals, int d) {
    reserveElementStorage(tiles, arrivals, moves.size(), d);
  });
  // Sources are read by position, so nothing is removed before everything is copied.
  forEachList(p, [&](auto const& moves, auto const&, auto const& tiles, auto const& arrivals, int d) {
    allocateElementStorage(tiles, arrivals, moves.size(), d);
  });
  forEachList(p, [&](auto const& moves, auto const& order, auto const& tiles, auto const& arrivals, int d) {
    copyElements(moves, order, tiles, arrivals, d);
  });
  for (std::size_t d = 0; d < removals->size(); ++d) removeElements((*removals)[d], static_cast<int>(d));
}

void ChannelBase::update(std::vector<ElementToFrom>& moves, int first, int last, bool sorted) {
  std::vector<std::uint64_t> order, tiles;
  TileArrivals arrivals;
  computePermutation(moves, order, tiles, arrivals, first, sorted);
  ElementPermutation p{ElementPermutation::kOneDepth, &moves, &order, &tiles, &arrivals, first, last};
  updateElementsNoDispatch(p);
}
void ChannelBase::update(std::vector<ElementToFrom>& moves, int depth, bool sorted) {
  update(moves, depth, depth, sorted);
}

void ChannelBase::update(ElementMoves& moves, bool sorted) {
  ElementOrder order;
  DestinationTiles tiles;
  ArrivalMap arrivals;
  computePermutation(moves, order, tiles, arrivals, sorted);
  updateElements(moves, order, tiles, arrivals);
}

void ChannelBase::update(TileDataElementAccessor& recorded) {
  Internal::finishRemovals(recorded.elementsFrom());
  ElementMoves& moves = recorded.elementsTo();
  for (auto& list : moves) Internal::sortMoves(list);
  ElementOrder order;
  DestinationTiles tiles;
  ArrivalMap arrivals;
  computePermutation(moves, order, tiles, arrivals, true);
  ElementPermutation p{ElementPermutation::kRecorded};
  p.allMoves = &moves, p.allOrders = &order, p.allTiles = &tiles, p.allArrivals = &arrivals;
  p.removals = &recorded.elementsFrom();
  updateElementsNoDispatch(p);
}

} // namespace VLN::TileTree3D
