// A flat buffer, or a .nvtt file, as a fuzzer's input.
//
// A buffer is 1 MiB of root table and some hundred bytes that matter. Here it is packed: the root table as
// its used slots, all else as it is, without the zeros at the end. mutate() knows the format, and makes the
// hashes of the envelope right again afterwards: otherwise they would hide everything behind them.
//
//   packed: u32 length, u16 roots, u16 envelope │ roots (slot u32, number u32) │ envelope │ 136 bytes │ what
//   is behind the root table
#pragma once

#include "Reader/NanoVTTReader.h"
#include "Reader/NanoVTTValidate.h"
#include "Reader/NvttFile.h"
#include "support/ReadAll.h"

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <random>
#include <utility>
#include <vector>

#if defined(__SANITIZE_ADDRESS__)
#define FLAT_CASE_ASAN 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
#define FLAT_CASE_ASAN 1
#endif
#endif
#if FLAT_CASE_ASAN
#include <sanitizer/asan_interface.h>
#endif

namespace Support {

class FlatCase {
public:
  static constexpr std::size_t kMost = 3 << 20;     ///< bytes of an unpacked case
  static constexpr std::size_t kTailMost = 1 << 17; ///< bytes behind the root table
  static constexpr std::uint64_t kBefore = nanovtt::kRootTableOffset, kBehind = nanovtt::kLlcOffset;

  using Bytes = std::vector<std::uint8_t>;

  std::uint32_t length = 0; ///< of the whole, unpacked
  std::vector<std::pair<std::uint32_t, std::uint32_t>> roots;
  Bytes envelope, head, tail;

  /// A buffer as it stands in memory, behind an envelope if wanted.
  static FlatCase of(std::uint8_t const* bytes, std::uint64_t count, bool file) {
    FlatCase c;
    if (file) c.envelope = makeEnvelope(bytes, count);
    c.length = static_cast<std::uint32_t>(c.envelope.size() + count);
    c.head.assign(bytes, bytes + kBefore);
    for (std::uint32_t slot = 0; slot < nanovtt::kMaxRoots; ++slot) {
      auto const number = nanovtt::load<std::uint32_t>(bytes + kBefore + 4 * std::uint64_t(slot));
      if (number != nanovtt::kNoTile) c.roots.emplace_back(slot, number);
    }
    c.tail.assign(bytes + kBehind, bytes + count);
    while (!c.tail.empty() && !c.tail.back()) c.tail.pop_back();
    return c;
  }

  Bytes pack() const {
    Bytes packed;
    auto const add = [&](auto value) {
      packed.resize(packed.size() + sizeof value);
      nanovtt::store(packed.data() + packed.size() - sizeof value, value);
    };
    add(length);
    add(static_cast<std::uint16_t>(roots.size()));
    add(static_cast<std::uint16_t>(envelope.size()));
    for (auto const& [slot, number] : roots) add(slot), add(number);
    for (Bytes const* part : {&envelope, &head, &tail})
      packed.insert(packed.end(), part->begin(), part->end());
    return packed;
  }
  /// Any bytes are a case.
  static FlatCase unpack(std::uint8_t const* bytes, std::size_t count) {
    FlatCase c;
    auto const take = [&](std::size_t wanted) {
      std::size_t const n = std::min(wanted, count);
      Bytes part(bytes, bytes + n);
      bytes += n, count -= n;
      part.resize(wanted);
      return part;
    };
    Bytes const front = take(8);
    c.length = std::min<std::uint32_t>(nanovtt::load<std::uint32_t>(front.data()), kMost);
    Bytes const slots = take(std::min<std::size_t>(nanovtt::load<std::uint16_t>(front.data() + 4), 4096) * 8);
    for (std::size_t n = 0; n < slots.size(); n += 8)
      c.roots.emplace_back(nanovtt::load<std::uint32_t>(slots.data() + n) % nanovtt::kMaxRoots,
                           nanovtt::load<std::uint32_t>(slots.data() + n + 4));
    c.envelope = take(std::min<std::size_t>(nanovtt::load<std::uint16_t>(front.data() + 6), 8192));
    c.head = take(kBefore);
    c.tail = take(std::min(count, kTailMost));
    return c;
  }

  /// Unpacks, judges, and where the answer is yes makes every lookup. Bytes behind the end are poisoned.
  /// @return Whether it was accepted.
  bool run() const {
    static Bytes memory;
    if (memory.empty()) memory.assign(kMost, 0);
    std::size_t const start = envelope.size();
    auto const place = [&](std::size_t at, std::uint8_t const* bytes, std::size_t count) {
      if (count && at < length)
        std::memcpy(memory.data() + at, bytes, std::min<std::size_t>(count, length - at));
    };
    std::memset(memory.data(), 0, length);
    place(0, envelope.data(), start);
    place(start, head.data(), head.size());
    if (start + kBefore < length)
      std::memset(memory.data() + start + kBefore, 0xFF,
                  std::min<std::size_t>(kBehind - kBefore, length - start - kBefore));
    for (auto const& [slot, number] : roots)
      place(start + kBefore + 4 * std::size_t(slot), reinterpret_cast<std::uint8_t const*>(&number), 4);
    place(start + kBehind, tail.data(), tail.size());
#if FLAT_CASE_ASAN
    ASAN_POISON_MEMORY_REGION(memory.data() + length, kMost - length);
#endif
    bool const accepted = start ? runFile(memory.data()) : runBuffer(memory.data(), length);
#if FLAT_CASE_ASAN
    ASAN_UNPOISON_MEMORY_REGION(memory.data() + length, kMost - length);
#endif
    return accepted;
  }

  template <class Random> void mutate(Random& random) {
    for (auto n = 1 + random() % 3; n; --n) mutateOnce(random);
    if (random() % 8) repair();
  }

  /// The lengths and hashes of the envelope, as far as it still is one.
  void repair() {
    if (envelope.size() < nanovtt::kNvttHeaderBytes) return;
    std::uint8_t* const h = envelope.data();
    nanovtt::store(h + nanovtt::kNvttFileLengthOffset, std::uint64_t(length));
    auto const hashOf = [&](std::uint64_t start, std::uint64_t bytes, std::uint64_t at) {
      if (start <= envelope.size() && bytes <= envelope.size() - start)
        nanovtt::store(h + at, nanovtt::hash64(h + start, bytes));
    };
    auto const get32 = [&](std::uint64_t at) { return std::uint64_t(nanovtt::load<std::uint32_t>(h + at)); };
    auto const get64 = [&](std::uint64_t at) { return nanovtt::load<std::uint64_t>(h + at); };
    hashOf(get64(nanovtt::kNvttDirectoryOffset),
           get32(nanovtt::kNvttEntryCountOffset) * get32(nanovtt::kNvttEntrySizeOffset),
           nanovtt::kNvttDirectoryHashOffset);
    hashOf(get64(nanovtt::kNvttPageTableOffset),
           std::min(get64(nanovtt::kNvttPageCountOffset), std::uint64_t(1) << 20) * 8,
           nanovtt::kNvttPageTableHashOffset);
    hashOf(0, nanovtt::kNvttHeaderHashOffset, nanovtt::kNvttHeaderHashOffset);
  }

private:
  static bool runBuffer(std::uint8_t const* bytes, std::uint64_t count) {
    if (!nanovtt::validate(bytes, count).ok()) return false;
    readAll(bytes);
    return true;
  }
  bool runFile(std::uint8_t const* bytes) const {
    nanovtt::NvttFile file;
    if (!nanovtt::NvttFile::open(bytes, length, file).ok()) return false;
    for (std::uint32_t n = 0; n < file.sectionCount() && n < 64; ++n) {
      auto const s = file.section(n);
      if (s.type >= nanovtt::NvttSectionType::kContainer && s.type <= nanovtt::NvttSectionType::kBounds)
        file.isIntact(s);
    }
    for (std::uint64_t page = 0; page < file.pageCount() && page < 4; ++page)
      file.isPageIntact(file.pageCount() - 1 - page);
    return runBuffer(file.buffer(), file.bufferLength());
  }

  /// A value that goes with the one that was there: off by one, of another place, or at an end of its range.
  template <class T, class Random> T other(T old, Random& random) {
    switch (random() % 8) {
    case 0:
      return static_cast<T>(old + 1);
    case 1:
      return static_cast<T>(old - 1);
    case 2:
      return static_cast<T>(old ^ T(T(1) << random() % (8 * sizeof(T))));
    case 3:
      return static_cast<T>(~T(0));
    case 4:
      return static_cast<T>(old + T(8u << random() % 8));
    case 5:
      return static_cast<T>(random() % 64);
    case 6:
      return static_cast<T>(T(random()) << (random() % (8 * sizeof(T))));
    default:
      return 0;
    }
  }
  template <class T, class Random> void change(Bytes& part, std::size_t at, Random& random) {
    if (part.size() < sizeof(T) || at > part.size() - sizeof(T)) return;
    std::uint8_t* const p = part.data() + at;
    nanovtt::store(p, other(nanovtt::load<T>(p), random));
  }

  template <class Random> void mutateOnce(Random& random) {
    std::size_t const fields = kBehind; // tail[0] is this byte of the buffer
    auto const anywhere = [&](Bytes const& part, std::size_t step) {
      return part.size() < step ? 0 : random() % (part.size() / step) * step;
    };
    switch (random() % 14) {
    case 0: // sizes and counts
      if (random() % 2)
        change<std::uint64_t>(head, random() % 2 * 8, random);
      else
        change<std::uint32_t>(head, 16 + random() % 30 * 4, random);
      break;
    case 1:
      change<std::uint32_t>(tail, nanovtt::kLlcOffset - fields + random() % 4 * 4, random);
      break;
    case 2: // child offsets, parents, child tables: the first bytes behind the fixed part
    case 3:
      change<std::uint32_t>(tail, 24 + random() % 256 * 4, random);
      break;
    case 4:
      change<std::uint64_t>(tail, 24 + random() % 64 * 8, random);
      break;
    case 5:
      change<std::uint64_t>(tail, anywhere(tail, 8), random);
      break;
    case 6:
      change<std::uint32_t>(tail, anywhere(tail, 4), random);
      break;
    case 7: { // two places change their values
      std::size_t const a = anywhere(tail, 4), b = anywhere(tail, 4);
      if (tail.size() >= 8)
        std::swap_ranges(
            tail.begin() + static_cast<std::ptrdiff_t>(a), tail.begin() + static_cast<std::ptrdiff_t>(a + 4),
            tail.begin() + static_cast<std::ptrdiff_t>(a == b ? (b + 4) % (tail.size() / 4 * 4) : b));
      break;
    }
    case 8: // a field of a grid
      if (auto const grid = findGrid(random)) {
        std::size_t const at[] = {0,   16,  20,  24,  28,  32,  36,  632, 636, 640, 648,
                                  696, 700, 704, 672, 684, 560, 608, 295, 736, 744};
        change<std::uint32_t>(tail, grid - 1 + at[random() % (sizeof at / sizeof *at)], random);
      }
      break;
    case 9: // an entry of a tile table
      if (auto const grid = findGrid(random))
        change<std::uint64_t>(tail, grid - 1 + 736 + random() % 64 * 8, random);
      break;
    case 10: // roots
      if (roots.empty() || random() % 4 == 0) {
        if (roots.size() < 4000)
          roots.emplace_back(static_cast<std::uint32_t>(random() % nanovtt::kMaxRoots),
                             static_cast<std::uint32_t>(random() % 64));
      } else {
        auto& root = roots[random() % roots.size()];
        if (random() % 2)
          root.second = other(root.second, random);
        else
          root.first = other(root.first, random) % nanovtt::kMaxRoots;
      }
      break;
    case 11: // lengths
      length = static_cast<std::uint32_t>(std::min<std::size_t>(other(length, random), kMost));
      if (random() % 2 && !tail.empty())
        tail.resize(std::min(kTailMost, static_cast<std::size_t>(random() % (2 * tail.size()))));
      break;
    case 12: // the envelope's header
      if (!envelope.empty()) change<std::uint32_t>(envelope, random() % 32 * 4, random);
      break;
    default: // its directory and page table
      if (!envelope.empty()) change<std::uint64_t>(envelope, 128 + random() % 64 * 8, random);
    }
  }

  /// Where in the tail a grid begins, plus 1; 0 when none is left.
  template <class Random> std::size_t findGrid(Random& random) const {
    std::vector<std::size_t> found;
    for (std::size_t at = 0; at + 8 <= tail.size(); at += 4)
      if (nanovtt::load<std::uint64_t>(tail.data() + at) == nanovtt::kGridMagic) found.push_back(at + 1);
    return found.empty() ? 0 : found[random() % found.size()];
  }

  /// The envelope of a buffer alone, written from the description of the format.
  static Bytes makeEnvelope(std::uint8_t const* buffer, std::uint64_t count) {
    nanovtt::BufferReader const reader(buffer);
    std::uint32_t const sections = 1 + reader.gridCount();
    std::uint64_t const pages = (count + (1 << 20) - 1) >> 20;
    Bytes e(4096);
    auto const put64 = [&](std::size_t at, std::uint64_t v) { nanovtt::store(e.data() + at, v); };
    auto const put32 = [&](std::size_t at, std::uint32_t v) { nanovtt::store(e.data() + at, v); };
    std::memcpy(e.data(), "\x89NVTT\r\n\x1A", 8);
    put32(8, 1), put32(12, 1), put32(16, 0x01020304), put32(20, 128);
    put64(24, 4096 + count), put64(32, 128), put32(40, sections), put32(44, 32);
    put64(48, 128 + 32 * sections), put64(56, pages), put64(64, 1 << 20), put64(72, 4096);
    put64(80, 4096), put64(88, count);
    for (std::uint32_t n = 0; n < sections; ++n) {
      std::uint64_t const start = n ? reader.gridOffset(n - 1) : 0;
      std::uint64_t const size = n ? reader.grid(n - 1).gridSize() : reader.container().containerSize();
      std::size_t const at = 128 + 32 * n;
      put32(at, n ? 2 : 1), put32(at + 4, n ? n - 1 : 0), put64(at + 8, 4096 + start), put64(at + 16, size);
      put64(at + 24, nanovtt::hash64(buffer + start, size));
    }
    for (std::uint64_t page = 0; page < pages; ++page)
      put64(128 + 32 * sections + 8 * page,
            nanovtt::hash64(buffer + (page << 20), std::min<std::uint64_t>(1 << 20, count - (page << 20))));
    FlatCase c;
    c.envelope = e, c.length = static_cast<std::uint32_t>(4096 + count);
    c.repair();
    return c.envelope;
  }
};

} // namespace Support
