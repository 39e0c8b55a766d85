#include "Interop/ChannelValues.h"

#include "GeometryVolume/channels/ChannelReader.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Numeric.h"
#include "Interop/ElementScalar.h"

#include <charconv>
#include <cmath>

namespace VLN::Interop {

namespace {

using Velorn::Math::double3;
using Velorn::Math::int3;
using VdbTraits = TileTree3D::PowerOfTwoTraits;

template <class T> class TypedValues final : public ChannelValues {
  using ChannelT = TileTree3D::Channel<VdbTraits, T, 4, 0>;
  using Scalar = typename ScalarOf<T>::type;

public:
  static constexpr int kComponents = kComponentsOf<T>;
  static_assert(kComponents <= kMostComponents);

  TypedValues(TileTree3D::Container<VdbTraits> const& tree, ChannelT const& channel)
      : m_reader(tree, channel) {}

  std::unique_ptr<ChannelValues> clone() const override { return std::make_unique<TypedValues>(*this); }
  int components() const override { return kComponents; }
  bool whole() const override { return std::is_integral_v<Scalar>; }
  bool wide() const override { return std::is_same_v<Scalar, double>; }
  void at(int3 const& voxel, double* values) const override {
    T const& value = m_reader.value(voxel);
    for (int c = 0; c < kComponents; ++c) values[c] = static_cast<double>(componentOf(value, c));
  }
  std::string text(int3 const& voxel) const override {
    T const& value = m_reader.value(voxel);
    std::string result;
    for (int c = 0; c < kComponents; ++c) {
      char digits[32];
      auto const end = std::to_chars(digits, digits + sizeof digits, +componentOf(value, c)).ptr;
      result.append(c > 0 ? "," : "").append(digits, end);
    }
    return result;
  }

private:
  TileTree3D::ChannelReader<ChannelT> m_reader;
};

template <class T>
void tryType(VdbVolume const& volume, std::string const& channel, std::unique_ptr<ChannelValues>& result) {
  if (result) return;
  auto const tree = volume.object->component<TileTree3D::Container<VdbTraits>>(kVdbContainerName);
  auto const typed = volume.object->component<TileTree3D::Channel<VdbTraits, T, 4, 0>>(channel);
  if (tree && typed) result = std::make_unique<TypedValues<T>>(*tree, *typed);
}

} // namespace

double lengthOf(double const* v, int count) {
  double const first = std::hypot(v[0], count > 1 ? v[1] : 0, count > 2 ? v[2] : 0);
  return count > 3 ? std::hypot(first, v[3]) : first;
}

ChannelValues::~ChannelValues() = default;

std::unique_ptr<ChannelValues> ChannelValues::of(VdbVolume const& volume, std::string const& channel) {
  std::unique_ptr<ChannelValues> result;
#define VLN_TRY_TYPE(type_, name_) tryType<type_>(volume, channel, result);
  VLN_FOR_EACH_FILE_ELEMENT_TYPE(VLN_TRY_TYPE)
#undef VLN_TRY_TYPE
  return result;
}

int3 ChannelValues::nearest(double3 const& position) {
  return {toIntFloor(position.x + 0.5), toIntFloor(position.y + 0.5), toIntFloor(position.z + 0.5)};
}

void ChannelValues::linear(double3 const& position, double* values) const {
  int3 low{};
  double3 weight{};
  bool inside = true;
  for (int a = 0; a < 3; ++a) {
    low[a] = toIntFloor(position[a]);
    weight[a] = position[a] - low[a];
    inside = inside && low[a] > VdbTraits::kMinTileCoord && low[a] < VdbTraits::kMaxTileCoord;
  }
  if (whole() || !inside) return at(nearest(position), values);
  int const count = components();
  double corner[kMostComponents];
  for (int c = 0; c < count; ++c) values[c] = 0;
  for (int n = 0; n < 8; ++n) {
    double share = 1;
    int3 voxel{};
    for (int a = 0; a < 3; ++a) {
      bool const high = n >> a & 1;
      voxel[a] = low[a] + high;
      share *= high ? weight[a] : 1 - weight[a];
    }
    if (share == 0) continue; // so that what is no number beyond a voxel does not reach it
    at(voxel, corner);
    for (int c = 0; c < count; ++c) values[c] += share * corner[c];
  }
}

} // namespace VLN::Interop
