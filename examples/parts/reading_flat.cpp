// A .nvtt file, read by the headers of src/Reader alone: what docs/reading_flat.md shows.
#include "GeometryVolume/volume/Volume.h"
#include "Interop/VolumeIo.h"

#include <cmath>
#include <fstream>
#include <iostream>
#include <iterator>
#include <vector>

// snippet: open
#include "Reader/NvttFile.h"

// The buffer of a file whose bytes were read or mapped; null when they cannot be trusted.
unsigned char const* bufferOf(void const* bytes, std::uint64_t length) {
  nanovtt::NvttFile file;
  nanovtt::Validation fault = nanovtt::NvttFile::open(bytes, length, file);
  if (fault.ok()) fault = nanovtt::validate(file.buffer(), file.bufferLength());
  if (fault.ok()) return file.buffer();
  std::cerr << fault.message << " at byte " << fault.position << "\n";
  return nullptr;
}
// end snippet

// snippet: cursor
#include "Reader/NanoVTTCursor.h"

// Mean over a box of tile space of a float grid of any build; deeper tiles than `depth` are not looked at.
double meanOf(nanovtt::GridReader const& grid, int low, int high, int depth) {
  nanovtt::GridCursor cursor(grid, depth); // remembers its way: one for each thread
  double sum = 0, count = 0;
  for (int z = low; z < high; ++z)
    for (int y = low; y < high; ++y)
      for (int x = low; x < high; ++x, ++count) sum += cursor.value(x, y, z);
  return sum / count;
}
// end snippet

// snippet: cells
// Reads at random places: a table of cells beside the buffer leads from a place to its tile.
double meanAt(nanovtt::GridReader const& grid, std::vector<nanovtt::Coord> const& places) {
  nanovtt::CellTable cells(grid.container()); // of 16 bytes a tile at the most
  std::vector<std::uint32_t> memory(cells.bytes() / sizeof(std::uint32_t));
  cells.write(grid.container(), memory.data());
  nanovtt::GridCursor cursor(grid, cells);
  double sum = 0;
  for (auto const& p : places) sum += cursor.value(p.x, p.y, p.z);
  return sum / double(places.size());
}
// end snippet

// snippet: typed
// The type known when it is compiled: vectors, blended between their samples.
nanovtt::Float3 velocityAt(nanovtt::GridReader const& grid, float x, float y, float z) {
  if (grid.type() != nanovtt::GridType::kFloat3) return {};
  return nanovtt::Cursor<nanovtt::GridType::kFloat3>(grid).trilinear(x, y, z);
}
// end snippet

// snippet: tiles
// The largest value of a grid: every sample of every tile once, tiles by their numbers.
double largestOf(nanovtt::GridReader const& grid) {
  double largest = -1e300;
  for (nanovtt::TileRef const& tile : nanovtt::tilesOf(grid.container())) { // its number, depth and corner
    nanovtt::TileBlock const block = grid.block(tile.number);
    for (int k = 0; k < block.core; ++k)
      for (int j = 0; j < block.core; ++j)
        for (int i = 0; i < block.core; ++i)
          largest = std::max(largest, block.getComponent(block.index(i, j, k), 0));
  }
  return largest;
}
// end snippet

namespace {

bool right = true;
void expect(bool holds, char const* what) {
  if (!holds) std::cerr << what << "\n";
  right = right && holds;
}

} // namespace

int main() {
  // x + 2 y + 4 z in a box, and the vector (x, y, z).
  VLN::TileTree3D::Volume volume(1.0f);
  auto density = volume.addField<float>("density", 0);
  auto velocity = volume.addField<Velorn::Math::float3>("velocity", {0, 0, 0});
  for (int z = 0; z < 16; ++z)
    for (int y = 0; y < 16; ++y)
      for (int x = 0; x < 16; ++x) {
        density.set(x, y, z, float(x + 2 * y + 4 * z));
        velocity.set(x, y, z, {float(x), float(y), float(z)});
      }
  VLN::Interop::save(volume, "flat.nvtt");

  std::ifstream in("flat.nvtt", std::ios::binary);
  std::vector<char> const bytes{std::istreambuf_iterator<char>(in), {}};
  unsigned char const* const buffer = bufferOf(bytes.data(), bytes.size());
  expect(buffer, "the file is sound");
  if (!buffer) return 1;
  nanovtt::BufferReader const reader(buffer);
  auto const grid = reader.grid(reader.find("density"));
  expect(grid.valueAt(3, 4, 5) == 31, "a value");
  expect(std::abs(meanOf(grid, 0, 16, nanovtt::kMaxDepth) - 52.5) < 1e-9, "a mean");
  expect(meanAt(grid, {{3, 4, 5}, {15, 0, 1}, {-9, 0, 0}}) == (31 + 19 + 0) / 3.0, "a mean of places");
  expect(largestOf(grid) == 105, "the largest value");
  auto const v = velocityAt(reader.grid(reader.find("velocity")), 3.5f, 4.25f, 5.75f);
  expect(v.v[0] == 3.5f && v.v[1] == 4.25f && v.v[2] == 5.75f, "a vector");
  expect(!bufferOf(bytes.data(), bytes.size() - 1), "a file that was cut is refused");
  return right ? 0 : 1;
}
