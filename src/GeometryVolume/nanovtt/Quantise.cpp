#include "GeometryVolume/nanovtt/QuantiseImpl.h"

#include "Reader/NanoVTTFormat.h"

#include <algorithm>
#include <cmath>
#include <cstring>
#include <nanovdb/util/DitherLUT.h>
#include <nanovdb/util/GridBuilder.h>

namespace nanovtt::Internal {

namespace {

// The loops over samples, once for processors with AVX2 and once for all: the arithmetic is the same.
#if defined(__x86_64__) && defined(__GNUC__) && !defined(__clang__) && !defined(__SANITIZE_ADDRESS__) &&     \
    !defined(__SANITIZE_THREAD__)
#define NANOVTT_FOR_WIDE_LANES __attribute__((target_clones("avx2", "default")))
#else
#define NANOVTT_FOR_WIDE_LANES
#endif

/// Samples are handled in groups of as many as a tile without halo has.
constexpr std::size_t kGroup = 64;
static_assert(kMaxCodes % kGroup == 0);

struct Range {
  float low, high;
  bool numbers; ///< no sample is NaN; those take no part in the rest
};

using Lanes = float __attribute__((vector_size(32)));
using LaneMask = std::int32_t __attribute__((vector_size(32)));

/// Lets the first lanes meet those that lie Step behind them.
template <int Step> [[gnu::always_inline]] inline void fold(Lanes& low, Lanes& high, LaneMask& numbers) {
  // Known to both compilers, unlike __builtin_shuffle.
  Lanes const l = __builtin_shufflevector(low, low, Step, Step + 1, Step + 2, Step + 3, 0, 0, 0, 0);
  Lanes const h = __builtin_shufflevector(high, high, Step, Step + 1, Step + 2, Step + 3, 0, 0, 0, 0);
  low = l < low ? l : low;
  high = h > high ? h : high;
  numbers &= __builtin_shufflevector(numbers, numbers, Step, Step + 1, Step + 2, Step + 3, 0, 0, 0, 0);
}

NANOVTT_FOR_WIDE_LANES Range rangeOf(float const* values, std::size_t count) {
  constexpr float kLargest = 3.4028235e38f;
  Lanes low = Lanes{} + kLargest, high = -low;
  LaneMask numbers = low == low;
  for (std::size_t n = 0; n < count; n += 8) {
    Lanes v;
    std::memcpy(&v, values + n, sizeof v);
    low = v < low ? v : low;
    high = v > high ? v : high;
    numbers &= v == v;
  }
  // Halves on halves: lane 0 has met all the others in the end.
  fold<4>(low, high, numbers);
  fold<2>(low, high, numbers);
  fold<1>(low, high, numbers);
  return {low[0], high[0], numbers[0] != 0};
}

/// What turns samples into codes.
struct Scale {
  double low, factor, largest;
};

/// Codes of a group of samples that are all numbers.
NANOVTT_FOR_WIDE_LANES void codesOfGroup(float const* values, float const* dither, Scale const& scale,
                                         std::int32_t* out) {
  using Floats = float __attribute__((vector_size(16)));
  using Doubles = double __attribute__((vector_size(32)));
  using Codes = std::int32_t __attribute__((vector_size(16)));
  Doubles const largest = Doubles{} + scale.largest;
  for (std::size_t n = 0; n < kGroup; n += 4) {
    Floats v, added;
    std::memcpy(&v, values + n, sizeof v);
    std::memcpy(&added, dither + n, sizeof added);
    Doubles code = (__builtin_convertvector(v, Doubles) - scale.low) * scale.factor +
                   __builtin_convertvector(added, Doubles);
    code = code < largest ? code : largest;
    Codes const whole = __builtin_convertvector(code, Codes);
    std::memcpy(out + n, &whole, sizeof whole);
  }
}

/// The samples of a tile with their range. What pads them to whole groups takes no part in it.
class Samples {
public:
  Samples(float const* samples, int count)
      : m_values(samples)
      , m_padded((static_cast<std::size_t>(count) + kGroup - 1) / kGroup * kGroup) {
    auto const used = static_cast<std::size_t>(count);
    if (m_padded != used) {
      std::memcpy(m_copy.data(), samples, used * sizeof(float));
      std::fill(m_copy.begin() + count, m_copy.begin() + static_cast<std::ptrdiff_t>(m_padded), samples[0]);
      m_values = m_copy.data();
    }
    Range const range = rangeOf(m_values, m_padded);
    m_low = range.low;
    m_numbers = range.numbers;
    m_range = double(range.high) - double(range.low);
    m_regular = m_range > 0 && std::isfinite(m_range);
  }
  Samples(Samples const&) = delete;
  Samples& operator=(Samples const&) = delete;

  float low() const { return m_low; }
  /// Whether the range is finite and above 0.
  bool regular() const { return m_regular; }
  /// Whether all samples are the same number: then all codes are 0, for what is added to them is below 1.
  bool constant() const { return m_range == 0; }
  std::size_t padded() const { return m_padded; }
  float value(std::size_t n) const { return m_values[n]; }
  float quantum(std::uint32_t largest) const {
    double const quantum = m_range / largest;
    return std::isfinite(quantum) ? static_cast<float>(quantum) : 0.0f;
  }

  /// @tparam Code uint8 or uint16, which holds `largest`.
  template <class Code> void codes(std::uint32_t largest, Dither const& dither, Code* out) const {
    double const low = m_low;
    double const scale = m_regular ? largest / m_range : 1.0;
    if (constant()) {
      std::fill_n(out, m_padded, Code(0));
    } else if (m_regular && m_numbers) {
      std::int32_t wide[kGroup];
      for (std::size_t n = 0; n < m_padded; n += kGroup) {
        codesOfGroup(m_values + n, dither.data() + n, {low, scale, double(largest)}, wide);
        for (std::size_t c = 0; c < kGroup; ++c) out[n + c] = static_cast<Code>(wide[c]);
      }
    } else {
      for (std::size_t n = 0; n < m_padded; ++n) {
        double const code = (double(m_values[n]) - low) * scale + double(dither[n]);
        out[n] = static_cast<Code>(code >= largest ? largest
                                   : code >= 1     ? static_cast<std::uint32_t>(code)
                                                   : 0);
      }
    }
  }

private:
  float const* m_values;
  std::size_t m_padded;
  float m_low;
  double m_range;
  bool m_regular;
  bool m_numbers;
  std::array<float, kMaxCodes> m_copy;
};

/// Codes of 1, 2 or 4 bits, the first one lowest.
void pack(std::uint8_t const* codes, std::size_t count, int logBits, std::uint8_t* out) {
  int const bits = 1 << logBits;
  std::size_t const each = 8u >> logBits;
  for (std::size_t n = 0; n < count; n += each) {
    std::uint32_t byte = 0;
    for (std::size_t c = 0; c < each; ++c)
      if (n + c < count) byte |= std::uint32_t(codes[n + c]) << (static_cast<int>(c) * bits);
    *out++ = static_cast<std::uint8_t>(byte);
  }
}

constexpr std::uint32_t largestCode(int logBits) { return (1u << (1u << logBits)) - 1; }

std::size_t codesStored(int count) { return count == kTileSamples ? std::size_t(kTileSamples) : kMaxCodes; }

/// Writes the codes of all samples, and zeros for `stored` - `count` more.
void writeCodes(Samples const& samples, int logBits, Dither const& dither, std::size_t count,
                std::size_t stored, std::uint8_t* out) {
  std::uint32_t const largest = largestCode(logBits);
  if (logBits == 4) {
    std::array<std::uint16_t, kMaxCodes> codes;
    samples.codes(largest, dither, codes.data());
    std::fill_n(codes.begin() + static_cast<std::ptrdiff_t>(count), stored - count, std::uint16_t(0));
    std::memcpy(out, codes.data(), stored * sizeof(std::uint16_t));
    return;
  }
  std::array<std::uint8_t, kMaxCodes> codes;
  samples.codes(largest, dither, codes.data());
  std::fill_n(codes.begin() + static_cast<std::ptrdiff_t>(count), stored - count, std::uint8_t(0));
  if (logBits == 3)
    std::memcpy(out, codes.data(), stored);
  else
    pack(codes.data(), stored, logBits, out);
}

} // namespace

Dither makeDither(bool enabled) {
  nanovdb::DitherLUT table(enabled);
  Dither dither;
  for (std::size_t n = 0; n < dither.size(); ++n) dither[n] = table(static_cast<int>(n));
  return dither;
}

void writeQuantised(Build build, float const* values, int count, Dither const& dither, std::uint8_t* out) {
  int const logBits = build == Build::kFp4 ? 2 : build == Build::kFp8 ? 3 : 4;
  Samples const samples(values, count);
  store(out + kQuantisedMinimumOffset, samples.low());
  store(out + kQuantisedQuantumOffset, samples.quantum(largestCode(logBits)));
  auto const codes = static_cast<std::size_t>(count);
  writeCodes(samples, logBits, dither, codes, codes, out + kQuantisedCodesOffset);
  // Tiles are as large as their type says; codes need not fill them.
  GridType const type = build == Build::kFp4   ? GridType::kFp4
                        : build == Build::kFp8 ? GridType::kFp8
                                               : GridType::kFp16;
  std::uint64_t const size = tileBytes(type, count != kTileSamples);
  std::uint64_t const used = kQuantisedCodesOffset + ((codes << logBits) + 7) / 8;
  std::memset(out + used, 0, size - used);
}

FpNRecord planFpN(float const* values, int count, float tolerance, Dither const& dither) {
  Samples const samples(values, count);
  nanovdb::AbsDiff const oracle(tolerance);
  FpNRecord record;
  record.minimum = samples.low();
  int logBits = 0;
  for (; samples.regular() && logBits < 4; ++logBits) {
    std::array<std::uint16_t, kMaxCodes> codes;
    samples.codes(largestCode(logBits), dither, codes.data());
    float const quantum = samples.quantum(largestCode(logBits));
    auto const within = [&](std::size_t n) {
      return oracle(samples.value(n), static_cast<float>(codes[n]) * quantum + samples.low());
    };
    std::size_t n = 0;
    while (n < static_cast<std::size_t>(count) && within(n)) ++n;
    if (n == static_cast<std::size_t>(count)) break;
  }
  record.logBits = static_cast<std::uint8_t>(logBits);
  record.quantum = samples.quantum(largestCode(logBits));
  record.payload = static_cast<std::uint16_t>((codesStored(count) << logBits) / 8);
  return record;
}

void writeFpN(FpNRecord const& record, float const* values, int count, Dither const& dither,
              std::uint8_t* out) {
  store(out, record);
  writeCodes(Samples(values, count), record.logBits, dither, static_cast<std::size_t>(count),
             codesStored(count), out + kFpNRecordBytes);
}

} // namespace nanovtt::Internal
