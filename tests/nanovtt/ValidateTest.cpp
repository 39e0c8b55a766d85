// Damaged buffers: every field in turn.
#include "Reader/NanoVTTReader.h"
#include "Reader/NanoVTTValidate.h"
#include "support/FlatVolume.h"
#include "support/ReadAll.h"

#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <limits>
#include <vector>

namespace {

using namespace Support;
using nanovtt::validate;
using Bytes = std::vector<std::uint8_t>;

/// Small, with three depths, an incomplete and a complete block, and two grids.
template <class BuildT = void> Bytes sample(FlatOptions options = {}) {
  FlatVolume volume;
  volume.complete({0, 0, 0}, 20, 2);
  volume.complete({4096, 0, 0}, 20, 1);
  volume.add({0, 0, 0}, 22, 25);
  volume.finish();
  std::mt19937 random(1);
  volume.channel<float>("a", 0.5f, [&](auto const&, int) { return flatValue<float>(random); });
  volume.channel<std::int32_t>("b", 1, [&](auto const&, int) { return flatValue<std::int32_t>(random); });
  options.rootLevelLimit = 8;
  auto const handle = flatten<BuildT>(*volume.object, options);
  EXPECT_FALSE(handle.empty());
  return {handle.data(), handle.data() + handle.size()};
}

struct Sample {
  std::string name;
  Bytes bytes;
};
std::vector<Sample> samples() {
  FlatOptions halo, coalesced, textures;
  halo.haloFraction = 1;
  coalesced.coalesce = true;
  textures.textures = true, textures.haloFraction = 1;
  return {{"plain", sample()},
          {"halo", sample(halo)},
          {"coalesced", sample(coalesced)},
          {"textures", sample(textures)},
          {"Fp4", sample<nanovdb::Fp4>(halo)},
          {"Fp16", sample<nanovdb::Fp16>()},
          {"FpN", sample<nanovdb::FpN>(halo)}};
}

template <class T> T get(Bytes const& bytes, std::uint64_t at) { return nanovtt::load<T>(bytes.data() + at); }
template <class T> void put(Bytes& bytes, std::uint64_t at, T value) {
  nanovtt::store<T>(bytes.data() + at, value);
}

/// The field with other values must be refused, at a byte not before `from`.
template <class T>
void expectRefused(Sample const& sample, std::uint64_t at, std::vector<T> const& values, char const* field) {
  Bytes bytes = sample.bytes;
  T const good = get<T>(bytes, at);
  for (T const value : values) {
    if (std::memcmp(&value, &good, sizeof(T)) == 0) continue;
    put(bytes, at, value);
    auto const answer = validate(bytes.data(), bytes.size());
    EXPECT_FALSE(answer.ok()) << sample.name << ": " << field << " at " << at << " became " << value;
    EXPECT_LE(answer.position, bytes.size()) << sample.name;
    put(bytes, at, good);
  }
  ASSERT_TRUE(validate(bytes.data(), bytes.size()).ok()) << "the damage was undone";
}
/// The same with values that integers go wrong by.
template <class T> void expectIntegerRefused(Sample const& sample, std::uint64_t at, char const* field) {
  T const good = get<T>(sample.bytes, at), last = std::numeric_limits<T>::max();
  std::vector<T> values{T(0),        T(1), T(good + 1), T(good - 1), T(good + 32),
                        T(good * 2), last, T(last - 7), T(last / 2), T(last / 2 + 1)};
  for (unsigned bit = 0; bit < 8 * sizeof(T); bit += 3)
    values.push_back(static_cast<T>(good ^ T(T(1) << bit)));
  expectRefused<T>(sample, at, values, field);
}

TEST(Validate, RequirementAcceptsWhatTheConversionWrites) {
  for (auto const& s : samples()) {
    auto const answer = validate(s.bytes.data(), s.bytes.size());
    EXPECT_TRUE(answer.ok()) << s.name << ": " << answer.message << " at " << answer.position;
    EXPECT_GT(readAll(s.bytes.data()), 0u);
  }
}

TEST(Validate, NegativeEveryShorterLength) {
  for (auto const& s : samples())
    for (std::uint64_t length = 0; length < s.bytes.size();
         length += length < 200 || length + 50 > s.bytes.size() ? 1 : 997) {
      Bytes const cut(s.bytes.begin(), s.bytes.begin() + static_cast<std::ptrdiff_t>(length));
      ASSERT_FALSE(validate(cut.data(), cut.size()).ok()) << s.name << ", " << length;
    }
}

TEST(Validate, NegativeBytesThatAreSomethingElse) {
  for (int const fill : {0, 0x20, 0x7F, 0xFF}) {
    Bytes const bytes(3 << 20, static_cast<std::uint8_t>(fill));
    EXPECT_FALSE(validate(bytes.data(), bytes.size()).ok()) << fill;
  }
  EXPECT_FALSE(validate(nullptr, 0).ok());
}

TEST(Validate, NegativeContainerFields) {
  for (auto const& s : samples()) {
    std::uint64_t const tiles = get<std::uint32_t>(s.bytes, 16 + 29 * 4),
                        inner = get<std::uint32_t>(s.bytes, 16 + 28 * 4);
    std::uint64_t const size = s.bytes.size();
    expectRefused<std::uint64_t>(s, 0, {0, size + 1, ~std::uint64_t(0), size << 32, 1048768}, "buffer size");
    expectIntegerRefused<std::uint64_t>(s, 8, "container size");
    for (std::uint64_t d = 0; d < 30; ++d)
      expectIntegerRefused<std::uint32_t>(s, 16 + 4 * d, "tileCountAccum");
    for (std::uint64_t a = 0; a < 3; ++a) {
      std::int32_t const llc = get<std::int32_t>(s.bytes, 1048712 + 4 * a);
      expectRefused<std::int32_t>(s, 1048712 + 4 * a,
                                  {llc + 1, llc - 4, INT32_MIN, INT32_MAX, 536870912, -536870913}, "llc");
    }
    expectIntegerRefused<std::uint32_t>(s, 1048724, "rootDepth");
    expectIntegerRefused<std::uint64_t>(s, 1048728, "parent table offset");
    for (std::uint64_t n = 0; n <= inner; ++n)
      expectIntegerRefused<std::uint64_t>(s, 1048736 + 8 * n, "child offset");
    for (std::uint64_t n = 0; n < tiles; ++n)
      expectIntegerRefused<std::uint32_t>(s, 1048736 + 8 * (inner + 1) + 4 * n, "parent");
    std::uint64_t const sentinel = get<std::uint64_t>(s.bytes, 1048736 + 8 * inner);
    for (std::uint64_t at = 8 * (inner + 1) + 4 * tiles; at < sentinel; at += 4)
      expectIntegerRefused<std::uint32_t>(s, 1048736 + at, "child");
    for (std::uint64_t n = 0; n < 32; n += 4)
      expectIntegerRefused<std::uint32_t>(s, 1048736 + sentinel + n, "sentinel");
  }
}

TEST(Validate, NegativeRootSlots) {
  Sample const s = samples()[0];
  std::vector<std::uint64_t> slots{0, 1, 63, 64, 4095, 4096, 262143};
  for (std::uint64_t slot = 0; slot < 262144; ++slot)
    if (get<std::uint32_t>(s.bytes, 136 + 4 * slot) != 0xFFFFFFFF) slots.push_back(slot);
  for (auto const slot : slots) expectIntegerRefused<std::uint32_t>(s, 136 + 4 * slot, "root slot");
}

TEST(Validate, NegativeGridFields) {
  for (auto const& s : samples()) {
    std::uint64_t const tiles = get<std::uint32_t>(s.bytes, 16 + 29 * 4);
    std::uint64_t start = get<std::uint64_t>(s.bytes, 8);
    for (int grid = 0; grid < 2; ++grid) {
      auto const field = [&](std::uint64_t at) { return start + at; };
      expectRefused<std::uint64_t>(s, field(0), {1, 0x314244566F6E614Eull, 0x4E616E6F56545431ull}, "magic");
      expectIntegerRefused<std::uint32_t>(s, field(16), "version");
      expectIntegerRefused<std::uint32_t>(s, field(20), "flags");
      expectIntegerRefused<std::uint32_t>(s, field(24), "index");
      expectIntegerRefused<std::uint32_t>(s, field(28), "count");
      expectIntegerRefused<std::uint64_t>(s, field(32), "size");
      expectRefused<std::uint8_t>(s, field(295), {1, 255}, "name's end");
      for (std::uint64_t n = 0; n < 22; ++n)
        expectRefused<float>(s, field(296 + 4 * n), {-1.5f, 3, 1e30f, NAN, INFINITY}, "map");
      for (std::uint64_t n = 0; n < 22; ++n)
        expectRefused<double>(s, field(384 + 8 * n), {-1.5, 3, 1e300, NAN, INFINITY}, "map");
      for (std::uint64_t n = 0; n < 6; ++n)
        expectRefused<double>(s, field(560 + 8 * n), {-1e9, 1e9, 0.001, NAN, INFINITY, -INFINITY},
                              "world box");
      for (std::uint64_t n = 0; n < 3; ++n)
        expectRefused<double>(s, field(608 + 8 * n), {0, -0.25, 0.2500001, NAN, INFINITY}, "voxel size");
      expectRefused<std::uint32_t>(s, field(632), {3, 0xFFFFFFFF}, "class");
      expectRefused<std::uint32_t>(s, field(636), {0, 2, 3, 5, 6, 7, 8, 9, 11, 12, 18, 100, 0xFFFFFFFF},
                                   "type");
      expectIntegerRefused<std::uint64_t>(s, field(640), "blind metadata");
      expectIntegerRefused<std::uint32_t>(s, field(648), "blind metadata");
      for (std::uint64_t n = 0; n < 6; ++n)
        expectRefused<std::int32_t>(s, field(672 + 4 * n), {INT32_MIN, INT32_MAX, -536870913, 600000000},
                                    "tile-space box");
      expectIntegerRefused<std::uint64_t>(s, field(696), "container offset");
      expectIntegerRefused<std::uint64_t>(s, field(704), "tree size");
      for (std::uint64_t n = 0; n <= tiles; ++n)
        expectIntegerRefused<std::uint64_t>(s, field(736 + 8 * n), "tile table");
      start += get<std::uint64_t>(s.bytes, start + 32);
    }
  }
}

TEST(Validate, NegativeFpNRecords) {
  Sample const s = samples().back();
  ASSERT_EQ(s.name, "FpN");
  std::uint64_t const tiles = get<std::uint32_t>(s.bytes, 16 + 29 * 4), grid = get<std::uint64_t>(s.bytes, 8);
  for (std::uint64_t n = 0; n < tiles; ++n) {
    std::uint64_t const record = grid + 736 + get<std::uint64_t>(s.bytes, grid + 736 + 8 * n);
    expectIntegerRefused<std::uint16_t>(s, record + 8, "payload");
    expectRefused<std::uint8_t>(
        s, record + 10, {static_cast<std::uint8_t>(get<std::uint8_t>(s.bytes, record + 10) + 1), 5, 255},
        "bits");
    expectRefused<std::uint8_t>(s, record + 11, {1, 128}, "reserved byte");
  }
}

// Any single byte of the tables: refused, or of no harm to any lookup.
TEST(Validate, RequirementNoDamagedByteLeadsOutOfTheBuffer) {
  std::mt19937 random(9);
  for (auto const& s : samples()) {
    Bytes bytes = s.bytes;
    std::uint64_t const grid = get<std::uint64_t>(bytes, 8);
    int accepted = 0;
    for (int n = 0; n < 3000; ++n) {
      std::uint64_t const at = n % 3 == 0   ? random() % 1048736
                               : n % 3 == 1 ? 1048712 + random() % (grid - 1048712)
                                            : grid + random() % (bytes.size() - grid);
      auto const good = bytes[at];
      bytes[at] = static_cast<std::uint8_t>(random());
      if (validate(bytes.data(), bytes.size()).ok()) {
        if (++accepted % 50 == 0) readAll(bytes.data());
      }
      bytes[at] = good;
    }
    EXPECT_GT(accepted, 0) << "samples may be anything";
  }
}

} // namespace
