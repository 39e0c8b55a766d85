// Trees and values beside OpenVDB and NanoVDB in the same run, for each grid:
//
//   topology  makes the tiles of all leaves, in the file's order or shuffled; an item is a leaf of 8 x 8 x 8
//             voxels. touchLeaf makes room for values as well and writes them, and so does "bulk with
//             values"; with zeros, large blocks of them come from the system when they are first used
//   read      a million active voxels, leaf by leaf or at random; an item is a voxel. "Many at once" and
//             "stored" give an array of values, the others their sum
//   sum       all active voxels; an item is an active voxel
//   import    an item is an active voxel. A deep copy is less work: an import arranges the values anew, fills
//             the coarser tiles, and finds out which state is implied by the values
//   file      a whole file, read back from where a grid was just written; here with all its guards, in a
//   child
//             process first
//   memory    bytes that the whole grid or volume holds for each active voxel
#include "BenchGrids.h"
#include "GeometryVolume/channels/ChannelReader.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/topology/VoxelTopology.h"

#include <benchmark/benchmark.h>
#include <nanovdb/util/OpenToNanoVDB.h>

#include <algorithm>
#include <bit>
#include <cmath>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <random>
#include <stdexcept>

#include <stdlib.h>

namespace {

using namespace VLN;
using namespace VLN::TileTree3D;
using openvdb::Coord;
using openvdb::FloatGrid;
using Shape = PowerOfTwoTraits;
using Tree = Container<Shape>;
using Values = Channel<Shape, float, 4, 0>;
using Topology = VoxelTopology<Shape>;

constexpr std::size_t kPositions = 1 << 20;

/// A grid in all three forms, and the places where it is read.
struct Subject {
  std::string name;
  FloatGrid::Ptr grid;
  nanovdb::GridHandle<nanovdb::HostBuffer> nano;
  Interop::VdbImport content;
  Ostil::Ptr<Tree> tree;
  Ostil::Ptr<Values> values;
  std::unique_ptr<ChannelReader<Values>> reader;
  std::vector<Coord> leaves; ///< corners, in the order of the grid's tree
  std::vector<Coord> ordered, shuffled;
  double activeVoxels = 0;

  Subject(std::string const& gridName, FloatGrid::Ptr const& source)
      : name(gridName)
      , grid(source)
      , nano(nanovdb::openToNanoVDB(*source))
      , content(Bench::importGrid(source)) {
    auto const& volume = content.volumes.at(0);
    tree = volume.object->component<Tree>(Interop::kVdbContainerName);
    values = volume.object->component<Values>(volume.channels.at(0).name);
    reader = std::make_unique<ChannelReader<Values>>(*tree, *values);
    activeVoxels = static_cast<double>(grid->activeVoxelCount());
    for (auto leaf = grid->tree().cbeginLeaf(); leaf; ++leaf) leaves.push_back(leaf->origin());
    // Active voxels: leaf by leaf in the file's order, and at random over all.
    std::vector<Coord> all;
    for (auto leaf = grid->tree().cbeginLeaf(); leaf; ++leaf)
      for (auto it = leaf->cbeginValueOn(); it; ++it) all.push_back(it.getCoord());
    std::mt19937 generator(11);
    for (std::size_t n = 0; n < kPositions; ++n) {
      ordered.push_back(all[n % all.size()]);
      shuffled.push_back(all[generator() % all.size()]);
    }
  }
};

void countItems(benchmark::State& state, double items) {
  state.counters["items"] = benchmark::Counter(items);
  state.SetItemsProcessed(static_cast<std::int64_t>(static_cast<double>(state.iterations()) * items));
}

// --- Topology: items are leaves of 8 x 8 x 8 voxels ---

using Order = std::vector<Coord>;

Order shuffledCopy(Order order) {
  std::shuffle(order.begin(), order.end(), std::mt19937(5));
  return order;
}

void touchLeaves(benchmark::State& state, Order const& leaves) {
  for (auto _ : state) {
    auto tree = std::make_unique<openvdb::FloatTree>(0.0f);
    {
      openvdb::tree::ValueAccessor<openvdb::FloatTree> accessor(*tree);
      for (Coord const& c : leaves) benchmark::DoNotOptimize(accessor.touchLeaf(c));
    }
    state.PauseTiming();
    tree.reset();
    state.ResumeTiming();
  }
  countItems(state, static_cast<double>(leaves.size()));
}

// The eight tiles of each leaf below roots 4096 voxels wide.
constexpr int kRootDepth = 18;

template <class F> void forQuarters(Coord const& leaf, F const& f) {
  for (int n = 0; n < 8; ++n)
    f(int3{leaf.x() + 4 * (n & 1), leaf.y() + 4 * (n >> 1 & 1), leaf.z() + 4 * (n >> 2)});
}

void addTiles(benchmark::State& state, Order const& leaves) {
  for (auto _ : state) {
    auto tree = std::make_unique<Tree>("", 1.0f);
    auto accessor = tree->tileAccessor();
    for (Coord const& c : leaves) {
      accessor.addTile(c.x(), c.y(), c.z(), kRootDepth);
      forQuarters(c,
                  [&](int3 const& p) { benchmark::DoNotOptimize(&accessor.addTile(p, Shape::kMaxDepth)); });
    }
    state.PauseTiming();
    tree.reset();
    state.ResumeTiming();
  }
  countItems(state, static_cast<double>(leaves.size()));
}

/// @param background Of a channel on them.
void addTilesInBulk(benchmark::State& state, Order const& leaves, std::optional<float> background = {}) {
  Tree::TileLists corners;
  std::map<std::array<int, 3>, int3> roots;
  for (Coord const& c : leaves) {
    int3 const root{Shape::align(c.x(), kRootDepth), Shape::align(c.y(), kRootDepth),
                    Shape::align(c.z(), kRootDepth)};
    roots[{root.x, root.y, root.z}] = root;
    forQuarters(c, [&](int3 const& p) { corners[Shape::kMaxDepth].append(p); });
  }
  for (auto const& entry : roots) corners[kRootDepth].append(entry.second);
  for (auto _ : state) {
    auto tree = std::make_unique<Tree>("", 1.0f);
    std::unique_ptr<Topology> topology;
    std::unique_ptr<Values> values;
    tree->tileAccessor().addTiles(corners);
    if (background) {
      topology = std::make_unique<Topology>("", kVoxelOffsetCorner);
      topology->update(*tree);
      values = std::make_unique<Values>("", &*background, kInitializeDefaultValue, true, true,
                                        Shape::kMaxDepth, Shape::kMaxDepth);
      values->update(*topology);
    }
    state.PauseTiming();
    values.reset();
    topology.reset();
    tree.reset();
    state.ResumeTiming();
  }
  countItems(state, static_cast<double>(leaves.size()));
}

// --- Values: items are voxels ---

template <class Read>
void read(benchmark::State& state, std::vector<Coord> const& places, Read const& value) {
  for (auto _ : state) {
    // The bits: adding floats would cost more than reading them.
    std::uint32_t sum = 0;
    for (Coord const& c : places) sum += std::bit_cast<std::uint32_t>(value(c));
    benchmark::DoNotOptimize(sum);
  }
  countItems(state, static_cast<double>(places.size()));
}

void readOurs(benchmark::State& state, Tree const& tree, Values const& values,
              std::vector<Coord> const& places) {
  auto const accessor = tree.tileAccessor();
  read(state, places, [&](Coord const& c) {
    TreeIndex const at = accessor.treeIndex(c.x(), c.y(), c.z(), Shape::kMaxDepth, false);
    return values.tileData(at)(c.x() & 3, c.y() & 3, c.z() & 3);
  });
}

void readReader(benchmark::State& state, ChannelReader<Values> const& reader,
                std::vector<Coord> const& places) {
  ChannelReader<Values> const values = reader;
  read(state, places, [&](Coord const& c) { return values.value(c.x(), c.y(), c.z()); });
}

/// The same, but each value goes into an array: what a read of many positions at once does.
template <class Read>
void store(benchmark::State& state, std::vector<Coord> const& places, Read const& value) {
  std::vector<float> values(places.size());
  for (auto _ : state) {
    float* to = values.data();
    for (Coord const& c : places) *to++ = value(c);
    benchmark::DoNotOptimize(values.data());
    benchmark::ClobberMemory();
  }
  countItems(state, static_cast<double>(places.size()));
}

void readMany(benchmark::State& state, ChannelReader<Values> const& reader,
              std::vector<Coord> const& places) {
  std::vector<int3> positions;
  for (Coord const& c : places) positions.push_back({c.x(), c.y(), c.z()});
  std::vector<float> values(positions.size());
  for (auto _ : state) {
    reader.read(positions, values);
    benchmark::DoNotOptimize(values.data());
    benchmark::ClobberMemory();
  }
  countItems(state, static_cast<double>(places.size()));
}

void readOpenVdb(benchmark::State& state, FloatGrid const& grid, std::vector<Coord> const& places) {
  auto const accessor = grid.getConstAccessor();
  read(state, places, [&](Coord const& c) { return accessor.getValue(c); });
}

void readNano(benchmark::State& state, nanovdb::NanoGrid<float> const& grid,
              std::vector<Coord> const& places) {
  auto const accessor = grid.getAccessor();
  read(state, places, [&](Coord const& c) { return accessor.getValue(nanovdb::Coord(c.x(), c.y(), c.z())); });
}

void storeOpenVdb(benchmark::State& state, FloatGrid const& grid, std::vector<Coord> const& places) {
  auto const accessor = grid.getConstAccessor();
  store(state, places, [&](Coord const& c) { return accessor.getValue(c); });
}

void storeNano(benchmark::State& state, nanovdb::NanoGrid<float> const& grid,
               std::vector<Coord> const& places) {
  auto const accessor = grid.getAccessor();
  store(state, places,
        [&](Coord const& c) { return accessor.getValue(nanovdb::Coord(c.x(), c.y(), c.z())); });
}

// --- Sums over all active voxels ---

void sumOpenVdb(benchmark::State& state, FloatGrid const& grid, double voxels) {
  using Manager = openvdb::tree::LeafManager<openvdb::FloatTree const>;
  Manager const leaves(grid.tree());
  for (auto _ : state) {
    struct Sum {
      double sum = 0;
      Sum() = default;
      Sum(Sum const&, tbb::split) {}
      void operator()(Manager::LeafRange const& range) {
        for (auto leaf = range.begin(); leaf; ++leaf)
          for (auto it = leaf->cbeginValueOn(); it; ++it) sum += static_cast<double>(*it);
      }
      void join(Sum const& other) { sum += other.sum; }
    } sum;
    tbb::parallel_reduce(leaves.leafRange(), sum);
    benchmark::DoNotOptimize(sum.sum);
  }
  countItems(state, voxels);
}

/// Sums what the importer's rule for level sets calls active: values within the band.
class SumVisitor : public Visitor<Tree> {
public:
  SumVisitor(Values const& values, float background)
      : m_values(values)
      , m_background(background) {
    setEndTileOverridden(false);
  }
  using Visitor::beginTile;
  void beginTile(TileType const& tile) override {
    if (!tile.atMaxDepth()) return;
    // First what counts, then the sums: both in lanes. Four sums, so that none waits for the one before.
    float counted[Values::kSize];
    float const* const values = m_values.tileData(tile.treeIndex()).data()->data();
    float const background = m_background;
    if (background > 0)
      for (int n = 0; n < Values::kSize; ++n)
        counted[n] = std::abs(values[n]) < background ? values[n] : 0.0f;
    else
      for (int n = 0; n < Values::kSize; ++n) counted[n] = values[n] != background ? values[n] : 0.0f;
    double sums[4] = {};
    for (int n = 0; n < Values::kSize; n += 4)
      for (int lane = 0; lane < 4; ++lane) sums[lane] += static_cast<double>(counted[n + lane]);
    m_sum += (sums[0] + sums[1]) + (sums[2] + sums[3]);
  }
  void join(Visitor const& other) override { m_sum += static_cast<SumVisitor const&>(other).m_sum; }
  Visitor* clone() const override { return new SumVisitor(m_values, m_background); }
  double sum() const { return m_sum; }

private:
  Values const& m_values;
  float m_background;
  double m_sum = 0;
};

void sumOurs(benchmark::State& state, Subject const& s) {
  for (auto _ : state) {
    SumVisitor visitor(*s.values, s.values->defaultValue());
    TraversalRange range;
    range.minDepth = Shape::kMaxDepth;
    range.grain = 1024;
    range.voxelEnd = 0;
    static_cast<Tree const&>(*s.tree).reduce(visitor, kParallelFlat, range);
    benchmark::DoNotOptimize(visitor.sum());
  }
  countItems(state, s.activeVoxels);
}

// --- Import ---

void import(benchmark::State& state, Subject const& s) {
  for (auto _ : state) benchmark::DoNotOptimize(Bench::importGrid(s.grid).volumes.size());
  countItems(state, s.activeVoxels);
}
void deepCopy(benchmark::State& state, Subject const& s) {
  for (auto _ : state) benchmark::DoNotOptimize(s.grid->deepCopy().get());
  countItems(state, s.activeVoxels);
}

/// A file of the grid, in a folder that goes with the process.
class GridFile {
public:
  explicit GridFile(Subject const& s) {
    std::string name = (std::filesystem::temp_directory_path() / "vln_bench_XXXXXX").string();
    if (!mkdtemp(name.data())) throw std::runtime_error("no folder for the file");
    m_folder = name;
    openvdb::io::File(path()).write(openvdb::GridPtrVec{s.grid});
  }
  ~GridFile() {
    std::error_code ignored;
    std::filesystem::remove_all(m_folder, ignored);
  }
  std::string path() const { return (m_folder / "grid.vdb").string(); }

private:
  std::filesystem::path m_folder;
};

void getGrids(benchmark::State& state, Subject const& s) {
  GridFile const file(s);
  for (auto _ : state) {
    openvdb::io::File in(file.path());
    in.open(false); // all values, now
    benchmark::DoNotOptimize(in.getGrids()->size());
  }
  countItems(state, s.activeVoxels);
}
void importFile(benchmark::State& state, Subject const& s) {
  GridFile const file(s);
  for (auto _ : state) benchmark::DoNotOptimize(Interop::importVdb(file.path()).volumes.size());
  countItems(state, s.activeVoxels);
}

// --- Memory: a figure, not a time ---

void bytes(benchmark::State& state, double amount, double voxels) {
  for (auto _ : state) benchmark::DoNotOptimize(amount);
  state.counters["bytes/voxel"] = amount / voxels;
}

double bytesOf(Interop::VdbImport const& content) {
  auto const& object = *content.volumes.at(0).object;
  double sum = 0;
  for (auto const& name : object.componentRange()) {
    std::uint64_t used = 0, allocated = 0;
    object.component(name)->memUse(used, allocated, true);
    sum += static_cast<double>(allocated);
  }
  return sum;
}

void add(Subject const& s, char const* what, std::function<void(benchmark::State&)> body, int threads = 0) {
  std::string name = s.name + "/" + what;
  if (threads > 0) name += "/threads:" + std::to_string(threads);
  auto const run = [body = std::move(body), threads](benchmark::State& state) {
    if (threads > 0)
      withThreads(threads, [&] { body(state); });
    else
      body(state);
  };
  benchmark::RegisterBenchmark(name.c_str(), run)->Unit(benchmark::kMillisecond)->UseRealTime();
}

void addAll(Subject const& s) {
  add(s, "topology/ordered/OpenVDB touchLeaf", [&](auto& st) { touchLeaves(st, s.leaves); });
  add(s, "topology/ordered/addTile", [&](auto& st) { addTiles(st, s.leaves); });
  add(s, "topology/shuffled/OpenVDB touchLeaf", [&](auto& st) { touchLeaves(st, shuffledCopy(s.leaves)); });
  add(s, "topology/shuffled/addTile", [&](auto& st) { addTiles(st, shuffledCopy(s.leaves)); });
  for (int threads : {1, 2}) {
    add(
        s, "topology/ordered/bulk", [&](auto& st) { addTilesInBulk(st, s.leaves); }, threads);
    add(
        s, "topology/ordered/bulk with values", [&](auto& st) { addTilesInBulk(st, s.leaves, 3.0f); },
        threads);
    add(
        s, "topology/ordered/bulk with zeros", [&](auto& st) { addTilesInBulk(st, s.leaves, 0.0f); },
        threads);
    add(
        s, "topology/shuffled/bulk", [&](auto& st) { addTilesInBulk(st, shuffledCopy(s.leaves)); }, threads);
  }
  for (bool const random : {false, true}) {
    auto const& places = random ? s.shuffled : s.ordered;
    std::string const order = random ? "read/random/" : "read/coherent/";
    add(s, (order + "OpenVDB").c_str(), [&](auto& st) { readOpenVdb(st, *s.grid, places); });
    add(s, (order + "NanoVDB").c_str(), [&](auto& st) { readNano(st, *s.nano.grid<float>(), places); });
    add(s, (order + "OpenVDB, stored").c_str(), [&](auto& st) { storeOpenVdb(st, *s.grid, places); });
    add(s, (order + "NanoVDB, stored").c_str(),
        [&](auto& st) { storeNano(st, *s.nano.grid<float>(), places); });
    add(s, (order + "ChannelReader").c_str(), [&](auto& st) { readReader(st, *s.reader, places); });
    add(s, (order + "ChannelReader, many at once").c_str(),
        [&](auto& st) { readMany(st, *s.reader, places); });
    add(s, (order + "accessor").c_str(), [&](auto& st) { readOurs(st, *s.tree, *s.values, places); });
  }
  for (int threads : {1, 2}) {
    add(
        s, "sum/OpenVDB", [&](auto& st) { sumOpenVdb(st, *s.grid, s.activeVoxels); }, threads);
    add(
        s, "sum/traversal", [&](auto& st) { sumOurs(st, s); }, threads);
    add(
        s, "import/OpenVDB deepCopy", [&](auto& st) { deepCopy(st, s); }, threads);
    add(
        s, "import/import", [&](auto& st) { import(st, s); }, threads);
    add(
        s, "file/OpenVDB getGrids", [&](auto& st) { getGrids(st, s); }, threads);
    add(
        s, "file/importVdb", [&](auto& st) { importFile(st, s); }, threads);
  }
  add(s, "import/ChannelReader", [&](auto& st) {
    for (auto _ : st) benchmark::DoNotOptimize(ChannelReader<Values>(*s.tree, *s.values).memUsage());
    countItems(st, s.activeVoxels);
  });
  add(s, "memory/OpenVDB",
      [&](auto& st) { bytes(st, static_cast<double>(s.grid->memUsage()), s.activeVoxels); });
  add(s, "memory/volume", [&](auto& st) { bytes(st, bytesOf(s.content), s.activeVoxels); });
}

} // namespace

int main(int argc, char** argv) {
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  // Kept to the end: benchmarks refer to them.
  static std::vector<std::unique_ptr<Subject>> subjects;
  for (Bench::BenchGrid const& g : Bench::benchGrids())
    subjects.push_back(std::make_unique<Subject>(g.name, g.grid));
  for (auto const& subject : subjects) addAll(*subject);
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  return 0;
}
