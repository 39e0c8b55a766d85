#include "Interop/VdbCheckedImpl.h"

#include "GeometryVolume/core/Parallel.h"
#include "Interop/HalfFloatsImpl.h"
#include "Interop/VdbGridNodesImpl.h"
#include "Interop/VdbWalkImpl.h"

#include <openvdb/io/Archive.h>
#include <openvdb/io/GridDescriptor.h>
#include <openvdb/io/io.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <exception>
#include <memory>
#include <new>
#include <streambuf>

#include <fcntl.h>
#include <unistd.h>

namespace VLN::Interop {

namespace {

using openvdb::GridBase;

constexpr std::size_t kLeafVoxels = 512;

// Reads bytes in memory, from a place on, and throws where they end.
class MemoryStream : private std::streambuf, public std::istream {
public:
  explicit MemoryStream(WalkedBytes const& bytes)
      : std::istream(static_cast<std::streambuf*>(this)) {
    auto* const begin = const_cast<char*>(bytes.data()); // a get area is never written to
    setg(begin, begin, begin + bytes.size());
    exceptions(std::ios::failbit | std::ios::badbit | std::ios::eofbit);
  }
  void goTo(std::size_t place) { setg(eback(), eback() + place, egptr()); }
  std::size_t place() const { return static_cast<std::size_t>(gptr() - eback()); }
};

/// Reads values that have been walked through.
template <class Value>
void readValues(MemoryStream& in, std::uint32_t count, ValueCoding const& coding, Value* values) {
  using Half = openvdb::io::RealToHalf<Value>;
  if constexpr (Half::isReal) {
    if (coding.half) {
      if (count == 0) return;
      using Written = typename Half::HalfT;
      constexpr std::size_t kReals = sizeof(Written) / sizeof(std::uint16_t); // in a value
      using Real = std::conditional_t<sizeof(Value) == kReals * sizeof(float), float, double>;
      static_assert(sizeof(Value) == kReals * sizeof(Real));
      std::uint16_t halves[kReals * kLeafVoxels];
      // Bytes are bytes, whatever they stand for.
      openvdb::io::readData<Written>(in, reinterpret_cast<Written*>(halves), count, coding.compression);
      widenHalves(halves, kReals * count, reinterpret_cast<Real*>(values));
      return;
    }
  }
  openvdb::io::readData<Value>(in, values, count, coding.compression);
}

/// Reads the buffers of a leaf, which have been walked through.
/// @param out Where its values go.
template <class Leaf>
void readLeaf(Leaf& leaf, WalkedBytes bytes, std::size_t place, MemoryStream& in, ValueCoding const& coding,
              typename Leaf::ValueType const& background, typename Leaf::ValueType* out) {
  static_assert(Leaf::SIZE == kLeafVoxels);
  using Value = typename Leaf::ValueType;
  in.goTo(place);
  typename Leaf::NodeMaskType mask;
  mask.load(in);
  leaf.setValueMask(mask);
  bytes.take(place);
  WrittenValues const values = walkBuffers<Leaf>(bytes, coding);
  Value some[Leaf::SIZE];
  Value* const written = values.count == Leaf::SIZE ? out : some;
  in.goTo(values.place);
  readValues(in, values.count, coding, written);
  if (written != out) spreadValues(values, bytes.data() + place, written, background, out);
}

/// All bytes of a file; null where they are not there.
std::unique_ptr<char[]> bytesOf(std::string const& path, std::size_t size) {
  int const file = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (file < 0) return nullptr;
  std::unique_ptr<char[]> bytes(new (std::nothrow) char[size]);
  std::atomic<bool> whole = bytes != nullptr;
  constexpr std::int64_t kPart = 1 << 20;
  if (bytes)
    parallelFor(0, std::int64_t(size),
                [&](std::int64_t first, std::int64_t last) {
                  while (first < last) {
                    ssize_t const got =
                        pread(file, bytes.get() + first, static_cast<std::size_t>(last - first), first);
                    if (got < 0 && errno == EINTR) continue;
                    if (got <= 0) break;
                    first += got;
                  }
                  if (first < last) whole = false;
                },
                {.grain = kPart});
  close(file);
  if (!whole) bytes.reset();
  return bytes;
}

/// What somebody who was told has thrown, apart from what reading throws.
struct ReadingStopped {
  std::exception_ptr reason;
};

class CheckedReader : public openvdb::io::Archive {
public:
  CheckedReader(WalkedBytes bytes, std::uint64_t memoryBytes, std::function<void(double)> const& told,
                LeafMemory leafMemory)
      : m_leafMemory(leafMemory)
      , m_bytes(bytes)
      , m_in(bytes)
      , m_memoryLeft(memoryBytes)
      , m_told(told) {}

  void read(VdbFile& file) {
    m_bytes.take(8); // it starts as it should
    auto const version = m_bytes.number<std::uint32_t>();
    walkOnlyIf(version >= openvdb::OPENVDB_FILE_VERSION_NODE_MASK_COMPRESSION &&
               version <= openvdb::OPENVDB_FILE_VERSION);
    m_bytes.take(4 + 4 + 1 + 36); // version of the library, whether there are offsets, the file's name
    readHeader(m_in);
    walkOnlyIf(m_in.place() == m_bytes.place());
    openvdb::io::setVersion(m_in, libraryVersion(), fileVersion());
    file.metadata = std::make_shared<openvdb::MetaMap>();
    readMetadata(*file.metadata);
    for (auto count = m_bytes.number<std::int32_t>(); count > 0; --count) readGrid(file);
  }

private:
  // Those of types that hold what they say. OpenVDB itself drops its notes for late loading.
  void readMetadata(openvdb::MetaMap& map) {
    map.clearMetadata();
    for (auto count = m_bytes.number<std::uint32_t>(); count > 0; --count) {
      std::string const name = m_bytes.text(), type = m_bytes.text();
      std::size_t const begin = m_bytes.place();
      auto const size = m_bytes.number<std::uint32_t>();
      char const* const bytes = m_bytes.take(size);
      if (name == GridBase::META_FILE_DELAYED_LOAD && type == "__delayedload") continue;
      walkOnlyIf(openvdb::Metadata::isRegisteredType(type) && type != "__delayedload");
      auto const value = openvdb::Metadata::createMetadata(type);
      walkOnlyIf(type == "string" || value->size() == size);
      walkOnlyIf(type != "bool" || bytes[0] == 0 || bytes[0] == 1);
      m_in.goTo(begin);
      value->read(m_in);
      walkOnlyIf(m_in.place() == m_bytes.place());
      map.insertMeta(name, *value);
    }
  }

  void readTransform(GridBase& grid) {
    std::size_t const begin = m_bytes.place();
    std::string const type = m_bytes.text();
    // Maps of fixed size.
    static constexpr char const* kTypes[] = {"AffineMap",
                                             "UnitaryMap",
                                             "ScaleMap",
                                             "UniformScaleMap",
                                             "TranslationMap",
                                             "ScaleTranslateMap",
                                             "UniformScaleTranslateMap"};
    walkOnlyIf(std::find(std::begin(kTypes), std::end(kTypes), type) != std::end(kTypes));
    m_in.goTo(begin);
    grid.readTransform(m_in);
    m_bytes.take(m_in.place() - m_bytes.place());
  }

  void readGrid(VdbFile& file) {
    // What a grid takes by itself: many small ones are more in memory than in a file.
    constexpr std::uint64_t kGrid = 8192;
    walkOnlyIf(m_memoryLeft >= kGrid);
    m_memoryLeft -= kGrid;
    std::size_t const begin = m_bytes.place();
    m_bytes.text();                     // name
    m_bytes.text();                     // type
    walkOnlyIf(m_bytes.text().empty()); // the grid whose tree this one has too
    m_bytes.take(3 * sizeof(std::int64_t));
    openvdb::io::GridDescriptor descriptor;
    m_in.goTo(begin);
    GridBase::Ptr grid = descriptor.read(m_in);
    walkOnlyIf(m_in.place() == m_bytes.place());
    ValueCoding coding{m_bytes.number<std::uint32_t>(), false};
    openvdb::io::setDataCompression(m_in, coding.compression);
    readMetadata(*grid);
    readTransform(*grid);
    coding.half = grid->saveFloatAsHalf();
    bool done = false;
    auto const attempt = [&]<class GridT>(GridT const*) {
      if (!done && grid->isType<GridT>()) {
        if (auto packed = readTree(static_cast<GridT&>(*grid).tree(), coding))
          file.packed.emplace(grid.get(), std::move(packed));
        done = true;
      }
    };
#define VLN_ATTEMPT(GridT) attempt(static_cast<openvdb::GridT const*>(nullptr));
    VLN_FOR_EACH_VDB_REAL_GRID(VLN_ATTEMPT)
    VLN_FOR_EACH_VDB_VECTOR_GRID(VLN_ATTEMPT)
    VLN_ATTEMPT(Int64Grid) // bytes of a file may be no bools
#undef VLN_ATTEMPT
    walkOnlyIf(done);
    file.grids.push_back(std::move(grid));
  }

  template <class TreeT> std::shared_ptr<PackedLeaves> readTree(TreeT& tree, ValueCoding const& coding) {
    using Leaf = typename TreeT::LeafNodeType;
    using Value = typename TreeT::ValueType;
    std::size_t const begin = m_bytes.place();
    std::uint64_t const memory = walkTopology<TreeT>(m_bytes, coding);
    walkOnlyIf(memory <= m_memoryLeft);
    m_memoryLeft -= memory;
    m_in.goTo(begin);
    tree.readTopology(m_in, coding.half);
    walkOnlyIf(m_in.place() == m_bytes.place());

    std::vector<Leaf*> leaves;
    leaves.reserve(tree.leafCount());
    tree.getNodes(leaves);
    std::vector<std::size_t> places;
    places.reserve(leaves.size());
    for (std::size_t n = 0; n < leaves.size(); ++n) {
      places.push_back(m_bytes.place());
      walkBuffers<Leaf>(m_bytes, coding);
    }
    std::shared_ptr<PackedLeaves> packed;
    if (m_leafMemory == LeafMemory::kPacked) {
      openvdb::Index32 next = 0;
      forEachInOrder<LeadingAxis::kZ>(
          tree, [&](Leaf& leaf) { leaf.setTransientData(next++); }, [](auto const&...) {});
      packed = std::make_shared<PackedLeaves>(leaves.size() * Leaf::SIZE * sizeof(Value));
    }
    auto const valuesOf = [&](Leaf& leaf) {
      return packed ? static_cast<Value*>(packed->begin()) + std::size_t(leaf.transientData()) * Leaf::SIZE
                    : leaf.buffer().data();
    };
    WalkedBytes const all(m_bytes.data(), m_bytes.size());
    auto const count = std::int64_t(leaves.size());
    for (std::int64_t done = 0, next = 0; done < count; done = next) {
      tell(places[static_cast<std::size_t>(done)]);
      next = std::min(done + kLeavesAtOnce, count);
      parallelFor(done, next,
                  [&](std::int64_t first, std::int64_t last) {
                    MemoryStream in(all);
                    for (auto n = static_cast<std::size_t>(first); n < static_cast<std::size_t>(last); ++n)
                      readLeaf(*leaves[n], all, places[n], in, coding, tree.background(),
                               valuesOf(*leaves[n]));
                  },
                  {.grain = 64});
    }
    return packed;
  }

  void tell(std::size_t place) const {
    if (!m_told) return;
    try {
      m_told(double(place) / double(m_bytes.size()));
    } catch (...) { throw ReadingStopped{std::current_exception()}; }
  }

  static constexpr std::int64_t kLeavesAtOnce = 16384; ///< some hundredths of a second

  LeafMemory m_leafMemory;
  WalkedBytes m_bytes;
  MemoryStream m_in;
  std::uint64_t m_memoryLeft;
  std::function<void(double)> const& m_told;
};

} // namespace

std::optional<VdbFile> readChecked(std::string const& path, std::uint64_t fileSize, std::uint64_t memoryBytes,
                                   std::function<void(double)> const& told, LeafMemory leafMemory) {
  if (fileSize > memoryBytes) return std::nullopt;
  try {
    auto const size = static_cast<std::size_t>(fileSize);
    std::unique_ptr<char[]> const bytes = bytesOf(path, size);
    if (!bytes) return std::nullopt;
    VdbFile file;
    file.path = path;
    file.memoryBytes = memoryBytes;
    CheckedReader(WalkedBytes(bytes.get(), size), memoryBytes - fileSize, told, leafMemory).read(file);
    return file;
  } catch (ReadingStopped const& stopped) {
    std::rethrow_exception(stopped.reason);
  } catch (WalkEnds const&) { return std::nullopt; } catch (std::exception const&) {
    return std::nullopt;
  }
}

} // namespace VLN::Interop
