// hash64(): the 64-bit hash of flat files. It finds damage, not malice: whoever may write a file can write
// its hashes.
//
//   bytes │ 8 │ 8 │ 8 │ 8 │ 8 │ ...     four lanes, each lane = rotl(lane + word * P2, 31) * P1,
//           l0  l1  l2  l3  l0          then joined, the rest of the bytes added, and mixed
//
// @source XXH64 with seed 0, from the published description of the algorithm ("xxHash fast digest
// algorithm").
// @cost About a byte for each third of a nanosecond or better; reads the bytes once.
#pragma once

#include "Reader/NanoVTTFormat.h"

namespace nanovtt {

namespace Internal {

inline constexpr std::uint64_t kHashPrime1 = 0x9E3779B185EBCA87ull;
inline constexpr std::uint64_t kHashPrime2 = 0xC2B2AE3D27D4EB4Full;
inline constexpr std::uint64_t kHashPrime3 = 0x165667B19E3779F9ull;
inline constexpr std::uint64_t kHashPrime4 = 0x85EBCA77C2B2AE63ull;
inline constexpr std::uint64_t kHashPrime5 = 0x27D4EB2F165667C5ull;

NANOVTT_HD constexpr std::uint64_t rotateLeft(std::uint64_t v, int bits) {
  return v << bits | v >> (64 - bits);
}
NANOVTT_HD constexpr std::uint64_t hashRound(std::uint64_t lane, std::uint64_t word) {
  return rotateLeft(lane + word * kHashPrime2, 31) * kHashPrime1;
}
NANOVTT_HD constexpr std::uint64_t hashJoin(std::uint64_t hash, std::uint64_t lane) {
  return (hash ^ hashRound(0, lane)) * kHashPrime1 + kHashPrime4;
}

} // namespace Internal

NANOVTT_HD inline std::uint64_t hash64(void const* bytes, std::uint64_t count) {
  using namespace Internal;
  auto const* p = static_cast<unsigned char const*>(bytes);
  std::uint64_t left = count, hash = kHashPrime5;
  if (left >= 32) {
    std::uint64_t a = kHashPrime1 + kHashPrime2, b = kHashPrime2, c = 0, d = 0 - kHashPrime1;
    for (; left >= 32; left -= 32, p += 32) {
      a = hashRound(a, load<std::uint64_t>(p));
      b = hashRound(b, load<std::uint64_t>(p + 8));
      c = hashRound(c, load<std::uint64_t>(p + 16));
      d = hashRound(d, load<std::uint64_t>(p + 24));
    }
    hash = rotateLeft(a, 1) + rotateLeft(b, 7) + rotateLeft(c, 12) + rotateLeft(d, 18);
    hash = hashJoin(hashJoin(hashJoin(hashJoin(hash, a), b), c), d);
  }
  hash += count;
  for (; left >= 8; left -= 8, p += 8)
    hash = rotateLeft(hash ^ hashRound(0, load<std::uint64_t>(p)), 27) * kHashPrime1 + kHashPrime4;
  if (left >= 4) {
    hash = rotateLeft(hash ^ load<std::uint32_t>(p) * kHashPrime1, 23) * kHashPrime2 + kHashPrime3;
    left -= 4, p += 4;
  }
  for (; left; --left, ++p) hash = rotateLeft(hash ^ *p * kHashPrime5, 11) * kHashPrime1;
  hash = (hash ^ hash >> 33) * kHashPrime2;
  hash = (hash ^ hash >> 29) * kHashPrime3;
  return hash ^ hash >> 32;
}

} // namespace nanovtt
