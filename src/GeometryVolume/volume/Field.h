// Field<T>: one named field of a volume, to read and to write by position.
//
//   Field<float> density = volume.addField<float>("density", 0);
//   density.set(1, 2, 3, 0.5f);                    makes the tile that holds the position
//   float const there = density.get(1, 2, 3);
//
// A Field is a handle: it refers to its volume, follows it when it is moved, and ends with it or with
// removeField(). Copies of a handle name the same field.
#pragma once

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/sampling/VoxelSampler.h"
#include "GeometryVolume/volume/detail/VolumeData.h"

#include <memory>
#include <span>
#include <string>

namespace VLN::TileTree3D {

/// What is blended between elements: see sample().
template <class T>
concept SampledElement = std::is_same_v<T, float>;

/// Elements of a tile of the deepest depth with one layer of what lies round it.
///
///   -1 | 0 1 2 3 | 4        value(i, j, k), each of i, j and k in -1..4
template <class T> struct Stencil {
  static constexpr int kWidth = 6;
  int3 corner; ///< of the tile, in tile space
  T values[kWidth * kWidth * kWidth];

  T const& value(int i, int j, int k) const { return values[index(i, j, k)]; }
  static constexpr int index(int i, int j, int k) { return i + 1 + kWidth * (j + 1 + kWidth * (k + 1)); }
};

/// The 64 elements of a tile of the deepest depth.
template <class T> struct TileBlock {
  int3 corner;
  T* values;

  T& operator()(int i, int j, int k) const { return values[i + 4 * (j + 4 * k)]; }
  int3 position(int i, int j, int k) const { return {corner.x + i, corner.y + j, corner.z + k}; }
};

/// Elements are the samples of the deepest depth: one for each position of tile space. Coarser tiles stand in
/// where there is no such tile.
/// @threads Reads may run at once, each thread with a handle of its own. Writes, and everything that is not
/// const here or in Volume, need the volume for themselves; forEachTile() and the bulk set() and get()
/// are parallel inside.
template <class T> class VLN_API Field {
public:
  using value_type = T;
  using ChannelType = Channel<Internal::VolumeShape, T, 4, 0>;

  /// Refers to nothing: only to be assigned to.
  Field() = default;
  Field(Field const& other);
  Field(Field&& other) noexcept;
  Field& operator=(Field const& other);
  Field& operator=(Field&& other) noexcept;
  ~Field();

  std::string const& name() const { return m_slot->name; }
  /// What is read where nothing has been written.
  T const& background() const;

  // One element
  /// @space Tile space.
  /// @edges Where there is no tile of the deepest depth, the sample of the deepest tile there; without any
  /// tile, and out of the domain, the background.
  /// @cost Near the last position one test; else one look into a hash table. Without a tile of the deepest
  /// depth a search in the tree.
  T get(int i, int j, int k) const {
    if (!near(i, j, k, m_readEpoch)) [[unlikely]]
      moveToRead(i, j, k);
    auto const at = Internal::FieldBlock::place(i, j, k);
    auto const* const tile = static_cast<T const*>(m_block->tile(at));
    if (!tile) [[unlikely]]
      return coarse(i, j, k);
    return tile[at.element()];
  }
  T get(int3 const& p) const { return get(p.x, p.y, p.z); }
  /// Makes the tile of the deepest depth that holds the position, where there is none: its other elements,
  /// and those of all other fields, keep the values that were read there before.
  /// @error std::out_of_range beyond the domain.
  /// @cost As get(). A tile made costs its elements; tree and channels take all new tiles in at once, when
  /// something other than set() next asks for them.
  void set(int i, int j, int k, T const& value) {
    if (!near(i, j, k, m_writeEpoch)) [[unlikely]]
      moveToWrite(i, j, k);
    auto const at = Internal::FieldBlock::place(i, j, k);
    auto* tile = static_cast<T*>(m_block->tile(at));
    if (!tile) [[unlikely]]
      tile = make(i, j, k);
    tile[at.element()] = value;
    m_volume->valuesChanged(*m_slot);
  }
  void set(int3 const& p, T const& value) { set(p.x, p.y, p.z, value); }

  // Many elements
  /// As set() for each position in turn: of equal positions the last counts. In parallel.
  /// @cost Meanwhile up to some 20 bytes of memory for each position.
  /// @error std::invalid_argument for spans of different lengths, std::out_of_range beyond the domain; no
  /// value has changed then.
  /// @numeric The same volume for any number of threads.
  void set(std::span<int3 const> positions, std::span<T const> values);
  /// values[n] = get(positions[n]), in parallel. @shape As many values as positions.
  /// @cost On one thread, at random places in a volume beyond the processor's caches, about a third of as
  /// many single calls: what they read is fetched side by side. Else about the same.
  /// @error std::invalid_argument where there are not as many values as positions.
  void get(std::span<int3 const> positions, std::span<T> values) const;
  /// Every element of every tile, coarse ones too. Makes no tiles.
  void fill(T const& value);

  // Blended
  /// @edges The background where there is no tile, and for positions that are no numbers.
  /// @cost A sampler is made when the field has changed since the last call: write first, then sample. See
  /// VoxelSamplerLinear for the rest.
  float sample(float3 const& position,
               SamplerSpace space = kSamplerWorldSpace) const requires SampledElement<T>;
  /// Many positions: values[n] = sample(positions[n], space). @shape As many values as positions.
  /// @cost At random places half of as many single calls, or less.
  /// @error std::invalid_argument where there are not as many values as positions.
  void sample(std::span<float3 const> positions, std::span<float> values,
              SamplerSpace space = kSamplerWorldSpace) const requires SampledElement<T>;
  /// In world space, whatever the position is given in.
  float3 gradient(float3 const& position,
                  SamplerSpace space = kSamplerWorldSpace) const requires SampledElement<T>;

  // The parts
  /// The channel, in step with the tree.
  ChannelType const& channel() const;
  /// The same, the volume's alone, to write elements. It may not be resized. Ask again after sample(): writes
  /// through an old reference are not noticed.
  ChannelType& editChannel();
  /// The channel with one layer of halo that Volume::fillHalos() filled last.
  /// @error std::logic_error before it has.
  Channel<Internal::VolumeShape, T, 4, 1> const& halos() const;

  // For the loops below
  /// Calls `body` for ranges of tiles of the deepest depth, in parallel, with `tile(n)` their elements.
  void forEachTileRange(RangeBody body);
  void forEachTileRange(RangeBody body) const;
  TileBlock<T> tileBlock(std::int64_t n) const;
  void gather(std::int64_t n, Stencil<T>& out) const;
  Internal::VolumeData const* volumeData() const { return m_volume; }

private:
  friend class Volume;
  Field(Internal::VolumeData& volume, Internal::FieldSlot& slot)
      : m_volume(&volume)
      , m_slot(&slot) {}

  bool near(int i, int j, int k, std::uint64_t epoch) const {
    return static_cast<std::uint32_t>((i ^ m_at.x) | (j ^ m_at.y) | (k ^ m_at.z)) <
               std::uint32_t(Internal::FieldBlock::kWidth) &&
           epoch == m_volume->epoch.load(std::memory_order_relaxed);
  }
  // Remember the block of a position.
  void moveToRead(int i, int j, int k) const;
  void moveToWrite(int i, int j, int k);
  [[gnu::always_inline]] void findBlock(int i, int j, int k) const;
  [[gnu::noinline]] T* make(int i, int j, int k);
  [[gnu::cold]] T coarse(int i, int j, int k) const;
  void const* sampler() const;

  Internal::VolumeData* m_volume = nullptr;
  Internal::FieldSlot* m_slot = nullptr;
  mutable Internal::FieldBlock* m_block = nullptr;
  mutable int3 m_at{0, 0, 0}; ///< low corner of the block
  mutable std::uint64_t m_readEpoch = 0, m_writeEpoch = 0;
  struct Sampler;
  mutable std::unique_ptr<Sampler> m_sampler;
};

} // namespace VLN::TileTree3D
