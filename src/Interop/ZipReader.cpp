#include "Interop/ZipReaderImpl.h"

#include "Interop/ArrayGridImpl.h"

#include <algorithm>

#include <zlib.h>

namespace VLN::Interop {

namespace {

[[noreturn]] void damaged(std::string const& what) {
  throw UnreadableArrays("is truncated or damaged: " + what);
}

constexpr std::uint32_t kLocal = 0x04034b50, kEntry = 0x02014b50, kEnd = 0x06054b50, kEnd64 = 0x06064b50,
                        kLocator64 = 0x07064b50;
constexpr std::uint64_t kEndSize = 22, kEntrySize = 46, kLocalSize = 30;
constexpr std::size_t kStep = 1 << 22; ///< by which what is unpacked grows: its size is a promise

} // namespace

std::string_view ZipReader::part(std::uint64_t at, std::uint64_t count) const {
  if (at > m_bytes.size() || count > m_bytes.size() - at) damaged("a part of the archive lies outside of it");
  return m_bytes.substr(at, count);
}

std::uint64_t ZipReader::number(std::uint64_t at, int bytes) const {
  auto const from = part(at, static_cast<std::uint64_t>(bytes));
  std::uint64_t value = 0;
  for (int n = bytes - 1; n >= 0; --n) value = value << 8 | static_cast<unsigned char>(from[n]);
  return value;
}

ZipReader::ZipReader(std::string_view bytes)
    : m_bytes(bytes) {
  if (bytes.size() < kEndSize || number(0, 4) != kLocal) {
    if (bytes.size() >= kEndSize && number(0, 4) == kEnd) return; // an archive of nothing
    throw UnreadableArrays("is no .npz file: it does not begin as an archive does");
  }
  // A comment of up to 64 kB may stand behind the end record.
  std::uint64_t end = bytes.size() - kEndSize, reach = std::min<std::uint64_t>(end, 0xffff);
  while (number(end, 4) != kEnd) {
    if (reach-- == 0) damaged("the archive has no directory");
    --end;
  }
  std::uint64_t count = number(end + 10, 2), at = number(end + 16, 4);
  if (end >= 20 && number(end - 20, 4) == kLocator64) {
    std::uint64_t const wide = number(end - 12, 8);
    if (number(wide, 4) != kEnd64) damaged("the directory of the archive is not where it should be");
    count = number(wide + 32, 8);
    at = number(wide + 48, 8);
  }
  for (std::uint64_t n = 0; n < count; ++n) {
    if (number(at, 4) != kEntry) damaged("the directory of the archive has fewer members than it says");
    Member m;
    m.method = static_cast<int>(number(at + 10, 2));
    m.checksum = static_cast<std::uint32_t>(number(at + 16, 4));
    m.packed = number(at + 20, 4);
    m.size = number(at + 24, 4);
    m.offset = number(at + 42, 4);
    std::uint64_t const nameSize = number(at + 28, 2), extraSize = number(at + 30, 2);
    m.name = part(at + kEntrySize, nameSize);
    if (number(at + 8, 2) & 1) throw UnreadableArrays("is encrypted");
    // What does not fit into 32 bits stands, in this order, in a field of its own.
    std::uint64_t extra = at + kEntrySize + nameSize;
    for (std::uint64_t const last = extra + extraSize; extra + 4 <= last;) {
      std::uint64_t const size = number(extra + 2, 2);
      if (number(extra, 2) == 1) {
        std::uint64_t from = extra + 4;
        for (std::uint64_t* const value : {&m.size, &m.packed, &m.offset})
          if (*value == 0xffffffff && from + 8 <= extra + 4 + size) *value = number(from, 8), from += 8;
      }
      extra += 4 + size;
    }
    at += kEntrySize + nameSize + extraSize + number(at + 32, 2);
    m_members.push_back(std::move(m));
  }
}

std::string ZipReader::content(Member const& m) const {
  if (number(m.offset, 4) != kLocal) damaged("a member of the archive is not where it should be");
  if (m.offset > m_bytes.size()) damaged("a member lies outside of the archive");
  std::uint64_t const begin = m.offset + kLocalSize + number(m.offset + 26, 2) + number(m.offset + 28, 2);
  auto const packed = part(begin, m.packed);
  std::string bytes;
  if (m.method == 0) {
    if (m.size != m.packed) damaged("a member of the archive has two sizes");
    bytes = packed;
  } else if (m.method == Z_DEFLATED) {
    z_stream stream{};
    if (inflateInit2(&stream, -MAX_WBITS) != Z_OK) throw std::bad_alloc();
    struct Ender {
      z_stream& stream;
      ~Ender() { inflateEnd(&stream); }
    } const ender{stream};
    std::uint64_t taken = 0;
    int state = Z_OK;
    while (state == Z_OK) {
      if (stream.avail_in == 0) {
        auto const next = std::min<std::uint64_t>(packed.size() - taken, 1u << 30);
        stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(packed.data() + taken));
        stream.avail_in = static_cast<uInt>(next);
        taken += next;
      }
      std::size_t const had = bytes.size();
      bytes.resize(had + kStep);
      stream.next_out = reinterpret_cast<Bytef*>(&bytes[had]);
      stream.avail_out = static_cast<uInt>(kStep);
      state = inflate(&stream, Z_NO_FLUSH);
      bytes.resize(bytes.size() - stream.avail_out);
      if (bytes.size() > m.size) damaged("a member of the archive is larger than it says");
    }
    if (state != Z_STREAM_END || bytes.size() != m.size)
      damaged("a member of the archive cannot be unpacked");
  } else
    throw UnreadableArrays(
        "is packed in a way that is not read: its members are neither stored nor deflated");
  uLong sum = crc32(0, nullptr, 0);
  for (std::size_t at = 0; at < bytes.size(); at += 1u << 30)
    sum = crc32(sum, reinterpret_cast<Bytef const*>(bytes.data() + at),
                static_cast<uInt>(std::min<std::size_t>(bytes.size() - at, 1u << 30)));
  if (sum != m.checksum) damaged("the checksum of a member of the archive is wrong");
  return bytes;
}

} // namespace VLN::Interop
