// Writes through the fields of a volume when memory ends: a write happens or does not, and what was written
// before stays, also where the tree cannot take its tiles in yet.
#include "Faults.h"

#include "GeometryVolume/volume/Volume.h"

#include <gtest/gtest.h>

#include <memory>
#include <sstream>

namespace {

using namespace VLN::TileTree3D;
using test::faults::After;
using test::faults::everyAllocation;

struct Fields {
  std::shared_ptr<Volume> volume = std::make_shared<Volume>();
  Field<float> a = volume->addField<float>("a", 1), b = volume->addField<float>("b", 2);
};

/// Some finest tiles, and a coarse one whose values are not the background.
Fields make() {
  Fields f;
  f.volume->refineWhere(
      {64, 0, 0}, {96, 32, 32}, [](TileBox const&) { return true; }, 25);
  f.a.fill(5);
  for (int n = 0; n < 9; ++n) f.b.set(9 * n, n, 0, float(n));
  return f;
}
constexpr int kMany = 300; // more than are added one by one
int3 place(int n) { return {5 * n - 400, n % 50, n % 7}; }

std::string state(Fields const& f) {
  std::ostringstream os;
  for (int n = 0; n < kMany; ++n) os << f.a.get(place(n)) << ' ' << f.b.get(place(n)) << ' ';
  os << f.a.get(70, 1, 1) << ' ' << f.b.get(70, 1, 1);
  return os.str();
}
bool sound(Fields const& f) {
  auto const& tree = f.volume->tree();
  return tree.checkConsistency(false) && f.a.channel().tileCount(-1) == tree.tileCount(-1) &&
         f.b.channel().tileCount(-1) == tree.tileCount(-1) && f.a.get(70, 1, 1) == 5.0f &&
         f.b.get(9, 1, 0) == 1.0f;
}

TEST(FieldWriteFaults, RequirementOneValueIsWrittenOrNot) {
  everyAllocation<Fields>(
      "a new tile", {&make, [](Fields& f) { f.a.set(-1000, 7, 7, 3); }, &state, After::kUnchanged, &sound});
  everyAllocation<Fields>("a tile where a coarse one is", {&make, [](Fields& f) { f.a.set(71, 1, 1, 3); },
                                                           &state, After::kUnchanged, &sound});
}

TEST(FieldWriteFaults, RequirementWhatWasWrittenStaysWhenTheTreeCannotGrow) {
  for (int const count : {6, kMany}) {
    auto const write = [=](Fields& f) {
      for (int n = 0; n < count; ++n) {
        f.a.set(place(n), float(n));
        if (n % 3 == 0) f.b.set(place(n), -float(n));
      }
    };
    everyAllocation<Fields>("the tree follows",
                            {[=] {
                               Fields f = make();
                               write(f);
                               return f;
                             },
                             [](Fields& f) { f.volume->topology(); },
                             [](Fields const&) { return std::string(); }, After::kUnchanged,
                             [=](Fields const& f) {
                               Fields whole = make();
                               write(whole);
                               return sound(f) && state(f) == state(whole);
                             }});
  }
}

TEST(FieldWriteFaults, RequirementValuesInBulkAreWrittenOrNot) {
  std::vector<int3> positions;
  std::vector<float> values;
  for (int n = 0; n < kMany; ++n) positions.push_back(place(n)), values.push_back(float(n));
  everyAllocation<Fields>(
      "in bulk", {&make, [&](Fields& f) { f.a.set(positions, values); }, &state, After::kUnchanged, &sound});
}

} // namespace
