// Round trip: read a .vdb file into a volume, change one value, write it out again, and read that back.
//
//   example_vdb_round_trip [FILE.vdb]
//
// Without a file a small cloud is made first. All output goes below a temporary folder, which is removed at
// the end.
#include "GeometryVolume/channels/ChannelReader.h"
#include "GeometryVolume/channels/NonLeafValues.h"
#include "Interop/VdbExport.h"
#include "Interop/VdbImport.h"
#include "Interop/VdbMake.h"

#include <bit>
#include <cstdint>
#include <cstdlib>
#include <exception>
#include <filesystem>
#include <iostream>
#include <optional>
#include <stdexcept>
#include <string>
#include <utility>

using namespace VLN::Interop;
using namespace VLN::TileTree3D;

// What the importer makes: the power-of-two shape, and channels without a halo.
using Shape = PowerOfTwoTraits;
using Tree = Container<Shape>;
using FloatChannel = Channel<Shape, float, 4, 0>;

namespace {

class TemporaryFolder {
public:
  TemporaryFolder() {
    std::string name = (std::filesystem::temp_directory_path() / "vdb_round_trip.XXXXXX").string();
    if (!mkdtemp(name.data())) throw std::runtime_error("no temporary folder");
    m_path = name;
  }
  TemporaryFolder(TemporaryFolder const&) = delete;
  TemporaryFolder& operator=(TemporaryFolder const&) = delete;
  ~TemporaryFolder() {
    std::error_code ignored;
    std::filesystem::remove_all(m_path, ignored);
  }
  std::string file(char const* name) const { return (m_path / name).string(); }

private:
  std::filesystem::path m_path;
};

// A voxel of the file: a sample of a tile at the deepest depth.
struct Voxel {
  TreeIndex tile;
  int3 sample; // in the tile
  int3 index;  // in the file, which is a position in tile space
};

template <class Body> void forEachVoxel(Tree const& tree, Body const& body) {
  for (std::int64_t n = 0; n < tree.tileCount(Shape::kMaxDepth); ++n) {
    auto const& tile = tree.tile(n, Shape::kMaxDepth);
    for (int k = 0; k < Shape::kTDW; ++k)
      for (int j = 0; j < Shape::kTDW; ++j)
        for (int i = 0; i < Shape::kTDW; ++i)
          body(Voxel{tile.treeIndex(), {i, j, k}, tile.childDataTIJK(i, j, k)});
  }
}

std::optional<Voxel> greatestVoxel(Tree const& tree, FloatChannel const& channel) {
  std::optional<Voxel> greatest;
  float value = 0;
  forEachVoxel(tree, [&](Voxel const& v) {
    float const here = channel.tileData(v.tile)(v.sample);
    if (!greatest || here > value) greatest = v, value = here;
  });
  return greatest;
}

bool sameBits(float a, float b) { return std::bit_cast<std::uint32_t>(a) == std::bit_cast<std::uint32_t>(b); }

std::size_t firstVolumeWithFloats(VdbImport const& content, std::string& channel) {
  for (std::size_t v = 0; v < content.volumes.size(); ++v)
    for (VdbChannel const& c : content.volumes[v].channels)
      if (c.type == "float") {
        channel = c.name;
        return v;
      }
  throw std::runtime_error(content.file + ": has no float grid");
}

int roundTrip(std::string const& input, std::string const& output) {
  // Import. Grids that share a transform are channels of one volume; what cannot come in is named.
  VdbImport const content = importVdb(input);
  std::cout << "read " << content.volumes.size() << " volume(s)\n";
  for (SkippedGrid const& s : content.skipped)
    std::cout << "  left out: " << s.grid << ": " << s.reason << '\n';

  std::string name;
  std::size_t const which = firstVolumeWithFloats(content, name);
  VdbVolume const& volume = content.volumes[which];
  VLN::Object& object = *volume.object;
  auto const tree = object.component<Tree>(kVdbContainerName);
  std::cout << "  '" << name << "': " << volume.channel(name)->activeVoxels << " active voxels in "
            << tree->tileCount(-1) << " tiles\n";

  // Change. Taken out of its object, the channel belongs to this function alone, so it may be written.
  auto channel = object.extractComponent<FloatChannel>(name);
  std::optional<Voxel> const voxel = greatestVoxel(*tree, *channel);
  if (!voxel) throw std::runtime_error(input + ": '" + name + "' has no leaf whose values could change");
  float& value = channel->tileData(voxel->tile)(voxel->sample);
  float const before = value;
  value = before == 0 ? 1.0f : before / 2;
  float const after = value;
  // Coarse tiles repeat values of the finer ones below them: bring them into step.
  setNonLeafValueToChildValue(*channel, *tree, kVoxelOffsetCorner, 0, Shape::kMaxDepth);
  // World positions go through the transform of the file, whatever it is.
  auto const& [i, j, k] = voxel->index;
  auto const world = volume.indexToWorld.toWorld({double(i), double(j), double(k)});
  std::cout << "changed voxel (" << i << ", " << j << ", " << k << ") at world (" << world.x << ", "
            << world.y << ", " << world.z << ") from " << before << " to " << after << '\n';
  object.putComponent(std::move(channel));

  // Export: all volumes, so that all grids of the input are in the output.
  exportVdb(content.volumes, output);
  std::cout << "wrote " << std::filesystem::file_size(output) << " bytes\n";

  // Read back. A reader finds the value at any position of tile space.
  VdbImport const copy = importVdb(output);
  VdbVolume const& again = copy.volumes.at(which);
  auto const original = object.component<FloatChannel>(name);
  auto const copied = again.object->component<FloatChannel>(name);
  auto const copiedTree = again.object->component<Tree>(kVdbContainerName);
  if (!copied || !copiedTree) throw std::runtime_error("the copy has no '" + name + "'");
  ChannelReader const reader(*copiedTree, *copied);
  std::int64_t voxels = 0, different = 0;
  forEachVoxel(*tree, [&](Voxel const& v) {
    ++voxels;
    if (!sameBits(std::as_const(*original).tileData(v.tile)(v.sample), reader.value(v.index))) ++different;
  });
  std::cout << "read back: " << again.channel(name)->activeVoxels << " active voxels; of " << voxels
            << " voxels in leaves " << different << " differ\n";
  return different == 0 && sameBits(reader.value(voxel->index), after) && !sameBits(before, after) ? 0 : 1;
}

} // namespace

int main(int argc, char** argv) {
  try {
    TemporaryFolder const folder;
    std::string input = argc > 1 ? argv[1] : "";
    if (input.empty()) {
      input = folder.file("cloud.vdb");
      makeCloud(input, 50000);
    }
    return roundTrip(input, folder.file("copy.vdb"));
  } catch (std::exception const& error) {
    // What goes wrong with a file is one line: "FILE: what is wrong".
    std::cerr << error.what() << '\n';
    return 1;
  }
}
