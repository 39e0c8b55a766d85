// ConstTileData, TileData, DynamicTileData: handles on the elements of one tile.
//
// A tile holds a core of E x E x E elements, wrapped by a halo of H layers that repeats values of the
// neighbours. Elements lie in one flat array, i fastest; coordinates count from the first core element:
//
//      -H ... -1 | 0 ... E-1 | E ... E+H-1          W = E + 2H
//        halo        core         halo
//
//      flat index of (i,j,k) = i + (j + k*W)*W + H*(1 + W + W*W)
//
// A handle made from a vector is a view: it owns nothing and copies as a view. A handle made from a size owns
// its vector and copies it.
#pragma once

#include "GeometryVolume/channels/detail/TileVectorOps.h"
#include "GeometryVolume/core/Export.h"
#include "GeometryVolume/pools/TileDataAllocator.h"
#include "Velorn/Math.h"

#include <cstdint>
#include <utility>

namespace VLN::TileTree3D {

using Velorn::Math::int3;

/// Read-only handle. Nothing checks coordinates, ranges, or a missing vector.
/// @threads Reading is free; different tiles may be written at the same time, one tile only by one thread.
template <class T, int E, int H> class VLN_API ConstTileData {
public:
  using value_type = T;
  using Vector = TileVector<T>;
  using const_iterator = typename Vector::const_iterator;

  static constexpr int kCore = E;
  static constexpr int kCoreSize = E * E * E;
  static constexpr int kHalo = H;
  static constexpr int kWidth = E + 2 * H;
  static constexpr int kSize = kWidth * kWidth * kWidth;
  /// Flat step of one coordinate.
  static constexpr int kStrideI = 1, kStrideJ = kWidth, kStrideK = kWidth * kWidth;
  /// Steps of a walk over the core on one flat counter: to the next element, and what to add after a row and
  /// after a slice.
  static constexpr int kIncI = 1, kIncJ = kWidth - kCore, kIncK = kWidth * (kWidth - kCore);
  static constexpr int kMinCoord = -H, kMaxCoord = E + H - 1;
  /// Flat offsets from the low corner of a cell to its other seven corners.
  static constexpr int kNBI = 1, kNBJ = kWidth, kNBK = kWidth * kWidth;
  static constexpr int kNBIJ = kNBI + kNBJ, kNBIK = kNBI + kNBK, kNBJK = kNBJ + kNBK,
                       kNBIJK = kNBI + kNBJ + kNBK;

  ConstTileData() = default;
  ConstTileData(Vector const* vector)
      : m_data(const_cast<Vector*>(vector)) {}
  /// Owns `size` zero elements. The size need not be kSize.
  explicit ConstTileData(int size)
      : ConstTileData(size, T{}) {}
  ConstTileData(int size, T const& value)
      : m_data(new Vector(static_cast<std::size_t>(size), value))
      , m_owner(true) {}
  /// An owner's copy owns a copy of the elements, on the default allocator; a view's copy is a view.
  ConstTileData(ConstTileData const& b) { copyFrom(b); }
  ConstTileData(ConstTileData&& b) noexcept
      : m_data(b.m_data)
      , m_owner(std::exchange(b.m_owner, false)) {}
  ConstTileData& operator=(ConstTileData const& b) {
    if (this == &b) return *this;
    release();
    copyFrom(b);
    return *this;
  }
  ConstTileData& operator=(ConstTileData&& b) noexcept {
    if (this == &b) return *this;
    release();
    m_data = b.m_data;
    m_owner = std::exchange(b.m_owner, false);
    return *this;
  }
  virtual ~ConstTileData() { release(); }

  static constexpr int index(int i, int j, int k) { return i + (j + k * kWidth) * kWidth + H * kNBIJK; }
  static constexpr int index(int3 const& p) { return index(p.x, p.y, p.z); }

  T const& operator()(int i, int j, int k) const { return at(index(i, j, k)); }
  T const& operator()(int3 const& p) const { return at(index(p)); }
  T const& operator[](int3 const& p) const { return at(index(p)); }
  T const& operator()(int flat) const { return at(flat); }
  T const& operator[](int flat) const { return at(flat); }

  int size() const { return static_cast<int>(m_data->size()); }
  bool empty() const { return m_data->empty(); }
  explicit operator bool() const { return m_data != nullptr; }
  const_iterator begin() const { return m_data->cbegin(); }
  const_iterator end() const { return m_data->cend(); }
  const_iterator cbegin() const { return m_data->cbegin(); }
  const_iterator cend() const { return m_data->cend(); }
  Vector const* data() const { return m_data; }
  /// Bytes of capacity and of the vector record.
  std::uint64_t memUsage() const { return m_data->capacity() * sizeof(T) + sizeof(Vector); }

protected:
  T& at(int flat) const { return (*m_data)[flat]; }
  void release() {
    if (m_owner) delete m_data;
    m_owner = false;
  }
  /// Becomes the owner of a new vector.
  void own(Vector* vector) {
    m_data = vector;
    m_owner = true;
  }
  Vector* vector() const { return m_data; }

private:
  void copyFrom(ConstTileData const& b) {
    m_owner = b.m_owner;
    m_data = b.m_owner && b.m_data ? new Vector(*b.m_data) : b.m_data;
  }

  Vector* m_data = nullptr;
  bool m_owner = false;
};

/// Writable handle.
template <class T, int E, int H> class VLN_API TileData : public ConstTileData<T, E, H> {
  using Base = ConstTileData<T, E, H>;

public:
  using typename Base::Vector;
  using iterator = typename Vector::iterator;

  TileData() = default;
  TileData(Vector* vector)
      : Base(vector) {}
  explicit TileData(int size)
      : Base(size) {}
  TileData(int size, T const& value)
      : Base(size, value) {}
  TileData(TileData const&) = default;
  TileData(TileData&&) noexcept = default;
  TileData& operator=(TileData const&) = default;
  TileData& operator=(TileData&&) noexcept = default;
  ~TileData() override = default;

  using Base::index;
  using Base::operator();
  using Base::operator[];
  using Base::begin;
  using Base::data;
  using Base::end;
  T& operator()(int i, int j, int k) { return this->at(index(i, j, k)); }
  T& operator()(int3 const& p) { return this->at(index(p)); }
  T& operator[](int3 const& p) { return this->at(index(p)); }
  T& operator()(int flat) { return this->at(flat); }
  T& operator[](int flat) { return this->at(flat); }
  iterator begin() { return this->vector()->begin(); }
  iterator end() { return this->vector()->end(); }
  Vector* data() { return this->vector(); }

  /// Every element, halo included. The value may lie inside the tile.
  void set(T const& value) { fillRun(elements(), this->size(), value); }
  /// Copies size() elements.
  /// @pre `src` holds as many.
  void set(ConstTileData<T, E, H> const& src) {
    if (src.data() != this->vector()) copyRun(src.data()->data(), this->size(), elements());
  }
  /// Takes over the elements of `src` and the state of its allocator; the tile behind `src` is then empty.
  void set(TileData&& src) {
    if (src.vector() != this->vector()) *this->vector() = std::move(*src.vector());
  }
  void setCore(T const& value) { setRange(0, E, 0, E, 0, E, value); }
  /// Every element outside the core.
  void setHalo(T const& value) {
    T const v = value;
    forEachHaloRun([&](int from, int count) { fillRun(elements() + from, count, v); });
  }
  /// Copies every element outside the core.
  void setHalo(ConstTileData<T, E, H> const& src) {
    if (src.data() == this->vector()) return;
    T const* const from = src.data()->data();
    forEachHaloRun([&](int at, int count) { copyRun(from + at, count, elements() + at); });
  }
  /// The corners and edges of the outermost shell: the elements with two coordinates or more at an end.
  void setHaloEdges(T const& value) {
    if constexpr (H > 0) {
      T const v = value;
      constexpr int low = Base::kMinCoord, high = Base::kMaxCoord;
      for (int k : {low, high}) {
        for (int j : {low, high}) setIRange(low, high + 1, j, k, v);
        for (int i : {low, high}) setJRange(i, low + 1, high, k, v);
      }
      for (int j : {low, high})
        for (int i : {low, high}) setKRange(i, j, low + 1, high, v);
    }
  }
  // Ranges are half-open, in core coordinates, and may name the halo. An empty range writes nothing.
  void setRange(int i0, int i1, int j0, int j1, int k0, int k1, T const& value) {
    T const v = value;
    for (int k = k0; k < k1; ++k)
      for (int j = j0; j < j1; ++j) fillRun(elements() + index(i0, j, k), i1 - i0, v);
  }
  void setIJRange(int i0, int i1, int j0, int j1, int k, T const& value) {
    setRange(i0, i1, j0, j1, k, k + 1, value);
  }
  void setIKRange(int i0, int i1, int j, int k0, int k1, T const& value) {
    setRange(i0, i1, j, j + 1, k0, k1, value);
  }
  void setJKRange(int i, int j0, int j1, int k0, int k1, T const& value) {
    setRange(i, i + 1, j0, j1, k0, k1, value);
  }
  void setIRange(int i0, int i1, int j, int k, T const& value) {
    fillRun(elements() + index(i0, j, k), i1 - i0, value);
  }
  void setJRange(int i, int j0, int j1, int k, T const& value) {
    T const v = value;
    for (int j = j0; j < j1; ++j) this->at(index(i, j, k)) = v;
  }
  void setKRange(int i, int j, int k0, int k1, T const& value) {
    T const v = value;
    for (int k = k0; k < k1; ++k) this->at(index(i, j, k)) = v;
  }
  /// Copies a box to the box at (di0, dj0, dk0), element by element with rising k, j, i. Each axis stops at
  /// whichever end comes first. An overlapping copy sees its own earlier writes.
  void copyRange(int i0, int i1, int j0, int j1, int k0, int k1, int di0, int di1, int dj0, int dj1, int dk0,
                 int dk1) {
    auto const shorter = [](int a, int b) { return a < b ? a : b; };
    int const ni = shorter(i1 - i0, di1 - di0);
    int const nj = shorter(j1 - j0, dj1 - dj0);
    int const nk = shorter(k1 - k0, dk1 - dk0);
    T* const p = elements();
    for (int k = 0; k < nk; ++k)
      for (int j = 0; j < nj; ++j) {
        T const* const from = p + index(i0, j0 + j, k0 + k);
        T* const to = p + index(di0, dj0 + j, dk0 + k);
        for (int i = 0; i < ni; ++i) to[i] = from[i];
      }
  }

protected:
  /// Drops the tail, or appends zeros.
  void resize(int n) { Internal::resizeVector(*this->vector(), n, T{}); }

private:
  T* elements() { return this->vector()->data(); }

  static void copyRun(T const* from, int n, T* to) {
    for (int i = 0; i < n; ++i) to[i] = from[i];
  }
  static void fillRun(T* p, int n, T const& value) { Internal::fillRun(p, n, value); }

  /// Calls body(first, count) for the runs of elements outside the core, in rising order.
  template <class Body> static void forEachHaloRun(Body const& body) {
    if constexpr (H > 0) {
      // Between two core rows of a slice the halo is one run: the end of a row and the start of the next.
      int done = 0;
      for (int k = 0; k < E; ++k)
        for (int j = 0; j < E; ++j) {
          int const row = index(0, j, k);
          body(done, row - done);
          done = row + E;
        }
      body(done, Base::kSize - done);
    }
  }
};

/// Writable handle whose element count can change. A handle on a channel's tile changes the tile itself.
template <class TD> class VLN_API DynamicTileData : public TD {
public:
  using T = typename TD::value_type;
  using typename TD::Vector;

  DynamicTileData() = default;
  DynamicTileData(Vector* vector)
      : TD(vector) {}
  explicit DynamicTileData(int size)
      : TD(size) {}
  DynamicTileData(int size, T const& value)
      : TD(size, value) {}
  DynamicTileData(DynamicTileData const&) = default;
  DynamicTileData(DynamicTileData&&) noexcept = default;
  DynamicTileData& operator=(DynamicTileData const&) = default;
  DynamicTileData& operator=(DynamicTileData&&) noexcept = default;
  ~DynamicTileData() override = default;

  /// Appends; the value may lie inside the tile.
  /// @error std::length_error when the tile has reached the limit of its static storage.
  void push(T const& value) {
    T const v = value;
    Internal::growForPush(*this->vector());
    this->vector()->push_back(v);
  }
  void push(T&& value) { push(static_cast<T const&>(value)); }
  /// @pre The tile is not empty.
  void pop() { this->vector()->pop_back(); }
  T& back() { return this->vector()->back(); }
  T const& back() const { return this->vector()->back(); }
  /// Drops all elements and the capacity. The tile is no longer static.
  void clear() {
    Vector fresh;
    this->vector()->swap(fresh);
  }
  void reserve(int n) {
    auto const wanted = static_cast<std::size_t>(n);
    if (n > 0 && wanted > this->vector()->capacity()) Internal::reserveVector(*this->vector(), wanted);
  }
  /// Drops the tail, or appends copies of `value`. A handle without a vector makes one and owns it.
  /// @error std::length_error beyond the limit of static storage.
  void resize(int n, T const& value) {
    auto const count = static_cast<std::size_t>(n);
    if (this->vector())
      Internal::resizeVector(*this->vector(), count, value);
    else
      this->own(new Vector(count, value));
  }
  /// Trims the capacity to the size when it exceeds the size by more than the slack: 0 trims all, 1 trims
  /// what is more than twice the size.
  /// @numeric The threshold (slack + 1) * size is formed in float and truncated.
  void repack(float slack) {
    Vector& v = *this->vector();
    auto const kept = static_cast<std::uint64_t>((slack + 1.0f) * static_cast<float>(v.size()));
    if (kept < v.capacity()) Internal::trimVector(v);
  }
};

} // namespace VLN::TileTree3D
