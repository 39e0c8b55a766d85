#include "GeometryVolume/volume/detail/FieldBlocks.h"

namespace VLN::TileTree3D::Internal {

FieldBlock* FieldBlocks::noBlock() {
  static FieldBlock none;
  return &none;
}

FieldBlock::Entry& FieldBlocks::entry(int3 const& corner) {
  if (2 * (m_used + 1) > m_slots.size()) resize(2 * m_slots.size());
  int3 const at{corner.x >> 3, corner.y >> 3, corner.z >> 3};
  std::size_t n = hash(at) & m_mask;
  while (m_slots[n].block && m_slots[n].at != at) n = (n + 1) & m_mask;
  Slot& slot = m_slots[n];
  FieldBlock& block = slot.block ? *slot.block : newBlock();
  if (!slot.block) {
    slot = {at, &block};
    ++m_used;
  }
  return block.tiles[FieldBlock::place(corner.x, corner.y, corner.z).slot()];
}

FieldBlock& FieldBlocks::newBlock() {
  if (m_left == 0) {
    m_chunks.emplace_back(kChunk);
    m_left = kChunk;
  }
  return m_chunks.back()[kChunk - m_left--];
}

void FieldBlocks::clear() { *this = FieldBlocks(); }

void FieldBlocks::reserve(std::int64_t tiles) {
  std::size_t slots = m_slots.size();
  // Most blocks hold several tiles; those that do not make the table grow.
  while (slots < 2 * (m_used + static_cast<std::size_t>(tiles) / 4)) slots *= 2;
  if (slots > m_slots.size()) resize(slots);
}

void FieldBlocks::resize(std::size_t slots) {
  std::vector<Slot> old(slots, Slot{{0, 0, 0}, nullptr});
  old.swap(m_slots);
  m_mask = slots - 1;
  for (Slot const& slot : old) {
    if (!slot.block) continue;
    std::size_t n = hash(slot.at) & m_mask;
    while (m_slots[n].block) n = (n + 1) & m_mask;
    m_slots[n] = slot;
  }
}

} // namespace VLN::TileTree3D::Internal
