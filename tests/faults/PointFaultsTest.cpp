// Points when memory ends: re-tiling, and volumes of points.
#include "Faults.h"

#include "GeometryVolume/channels/ElementReTile.h"
#include "GeometryVolume/channels/UpdateTopologies.h"
#include "GeometryVolume/topology/Command.h"

#include <gtest/gtest.h>
#include <memory>
#include <sstream>

#ifdef VLN_TEST_INTEROP
#include "Interop/PointVolume.h"
#endif

namespace {

using namespace VLN::TileTree3D;
using test::faults::After;
using test::faults::everyAllocation;
using Shape = PowerOfTwoTraits;
using Positions = Channel<Shape, VLN::TileTree3D::float3, 4, 0>;
using Ids = Channel<Shape, int, 4, 0>;
namespace Command = VLN::TileTree3D::Command;

/// Points with a number each. Names are longer than what a string holds without memory of its own.
struct Cloud {
  std::shared_ptr<Container<Shape>> tree = std::make_shared<Container<Shape>>("tree of all the points", 1.0f);
  std::shared_ptr<PointTopology<Shape>> topology =
      std::make_shared<PointTopology<Shape>>("topology of all the points");
  std::shared_ptr<Positions> positions = std::make_shared<Positions>(
      "positions of all the points", nullptr, kInitializeDefaultValue, false, true, 0, 28);
  std::shared_ptr<VLN::Object> object = std::make_shared<VLN::Object>();
};
constexpr char const* kIds = "numbers of all the points";

Cloud cloud() {
  Cloud c;
  auto accessor = c.tree->tileAccessor();
  for (int n = 0; n < 20; ++n) accessor.addTile(4 * n, 0, 4 * (n % 3), 28);
  accessor.addTiles(Container<Shape>::TileLists{});
  c.topology->setTargetName(c.tree->name());
  c.positions->setTargetName(c.topology->name());
  c.topology->update(*c.tree);
  c.positions->update(*c.topology);
  Command::createChannel<int, 2, 4, 4, 0, 0>(kIds, *c.topology, *c.object, 0, kInitializeDefaultValue, 0, 28);
  auto ids = c.object->extractComponent<Ids>(kIds);
  int id = 0;
  for (std::int64_t n = 0; n < c.tree->tileCount(28); ++n) {
    auto const& t = std::as_const(*c.tree).tile(n, 28);
    for (int i = 0; i < 3; ++i) {
      c.positions->tileDataAccessor()
          .tileData(TreeIndex{n, 28})
          .push({float(t.ti()) + float(i) * 1.2f, float(t.tj()) + 1.5f, float(t.tk()) + 0.5f});
      ids->tileDataAccessor().tileData(TreeIndex{n, 28}).push(++id);
    }
  }
  c.object->putComponent(std::move(ids));
  c.topology->update(*c.positions);
  for (auto& p : *c.positions) p.x += 2.9f, p.y += float(int(p.x) % 5) * 4;
  return c;
}
std::string stateOf(Cloud const& c) {
  std::ostringstream os;
  os << c.tree->checkConsistency(false) << ' ' << c.tree->tileCount(-1) << ' ' << c.topology->tileCount(-1)
     << ' ' << c.positions->tileCount(-1) << ':';
  for (auto const& p : std::as_const(*c.positions)) os << ' ' << p.x << ',' << p.y << ',' << p.z;
  auto const ids = c.object->component<Ids>(kIds);
  os << " ids " << (ids ? ids->tileCount(-1) : -1);
  if (ids)
    for (int const id : *ids) os << ' ' << id;
  return os.str();
}
/// Each component is whole, and none has left the object.
bool isSound(Cloud const& c) {
  auto const ids = c.object->component<Ids>(kIds);
  return c.tree->checkConsistency(false) && ids && std::int64_t(ids->size()) == ids->elementCount(-1) &&
         std::int64_t(c.positions->size()) == c.positions->elementCount(-1);
}

TEST(PointFaults, RequirementReTiling) {
  for (bool const prune : {false, true})
    everyAllocation<Cloud>(
        prune ? "re-tiled and pruned" : "re-tiled",
        {&cloud,
         [=](Cloud& c) { channelElementReTile(*c.tree, *c.topology, *c.positions, *c.object, prune); },
         &stateOf, After::kTorn, &isSound});
}

#ifdef VLN_TEST_INTEROP
using namespace VLN::Interop;

PointSet somePoints() {
  PointSet points;
  auto mass = makeAttribute<float>("mass of each of the points");
  auto id = makeAttribute<std::int64_t>("id");
  for (int n = 0; n < 300; ++n) {
    points.positions.push_back({float(n % 13) * 1.7f, float(n % 7) * 2.3f, float(n) * 0.31f});
    mass.append(float(n) / 8);
    id.append(std::int64_t(n));
  }
  points.attributes = {mass, id};
  return points;
}
std::string stateOf(PointSet const& points) {
  std::ostringstream os;
  for (std::size_t n = 0; n < points.size(); ++n) {
    os << ' ' << points.positions[n].x << ',' << points.positions[n].y << ',' << points.positions[n].z;
    for (auto const& a : points.attributes)
      os << '/' << (a.type == "float" ? double(a.value<float>(n)) : double(a.value<std::int64_t>(n)));
  }
  return os.str();
}

TEST(PointFaults, RequirementVolumesOfPoints) {
  struct Made {
    PointSet points = somePoints();
    PointVolume volume;
    PointSet back;
  };
  everyAllocation<Made>("built and read back", {[] { return Made(); },
                                                [](Made& m) {
                                                  auto volume = buildPointVolume(m.points);
                                                  auto back = pointSetOf(volume);
                                                  m.volume = std::move(volume), m.back = std::move(back);
                                                },
                                                [](Made const& m) { return stateOf(m.back); }});
  everyAllocation<PointVolume>(
      "advected", {[] { return buildPointVolume(somePoints()); },
                   [](PointVolume& v) {
                     advect(v, {3.7, -2.2, 5.1});
                   },
                   [](PointVolume const& v) {
                     return v.object->component<PositionChannel>(kPositionsName) ? stateOf(pointSetOf(v))
                                                                                 : "lost";
                   },
                   After::kTorn,
                   [](PointVolume const& v) {
                     return v.object->component<PositionChannel>(kPositionsName) &&
                            v.object->component<PointContainer>(kPointContainerName) &&
                            v.object->component<VLN::Interop::PointTopology>(kPointTopologyName);
                   }});
}
#endif

} // namespace
