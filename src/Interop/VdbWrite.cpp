#include "Interop/VdbWriteImpl.h"

#include "Interop/FileError.h"

#include <openvdb/io/Archive.h>

#include <cstdio>
#include <sstream>

namespace VLN::Interop {

namespace {

// OpenVDB's own writer of files does not ask whether its writes succeed. So the bytes are made in memory, and
// written with every step checked.
class MemoryArchive : public openvdb::io::Archive {
public:
  std::string write(openvdb::GridPtrVec const& grids, openvdb::MetaMap const& metadata) const {
    std::ostringstream out(std::ios::binary);
    openvdb::GridCPtrVec const constGrids(grids.begin(), grids.end());
    Archive::write(out, constGrids, /*seekable=*/true, metadata);
    return std::move(out).str();
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

void writeVdbFile(OutputFile& file, openvdb::GridPtrVec const& grids, openvdb::MetaMap const& metadata) {
  std::string bytes;
  try {
    // Written anew; one of a foreign type would be in the way.
    for (auto const& grid : grids) grid->removeMeta(openvdb::GridBase::META_FILE_COMPRESSION);
    bytes = MemoryArchive().write(grids, metadata);
  } catch (openvdb::Exception const& error) {
    throw FileError(file.path(), "cannot be written: " + oneLine(error.what()));
  }
  setIdentity(bytes);
  file.write(bytes.data(), bytes.size());
  file.commit();
}

} // namespace VLN::Interop
