// NvttFile: the envelope of a .nvtt file, which holds a NanoVTT buffer as it stands in memory.
//
//   │ header 128 │ directory │ page hashes │ 0 │ buffer: container, grids │ 0 │ traversal │ 0 │ neighbours │
//   0 │ bounds │ └────────────────────────────────────────┘ ^ multiple of 4096           ^ multiples of 64
//
// docs/flat_buffer.md has the byte tables. What a later version adds is skipped here: sections of unknown
// types, and what headers and directory entries hold beyond the bytes known here. A file says itself which
// version of a reader it needs at least.
//
// The file's bytes, mapped or read, are used in place. open() looks at the envelope alone, so that a part can
// be used after it alone was checked; validate() of NanoVTTValidate.h then judges the buffer.
#pragma once

#include "Reader/Hash64.h"
#include "Reader/NanoVTTFormat.h"
#include "Reader/NanoVTTValidate.h"

namespace nanovtt {

/// The first bytes are not text, and show whether line ends were changed on the way.
inline constexpr std::uint64_t kNvttMagic = 0x1A0A0D5454564E89ull; // 0x89 'N' 'V' 'T' 'T' CR LF 0x1A
inline constexpr std::uint32_t kNvttVersion = 1;
inline constexpr std::uint32_t kNvttByteOrder = 0x01020304u;
inline constexpr std::uint64_t kNvttHeaderBytes = 128;
inline constexpr std::uint64_t kNvttEntryBytes = 32;
inline constexpr std::uint64_t kNvttPageBytes = std::uint64_t(1) << 20;
inline constexpr std::uint64_t kNvttSectionAlignment = 64;
/// Of the first section, so that a mapped buffer begins with a page of memory.
inline constexpr std::uint64_t kNvttDataAlignment = 4096;

// Header
inline constexpr std::uint64_t kNvttMagicOffset = 0;           // u64
inline constexpr std::uint64_t kNvttVersionOffset = 8;         // u32, of the writer
inline constexpr std::uint64_t kNvttReaderVersionOffset = 12;  // u32, the oldest reader that will do
inline constexpr std::uint64_t kNvttByteOrderOffset = 16;      // u32
inline constexpr std::uint64_t kNvttHeaderSizeOffset = 20;     // u32, at least 128
inline constexpr std::uint64_t kNvttFileLengthOffset = 24;     // u64
inline constexpr std::uint64_t kNvttDirectoryOffset = 32;      // u64
inline constexpr std::uint64_t kNvttEntryCountOffset = 40;     // u32
inline constexpr std::uint64_t kNvttEntrySizeOffset = 44;      // u32, at least 32
inline constexpr std::uint64_t kNvttPageTableOffset = 48;      // u64
inline constexpr std::uint64_t kNvttPageCountOffset = 56;      // u64
inline constexpr std::uint64_t kNvttPageSizeOffset = 64;       // u64
inline constexpr std::uint64_t kNvttDataOffset = 72;           // u64, where the first page begins
inline constexpr std::uint64_t kNvttBufferOffset = 80;         // u64
inline constexpr std::uint64_t kNvttBufferLengthOffset = 88;   // u64
inline constexpr std::uint64_t kNvttDirectoryHashOffset = 96;  // u64
inline constexpr std::uint64_t kNvttPageTableHashOffset = 104; // u64
inline constexpr std::uint64_t kNvttHeaderHashOffset = 120;    // u64, of the bytes before it

// Directory entry
inline constexpr std::uint64_t kNvttEntryTypeOffset = 0;    // u32
inline constexpr std::uint64_t kNvttEntryIndexOffset = 4;   // u32, the number of a grid
inline constexpr std::uint64_t kNvttEntryStartOffset = 8;   // u64, from the start of the file
inline constexpr std::uint64_t kNvttEntryLengthOffset = 16; // u64
inline constexpr std::uint64_t kNvttEntryHashOffset = 24;   // u64

enum class NvttSectionType : std::uint32_t {
  kContainer = 1,
  kGrid = 2,
  kTraversal = 3,
  kNeighbors = 4,
  kBounds = 5
};

struct NvttSection {
  NvttSectionType type = {};
  std::uint32_t index = 0;
  std::uint64_t offset = 0, length = 0, hash = 0;
};

class NvttFile {
public:
  /// Looks at the header alone, of which 128 bytes suffice: whether a file of that length is whole, and how
  /// large its buffer is, before any more of it is read.
  /// @return The first fault, at its offset in the file.
  static Validation openHeader(void const* bytes, std::uint64_t available, std::uint64_t fileLength,
                               NvttFile& file) {
    file = NvttFile();
    file.m_bytes = static_cast<unsigned char const*>(bytes);
    file.m_length = fileLength;
    if (available < kNvttHeaderBytes || fileLength < kNvttHeaderBytes)
      return {"shorter than a header", available};
    return file.header();
  }
  /// Checks header, directory and page table, with their hashes. Reads nothing of the sections.
  static Validation open(void const* bytes, std::uint64_t length, NvttFile& file) {
    Validation const answer = openHeader(bytes, length, length, file);
    return answer.ok() ? file.directory() : answer;
  }

  std::uint32_t version() const { return get<std::uint32_t>(kNvttVersionOffset); }
  std::uint64_t fileLength() const { return m_length; }
  unsigned char const* buffer() const { return m_bytes + get<std::uint64_t>(kNvttBufferOffset); }
  std::uint64_t bufferLength() const { return get<std::uint64_t>(kNvttBufferLengthOffset); }

  std::uint32_t sectionCount() const { return get<std::uint32_t>(kNvttEntryCountOffset); }
  NvttSection section(std::uint32_t n) const {
    std::uint64_t const at = get<std::uint64_t>(kNvttDirectoryOffset) + n * entryBytes();
    return {static_cast<NvttSectionType>(get<std::uint32_t>(at + kNvttEntryTypeOffset)),
            get<std::uint32_t>(at + kNvttEntryIndexOffset), get<std::uint64_t>(at + kNvttEntryStartOffset),
            get<std::uint64_t>(at + kNvttEntryLengthOffset), get<std::uint64_t>(at + kNvttEntryHashOffset)};
  }
  /// The number of a section; sectionCount() when there is none.
  std::uint32_t find(NvttSectionType type, std::uint32_t index = 0) const {
    std::uint32_t n = 0;
    for (; n < sectionCount(); ++n) {
      NvttSection const s = section(n);
      if (s.type == type && s.index == index) break;
    }
    return n;
  }
  unsigned char const* data(NvttSection const& s) const { return m_bytes + s.offset; }
  /// @cost Reads the section.
  bool isIntact(NvttSection const& s) const { return hash64(data(s), s.length) == s.hash; }

  std::uint64_t pageCount() const { return get<std::uint64_t>(kNvttPageCountOffset); }
  std::uint64_t pageStart(std::uint64_t page) const {
    return get<std::uint64_t>(kNvttDataOffset) + page * get<std::uint64_t>(kNvttPageSizeOffset);
  }
  std::uint64_t pageLength(std::uint64_t page) const {
    std::uint64_t const left = m_length - pageStart(page), size = get<std::uint64_t>(kNvttPageSizeOffset);
    return left < size ? left : size;
  }
  /// @cost Reads the page.
  bool isPageIntact(std::uint64_t page) const {
    return hash64(m_bytes + pageStart(page), pageLength(page)) ==
           get<std::uint64_t>(get<std::uint64_t>(kNvttPageTableOffset) + 8 * page);
  }
  /// Checks every page, which is every byte behind the page table. @cost Reads all of the file.
  Validation checkPages() const {
    for (std::uint64_t page = 0; page < pageCount(); ++page)
      if (!isPageIntact(page)) return {"a page differs from its hash", pageStart(page)};
    return {};
  }

private:
  template <class T> T get(std::uint64_t at) const { return load<T>(m_bytes + at); }
  std::uint64_t entryBytes() const { return get<std::uint32_t>(kNvttEntrySizeOffset); }
  /// Whether `count` items of `size` bytes from `start` on lie in the file, behind the header.
  bool fits(std::uint64_t start, std::uint64_t count, std::uint64_t size) const {
    return start >= kNvttHeaderBytes && start <= m_length && count <= (m_length - start) / size;
  }

  Validation header() const {
    if (get<std::uint64_t>(kNvttMagicOffset) != kNvttMagic) return {"not a flat file", kNvttMagicOffset};
    if (get<std::uint32_t>(kNvttByteOrderOffset) != kNvttByteOrder)
      return {"byte order", kNvttByteOrderOffset};
    if (get<std::uint32_t>(kNvttReaderVersionOffset) > kNvttVersion)
      return {"needs a later version of the reader", kNvttReaderVersionOffset};
    if (get<std::uint64_t>(kNvttHeaderHashOffset) != hash64(m_bytes, kNvttHeaderHashOffset))
      return {"the header differs from its hash", kNvttHeaderHashOffset};
    if (get<std::uint64_t>(kNvttFileLengthOffset) != m_length)
      return {"length of the file", kNvttFileLengthOffset};
    if (get<std::uint32_t>(kNvttHeaderSizeOffset) < kNvttHeaderBytes)
      return {"header size", kNvttHeaderSizeOffset};
    if (entryBytes() < kNvttEntryBytes) return {"size of directory entries", kNvttEntrySizeOffset};
    if (!fits(get<std::uint64_t>(kNvttDirectoryOffset), sectionCount(), entryBytes()))
      return {"the directory is beyond the end", kNvttDirectoryOffset};
    if (!fits(get<std::uint64_t>(kNvttPageTableOffset), pageCount(), 8))
      return {"the page table is beyond the end", kNvttPageTableOffset};
    auto const data = get<std::uint64_t>(kNvttDataOffset), page = get<std::uint64_t>(kNvttPageSizeOffset);
    if (data < kNvttHeaderBytes || data > m_length) return {"start of the data", kNvttDataOffset};
    if (page < kNvttDataAlignment || page % kNvttDataAlignment) return {"page size", kNvttPageSizeOffset};
    std::uint64_t const left = m_length - data;
    if (pageCount() != left / page + (left % page != 0)) return {"number of pages", kNvttPageCountOffset};
    auto const start = get<std::uint64_t>(kNvttBufferOffset);
    if (start < data || start % kNvttSectionAlignment) return {"start of the buffer", kNvttBufferOffset};
    if (!fits(start, bufferLength(), 1)) return {"the buffer is beyond the end", kNvttBufferLengthOffset};
    return {};
  }

  Validation directory() const {
    auto const start = get<std::uint64_t>(kNvttDirectoryOffset),
               pages = get<std::uint64_t>(kNvttPageTableOffset);
    if (hash64(m_bytes + start, sectionCount() * entryBytes()) !=
        get<std::uint64_t>(kNvttDirectoryHashOffset))
      return {"the directory differs from its hash", start};
    if (hash64(m_bytes + pages, pageCount() * 8) != get<std::uint64_t>(kNvttPageTableHashOffset))
      return {"the page table differs from its hash", pages};
    auto const buffer = get<std::uint64_t>(kNvttBufferOffset);
    for (std::uint32_t n = 0; n < sectionCount(); ++n) {
      std::uint64_t const at = start + n * entryBytes();
      NvttSection const s = section(n);
      bool inside = fits(s.offset, s.length, 1);
      switch (s.type) {
      case NvttSectionType::kContainer:
      case NvttSectionType::kGrid:
        inside = inside && s.offset >= buffer && s.length <= bufferLength() &&
                 s.offset - buffer <= bufferLength() - s.length;
        break;
      case NvttSectionType::kTraversal:
      case NvttSectionType::kNeighbors:
      case NvttSectionType::kBounds:
        inside = inside && s.offset % kNvttSectionAlignment == 0;
        break;
      default:
        inside = true; // of a later version, which knows what it is
      }
      if (!inside) return {"a section is beyond the end", at + kNvttEntryStartOffset};
    }
    return {};
  }

  unsigned char const* m_bytes = nullptr;
  std::uint64_t m_length = 0;
};

} // namespace nanovtt
