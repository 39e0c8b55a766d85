// What channels report: memory, messages, accounting.
#include "FakeTree.h"
#include "GeometryVolume/core/LoggerHooks.h"
#include "ProbeChannel.h"

#include <gtest/gtest.h>
#include <map>

namespace {

using namespace VLN;
using namespace VLN::TileTree3D;
using namespace VLN::Test;

using C = ProbeChannel<PowerOfTwoTraits, float, 4, 1>;

TEST(ChannelMemUse, RequirementCountsVectorsByDepthAndElements) {
  C channel;
  FakeTree tree;
  tree.set(0, 1).set(28, 5);
  channel.update(tree);
  std::uint64_t used = 0, allocated = 0;
  channel.getData()->memUse(used, allocated);
  std::uint64_t const records = sizeof(ChannelData<float>) + 29 * sizeof(std::vector<int>);
  EXPECT_EQ(used, records + 6 * 216 * sizeof(float));
  EXPECT_EQ(allocated, used);
}

TEST(ChannelMemUse, RequirementWarnsOfSharedStorageAndUncountedBlocks) {
  C channel(Flags{true});
  channel.update(FakeTree().set(1, 2));
  C const copy(channel);
  std::uint64_t used = 0, allocated = 0;
  testing::internal::CaptureStderr();
  channel.getData()->memUse(used, allocated);
  EXPECT_EQ(testing::internal::GetCapturedStderr(),
            "Channel::Data.memUse(): Warning: 'm_data' not unique (use count = 2)\n"
            "Channel::Data.memUse(): Warning: not counting size of 'allocations'\n");
  testing::internal::CaptureStderr();
  C().getData()->memUse(used, allocated);
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
}

/// A logger that remembers who holds which block.
class Accounting : public ::testing::Test {
protected:
  Accounting() {
    s_held.clear();
    s_dump = false;
    VLN::Internal::g_loggerHooks.storeRelease(&kHooks);
  }
  ~Accounting() override { VLN::Internal::g_loggerHooks.storeRelease(nullptr); }

  static inline std::map<Base const*, void const*> s_held;
  static inline int s_reallocated = 0;
  static inline bool s_dump = false;
  static constexpr LoggerHooks kHooks{
      [](Base const*) {},
      [](Base const*) {},
      [](void const* block, Base const* owner) {
        EXPECT_EQ(s_held.count(owner), 0u);
        s_held[owner] = block;
      },
      [](void const* block, Base const* owner) {
        EXPECT_EQ(s_held[owner], block);
        s_held.erase(owner);
      },
      [](void const* from, void const* to) {
        ++s_reallocated;
        for (auto& [owner, block] : s_held)
          if (block == from) block = to;
      },
      [] { return s_dump; },
  };
};

TEST_F(Accounting, RequirementStorageIsAttributedToItsChannels) {
  {
    C a;
    EXPECT_EQ(s_held[&a], a.dataPtr());
    a.update(FakeTree().set(2, 3));
    C b(a);
    EXPECT_EQ(s_held[&b], a.dataPtr());
    b.cloneData();
    EXPECT_EQ(s_held[&b], b.dataPtr());
    EXPECT_NE(s_held[&b], s_held[&a]);
    C c;
    c = a;
    EXPECT_EQ(s_held[&c], a.dataPtr());
    c.update(FakeTree().set(2, 5));
    EXPECT_EQ(s_held[&c], c.dataPtr());
    EXPECT_NE(s_held[&c], s_held[&a]);
    TilePermutation p(kChannelDepths);
    p[2] = {2, 0, 1};
    int const before = s_reallocated;
    a.permute(&p);
    EXPECT_EQ(s_reallocated, before + 1);
    EXPECT_EQ(s_held[&a], a.dataPtr());
  }
  EXPECT_TRUE(s_held.empty());
}

TEST_F(Accounting, RequirementDeepCopyIsAnnounced) {
  C const a;
  Ostil::Ptr<VLN::Component> copy;
  testing::internal::CaptureStdout();
  a.copyTo(copy);
  auto const text = testing::internal::GetCapturedStdout();
  EXPECT_EQ(text.rfind("ERROR: Copying probe from ptr 0x", 0), 0u) << text;
  EXPECT_NE(text.find(" to ptr 0x"), std::string::npos);
  EXPECT_EQ(text.back(), '\n');
}

TEST_F(Accounting, RequirementDumpTellsOfSharedData) {
  C a, b;
  b = a;
  std::uint64_t used = 0, allocated = 0;
  testing::internal::CaptureStdout();
  a.memUse(used, allocated, false);
  EXPECT_EQ(testing::internal::GetCapturedStdout(), "");
  s_dump = true;
  testing::internal::CaptureStdout();
  a.memUse(used, allocated, false);
  auto const text = testing::internal::GetCapturedStdout();
  EXPECT_EQ(text.rfind(" Data shared by 2 channels, raw data ptr = 0x", 0), 0u) << text;
  EXPECT_NE(text.find("\n Total shared data = "), std::string::npos);
  EXPECT_NE(text.find("MB (total shared data allocated = "), std::string::npos);
  EXPECT_EQ(text.substr(text.size() - 3), "MB)");
}

TEST_F(Accounting, BoundaryCopyIntoAnEmptyTargetWithoutLoggingIsSilent) {
  VLN::Internal::g_loggerHooks.storeRelease(nullptr);
  C const a;
  Ostil::Ptr<VLN::Component> copy;
  testing::internal::CaptureStdout();
  a.copyTo(copy);
  EXPECT_EQ(testing::internal::GetCapturedStdout(), "");
}

} // namespace
