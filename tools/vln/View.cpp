#include "Drawing.h"
#include "Interop/FileError.h"
#include "Interop/FileFormat.h"
#include "ProgressBar.h"
#include "Render/Bricks.h"
#include "Render/Colors.h"
#include "StandardOutput.h"
#include "ViewCommand.h"
#include "ViewPoints.h"

#include <algorithm>
#include <array>
#include <bit>
#include <cmath>
#include <filesystem>
#include <iostream>
#include <memory>
#include <stdexcept>

#include <fmt/format.h>
#include <nlohmann/json.hpp>

namespace Vln {

using namespace VLN::Interop;
using namespace VLN::Render;
using nlohmann::ordered_json;

namespace {

static_assert(std::endian::native == std::endian::little, "pages hold little-endian numbers");

// What a browser and a small graphics card are asked to hold.
constexpr std::size_t kMostBricks = (std::size_t(256) << 20) / kPackedSamples;
// A depth of fewer bricks is not worth a step of the slider.
constexpr std::size_t kFewestBricks = 4;

ordered_json numbers(Vec3d v) { return {v.x, v.y, v.z}; }

template <class T> void append(std::string& bytes, T const* values, std::size_t count) {
  bytes.append(reinterpret_cast<char const*>(values), count * sizeof(T));
}

struct Level {
  ordered_json about;
  std::string block;
  int depth = 0;
};

Level packedLevel(PackedField const& packed) {
  Level level;
  std::string bytes;
  bytes.reserve(packed.bricks.size() * sizeof(PackedBrick) + packed.codes.size());
  for (std::uint32_t PackedBrick::*part :
       {&PackedBrick::x, &PackedBrick::y, &PackedBrick::z, &PackedBrick::level})
    for (PackedBrick const& b : packed.bricks) append(bytes, &(b.*part), 1);
  for (float PackedBrick::*part : {&PackedBrick::low, &PackedBrick::high})
    for (PackedBrick const& b : packed.bricks) append(bytes, &(b.*part), 1);
  // Differences along x pack better than codes.
  for (std::size_t n = 0; n < packed.codes.size(); ++n)
    bytes += static_cast<char>(packed.codes[n] - (n % kPackedWidth ? packed.codes[n - 1] : 0));
  level.depth = packed.depth;
  level.block = packedText(bytes);
  level.about = {{"depth", packed.depth},
                 {"origin", numbers(packed.origin)},
                 {"spacing", packed.spacing},
                 {"levels", packed.levels},
                 {"bricks", packed.bricks.size()}};
  return level;
}

struct Channel {
  ordered_json about;
  std::vector<Level> levels; ///< the coarsest first
  std::uint64_t bytes() const {
    std::uint64_t sum = 0;
    for (Level const& level : levels) sum += level.block.size();
    return sum;
  }
};

// Depths from the roots on, until one is too large.
std::vector<Level> packLevels(Field const& field, ViewCommandOptions const& options,
                              Progress const& progress) {
  int const finest = finestDepth(field);
  int const deepest = options.look.depth >= 0 ? std::min(options.look.depth, finest) : finest;
  // The first depth at which the field is more than a brick wide.
  Vec3 const extent = field.wholeView().high - field.wholeView().low;
  float const widest = std::max({extent.x, extent.y, extent.z});
  int first = deepest;
  while (first > 0 && widest > std::ldexp(float(kPackedCore), nanovtt::kMaxDepth - first)) --first;
  bool const isLimited = options.look.depth < 0 || options.hasMaxSize;
  std::vector<Level> levels;
  std::uint64_t sum = 0;
  for (int depth = first; depth <= deepest; ++depth) {
    // Each depth is up to eight times as much work as the one above it.
    if (progress) progress("packing", std::ldexp(1.0, 3 * (depth - deepest)) / 8);
    auto const packed = packField(field, {depth, kMostBricks, options.look.render.threads});
    if (packed.bricks.empty()) continue;
    if (packed.bricks.size() > kMostBricks) break;
    Level level = packedLevel(packed);
    if (isLimited && !levels.empty() && sum + level.block.size() > options.maxSize) break;
    if (!levels.empty() && levels.back().about["bricks"] < kFewestBricks)
      sum -= levels.back().block.size(), levels.pop_back();
    sum += level.block.size();
    levels.push_back(std::move(level));
  }
  if (options.look.depth >= 0 && (levels.empty() || levels.back().depth < deepest))
    throw std::invalid_argument(
        fmt::format("its depth {} does not fit{}", deepest, options.hasMaxSize ? " into the size" : ""));
  if (levels.empty()) throw std::invalid_argument("nothing of it differs from the background");
  return levels;
}

char const* nameOf(Mode mode) {
  constexpr char const* names[] = {"fog", "surface", "mip", "mean"};
  return names[static_cast<int>(mode)];
}

ordered_json aboutChannel(Drawing& drawing, double unit) {
  auto const& r = drawing.options();
  Field& field = drawing.field();
  auto const& toWorld = drawing.source().tileToWorld;
  ordered_json rows = ordered_json::array();
  for (Vec3d const& row : toWorld.rows) rows.push_back(numbers(row));
  auto const names = opacityNames();
  bool const isNamed = std::find(names.begin(), names.end(), r.transfer.opacity) != names.end();
  ordered_json about = {{"name", drawing.source().channel},
                        {"mode", nameOf(r.mode)},
                        {"iso", r.iso},
                        {"low", field.low()},
                        {"high", field.high()},
                        {"background", field.background()},
                        {"range", {r.transfer.low, r.transfer.high}},
                        {"log", r.transfer.log},
                        {"colors", r.transfer.colors},
                        {"colored", r.colored},
                        {"opacity", r.transfer.opacity},
                        {"unit", unit},
                        {"rows", rows},
                        {"shift", numbers(toWorld.point(field.origin()))},
                        {"boxLow", numbers(field.wholeView().low.as<double>())},
                        {"boxHigh", numbers(field.wholeView().high.as<double>())},
                        {"levels", ordered_json::array()}};
  if (r.transfer.awayFrom) about["awayFrom"] = r.transfer.from;
  if (!isNamed) {
    // Of the range; where another is chosen in the page, opacities stay where they are.
    auto const transfer = std::make_unique<Transfer>(r.transfer);
    about["ownOpacity"] =
        std::vector<float>(transfer->view().opacity, transfer->view().opacity + kTransferSize);
  }
  return about;
}

// The page may show a surface as fog, whatever its values.
double unitOf(Drawing& drawing, Camera const& camera) {
  auto const& r = drawing.options();
  if (r.opacityUnit > 0) return r.opacityUnit;
  auto const& toWorld = drawing.source().tileToWorld;
  try {
    return opacityUnit(drawing.field(), toWorld, camera, r);
  } catch (std::invalid_argument const&) {
    if (r.mode != Mode::kSurface) throw;
    return toWorld.edge(0);
  }
}

// Colour maps and opacities by name, the same for all channels.
std::string tables(ordered_json& about) {
  std::string bytes;
  about["colorMaps"] = colorMapNames();
  about["opacities"] = opacityNames();
  for (auto const& name : colorMapNames()) {
    std::array<Vec3, 256> colors;
    colorMap(name, colors);
    for (Vec3 const& c : colors) append(bytes, &c.x, 1), append(bytes, &c.y, 1), append(bytes, &c.z, 1);
  }
  for (auto const& name : opacityNames()) {
    TransferOptions options;
    options.opacity = name;
    append(bytes, Transfer(options).view().opacity, kTransferSize);
  }
  return bytes;
}

struct Page {
  ordered_json about;
  std::vector<std::string> blocks;
  std::string summary, note;
};

void addPoints(Page& page, PointCloud const& cloud, ViewCommandOptions const& options) {
  std::uint64_t const beside = viewScript().size() + 8192;
  PackedPoints points = packPoints(cloud, options.maxSize > beside ? options.maxSize - beside : 0);
  page.summary = points.count < cloud.positions.size()
                     ? fmt::format("  {} of {} points\n", points.count, cloud.positions.size())
                     : fmt::format("  {} points\n", points.count);
  page.about["points"] = {{"count", points.count},
                          {"origin", numbers(points.origin)},
                          {"size", numbers(points.size)},
                          {"radius", points.radius}};
  page.blocks.push_back(std::move(points.block));
}

Page makePage(ViewCommandOptions const& options, ProgressBar& bar) {
  Page page;
  std::vector<Channel> channels;
  auto names = options.channels;
  if (names.empty()) names.emplace_back();
  for (std::size_t n = 0; n < names.size(); ++n) {
    auto const from = double(n) / double(names.size()), to = double(n + 1) / double(names.size());
    Drawing drawing(options.look, names[n], bar.progress(from, from + 0.5 * (to - from)));
    page.note = drawing.source().note;
    Camera const camera = drawing.camera(0, 1);
    if (n == 0)
      page.about["camera"] = {{"position", numbers(camera.position)},
                              {"focalPoint", numbers(camera.focalPoint)},
                              {"viewUp", numbers(camera.viewUp)},
                              {"viewAngle", camera.viewAngle}};
    if (drawing.source().points) {
      addPoints(page, *drawing.source().points, options);
      return page;
    }
    Channel channel;
    channel.about = aboutChannel(drawing, unitOf(drawing, camera));
    channel.levels = packLevels(drawing.field(), options, bar.progress(from + 0.5 * (to - from), to));
    channels.push_back(std::move(channel));
  }
  auto const& light = options.look.render.light;
  if (length(light) > 0) page.about["light"] = numbers(normalized(light));
  std::string const common = packedText(tables(page.about));

  // Where all together are too large, the largest goes without its deepest depth.
  bool const isLimited = options.look.depth < 0 || options.hasMaxSize;
  auto const total = [&] {
    // Beside the blocks: the scripts, and a description of less than a page of paper for each channel.
    std::uint64_t sum = viewScript().size() + common.size() + 4096 * (2 + channels.size());
    for (Channel const& channel : channels) sum += channel.bytes();
    return sum;
  };
  while (isLimited && total() > options.maxSize) {
    auto const largest = std::max_element(channels.begin(), channels.end(), [](auto const& a, auto const& b) {
      return a.levels.back().block.size() < b.levels.back().block.size();
    });
    if (options.look.depth >= 0 || largest->levels.size() == 1)
      throw std::invalid_argument(
          fmt::format("does not fit into {} bytes: it takes {}", options.maxSize, total()));
    largest->levels.pop_back();
  }

  page.blocks.push_back(common);
  page.about["channels"] = ordered_json::array();
  for (Channel& channel : channels) {
    for (Level& level : channel.levels) {
      level.about["block"] = page.blocks.size();
      page.blocks.push_back(std::move(level.block));
      channel.about["levels"].push_back(std::move(level.about));
    }
    auto const& finest = channel.about["levels"].back();
    page.summary += fmt::format("  {}: depth {}, {} bricks\n", oneLine(channel.about["name"], 60),
                                finest["depth"].get<int>(), finest["bricks"].get<std::size_t>());
    page.about["channels"].push_back(std::move(channel.about));
  }
  return page;
}

} // namespace

void view(ViewCommandOptions const& options) {
  std::string const& file = options.look.file;
  std::string const output = options.look.output.empty()
                                 ? std::filesystem::path(file).stem().string() + ".html"
                                 : options.look.output;
  if (viewScript().empty())
    throw std::runtime_error(
        "this program was built without the viewer's page; -DVLN_WITH_VIEW=ON builds it in "
        "(docs/viewing.md)");
  checkOutputFor(FileContent::kPages, output);
  TransferOptions early; // what is wrong with the opacity is told before the file is read
  early.opacity = options.look.render.transfer.opacity;
  Transfer const unused(early);
  Page page;
  {
    ProgressBar bar;
    try {
      page = makePage(options, bar);
    } catch (std::invalid_argument const& error) { throw FileError(file, error.what()); }
  }
  std::string const title = std::filesystem::path(file).filename().string();
  page.about["title"] = title;
  writeViewPage(output, title, page.about, page.blocks);
  std::error_code error;
  auto const size = std::filesystem::file_size(output, error);
  remarks(output) << output << (error ? "" : fmt::format(", {:.1f} MB", double(size) / 1e6)) << "\n"
                  << page.summary;
  if (!page.note.empty()) std::cerr << fmt::format("vln: {}: note: {}\n", file, page.note);
}

} // namespace Vln
