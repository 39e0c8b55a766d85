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

/// A tree that has been walked through, to be made of its bytes.
class TreeToRead {
public:
  virtual ~TreeToRead() = default;
  /// Where the buffers of its leaves begin.
  std::vector<std::size_t> const& places() const { return m_places; }
  /// @param in With the versions of the file set.
  virtual void makeNodes(MemoryStream& in) = 0;
  virtual void readLeaves(std::int64_t first, std::int64_t last) const = 0;
  /// Null for leaves with buffers.
  std::shared_ptr<PackedLeaves> const& packed() const { return m_packed; }

protected:
  std::vector<std::size_t> m_places;
  std::shared_ptr<PackedLeaves> m_packed;
};

template <class TreeT> class TypedTreeToRead final : public TreeToRead {
public:
  /// @param bytes At the tree; afterwards behind it.
  /// @error WalkEnds, also where the tree would take more than `memoryLeft`, which falls by what it takes.
  TypedTreeToRead(TreeT& tree, WalkedBytes& bytes, ValueCoding const& coding, LeafMemory leafMemory,
                  std::uint64_t& memoryLeft)
      : m_tree(tree)
      , m_bytes(bytes.data(), bytes.size())
      , m_coding(coding)
      , m_leafMemory(leafMemory)
      , m_begin(bytes.place()) {
    WalkedTree const walked = walkTopology<TreeT>(bytes, coding);
    walkOnlyIf(walked.memory <= memoryLeft);
    memoryLeft -= walked.memory;
    m_end = bytes.place();
    m_places.reserve(walked.leaves);
    for (std::uint64_t n = 0; n < walked.leaves; ++n) {
      m_places.push_back(bytes.place());
      walkBuffers<Leaf>(bytes, coding);
    }
  }

  void makeNodes(MemoryStream& in) override {
    openvdb::io::setDataCompression(in, m_coding.compression);
    in.goTo(m_begin);
    m_tree.readTopology(in, m_coding.half);
    walkOnlyIf(in.place() == m_end);
    m_leaves.reserve(m_places.size());
    m_tree.getNodes(m_leaves);
    walkOnlyIf(m_leaves.size() == m_places.size());
    if (m_leafMemory != LeafMemory::kPacked) return;
    openvdb::Index32 next = 0;
    forEachInOrder<LeadingAxis::kZ>(
        m_tree, [&](Leaf& leaf) { leaf.setTransientData(next++); }, [](auto const&...) {});
    m_packed = std::make_shared<PackedLeaves>(m_leaves.size() * Leaf::SIZE * sizeof(Value));
  }

  void readLeaves(std::int64_t first, std::int64_t last) const override {
    MemoryStream in(m_bytes);
    for (auto n = static_cast<std::size_t>(first); n < static_cast<std::size_t>(last); ++n)
      readLeaf(*m_leaves[n], m_bytes, m_places[n], in, m_coding, m_tree.background(), valuesOf(*m_leaves[n]));
  }

private:
  using Leaf = typename TreeT::LeafNodeType;
  using Value = typename TreeT::ValueType;

  Value* valuesOf(Leaf& leaf) const {
    return m_packed ? static_cast<Value*>(m_packed->begin()) + std::size_t(leaf.transientData()) * Leaf::SIZE
                    : leaf.buffer().data();
  }

  TreeT& m_tree;
  WalkedBytes m_bytes; ///< all of the file
  ValueCoding m_coding;
  LeafMemory m_leafMemory;
  std::size_t m_begin, m_end = 0;
  std::vector<Leaf*> m_leaves;
};

class CheckedReader : public openvdb::io::Archive {
public:
  CheckedReader(WalkedBytes bytes, std::uint64_t memoryBytes, std::function<void(double)> const& progress,
                LeafMemory leafMemory)
      : m_leafMemory(leafMemory)
      , m_bytes(bytes)
      , m_all(bytes)
      , m_in(bytes)
      , m_memoryLeft(memoryBytes)
      , m_progress(progress) {}

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
    for (auto count = m_bytes.number<std::int32_t>(); count > 0; --count) walkGrid(file);
    readTrees(file);
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

  // Its tree is still to be made.
  void walkGrid(VdbFile& file) {
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
    readMetadata(*grid);
    readTransform(*grid);
    coding.half = grid->saveFloatAsHalf();
    std::size_t const known = m_trees.size();
    auto const attempt = [&]<class GridT>(GridT const*) {
      if (m_trees.size() > known || !grid->isType<GridT>()) return;
      m_trees.push_back(std::make_unique<TypedTreeToRead<typename GridT::TreeType>>(
          static_cast<GridT&>(*grid).tree(), m_bytes, coding, m_leafMemory, m_memoryLeft));
    };
#define VLN_ATTEMPT(GridT) attempt(static_cast<openvdb::GridT const*>(nullptr));
    VLN_FOR_EACH_VDB_REAL_GRID(VLN_ATTEMPT)
    VLN_FOR_EACH_VDB_VECTOR_GRID(VLN_ATTEMPT)
    VLN_ATTEMPT(Int64Grid) // bytes of a file may be no bools
#undef VLN_ATTEMPT
    walkOnlyIf(m_trees.size() > known);
    file.grids.push_back(std::move(grid));
  }

  /// Makes all trees at once, and then all leaves: those of many small grids keep all cores busy.
  void readTrees(VdbFile& file) {
    parallelFor(0, std::int64_t(m_trees.size()), [&](std::int64_t first, std::int64_t last) {
      MemoryStream in(m_all);
      openvdb::io::setVersion(in, libraryVersion(), fileVersion());
      for (auto n = static_cast<std::size_t>(first); n < static_cast<std::size_t>(last); ++n)
        m_trees[n]->makeNodes(in);
    });
    for (std::size_t n = 0; n < m_trees.size(); ++n)
      if (auto const& packed = m_trees[n]->packed()) file.packed.emplace(file.grids[n].get(), packed);

    struct Part {
      TreeToRead const* tree;
      std::int64_t first, last; ///< leaves
    };
    std::vector<Part> parts;
    std::int64_t leaves = 0;
    auto const read = [&] {
      if (parts.empty()) return;
      reportProgress(parts[0].tree->places()[parts[0].first]);
      parallelFor(0, std::int64_t(parts.size()), [&](std::int64_t first, std::int64_t last) {
        for (auto n = static_cast<std::size_t>(first); n < static_cast<std::size_t>(last); ++n)
          parts[n].tree->readLeaves(parts[n].first, parts[n].last);
      });
      parts.clear();
      leaves = 0;
    };
    for (auto const& tree : m_trees) {
      auto const count = std::int64_t(tree->places().size());
      for (std::int64_t first = 0; first < count; first += kLeavesInPart) {
        parts.push_back({tree.get(), first, std::min(first + kLeavesInPart, count)});
        leaves += kLeavesInPart;
        if (leaves >= kLeavesAtOnce) read();
      }
    }
    read();
  }

  void reportProgress(std::size_t place) const {
    if (!m_progress) return;
    try {
      m_progress(double(place) / double(m_bytes.size()));
    } catch (...) { throw ReadingStopped{std::current_exception()}; }
  }

  static constexpr std::int64_t kLeavesInPart = 64, kLeavesAtOnce = 16384; ///< some hundredths of a second

  LeafMemory m_leafMemory;
  WalkedBytes m_bytes, m_all; ///< what is to come, and all of the file
  MemoryStream m_in;
  std::uint64_t m_memoryLeft;
  std::function<void(double)> const& m_progress;
  std::vector<std::unique_ptr<TreeToRead>> m_trees; ///< of the file's grids
};

} // namespace

std::optional<VdbFile> readChecked(std::string const& path, std::uint64_t fileSize, std::uint64_t memoryBytes,
                                   std::function<void(double)> const& progress, LeafMemory leafMemory) {
  if (fileSize > memoryBytes) return std::nullopt;
  try {
    auto const size = static_cast<std::size_t>(fileSize);
    std::unique_ptr<char[]> const bytes = bytesOf(path, size);
    if (!bytes) return std::nullopt;
    VdbFile file;
    file.path = path;
    file.memoryBytes = memoryBytes;
    CheckedReader(WalkedBytes(bytes.get(), size), memoryBytes - fileSize, progress, leafMemory).read(file);
    return file;
  } catch (ReadingStopped const& stopped) {
    std::rethrow_exception(stopped.reason);
  } catch (WalkEnds const&) { return std::nullopt; } catch (std::exception const&) {
    return std::nullopt;
  }
}

} // namespace VLN::Interop
