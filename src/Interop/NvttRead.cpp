#include "Interop/NvttRead.h"

#include "GeometryVolume/core/Parallel.h"
#include "Interop/FileError.h"
#include "Reader/NanoVTTBounds.h"
#include "Reader/NanoVTTValidate.h"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <limits>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

namespace VLN::Interop {

namespace {

/// An open file, and its first bytes.
class Descriptor {
public:
  explicit Descriptor(std::string const& path)
      : m_fd(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK)) {}
  Descriptor(Descriptor const&) = delete;
  Descriptor& operator=(Descriptor const&) = delete;
  ~Descriptor() {
    if (m_fd >= 0) close(m_fd);
  }
  int get() const { return m_fd; }
  /// How many of the wanted bytes there are.
  std::size_t head(unsigned char* bytes, std::size_t count) const {
    std::size_t have = 0;
    while (have < count) {
      ssize_t const n = pread(m_fd, bytes + have, count - have, static_cast<off_t>(have));
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) break;
      have += static_cast<std::size_t>(n);
    }
    return have;
  }

private:
  int m_fd;
};

std::string reason(nanovtt::Validation const& answer, std::uint64_t from = 0) {
  return std::string(answer.message) + " (at byte " + std::to_string(from + answer.position) + ")";
}

/// The first page that differs from its hash; the number of pages when none does.
std::uint64_t firstDamagedPage(nanovtt::NvttFile const& file) {
  std::atomic<std::uint64_t> first = file.pageCount();
  parallelFor(0, static_cast<std::int64_t>(file.pageCount()), [&](std::int64_t begin, std::int64_t end) {
    for (auto page = static_cast<std::uint64_t>(begin); page < static_cast<std::uint64_t>(end); ++page) {
      if (file.isPageIntact(page)) continue;
      std::uint64_t known = first.load();
      while (page < known && !first.compare_exchange_weak(known, page)) {}
      return;
    }
  });
  return first;
}

void checkBounds(std::string const& path, nanovtt::NvttFile const& file,
                 nanovtt::ContainerReader const& tree) {
  for (std::uint32_t n = 0; n < file.sectionCount(); ++n) {
    auto const s = file.section(n);
    if (s.type != nanovtt::NvttSectionType::kBounds) continue;
    if (!file.isIntact(s)) throw FileError(path, reason({"bounds differ from their hash", s.offset}));
    auto const answer = nanovtt::BoundsReader::check(file.data(s), s.length, tree);
    if (!answer.ok()) throw FileError(path, reason(answer, s.offset));
  }
}

} // namespace

MappedNvtt::MappedNvtt(std::string const& path, NvttCheck check) {
  Descriptor const fd(path);
  struct stat status {};
  if (fd.get() < 0 || fstat(fd.get(), &status) != 0) throw FileError(path, std::strerror(errno));
  if (!S_ISREG(status.st_mode)) throw FileError(path, "not a regular file");
  auto const length = static_cast<std::uint64_t>(status.st_size);

  unsigned char head[nanovtt::kNvttHeaderBytes];
  auto answer = nanovtt::NvttFile::openHeader(head, fd.head(head, sizeof head), length, m_file);
  if (!answer.ok()) throw FileError(path, reason(answer));
  if (length > std::numeric_limits<std::size_t>::max() / 2)
    throw FileError(path, "larger than memory allows");
  m_length = static_cast<std::size_t>(length);
  void* const bytes = mmap(nullptr, m_length, PROT_READ, MAP_PRIVATE, fd.get(), 0);
  if (bytes == MAP_FAILED) throw FileError(path, "larger than memory allows, or not to be mapped");
  m_bytes = bytes;
  try {
    answer = nanovtt::NvttFile::open(m_bytes, length, m_file);
    if (!answer.ok()) throw FileError(path, reason(answer));
    if (check == NvttCheck::kPages) {
      std::uint64_t const page = firstDamagedPage(m_file);
      if (page != m_file.pageCount())
        throw FileError(path, reason({"a page differs from its hash", m_file.pageStart(page)}));
    }
    answer = nanovtt::validate(m_file.buffer(), m_file.bufferLength());
    auto const start =
        static_cast<std::uint64_t>(m_file.buffer() - static_cast<unsigned char const*>(m_bytes));
    if (!answer.ok()) throw FileError(path, reason(answer, start));
    m_reader = nanovtt::BufferReader(m_file.buffer());
    checkBounds(path, m_file, m_reader.container());
  } catch (...) {
    munmap(m_bytes, m_length);
    throw;
  }
}

void const* MappedNvtt::bounds(std::uint32_t grid) const {
  std::uint32_t const n = m_file.find(nanovtt::NvttSectionType::kBounds, grid);
  return n < m_file.sectionCount() ? m_file.data(m_file.section(n)) : nullptr;
}

MappedNvtt::~MappedNvtt() { munmap(m_bytes, m_length); }

bool isNvttFile(std::string const& path) {
  Descriptor const fd(path);
  unsigned char head[8];
  return fd.get() >= 0 && fd.head(head, sizeof head) == sizeof head &&
         nanovtt::load<std::uint64_t>(head) == nanovtt::kNvttMagic;
}

} // namespace VLN::Interop
