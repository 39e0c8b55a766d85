#include "Interop/NvttWrite.h"

#include "GeometryVolume/core/Parallel.h"
#include "Interop/FileError.h"
#include "Interop/OutputFile.h"
#include "Reader/NanoVTTBounds.h"
#include "Reader/NvttFile.h"

#include <algorithm>
#include <string>
#include <vector>

namespace VLN::Interop {

namespace {

using namespace nanovtt;

/// A run of bytes of the file behind its page table; the gaps between runs are 0.
struct Run {
  std::uint64_t offset;
  unsigned char const* bytes;
  std::uint64_t length;
};

std::uint64_t align(std::uint64_t n, std::uint64_t to) { return (n + to - 1) / to * to; }

class Writer {
public:
  explicit Writer(NvttContent const& content)
      : m_content(content) {
    auto const* const buffer = static_cast<unsigned char const*>(content.buffer);
    BufferReader const reader(buffer);
    std::uint32_t const grids = reader.gridCount();
    bool const traversal = content.traversalLength, neighbors = content.neighborsLength;

    m_header.resize(kNvttHeaderBytes);
    m_directory.resize((1 + grids + traversal + neighbors + content.bounds.size()) * kNvttEntryBytes);
    // Where the data begin depends on the number of pages, and that on where the last section ends; from the
    // start of the data on.
    std::uint64_t end = content.bufferLength;
    std::uint64_t const traversalAt = align(end, kNvttSectionAlignment);
    if (traversal) end = traversalAt + content.traversalLength;
    std::uint64_t const neighborsAt = align(end, kNvttSectionAlignment);
    if (neighbors) end = neighborsAt + content.neighborsLength;
    std::vector<std::uint64_t> boundsAt;
    for (auto const& bounds : content.bounds) {
      boundsAt.push_back(align(end, kNvttSectionAlignment));
      end = boundsAt.back() + bounds.length;
    }
    m_pages.resize(align(end, kNvttPageBytes) / kNvttPageBytes * 8);
    m_data = align(m_header.size() + m_directory.size() + m_pages.size(), kNvttDataAlignment);
    m_length = m_data + end;

    m_runs.push_back({m_data, buffer, content.bufferLength});
    m_sections.push_back({NvttSectionType::kContainer, 0, m_data, reader.container().containerSize(), 0});
    for (std::uint32_t n = 0; n < grids; ++n)
      m_sections.push_back(
          {NvttSectionType::kGrid, n, m_data + reader.gridOffset(n), reader.grid(n).gridSize(), 0});
    if (traversal)
      add(NvttSectionType::kTraversal, m_data + traversalAt, content.traversal, content.traversalLength);
    if (neighbors)
      add(NvttSectionType::kNeighbors, m_data + neighborsAt, content.neighbors, content.neighborsLength);
    for (std::size_t n = 0; n < boundsAt.size(); ++n)
      add(NvttSectionType::kBounds, m_data + boundsAt[n], content.bounds[n].bytes, content.bounds[n].length,
          content.bounds[n].grid);
  }

  void write(OutputFile& file) {
    makeDirectory();
    makePages();
    makeHeader();
    file.write(m_header.data(), m_header.size());
    file.write(m_directory.data(), m_directory.size());
    file.write(m_pages.data(), m_pages.size());
    std::uint64_t at = m_header.size() + m_directory.size() + m_pages.size();
    for (Run const& run : m_runs) {
      std::string const gap(run.offset - at, '\0');
      file.write(gap);
      file.write(run.bytes, run.length);
      at = run.offset + run.length;
    }
  }

private:
  void add(NvttSectionType type, std::uint64_t offset, void const* bytes, std::uint64_t length,
           std::uint32_t index = 0) {
    m_runs.push_back({offset, static_cast<unsigned char const*>(bytes), length});
    m_sections.push_back({type, index, offset, length, 0});
  }

  unsigned char const* at(std::uint64_t offset) const {
    auto run = m_runs.begin();
    while (offset - run->offset >= run->length) ++run;
    return run->bytes + (offset - run->offset);
  }

  void makeDirectory() {
    auto const count = static_cast<std::int64_t>(m_sections.size());
    parallelFor(0, count, [&](std::int64_t begin, std::int64_t end) {
      for (std::int64_t n = begin; n < end; ++n) {
        NvttSection& s = m_sections[n];
        s.hash = hash64(at(s.offset), s.length);
        unsigned char* const entry = m_directory.data() + static_cast<std::size_t>(n) * kNvttEntryBytes;
        store(entry + kNvttEntryTypeOffset, static_cast<std::uint32_t>(s.type));
        store(entry + kNvttEntryIndexOffset, s.index);
        store(entry + kNvttEntryStartOffset, s.offset);
        store(entry + kNvttEntryLengthOffset, s.length);
        store(entry + kNvttEntryHashOffset, s.hash);
      }
    });
  }

  /// The hash of a page that lies in one run; a page over a gap is put together first.
  std::uint64_t pageHash(std::uint64_t start, std::uint64_t length) const {
    for (Run const& run : m_runs)
      if (start >= run.offset && start + length <= run.offset + run.length)
        return hash64(run.bytes + (start - run.offset), length);
    std::vector<unsigned char> page(length);
    for (Run const& run : m_runs) {
      std::uint64_t const low = std::max(start, run.offset),
                          high = std::min(start + length, run.offset + run.length);
      if (low < high) std::copy_n(run.bytes + (low - run.offset), high - low, page.data() + (low - start));
    }
    return hash64(page.data(), length);
  }

  void makePages() {
    parallelFor(0, static_cast<std::int64_t>(m_pages.size() / 8), [&](std::int64_t begin, std::int64_t end) {
      for (std::int64_t n = begin; n < end; ++n) {
        std::uint64_t const start = m_data + static_cast<std::uint64_t>(n) * kNvttPageBytes;
        store(m_pages.data() + 8 * static_cast<std::size_t>(n),
              pageHash(start, std::min(kNvttPageBytes, m_length - start)));
      }
    });
  }

  void makeHeader() {
    unsigned char* const h = m_header.data();
    store(h + kNvttMagicOffset, kNvttMagic);
    store(h + kNvttVersionOffset, kNvttVersion);
    store(h + kNvttReaderVersionOffset, std::uint32_t(1));
    store(h + kNvttByteOrderOffset, kNvttByteOrder);
    store(h + kNvttHeaderSizeOffset, static_cast<std::uint32_t>(kNvttHeaderBytes));
    store(h + kNvttFileLengthOffset, m_length);
    store(h + kNvttDirectoryOffset, kNvttHeaderBytes);
    store(h + kNvttEntryCountOffset, static_cast<std::uint32_t>(m_sections.size()));
    store(h + kNvttEntrySizeOffset, static_cast<std::uint32_t>(kNvttEntryBytes));
    store(h + kNvttPageTableOffset, std::uint64_t(kNvttHeaderBytes + m_directory.size()));
    store(h + kNvttPageCountOffset, std::uint64_t(m_pages.size() / 8));
    store(h + kNvttPageSizeOffset, kNvttPageBytes);
    store(h + kNvttDataOffset, m_data);
    store(h + kNvttBufferOffset, m_data);
    store(h + kNvttBufferLengthOffset, m_content.bufferLength);
    store(h + kNvttDirectoryHashOffset, hash64(m_directory.data(), m_directory.size()));
    store(h + kNvttPageTableHashOffset, hash64(m_pages.data(), m_pages.size()));
    store(h + kNvttHeaderHashOffset, hash64(h, kNvttHeaderHashOffset));
  }

  NvttContent const& m_content;
  std::vector<unsigned char> m_header, m_directory, m_pages;
  std::vector<Run> m_runs;
  std::vector<NvttSection> m_sections;
  std::uint64_t m_data = 0, m_length = 0;
};

} // namespace

void writeNvtt(std::string const& path, NvttContent const& content) {
  auto const answer = validate(content.buffer, content.bufferLength);
  if (!answer.ok())
    throw FileError(path, "what is to be written is not a flat buffer: " + std::string(answer.message) +
                              " at byte " + std::to_string(answer.position));
  BufferReader const reader(content.buffer);
  for (auto const& bounds : content.bounds) {
    auto const fault = BoundsReader::check(bounds.bytes, bounds.length, reader.container());
    if (!fault.ok() || bounds.grid >= reader.gridCount())
      throw FileError(path, "what is to be written has bounds of other tiles: " +
                                std::string(fault.ok() ? "no such grid" : fault.message));
  }
  OutputFile file(path);
  Writer(content).write(file);
  file.commit();
}

} // namespace VLN::Interop
