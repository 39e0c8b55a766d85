// What the pool says when its log is on.
#include "ChannelPoolFixture.h"
#include "PoolScript.h"

#include <algorithm>
#include <map>
#include <regex>
#include <sstream>

namespace {

using namespace test;
using Lines = std::vector<std::string>;

std::string text(void const* p) {
  std::ostringstream os;
  os << p;
  return os.str();
}

class ChannelPoolLog : public ChannelPoolTest {
protected:
  ChannelPoolLog() {
    script.group.setFree(10 * kMB);
    ArrayPool::disable();
    ChannelPool::enableLog();
  }
  /// The lines so far, without the time that reading the figures took, and without the allocator's own text.
  Lines lines() {
    Lines result;
    bool stats = false;
    for (auto const& line : script.out.take()) {
      if (stats && (line.starts_with("ChannelPool:") || line.starts_with("ArrayPool:"))) stats = false;
      if (!stats)
        result.push_back(
            std::regex_replace(line, std::regex("stats took [0-9.e+-]+ seconds$"), "stats took T seconds"));
      if (line.starts_with("ChannelPool: jemalloc stats ")) stats = true;
    }
    return result;
  }
  static Lines dumpOf(std::string const& pool, Lines const& entries, std::string const& total) {
    bool const channels = pool == "ChannelPool";
    Lines result{
        pool + ":Total physical memory = 64MB, available physical memory = 10MB. Retrieving stats took T "
               "seconds",
        pool + ":========================",
        pool + (channels ? ":Content of channel pool:" : ":Content of array pool:"),
        pool + (channels ? ":Total allocated memory:" : ":Total allocated memory : ") + total + "MB",
        pool + ":========================"};
    result.insert(result.end(), entries.begin(), entries.end());
    result.push_back(pool + ":========================");
    return result;
  }
  template <class... L> static Lines join(L const&... parts) {
    Lines all;
    (all.insert(all.end(), parts.begin(), parts.end()), ...);
    return all;
  }
  static std::string megabytes(std::uint64_t bytes) {
    std::ostringstream os;
    os << VLN::TileTree3D::PoolUtils::toMB(bytes);
    return os.str();
  }
  PoolScript script;
};

TEST_F(ChannelPoolLog, RequirementANewChannel) {
  auto const channel =
      ChannelPool::allocate<PowerOfTwoTraits, float, 5, 0>(0.0f, false, true, 2, 20, 77, nullptr);
  std::string const entry = "ChannelPool:Channel<float, 5, 0>(2, 20, #0, 0MB, use_count = 2)";
  std::string const total = megabytes(ChannelPool::allocatedMemory());
  EXPECT_EQ(lines(),
            join(Lines{"ChannelPool: allocate.begin",
                       "ChannelPool:allocate<Traits<2,4,0,1>, float, 5, 0>(in_defaultValue, 0, 1, 2, 20, 77)",
                       "ChannelPool: MyTileDataTraits::kE = 1", "ChannelPool: MyTileDataTraits::kH = 0",
                       "ChannelPool: TDW - Traits::kTileDataWidth = 1", "ChannelPool: H = 0",
                       "ChannelPool: traitsIndex = 0", "ChannelPool: TileDataTraitsIndex = 1",
                       "ChannelPool: typeIndex = 0", "ChannelPool: Warning - memStats NOT OK",
                       "ChannelPool: Creating channel " + text(channel.get()),
                       "ChannelPool: Inserting into pool = 1", "ChannelPool: Stats after allocation.begin"},
                 dumpOf("ChannelPool", {entry}, total),
                 Lines{"ChannelPool: Stats after allocation.end", "ChannelPool: allocate.end"}));
}

TEST_F(ChannelPoolLog, RequirementIndices) {
  auto const indices = [&](auto const& channel) {
    EXPECT_TRUE(channel);
    Lines const all = lines();
    return all[6].substr(13) + all[7].substr(13) + all[8].substr(13);
  };
  EXPECT_EQ(indices(ChannelPool::allocate<PowerOfTwoTraits, float, 4, 0>(0, false, true, 0, 28, 1, nullptr)),
            "traitsIndex = 0TileDataTraitsIndex = 0typeIndex = 0");
  EXPECT_EQ(indices(ChannelPool::allocate<OddTraits, int, 5, 0>(0, false, true, 0, 12, 1, nullptr)),
            "traitsIndex = 1TileDataTraitsIndex = 0typeIndex = 11");
  EXPECT_EQ(indices(ChannelPool::allocate<OddTraits, unsigned char, 6, 0>(0, false, true, 0, 12, 1, nullptr)),
            "traitsIndex = 1TileDataTraitsIndex = 1typeIndex = 14");
  EXPECT_EQ(indices(ChannelPool::allocate<OddTraits, Velorn::Math::double3, 5, 1>({}, false, true, 0, 12, 1,
                                                                                  nullptr)),
            "traitsIndex = 1TileDataTraitsIndex = 2typeIndex = 8");
  EXPECT_EQ(
      indices(ChannelPool::allocate<PowerOfTwoTraits, std::int64_t, 4, 1>(0, false, true, 0, 28, 1, nullptr)),
      "traitsIndex = 0TileDataTraitsIndex = 2typeIndex = 13");
}

TEST_F(ChannelPoolLog, RequirementReuse) {
  auto const used = density(8);
  auto channel = density(8);
  std::string const address = text(channel.get());
  channel.reset();
  ChannelPool::enableRequiredFreeSize();
  ChannelPool::setRequiredFreeSize(1000);
  lines();
  Tiles const tiles(8);
  channel = ChannelPool::allocate<PowerOfTwoTraits, float, 4, 1>(0.0f, false, false, 3, 27, 19, &tiles);
  Lines all = lines();
  ASSERT_GT(all.size(), 19u);
  EXPECT_EQ(
      Lines(all.begin() + 9, all.begin() + 19),
      (Lines{"ChannelPool:Cannot re-use channel because use_count = 2, ptr->depth() = 28, in_maxDepth = 27, "
             "ptr->minDepth() = 0, in_minDepth = 3",
             "ChannelPool: estimatedExtraMemUsage = 8640, data.m_requiredFreeSize = 1000",
             "ChannelPool: physical free = 10485760", "ChannelPool: Re-using channel " + address,
             "ChannelPool: Call-element constructor 0 1", "ChannelPool: MinDepth 3 0",
             "ChannelPool: Depth 27 28", "ChannelPool: Re-using channel " + address,
             "ChannelPool: Inserting into pool = 1", "ChannelPool: Stats after allocation.begin"}));
  EXPECT_EQ(all.back(), "ChannelPool: allocate.end");
}

TEST_F(ChannelPoolLog, RequirementMakingRoom) {
  ChannelPool::enableRequiredFreeSize();
  ChannelPool::setRequiredFreeSize(10 * kMB);
  lines();
  auto const channel = density(10);
  Lines const all = lines();
  EXPECT_EQ(all[9], "ChannelPool: estimatedExtraMemUsage = 8640, data.m_requiredFreeSize = 10485760");
  EXPECT_EQ(all[10], "ChannelPool: physical free = 10485760");
  EXPECT_EQ(all[11], "ChannelPool: attempting to free temporary buffers..");
  EXPECT_EQ(all[12], "ChannelPool: freeMemory.begin");
}

TEST_F(ChannelPoolLog, RequirementDumpsComeInPairsOnceBothPoolsAreOn) {
  ArrayPool::enable();
  auto channel = ChannelPool::allocate<PowerOfTwoTraits, float, 5, 0>(0.0f, false, true, 2, 20, 77, nullptr);
  std::string const total = megabytes(ChannelPool::allocatedMemory());
  Lines all = lines();
  auto const from = std::find(all.begin(), all.end(), "ChannelPool: Stats after allocation.begin");
  ASSERT_NE(from, all.end());
  std::string const entry = "ChannelPool:Channel<float, 5, 0>(2, 20, #0, 0MB, use_count = 2)";
  EXPECT_EQ(Lines(from + 1, all.end() - 2),
            join(dumpOf("ChannelPool", {entry}, total), dumpOf("ArrayPool", {}, "0")));
  ChannelPool::enableRequiredFreeSize();
  EXPECT_EQ(
      lines(),
      join(Lines{"ChannelPool:enableRequiredFreeSize", "ChannelPool: freeRequiredMemory.begin",
                 "freeRequiredMemory of 0MB begin",
                 "ChannelPool:Not necessary to free required memory: free physical memory = 10MB, required "
                 "= 0MB",
                 "freeRequiredMemory of 0MB end"},
           dumpOf("ChannelPool", {entry}, total), dumpOf("ArrayPool", {}, "0"),
           Lines{"ChannelPool: freeRequiredMemory.end"}));
  ChannelPool::setRequiredFreeSize(2 * kMB);
  EXPECT_EQ(lines().front(), "ChannelPool:setRequiredFreeSize of 2MB");
  ChannelPool::addRequiredFreeSize(2 * kMB);
  EXPECT_EQ(lines().front(), "ChannelPool:addRequiredFreeSize of 2MB");
  ChannelPool::subtractRequiredFreeSize(kMB);
  EXPECT_EQ(lines().front(), "ChannelPool:addRequiredFreeSize of 1MB");
  ChannelPool::disableRequiredFreeSize();
  EXPECT_EQ(lines().front(), "ChannelPool:disableRequiredFreeSize");
}

TEST_F(ChannelPoolLog, RequirementAnEntryTellsItsElements) {
  auto const channel = density(8);
  lines();
  ChannelPool::dump();
  Lines const all = lines();
  ASSERT_EQ(all.size(), 7u);
  // 9 tiles of 216 elements; their number is told in megabytes, too.
  EXPECT_EQ(all[5], "ChannelPool:Channel<float, 4, 1>(0, 28, #1944, 0.00185394MB, use_count = 2)");
}

/// Looks into the pool whenever it is asked for the elements of a tile, which happens in the midst of an
/// update.
class Curious final : public VLN::TileTree3D::Component {
public:
  explicit Curious(std::int64_t tiles)
      : m_tiles(tiles) {}
  std::uint64_t size() const override { return static_cast<std::uint64_t>(elementCount(-1)); }
  void update(VLN::Component const&) override {}
  std::int64_t elementCount(int depth) const override { return tileCount(depth) * 64; }
  int elementCount(VLN::TileTree3D::TreeIndex const&) const override {
    ChannelPool::dump();
    return 64;
  }
  std::int64_t tileCount(int depth) const override { return depth == -1 || depth == 28 ? m_tiles : 0; }

private:
  std::int64_t m_tiles;
};

TEST_F(ChannelPoolLog, RegressionAChannelThatIsBeingChangedIsListedAsLastSeen) {
  auto const channel =
      ChannelPool::allocate<PowerOfTwoTraits, float, 4, 0>(0.0f, false, true, 0, 28, 4, nullptr);
  channel->update(Tiles(7));
  lines();
  ChannelPool::dump();
  std::string const entry = "ChannelPool:Channel<float, 4, 0>(0, 28, #";
  auto const listed = [&] {
    std::map<std::string, int> found;
    for (auto const& line : lines())
      if (line.starts_with(entry))
        ++found[line.substr(entry.size(), line.find(',', entry.size()) - entry.size())];
    return found;
  };
  EXPECT_EQ(listed(), (std::map<std::string, int>{{"448", 1}}));
  channel->update(Curious(27));
  EXPECT_EQ(listed(), (std::map<std::string, int>{{"448", 20}}));
  ChannelPool::dump();
  EXPECT_EQ(listed(), (std::map<std::string, int>{{"1728", 1}}));
  auto accessor = channel->tileDataAccessor();
  accessor.tileData(VLN::TileTree3D::TreeIndex{0, 28}).push(1.0f);
  ChannelPool::dump();
  EXPECT_EQ(listed(), (std::map<std::string, int>{{"1728", 1}}));
}

TEST_F(ChannelPoolLog, RequirementFreeingWithFlush) {
  idle({8, 8});
  std::uint64_t const held = ChannelPool::allocatedMemory();
  lines();
  script.free("ChannelPool: removing ", 9)
      .free("ChannelPool: jemalloc stats after flushing:", 10.5)
      .free("ChannelPool: jemalloc stats after flushing:", 12);
  ChannelPool::freeMemory(8 * 864);
  std::string const each = megabytes(held / 2), required = megabytes(10 * kMB + 8 * 864);
  Lines const all = lines();
  auto const amounts = [&](std::uint64_t allocated, std::string const& available,
                           std::string const& physical) {
    return Lines{"ChannelPool: Allocated = " + megabytes(allocated) + "MB",
                 "ChannelPool: Available physical and pool (minus required) = " + available + "MB",
                 "ChannelPool: Available physical = " + physical + "MB"};
  };
  EXPECT_EQ(
      all,
      join(
          Lines{"ChannelPool: freeMemory.begin", "ChannelPool:freeMemory of " + megabytes(8 * 864) + "MB"},
          amounts(held, megabytes(10 * kMB + held), "10"),
          Lines{"ChannelPool: Physical memory free before = 10MB",
                "ChannelPool:Attempting freeing of memory, try #1",
                "ChannelPool: potentialRemoveMap.size() = 2",
                "ChannelPool: removing 1 channels of total size " + each + "MB",
                "ChannelPool: Flushing jemalloc because not enough physical memory was available",
                " Physical free = 9MB", " Physical required = " + required + "MB",
                "ChannelPool: jemalloc stats before flushing:", "ChannelPool: jemalloc stats after flushing:",
                "ChannelPool: Enough physical memory is now available: ", " Physical free = 10.5MB",
                " Required free = " + required + "MB",
                "ChannelPool:OK: Enough physical memory now available (", " Physical free = 10.5MB",
                " Required free = " + required + "MB"},
          amounts(held / 2, megabytes(10 * kMB + kMB / 2 + held / 2), "10.5"),
          Lines{"ChannelPool: Available physical before = 10MB",
                "ChannelPool: Requested total free amount = " + megabytes(8 * 864) + "MB",
                "ChannelPool: Satisfied free amount = 0.5MB", "ChannelPool: freeMemory.end"}));
}

TEST_F(ChannelPoolLog, RequirementOthers) {
  ChannelPool::freeMemoryNotUsedSinceCount(0);
  EXPECT_EQ(lines(), (Lines{"ChannelPool: freeMemoryNotUsedSinceCount.begin",
                            "ChannelPool: freeMemoryNotUsedSinceCount.end"}));
  ChannelPool::freeAllMemory();
  EXPECT_EQ(lines(), (Lines{"ChannelPool: freeAllMemory.begin", "ChannelPool: freeAllMemory.end"}));
  ChannelPool::disableLog();
  auto const channel = density(8);
  ChannelPool::freeMemory(1);
  EXPECT_EQ(lines(), Lines{}) << "nothing is said while the log is off";
}

} // namespace
