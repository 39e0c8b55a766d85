// The library's reader against the slow one, on random volumes.
#include "Reader/NanoVTTCursor.h"
#include "Reader/NanoVTTValidate.h"
#include "support/FlatChecks.h"

#include <gtest/gtest.h>

#include <type_traits>

namespace {

using namespace Support;

static_assert(std::is_trivially_copyable_v<nanovtt::BufferReader> &&
              std::is_trivially_copyable_v<nanovtt::GridReader>);

void expectSameTree(nanovtt::ContainerReader const& reader, FlatModel const& model,
                    std::string const& label) {
  ASSERT_EQ(reader.tileCount(), model.tiles.size()) << label;
  EXPECT_EQ(reader.rootDepth(), model.rootDepth) << label;
  std::size_t met = 0;
  reader.forEachTile([&](nanovtt::TileRef const& tile) {
    ++met;
    auto const& wanted = model.tiles[tile.number];
    ASSERT_EQ(tile.depth, wanted.depth) << label;
    ASSERT_EQ(reader.depthOf(tile.number), wanted.depth) << label;
    ASSERT_EQ(reader.parent(tile.number), wanted.parent) << label;
    ASSERT_EQ(tile.width(), FlatModel::width(wanted.depth)) << label;
    ASSERT_TRUE(tile.corner.x == wanted.corner.x && tile.corner.y == wanted.corner.y &&
                tile.corner.z == wanted.corner.z)
        << label;
  });
  EXPECT_EQ(met, model.tiles.size()) << label;

  std::mt19937 random(5);
  auto const expectAt = [&](int3 const& p, int depth) {
    auto const tile = reader.find(p.x, p.y, p.z, depth);
    auto const number = model.find(p, depth);
    ASSERT_EQ(tile.number, number) << label << ", at " << p.x << ' ' << p.y << ' ' << p.z << ", depth "
                                   << depth;
    ASSERT_EQ(tile.valid(), number != FlatModel::kNone);
    if (!tile.valid()) return;
    ASSERT_EQ(tile.depth, model.tiles[number].depth) << label;
    int3 const c = model.tiles[number].corner;
    ASSERT_TRUE(tile.corner.x == c.x && tile.corner.y == c.y && tile.corner.z == c.z) << label;
  };
  for (auto const& tile : model.tiles)
    for (int n = 0; n < 4; ++n) {
      std::int64_t const w = FlatModel::width(tile.depth);
      int3 p;
      for (int a = 0; a < 3; ++a)
        p[a] = static_cast<int>(std::clamp<std::int64_t>(
            tile.corner[a] - w / 2 + static_cast<std::int64_t>(random() % static_cast<std::uint64_t>(2 * w)),
            INT32_MIN, INT32_MAX));
      expectAt(p, static_cast<int>(random() % 31) - 1);
    }
  for (int const x : {INT32_MIN, -536870913, -536870912, -1, 0, 536870911, 536870912, INT32_MAX})
    for (int const z : {INT32_MIN, -536870912, 0, INT32_MAX}) expectAt({x, 0, z}, 28);
}

// Tiles by number, without the traversal structure: onward, back, and from anywhere.
void expectSameOrder(nanovtt::ContainerReader const& reader, FlatModel const& model,
                     std::string const& label) {
  auto const count = static_cast<std::uint32_t>(model.tiles.size());
  auto const expectTile = [&](nanovtt::TileRef const& tile, std::uint32_t number) {
    auto const& wanted = model.tiles[number];
    ASSERT_EQ(tile.number, number) << label;
    ASSERT_EQ(tile.depth, wanted.depth) << label << ", tile " << number;
    ASSERT_TRUE(tile.corner.x == wanted.corner.x && tile.corner.y == wanted.corner.y &&
                tile.corner.z == wanted.corner.z)
        << label << ", tile " << number;
  };
  std::uint32_t n = 0;
  for (nanovtt::TileRef const& tile : nanovtt::tilesOf(reader)) expectTile(tile, n++);
  EXPECT_EQ(n, count) << label;
  nanovtt::TileIterator at(reader, count);
  EXPECT_TRUE(at.atEnd());
  while (n > 0) expectTile(*--at, --n);
  std::mt19937 random(7);
  for (int step = 0; step < 200 && count > 0; ++step) {
    at.seek(static_cast<std::uint32_t>(random() % count));
    expectTile(*at, at.number());
    expectTile(*nanovtt::TileIterator(reader, at.number()), at.number());
    if (!(++at).atEnd()) expectTile(*at, at.number());
  }
  for (std::uint32_t tile = 0; tile < count; tile += 3) {
    auto const& t = model.tiles[tile];
    nanovtt::TileRef const ref{tile, t.depth, {t.corner.x, t.corner.y, t.corner.z}};
    bool has = false;
    if (t.depth < 28) {
      auto const list = reader.children(tile);
      for (std::uint32_t c = 0; c < list.count(); ++c) has |= list[c] != nanovtt::kNoTile;
      ASSERT_EQ(reader.hasChildren(tile), has) << label;
    }
    for (int c = 0; c < 27; ++c) {
      std::int64_t const w = FlatModel::width(t.depth);
      std::int64_t const p[3] = {t.corner.x + (c % 3 - 1) * w, t.corner.y + (c / 3 % 3 - 1) * w,
                                 t.corner.z + (c / 9 - 1) * w};
      bool const isIn = std::all_of(p, p + 3, [](auto v) { return v >= INT32_MIN && v <= INT32_MAX; });
      auto const wanted =
          isIn ? model.find({static_cast<int>(p[0]), static_cast<int>(p[1]), static_cast<int>(p[2])}, t.depth)
               : FlatModel::kNone;
      ASSERT_EQ(reader.neighbor(ref, c % 3 - 1, c / 3 % 3 - 1, c / 9 - 1).number, wanted)
          << label << ", tile " << tile << ", neighbour " << c;
    }
  }
}

template <class Value> double componentOf(Value const& value, int c) {
  if constexpr (std::is_arithmetic_v<Value>)
    return static_cast<double>(value) + 0 * c;
  else
    return static_cast<double>(value.v[c]);
}

// A cursor that knows its type, at places in and beside tiles, near each other and not, at every depth limit.
template <nanovtt::GridType kType>
void expectSameReads(nanovtt::GridReader const& grid, FlatModel const& model, std::string const& label) {
  ASSERT_EQ(grid.type(), kType) << label;
  std::mt19937 random(11);
  for (int const limit : {28, 27, 25, 20, -1}) {
    nanovtt::Cursor<kType> cursor(grid, limit);
    for (auto const& tile : model.tiles)
      for (int n = 0; n < 3; ++n) {
        std::int64_t const w = FlatModel::width(tile.depth);
        std::int32_t p[3];
        for (int a = 0; a < 3; ++a)
          p[a] = static_cast<std::int32_t>(std::clamp<std::int64_t>(
              tile.corner[a] - w / 2 +
                  static_cast<std::int64_t>(random() % static_cast<std::uint64_t>(2 * w)),
              INT32_MIN, INT32_MAX));
        for (int step = 0; step < 3; ++step) {
          auto const value = cursor.value(p[0], p[1], p[2]);
          for (int c = 0; c < nanovtt::componentCount(kType); ++c)
            ASSERT_EQ(componentOf(value, c), grid.valueAt(p[0], p[1], p[2], c, limit))
                << label << ", at " << p[0] << ' ' << p[1] << ' ' << p[2] << ", depth " << limit;
          if (p[step] < INT32_MAX) ++p[step];
        }
      }
  }
}

void expectSameReads(nanovtt::GridReader const& grid, FlatModel const& model, std::string const& label) {
  using nanovtt::GridType;
  switch (grid.type()) {
#define FLAT_READS(type)                                                                                     \
  case GridType::type:                                                                                       \
    return expectSameReads<GridType::type>(grid, model, label);
    FLAT_READS(kFloat)
    FLAT_READS(kDouble)
    FLAT_READS(kInt16)
    FLAT_READS(kInt32)
    FLAT_READS(kInt64)
    FLAT_READS(kFloat3)
    FLAT_READS(kDouble3)
    FLAT_READS(kUInt32)
    FLAT_READS(kFp4)
    FLAT_READS(kFp8)
    FLAT_READS(kFp16)
    FLAT_READS(kFpN)
    FLAT_READS(kFloat4)
#undef FLAT_READS
  }
  FAIL() << label << ": type " << static_cast<int>(grid.type());
}

template <class T>
void expectSameBlocks(nanovtt::GridReader const& reader, FlatModel const& model, FlatModel::Grid const& grid,
                      std::string const& label) {
  using Traits = VLN::TileTree3D::ElementTraits<T>;
  for (std::uint32_t n = 0; n < model.tiles.size(); ++n) {
    auto const block = reader.block(n);
    auto const core = 4 << (FlatModel::isQuantised(grid.type) ? 0 : grid.levels(n));
    ASSERT_EQ(block.core, core) << label;
    std::vector<T> wanted;
    if constexpr (std::is_same_v<T, float>) {
      if (FlatModel::isQuantised(grid.type)) {
        auto const q = model.quantised(grid, n);
        ASSERT_EQ(block.bits, q.bits) << label;
        ASSERT_EQ(block.hasHalo(), q.codes.size() == 125) << label;
        for (std::size_t k = 0; k < q.codes.size(); ++k) {
          ASSERT_EQ(block.code(k), q.codes[k]) << label << ", tile " << n;
          wanted.push_back(q.minimum + static_cast<float>(q.codes[k]) * q.quantum);
        }
      }
    }
    if (reader.isTexture()) {
      auto const q = static_cast<int>(reader.textureWidth() / 5), c = static_cast<int>(n) + 1;
      wanted = model.template brick<T>(grid, 5 * q, c % q, c / q % q, c / (q * q));
    } else if (wanted.empty()) {
      wanted = model.template block<T>(grid, n);
    }
    auto const w = static_cast<std::size_t>(block.width);
    ASSERT_EQ(wanted.size(), w * w * w) << label;
    for (std::size_t k = 0; k < wanted.size(); ++k) {
      auto const at =
          block.index(static_cast<int>(k % w), static_cast<int>(k / w % w), static_cast<int>(k / w / w));
      for (int c = 0; c < Traits::kComponents; ++c)
        ASSERT_EQ(block.getComponent(at, c), static_cast<double>(Traits::component(wanted[k], c)))
            << label << ", tile " << n << ", sample " << k;
      if (block.bits) continue;
      T const value = block.get<T>(at);
      ASSERT_EQ(std::memcmp(&value, &wanted[k], sizeof(T)), 0) << label << ", tile " << n << ", sample " << k;
    }
  }
}

template <class HandleT> void expectSame(HandleT const& handle, std::string const& label) {
  if (handle.empty()) return;
  // Of the exact length, so that a sanitizer sees what lies beyond.
  std::vector<std::uint8_t> const bytes(handle.data(), handle.data() + handle.size());
  auto const validation = nanovtt::validate(bytes.data(), bytes.size());
  ASSERT_TRUE(validation.ok()) << label << ": " << validation.message << " at " << validation.position;
  FlatModel const model(bytes.data(), bytes.size());
  nanovtt::BufferReader const reader(bytes.data());
  EXPECT_EQ(reader.container().bufferSize(), bytes.size());
  expectSameTree(reader.container(), model, label);
  expectSameOrder(reader.container(), model, label);
  ASSERT_EQ(reader.gridCount(), model.grids.size()) << label;
  for (std::uint32_t n = 0; n < reader.gridCount(); ++n) {
    auto const& wanted = model.grids[n];
    auto const grid = reader.grid(n);
    EXPECT_EQ(reader.gridOffset(n), wanted.start);
    EXPECT_EQ(reader.find(wanted.name.c_str()), n);
    EXPECT_EQ(grid.name(), wanted.name);
    EXPECT_EQ(static_cast<std::uint32_t>(grid.type()), wanted.type);
    EXPECT_EQ(static_cast<std::uint32_t>(grid.gridClass()), wanted.gridClass);
    EXPECT_EQ(grid.gridSize(), wanted.size);
    EXPECT_EQ(grid.checksum(), wanted.checksum);
    EXPECT_EQ(grid.voxelSize(), wanted.voxelSize);
    for (int k = 0; k < 6; ++k) {
      EXPECT_EQ(grid.tileBox(k), wanted.box[static_cast<std::size_t>(k)]);
      EXPECT_EQ(grid.worldBox(k), wanted.worldBox[static_cast<std::size_t>(k)]);
    }
    EXPECT_EQ(
        std::memcmp(grid.defaultValue().samples, wanted.defaultValue.data(), wanted.defaultValue.size()), 0);
    switch (wanted.type) {
    case 2:
      expectSameBlocks<double>(grid, model, wanted, label);
      break;
    case 3:
      expectSameBlocks<std::int16_t>(grid, model, wanted, label);
      break;
    case 4:
      expectSameBlocks<std::int32_t>(grid, model, wanted, label);
      break;
    case 5:
      expectSameBlocks<std::int64_t>(grid, model, wanted, label);
      break;
    case 6:
      expectSameBlocks<Velorn::Math::float3>(grid, model, wanted, label);
      break;
    case 7:
      expectSameBlocks<Velorn::Math::double3>(grid, model, wanted, label);
      break;
    case 10:
      expectSameBlocks<std::uint32_t>(grid, model, wanted, label);
      break;
    case 17:
      expectSameBlocks<Velorn::Math::float4>(grid, model, wanted, label);
      break;
    default:
      expectSameBlocks<float>(grid, model, wanted, label);
    }
    // A point in each tile, through the whole way down.
    for (std::uint32_t t = 0; t < model.tiles.size(); ++t) {
      auto const corner = model.tiles[t].corner;
      auto const last = static_cast<int>(FlatModel::width(model.tiles[t].depth) - 1);
      nanovtt::TileRef const ref{t, model.tiles[t].depth, {corner.x, corner.y, corner.z}};
      auto const block = grid.block(t);
      int const end = block.core - 1;
      ASSERT_EQ(grid.sampleAt(block, ref, corner.x, corner.y, corner.z), 0u) << label;
      ASSERT_EQ(grid.sampleAt(block, ref, corner.x + last, corner.y + last, corner.z + last),
                block.index(end, end, end))
          << label;
      ASSERT_EQ(grid.valueAt(corner.x, corner.y, corner.z, 0, ref.depth), block.getComponent(0, 0)) << label;
    }
    expectSameReads(grid, model, label);
    ASSERT_EQ(grid.valueAt(INT32_MAX, 0, 0), grid.defaultValue().getComponent(0, 0)) << label;
  }
  EXPECT_EQ(reader.find("no such name"), reader.gridCount());
}

TEST(Reader, RequirementReadsWhatTheSlowReaderReads) {
  for (std::uint32_t seed = 300; seed < 312; ++seed) {
    FlatVolume volume;
    fillRandom(volume, seed, 150);
    std::string const label = "seed " + std::to_string(seed);
    FlatOptions options;
    options.rootLevelLimit = 28 - volume.top;
    for (float const fraction : {0.0f, 0.4f, 1.0f}) {
      options.haloFraction = fraction;
      expectSame(flatten(*volume.object, options), label);
      expectSame(flatten<nanovdb::Fp4>(*volume.object, options), label + " Fp4");
      expectSame(flatten<nanovdb::Fp8>(*volume.object, options), label + " Fp8");
      expectSame(flatten<nanovdb::Fp16>(*volume.object, options), label + " Fp16");
      options.tolerance = 0.3f;
      expectSame(flatten<nanovdb::FpN>(*volume.object, options), label + " FpN");
      options.coalesce = true;
      expectSame(flatten(*volume.object, options), label + " coalesced");
      options.coalesce = false;
      options.morton = !options.morton;
    }
    options.textures = true;
    expectSame(flatten(*volume.object, options), label + " textures");
  }
}

TEST(Reader, BoundaryVolumesWithoutTilesOrGrids) {
  FlatVolume volume;
  volume.finish();
  expectSame(flatten(*volume.object, {}), "no tile, no channel");
  volume.channel<float>("f", 1.5f, [](auto const&, int) { return 0.0f; });
  FlatOptions options;
  for (float const fraction : {0.0f, 1.0f}) {
    options.haloFraction = fraction;
    expectSame(flatten(*volume.object, options), "no tile");
    expectSame(flatten<nanovdb::Fp4>(*volume.object, options), "no tile, Fp4");
    expectSame(flatten<nanovdb::FpN>(*volume.object, options), "no tile, FpN");
    options.textures = fraction == 1;
    expectSame(flatten(*volume.object, options), "no tile, textures");
  }
  FlatVolume other;
  fillRandom(other, 1, 50);
  options = {};
  options.filter = "nothing";
  expectSame(flatten(*other.object, options), "no grid");
  options.elementBytes = 1, options.cubic = true;
  expectSame(flatten(*other.object, options), "no grid, nothing behind the container");
}

} // namespace
