#include "Commands.h"
#include "Content.h"
#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/sampling/VoxelSamplerLinear.h"
#include "Interop/FileError.h"
#include "Interop/VdbImport.h"
#include "ProgressBar.h"

#include <cerrno>
#include <charconv>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <iterator>
#include <memory>
#include <stdexcept>
#include <string_view>

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

// Points whose lines are formed before they are written.
constexpr std::int64_t kBlock = 1 << 16;
constexpr std::int64_t kChunk = 1 << 11;

std::string_view trimmed(std::string_view text) {
  auto const blank = [](char c) { return c == ' ' || c == '\t' || c == '\r'; };
  while (!text.empty() && blank(text.front())) text.remove_prefix(1);
  while (!text.empty() && blank(text.back())) text.remove_suffix(1);
  return text;
}

// One number of a line; false for anything else.
bool parse(std::string_view text, double& number) {
  text = trimmed(text);
  if (!text.empty() && text.front() == '+') text.remove_prefix(1);
  auto const [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
  return !text.empty() && error == std::errc() && end == text.data() + text.size();
}

std::vector<double3> readPoints(std::string const& path) {
  std::error_code unknown;
  if (std::filesystem::is_directory(path, unknown)) throw FileError(path, "is a directory");
  std::ifstream in(path, std::ios::binary);
  if (!in) throw FileError(path, std::strerror(errno));
  std::string const text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  if (in.bad()) throw FileError(path, "cannot be read");
  std::vector<double3> points;
  std::size_t line = 0;
  for (std::size_t begin = 0; begin < text.size();) {
    std::size_t const end = std::min(text.find('\n', begin), text.size());
    auto rest = std::string_view(text).substr(begin, end - begin);
    begin = end + 1;
    ++line;
    if (trimmed(rest).empty()) continue;
    double3 p{};
    bool good = true;
    for (int a = 0; a < 3 && good; ++a) {
      std::size_t const comma = rest.find(',');
      good = (comma == std::string_view::npos) == (a == 2) && parse(rest.substr(0, comma), p[a]);
      if (a < 2 && good) rest.remove_prefix(comma + 1);
    }
    if (!good) throw FileError(path, fmt::format("line {} is not of the form x,y,z", line));
    points.push_back(p);
  }
  return points;
}

// A point of world space as a line: through the whole transform into the tree's space, and the gradient back.
struct Line {
  VdbVolume const& volume;
  float voxelSize; ///< that the sampler's gradients were divided by

  void append(fmt::memory_buffer& text, Sampler const& sampler, double3 const& p) const {
    double3 const index = volume.indexToWorld.toIndex(p);
    float3 g;
    float const value = sampler.sampleGradient(
        {static_cast<float>(index.x), static_cast<float>(index.y), static_cast<float>(index.z)},
        VLN::TileTree3D::kSamplerTileSpace, &g);
    g *= voxelSize;
    double3 const w = volume.indexToWorld.gradientToWorld({g.x, g.y, g.z}, index);
    fmt::format_to(std::back_inserter(text), "{:.9g},{:.9g},{:.9g},{:.9g},{:.9g},{:.9g},{:.9g}\n", p.x, p.y,
                   p.z, value, w.x, w.y, w.z);
  }
};

void writeLines(std::vector<double3> const& points, Sampler const& cold, Line const& line) {
  std::vector<std::unique_ptr<Sampler>> samplers(static_cast<std::size_t>(VLN::parallelThreads()));
  auto const count = static_cast<std::int64_t>(points.size());
  std::cout << "x,y,z,value,gx,gy,gz\n";
  for (std::int64_t first = 0; first < count && std::cout; first += kBlock) {
    std::int64_t const last = std::min(first + kBlock, count);
    std::vector<std::string> lines(static_cast<std::size_t>(VLN::chunkCount(first, last, kChunk)));
    VLN::parallelChunks(first, last, kChunk, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
      auto& sampler = samplers[static_cast<std::size_t>(VLN::parallelThreadIndex())];
      if (!sampler) sampler = std::make_unique<Sampler>(cold);
      fmt::memory_buffer text;
      for (std::int64_t n = begin; n < end; ++n)
        line.append(text, *sampler, points[static_cast<std::size_t>(n)]);
      lines[static_cast<std::size_t>(chunk)].assign(text.data(), text.size());
    });
    for (auto const& text : lines) std::cout << text;
  }
}

} // namespace

void probe(ProbeOptions const& options) {
  std::vector<double3> points;
  if (options.positions.size() % 3 != 0)
    throw std::invalid_argument("positions are three numbers each, but there are " +
                                std::to_string(options.positions.size()));
  for (std::size_t n = 0; n < options.positions.size(); n += 3)
    points.push_back({options.positions[n], options.positions[n + 1], options.positions[n + 2]});
  if (!options.points.empty()) {
    auto const read = readPoints(options.points);
    points.insert(points.end(), read.begin(), read.end());
  } else if (points.empty()) {
    throw std::invalid_argument("no position given: X Y Z or --points is required");
  }
  VdbImport content;
  {
    ProgressBar bar;
    content = importVdb(options.file, options.limits, bar.progress());
  }
  auto const& volume = volumeWith(content, options.channel);
  auto const container = volume.object->component<Container>(kVdbContainerName);
  auto const topology = volume.object->component<Topology>(kVdbTopologyName);
  auto const channel = volume.object->component<FloatChannel>(options.channel);
  writeLines(points, {*container, *topology, *channel}, {volume, container->voxelSize()});
  std::cout.flush();
}

} // namespace Vln
