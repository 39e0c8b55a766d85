// What options exclude each other, what is said on standard error, and what is logged.
#include "FlatChecks.h"
#include "support/CaptureStream.h"

#include <gtest/gtest.h>
#include <tbb/task_arena.h>

namespace {

using namespace Support;
using nanovtt::AlignedHostBuffer;
using nanovtt::CopyableCudaDeviceBuffer;
using Handle = nanovtt::GridHandle<AlignedHostBuffer>;

constexpr char const* kTraversalOff =
    "VTTToNanoVTT: enableNanoVTTTraversal disabled. Requirements: out_traversalStructure != nullptr and "
    "coalesceTileData == false.\n";
constexpr char const* kTexturesOff =
    "VTTToNanoVTT: storeTileDataAs3DTextures disabled. Requirements: currently not supported with "
    "quantization nor tile data coalescing.\n";
constexpr char const* kNeighborsOff =
    "VTTToNanoVTT: enableNanoVTTNeighbors disabled. Requirements: out_neighborStructure != nullptr and "
    "coalesceTileData == false.\n";
constexpr char const* kCoalesceOff =
    "VTTToNanoVTT: coalesceTileData disabled. Requirements: currently not supported with quantization.\n";
constexpr char const* kCoarserOff =
    "VTTToNanoVTT: setCoarserLevels disabled. Requirements: VoxelT != nanovdb::FpN.\n";

std::string bytesOf(std::uint8_t const* data, std::uint64_t size) {
  return {reinterpret_cast<char const*>(data), size};
}
template <class B> std::string bytesOf(nanovtt::GridHandle<B> const& handle) {
  return bytesOf(handle.data(), handle.size());
}

struct Said {
  std::string bytes, out, err;
};
template <class BuildT = void, bool kCoalesce = true>
Said convert(VLN::Object const& object, FlatOptions const& options, AlignedHostBuffer* traversal = nullptr,
             AlignedHostBuffer* neighbors = nullptr) {
  CaptureStream out(std::cout), err(std::cerr);
  auto const handle = flatten<BuildT, AlignedHostBuffer, kCoalesce>(object, options, traversal, neighbors);
  return {bytesOf(handle), out.text(), err.text()};
}

class FlatOptionsTest : public ::testing::Test {
protected:
  FlatOptionsTest() {
    fillRandom(volume, 42, 200);
    base.rootLevelLimit = 28 - volume.top;
  }
  VLN::Object const& object() const { return *volume.object; }

  FlatVolume volume;
  FlatOptions base;
};

TEST_F(FlatOptionsTest, RequirementWithoutVerbosityNothingIsLogged) {
  auto const said = convert(object(), base);
  EXPECT_FALSE(said.bytes.empty());
  EXPECT_EQ(said.out, "");
  EXPECT_EQ(said.err, "");
}

TEST_F(FlatOptionsTest, BoundaryFinestLevelIsClamped) {
  auto options = base;
  options.finestLevel = -1;
  auto const said = convert(object(), options);
  options.finestLevel = 0;
  EXPECT_EQ(said.bytes, convert(object(), options).bytes);
  FlatVolume top;
  top.add({0, 0, 0}, 0, 2);
  top.finish();
  options.finestLevel = 99;
  expectFlat(top, options, flatten(*top.object, options), "finest level 99");
  FlatModel const model(flatten(*top.object, options).data(), flatten(*top.object, options).size());
  EXPECT_EQ(model.tiles.size(), 1u) << "depth 0 alone";
}

TEST_F(FlatOptionsTest, RequirementTexturesNeedAHaloForEveryTile) {
  auto options = base;
  options.textures = true, options.haloFraction = 0.99f;
  auto plain = options;
  plain.textures = false;
  auto const said = convert(object(), options);
  EXPECT_EQ(said.err, kTexturesOff);
  EXPECT_EQ(said.bytes, convert(object(), plain).bytes);
  options.haloFraction = 1;
  EXPECT_EQ(convert(object(), options).err, "");
  options.coalesce = true;
  EXPECT_EQ(convert(object(), options).err, kTexturesOff);
}

TEST_F(FlatOptionsTest, RequirementQuantisedBuildsKeepTheirTilesPlain) {
  auto options = base;
  options.coalesce = options.textures = true, options.haloFraction = 1;
  auto plain = options;
  plain.coalesce = plain.textures = false;
  auto const said = convert<nanovdb::Fp8>(object(), options);
  EXPECT_EQ(said.err, std::string(kCoalesceOff) + kTexturesOff);
  EXPECT_EQ(said.bytes, convert<nanovdb::Fp8>(object(), plain).bytes);
  options.setCoarser = true;
  EXPECT_EQ(convert<nanovdb::FpN>(object(), options).err,
            std::string(kCoalesceOff) + kTexturesOff + kCoarserOff);
  EXPECT_EQ(convert<nanovdb::Fp16>(object(), options).err, std::string(kCoalesceOff) + kTexturesOff)
      << "Fp16 sets coarser levels";
}

TEST_F(FlatOptionsTest, RequirementStructuresAreTurnedOffAloud) {
  auto options = base;
  options.traversal = true;
  EXPECT_EQ(convert(object(), options).err, kTraversalOff) << "nowhere to put it";
  AlignedHostBuffer traversal, neighbors;
  EXPECT_EQ(convert(object(), options, &traversal).err, "");
  EXPECT_FALSE(traversal.empty());
  options.coalesce = true;
  traversal.clear();
  EXPECT_EQ(convert(object(), options, &traversal, &neighbors).err,
            std::string(kTraversalOff) + kNeighborsOff);
  EXPECT_TRUE(traversal.empty());
  EXPECT_TRUE(neighbors.empty());
}

TEST_F(FlatOptionsTest, BoundaryATraversalThatIsNotAskedForIsLeftAlone) {
  auto traversal = AlignedHostBuffer::create(5);
  traversal.data()[0] = 77;
  EXPECT_EQ(convert(object(), base, &traversal).err, "");
  EXPECT_EQ(traversal.size(), 5u);
  EXPECT_EQ(traversal.data()[0], 77);
}

TEST_F(FlatOptionsTest, RequirementNeighborsNeedNoTraversal) {
  AlignedHostBuffer neighbors;
  EXPECT_EQ(convert(object(), base, nullptr, &neighbors).err, "");
  EXPECT_FALSE(neighbors.empty());
  neighbors.clear();
  EXPECT_EQ(convert<nanovdb::Fp4>(object(), base, nullptr, &neighbors).err, "");
  EXPECT_FALSE(neighbors.empty());
}

std::uint64_t structureSize(std::uint64_t bytes, FlatOptions const& options) {
  auto const element = static_cast<std::uint64_t>(options.elementBytes);
  if (options.textures) return (bytes + element * 16384 - 1) / (element * 16384) * (element * 16384);
  if (!options.cubic) return bytes;
  std::uint64_t s = 0;
  while (s * s * s * element < bytes) ++s;
  return s * s * s * element;
}

TEST_F(FlatOptionsTest, RequirementStructuresNameEveryTileAndItsNeighbors) {
  for (int kind = 0; kind < 6; ++kind) {
    auto options = base;
    options.traversal = true;
    options.morton = kind == 1, options.cubic = kind >= 2, options.elementBytes = kind == 3 ? 12 : 4;
    if (kind == 4) options.textures = true, options.haloFraction = 1;
    if (kind == 5) options.finestLevel = 28 - volume.top - 1;
    AlignedHostBuffer traversal, neighbors;
    auto const handle = flatten(object(), options, &traversal, &neighbors);
    FlatExpectation const expected(volume.tree, options);
    ASSERT_FALSE(expected.refused);
    std::uint64_t const tiles = expected.tiles.size();
    ASSERT_EQ(traversal.size(), structureSize(tiles * 16, options)) << kind;
    ASSERT_EQ(neighbors.size(), structureSize(tiles * 216, options)) << kind;
    EXPECT_EQ(reinterpret_cast<std::uintptr_t>(traversal.data()) % 32, 0u);
    auto const accessor = volume.tree.tileAccessor();
    for (std::uint64_t n = 0; n < tiles; ++n) {
      auto const& e = *expected.tiles[n];
      std::int32_t row[4];
      std::memcpy(row, traversal.data() + 16 * n, 16);
      ASSERT_TRUE(row[0] == e.corner.x && row[1] == e.corner.y && row[2] == e.corner.z && row[3] == e.depth)
          << kind << ", tile " << n;
      std::uint32_t found[27];
      std::memcpy(found, neighbors.data() + 108 * n, 108);
      EXPECT_EQ(found[13], n);
      for (int d = 0; d < 27; ++d) {
        std::int64_t const w = FlatTraits::width(e.depth);
        std::int64_t const at[3] = {e.corner.x + (d / 9 - 1) * w, e.corner.y + (d / 3 % 3 - 1) * w,
                                    e.corner.z + (d % 3 - 1) * w};
        std::uint32_t wanted = 0xFFFFFFFFu;
        if (*std::min_element(at, at + 3) >= FlatTraits::kMinTileCoord &&
            *std::max_element(at, at + 3) <= FlatTraits::kMaxTileCoord) {
          auto const& tile = accessor.tile(static_cast<int>(at[0]), static_cast<int>(at[1]),
                                           static_cast<int>(at[2]), e.depth, false);
          if (tile.valid() && tile.depth() >= expected.rootDepth)
            wanted = expected.find(tile.tijk(), tile.depth())->number;
        }
        ASSERT_EQ(found[d], wanted) << kind << ", tile " << n << ", direction " << d;
      }
    }
  }
}

TEST_F(FlatOptionsTest, RequirementTheFormWithoutCoalescingLaysTilesOutPlain) {
  auto options = base;
  auto const plain = convert(object(), options).bytes;
  EXPECT_EQ((convert<void, false>(object(), options).bytes), plain);
  options.coalesce = true;
  EXPECT_EQ((convert<void, false>(object(), options).bytes), plain);
  EXPECT_NE(convert(object(), options).bytes, plain);
}

TEST_F(FlatOptionsTest, RequirementBothBufferTypesHoldTheSameBytes) {
  auto const plain = convert(object(), base).bytes;
  auto options = base;
  options.traversal = true;
  CopyableCudaDeviceBuffer traversal, neighbors;
  auto const handle = flatten<void, CopyableCudaDeviceBuffer>(object(), options, &traversal, &neighbors);
  EXPECT_EQ(bytesOf(handle), plain);
  AlignedHostBuffer hostTraversal, hostNeighbors;
  convert(object(), options, &hostTraversal, &hostNeighbors);
  EXPECT_EQ(bytesOf(traversal.data(), traversal.size()), bytesOf(hostTraversal.data(), hostTraversal.size()));
  EXPECT_EQ(bytesOf(neighbors.data(), neighbors.size()), bytesOf(hostNeighbors.data(), hostNeighbors.size()));
  EXPECT_EQ((bytesOf(flatten<nanovdb::FpN, CopyableCudaDeviceBuffer, false>(object(), base))),
            convert<nanovdb::FpN>(object(), base).bytes);
}

TEST_F(FlatOptionsTest, RequirementAllBuffersComeFromThePool) {
  auto options = base;
  options.traversal = true;
  auto const plain = convert(object(), options).bytes;
  auto const pool = AlignedHostBuffer::createPool(16 << 20);
  AlignedHostBuffer traversal, neighbors;
  // What lies askew in the pool does not matter.
  auto const odd = AlignedHostBuffer::create(13, &pool);
  auto const first = flatten(object(), options, &traversal, &neighbors, nullptr, pool);
  auto const second = flatten(object(), options, &traversal, &neighbors, nullptr, pool);
  EXPECT_EQ(bytesOf(first), plain);
  EXPECT_EQ(bytesOf(second), plain);
  for (auto const* data : {first.data(), second.data(), static_cast<std::uint8_t const*>(traversal.data()),
                           static_cast<std::uint8_t const*>(neighbors.data())}) {
    EXPECT_EQ(reinterpret_cast<std::uintptr_t>(data) % 32, 0u);
  }
  EXPECT_EQ(first.buffer().pool(), pool.pool());
  EXPECT_EQ(traversal.pool(), pool.pool());
  EXPECT_EQ(neighbors.pool(), pool.pool());
  EXPECT_EQ(pool.pool()->bufferCount(), 5u) << "no pad stays";

  auto const small = AlignedHostBuffer::createPool(1000);
  EXPECT_THROW((flatten<void, AlignedHostBuffer>(object(), base, nullptr, nullptr, nullptr, small)),
               std::runtime_error);
  EXPECT_EQ(small.pool()->bufferCount(), 0u);
}

TEST_F(FlatOptionsTest, NegativeMissingComponentsGiveAnEmptyHandle) {
  auto const nothing = VLN::createEmptyVLN();
  auto options = base;
  EXPECT_EQ(convert(*nothing, options).bytes, "");
  options.verbosity = 1;
  auto const said = convert(*nothing, options);
  EXPECT_EQ(said.err, "");
  EXPECT_EQ(said.out.find("Container pass 1"), std::string::npos);
  EXPECT_NE(said.out.find("converted from VTT to NanoVTT in "), std::string::npos);
}

TEST_F(FlatOptionsTest, BoundaryAFilterThatNothingPasses) {
  for (std::string const filter : {"nothing", "", " ", "$", "!*"}) {
    auto options = base;
    options.filter = filter;
    auto const handle = flatten(object(), options);
    FlatModel const model(handle.data(), handle.size());
    EXPECT_TRUE(model.grids.empty()) << filter;
    EXPECT_FALSE(model.tiles.empty()) << filter;
  }
  auto options = base;
  options.filter = "c* !c1";
  auto const handle = flatten(object(), options);
  FlatModel const model(handle.data(), handle.size());
  for (auto const& grid : model.grids) EXPECT_NE(grid.name, "c1");
  EXPECT_GT(model.grids.size(), 2u);
}

// The words of the log, in their order.
void expectWords(std::string const& text, std::vector<std::string> const& words) {
  std::size_t at = 0;
  for (auto const& word : words) {
    auto const found = text.find(word, at);
    ASSERT_NE(found, std::string::npos) << '"' << word << "\" is not behind byte " << at << " of\n" << text;
    at = found + word.size();
  }
}

TEST_F(FlatOptionsTest, RequirementTheLogTellsEveryStage) {
  auto options = base;
  options.verbosity = 1, options.setCoarser = true;
  auto const said = convert(object(), options);
  EXPECT_EQ(said.err, "");
  FlatExpectation const expected(volume.tree, options);
  std::string const tiles = std::to_string(expected.tiles.size());
  expectWords(said.out, {"Building perfect hash table at depth ",
                         " maxTileSpaceSize = ",
                         " maxTileSpaceEntries = ",
                         " llc = ",
                         " tvw = ",
                         "rootDepth = " + std::to_string(expected.rootDepth),
                         "number of roots = ",
                         "maxRoots = 262144",
                         "numNonLeavesAtCoarserDepths = ",
                         "Container size alignment = ",
                         "haloOptDepth = ",
                         ", haloOptFraction = ",
                         ", haloOptBudget = ",
                         "numNanoVTTTiles = " + tiles,
                         "numHaloTiles = ",
                         "numNonHaloTiles = ",
                         "tdOffset[numNanoVTTTiles] = ",
                         "Container pass 1 = ",
                         "Grid #",
                         ": Found channel of type '",
                         "' and name 'c0' and grid size ",
                         "Found #",
                         " number of grids",
                         "Channels pass 1 = ",
                         "numNanoVTTTiles = " + tiles,
                         "bufferSize = ",
                         " - Size of TileDataVariable = 12",
                         " - Size of TreeIndex = 8",
                         " - Size of VoxelCoord = 16",
                         " - Size of TileIndex = 4",
                         " - Size of nanovdb::Coord = 12",
                         " - Traits::kTileSize = 8",
                         "containerSize = ",
                         "gridAndTreeSizeTotal = ",
                         "Allocation and clearing buffers = ",
                         "voxelSize = ",
                         "tileCountAccum[0] = 0",
                         "tileCountAccum[29] = " + tiles,
                         "tileCount[0] = ",
                         "tileCount[28] = ",
                         "BufferSize = ",
                         "numTilesCoalesced = ",
                         "numNonLeavesAtCoarserDepths = ",
                         "Container size = ",
                         "Container hash table size = ",
                         "Potential container memory savings = ",
                         "Potential total memory savings: before: ",
                         "MB, after: ",
                         "Container pass 2 = ",
                         "Channel c0 stats:",
                         " - minDepth = ",
                         " - maxDepth = ",
                         "areCoarserOK = ",
                         "name = 'c0",
                         "containerOffset = ",
                         "Size of tile data = ",
                         "c0: Adding data to tiles and computing bbox = ",
                         "WorldBBox = (",
                         ") to (",
                         "Adding gridAndTreeSize ",
                         "GridVTTBase = ",
                         "GridCount = ",
                         "GridIndex = ",
                         "GridSize = ",
                         "c0: Setting to nullptr (potential dealloc) = ",
                         "Channels pass 2 = ",
                         "converted from VTT to NanoVTT in ",
                         " seconds"});
  options.coalesce = true, options.setCoarser = false;
  expectWords(convert(object(), options).out,
              {"coalesceTileData=ON, NANOVTT_SUPPORT_COALESCED_TILES=ON, kEnableCoalescedTilesSupportT = ON",
               "Compacted tiles[", "] from ", " to "});
  auto const off = convert<void, false>(object(), options).out;
  expectWords(
      off, {"coalesceTileData=ON, NANOVTT_SUPPORT_COALESCED_TILES=OFF, kEnableCoalescedTilesSupportT = OFF"});
  EXPECT_EQ(off.find("Compacted tiles["), std::string::npos);
  options.coalesce = false, options.textures = true, options.haloFraction = 1;
  expectWords(convert(object(), options).out, {"texture dim = ", " for property c0"});
  options.textures = false;
  expectWords(convert<nanovdb::Fp8>(object(), options).out, {"treeSize (quantization) = "});
  expectWords(convert<nanovdb::FpN>(object(), options).out, {"tolerance = 0"});
}

TEST_F(FlatOptionsTest, RequirementBytesDoNotDependOnThreads) {
  auto const at = [&]<class BuildT>(int threads, FlatOptions const& options) {
    tbb::task_arena arena(threads);
    AlignedHostBuffer traversal, neighbors;
    std::string bytes;
    arena.execute([&] {
      bytes = bytesOf(flatten<BuildT>(object(), options, &traversal, &neighbors));
      bytes += bytesOf(traversal.data(), traversal.size()) + bytesOf(neighbors.data(), neighbors.size());
    });
    return bytes;
  };
  for (int kind = 0; kind < 5; ++kind) {
    auto options = base;
    options.checksum = nanovdb::ChecksumMode(2);
    options.haloFraction = kind == 1 ? 0.4f : kind == 2 ? 1.0f : 0.0f;
    options.coalesce = kind == 3, options.morton = kind == 4, options.traversal = kind != 3,
    options.setCoarser = true;
    auto const one = at.operator()<void>(1, options);
    auto const four = at.operator()<nanovdb::Fp4>(1, options);
    options.setCoarser = false;
    auto const any = at.operator()<nanovdb::FpN>(1, options);
    for (int const threads : {2, 8}) {
      EXPECT_EQ(at.operator()<nanovdb::FpN>(threads, options), any) << kind << ", " << threads;
      options.setCoarser = true;
      EXPECT_EQ(at.operator()<void>(threads, options), one) << kind << ", " << threads;
      EXPECT_EQ(at.operator()<nanovdb::Fp4>(threads, options), four) << kind << ", " << threads;
      options.setCoarser = false;
    }
  }
}

} // namespace
