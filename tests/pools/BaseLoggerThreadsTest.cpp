// The report while other threads make, share, copy and destroy components.
#include "LoggerFixture.h"

#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/tiletree/Container.h"
#include "GeometryVolume/tiletree/TileAccessor.h"
#include "GeometryVolume/topology/PointTopology.h"
#include "GeometryVolume/topology/VoxelTopology.h"

#include <algorithm>
#include <atomic>
#include <chrono>
#include <iostream>
#include <sstream>
#include <thread>
#include <vector>

namespace {

using namespace VLN::TileTree3D;
using test::BaseLogger;
using test::LoggerTest;
using Tree = Container<PowerOfTwoTraits>;
using Topology = VoxelTopology<PowerOfTwoTraits>;
using Density = Channel<PowerOfTwoTraits, float, 4, 0>;

/// Trees and topologies that exist are not changed while the report walks; everything else may happen.
struct Source {
  Source() {
    for (int i = 0; i < 8; ++i) tree.tileAccessor().addTile({16 * i, 0, 0}, 26);
    topology.update(tree);
  }
  void makeAndDestroy(int thread) const {
    Tree const copy(tree);
    Topology const counts(topology);
    Density density("density_" + std::to_string(thread), nullptr, kInitializeDefaultValue, false, true, 0,
                    28);
    density.update(counts);
    Density shared(density);
    Ostil::Ptr<VLN::Component> deepTree, deepChannel;
    copy.copyTo(deepTree);
    shared.copyTo(deepChannel);
    shared.cloneData();
    density = shared;
    ASSERT_EQ(density.tileCount(-1), tree.tileCount(-1));
  }
  Tree tree{"voxel_tree", 1.0f};
  Topology topology{"voxel_component", kVoxelOffsetCorner};
};

/// Swallows what sizes of shared data are warned of.
struct QuietErrors {
  std::ostringstream text;
  std::streambuf* before = std::cerr.rdbuf(text.rdbuf());
  ~QuietErrors() { std::cerr.rdbuf(before); }
};

TEST_F(LoggerTest, RequirementAReportWhileEightThreadsCreateAndDestroy) {
  using Clock = std::chrono::steady_clock;
  QuietErrors const quiet;
  Source const source;
  auto const until = Clock::now() + std::chrono::seconds(3);
  std::atomic<bool> stop{false};
  std::atomic<int> rounds{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < 8; ++t)
    threads.emplace_back([&, t] {
      while (!stop) source.makeAndDestroy(t), ++rounds;
    });
  int reports = 0;
  do {
    BaseLogger::dump();
    BaseLogger::numberOfActiveCopies();
    ++reports;
    out.take();
  } while (Clock::now() < until);
  stop = true;
  for (auto& thread : threads) thread.join();
  out.take();
  EXPECT_GT(rounds, 8);
  RecordProperty("rounds", rounds.load());
  RecordProperty("reports", reports);
  EXPECT_EQ(counter("numDeAllocNotOK"), 0);
  EXPECT_EQ(counter("numAllocOK"), counter("numDeAllocOK") + 2) << "tree and topology of the source are left";
  EXPECT_EQ(counter("numVoidDeAllocNotOK"), 0);
}

TEST_F(LoggerTest, RegressionTopologiesAreMeasuredWhole) {
  QuietErrors const quiet;
  Source const source;
  PointTopology<PowerOfTwoTraits> points("voxel_points");
  points.update(source.tree);
  std::atomic<bool> stop{false};
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t)
    threads.emplace_back([&] {
      while (!stop) {
        Topology voxels(source.topology);
        PointTopology<PowerOfTwoTraits> copy(points);
        voxels = source.topology;
        copy.update(source.tree);
        voxels.setName("voxel_renamed");
      }
    });
  double largest = 0;
  auto const until = std::chrono::steady_clock::now() + std::chrono::seconds(1);
  while (std::chrono::steady_clock::now() < until) {
    out.take();
    BaseLogger::dump();
    largest = std::max(largest, std::stod(out.after("Total mem occupied by data: used = ")));
  }
  stop = true;
  for (auto& thread : threads) thread.join();
  EXPECT_LT(largest, 10.0) << "megabytes";
}

} // namespace
