#include "GeometryVolume/nanovtt/ChecksumImpl.h"

#include "GeometryVolume/core/Parallel.h"

#include <algorithm>
#include <array>
#include <bit>
#include <cstring>
#include <vector>

namespace nanovtt::Internal {

namespace {

constexpr std::uint32_t kPolynomial = 0xEDB88320u;
constexpr std::size_t kStep = 16;

// kTables[n][b]: what byte b contributes when n more bytes follow it in the same step.
constexpr auto kTables = [] {
  std::array<std::array<std::uint32_t, 256>, kStep> tables{};
  for (std::uint32_t b = 0; b < 256; ++b) {
    std::uint32_t crc = b;
    for (int bit = 0; bit < 8; ++bit) crc = (crc >> 1) ^ (crc & 1 ? kPolynomial : 0);
    tables[0][b] = crc;
  }
  for (std::size_t n = 1; n < kStep; ++n)
    for (std::size_t b = 0; b < 256; ++b)
      tables[n][b] = (tables[n - 1][b] >> 8) ^ tables[0][tables[n - 1][b] & 0xFF];
  return tables;
}();

std::uint32_t crcOf(std::uint8_t const* p, std::uint64_t size) {
  std::uint32_t crc = ~0u;
  for (; size >= kStep; size -= kStep, p += kStep) {
    std::array<std::uint32_t, 4> words;
    std::memcpy(words.data(), p, kStep);
    words[0] ^= crc;
    crc = 0;
    for (std::size_t n = 0; n < kStep; ++n) crc ^= kTables[kStep - 1 - n][words[n / 4] >> (n % 4 * 8) & 0xFF];
  }
  for (; size > 0; --size, ++p) crc = (crc >> 8) ^ kTables[0][(crc ^ *p) & 0xFF];
  return ~crc;
}

// A bit matrix over GF(2): row n is the image of bit n.
using Matrix = std::array<std::uint32_t, 32>;

std::uint32_t times(Matrix const& m, std::uint32_t v) {
  std::uint32_t sum = 0;
  for (; v; v &= v - 1) sum ^= m[std::countr_zero(v)];
  return sum;
}
Matrix square(Matrix const& m) {
  Matrix result;
  for (std::size_t n = 0; n < 32; ++n) result[n] = times(m, m[n]);
  return result;
}

} // namespace

std::uint32_t crc32Combine(std::uint32_t first, std::uint32_t second, std::uint64_t secondSize) {
  // The first sum moves on by secondSize zero bytes: powers of the step by one zero bit.
  Matrix step;
  step[0] = kPolynomial;
  for (std::size_t n = 1; n < 32; ++n) step[n] = 1u << (n - 1);
  for (int n = 0; n < 3; ++n) step = square(step);
  for (; secondSize > 0; secondSize >>= 1, step = square(step))
    if (secondSize & 1) first = times(step, first);
  return first ^ second;
}

std::uint32_t crc32(std::uint8_t const* bytes, std::uint64_t size) {
  constexpr std::int64_t kPiece = 1 << 20;
  auto const length = static_cast<std::int64_t>(size);
  std::vector<std::uint32_t> parts(VLN::chunkCount(0, length, kPiece));
  VLN::parallelChunks(0, length, kPiece, [&](std::int64_t chunk, std::int64_t begin, std::int64_t end) {
    parts[chunk] = crcOf(bytes + begin, static_cast<std::uint64_t>(end - begin));
  });
  std::uint32_t sum = crcOf(bytes, 0);
  for (std::size_t n = 0; n < parts.size(); ++n) {
    std::int64_t const begin = static_cast<std::int64_t>(n) * kPiece;
    sum = crc32Combine(sum, parts[n], static_cast<std::uint64_t>(std::min(kPiece, length - begin)));
  }
  return sum;
}

} // namespace nanovtt::Internal
