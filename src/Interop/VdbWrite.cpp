#include "Interop/VdbWriteImpl.h"

#include "Interop/FileError.h"
#include "Reader/Hash64.h"

#include <openvdb/io/Archive.h>
#include <openvdb/io/GridDescriptor.h>
#include <openvdb/io/io.h>

#include <algorithm>
#include <cstdio>
#include <cstring>
#include <map>
#include <memory>
#include <ostream>
#include <set>
#include <streambuf>

namespace VLN::Interop {

namespace {

// Bytes of a file in pieces: one that grows as a whole would be copied, and be there twice meanwhile.
class FileBytes : public std::streambuf {
public:
  std::size_t size() const { return m_size; }
  /// Calls `f(bytes, count)` for each piece from a place on.
  template <class F> void forEachPiece(std::size_t from, F const& f) const {
    for (std::size_t at = from; at < m_size;) {
      std::size_t const count = std::min(kPiece - at % kPiece, m_size - at);
      f(m_pieces[at / kPiece].get() + at % kPiece, count);
      at += count;
    }
  }
  void replace(std::size_t place, char const* bytes, std::size_t count) {
    m_at = place;
    append(bytes, count);
  }

protected:
  std::streamsize xsputn(char const* bytes, std::streamsize count) override {
    append(bytes, static_cast<std::size_t>(count));
    return count;
  }
  int_type overflow(int_type c) override {
    if (traits_type::eq_int_type(c, traits_type::eof())) return traits_type::not_eof(c);
    char const byte = traits_type::to_char_type(c);
    append(&byte, 1);
    return c;
  }
  pos_type seekoff(off_type by, std::ios_base::seekdir from, std::ios_base::openmode) override {
    off_type const base = from == std::ios_base::beg   ? 0
                          : from == std::ios_base::cur ? static_cast<off_type>(m_at)
                                                       : static_cast<off_type>(m_size);
    return seekpos(base + by, std::ios_base::out);
  }
  pos_type seekpos(pos_type to, std::ios_base::openmode) override {
    auto const place = static_cast<off_type>(to);
    if (place < 0 || place > static_cast<off_type>(m_size)) return pos_type(off_type(-1));
    m_at = static_cast<std::size_t>(place);
    return to;
  }

private:
  void append(char const* bytes, std::size_t count) {
    while (count > 0) {
      if (m_at / kPiece == m_pieces.size()) m_pieces.emplace_back(new char[kPiece]);
      std::size_t const part = std::min(kPiece - m_at % kPiece, count);
      std::memcpy(m_pieces[m_at / kPiece].get() + m_at % kPiece, bytes, part);
      m_at += part, bytes += part, count -= part;
      m_size = std::max(m_size, m_at);
    }
  }

  static constexpr std::size_t kPiece = std::size_t(1) << 20;
  std::vector<std::unique_ptr<char[]>> m_pieces;
  std::size_t m_at = 0, m_size = 0;
};

// OpenVDB's own writer of files does not ask whether its writes succeed. So the bytes are made in memory, and
// written with every step checked. It also wants all grids at once; here each is there for its turn alone.
class MemoryArchive : public openvdb::io::Archive {
public:
  void write(std::string const& path, std::vector<GridInTurn> const& grids, openvdb::MetaMap const& metadata,
             FileBytes& bytes) const {
    std::ostream out(&bytes);
    out.exceptions(std::ios::badbit); // there was no memory
    auto const withFileErrors = [&](auto const& step) {
      try {
        step();
      } catch (openvdb::Exception const& error) {
        throw FileError(path, "cannot be written: " + oneLine(error.what()));
      }
    };
    withFileErrors([&] {
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
      withFileErrors([&] {
        // Written anew; one of a foreign type would be in the way.
        grid->removeMeta(openvdb::GridBase::META_FILE_COMPRESSION);
        openvdb::io::GridDescriptor descriptor(uniqueName(inTurn.name, alike[inTurn.name] > 1, taken),
                                               grid->type(), grid->saveFloatAsHalf());
        writeGrid(descriptor, grid, out, /*seekable=*/true);
      });
    }
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
void setIdentity(FileBytes& bytes) {
  constexpr std::size_t kBegin = 8 + 4 + 4 + 4 + 1, kLength = 36;
  if (bytes.size() < kBegin + kLength) return;
  std::vector<std::uint64_t> hashes; // of the pieces, and then of those
  bytes.forEachPiece(kBegin + kLength, [&](char const* piece, std::size_t count) {
    hashes.push_back(nanovtt::hash64(piece, count));
  });
  std::uint64_t hash[2];
  for (std::uint64_t& h : hash) {
    h = nanovtt::hash64(hashes.data(), hashes.size() * sizeof hashes[0]);
    hashes.push_back(h);
  }
  char text[kLength + 1];
  std::snprintf(text, sizeof text, "%08x-%04x-5%03x-8%03x-%012llx", unsigned(hash[0] >> 32),
                unsigned(hash[0] >> 16 & 0xffff), unsigned(hash[0] & 0xfff), unsigned(hash[1] >> 48 & 0xfff),
                static_cast<unsigned long long>(hash[1] & 0xffffffffffffu));
  bytes.replace(kBegin, text, kLength);
}

} // namespace

void writeVdbFile(OutputFile& file, std::vector<GridInTurn> const& grids, openvdb::MetaMap const& metadata,
                  std::function<void()> const& onWriting) {
  FileBytes bytes;
  MemoryArchive().write(file.path(), grids, metadata, bytes);
  if (onWriting) onWriting();
  setIdentity(bytes);
  bytes.forEachPiece(0, [&](char const* piece, std::size_t count) { file.write(piece, count); });
  file.commit();
}

void writeVdbFile(OutputFile& file, openvdb::GridBase::Ptr const& grid) {
  writeVdbFile(file, {{grid->getName(), [&] { return grid; }}}, {});
}

} // namespace VLN::Interop
