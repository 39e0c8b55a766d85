#include "Commands.h"
#include "Content.h"
#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/sampling/VoxelSamplerLinear.h"
#include "Interop/ChannelValues.h"
#include "Interop/FileFormat.h"
#include "Interop/OutputFile.h"
#include "Interop/VolumeFile.h"
#include "Positions.h"
#include "ProgressBar.h"
#include "StandardOutput.h"

#include <iterator>
#include <memory>
#include <optional>
#include <stdexcept>

#include <fmt/format.h>

namespace Vln {

namespace {

using namespace VLN::Interop;
using VdbTraits = VLN::TileTree3D::Traits<2, 4, 0, 1>;
using Container = VLN::TileTree3D::Container<VdbTraits>;
using Topology = VLN::TileTree3D::VoxelTopology<VdbTraits>;
using FloatChannel = VLN::TileTree3D::Channel<VdbTraits, float, 4, 0>;
using Sampler = VLN::TileTree3D::FloatVoxelSamplerLinear<VdbTraits>;
using Velorn::Math::double3;
using Velorn::Math::float3;

// Points of a piece of work.
constexpr std::int64_t kChunk = 1 << 11;

// Prints a position's line from the value on.
class Prober {
public:
  virtual ~Prober() = default;
  virtual std::unique_ptr<Prober> clone() const = 0;
  virtual std::string columns() const = 0;
  /// @param index The position in the tree's space.
  virtual void append(fmt::memory_buffer& text, double3 const& index) const = 0;
};

// Values with gradients, back through the whole transform.
class FloatProber final : public Prober {
public:
  FloatProber(VdbVolume const& volume, Container const& tree, Topology const& topology,
              FloatChannel const& channel)
      : m_volume(volume)
      , m_tree(tree)
      , m_sampler(tree, topology, channel) {}

  std::unique_ptr<Prober> clone() const override { return std::make_unique<FloatProber>(*this); }
  std::string columns() const override { return "value,gx,gy,gz"; }
  void append(fmt::memory_buffer& text, double3 const& index) const override {
    float3 g;
    float const value = m_sampler.sampleGradient(
        {static_cast<float>(index.x), static_cast<float>(index.y), static_cast<float>(index.z)},
        VLN::TileTree3D::kSamplerTileSpace, &g);
    g *= m_tree.voxelSize(); // by which the sampler divided
    double3 const w = m_volume.indexToWorld.gradientToWorld({g.x, g.y, g.z}, index);
    fmt::format_to(std::back_inserter(text), ",{:.9g},{:.9g},{:.9g},{:.9g}", value, w.x, w.y, w.z);
  }

private:
  VdbVolume const& m_volume;
  Container const& m_tree;
  Sampler m_sampler;
};

// Values of the other types by component.
class AnyProber final : public Prober {
public:
  explicit AnyProber(std::unique_ptr<ChannelValues> values)
      : m_values(std::move(values)) {}

  std::unique_ptr<Prober> clone() const override { return std::make_unique<AnyProber>(m_values->clone()); }
  std::string columns() const override {
    return m_values->components() == 1 ? "value" : "value_x,value_y,value_z";
  }
  void append(fmt::memory_buffer& text, double3 const& index) const override {
    auto const at = std::back_inserter(text);
    if (m_values->whole()) {
      fmt::format_to(at, ",{}", m_values->text(ChannelValues::nearest(index)));
      return;
    }
    double values[kMostComponents];
    m_values->linear(index, values);
    for (int c = 0; c < m_values->components(); ++c)
      fmt::format_to(at, ",{:.{}g}", values[c], m_values->wide() ? 17 : 9);
  }

private:
  std::unique_ptr<ChannelValues> m_values;
};

std::unique_ptr<Prober> proberOf(VdbVolume const& volume, std::string const& channel) {
  auto const tree = volume.object->component<Container>(kVdbContainerName);
  auto const topology = volume.object->component<Topology>(kVdbTopologyName);
  auto const floats = volume.object->component<FloatChannel>(channel);
  if (tree && topology && floats) return std::make_unique<FloatProber>(volume, *tree, *topology, *floats);
  auto values = ChannelValues::of(volume, channel);
  if (!values) throw std::runtime_error("channel '" + channel + "' has a type that cannot be printed");
  return std::make_unique<AnyProber>(std::move(values));
}

// Writes lines to a file, or to standard output.
class Lines {
public:
  Lines(IndexToWorld const& indexToWorld, Prober const& prober, OutputFile* file)
      : m_indexToWorld(indexToWorld)
      , m_prober(prober)
      , m_file(file)
      , m_probers(static_cast<std::size_t>(VLN::parallelThreads())) {
    put("x,y,z," + prober.columns() + "\n");
  }

  void write(std::vector<double3> const& points) {
    auto const count = static_cast<std::int64_t>(points.size());
    constexpr std::int64_t kBlock = 32 * kChunk; // whose lines are formed before they are written
    for (std::int64_t first = 0; first < count && out(); first += kBlock) {
      std::int64_t const last = std::min(first + kBlock, count);
      std::vector<std::string> lines(static_cast<std::size_t>(VLN::chunkCount(first, last, kChunk)));
      VLN::parallelChunks(first, last, kChunk, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
        auto& prober = m_probers[static_cast<std::size_t>(VLN::parallelThreadIndex())];
        if (!prober) prober = m_prober.clone();
        fmt::memory_buffer text;
        for (std::int64_t n = begin; n < end; ++n) append(text, *prober, points[static_cast<std::size_t>(n)]);
        lines[static_cast<std::size_t>(chunk)].assign(text.data(), text.size());
      });
      for (auto const& text : lines) put(text);
    }
  }

private:
  void append(fmt::memory_buffer& text, Prober const& prober, double3 const& p) const {
    fmt::format_to(std::back_inserter(text), "{:.{}g},{:.{}g},{:.{}g}", p.x, kDigits, p.y, kDigits, p.z,
                   kDigits);
    prober.append(text, m_indexToWorld.toIndex(p));
    text.push_back('\n');
  }
  void put(std::string const& text) {
    if (m_file)
      m_file->write(text);
    else
      out() << text;
  }

  // Enough for a hundredth of a millimetre at any place on the earth.
  static constexpr int kDigits = 12;

  IndexToWorld const& m_indexToWorld;
  Prober const& m_prober;
  OutputFile* m_file;
  std::vector<std::unique_ptr<Prober>> m_probers;
};

std::vector<double3> givenPositions(std::vector<std::string> const& numbers) {
  if (numbers.size() % 3 != 0)
    throw std::invalid_argument("positions are three numbers each, but there are " +
                                std::to_string(numbers.size()));
  std::vector<double3> points(numbers.size() / 3);
  for (std::size_t n = 0; n < numbers.size(); ++n)
    if (!parseNumber(numbers[n], points[n / 3][static_cast<int>(n % 3)]))
      throw std::invalid_argument("'" + numbers[n] + "' is no number that a position could have");
  return points;
}

} // namespace

void probe(ProbeOptions const& options) {
  bool const standardInput = options.points == "-" || options.positions == std::vector<std::string>{"-"};
  std::vector<double3> points;
  if (options.positions != std::vector<std::string>{"-"}) points = givenPositions(options.positions);
  if (points.empty() && options.points.empty() && !standardInput)
    throw std::invalid_argument("no position given: X Y Z, - or --points is required");
  std::optional<PositionLines> lines;
  if (standardInput || !options.points.empty()) lines.emplace(standardInput ? "-" : options.points);
  // Of a file all lines are looked at before the first value is printed.
  if (lines && !lines->streams())
    while (lines->next(points)) {}
  if (!options.output.empty()) checkOutputFor(FileContent::kValues, options.output);
  VdbImport content;
  {
    ProgressBar bar;
    content = importVolumes(options.file, options.limits, bar.progress());
  }
  auto const& volume = volumeWith(content, options.channel);
  auto const prober = proberOf(volume, options.channel);
  std::optional<OutputFile> file;
  if (!options.output.empty()) file.emplace(options.output);
  Lines text(volume.indexToWorld, *prober, file ? &*file : nullptr);
  text.write(points);
  if (lines && lines->streams())
    for (bool more = true; more && out();) {
      // Who asks may wait for the answer before the next question.
      if (!file) out().flush();
      points.clear();
      more = lines->next(points);
      text.write(points);
    }
  if (file) file->commit();
  leaveToSystem(std::move(content));
}

} // namespace Vln
