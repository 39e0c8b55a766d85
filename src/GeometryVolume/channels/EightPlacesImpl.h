// Where positions lie in their blocks, eight at a time: once for every processor, and once for those with
// AVX2.
#pragma once

#include "GeometryVolume/core/detail/SimdLanes.h"

#include <bit>
#include <cstddef>
#include <cstdint>
#include <cstring>

#if defined(__x86_64__) && defined(__GNUC__)
#include <immintrin.h>
#define VLN_HAS_WIDE_LANES 1
#else
#define VLN_HAS_WIDE_LANES 0
#endif

namespace VLN::TileTree3D::Internal {

/// A position in its block: which tile, and which of its elements.
struct BulkPlace {
  std::uint8_t element, slot;
};
static_assert(sizeof(BulkPlace) == 2 && std::endian::native == std::endian::little);

/// What is found of positions, and where it goes.
struct PlacesFound {
  BulkPlace* places;
  std::uint8_t* slots; ///< of each position, 1 << slot
  std::uint8_t* first; ///< of each eight a bit for each that lies in another block than the one before
};

/// @param before The position before the first one.
/// @param eights How many times eight positions there are.
using FindPlaces = void (*)(Velorn::Math::int3 const* positions, std::size_t eights,
                            Velorn::Math::int3 const& before, PlacesFound const& out);

/// In lanes that every processor has.
class NarrowPlaces {
public:
  static void find(Velorn::Math::int3 const* positions, std::size_t eights, Velorn::Math::int3 const& before,
                   PlacesFound const& out) {
    auto const all = [](int c) {
      auto const u = static_cast<std::uint32_t>(c);
      return UnsignedLanes{u, u, u, u};
    };
    Four last{all(before.x), all(before.y), all(before.z)};
    for (std::size_t n = 0; n < eights; ++n) {
      auto const [even, odd] = load(positions + 8 * n);
      Shorts const changed = mix(differ(shifted(last, odd), even), differ(even, odd));
      last = odd;
      // The low bits of eight bytes, side by side.
      out.first[n] = static_cast<std::uint8_t>((bytesOf(changed & 1) * 0x0102040810204080u) >> 56);

      Shorts const x = mix(even.x, odd.x), y = mix(even.y, odd.y), z = mix(even.z, odd.z);
      Shorts const sx = x & 4, sy = y & 4, sz = z & 4;
      Shorts const place = (x & 3) | (y & 3) << 2 | (z & 3) << 4 | sx << 6 | sy << 7 | sz << 8;
      std::memcpy(out.places + 8 * n, &place, sizeof(place));
      // Bit n of eight that stand for slots, where bits 0, 1 and 2 of n are those of the axes.
      auto const among = [](Shorts s, std::uint16_t unset) {
        return reinterpret_cast<Shorts>(s == 4) ^ unset;
      };
      std::uint64_t const slots = bytesOf(among(sx, 0x55) & among(sy, 0x33) & among(sz, 0x0f) & 0xff);
      std::memcpy(out.slots + 8 * n, &slots, sizeof(slots));
    }
  }

private:
  using Shorts = std::uint16_t __attribute__((vector_size(16)));
  using Bytes = std::uint8_t __attribute__((vector_size(8)));
  struct Four {
    UnsignedLanes x, y, z;
  };
  struct Eight {
    Four even, odd; ///< 0 2 4 6, 1 3 5 7
  };

  static Eight load(Velorn::Math::int3 const* p) {
    auto const at = [p](int pair, int word) {
      UnsignedLanes out;
      std::memcpy(&out, reinterpret_cast<char const*>(p + 2 * pair) + 4 * word, sizeof(out));
      return out;
    };
    auto const low = [](auto a, auto b) { return __builtin_shufflevector(a, b, 0, 4, 1, 5); };
    auto const high = [](auto a, auto b) { return __builtin_shufflevector(a, b, 2, 6, 3, 7); };
    auto const first = [](auto a, auto b) { return __builtin_shufflevector(a, b, 0, 1, 4, 5); };
    auto const second = [](auto a, auto b) { return __builtin_shufflevector(a, b, 2, 3, 6, 7); };
    // Pairs from their first word on are x y z x, from their third word on z x y z.
    UnsignedLanes const xy[2] = {low(at(0, 0), at(1, 0)), low(at(2, 0), at(3, 0))};
    UnsignedLanes const zx[2] = {high(at(0, 0), at(1, 0)), high(at(2, 0), at(3, 0))};
    UnsignedLanes const yz[2] = {high(at(0, 2), at(1, 2)), high(at(2, 2), at(3, 2))};
    return {{first(xy[0], xy[1]), second(xy[0], xy[1]), first(zx[0], zx[1])},
            {second(zx[0], zx[1]), first(yz[0], yz[1]), second(yz[0], yz[1])}};
  }
  /// Of lanes for every other position those for all: the even ones lie low.
  static Shorts mix(UnsignedLanes even, UnsignedLanes odd) {
    return reinterpret_cast<Shorts>((even & 0xffffu) | odd << 16);
  }
  static std::uint64_t bytesOf(Shorts v) {
    return std::bit_cast<std::uint64_t>(__builtin_convertvector(v, Bytes));
  }
  /// True lanes where two positions lie in different blocks.
  static UnsignedLanes differ(Four const& a, Four const& b) {
    UnsignedLanes const off = (a.x ^ b.x) | (a.y ^ b.y) | (a.z ^ b.z);
    return reinterpret_cast<UnsignedLanes>((off & ~7u) != 0);
  }
  /// The odd positions before the even ones; `last` are those of the eight before.
  static Four shifted(Four const& last, Four const& odd) {
    auto const shift = [](UnsignedLanes l, UnsignedLanes v) {
      auto const ends = __builtin_shufflevector(l, v, 3, 3, 4, 4);
      return __builtin_shufflevector(ends, v, 0, 2, 5, 6);
    };
    return {shift(last.x, odd.x), shift(last.y, odd.y), shift(last.z, odd.z)};
  }
};

#if VLN_HAS_WIDE_LANES
/// In AVX2's lanes, with half the steps.
/// @pre isThere().
class WidePlaces {
public:
  static bool isThere() {
    static bool const there = __builtin_cpu_supports("avx2");
    return there;
  }
  [[gnu::target("avx2")]] static void find(Velorn::Math::int3 const* positions, std::size_t eights,
                                           Velorn::Math::int3 const& before, PlacesFound const& out) {
    Lanes lastX = _mm256_set1_epi32(before.x), lastY = _mm256_set1_epi32(before.y),
          lastZ = _mm256_set1_epi32(before.z);
    for (std::size_t n = 0; n < eights; ++n) {
      auto const* const p = reinterpret_cast<float const*>(positions + 8 * n);
      // In each half four positions: x y z x, y z x y, z x y z.
      __m256 const a = halves(p, p + 12), b = halves(p + 4, p + 16), c = halves(p + 8, p + 20);
      __m256 const xy = _mm256_shuffle_ps(b, c, _MM_SHUFFLE(2, 1, 3, 2)),
                   yz = _mm256_shuffle_ps(a, b, _MM_SHUFFLE(1, 0, 2, 1));
      Lanes const x = _mm256_castps_si256(_mm256_shuffle_ps(a, xy, _MM_SHUFFLE(2, 0, 3, 0))),
                  y = _mm256_castps_si256(_mm256_shuffle_ps(yz, xy, _MM_SHUFFLE(3, 1, 2, 0))),
                  z = _mm256_castps_si256(_mm256_shuffle_ps(yz, c, _MM_SHUFFLE(3, 0, 3, 1)));

      Lanes const off = _mm256_or_si256(_mm256_or_si256(step(x, lastX), step(y, lastY)), step(z, lastZ));
      Lanes const same = _mm256_cmpeq_epi32(_mm256_srli_epi32(off, 3), _mm256_setzero_si256());
      out.first[n] = static_cast<std::uint8_t>(~_mm256_movemask_ps(_mm256_castsi256_ps(same)));

      Lanes const three = _mm256_set1_epi32(3), four = _mm256_set1_epi32(4);
      Lanes const element = join(_mm256_and_si256(x, three), _mm256_slli_epi32(_mm256_and_si256(y, three), 2),
                                 _mm256_slli_epi32(_mm256_and_si256(z, three), 4));
      Lanes const slot4 = join(_mm256_and_si256(x, four), _mm256_slli_epi32(_mm256_and_si256(y, four), 1),
                               _mm256_slli_epi32(_mm256_and_si256(z, four), 2));
      Lanes const bit = _mm256_sllv_epi32(_mm256_set1_epi32(1 << 16), _mm256_srli_epi32(slot4, 2));
      // A place in the low half of each lane, the slot's bit in the third byte. In each half places come
      // together, and bits.
      Lanes const all = join(element, _mm256_slli_epi32(slot4, 6), bit);
      Lanes const packed = _mm256_shuffle_epi8(
          all,
          _mm256_broadcastsi128_si256(_mm_setr_epi8(0, 1, 4, 5, 8, 9, 12, 13, 2, 6, 10, 14, -1, -1, -1, -1)));
      Lanes const sorted = _mm256_permutevar8x32_epi32(packed, _mm256_setr_epi32(0, 1, 4, 5, 2, 6, 3, 7));
      _mm_storeu_si128(reinterpret_cast<__m128i*>(out.places + 8 * n), _mm256_castsi256_si128(sorted));
      _mm_storel_epi64(reinterpret_cast<__m128i*>(out.slots + 8 * n), _mm256_extracti128_si256(sorted, 1));
    }
  }

private:
  using Lanes = __m256i;

  [[gnu::target("avx2")]] static __m256 halves(float const* low, float const* high) {
    return _mm256_insertf128_ps(_mm256_castps128_ps256(_mm_loadu_ps(low)), _mm_loadu_ps(high), 1);
  }
  [[gnu::target("avx2")]] static Lanes join(Lanes a, Lanes b, Lanes c) {
    return _mm256_or_si256(_mm256_or_si256(a, b), c);
  }
  /// In which bits coordinates differ from those before them.
  /// @param last Lane 0 holds what comes before these, and then what comes before the next ones.
  [[gnu::target("avx2")]] static Lanes step(Lanes v, Lanes& last) {
    Lanes const turned = _mm256_permutevar8x32_epi32(v, _mm256_setr_epi32(7, 0, 1, 2, 3, 4, 5, 6));
    Lanes const beforeThem = _mm256_blend_epi32(turned, last, 1);
    last = turned;
    return _mm256_xor_si256(v, beforeThem);
  }
};
#endif

/// The fastest way that this processor has.
inline FindPlaces findPlaces() {
#if VLN_HAS_WIDE_LANES
  if (WidePlaces::isThere()) return WidePlaces::find;
#endif
  return NarrowPlaces::find;
}

} // namespace VLN::TileTree3D::Internal
