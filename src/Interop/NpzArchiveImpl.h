// An .npz file is a zip archive of .npy files:
//
//   [local header, content, sizes and checksum] ...  [directory: one record for each]  [end records]
//
// Sizes are known only behind the content, and may be large: all of them are of 64 bits.
#pragma once

#include "Interop/FileError.h"
#include "Interop/FreeNameImpl.h"
#include "Interop/OutputFile.h"

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstring>
#include <iterator>
#include <new>
#include <set>
#include <string>
#include <vector>

#include <zlib.h>

namespace VLN::Interop {

class ZipWriter {
public:
  explicit ZipWriter(OutputFile& out)
      : m_out(out) {}
  ZipWriter(ZipWriter const&) = delete;
  ZipWriter& operator=(ZipWriter const&) = delete;
  ~ZipWriter() {
    if (m_open) deflateEnd(&m_stream);
  }

  void begin(std::string const& name) {
    m_members.push_back({name, m_position, 0, 0, 0});
    m_stream = {};
    if (deflateInit2(&m_stream, 1, Z_DEFLATED, -MAX_WBITS, 8, Z_DEFAULT_STRATEGY) != Z_OK)
      throw std::bad_alloc();
    m_open = true;
    Record header;
    header.number<4>(0x04034b50).number<2>(45).number<2>(kFlags).number<2>(Z_DEFLATED);
    header.number<2>(0).number<2>(kDate).number<4>(0).number<4>(0xffffffff).number<4>(0xffffffff);
    header.number<2>(name.size()).number<2>(20).text(name);
    header.number<2>(1).number<2>(16).number<8>(0).number<8>(0);
    put(header);
  }
  void write(void const* bytes, std::size_t count) { deflateAll(bytes, count, Z_NO_FLUSH); }
  void end() {
    deflateAll(nullptr, 0, Z_FINISH);
    deflateEnd(&m_stream);
    m_open = false;
    Member const& m = m_members.back();
    put(Record().number<4>(0x08074b50).number<4>(m.checksum).number<8>(m.packed).number<8>(m.size));
  }
  /// Writes the directory.
  void finish() {
    std::uint64_t const begin = m_position;
    for (Member const& m : m_members) {
      Record record;
      record.number<4>(0x02014b50).number<2>(45).number<2>(45).number<2>(kFlags).number<2>(Z_DEFLATED);
      record.number<2>(0).number<2>(kDate).number<4>(m.checksum).number<4>(0xffffffff).number<4>(0xffffffff);
      record.number<2>(m.name.size()).number<2>(28).number<2>(0).number<2>(0).number<2>(0).number<4>(0);
      record.number<4>(0xffffffff).text(m.name);
      record.number<2>(1).number<2>(24).number<8>(m.size).number<8>(m.packed).number<8>(m.at);
      put(record);
    }
    std::uint64_t const end = m_position, count = m_members.size();
    put(Record()
            .number<4>(0x06064b50)
            .number<8>(44)
            .number<2>(45)
            .number<2>(45)
            .number<4>(0)
            .number<4>(0)
            .number<8>(count)
            .number<8>(count)
            .number<8>(end - begin)
            .number<8>(begin));
    put(Record().number<4>(0x07064b50).number<4>(0).number<8>(end).number<4>(1));
    put(Record()
            .number<4>(0x06054b50)
            .number<2>(0)
            .number<2>(0)
            .number<2>(0xffff)
            .number<2>(0xffff)
            .number<4>(0xffffffff)
            .number<4>(0xffffffff)
            .number<2>(0));
  }

private:
  static constexpr int kFlags = 8 | 1 << 11; ///< sizes behind the content; names are UTF-8
  static constexpr int kDate = 33;           ///< 1980-01-01: the same volume makes the same file

  struct Member {
    std::string name;
    std::uint64_t at, size, packed;
    std::uint32_t checksum;
  };
  /// Numbers with the low byte first.
  struct Record {
    std::string bytes;
    template <int N> Record& number(std::uint64_t value) {
      for (int n = 0; n < N; ++n) bytes += static_cast<char>(value >> 8 * n & 0xff);
      return *this;
    }
    Record& text(std::string const& s) {
      bytes += s;
      return *this;
    }
  };

  void put(Record const& record) {
    m_out.write(record.bytes);
    m_position += record.bytes.size();
  }
  void deflateAll(void const* bytes, std::size_t count, int flush) {
    Member& m = m_members.back();
    auto const* from = static_cast<Bytef const*>(bytes);
    do {
      auto const part = static_cast<uInt>(std::min<std::size_t>(count, 1u << 30));
      if (part > 0) m.checksum = static_cast<std::uint32_t>(crc32(m.checksum, from, part));
      m_stream.next_in = const_cast<Bytef*>(from);
      m_stream.avail_in = part;
      int state = Z_OK;
      do {
        m_stream.next_out = m_room.data();
        m_stream.avail_out = static_cast<uInt>(m_room.size());
        state = deflate(&m_stream, flush);
        std::size_t const made = m_room.size() - m_stream.avail_out;
        m_out.write(m_room.data(), made);
        m.packed += made;
        m_position += made;
      } while (m_stream.avail_out == 0 || (flush == Z_FINISH && state != Z_STREAM_END));
      m.size += part;
      from += part;
      count -= part;
    } while (count > 0);
  }

  OutputFile& m_out;
  std::uint64_t m_position = 0;
  std::vector<Member> m_members;
  z_stream m_stream{};
  bool m_open = false;
  std::array<Bytef, 1 << 16> m_room;
};

/// The head of a .npy file; @param descr As numpy has it: "<f4".
inline std::string npyHeader(std::string const& descr, std::vector<std::int64_t> const& shape,
                             bool fortranOrder) {
  std::string text =
      "{'descr': '" + descr + "', 'fortran_order': " + (fortranOrder ? "True" : "False") + ", 'shape': (";
  for (auto const n : shape) text += std::to_string(n) + ",";
  text += "), }";
  std::size_t const fixed = 10;
  while ((fixed + text.size() + 1) % 64 != 0) text += ' ';
  text += '\n';
  std::string header("\x93NUMPY\x01\x00", 8);
  header += static_cast<char>(text.size() & 0xff);
  header += static_cast<char>(text.size() >> 8);
  return header + text;
}

inline void writeSmall(ZipWriter& zip, std::string const& name, std::string const& descr,
                       std::vector<std::int64_t> const& shape, void const* values, std::size_t bytes) {
  zip.begin(name + ".npy");
  std::string const header = npyHeader(descr, shape, false);
  zip.write(header.data(), header.size());
  zip.write(values, bytes);
  zip.end();
}

/// A name of the archive that no other member has, and that is no path.
inline std::string memberName(std::string const& channel, std::set<std::string>& taken) {
  std::string base = oneLine(channel, 200);
  std::replace(base.begin(), base.end(), '/', '_');
  std::replace(base.begin(), base.end(), '\\', '_');
  constexpr char const* kParts[] = {".background", ".indices", ".values"};
  for (;;) {
    std::string const name = freeName(base, taken);
    // Members of its own follow an array, none of which may be there before it.
    if (std::any_of(std::begin(kParts), std::end(kParts),
                    [&](char const* part) { return taken.contains(name + part); }))
      continue;
    for (char const* part : kParts) taken.insert(name + part);
    return name;
  }
}

} // namespace VLN::Interop
