// A file is a row of segments:
//
//   header, 16 bytes      magic number, version, number of grids, codec
//   for each grid         176 bytes: sizes, type, class, boxes; its name
//   for each grid         its bytes, packed or as they are
//
// A grid is one block of memory whose parts find each other by offsets. NanoVDB follows these as they are; so
// all of them are checked before: that each node lies in the block, and where its parent has it. Then no node
// is met twice, and nothing that is read lies elsewhere.
#include "Interop/NvdbFile.h"

#include "Interop/FileError.h"
#include "Interop/GuardedReadImpl.h"
#include "Interop/OutputFile.h"
#include "Interop/RegularFileImpl.h"
#include "Interop/VdbExportImpl.h"
#include "Interop/VdbImportImpl.h"

#define NANOVDB_USE_TBB
#include <nanovdb/util/IO.h>
#include <nanovdb/util/NanoToOpenVDB.h>
#include <nanovdb/util/OpenToNanoVDB.h>

#include <cstring>
#include <fstream>
#include <optional>
#include <set>
#include <sstream>

#include <zlib.h>
#ifdef VLN_BLOSC
#include <blosc.h>
#endif

namespace VLN::Interop {

namespace {

using nanovdb::Coord;
using nanovdb::GridType;
using nanovdb::io::Codec;

constexpr std::uint64_t kAlignment = NANOVDB_DATA_ALIGNMENT;
constexpr std::uint32_t kLongestName = 1u << 16;
constexpr std::uint64_t kBloscPiece = std::uint64_t(1) << 30; ///< of this many bytes each part is packed

/// Of a file whose name is added by who reads it.
struct Unreadable : FileError {
  explicit Unreadable(std::string const& reason)
      : FileError("", reason) {}
};
struct Damaged : Unreadable {
  explicit Damaged(std::string const& what)
      : Unreadable("is damaged: " + what) {}
};

// The bytes of one grid.
class Block {
public:
  explicit Block(std::uint64_t size)
      : m_handle(nanovdb::HostBuffer::create(size)) {
    // The buffer is made by malloc, whose answer it does not look at.
    if (!m_handle.data()) throw std::bad_alloc();
  }
  std::uint8_t* data() { return m_handle.data(); }
  std::uint64_t size() const { return m_handle.size(); }

  /// The part of that type at an offset.
  template <class T> T const* at(std::uint64_t offset, char const* what) const {
    if (offset > size() || size() - offset < sizeof(T) || offset % kAlignment != 0)
      throw Damaged(std::string(what) + " lies outside of its grid");
    return reinterpret_cast<T const*>(m_handle.data() + offset);
  }
  std::uint64_t offsetOf(void const* part) const {
    return static_cast<std::uint64_t>(static_cast<std::uint8_t const*>(part) - m_handle.data());
  }

private:
  nanovdb::GridHandle<nanovdb::HostBuffer> m_handle;
};

void expectPlace(Coord const& found, Coord const& wanted) {
  if (!(found == wanted)) throw Damaged("a node is not where its parent has it");
}

template <class BuildT> void checkLeaf(Block const& block, std::uint64_t offset, Coord const& place) {
  auto const* leaf = block.at<nanovdb::NanoLeaf<BuildT>>(offset, "a leaf");
  expectPlace(leaf->origin(), place);
  if constexpr (std::is_same_v<BuildT, nanovdb::FpN>) {
    if (block.size() - offset < leaf->data()->memUsage()) throw Damaged("a leaf lies outside of its grid");
  }
}

/// @tparam Level 2 for the upper internal nodes, 1 for the lower ones.
template <class BuildT, int Level>
void checkInternal(Block const& block, std::uint64_t offset, Coord const& place) {
  using Node = std::conditional_t<Level == 2, nanovdb::NanoUpper<BuildT>, nanovdb::NanoLower<BuildT>>;
  auto const* node = block.at<Node>(offset, "a node");
  expectPlace(node->origin(), place);
  auto const& data = *node->data();
  for (std::uint32_t n = 0; n < Node::SIZE; ++n) {
    if (!data.mChildMask.isOn(n)) continue;
    // Sums of unsigned numbers wrap, and what has wrapped lies outside.
    std::uint64_t const child = offset + static_cast<std::uint64_t>(data.mTable[n].child);
    Coord const at = node->offsetToGlobalCoord(n);
    if constexpr (Level == 2)
      checkInternal<BuildT, 1>(block, child, at);
    else
      checkLeaf<BuildT>(block, child, at);
  }
}

template <class BuildT> nanovdb::NanoGrid<BuildT> const& checkGrid(Block& block) {
  using Grid = nanovdb::NanoGrid<BuildT>;
  using Root = nanovdb::NanoRoot<BuildT>;
  auto const* grid = block.at<Grid>(0, "the grid");
  auto const* tree = block.at<nanovdb::TreeData<3>>(sizeof(nanovdb::GridData), "the tree");
  std::uint64_t const offset = sizeof(nanovdb::GridData) + tree->mNodeOffset[3];
  if (tree->mNodeOffset[3] < sizeof(nanovdb::TreeData<3>) || offset < tree->mNodeOffset[3])
    throw Damaged("its root is not behind its tree");
  auto const& root = *block.at<Root>(offset, "the root")->data();
  if ((block.size() - offset - sizeof(Root)) / sizeof(typename Root::Tile) < root.mTableSize)
    throw Damaged("the table of its root is longer than the grid");
  std::set<Coord> places;
  for (std::uint32_t n = 0; n < root.mTableSize; ++n) {
    auto const& tile = *root.tile(n);
    if (!places.insert(tile.origin()).second) throw Damaged("its root names a place twice");
    if (tile.isChild())
      checkInternal<BuildT, 2>(block, offset + static_cast<std::uint64_t>(tile.child), tile.origin());
  }
  return *grid;
}

template <class BuildT> openvdb::GridBase::Ptr toOpen(Block& block) {
  return nanovdb::nanoToOpenVDB(checkGrid<BuildT>(block));
}

/// Null for types that no volume has.
openvdb::GridBase::Ptr toOpenOfType(Block& block, GridType type) {
  switch (type) {
  case GridType::Float:
    return toOpen<float>(block);
  case GridType::Double:
    return toOpen<double>(block);
  case GridType::Int32:
    return toOpen<std::int32_t>(block);
  case GridType::Int64:
    return toOpen<std::int64_t>(block);
  case GridType::Boolean:
    return toOpen<bool>(block);
  case GridType::Mask:
    return toOpen<nanovdb::ValueMask>(block);
  case GridType::Vec3f:
    return toOpen<nanovdb::Vec3f>(block);
  case GridType::Vec3d:
    return toOpen<nanovdb::Vec3d>(block);
  case GridType::Fp4:
    return toOpen<nanovdb::Fp4>(block);
  case GridType::Fp8:
    return toOpen<nanovdb::Fp8>(block);
  case GridType::Fp16:
    return toOpen<nanovdb::Fp16>(block);
  case GridType::FpN:
    return toOpen<nanovdb::FpN>(block);
  default:
    return nullptr;
  }
}

class NvdbReader {
public:
  explicit NvdbReader(std::string const& path)
      : m_in(path, std::ios::binary)
      , m_left(regularFileSize(path)) {
    m_file.path = path;
    m_in.exceptions(std::ios::failbit | std::ios::badbit | std::ios::eofbit);
  }

  VdbFile run() {
    openvdb::initialize();
    while (m_left > 0) readSegment();
    return std::move(m_file);
  }

private:
  void read(void* to, std::uint64_t bytes) {
    need(bytes);
    m_in.read(static_cast<char*>(to), static_cast<std::streamsize>(bytes));
    m_left -= bytes;
  }
  void need(std::uint64_t bytes) const {
    if (bytes > m_left) throw Unreadable("is truncated or damaged: data that it announces is missing");
  }

  void readSegment() {
    nanovdb::io::Header header;
    read(&header, sizeof header);
    if (header.magic != NANOVDB_MAGIC_NUMBER) throw Damaged("a segment does not begin as one");
    if (header.version.getMajor() != NANOVDB_MAJOR_VERSION_NUMBER)
      throw Unreadable("is of version " + std::to_string(header.version.getMajor()) +
                       " of NanoVDB's format, and " + std::to_string(NANOVDB_MAJOR_VERSION_NUMBER) +
                       " is read");
    struct Entry {
      nanovdb::io::MetaData data;
      std::string name;
    };
    std::vector<Entry> entries;
    for (int n = 0; n < header.gridCount; ++n) {
      Entry entry;
      read(&entry.data, sizeof entry.data);
      if (entry.data.nameSize > kLongestName) throw Damaged("a name of it is too long");
      entry.name.resize(entry.data.nameSize);
      read(entry.name.data(), entry.name.size());
      entry.name.resize(std::strlen(entry.name.c_str()));
      entries.push_back(std::move(entry));
    }
    for (auto const& [data, name] : entries) readGrid(data, name, header.codec);
  }

  void readGrid(nanovdb::io::MetaData const& data, std::string const& name, Codec codec) {
    need(data.fileSize);
    std::uint64_t const end = m_left - data.fileSize;
    Block block(data.gridSize);
    unpack(block, data.fileSize, codec);
    if (m_left != end) throw Damaged("a grid is shorter than it announces");
    auto& head = const_cast<nanovdb::GridData&>(*block.at<nanovdb::GridData>(0, "a grid"));
    if (head.mMagic != NANOVDB_MAGIC_NUMBER || head.mGridSize > block.size() ||
        head.mGridType != data.gridType)
      throw Damaged("a grid is none, or another one than it says");
    // The name is taken from the file; that in the block may lead anywhere.
    std::memset(head.mGridName, 0, sizeof head.mGridName);
    head.setFlagsOff();
    auto const skip = [&](std::string const& reason) { m_file.skipped.push_back({name, reason}); };
    for (double const m : head.mMap.mMatD)
      if (!std::isfinite(m)) return skip("its transform cannot be used");
    for (double const m : head.mMap.mVecD)
      if (!std::isfinite(m)) return skip("its transform cannot be used");
    if (head.mGridClass == nanovdb::GridClass::PointIndex || head.mGridClass == nanovdb::GridClass::PointData)
      return skip("grids of points are not read");
    openvdb::GridBase::Ptr grid;
    try {
      grid = toOpenOfType(block, head.mGridType);
    } catch (openvdb::ArithmeticError const&) { return skip("its transform cannot be used"); }
    if (!grid) {
      bool const known = head.mGridType < GridType::End;
      return skip(known ? std::string("grids of type ") + nanovdb::toStr(head.mGridType) + " are not read"
                        : "it is of an unknown type");
    }
    grid->setName(name);
    m_file.grids.push_back(grid);
  }

  void unpack(Block& block, std::uint64_t fileSize, Codec codec) {
    switch (codec) {
    case Codec::NONE:
      if (fileSize != block.size()) throw Damaged("a grid has two sizes");
      return read(block.data(), block.size());
    case Codec::ZIP: {
      auto const packed = readPiece();
      uLongf size = block.size();
      if (uncompress(block.data(), &size, packed.data(), packed.size()) != Z_OK || size != block.size())
        throw Damaged("a grid cannot be unpacked");
      return;
    }
    case Codec::BLOSC:
#ifdef VLN_BLOSC
      for (std::uint64_t done = 0; done < block.size();) {
        auto const packed = readPiece();
        std::uint64_t const wanted = std::min(kBloscPiece, block.size() - done);
        std::size_t size = 0;
        if (blosc_cbuffer_validate(packed.data(), packed.size(), &size) != 0 || size != wanted ||
            blosc_decompress_ctx(packed.data(), block.data() + done, wanted, 1) !=
                static_cast<std::int64_t>(wanted))
          throw Damaged("a grid cannot be unpacked");
        done += wanted;
      }
      return;
#else
      throw Unreadable("is packed with blosc, which this build was made without");
#endif
    default:
      throw Damaged("its codec is none");
    }
  }
  std::vector<std::uint8_t> readPiece() {
    std::uint64_t size = 0;
    read(&size, sizeof size);
    need(size);
    std::vector<std::uint8_t> bytes(size);
    read(bytes.data(), size);
    return bytes;
  }

  std::ifstream m_in;
  std::uint64_t m_left; ///< bytes that have not been read
  VdbFile m_file;
};

using Handle = nanovdb::GridHandle<nanovdb::HostBuffer>;

template <class Grid> bool tryWrite(openvdb::GridBase const& grid, std::optional<Handle>& handle) {
  if (!grid.isType<Grid>()) return false;
  handle.emplace(nanovdb::openToNanoVDB(static_cast<Grid const&>(grid)));
  return true;
}

Handle toNano(openvdb::GridBase const& grid, std::string const& path) {
  std::string const name = "the grid '" + oneLine(grid.getName(), 60) + "' ";
  if (!grid.transform().isLinear())
    throw FileError(path, name + "has a transform that is not linear, which .nvdb files cannot tell");
  std::optional<Handle> handle;
  bool const known =
      tryWrite<openvdb::FloatGrid>(grid, handle) || tryWrite<openvdb::DoubleGrid>(grid, handle) ||
      tryWrite<openvdb::Int32Grid>(grid, handle) || tryWrite<openvdb::Int64Grid>(grid, handle) ||
      tryWrite<openvdb::BoolGrid>(grid, handle) || tryWrite<openvdb::MaskGrid>(grid, handle) ||
      tryWrite<openvdb::Vec3SGrid>(grid, handle);
  if (!known) throw FileError(path, name + "is of a type that .nvdb files do not have");
  return std::move(*handle);
}

} // namespace

bool isNvdbFile(std::string const& path) {
  std::uint64_t magic = 0;
  std::ifstream in(path, std::ios::binary);
  in.read(reinterpret_cast<char*>(&magic), sizeof magic);
  return in && magic == NANOVDB_MAGIC_NUMBER;
}

VdbImport importNvdb(std::string const& path, VdbReadLimits const& asked, Progress const& progress) {
  if (progress) progress("reading", 0);
  openvdb::initialize();
  VdbFile file = readGuarded(path, asked, regularFileSize(path), [&] { return NvdbReader(path).run(); });
  return importGrids(file, asked, progress);
}

void exportNvdb(VdbImport const& content, std::string const& path, Progress const& progress) {
  openvdb::initialize();
  OutputFile out(path);
  std::vector<Handle> handles;
  nanovdb::io::Segment segment;
  auto const grids = exportedGrids(content, [&](char const* stage, double done) {
    if (progress) progress(stage, 0.5 * done);
  });
  for (auto const& grid : grids) {
    handles.push_back(toNano(*grid, path));
    segment.add(handles.back());
    segment.meta.back().fileSize = handles.back().size();
    if (progress) progress("converting", 0.5 + 0.4 * double(handles.size()) / double(grids.size()));
  }
  if (handles.empty()) throw FileError(path, "there is no grid to be written");
  if (handles.size() > 0xffff) throw FileError(path, "there are more grids than an .nvdb file holds");
  std::ostringstream head(std::ios::binary);
  segment.write(head);
  out.write(head.str());
  for (auto const& handle : handles) out.write(handle.data(), handle.size());
  out.commit();
  if (progress) progress("done", 1);
}

} // namespace VLN::Interop
