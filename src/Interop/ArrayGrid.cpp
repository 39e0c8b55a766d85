#include "Interop/ArrayGridImpl.h"

#include <algorithm>
#include <cmath>
#include <cstring>
#include <limits>
#include <optional>

namespace VLN::Interop {

namespace {

template <class T> T load(std::byte const* from, bool bigEndian) {
  std::byte bytes[sizeof(T)];
  std::memcpy(bytes, from, sizeof(T));
  if (bigEndian) std::reverse(bytes, bytes + sizeof(T));
  T value;
  std::memcpy(&value, bytes, sizeof value);
  return value;
}

float fromHalf(std::uint16_t bits) {
  int const exponent = bits >> 10 & 31, fraction = bits & 1023;
  float const size = exponent == 31  ? (fraction ? std::numeric_limits<float>::quiet_NaN()
                                                 : std::numeric_limits<float>::infinity())
                     : exponent == 0 ? std::ldexp(float(fraction), -24)
                                     : std::ldexp(float(fraction + 1024), exponent - 25);
  return bits >> 15 ? -size : size;
}

template <class T> T numberAt(std::byte const* from, NumberType const& type) {
  if constexpr (std::is_same_v<T, bool>)
    return *from != std::byte{0};
  else if constexpr (std::is_floating_point_v<T>)
    return static_cast<T>(realOf(from, type));
  else
    return static_cast<T>(wholeOf(from, type));
}

template <class Value> struct ScalarOfValue { using type = Value; };
template <class T> struct ScalarOfValue<openvdb::math::Vec3<T>> { using type = T; };

template <class GridT> class TypedArrayGrid final : public ArrayGrid {
  using Value = typename GridT::ValueType;
  using Scalar = typename ScalarOfValue<Value>::type;

public:
  TypedArrayGrid()
      : m_grid(GridT::create()) {}

  openvdb::GridBase::Ptr grid() const override { return m_grid; }
  void setBackground(std::byte const* value, NumberType const& type) override {
    m_grid = GridT::create(valueOf(value, type.bytes, type));
    m_accessor.emplace(m_grid->getAccessor());
  }
  void setBox(std::byte const* values, NumberType const& type, ArrayLayout const& layout,
              openvdb::Coord const& low) override {
    Value const background = m_grid->background();
    auto& to = accessor();
    openvdb::Coord at;
    for (std::int64_t z = 0; z < layout.count[2]; ++z)
      for (std::int64_t y = 0; y < layout.count[1]; ++y) {
        std::byte const* from = values + z * layout.stride[2] + y * layout.stride[1];
        at[1] = low[1] + int(y), at[2] = low[2] + int(z);
        for (std::int64_t x = 0; x < layout.count[0]; ++x, from += layout.stride[0]) {
          Value const value = valueOf(from, layout.componentStride, type);
          // Bit for bit: what is no number equals nothing, itself neither.
          if (std::memcmp(&value, &background, sizeof value) == 0 || value == background) continue;
          at[0] = low[0] + int(x);
          to.setValueOn(at, value);
        }
      }
  }
  void setVoxel(openvdb::Coord const& at, std::byte const* value, NumberType const& type,
                std::int64_t componentStride) override {
    accessor().setValueOn(at, valueOf(value, componentStride, type));
  }

private:
  static Value valueOf(std::byte const* from, std::int64_t componentStride, NumberType const& type) {
    if constexpr (std::is_same_v<Value, Scalar>) {
      return numberAt<Scalar>(from, type);
    } else {
      Value value;
      for (int c = 0; c < 3; ++c) value[c] = numberAt<Scalar>(from + c * componentStride, type);
      return value;
    }
  }
  typename GridT::Accessor& accessor() {
    if (!m_accessor) m_accessor.emplace(m_grid->getAccessor());
    return *m_accessor;
  }

  typename GridT::Ptr m_grid;
  std::optional<typename GridT::Accessor> m_accessor;
};

template <class GridT> std::unique_ptr<ArrayGrid> make() { return std::make_unique<TypedArrayGrid<GridT>>(); }

} // namespace

double realOf(std::byte const* from, NumberType const& type) {
  if (type.kind != 'f') return double(wholeOf(from, type));
  if (type.bytes == 2) return double(fromHalf(load<std::uint16_t>(from, type.bigEndian)));
  return type.bytes == 4 ? double(load<float>(from, type.bigEndian)) : load<double>(from, type.bigEndian);
}

std::int64_t wholeOf(std::byte const* from, NumberType const& type) {
  bool const plain = type.kind != 'i', big = type.bigEndian;
  switch (type.bytes) {
  case 1:
    return plain ? std::int64_t(load<std::uint8_t>(from, big)) : load<std::int8_t>(from, big);
  case 2:
    return plain ? std::int64_t(load<std::uint16_t>(from, big)) : load<std::int16_t>(from, big);
  case 4:
    return plain ? std::int64_t(load<std::uint32_t>(from, big)) : load<std::int32_t>(from, big);
  default: {
    auto const value = load<std::uint64_t>(from, big);
    if (plain && value > std::uint64_t(std::numeric_limits<std::int64_t>::max()))
      throw UnreadableArrays("holds a number of 64 bits that volumes have no room for");
    return static_cast<std::int64_t>(value);
  }
  }
}

std::unique_ptr<ArrayGrid> ArrayGrid::of(NumberType const& type, int components) {
  if (components != 1 && components != 3) return nullptr;
  bool const vector = components == 3;
  if (type.kind == 'b') return vector || type.bytes != 1 ? nullptr : make<openvdb::BoolGrid>();
  if (type.kind == 'f') {
    if (type.bytes == 2 || type.bytes == 4)
      return vector ? make<openvdb::Vec3SGrid>() : make<openvdb::FloatGrid>();
    if (type.bytes == 8) return vector ? make<openvdb::Vec3DGrid>() : make<openvdb::DoubleGrid>();
    return nullptr;
  }
  if (type.kind != 'i' && type.kind != 'u') return nullptr;
  int const wanted = type.kind == 'u' ? 2 * type.bytes : type.bytes;
  if (wanted <= 4) return vector ? make<openvdb::Vec3IGrid>() : make<openvdb::Int32Grid>();
  return vector || type.bytes > 8 ? nullptr : make<openvdb::Int64Grid>();
}

openvdb::math::Transform::Ptr transformOfRows(double const (&rows)[3][4]) {
  openvdb::math::Mat4d matrix = openvdb::math::Mat4d::identity(); // for row vectors
  for (int row = 0; row < 3; ++row)
    for (int column = 0; column < 4; ++column) {
      if (!std::isfinite(rows[row][column]))
        throw UnreadableArrays("has a transform that is no matrix of numbers");
      matrix(column, row) = rows[row][column];
    }
  try {
    return openvdb::math::Transform::createLinearTransform(matrix);
  } catch (openvdb::Exception const&) {
    throw UnreadableArrays("has a transform that cannot be turned round");
  }
}

} // namespace VLN::Interop
