#include "Interop/Slice.h"

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/channels/NonLeafValues.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Numeric.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/sampling/VoxelSamplerLinear.h"
#include "GeometryVolume/tiletree/Container.h"
#include "Interop/ChannelValues.h"
#include "Interop/ColorMap.h"
#include "Interop/ElementScalar.h"
#include "Interop/VdbDetails.h"

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <functional>
#include <memory>
#include <stdexcept>
#include <vector>

namespace VLN::Interop {

namespace {

using VdbTraits = TileTree3D::Traits<2, 4, 0, 1>;
using Container = TileTree3D::Container<VdbTraits>;
using TileTree3D::ChannelBase;
using TileTree3D::TreeIndex;
using Topology = TileTree3D::VoxelTopology<VdbTraits>;
using FloatChannel = TileTree3D::Channel<VdbTraits, float, 4, 0>;
using Sampler = TileTree3D::FloatVoxelSamplerLinear<VdbTraits>;
using Velorn::Math::double3;
using Velorn::Math::float3;
using Velorn::Math::int3;

constexpr Rgb kNoTile{222, 222, 222};
constexpr Rgb kPaper{255, 255, 255};

struct Sample {
  float value = 0;
  bool found = false;
};

std::string number(double value) {
  char text[32];
  std::snprintf(text, sizeof text, "%.9g", value);
  return text;
}

// Gives a sample as a number: of a vector a component, or its length.
using Reader = std::function<float(TreeIndex const&, int3 const&)>;

template <class T> float asNumber(T const& value, int component) {
  if (kComponentsOf<T> == 1 || component >= 0)
    return static_cast<float>(componentOf(value, std::max(component, 0)));
  double components[kMostComponents] = {};
  for (int c = 0; c < kComponentsOf<T>; ++c) components[c] = static_cast<double>(componentOf(value, c));
  return static_cast<float>(lengthOf(components, kComponentsOf<T>));
}

template <class T> void tryReader(ChannelBase const& channel, int component, Reader& reader) {
  auto const* typed = dynamic_cast<TileTree3D::Channel<VdbTraits, T, 4, 0> const*>(&channel);
  if (!typed) return;
  reader = [typed, component](TreeIndex const& tile, int3 const& sample) {
    return asNumber(typed->tileData(tile)(sample), component);
  };
}

Reader readerOf(ChannelBase const& channel, int component) {
  Reader reader;
#define VLN_TRY_TYPE(type_, name_) tryReader<type_>(channel, component, reader);
  VLN_FOR_EACH_FILE_ELEMENT_TYPE(VLN_TRY_TYPE)
#undef VLN_TRY_TYPE
  return reader;
}

// The plane, in the space that the picture shows, and the way from there to the tree.
class Plane {
public:
  int axis, across, up; // axes of the picture's space
  int width, height;

  // @error std::invalid_argument.
  Plane(VdbVolume const& volume, VdbChannel const& channel, SliceOptions const& options)
      : axis(options.axis)
      , across(options.axis == 0 ? 1 : 0)
      , up(options.axis == 2 ? 1 : 2)
      , m_box(channel.activeBox)
      , m_transform(volume.indexToWorld)
      , m_way(options.indexSpace  ? Way::kIndex
              : isAligned(volume) ? Way::kAligned
                                  : Way::kTurned) {
    bound();
    double const first = m_first[axis], last = m_last[axis];
    m_at = options.at ? *options.at : 0.5 * (first + last);
    // Half a voxel beyond the outermost samples these are still the nearest.
    double const slack = m_way == Way::kTurned ? 0 : 0.5 * (last - first) / std::max(1, extent(axis) - 1);
    double const half = extent(axis) == 1 && m_way != Way::kTurned ? 0.5 * m_step[axis] : slack;
    if (!(m_at >= first - half && m_at <= last + half))
      throw std::invalid_argument("position " + number(m_at) + " on axis " + std::string(1, "xyz"[axis]) +
                                  " misses the active voxels, which lie in " + number(first) + ".." +
                                  number(last));
    double const wide = length(across), tall = length(up), scale = options.size / std::max(wide, tall);
    width = std::max(1, static_cast<int>(std::lround(wide * scale)));
    height = std::max(1, static_cast<int>(std::lround(tall * scale)));
  }

  /// Where the plane lies; when the nearest samples are drawn, the plane of these.
  double at(bool nearest) const {
    if (!nearest || m_way == Way::kTurned) return m_at;
    return m_first[axis] + (std::floor(indexOnAxis() + 0.5) - m_box.min[axis]) * m_step[axis];
  }

  /// The middle of a pixel in the tree's space.
  /// @return false beyond the active box. The half voxels at its border lie beyond the last samples, and show
  /// those.
  bool indexOf(int x, int y, double3& index) const {
    double const u = (x + 0.5) / width, v = 1 - (y + 0.5) / height;
    bool inside = true;
    if (m_way == Way::kTurned) {
      double3 p{};
      p[axis] = m_at;
      p[across] = m_first[across] + u * (m_last[across] - m_first[across]);
      p[up] = m_first[up] + v * (m_last[up] - m_first[up]);
      index = m_transform.toIndex(p);
      for (int a = 0; a < 3; ++a)
        inside = inside && index[a] >= m_box.min[a] - 0.5 && index[a] <= m_box.max[a] - 0.5;
    } else {
      index[axis] = indexOnAxis();
      index[across] = m_box.min[across] + u * extent(across) - 0.5;
      index[up] = m_box.min[up] + v * extent(up) - 0.5;
    }
    for (int a = 0; a < 3 && inside; ++a)
      index[a] = std::clamp(index[a], double(m_box.min[a]), double(m_box.max[a] - 1));
    return inside;
  }

private:
  enum class Way {
    kIndex,   ///< the picture shows index space
    kAligned, ///< world space, whose axes are those of the grid
    kTurned   ///< world space
  };

  int extent(int a) const { return m_box.max[a] - m_box.min[a]; }
  double length(int a) const {
    return m_way == Way::kTurned ? m_last[a] - m_first[a] : extent(a) * m_step[a];
  }
  double indexOnAxis() const { return m_box.min[axis] + (m_at - m_first[axis]) / m_step[axis]; }

  static bool isAligned(VdbVolume const& volume) {
    auto const m = matrixOf(volume.indexToWorld);
    for (std::size_t row = 0; row < 3 && !m.empty(); ++row)
      for (std::size_t column = 0; column < 3; ++column)
        if (row == column ? !(m[row][column] > 0) : m[row][column] != 0) return false;
    return !m.empty();
  }

  // First and last sample on each axis; of a turned grid the corners of the box round its voxels.
  void bound() {
    double const half = m_way == Way::kTurned ? 0.5 : 0;
    for (int corner = 0; corner < 8; ++corner) {
      double3 p{};
      for (int a = 0; a < 3; ++a) p[a] = corner >> a & 1 ? m_box.max[a] - 1 + half : m_box.min[a] - half;
      if (m_way != Way::kIndex) p = m_transform.toWorld(p);
      for (int a = 0; a < 3; ++a) {
        m_first[a] = corner == 0 ? p[a] : std::min(m_first[a], p[a]);
        m_last[a] = corner == 0 ? p[a] : std::max(m_last[a], p[a]);
      }
    }
    auto const size = m_transform.voxelSize();
    for (int a = 0; a < 3; ++a) m_step[a] = m_way == Way::kIndex ? 1 : size[a];
  }

  IndexBox m_box;
  IndexToWorld m_transform;
  Way m_way;
  double m_at = 0;
  double3 m_first{}, m_last{}, m_step{};
};

std::size_t pixelCount(Plane const& plane) {
  return static_cast<std::size_t>(plane.width) * static_cast<std::size_t>(plane.height);
}

// What each thread needs of its own is made by `prepare`; it gives the sample at a place of the tree's space.
template <class Prepare> std::vector<Sample> samplesOf(Plane const& plane, Prepare const& prepare) {
  using Take = decltype(prepare());
  std::vector<Sample> samples(pixelCount(plane));
  std::vector<std::unique_ptr<Take>> takes(parallelThreads());
  parallelFor(0, plane.height,
              [&](std::int64_t begin, std::int64_t end) {
                auto& take = takes[parallelThreadIndex()];
                if (!take) take = std::make_unique<Take>(prepare());
                for (std::int64_t y = begin; y < end; ++y)
                  for (int x = 0; x < plane.width; ++x)
                    if (double3 p; plane.indexOf(x, static_cast<int>(y), p))
                      samples[y * plane.width + x] = (*take)(p);
              },
              {.grain = 8});
  return samples;
}

std::vector<Sample> nearestSamples(Plane const& plane, Container const& tree, Reader const& read, int depth) {
  return samplesOf(plane, [&] {
    return [&, accessor = tree.tileAccessor()](double3 const& p) -> Sample {
      int3 const voxel = ChannelValues::nearest(p);
      auto const& tile = accessor.tile(voxel, depth, false);
      if (!tile.valid()) return {};
      return {read(tile.treeIndex(), tile.childDataIJK(voxel)), true};
    };
  });
}

// Of other types than float, at the deepest depth.
std::vector<Sample> blendedSamples(Plane const& plane, Container const& tree, ChannelValues const& values,
                                   int component) {
  return samplesOf(plane, [&] {
    return [&, accessor = tree.tileAccessor(),
            own = std::shared_ptr<ChannelValues const>(values.clone())](double3 const& p) -> Sample {
      int3 const voxel = ChannelValues::nearest(p);
      if (!accessor.tile(voxel, Container::kMaxDepth, false).valid()) return {};
      double v[kMostComponents] = {};
      own->linear(p, v);
      double const shown = component >= 0           ? v[component]
                           : own->components() == 1 ? v[0]
                                                    : lengthOf(v, own->components());
      return {static_cast<float>(shown), true};
    };
  });
}

std::vector<Sample> linearSamples(Plane const& plane, Sampler const& cold, int depth,
                                  IndexToWorld const* gradientIn, float voxelSize) {
  // Samplers keep tiles that they have widened.
  return samplesOf(plane, [&] {
    return [&, sampler = std::make_shared<Sampler>(cold)](double3 const& at) -> Sample {
      float3 const p{static_cast<float>(at.x), static_cast<float>(at.y), static_cast<float>(at.z)};
      TileTree3D::TreeIndex tile;
      int3 ijk;
      float3 weights;
      if (!sampler->prepareToSample(p, TileTree3D::kSamplerTileSpace, tile, ijk, weights, depth, nullptr))
        return {};
      if (!gradientIn) return {sampler->sample(tile, ijk, weights), true};
      // The sampler knows one voxel size; the transform may have three, and a shear.
      float3 g;
      sampler->sampleGradient(p, depth, TileTree3D::kSamplerTileSpace, &g);
      g *= voxelSize;
      auto const w = gradientIn->gradientToWorld({g.x, g.y, g.z}, {p.x, p.y, p.z});
      return {static_cast<float>(std::hypot(w.x, w.y, w.z)), true};
    };
  });
}

bool hasRootsBelow(Container const& tree, int depth) {
  for (int d = depth + 1; d <= Container::kMaxDepth; ++d)
    if (tree.rootCount(d) > 0) return true;
  return false;
}

// A volume with tiles from some depth on above the roots that it had, which hold their children's values.
struct CoarsenedVolume {
  Container tree;
  Topology topology;
  FloatChannel channel;

  CoarsenedVolume(Container const& from, Topology const& offsets, FloatChannel const& values, int depth)
      : tree(from)
      , topology("", offsets.offsetType())
      , channel("", &values.defaultValue(), TileTree3D::kInitializeDefaultValue, true, true, depth,
                values.depth()) {
    Container::TileLists corners;
    for (auto it = from.cbeginRoots(); it != from.cendRoots(); ++it) {
      int3 const p = it->first.ijk();
      if (it->second.depth > depth)
        corners[depth].append(
            {VdbTraits::align(p.x, depth), VdbTraits::align(p.y, depth), VdbTraits::align(p.z, depth)});
    }
    tree.tileAccessor().addTiles(corners);
    topology.update(tree);
    channel.update(topology);
    // New tiles of a depth follow those that it had.
    for (int d = std::max(depth, values.minDepth()); d <= values.depth(); ++d)
      for (std::int64_t n = 0; n < from.tileCount(d); ++n) channel.tileData(n, d).set(values.tileData(n, d));
    TileTree3D::setNonLeafValueToChildValue(channel, tree, TileTree3D::kVoxelOffsetCorner, depth,
                                            Container::kMaxDepth);
  }
};

// Beyond this share of the larger side the smaller one matters.
constexpr double kBothSigns = 0.05;
// An end that lies as far beyond the rest as this many times its extent is an outlier.
constexpr double kFarOff = 2;

// The value that a share of the numbers stays below.
double quantile(std::vector<float>& numbers, double share) {
  auto const nth = numbers.begin() + static_cast<std::ptrdiff_t>(share * double(numbers.size() - 1));
  std::nth_element(numbers.begin(), nth, numbers.end());
  return *nth;
}

// From the numbers that were drawn to colours.
ColorMap colorsFor(Slice& slice, std::vector<float>& numbers, SliceOptions const& options) {
  using Kind = ColorMap::Kind;
  if (!numbers.empty()) {
    auto const [low, high] = std::minmax_element(numbers.begin(), numbers.end());
    slice.low = slice.bottom = *low, slice.high = slice.top = *high;
    double const share = options.percentile / 100;
    double const few = quantile(numbers, 1 - share), most = quantile(numbers, share);
    double const body = most - few;
    if (few - slice.low > kFarOff * body && body > 0) slice.bottom = few;
    bool const signs = slice.bottom < 0 && most > 0 &&
                       std::min(-slice.bottom, most) >= kBothSigns * std::max(-slice.bottom, most);
    // A band of both signs is shown whole, unless few values lie far off.
    if ((!signs || slice.high - most > kFarOff * body) && most > slice.bottom) slice.top = most;
  }
  if (options.range) slice.bottom = options.range->first, slice.top = options.range->second;
  double const larger = std::max(-slice.bottom, slice.top);
  bool const signs =
      slice.bottom < 0 && slice.top > 0 && std::min(-slice.bottom, slice.top) >= kBothSigns * larger;
  Kind const kind = options.colors == SliceColors::kAuto ? (signs ? Kind::kDiverging : Kind::kSequential)
                    : options.colors == SliceColors::kDiverging  ? Kind::kDiverging
                    : options.colors == SliceColors::kSequential ? Kind::kSequential
                                                                 : Kind::kGray;
  if (kind == Kind::kDiverging && !options.range) return {kind, -larger, larger};
  return {kind, slice.bottom, slice.top};
}

// The picture, its scale beside it, the title above.
Image arrange(Image const& picture, ColorMap const& map, ColorMap::Marks const& marks,
              SliceOptions const& options, double at) {
  int const textScale = options.size >= 700 ? 2 : 1, margin = 8 * textScale;
  Image const scale =
      map.scale(std::clamp(picture.height(), 60 * textScale, 400 * textScale), textScale, marks);
  int const width = picture.width() + scale.width() + 3 * margin;
  int const head = options.title.empty() ? 0 : Image::textHeight(textScale) + margin;
  int const height = std::max(picture.height(), scale.height()) + 2 * margin;
  Image image(width, height + head, kPaper);
  char const axis = (options.indexSpace ? "ijk" : "xyz")[options.axis];
  std::string title = options.title + ", " + axis + " = " + number(at);
  if (options.title.empty()) title.clear();
  if (Image::textWidth(title, textScale) > width - 2 * margin) {
    auto const room = static_cast<std::size_t>(std::max(0, (width - 2 * margin) / (6 * textScale) - 3));
    title = title.substr(0, room) + "...";
  }
  image.text(margin, margin, title, {40, 40, 40}, textScale);
  image.paste(picture, margin, head + (height - picture.height()) / 2);
  image.paste(scale, picture.width() + 2 * margin, head + (height - scale.height()) / 2);
  return image;
}

void check(VdbChannel const& info, ChannelValues const& values, SliceOptions const& options) {
  if (info.activeBox.empty()) throw std::invalid_argument("channel '" + info.name + "' has no active voxel");
  if (options.axis < 0 || options.axis > 2) throw std::invalid_argument("the axis must be x, y or z");
  if (options.size < kSmallestSlice || options.size > kLargestSlice)
    throw std::invalid_argument("the size must lie in " + std::to_string(kSmallestSlice) + ".." +
                                std::to_string(kLargestSlice));
  if (!(options.percentile > 50 && options.percentile <= 100))
    throw std::invalid_argument("the percentile must lie above 50 and not above 100");
  if (options.range && !(options.range->first < options.range->second))
    throw std::invalid_argument("the range must begin below its end");
  if (options.component >= values.components() || (options.component >= 0 && values.components() == 1))
    throw std::invalid_argument("channel '" + info.name + "' has no component " +
                                std::string(1, "xyzw"[std::min(options.component, 3)]));
}

} // namespace

Slice drawSlice(VdbVolume const& volume, std::string const& name, SliceOptions const& options) {
  VdbChannel const* info = volume.channel(name);
  auto const channel = volume.object->component<ChannelBase>(name);
  auto const container = volume.object->component<Container>(kVdbContainerName);
  auto const topology = volume.object->component<Topology>(kVdbTopologyName);
  auto const values = info ? ChannelValues::of(volume, name) : nullptr;
  if (!values || !channel || !container || !topology)
    throw std::invalid_argument("there is no channel '" + name + "'");
  check(*info, *values, options);

  Plane const plane(volume, *info, options);
  auto const* floats = dynamic_cast<FloatChannel const*>(channel.get());
  if (options.gradient && !floats)
    throw std::invalid_argument("channel '" + name +
                                "' is no float channel, so that it has no gradient here");
  int const depth = std::min(options.depth, Container::kMaxDepth);
  bool const blends = floats || (!values->whole() && depth == Container::kMaxDepth);
  bool const nearest = !blends || (options.nearest && !options.gradient);
  auto const draw = [&](Sampler const& sampler) {
    return linearSamples(plane, sampler, depth, options.gradient ? &volume.indexToWorld : nullptr,
                         container->voxelSize());
  };
  std::vector<Sample> samples;
  if (nearest) {
    samples = nearestSamples(plane, *container, readerOf(*channel, options.component), depth);
  } else if (!floats) {
    samples = blendedSamples(plane, *container, *values, options.component);
  } else if (hasRootsBelow(*container, depth)) {
    CoarsenedVolume const coarsened(*container, *topology, *floats, depth);
    samples = draw({coarsened.tree, coarsened.topology, coarsened.channel});
  } else {
    samples = draw({*container, *topology, *floats});
  }

  Slice slice{Image(1, 1), plane.at(nearest), 0, 0, 0, 0, 0};
  std::vector<float> numbers;
  bool anyNotANumber = false;
  for (Sample const& s : samples) {
    slice.drawn += s.found;
    anyNotANumber = anyNotANumber || (s.found && std::isnan(s.value));
    if (s.found && std::isfinite(s.value)) numbers.push_back(s.value);
  }
  ColorMap const map = colorsFor(slice, numbers, options);
  Image picture(plane.width, plane.height, kNoTile);
  parallelFor(0, plane.height,
              [&](std::int64_t begin, std::int64_t end) {
                for (int y = static_cast<int>(begin); y < end; ++y)
                  for (int x = 0; x < plane.width; ++x) {
                    Sample const& s =
                        samples[static_cast<std::size_t>(y) * static_cast<std::size_t>(plane.width) +
                                static_cast<std::size_t>(x)];
                    if (s.found) picture(x, y) = map.color(s.value);
                  }
              },
              {.grain = 64});
  slice.image = arrange(picture, map, {map.high() < slice.high, map.low() > slice.low, anyNotANumber},
                        options, slice.at);
  return slice;
}

} // namespace VLN::Interop
