#include "GeometryVolume/nanovtt/QuantiseImpl.h"

#include "Reader/NanoVTTFormat.h"

#include <algorithm>
#include <cmath>
#include <cstring>
#include <nanovdb/util/DitherLUT.h>
#include <nanovdb/util/GridBuilder.h>

namespace nanovtt::Internal {

namespace {

using Lanes = float __attribute__((vector_size(16)));

/// The samples of a tile with their range. What pads them to whole groups takes no part in it.
class Samples {
public:
  Samples(float const* samples, int count)
      : m_padded((static_cast<std::size_t>(count) + 63) / 64 * 64) {
    std::memcpy(m_values.data(), samples, static_cast<std::size_t>(count) * sizeof(float));
    for (auto n = static_cast<std::size_t>(count); n < m_padded; ++n) m_values[n] = samples[0];
    constexpr float kLargest = 3.4028235e38f;
    Lanes low{kLargest, kLargest, kLargest, kLargest}, high = -low;
    auto numbers = low == low;
    for (std::size_t n = 0; n < m_padded; n += 4) {
      Lanes v;
      std::memcpy(&v, m_values.data() + n, sizeof v);
      low = v < low ? v : low;
      high = v > high ? v : high;
      numbers &= v == v;
    }
    m_low = low[0];
    float top = high[0];
    for (int lane = 1; lane < 4; ++lane) {
      if (low[lane] < m_low) m_low = low[lane];
      if (high[lane] > top) top = high[lane];
    }
    m_numbers = numbers[0] & numbers[1] & numbers[2] & numbers[3];
    m_range = double(top) - double(m_low);
    m_regular = m_range > 0 && std::isfinite(m_range);
  }

  float low() const { return m_low; }
  bool regular() const { return m_regular; }
  std::size_t padded() const { return m_padded; }
  float value(std::size_t n) const { return m_values[n]; }
  float quantum(std::uint32_t largest) const {
    double const quantum = m_range / largest;
    return std::isfinite(quantum) ? static_cast<float>(quantum) : 0.0f;
  }

  void codes(std::uint32_t largest, Dither const& dither, std::uint32_t* out) const {
    double const low = m_low;
    double const scale = m_regular ? largest / m_range : 1.0;
    if (m_regular && m_numbers) {
      for (std::size_t n = 0; n < m_padded; n += 64) codesOf64(n, low, scale, dither, out);
      for (std::size_t n = 0; n < m_padded; ++n) out[n] = std::min(out[n], largest);
      return;
    }
    for (std::size_t n = 0; n < m_padded; ++n) {
      double const code = (double(m_values[n]) - low) * scale + double(dither[n]);
      out[n] = code >= largest ? largest : code >= 1 ? static_cast<std::uint32_t>(code) : 0; // NaN too
    }
  }

private:
  void codesOf64(std::size_t first, double low, double scale, Dither const& dither,
                 std::uint32_t* out) const {
    float const* const v = m_values.data() + first;
    float const* const d = dither.data() + first;
    auto* const codes = reinterpret_cast<std::int32_t*>(out + first);
    for (std::size_t n = 0; n < 64; ++n)
      codes[n] = static_cast<std::int32_t>((double(v[n]) - low) * scale + double(d[n]));
  }

  alignas(16) std::array<float, kMaxCodes> m_values;
  std::size_t m_padded;
  float m_low = 0;
  double m_range = 0;
  bool m_regular = false; ///< the range is finite and above 0
  bool m_numbers = true;  ///< no sample is NaN
};

/// Codes of 1 to 16 bits, each a power of two, the first one lowest.
void pack(std::uint32_t const* codes, std::size_t count, int logBits, std::uint8_t* out) {
  switch (logBits) {
  case 4:
    for (std::size_t n = 0; n < count; ++n) {
      auto const code = static_cast<std::uint16_t>(codes[n]);
      std::memcpy(out + 2 * n, &code, sizeof code);
    }
    return;
  case 3:
    for (std::size_t n = 0; n < count; ++n) out[n] = static_cast<std::uint8_t>(codes[n]);
    return;
  default:
    int const bits = 1 << logBits;
    std::size_t const each = 8u >> logBits;
    for (std::size_t n = 0; n < count; n += each) {
      std::uint32_t byte = 0;
      for (std::size_t c = 0; c < each; ++c)
        if (n + c < count) byte |= codes[n + c] << (static_cast<int>(c) * bits);
      *out++ = static_cast<std::uint8_t>(byte);
    }
  }
}

constexpr std::uint32_t largestCode(int logBits) { return (1u << (1u << logBits)) - 1; }

std::size_t codesStored(int count) { return count == kTileSamples ? std::size_t(kTileSamples) : kMaxCodes; }

} // namespace

Dither makeDither(bool enabled) {
  nanovdb::DitherLUT table(enabled);
  Dither dither;
  for (std::size_t n = 0; n < dither.size(); ++n) dither[n] = table(static_cast<int>(n));
  return dither;
}

void writeQuantised(Build build, float const* values, int count, Dither const& dither, std::uint8_t* out) {
  int const logBits = build == Build::kFp4 ? 2 : build == Build::kFp8 ? 3 : 4;
  std::uint32_t const largest = largestCode(logBits);
  Samples const samples(values, count);
  std::array<std::uint32_t, kMaxCodes> codes;
  samples.codes(largest, dither, codes.data());
  store(out + kQuantisedMinimumOffset, samples.low());
  store(out + kQuantisedQuantumOffset, samples.quantum(largest));
  std::uint8_t* const target = out + kQuantisedCodesOffset;
  pack(codes.data(), static_cast<std::size_t>(count), logBits, target);
  // Tiles are as large as their type says; codes need not fill them.
  GridType const type = build == Build::kFp4   ? GridType::kFp4
                        : build == Build::kFp8 ? GridType::kFp8
                                               : GridType::kFp16;
  std::uint64_t const size = tileBytes(type, count != kTileSamples);
  std::uint64_t const used = kQuantisedCodesOffset + ((static_cast<std::uint64_t>(count) << logBits) + 7) / 8;
  std::memset(out + used, 0, size - used);
}

FpNRecord planFpN(float const* values, int count, float tolerance, Dither const& dither) {
  Samples const samples(values, count);
  nanovdb::AbsDiff const oracle(tolerance);
  FpNRecord record;
  record.minimum = samples.low();
  int logBits = 0;
  for (; samples.regular() && logBits < 4; ++logBits) {
    std::array<std::uint32_t, kMaxCodes> codes;
    samples.codes(largestCode(logBits), dither, codes.data());
    float const quantum = samples.quantum(largestCode(logBits));
    int n = 0;
    while (n < count &&
           oracle(samples.value(static_cast<std::size_t>(n)),
                  static_cast<float>(codes[static_cast<std::size_t>(n)]) * quantum + samples.low()))
      ++n;
    if (n == count) break;
  }
  record.logBits = static_cast<std::uint8_t>(logBits);
  record.quantum = samples.quantum(largestCode(logBits));
  record.payload = static_cast<std::uint16_t>((codesStored(count) << logBits) / 8);
  return record;
}

void writeFpN(FpNRecord const& record, float const* values, int count, Dither const& dither,
              std::uint8_t* out) {
  store(out, record);
  Samples const samples(values, count);
  std::array<std::uint32_t, kMaxCodes> codes;
  samples.codes(largestCode(record.logBits), dither, codes.data());
  // What pads the codes of a halo tile is 0.
  std::fill(codes.begin() + count, codes.begin() + static_cast<std::ptrdiff_t>(samples.padded()), 0u);
  pack(codes.data(), codesStored(count), record.logBits, out + kFpNRecordBytes);
}

} // namespace nanovtt::Internal
