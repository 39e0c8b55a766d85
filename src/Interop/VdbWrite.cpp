#include "Interop/VdbWriteImpl.h"

#include "Interop/FileError.h"

#include <openvdb/io/Archive.h>
#include <openvdb/io/GridDescriptor.h>
#include <openvdb/io/io.h>

#include <cstdio>
#include <map>
#include <set>
#include <sstream>

namespace VLN::Interop {

namespace {

// OpenVDB's own writer of files does not ask whether its writes succeed. So the bytes are made in memory, and
// written with every step checked. It also wants all grids at once; here each is there for its turn alone.
class MemoryArchive : public openvdb::io::Archive {
public:
  std::string write(std::string const& path, std::vector<GridInTurn> const& grids,
                    openvdb::MetaMap const& metadata) const {
    std::ostringstream out(std::ios::binary);
    auto const toldAs = [&](auto const& step) {
      try {
        step();
      } catch (openvdb::Exception const& error) {
        throw FileError(path, "cannot be written: " + oneLine(error.what()));
      }
    };
    toldAs([&] {
      openvdb::io::setWriteGridStatsMetadata(out, isGridStatsMetadataEnabled());
      writeHeader(out, /*seekable=*/true);
      metadata.writeMeta(out);
      auto const count = static_cast<std::int32_t>(grids.size());
      out.write(reinterpret_cast<char const*>(&count), sizeof count);
    });
    std::map<std::string, int> alike;
    for (auto const& grid : grids) ++alike[grid.name];
    std::set<std::string> taken;
    for (auto const& inTurn : grids) {
      auto const grid = inTurn.make();
      toldAs([&] {
        // Written anew; one of a foreign type would be in the way.
        grid->removeMeta(openvdb::GridBase::META_FILE_COMPRESSION);
        openvdb::io::GridDescriptor descriptor(uniqueName(inTurn.name, alike[inTurn.name] > 1, taken),
                                               grid->type(), grid->saveFloatAsHalf());
        writeGrid(descriptor, grid, out, /*seekable=*/true);
      });
    }
    return std::move(out).str();
  }

private:
  // As OpenVDB tells grids of one name, or of none, apart.
  static std::string uniqueName(std::string const& name, bool hasNamesakes, std::set<std::string>& taken) {
    using openvdb::io::GridDescriptor;
    std::string unique = name.empty() || hasNamesakes ? GridDescriptor::addSuffix(name, 0) : name;
    for (int n = 1; !taken.insert(unique).second; ++n) unique = GridDescriptor::addSuffix(name, n);
    return unique;
  }
};

// The library gives each file an arbitrary identity; one computed from the content makes equal volumes
// equal files. It stands behind the magic number, the versions and a flag.
void setIdentity(std::string& bytes) {
  constexpr std::size_t kBegin = 8 + 4 + 4 + 4 + 1, kLength = 36;
  if (bytes.size() < kBegin + kLength) return;
  std::uint64_t hash[2] = {0xcbf29ce484222325u, 0x84222325cbf29ce4u};
  for (std::size_t n = kBegin + kLength; n < bytes.size(); ++n)
    for (auto& h : hash) h = (h ^ static_cast<unsigned char>(bytes[n])) * 0x100000001b3u;
  char text[kLength + 1];
  std::snprintf(text, sizeof text, "%08x-%04x-5%03x-8%03x-%012llx", unsigned(hash[0] >> 32),
                unsigned(hash[0] >> 16 & 0xffff), unsigned(hash[0] & 0xfff), unsigned(hash[1] >> 48 & 0xfff),
                static_cast<unsigned long long>(hash[1] & 0xffffffffffffu));
  bytes.replace(kBegin, kLength, text, kLength);
}

} // namespace

void writeVdbFile(OutputFile& file, std::vector<GridInTurn> const& grids, openvdb::MetaMap const& metadata,
                  std::function<void()> const& onWriting) {
  std::string bytes = MemoryArchive().write(file.path(), grids, metadata);
  if (onWriting) onWriting();
  setIdentity(bytes);
  file.write(bytes.data(), bytes.size());
  file.commit();
}

void writeVdbFile(OutputFile& file, openvdb::GridBase::Ptr const& grid) {
  writeVdbFile(file, {{grid->getName(), [&] { return grid; }}}, {});
}

} // namespace VLN::Interop
