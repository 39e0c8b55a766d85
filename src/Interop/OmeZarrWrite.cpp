#include "Interop/OmeZarrWrite.h"

#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/tiletree/Container.h"
#include "Interop/DenseReaderImpl.h"
#include "Interop/FileError.h"
#include "Interop/FreeNameImpl.h"
#include "Interop/OutputFolder.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>
#include <cstring>
#include <new>
#include <optional>

#include <zlib.h>

namespace VLN::Interop {

namespace {

using Traits = TileTree3D::PowerOfTwoTraits;
using Tree = TileTree3D::Container<Traits>;
using Velorn::Math::int3;

constexpr int kChunk = 64;
constexpr int kCompression = 1;            ///< of zlib's levels
constexpr std::int64_t kChunksAtOnce = 64; ///< between two reports
constexpr std::size_t kLongestName = 200;  ///< bytes: file systems end at 255
constexpr char const* kGroup = "{\"zarr_format\": 2}\n";

std::string quoted(std::string const& text) {
  std::string result = "\"";
  for (char const c : text) {
    if (c == '"' || c == '\\') result += '\\';
    result += c;
  }
  return result + '"';
}

template <class T> std::string digits(T v) {
  char buffer[32];
  return {buffer, std::to_chars(buffer, buffer + sizeof buffer, v).ptr};
}
/// A number as the attributes have it: exact, and with the names that Zarr has for what is no number.
template <class T> std::string numberOf(std::byte const* bytes) {
  T value;
  std::memcpy(&value, bytes, sizeof value);
  if constexpr (std::is_floating_point_v<T>) {
    if (std::isnan(value)) return "\"NaN\"";
    if (std::isinf(value)) return value > 0 ? "\"Infinity\"" : "\"-Infinity\"";
    std::string const text = digits(double(value));
    return text.find_first_of(".e") == std::string::npos ? text + ".0" : text;
  } else
    return digits(+value);
}

std::string fillValue(DenseReader const& reader, std::byte const* value, bool flags) {
  if (flags) return value[0] != std::byte{0} ? "true" : "false";
  switch (reader.scalarBytes) {
  case 1:
    return reader.kind == 'u' ? numberOf<std::uint8_t>(value) : numberOf<std::int8_t>(value);
  case 2:
    return reader.kind == 'u' ? numberOf<std::uint16_t>(value) : numberOf<std::int16_t>(value);
  case 4:
    return reader.kind == 'f'   ? numberOf<float>(value)
           : reader.kind == 'u' ? numberOf<std::uint32_t>(value)
                                : numberOf<std::int32_t>(value);
  default:
    return reader.kind == 'f'   ? numberOf<double>(value)
           : reader.kind == 'u' ? numberOf<std::uint64_t>(value)
                                : numberOf<std::int64_t>(value);
  }
}

std::string typeOf(DenseReader const& reader, bool flags) {
  if (flags) return "|b1";
  return std::string(reader.scalarBytes == 1 ? "|" : "<") + reader.kind + std::to_string(reader.scalarBytes);
}

/// A channel's name as that of a folder.
std::string folderName(std::string const& channel, std::set<std::string>& taken) {
  std::string name = oneLine(channel, kLongestName);
  if (name.size() > kLongestName) {
    std::size_t end = kLongestName;
    while (end > 0 && (static_cast<unsigned char>(name[end]) & 0xc0) == 0x80) --end; // between characters
    name.resize(end);
  }
  std::replace(name.begin(), name.end(), '/', '_');
  std::replace(name.begin(), name.end(), '\\', '_');
  if (!name.empty() && name.front() == '.') name.front() = '_';
  return freeName(name, taken);
}

/// One level of a channel: which chunks of its array may hold more than the background.
class Chunks {
public:
  using Place = std::array<std::int64_t, 3>; ///< z, y, x

  Chunks(std::string const& path, DensePlan const& plan, double chunkBytes)
      : m_path(path)
      , m_plan(plan)
      , m_most(kMostDenseBytes / chunkBytes) {
    for (std::size_t a = 0; a < 3; ++a) m_count[a] = (plan.count[a] + kChunk - 1) / kChunk;
  }

  /// Those that samples [low, high) of the level lie in.
  void add(std::array<std::int64_t, 3> const& low, std::array<std::int64_t, 3> const& high) {
    std::int64_t first[3], last[3];
    double count = 1;
    for (std::size_t a = 0; a < 3; ++a) {
      first[a] = std::max<std::int64_t>(low[a] - m_plan.box.min[int(a)], 0) / kChunk;
      last[a] = (std::min(high[a] - m_plan.box.min[int(a)], m_plan.count[a]) + kChunk - 1) / kChunk;
      if (first[a] >= last[a]) return;
      count *= double(last[a] - first[a]);
    }
    if (count + double(m_places.size()) > m_most) {
      tidy();
      if (count + double(m_places.size()) > m_most)
        throw FileError(m_path, "would take more than 1000 GB at depth " + std::to_string(depth()));
    }
    for (auto z = first[2]; z < last[2]; ++z)
      for (auto y = first[1]; y < last[1]; ++y)
        for (auto x = first[0]; x < last[0]; ++x)
          if (m_places.empty() || m_places.back() != Place{z, y, x}) m_places.push_back({z, y, x});
  }
  void addAll() {
    std::array<std::int64_t, 3> low{}, high{};
    for (std::size_t a = 0; a < 3; ++a) low[a] = m_plan.box.min[int(a)], high[a] = m_plan.box.max[int(a)];
    add(low, high);
  }
  std::vector<Place> const& places() {
    tidy();
    return m_places;
  }

private:
  int depth() const {
    int d = Traits::kMaxDepth;
    while (d > 0 && Traits::width(d) / Traits::kTDW < m_plan.width) --d;
    return d;
  }
  void tidy() {
    std::sort(m_places.begin(), m_places.end());
    m_places.erase(std::unique(m_places.begin(), m_places.end()), m_places.end());
  }

  std::string const& m_path;
  DensePlan const& m_plan;
  double m_most;
  std::array<std::int64_t, 3> m_count{};
  std::vector<Place> m_places;
};

class Writer {
public:
  Writer(std::string const& path, std::vector<DenseVolume> const& volumes, Progress const& progress)
      : m_path(path)
      , m_volumes(volumes)
      , m_progress(progress) {}

  void run() {
    m_out.emplace(m_path, kZarrMark);
    for (auto const& volume : m_volumes) m_images += double(volume.channels.size());
    if (m_images == 0) throw FileError(m_path, "there is no channel to be written");
    std::set<std::string> taken{"OME"};
    std::string series;
    m_out->write(kZarrMark, std::string(kGroup));
    for (auto const& volume : m_volumes) {
      auto const levels = planLevels(volume);
      for (std::size_t n = 0; n < volume.channels.size(); ++n) {
        std::string folder;
        if (m_images > 1) {
          std::string const name = folderName(volume.channels[n], taken);
          series += (series.empty() ? "" : ", ") + quoted(name);
          folder = name + "/";
          m_out->write(folder + kZarrMark, std::string(kGroup));
        }
        writeImage(folder, volume, levels, n);
        ++m_imagesDone;
      }
    }
    if (m_images > 1) {
      m_out->write(".zattrs", "{\"bioformats2raw.layout\": 3}\n");
      m_out->write("OME/.zgroup", std::string(kGroup));
      m_out->write("OME/.zattrs", "{\"series\": [" + series + "]}\n");
    }
    m_out->commit();
    report("done", 1);
  }

private:
  void report(char const* stage, double done) const {
    if (m_progress) m_progress(stage, done);
  }

  struct Level {
    int depth;
    DensePlan plan;
  };
  /// Of boxes that may be larger than any dense one.
  static double samplesOf(Level const& level) {
    auto const& count = level.plan.count;
    return double(count[0]) * double(count[1]) * double(count[2]);
  }

  std::vector<Level> planLevels(DenseVolume const& volume) {
    auto const tree = volume.object.component<Tree>(kVdbContainerName);
    std::vector<Level> levels;
    for (int depth = Traits::kMaxDepth; depth >= 0; --depth) {
      if (!tree || tree->tileCount(depth) == 0) continue;
      DenseVolume at = volume;
      at.depth = depth;
      levels.push_back({depth, planDense(m_path, at, true)});
      auto const& m = levels.back().plan.toWorld;
      for (int a = 0; a < 3; ++a) {
        double const others = std::abs(m[(a + 1) % 3][a]) + std::abs(m[(a + 2) % 3][a]);
        if (!(m[a][a] > 0) || !(others <= 1e-9 * m[a][a]))
          throw FileError(m_path, "the transform of the volume turns, mirrors or skews it, which .zarr files "
                                  "cannot tell");
      }
    }
    if (levels.empty()) throw FileError(m_path, "the volume has no tile, and so no level to be written");
    return levels;
  }

  void writeImage(std::string const& folder, DenseVolume const& volume, std::vector<Level> const& levels,
                  std::size_t channel) {
    std::string const& name = volume.channels[channel];
    bool const vector = levels.front().plan.readers[channel]->components > 1;
    std::string sets;
    for (std::size_t n = 0; n < levels.size(); ++n) {
      DensePlan const& plan = levels[n].plan;
      std::string scale, translation;
      for (int a = 2; a >= 0; --a) {
        scale += (scale.empty() ? "" : ", ") + digits(plan.toWorld[a][a]);
        translation += (translation.empty() ? "" : ", ") +
                       digits(plan.toWorld[a][3] + plan.toWorld[a][a] * double(plan.box.min[a]));
      }
      sets.append(n ? ",\n" : "").append("   {\"path\": \"").append(std::to_string(n));
      sets.append("\", \"coordinateTransformations\": [{\"type\": \"scale\", \"scale\": [");
      sets.append(vector ? "1.0, " : "").append(scale);
      sets.append("]}, {\"type\": \"translation\", \"translation\": [");
      sets.append(vector ? "0.0, " : "").append(translation).append("]}]}");
    }
    std::string axes = vector ? "{\"name\": \"c\", \"type\": \"channel\"}, " : "";
    axes += "{\"name\": \"z\", \"type\": \"space\"}, {\"name\": \"y\", \"type\": \"space\"}, "
            "{\"name\": \"x\", \"type\": \"space\"}";
    m_out->write(folder + ".zattrs", "{\"multiscales\": [{\"version\": \"0.4\", \"name\": " +
                                         quoted(oneLine(name, kLongestName)) + ",\n  \"axes\": [" + axes +
                                         "],\n  \"datasets\": [\n" + sets + "]}]}\n");
    bool const flags = std::find(volume.flags.begin(), volume.flags.end(), name) != volume.flags.end();
    double samples = 0, done = 0;
    for (Level const& level : levels) samples += samplesOf(level);
    for (std::size_t n = 0; n < levels.size(); ++n) {
      double const share = samplesOf(levels[n]) / samples;
      writeArray(folder + std::to_string(n) + "/", volume, levels[n], *levels[n].plan.readers[channel], flags,
                 [&](double part) {
                   report("writing the levels", (m_imagesDone + done + share * part) / m_images);
                 });
      done += share;
    }
  }

  void writeArray(std::string const& folder, DenseVolume const& volume, Level const& level,
                  DenseReader const& reader, bool flags, auto const& reportProgress) {
    DensePlan const& plan = level.plan;
    auto const background = reader.background();
    auto const scalar = static_cast<std::size_t>(reader.scalarBytes);
    std::string shape, chunks;
    std::size_t chunk[3], chunkBytes = scalar;
    for (int a = 2; a >= 0; --a) {
      chunk[a] = static_cast<std::size_t>(std::min<std::int64_t>(plan.count[a], kChunk));
      chunkBytes *= chunk[a];
      shape += (shape.empty() ? "" : ", ") + std::to_string(plan.count[a]);
      chunks += (chunks.empty() ? "" : ", ") + std::to_string(chunk[a]);
    }
    if (reader.components > 1) {
      shape = std::to_string(reader.components) + ", " + shape;
      chunks = "1, " + chunks;
    }
    m_out->write(folder + ".zarray",
                 "{\"zarr_format\": 2, \"shape\": [" + shape + "], \"chunks\": [" + chunks +
                     "], \"dtype\": \"" + typeOf(reader, flags) +
                     "\", \"order\": \"C\", \"fill_value\": " + fillValue(reader, background.data(), flags) +
                     ", \"filters\": null, \"compressor\": {\"id\": \"zlib\", \"level\": " +
                     std::to_string(kCompression) + "}, \"dimension_separator\": \"/\"}\n");
    // An array has one such value. Where components differ in it, what is empty in one is not in another.
    Chunks marked(m_path, plan, double(chunkBytes) * reader.components);
    bool same = true;
    for (std::size_t c = 1; c < background.size() / scalar; ++c)
      same = same && std::memcmp(background.data(), background.data() + c * scalar, scalar) == 0;
    if (same)
      mark(volume, level, reader, background, marked);
    else
      marked.addAll();
    auto const& places = marked.places();
    std::vector<std::byte> empty(chunkBytes);
    for (std::size_t at = 0; at < chunkBytes; at += scalar)
      std::memcpy(&empty[at], background.data(), scalar);
    auto const count = static_cast<std::int64_t>(places.size()) * reader.components;
    for (std::int64_t first = 0; first < count; first += kChunksAtOnce) {
      reportProgress(double(first) / double(count));
      parallelFor(first, std::min(first + kChunksAtOnce, count), [&](std::int64_t begin, std::int64_t end) {
        std::vector<std::byte> values, slice;
        for (auto n = begin; n < end; ++n) {
          auto const& place = places[n / reader.components];
          auto const c = static_cast<int>(n % reader.components);
          values = empty;
          read(level, reader, place, c, chunk, values, slice);
          if (values == empty) continue;
          std::string name = reader.components > 1 ? std::to_string(c) + "/" : "";
          name += std::to_string(place[0]) + "/" + std::to_string(place[1]) + "/" + std::to_string(place[2]);
          pack(folder + name, values);
        }
      });
    }
  }

  /// The chunks that tiles of the level lie in, or a coarser sample that holds for the level and is not
  /// empty.
  static void mark(DenseVolume const& volume, Level const& level, DenseReader const& reader,
                   std::vector<std::byte> const& background, Chunks& marked) {
    auto const tree = volume.object.component<Tree>(kVdbContainerName);
    std::int64_t const width = level.plan.width;
    auto const add = [&](int3 const& low, std::int64_t wide) {
      std::array<std::int64_t, 3> first{}, last{};
      for (int a = 0; a < 3; ++a) {
        // Corners of tiles are multiples of their widths, and those of what the level's samples are.
        first[a] = low[a] / width;
        last[a] = (low[a] + wide) / width;
      }
      marked.add(first, last);
    };
    std::size_t const bytes = background.size();
    std::vector<std::byte> values(16 * bytes);
    for (int d = 0; d <= level.depth; ++d)
      for (std::int64_t n = 0; n < tree->tileCount(d); ++n) {
        auto const& tile = tree->tile(n, d);
        std::int64_t const sample = tile.voxelDataWidth();
        if (d == level.depth) {
          add(tile.tijk(), sample * Traits::kTDW);
          continue;
        }
        IndexBox box;
        for (int a = 0; a < 3; ++a) {
          box.min[a] = static_cast<int>(tile.tijk()[a] / sample);
          box.max[a] = box.min[a] + Traits::kTDW;
        }
        for (int z = 0; z < Traits::kTDW; ++z) {
          reader.slice(box, box.min.z + z, d, 0, reader.components, values.data());
          for (int y = 0; y < Traits::kTDW; ++y)
            for (int x = 0; x < Traits::kTDW; ++x)
              if (tile.isLeaf(x / 2, y / 2, z / 2) &&
                  std::memcmp(&values[static_cast<std::size_t>(x + 4 * y) * bytes], background.data(),
                              bytes) != 0)
                add(tile.childDataTIJK(x, y, z), sample);
        }
      }
  }

  /// A chunk of one component; what lies beyond the array is left as it is.
  static void read(Level const& level, DenseReader const& reader, Chunks::Place const& place, int component,
                   std::size_t const (&chunk)[3], std::vector<std::byte>& values,
                   std::vector<std::byte>& slice) {
    IndexBox box;
    for (int a = 0; a < 3; ++a) {
      box.min[a] = static_cast<int>(level.plan.box.min[a] + place[2 - a] * kChunk);
      box.max[a] =
          static_cast<int>(std::min<std::int64_t>(std::int64_t(box.min[a]) + kChunk, level.plan.box.max[a]));
    }
    auto const scalar = static_cast<std::size_t>(reader.scalarBytes);
    auto const wide = static_cast<std::size_t>(box.max.x - box.min.x) * scalar;
    slice.resize(wide * static_cast<std::size_t>(box.max.y - box.min.y));
    for (int z = box.min.z; z < box.max.z; ++z) {
      reader.slice(box, z, level.depth, component, component + 1, slice.data());
      for (int y = box.min.y; y < box.max.y; ++y)
        std::memcpy(&values[(static_cast<std::size_t>(z - box.min.z) * chunk[1] +
                             static_cast<std::size_t>(y - box.min.y)) *
                            chunk[0] * scalar],
                    &slice[static_cast<std::size_t>(y - box.min.y) * wide], wide);
    }
  }

  void pack(std::string const& name, std::vector<std::byte> const& values) const {
    uLongf size = compressBound(values.size());
    std::vector<Bytef> packed(size);
    if (compress2(packed.data(), &size, reinterpret_cast<Bytef const*>(values.data()), values.size(),
                  kCompression) != Z_OK)
      throw std::bad_alloc();
    m_out->write(name, packed.data(), size);
  }

  std::string const& m_path;
  std::vector<DenseVolume> const& m_volumes;
  Progress const& m_progress;
  std::optional<OutputFolder> m_out;
  double m_images = 0, m_imagesDone = 0;
};

} // namespace

void writeOmeZarr(std::string const& path, std::vector<DenseVolume> const& volumes,
                  Progress const& progress) {
  Writer(path, volumes, progress).run();
}

} // namespace VLN::Interop
