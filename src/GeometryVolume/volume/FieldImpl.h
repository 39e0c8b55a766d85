// Definitions of Field. Only the generated sources include this.
#pragma once

#include "GeometryVolume/channels/ManyReadsImpl.h"
#include "GeometryVolume/sampling/VoxelSamplerLinear.h"
#include "GeometryVolume/volume/FieldSlotImpl.h"
#include "GeometryVolume/volume/Volume.h"

#include <cstring>
#include <stdexcept>
#include <string>
#include <type_traits>
#include <utility>

namespace VLN::TileTree3D {

template <class T> struct Field<T>::Sampler {
  FloatVoxelSamplerLinear<Internal::VolumeShape> linear;
  std::uint64_t epoch, version, values;
};

template <class T>
Field<T>::Field(Field const& other)
    : m_volume(other.m_volume)
    , m_slot(other.m_slot)
    , m_block(other.m_block)
    , m_at(other.m_at)
    , m_readEpoch(other.m_readEpoch)
    , m_writeEpoch(other.m_writeEpoch) {}
template <class T> Field<T>::Field(Field&& other) noexcept = default;
template <class T> Field<T>& Field<T>::operator=(Field const& other) {
  if (this != &other) *this = Field(other);
  return *this;
}
template <class T> Field<T>& Field<T>::operator=(Field&& other) noexcept = default;
template <class T> Field<T>::~Field() = default;

namespace Internal {
inline void checkCounts(std::string const& field, std::size_t positions, std::size_t values) {
  if (positions != values)
    throw std::invalid_argument("field \"" + field + "\": " + std::to_string(positions) + " positions with " +
                                std::to_string(values) + " values");
}
template <class T> TypedSlot<T>& typed(FieldSlot& slot) { return static_cast<TypedSlot<T>&>(slot); }
} // namespace Internal

template <class T> T const& Field<T>::background() const {
  return Internal::typed<T>(*m_slot).typed().defaultValue();
}

template <class T> inline void Field<T>::findBlock(int i, int j, int k) const {
  m_readEpoch = m_volume->epoch.load(std::memory_order_relaxed);
  m_writeEpoch = m_slot->exclusive.load(std::memory_order_relaxed) ? m_readEpoch : 0;
  m_at = {i & ~7, j & ~7, k & ~7};
  m_block = m_slot->blocks.find(i, j, k);
}

template <class T> void Field<T>::moveToRead(int i, int j, int k) const {
  m_volume->sync(*m_slot);
  findBlock(i, j, k);
}

template <class T> void Field<T>::moveToWrite(int i, int j, int k) {
  m_volume->prepareWrite(*m_slot);
  findBlock(i, j, k);
}

template <class T> T* Field<T>::make(int i, int j, int k) {
  // Another handle may have made the block.
  if (m_block == Internal::FieldBlocks::noBlock()) findBlock(i, j, k);
  if (!m_block->tile(i, j, k)) {
    int3 const p{i, j, k};
    if (!Internal::VolumeShape::inDomain(p)) Internal::throwOutside(p);
    Internal::BlockTiles tile{p, 1u << Internal::FieldBlock::place(i, j, k).slot()};
    Internal::typed<T>(*m_slot).makePending(*m_volume, {&tile, 1});
    findBlock(i, j, k);
  }
  return static_cast<T*>(m_block->tile(i, j, k));
}

template <class T> T Field<T>::coarse(int i, int j, int k) const {
  using namespace Internal;
  moveToRead(i, j, k); // the tile may have been made through another handle
  auto const place = FieldBlock::place(i, j, k);
  if (auto const* const tile = static_cast<T const*>(m_block->tile(place))) return tile[place.element()];
  auto& slot = typed<T>(*m_slot);
  auto const accessor = std::as_const(*m_volume->tree).tileAccessor();
  TreeIndex at = accessor.treeIndex(i, j, k, kFinest, false);
  while (at.valid()) {
    auto const& elements = slot.tile(at);
    auto const& tile = accessor.tile(at);
    if (elements.size() >= kTileElements) {
      int3 const p = tile.childDataIJK(i, j, k);
      return elements[ConstTileData<T, 4, 0>::index(p)];
    }
    at = tile.parentTreeIndex();
  }
  return slot.typed().defaultValue();
}

template <class T> void Field<T>::set(std::span<int3 const> positions, std::span<T const> values) {
  using namespace Internal;
  checkCounts(m_slot->name, positions.size(), values.size());
  auto const& slot = typed<T>(*m_slot);
  auto const chunkTiles = [&](std::size_t first) {
    return std::make_unique<TypedChunkTiles<T>>(slot, *m_volume->tree, values.data() + first);
  };
  if (isAtRandom(positions)) {
    ScatteredElements const found = findScattered(*m_volume, *m_slot, positions, chunkTiles);
    m_volume->valuesChanged(*m_slot);
    parallelFor(0, static_cast<std::int64_t>(found.shares), [&](std::int64_t begin, std::int64_t end) {
      for (auto share = begin; share < end; ++share) found.write(share, values.data());
    });
    return;
  }
  BulkRuns const plan = planBulk(*m_volume, *m_slot, positions, chunkTiles);
  m_volume->valuesChanged(*m_slot);
  parallelFor(0, static_cast<std::int64_t>(plan.shares), [&](std::int64_t begin, std::int64_t end) {
    for (auto share = begin; share < end; ++share)
      for (std::size_t chunk = 0; chunk < plan.chunks(); ++chunk) {
        std::size_t const first = plan.begins[chunk];
        for (BulkRun const& run : plan.list(chunk, share))
          writeRun(run, &plan.places[first + run.begin], values.data() + first + run.begin);
      }
  });
}

template <class T> void Field<T>::get(std::span<int3 const> positions, std::span<T> values) const {
  using namespace Internal;
  checkCounts(m_slot->name, positions.size(), values.size());
  m_volume->sync(*m_slot);
  auto const& blocks = m_slot->blocks;
  using Size = std::integral_constant<std::size_t, sizeof(T)>;
  constexpr std::int64_t kGrain = 1 << 14;
  parallelFor(
      0, std::ssize(positions),
      [&](std::int64_t begin, std::int64_t end) {
        Field const own(*this); // for what each thread remembers
        auto const first = static_cast<std::size_t>(begin), count = static_cast<std::size_t>(end - begin);
        ManyReads<FieldBlock, Size> reads({sizeof(T), 4, 0}, Size());
        reads.read(
            positions.subspan(first, count), [&](int3 const& p) { blocks.prefetch(p); },
            [&](int3 const& p) -> FieldBlock const* { return blocks.find(p.x, p.y, p.z); },
            values.data() + first, [&](std::size_t n) { values[first + n] = own.get(positions[first + n]); });
      },
      {.grain = kGrain});
}

template <class T> void Field<T>::fill(T const& value) {
  T const copy = value;
  auto& channel = editChannel();
  for (T& element : channel) element = copy;
}

template <class T> void const* Field<T>::sampler() const {
  if constexpr (std::is_same_v<T, float>) {
    m_volume->syncTree();
    auto const epoch = m_volume->epoch.load(std::memory_order_relaxed);
    if (m_slot->written.load(std::memory_order_acquire)) {
      std::lock_guard const lock(m_volume->mutex);
      if (m_slot->written.load(std::memory_order_relaxed)) {
        m_slot->values.fetch_add(1, std::memory_order_release);
        m_slot->written.store(false, std::memory_order_release);
      }
    }
    auto const values = m_slot->values.load(std::memory_order_acquire);
    if (!m_sampler || m_sampler->epoch != epoch || m_sampler->version != m_volume->version ||
        m_sampler->values != values) {
      m_volume->sync();
      m_sampler.reset(new Sampler{{*m_volume->tree, *m_volume->topology, channel()},
                                  m_volume->epoch.load(std::memory_order_relaxed),
                                  m_volume->version,
                                  values});
    }
    return &m_sampler->linear;
  } else {
    return nullptr;
  }
}

template <class T>
float Field<T>::sample(float3 const& position, SamplerSpace space) const requires SampledElement<T> {
  return static_cast<FloatVoxelSamplerLinear<Internal::VolumeShape> const*>(sampler())->sample(position,
                                                                                               space);
}

template <class T>
void Field<T>::sample(std::span<float3 const> positions, std::span<float> values,
                      SamplerSpace space) const requires SampledElement<T> {
  Internal::checkCounts(m_slot->name, positions.size(), values.size());
  static_cast<FloatVoxelSamplerLinear<Internal::VolumeShape> const*>(sampler())->sample(
      positions.data(), values.data(), static_cast<std::int64_t>(positions.size()),
      Internal::VolumeShape::kMaxDepth, space);
}

template <class T>
float3 Field<T>::gradient(float3 const& position, SamplerSpace space) const requires SampledElement<T> {
  float3 out;
  static_cast<FloatVoxelSamplerLinear<Internal::VolumeShape> const*>(sampler())->sampleGradient(position,
                                                                                                space, &out);
  return out;
}

template <class T> auto Field<T>::channel() const -> ChannelType const& {
  m_volume->sync(*m_slot);
  return Internal::typed<T>(*m_slot).typed();
}

template <class T> auto Field<T>::editChannel() -> ChannelType& {
  m_volume->sync();
  m_volume->prepareWrite(*m_slot);
  m_volume->valuesChanged(*m_slot);
  return Internal::typed<T>(*m_slot).typed();
}

template <class T> auto Field<T>::halos() const -> Channel<Internal::VolumeShape, T, 4, 1> const& {
  m_volume->sync();
  auto const found =
      m_volume->rest.template component<Channel<Internal::VolumeShape, T, 4, 1>>(m_slot->name + "_halo");
  if (!found) throw std::logic_error("field \"" + m_slot->name + "\": fill its halos first");
  return *found;
}

template <class T> void Field<T>::forEachTileRange(RangeBody body) {
  editChannel();
  std::as_const(*this).forEachTileRange(body);
}

template <class T> void Field<T>::forEachTileRange(RangeBody body) const {
  m_volume->sync();
  parallelFor(0, std::as_const(*m_volume->tree).tileCount(Internal::kFinest), body, {.grain = 64});
}

template <class T> TileBlock<T> Field<T>::tileBlock(std::int64_t n) const {
  auto const& tile = std::as_const(*m_volume->tree).tile(n, Internal::kFinest);
  auto const& elements = Internal::typed<T>(*m_slot).tile({n, Internal::kFinest});
  bool const whole = tile.valid() && elements.size() >= Internal::kTileElements;
  return {tile.tijk(), whole ? const_cast<T*>(elements.data()) : nullptr};
}

template <class T> void Field<T>::gather(std::int64_t n, Stencil<T>& out) const {
  using namespace Internal;
  int3 const at = std::as_const(*m_volume->tree).tile(n, kFinest).tijk();
  out.corner = at;
  auto const& blocks = m_slot->blocks;
  for (int dk = -1; dk <= 1; ++dk)
    for (int dj = -1; dj <= 1; ++dj)
      for (int di = -1; di <= 1; ++di) {
        int const x = at.x + 4 * di, y = at.y + 4 * dj, z = at.z + 4 * dk;
        auto const first = [](int d) { return d < 0 ? 3 : 0; };
        auto const width = [](int d) { return d ? 1 : 4; };
        auto const to = [](int d) { return d < 0 ? -1 : d == 0 ? 0 : 4; };
        auto const* const from = static_cast<T const*>(blocks.tile(x, y, z));
        for (int k = 0; k < width(dk); ++k)
          for (int j = 0; j < width(dj); ++j) {
            T* const row = out.values + Stencil<T>::index(to(di), to(dj) + j, to(dk) + k);
            int const fj = first(dj) + j, fk = first(dk) + k;
            for (int i = 0; i < width(di); ++i)
              row[i] =
                  from ? from[first(di) + i + 4 * (fj + 4 * fk)] : coarse(x + first(di) + i, y + fj, z + fk);
          }
      }
}

template <class T>
Field<T> Volume::addField(std::string const& name, std::type_identity_t<T> const& background) {
  using namespace Internal;
  checkNewName(name);
  m_data->sync();
  Ostil::Ptr<Channel<VolumeShape, T, 4, 0>> channel = Command::createChannel<T, 2, 4, 4, 0, 0>(
      name, *m_data->topology, background, kInitializeDefaultValue, 0, kFinest);
  return Field<T>(*m_data, addSlot(std::make_unique<TypedSlot<T>>(std::move(channel))));
}

template <class T> Field<T> Volume::field(std::string const& name) const {
  auto& slot = findSlot(name);
  if (!dynamic_cast<Internal::TypedSlot<T>*>(&slot))
    throw std::invalid_argument("field \"" + name + "\" holds " + slot.typeName() + ", not " +
                                kElementType<T>.name);
  return Field<T>(*m_data, slot);
}

template <class T> bool Volume::hasField(std::string const& name) const {
  return dynamic_cast<Internal::TypedSlot<T>*>(m_data->find(name)) != nullptr;
}

} // namespace VLN::TileTree3D
