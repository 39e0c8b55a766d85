#include "GeometryVolume/volume/detail/FieldBlocks.h"

#include <algorithm>
#include <iterator>

namespace VLN::TileTree3D::Internal {

FieldBlock* FieldBlocks::noBlock() {
  static FieldBlock none;
  return &none;
}

FieldBlock& FieldBlocks::make(int3 const& position, FieldBlock* block) {
  if (2 * (m_used + 1) > m_slots.size()) resize(2 * m_slots.size());
  Key const key(position);
  std::size_t n = key.hash & m_mask;
  while (m_slots[n].block && m_slots[n].key.at != key.at) n = (n + 1) & m_mask;
  Slot& slot = m_slots[n];
  if (slot.block) return *slot.block;
  FieldBlock& made = block ? *block : newBlock();
  slot = {key, &made};
  ++m_used;
  return made;
}

FieldBlock& FieldBlocks::newBlock() {
  if (m_left == 0) {
    m_left = std::clamp(m_used, kFirstChunk, kMostChunk);
    m_chunks.emplace_back(m_left);
  }
  return m_chunks.back()[m_chunks.back().size() - m_left--];
}

void FieldBlocks::takeMemory(FieldBlocks& other) {
  // In front: the last one is this table's own, and has blocks left.
  m_chunks.insert(m_chunks.begin(), std::move_iterator(other.m_chunks.begin()),
                  std::move_iterator(other.m_chunks.end()));
  other.clear();
}

void FieldBlocks::clear() { *this = FieldBlocks(); }

void FieldBlocks::reserve(std::size_t blocks) {
  std::size_t slots = m_slots.size();
  while (slots < 2 * (m_used + blocks)) slots *= 2;
  if (slots > m_slots.size()) resize(slots);
}

void FieldBlocks::resize(std::size_t slots) {
  std::vector<Slot> old(slots);
  old.swap(m_slots);
  m_mask = slots - 1;
  for (Slot const& slot : old) {
    if (!slot.block) continue;
    std::size_t n = slot.key.hash & m_mask;
    while (m_slots[n].block) n = (n + 1) & m_mask;
    m_slots[n] = slot;
  }
}

} // namespace VLN::TileTree3D::Internal
