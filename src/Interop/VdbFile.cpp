#include "Interop/VdbFile.h"

#include "Interop/FileError.h"
#include "Interop/GuardedReadImpl.h"
#include "Interop/RegularFileImpl.h"
#include "Interop/VdbCheckedImpl.h"
#include "Interop/VdbFileImpl.h"

#include <openvdb/io/Archive.h>
#include <openvdb/io/GridDescriptor.h>
#include <openvdb/io/io.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fstream>
#include <sstream>

namespace VLN::Interop {

namespace {

// Regular file that starts as a .vdb file does. Returns its size.
std::uint64_t checkHeader(std::string const& path) {
  std::uint64_t const size = regularFileSize(path);
  std::ifstream in(path, std::ios::binary);
  unsigned char head[8] = {};
  in.read(reinterpret_cast<char*>(head), sizeof head);
  static constexpr unsigned char kMagic[8] = {0x20, 0x42, 0x44, 0x56, 0, 0, 0, 0};
  auto const got = static_cast<std::size_t>(in.gcount());
  if (std::memcmp(head, kMagic, std::min(got, sizeof head)) != 0)
    throw FileError(path, "is not an OpenVDB file");
  if (got < sizeof head) throw FileError(path, "is truncated");
  return size;
}

// OpenVDB's own readers give a file up at the first grid of a type that is not registered. This one goes on
// behind it.
class WholeReader : public openvdb::io::Archive {
public:
  void read(std::istream& in, VdbFile& file) {
    readHeader(in);
    auto streamMetadata = std::make_shared<openvdb::io::StreamMetadata>();
    openvdb::io::setStreamMetadataPtr(in, streamMetadata, /*transfer=*/false);
    openvdb::io::setVersion(in, libraryVersion(), fileVersion());
    setDataCompression(in);
    file.metadata = std::make_shared<openvdb::MetaMap>();
    file.metadata->readMeta(in);
    std::int32_t const count = readGridCount(in);
    std::vector<openvdb::io::GridDescriptor> descriptors;
    NamedGridMap byName;
    for (std::int32_t n = 0; n < count; ++n) {
      openvdb::io::GridDescriptor descriptor;
      auto const grid = create(in, descriptor);
      if (!grid) {
        skip(in, descriptor, file);
        continue;
      }
      readGrid(grid, descriptor, in);
      descriptors.push_back(descriptor);
      file.grids.push_back(grid);
      byName[descriptor.uniqueName()] = grid;
    }
    for (auto const& descriptor : descriptors) connectInstance(descriptor, byName);
  }

private:
  // Null for an unknown type: the offsets come next then.
  static openvdb::GridBase::Ptr create(std::istream& in, openvdb::io::GridDescriptor& descriptor) {
    try {
      return descriptor.read(in);
    } catch (openvdb::LookupError const&) { return nullptr; }
  }

  void skip(std::istream& in, openvdb::io::GridDescriptor const& descriptor, VdbFile& file) {
    std::int64_t offsets[3] = {}; // of the grid, of its blocks, of its end
    in.read(reinterpret_cast<char*>(offsets), sizeof offsets);
    if (!inputHasGridOffsets() || offsets[2] < in.tellg())
      throw std::runtime_error("grids of type " + oneLine(descriptor.gridType(), 60) + " are not read");
    in.seekg(offsets[2]);
    file.skipped.push_back({openvdb::io::GridDescriptor::nameAsString(descriptor.uniqueName()),
                            "grids of type " + oneLine(descriptor.gridType()) + " are not read"});
  }
};

// Reads from a stream that throws at the first byte that is missing: OpenVDB itself does not ask whether its
// reads succeed, and would go on with whatever its buffers hold.
VdbFile readWhole(std::string const& path) {
  openvdb::initialize();
  VdbFile file;
  file.path = path;
  std::ifstream in(path, std::ios::binary);
  if (!in) throw FileError(path, std::string("cannot be opened: ") + std::strerror(errno));
  in.exceptions(std::ios::failbit | std::ios::badbit | std::ios::eofbit);
  WholeReader().read(in, file);
  return file;
}

} // namespace

void probeVdbFile(std::string const& path, VdbReadLimits const& limits) {
  openvdb::initialize();
  probeInChild(path, limits, checkHeader(path), [&] { return readWhole(path); });
}

VdbFile readVdbFile(std::string const& path, VdbReadLimits const& limits,
                    std::function<void(double)> const& progress, LeafMemory leafMemory) {
  openvdb::initialize();
  std::uint64_t const size = checkHeader(path);
  VdbReadLimits const bounds = effectiveLimits(limits, size);
  if (auto file = readChecked(path, size, bounds.memoryBytes, progress, leafMemory)) return std::move(*file);
  return readGuarded(path, bounds, size, [&] { return readWhole(path); });
}

char const* openvdbVersion() { return openvdb::getLibraryVersionString(); }

} // namespace VLN::Interop
