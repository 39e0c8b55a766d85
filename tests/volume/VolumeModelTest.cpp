// Random sequences of calls on volumes and their copies, beside a map from positions to values.
#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/volume/ForEach.h"
#include "support/Print.h"
#include "support/Threads.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <cstring>
#include <map>
#include <random>
#include <vector>

namespace VLN::Test {
namespace {

using namespace VLN::TileTree3D;

template <class T> T valueOf(int n) {
  T value{};
  auto* bytes = reinterpret_cast<unsigned char*>(&value);
  // Small whole numbers in each component, whatever the type.
  if constexpr (std::is_arithmetic_v<T>) {
    value = static_cast<T>(n % 100);
  } else {
    using S = typename T::Scalar;
    for (std::size_t at = 0; at < sizeof(T); at += sizeof(S)) {
      S const s = static_cast<S>(n % 100 + static_cast<int>(at));
      std::memcpy(bytes + at, &s, sizeof s);
    }
  }
  return value;
}

template <class T> bool same(T const& a, T const& b) { return std::memcmp(&a, &b, sizeof(T)) == 0; }

using Key = std::array<int, 3>;

/// A volume with two fields, and what they should hold.
template <class T> struct Subject {
  Volume volume;
  std::map<Key, T> a, b;

  Subject() {
    volume.addField<T>("a", valueOf<T>(7));
    volume.addField<T>("b", valueOf<T>(0));
  }
  Field<T> field(bool first) { return volume.field<T>(first ? "a" : "b"); }
  std::map<Key, T>& model(bool first) { return first ? a : b; }
};

template <class T> class Sequence {
public:
  explicit Sequence(std::uint32_t seed)
      : m_random(seed) {
    m_subjects.reserve(4); // so that they stay where they are
    m_subjects.emplace_back();
  }

  void run(int steps) {
    for (int n = 0; n < steps && !testing::Test::HasFailure(); ++n) step(n);
    for (auto& subject : m_subjects) checkAll(subject);
  }

private:
  int below(int n) { return static_cast<int>(m_random() % static_cast<unsigned>(n)); }
  int3 position() {
    // Near each other, across the origin, and at the ends of the domain.
    static int3 const centers[] = {
        {0, 0, 0}, {4096, -5, 9}, {-536870912, 536870911, 0}, {100000, 7, -100000}};
    int3 const c = centers[below(10) < 7 ? 0 : below(4)];
    int3 p{0, 0, 0};
    for (int axis = 0; axis < 3; ++axis)
      p[axis] = static_cast<int>(
          std::clamp<std::int64_t>(std::int64_t(c[axis]) + below(20) - 10, -536870912, 536870911));
    return p;
  }
  Subject<T>& subject() { return m_subjects[static_cast<std::size_t>(below(int(m_subjects.size())))]; }

  void step(int n) {
    Subject<T>& s = subject();
    bool const first = below(2) == 0;
    auto field = s.field(first);
    auto& model = s.model(first);
    switch (below(14)) {
    case 0: {
      std::vector<int3> positions;
      std::vector<T> values;
      for (int count = below(200); count > 0; --count) {
        positions.push_back(position());
        values.push_back(valueOf<T>(below(1000)));
      }
      field.set(positions, values);
      for (std::size_t i = 0; i < positions.size(); ++i) model[key(positions[i])] = values[i];
      break;
    }
    case 1: {
      int3 const low = position();
      s.volume.refineWhere(low, {low.x + 9, low.y + 9, low.z + 9},
                           [&](TileBox const& box) { return (box.corner.x / box.width) % 3 != 1; });
      break;
    }
    case 2: {
      auto const goes = [n](int3 const& corner) { return (corner.x / 4 + corner.y / 4 + n) % 5 == 0; };
      s.volume.removeWhere([&](TileBox const& box) { return goes(box.corner); });
      for (auto* m : {&s.a, &s.b})
        std::erase_if(*m, [&](auto const& e) {
          return goes({e.first[0] & ~3, e.first[1] & ~3, e.first[2] & ~3});
        });
      break;
    }
    case 3:
      if (m_subjects.size() < 4) {
        m_subjects.push_back(s);
      } else {
        subject() = Subject<T>(s);
      }
      break;
    case 4: { // moved away and back: handles follow
      Volume moved = std::move(s.volume);
      auto const value = valueOf<T>(below(1000));
      int3 const p = position();
      field.set(p, value);
      model[key(p)] = value;
      s.volume = std::move(moved);
      break;
    }
    case 5:
      m_object = s.volume.object();
      break;
    case 6:
      forEachSample(field, [&](int3 const& p, T& value) {
        if ((p.x + p.y) % 7 == 0) value = valueOf<T>(p.z & 31);
      });
      for (std::int64_t t = 0; t < s.volume.tree().tileCount(28); ++t) {
        int3 const c = s.volume.tree().tile(t, 28).tijk();
        for (int e = 0; e < 64; ++e) {
          int3 const p{c.x + e % 4, c.y + e / 4 % 4, c.z + e / 16};
          if ((p.x + p.y) % 7 == 0) model[key(p)] = valueOf<T>(p.z & 31);
        }
      }
      break;
    default:
      for (int count = below(60); count > 0; --count) {
        int3 const p = position();
        auto const value = valueOf<T>(below(1000));
        field.set(p, value);
        model[key(p)] = value;
        if (below(4) == 0) checkOne(s, !first);
      }
    }
    checkOne(s, first);
    if (below(8) == 0) checkAll(s);
  }

  static Key key(int3 const& p) { return {p.x, p.y, p.z}; }
  void checkOne(Subject<T>& s, bool first) { check(s, first, position()); }
  void check(Subject<T>& s, bool first, int3 const& p) {
    auto const& model = s.model(first);
    auto const found = model.find(key(p));
    auto const field = s.field(first);
    T const wanted = found != model.end() ? found->second : field.background();
    ASSERT_TRUE(same(wanted, field.get(p))) << p << (first ? " of a" : " of b");
  }
  void checkAll(Subject<T>& s) {
    for (bool const first : {true, false})
      for (auto const& [k, value] : s.model(first)) check(s, first, {k[0], k[1], k[2]});
    ASSERT_TRUE(s.volume.tree().checkConsistency(false));
    for (bool const first : {true, false}) {
      auto const& channel = s.field(first).channel();
      for (int d = 0; d <= 28; ++d) ASSERT_EQ(channel.tileCount(d), s.volume.tree().tileCount(d));
      ASSERT_EQ(s.volume.topology().tileCount(-1), s.volume.tree().tileCount(-1));
    }
  }

  std::mt19937 m_random;
  std::vector<Subject<T>> m_subjects;
  VLN::Object m_object;
};

template <class T> void runSequences(int count, int steps) {
  for (int n = 0; n < count; ++n) {
    auto const seed = static_cast<std::uint32_t>(1000 * sizeof(T) + static_cast<std::size_t>(n));
    SCOPED_TRACE("seed " + std::to_string(seed));
    Sequence<T>(seed).run(steps);
    if (testing::Test::HasFailure()) return;
  }
}

#define VLN_SEQUENCE(type, name)                                                                             \
  TEST(VolumeModelTest, RequirementRandomCallsOn_##name) { runSequences<type>(4, 60); }
VLN_FOR_EACH_ELEMENT_TYPE(VLN_SEQUENCE)
#undef VLN_SEQUENCE

} // namespace
} // namespace VLN::Test
