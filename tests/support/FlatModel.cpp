#include "support/FlatModel.h"

#include <algorithm>
#include <cmath>

namespace Support {

namespace {

constexpr std::uint64_t kBase = 1048736;

}

FlatModel::FlatModel(std::uint8_t const* bytes, std::uint64_t length)
    : m_bytes(bytes)
    , m_length(length) {
  readContainer();
  std::uint64_t start = containerSize;
  std::uint32_t index = 0;
  // Behind the last grid the buffer is zero.
  while (start + 736 <= bufferSize && get<std::uint64_t>(start) != 0) {
    readGrid(start, index++);
    start += grids.back().size;
    check(start <= bufferSize, "grids end behind the buffer");
  }
  for (Grid const& g : grids) check(g.count == grids.size(), "grid count of " + g.name);
  for (std::uint64_t n = start; n < bufferSize; ++n) check(m_bytes[n] == 0, "bytes behind the last grid");
}

void FlatModel::readContainer() {
  bufferSize = get<std::uint64_t>(0);
  check(bufferSize == m_length, "buffer size");
  containerSize = get<std::uint64_t>(8);
  check(containerSize % 32 == 0 && containerSize <= bufferSize, "container size");
  for (std::size_t d = 0; d < 30; ++d) accum[d] = get<std::uint32_t>(16 + 4 * d);
  for (int a = 0; a < 3; ++a) llc[a] = get<std::int32_t>(1048712 + 4 * static_cast<std::uint64_t>(a));
  rootDepth = get<std::int32_t>(1048724);
  check(rootDepth >= 0 && rootDepth <= 28, "root depth");
  for (int d = 0; d <= rootDepth; ++d)
    check(accum[static_cast<std::size_t>(d)] == 0, "count above the root depth");
  for (std::size_t d = 1; d < 30; ++d) check(accum[d - 1] <= accum[d], "counts descend");

  std::uint64_t const total = accum[29], nonFinest = accum[28];
  check(get<std::uint64_t>(1048728) == (nonFinest + 1) * 8, "parent table offset");
  std::uint64_t const tables = (nonFinest + 1) * 8 + total * 4;
  sentinel = get<std::uint64_t>(kBase + nonFinest * 8);
  check(sentinel >= tables, "sentinel inside the tables");
  for (std::uint64_t n = 0; n < 32; ++n)
    check(get<std::uint8_t>(kBase + sentinel + n) == 0xFF, "sentinel bytes");
  std::uint64_t const used = kBase + sentinel + 32;
  check(containerSize == used + (32 - used % 32), "container's padding");
  for (std::uint64_t n = used; n < containerSize; ++n) check(get<std::uint8_t>(n) == 0, "padding bytes");

  tiles.resize(total);
  std::uint32_t roots = 0;
  for (int z = 0; z < 64; ++z)
    for (int y = 0; y < 64; ++y)
      for (int x = 0; x < 64; ++x) {
        auto const slot = static_cast<std::uint64_t>((z * 64 + y) * 64 + x);
        auto const number = get<std::uint32_t>(136 + 4 * slot);
        if (number == kNone) continue;
        ++roots;
        std::int64_t const w = width(rootDepth);
        std::int64_t const at[3] = {llc.x + x * w, llc.y + y * w, llc.z + z * w};
        for (auto const c : at)
          check(c >= -536870912 && c + w <= 536870912 && (c + 536870912) % w == 0, "root outside");
        walk(number, {static_cast<int>(at[0]), static_cast<int>(at[1]), static_cast<int>(at[2])}, rootDepth,
             kNone);
      }
  check(roots == accum[static_cast<std::size_t>(rootDepth) + 1], "number of roots");
  for (Tile const& tile : tiles) check(tile.depth >= 0, "a tile that nothing leads to");
  // Tables lie in the order of their tiles, without a gap.
  std::uint64_t next = tables;
  for (auto const& [number, offset] : m_childTables) {
    check(offset == next, "child table of " + std::to_string(number));
    next += tiles[number].children.size() * 4;
  }
  check(next == sentinel, "end of the child tables");
}

void FlatModel::walk(std::uint32_t number, int3 const& corner, int depth, std::uint32_t parent) {
  auto const d = static_cast<std::size_t>(depth);
  std::string const name = "tile " + std::to_string(number);
  check(depth <= 28 && number >= accum[d] && number < accum[d + 1], name + " is not of its depth");
  Tile& tile = tiles[number];
  check(tile.depth < 0, name + " is met twice");
  tile.corner = corner;
  tile.depth = depth;
  std::uint64_t const nonFinest = accum[28];
  tile.parent = get<std::uint32_t>(kBase + (nonFinest + 1) * 8 + 4 * std::uint64_t(number));
  check(tile.parent == parent, name + " has another parent");
  if (depth == 28) return;

  auto const entry = get<std::uint64_t>(kBase + 8 * std::uint64_t(number));
  std::uint64_t const offset = entry & 0xFFFFFFFFFFFFull;
  int const levels = static_cast<int>(entry >> 56);
  check((entry >> 48 & 0xFF) == 0 && levels <= 3, name + " has an odd child offset");
  if (offset == sentinel) {
    check(levels == 0, name + " has a block and no children");
    return;
  }
  m_childTables[number] = offset;
  int const across = 2 << levels;
  tile.levels = levels;
  for (int n = 0; n < across * across * across; ++n)
    tile.children.push_back(get<std::uint32_t>(kBase + offset + 4 * static_cast<std::uint64_t>(n)));
  std::int64_t const w = width(depth) / across;
  for (int n = 0; n < across * across * across; ++n) {
    std::uint32_t const child = tiles[number].children[static_cast<std::size_t>(n)];
    if (child == kNone) continue;
    check(child < tiles.size(), name + " has a child beyond the last tile");
    int3 const at{static_cast<int>(corner.x + n % across * w),
                  static_cast<int>(corner.y + n / across % across * w),
                  static_cast<int>(corner.z + n / across / across * w)};
    walk(child, at, depth + levels + 1, number);
  }
}

std::uint32_t FlatModel::find(int3 const& p, int depth) const {
  if (depth < rootDepth) return kNone;
  std::int64_t const w = width(rootDepth);
  std::int64_t slot = 0;
  for (int a = 2; a >= 0; --a) {
    std::int64_t const d = std::int64_t(p[a]) - llc[a];
    if (d < 0 || d / w >= 64) return kNone;
    slot = slot * 64 + d / w;
  }
  auto number = get<std::uint32_t>(136 + 4 * static_cast<std::uint64_t>(slot));
  if (number == kNone) return kNone;
  int at = rootDepth;
  for (;;) {
    if (at == 28) return number;
    auto const entry = get<std::uint64_t>(kBase + 8 * std::uint64_t(number));
    int const levels = static_cast<int>(entry >> 56);
    int const childDepth = at + levels + 1;
    if (childDepth > depth) return number;
    std::int64_t const cw = width(childDepth), across = 2 << levels;
    std::int64_t index = 0;
    for (int a = 2; a >= 0; --a) index = index * across + (std::int64_t(p[a]) + 536870912) % width(at) / cw;
    auto const child =
        get<std::uint32_t>(kBase + (entry & 0xFFFFFFFFFFFFull) + 4 * static_cast<std::uint64_t>(index));
    if (child == kNone) return number;
    number = child;
    at = childDepth;
  }
}

std::uint64_t FlatModel::elementBytes(std::uint32_t type) {
  switch (type) {
  case 1:
  case 4:
  case 10:
  case 13:
  case 14:
  case 15:
  case 16:
    return 4;
  case 2:
  case 5:
    return 8;
  case 3:
    return 2;
  case 6:
    return 12;
  case 7:
    return 24;
  case 17:
    return 16;
  default:
    throw std::runtime_error("grid type " + std::to_string(type));
  }
}

void FlatModel::readGrid(std::uint64_t start, std::uint32_t index) {
  Grid g;
  g.start = start;
  check(get<std::uint64_t>(start) == 0x4E616E6F56545430ull, "magic");
  g.checksum = get<std::uint64_t>(start + 8);
  check(get<std::uint32_t>(start + 16) == 0x200000, "version");
  check(get<std::uint32_t>(start + 20) == 0, "flags");
  g.index = get<std::uint32_t>(start + 24);
  check(g.index == index, "grid index");
  g.count = get<std::uint32_t>(start + 28);
  g.size = get<std::uint64_t>(start + 32);
  check(g.size % 32 == 0 && g.size <= bufferSize - start, "grid size");
  auto const* const name = reinterpret_cast<char const*>(at(start + 40, 256));
  check(name[255] == 0, "name's end");
  g.name = name;
  check(std::all_of(name + g.name.size(), name + 256, [](char c) { return c == 0; }),
        "bytes behind the name");

  g.voxelSize = get<double>(start + 608);
  check(get<double>(start + 616) == g.voxelSize && get<double>(start + 624) == g.voxelSize, "voxel sizes");
  auto const vf = static_cast<float>(g.voxelSize);
  for (std::uint64_t n = 0; n < 9; ++n) {
    bool const diagonal = n % 4 == 0;
    check(get<float>(start + 296 + 4 * n) == (diagonal ? vf : 0), "float matrix");
    check(get<double>(start + 384 + 8 * n) == (diagonal ? g.voxelSize : 0), "double matrix");
    if (diagonal) {
      check(std::abs(get<float>(start + 332 + 4 * n) * vf - 1) < 1e-6f, "float inverse");
      check(std::abs(get<double>(start + 456 + 8 * n) * g.voxelSize - 1) < 1e-6, "double inverse");
    } else {
      check(get<float>(start + 332 + 4 * n) == 0 && get<double>(start + 456 + 8 * n) == 0, "inverse");
    }
  }
  for (std::uint64_t n = 0; n < 3; ++n)
    check(get<float>(start + 368 + 4 * n) == 0 && get<double>(start + 528 + 8 * n) == 0, "translation");
  check(get<float>(start + 380) == 1 && get<double>(start + 552) == 1, "taper");

  for (std::size_t n = 0; n < 6; ++n) {
    g.worldBox[n] = get<double>(start + 560 + 8 * n);
    g.box[n] = get<std::int32_t>(start + 672 + 4 * n);
  }
  g.gridClass = get<std::uint32_t>(start + 632);
  g.type = get<std::uint32_t>(start + 636);
  check(get<std::int64_t>(start + 640) == 0 && get<std::uint32_t>(start + 648) == 0, "blind metadata");
  check(get<std::uint64_t>(start + 696) == start + 672, "container offset");
  check(get<std::uint64_t>(start + 704) == g.size - 672, "tree size");
  auto const* const defaults = at(start + 712, elementBytes(g.type));
  g.defaultValue.assign(defaults, defaults + elementBytes(g.type));

  for (std::uint64_t n = 0; n <= tiles.size(); ++n)
    g.table.push_back(get<std::uint64_t>(start + 736 + 8 * n));
  std::uint64_t const used = 736 + g.end();
  check(g.size == used + (32 - used % 32), "grid's padding");
  for (std::uint64_t n = used; n < g.size; ++n)
    check(get<std::uint8_t>(start + n) == 0, "grid's padding bytes");
  readTable(g);
  grids.push_back(g);
}

// Tiles lie one after the other, in the order of their numbers.
void FlatModel::readTable(Grid& g) const {
  std::uint64_t const table = g.table.size() * 8, element = elementBytes(g.type);
  bool const texture = !tiles.empty() && g.offset(0) == 5;
  if (texture) {
    check(!isQuantised(g.type), "a quantised texture");
    for (std::size_t n = 0; n < tiles.size(); ++n)
      check(g.width(n) == 5 && g.levels(n) == 0, "texture entry");
    return;
  }
  std::uint64_t next = table;
  for (std::size_t n = 0; n < tiles.size(); ++n) {
    std::string const name = "data of tile " + std::to_string(n);
    check(g.offset(n) == next, name + " at " + std::to_string(g.offset(n)) + ", not " + std::to_string(next));
    if (isQuantised(g.type)) {
      check(g.width(n) == 0 && g.levels(n) == 0, name + ": a quantised entry has no width");
      next = g.table[n + 1] & 0xFFFFFFFFFFFFull;
      quantised(g, n);
    } else {
      int const core = 4 << g.levels(n);
      check(g.levels(n) <= 3 && (g.width(n) == core || g.width(n) == core + 1), name + ": width");
      std::uint64_t const w = static_cast<std::uint64_t>(g.width(n));
      next += w * w * w * element;
    }
  }
  // A texture without tiles has the brick of no tile.
  if (tiles.empty() && g.end() == next + 125 * element) return;
  check(g.end() == next, "end of the tile data");
}

FlatModel::Quantised FlatModel::quantised(Grid const& g, std::size_t n) const {
  std::uint64_t const start = g.start + 736 + g.offset(n);
  std::uint64_t const size = (n + 1 < tiles.size() ? g.offset(n + 1) : g.end()) - g.offset(n);
  Quantised q;
  q.minimum = get<float>(start);
  q.quantum = get<float>(start + 4);
  std::uint64_t codes = start + 8, count = 0;
  if (g.type == 16) {
    auto const payload = get<std::uint16_t>(start + 8);
    auto const logBits = get<std::uint8_t>(start + 10);
    check(get<std::uint8_t>(start + 11) == 0 && logBits <= 4, "FpN record");
    check(size == 12u + payload, "FpN payload");
    q.bits = 1 << logBits;
    codes = start + 12;
    std::uint64_t const stored = payload * 8u / static_cast<unsigned>(q.bits);
    check(stored == 64 || stored == 128, "FpN count of codes");
    count = stored == 64 ? 64 : 125;
  } else {
    q.bits = g.type == 13 ? 4 : g.type == 14 ? 8 : 16;
    std::uint64_t const plain = g.type == 13 ? 44 : g.type == 14 ? 76 : 140;
    std::uint64_t const halo = g.type == 13 ? 72 : g.type == 14 ? 136 : 264;
    check(size == plain || size == halo, "size of a quantised tile");
    count = size == plain ? 64 : 125;
  }
  for (std::uint64_t k = 0; k < count; ++k) {
    std::uint32_t code = 0;
    for (int b = 0; b < q.bits; ++b) {
      std::uint64_t const bit = k * static_cast<std::uint64_t>(q.bits) + static_cast<std::uint64_t>(b);
      code |= static_cast<std::uint32_t>(get<std::uint8_t>(codes + bit / 8) >> (bit % 8) & 1) << b;
    }
    q.codes.push_back(code);
  }
  return q;
}

FlatModel::Grid const& FlatModel::grid(std::string const& name) const {
  for (Grid const& g : grids)
    if (g.name == name) return g;
  throw std::runtime_error("no grid " + name);
}

std::uint32_t FlatModel::crc32(std::uint8_t const* bytes, std::uint64_t count) {
  std::uint32_t crc = 0xFFFFFFFFu;
  for (std::uint64_t n = 0; n < count; ++n) {
    crc ^= bytes[n];
    for (int bit = 0; bit < 8; ++bit) crc = crc & 1 ? crc >> 1 ^ 0xEDB88320u : crc >> 1;
  }
  return ~crc;
}

std::uint64_t FlatModel::checksum(Grid const& g, int mode) const {
  if (mode == 0) return ~std::uint64_t(0);
  std::uint32_t const c[2] = {crc32(at(0, containerSize), containerSize), crc32(at(g.start + 16, 720), 720)};
  std::uint64_t const low = crc32(reinterpret_cast<std::uint8_t const*>(c), 8);
  std::uint64_t high = 0xFFFFFFFFu;
  if (mode == 2 && !tiles.empty()) high = crc32(at(g.start + 736, g.size - 736), g.size - 736);
  return high << 32 | low;
}

} // namespace Support
