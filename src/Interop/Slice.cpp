#include "Interop/Slice.h"

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/channels/NonLeafValues.h"
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Numeric.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/sampling/VoxelSamplerLinear.h"
#include "GeometryVolume/tiletree/Container.h"
#include "Interop/ColorMap.h"

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
  std::snprintf(text, sizeof text, "%.6g", value);
  return text;
}

// Gives a sample as a number: a vector by its length.
using Reader = std::function<float(TreeIndex const&, int3 const&)>;

float asNumber(auto const& value) {
  using T = std::remove_cvref_t<decltype(value)>;
  if constexpr (std::is_arithmetic_v<T>)
    return static_cast<float>(value);
  else
    return static_cast<float>(std::hypot(double(value.x), double(value.y), double(value.z)));
}

template <class T> bool readerIfOf(ChannelBase const& channel, Reader& reader) {
  auto const* typed = dynamic_cast<TileTree3D::Channel<VdbTraits, T, 4, 0> const*>(&channel);
  if (!typed) return false;
  reader = [typed](TreeIndex const& tile, int3 const& sample) {
    return asNumber(typed->tileData(tile)(sample));
  };
  return true;
}

Reader readerOf(ChannelBase const& channel) {
  Reader reader;
  bool const known = readerIfOf<float>(channel, reader) ||
                     readerIfOf<Velorn::Math::float3>(channel, reader) || readerIfOf<int>(channel, reader) ||
                     readerIfOf<std::int64_t>(channel, reader) ||
                     readerIfOf<unsigned char>(channel, reader) ||
#if VLN_HAS_ELEMENT_INT3
                     readerIfOf<int3>(channel, reader) ||
#endif
#if VLN_HAS_ELEMENT_DOUBLE
                     readerIfOf<double>(channel, reader) ||
#endif
                     readerIfOf<Velorn::Math::double3>(channel, reader);
  if (!known) throw std::invalid_argument("channel '" + channel.name() + "' has a type that cannot be drawn");
  return reader;
}

// The plane in samples and in pixels.
struct Plane {
  int axis, across, up; // axes of tile space
  int at;               // index along `axis`
  double where;         // the same, between indices
  IndexBox box;
  int width, height;

  int extent(int a) const { return box.max[a] - box.min[a]; }
  double acrossAt(int x) const { return box.min[across] + (x + 0.5) * extent(across) / width; }
  double upAt(int y) const { return box.max[up] - (y + 0.5) * extent(up) / height; }
  // A pixel in the middle of a sample's square lies on the sample. The half squares at the border lie beyond
  // the last samples, and show those.
  float3 placeOf(int x, int y) const {
    auto const inside = [this](int a, double c) {
      return static_cast<float>(std::clamp(c, double(box.min[a]), double(box.max[a] - 1)));
    };
    float3 p{};
    p[axis] = static_cast<float>(where);
    p[across] = inside(across, acrossAt(x) - 0.5);
    p[up] = inside(up, upAt(y) - 0.5);
    return p;
  }
  int3 indexOf(int x, int y) const {
    int3 p{};
    p[axis] = at;
    p[across] = box.min[across] + static_cast<int>((x + 0.5) * extent(across) / width);
    p[up] = box.max[up] - 1 - static_cast<int>((y + 0.5) * extent(up) / height);
    return p;
  }
};

// World position, on the plane's axis, of the point of index `at` on the line through the middle of the box.
double worldOn(VdbVolume const& volume, Plane const& plane, double at) {
  Velorn::Math::double3 index{};
  for (int a = 0; a < 3; ++a) index[a] = 0.5 * (double(plane.box.min[a]) + plane.box.max[a] - 1);
  index[plane.axis] = at;
  return volume.indexToWorld.toWorld(index)[plane.axis];
}

// Index of the point of that line which lies at a world position.
double indexAt(VdbVolume const& volume, Plane const& plane, double world) {
  int const low = plane.box.min[plane.axis], high = plane.box.max[plane.axis];
  double const first = worldOn(volume, plane, low), last = worldOn(volume, plane, high);
  if (first == last)
    throw std::invalid_argument(std::string("its transform turns axis ") + "xyz"[plane.axis] +
                                " away, so that a position on it names no plane; leave --at out");
  return low + (world - first) / (last - first) * (double(high) - low);
}

Plane planeFor(VdbVolume const& volume, VdbChannel const& channel, SliceOptions const& options) {
  Plane plane{};
  plane.axis = options.axis;
  plane.across = options.axis == 0 ? 1 : 0;
  plane.up = options.axis == 2 ? 1 : 2;
  plane.box = channel.activeBox;
  int const low = plane.box.min[plane.axis], high = plane.box.max[plane.axis] - 1;
  double const at = options.at ? indexAt(volume, plane, *options.at) : 0.5 * (double(low) + high);
  plane.at = toIntFloor(at + 0.5);
  plane.where = at;
  if (plane.at < low || plane.at > high)
    throw std::invalid_argument(
        "position " + number(options.at.value_or(0)) + " on axis " + std::string(1, "xyz"[plane.axis]) +
        " misses the active voxels, which lie in " + number(worldOn(volume, plane, low)) + ".." +
        number(worldOn(volume, plane, high)));
  double const across = plane.extent(plane.across), up = plane.extent(plane.up);
  double const scale = options.size / std::max(across, up);
  plane.width = std::max(1, static_cast<int>(std::lround(across * scale)));
  plane.height = std::max(1, static_cast<int>(std::lround(up * scale)));
  return plane;
}

std::size_t pixelCount(Plane const& plane) {
  return static_cast<std::size_t>(plane.width) * static_cast<std::size_t>(plane.height);
}

std::vector<Sample> nearestSamples(Plane const& plane, Container const& tree, ChannelBase const& channel,
                                   int depth) {
  std::vector<Sample> samples(pixelCount(plane));
  Reader const read = readerOf(channel);
  parallelFor(0, plane.height,
              [&](std::int64_t begin, std::int64_t end) {
                auto accessor = tree.tileAccessor();
                for (std::int64_t y = begin; y < end; ++y)
                  for (int x = 0; x < plane.width; ++x) {
                    int3 const p = plane.indexOf(x, static_cast<int>(y));
                    auto const& tile = accessor.tile(p, depth, false);
                    if (!tile.valid()) continue;
                    samples[static_cast<std::size_t>(y * plane.width + x)] = {
                        read(tile.treeIndex(), tile.childDataIJK(p)), true};
                  }
              },
              {.grain = 8});
  return samples;
}

std::vector<Sample> linearSamples(Plane const& plane, Sampler const& cold, int depth,
                                  IndexToWorld const* gradientIn, float voxelSize) {
  std::vector<Sample> samples(pixelCount(plane));
  // Samplers keep tiles that they have widened: one for each thread, for all of its rows.
  std::vector<std::unique_ptr<Sampler>> samplers(static_cast<std::size_t>(parallelThreads()));
  parallelFor(0, plane.height,
              [&](std::int64_t begin, std::int64_t end) {
                auto& sampler = samplers[static_cast<std::size_t>(parallelThreadIndex())];
                if (!sampler) sampler = std::make_unique<Sampler>(cold);
                for (std::int64_t y = begin; y < end; ++y)
                  for (int x = 0; x < plane.width; ++x) {
                    float3 const p = plane.placeOf(x, static_cast<int>(y));
                    TileTree3D::TreeIndex tile;
                    int3 ijk;
                    float3 weights;
                    if (!sampler->prepareToSample(p, TileTree3D::kSamplerTileSpace, tile, ijk, weights, depth,
                                                  nullptr))
                      continue;
                    Sample& s = samples[static_cast<std::size_t>(y * plane.width + x)];
                    s.found = true;
                    if (gradientIn) {
                      // The sampler knows one voxel size; the transform may have three, and a shear.
                      float3 g;
                      sampler->sampleGradient(p, depth, TileTree3D::kSamplerTileSpace, &g);
                      g *= voxelSize;
                      auto const w = gradientIn->gradientToWorld({g.x, g.y, g.z}, {p.x, p.y, p.z});
                      s.value = static_cast<float>(std::hypot(w.x, w.y, w.z));
                    } else {
                      s.value = sampler->sample(tile, ijk, weights);
                    }
                  }
              },
              {.grain = 8});
  return samples;
}

bool hasRootsBelow(Container const& tree, int depth) {
  for (int d = depth + 1; d <= Container::kMaxDepth; ++d)
    if (tree.rootCount(d) > 0) return true;
  return false;
}

// A volume with tiles from some depth on above the roots that it had, which hold their children's values.
struct Raised {
  Container tree;
  Topology topology;
  FloatChannel channel;

  Raised(Container const& from, Topology const& offsets, FloatChannel const& values, int depth)
      : tree(from)
      , topology("", offsets.offsetType())
      , channel("", &values.defaultValue(), TileTree3D::kInitializeDefaultValue, true, true, depth,
                values.depth()) {
    Container::TileLists corners;
    for (auto it = from.cbeginRoots(); it != from.cendRoots(); ++it) {
      int3 const p = it->first.ijk();
      if (it->second.depth > depth)
        corners[static_cast<std::size_t>(depth)].append(
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

} // namespace

Slice drawSlice(VdbVolume const& volume, std::string const& name, SliceOptions const& options) {
  VdbChannel const* info = volume.channel(name);
  auto const channel = volume.object->component<ChannelBase>(name);
  auto const container = volume.object->component<Container>(kVdbContainerName);
  auto const topology = volume.object->component<Topology>(kVdbTopologyName);
  if (!info || !channel || !container || !topology)
    throw std::invalid_argument("there is no channel '" + name + "'");
  if (info->activeBox.empty()) throw std::invalid_argument("channel '" + name + "' has no active voxel");
  if (options.axis < 0 || options.axis > 2) throw std::invalid_argument("the axis must be x, y or z");
  if (options.size < kSmallestSlice || options.size > kLargestSlice)
    throw std::invalid_argument("the size must lie in " + std::to_string(kSmallestSlice) + ".." +
                                std::to_string(kLargestSlice));

  Plane const plane = planeFor(volume, *info, options);
  auto const* floats = dynamic_cast<FloatChannel const*>(channel.get());
  if (options.gradient && !floats)
    throw std::invalid_argument("channel '" + name +
                                "' is no float channel, so that it has no gradient here");
  // Channels of other types than float are drawn by their nearest samples.
  bool const nearest = !floats || (options.nearest && !options.gradient);
  int const depth = std::min(options.depth, Container::kMaxDepth);
  auto const draw = [&](Sampler const& sampler) {
    return linearSamples(plane, sampler, depth, options.gradient ? &volume.indexToWorld : nullptr,
                         container->voxelSize());
  };
  std::vector<Sample> samples;
  if (nearest) {
    samples = nearestSamples(plane, *container, *channel, depth);
  } else if (hasRootsBelow(*container, depth)) {
    Raised const raised(*container, *topology, *floats, depth);
    samples = draw({raised.tree, raised.topology, raised.channel});
  } else {
    samples = draw({*container, *topology, *floats});
  }

  Slice slice{Image(1, 1), worldOn(volume, plane, nearest ? plane.at : plane.where), 0, 0, 0, 0};
  std::vector<float> numbers;
  for (Sample const& s : samples) {
    slice.drawn += s.found;
    if (s.found && std::isfinite(s.value)) numbers.push_back(s.value);
  }
  if (!numbers.empty()) {
    auto const [low, high] = std::minmax_element(numbers.begin(), numbers.end());
    slice.low = *low, slice.high = slice.top = *high;
    if (slice.low >= 0 || slice.high <= 0) {
      auto const nth = numbers.begin() + static_cast<std::ptrdiff_t>(0.995 * double(numbers.size() - 1));
      std::nth_element(numbers.begin(), nth, numbers.end());
      if (*nth > slice.low) slice.top = *nth;
    }
  }
  ColorMap const map = ColorMap::forRange(slice.low, slice.top);
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

  int const textScale = options.size >= 700 ? 2 : 1;
  int const margin = 8 * textScale;
  Image const scale =
      map.scale(std::clamp(plane.height, 60 * textScale, 400 * textScale), textScale, slice.top < slice.high);
  slice.image = Image(plane.width + scale.width() + 3 * margin,
                      std::max(plane.height, scale.height()) + 2 * margin, kPaper);
  slice.image.paste(picture, margin, (slice.image.height() - plane.height) / 2);
  slice.image.paste(scale, plane.width + 2 * margin, (slice.image.height() - scale.height()) / 2);
  return slice;
}

} // namespace VLN::Interop
