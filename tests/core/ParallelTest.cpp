// Parallel loops: coverage, order of joins, cancellation, exceptions.
#include "GeometryVolume/core/Parallel.h"
#include "Ostil/Job.h"
#include "Velorn/ExceptionMessage.h"
#include "support/Threads.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cmath>
#include <cstring>
#include <numeric>
#include <random>
#include <stdexcept>
#include <string>
#include <thread>
#include <tuple>
#include <vector>

using namespace VLN;

namespace {

/// Cancels the job while it lives.
struct Cancelled {
  Cancelled() { Ostil::setJobCancelled(true); }
  ~Cancelled() { Ostil::setJobCancelled(false); }
};

} // namespace

// requirement
TEST(Parallel, EachItemIsHandledOnce) {
  for (int threads : {1, 2, 8}) {
    for (std::int64_t n : {0, 1, 2, 63, 1000}) {
      for (std::int64_t grain : {0, 1, 7, 5000}) {
        std::vector<std::atomic<int>> hits(static_cast<std::size_t>(n));
        AffinityPartitioner affinity;
        withThreads(threads, [&] {
          ParallelOptions options;
          options.grain = grain;
          options.affinity = grain == 7 ? &affinity : nullptr;
          parallelFor(
              10, 10 + n,
              [&](std::int64_t b, std::int64_t e) {
                EXPECT_LT(b, e);
                for (std::int64_t i = b; i < e; ++i) ++hits[static_cast<std::size_t>(i - 10)];
              },
              options);
        });
        for (auto const& hit : hits) ASSERT_EQ(hit, 1) << threads << ' ' << n << ' ' << grain;
      }
    }
  }
  int calls = 0;
  parallelFor(5, 5, [&](std::int64_t, std::int64_t) { ++calls; });
  parallelFor(5, 4, [&](std::int64_t, std::int64_t) { ++calls; });
  EXPECT_EQ(calls, 0);
}

// requirement
TEST(Parallel, ChunksAreConsecutive) {
  std::vector<std::pair<std::int64_t, std::int64_t>> chunks(4);
  parallelChunks(3, 13, 3, [&](std::int64_t c, std::int64_t b, std::int64_t e) {
    chunks[static_cast<std::size_t>(c)] = {b, e};
  });
  using Chunks = decltype(chunks);
  EXPECT_EQ(chunks, (Chunks{{3, 6}, {6, 9}, {9, 12}, {12, 13}}));
  EXPECT_EQ(chunkCount(3, 13, 3), 4);
  EXPECT_EQ(chunkCount(3, 3, 3), 0);
}

// requirement: floating-point sums come out the same bytes with any number of threads
TEST(Parallel, ReductionDoesNotDependOnThreads) {
  std::vector<double> values(20000);
  std::mt19937 random(5);
  for (auto& v : values) v = std::ldexp(static_cast<double>(random()), static_cast<int>(random() % 60) - 30);
  auto const sum = [&](int threads) {
    double result = 0;
    withThreads(threads, [&] {
      result = parallelReduce(
          0, static_cast<std::int64_t>(values.size()), 64, 0.0,
          [&](std::int64_t b, std::int64_t e) {
            return std::accumulate(&values[b], &values[e - 1] + 1, 0.0);
          },
          [](double a, double b) { return a + b; });
    });
    return result;
  };
  double const one = sum(1);
  for (int threads : {2, 8}) {
    double const many = sum(threads);
    EXPECT_EQ(std::memcmp(&one, &many, sizeof one), 0) << threads;
  }
}

// requirement: equal keys keep their order
TEST(Parallel, SortOfPositionsIsStable) {
  std::vector<int> keys(5000);
  std::mt19937 random(7);
  for (int& key : keys) key = static_cast<int>(random() % 10);
  std::vector<std::uint64_t> order(keys.size());
  std::iota(order.begin(), order.end(), 0u);
  auto expected = order;
  std::stable_sort(expected.begin(), expected.end(), [&](auto a, auto b) { return keys[a] < keys[b]; });
  parallelSortPositions(order.data(), static_cast<std::int64_t>(order.size()),
                        [&](std::uint64_t a, std::uint64_t b) { return keys[a] < keys[b]; });
  EXPECT_EQ(order, expected);
}

// requirement: by key, then by value, however many records and whichever of their bits differ
TEST(Parallel, SortOfRecordsIsByKeyThenValue) {
  std::mt19937_64 random(11);
  std::uint64_t const all = ~std::uint64_t(0);
  struct Bits {
    std::uint64_t high, low;
  };
  for (Bits const bits :
       {Bits{all, all}, Bits{0, 0xff}, Bits{0, 3}, Bits{0, 0}, Bits{all << 60, 0}, Bits{0x249249, all << 37},
        Bits{0, 0xffffffff}, Bits{0, 0x1ffffffff}, Bits{0xff00, 0xff}, Bits{all, 0x5555}}) {
    for (std::size_t const n : {0u, 1u, 2u, 499u, 500u, 501u, 32768u, 32769u, 100000u}) {
      for (bool const valuesRise : {true, false}) {
        std::vector<SortRecord> records(n);
        for (std::size_t i = 0; i < n; ++i)
          records[i] = {random() & bits.high, random() & bits.low,
                        valuesRise ? static_cast<std::int64_t>(i) - 50
                                   : static_cast<std::int64_t>(random() >> 1)};
        auto const key = [](SortRecord const& r) { return std::tuple(r.high, r.low, r.value); };
        auto expected = records;
        std::sort(expected.begin(), expected.end(),
                  [&](auto const& a, auto const& b) { return key(a) < key(b); });
        for (int const threads : {1, 2, 8}) {
          auto sorted = records;
          withThreads(threads, [&] { parallelSort(sorted.data(), static_cast<std::int64_t>(n)); });
          ASSERT_TRUE(std::equal(sorted.begin(), sorted.end(), expected.begin(), expected.end(),
                                 [&](auto const& a, auto const& b) { return key(a) == key(b); }))
              << n << " records, bits " << std::hex << bits.high << ' ' << bits.low;
        }
      }
    }
  }
}

// requirement: the same for keys of interleaved coordinates, few of whose differing bits decide
TEST(Parallel, SortOfInterleavedCoordinates) {
  std::mt19937 random(12);
  for (int const width : {2, 700, 5000, 1 << 20}) {
    for (int const step : {1, 8}) {
      for (int const middle : {0, 1000, -77777}) {
        std::vector<SortRecord> records(3000);
        for (std::size_t n = 0; n < records.size(); ++n) {
          auto& record = records[n];
          record = {0, 0, static_cast<std::int64_t>(n)};
          for (int axis = 0; axis < 3; ++axis) {
            int const at =
                middle + (static_cast<int>(random() % static_cast<unsigned>(width)) - width / 2) * step;
            auto const offset = static_cast<std::uint64_t>(at + (1 << 29));
            for (int bit = 0; bit < 32; ++bit)
              (bit < 16 ? record.low : record.high) |= (offset >> bit & 1) << (3 * (bit % 16) + axis);
          }
        }
        auto const key = [](SortRecord const& r) { return std::tuple(r.high, r.low, r.value); };
        auto const less = [&](SortRecord const& a, SortRecord const& b) { return key(a) < key(b); };
        auto expected = records;
        std::sort(expected.begin(), expected.end(), less);
        parallelSort(records.data(), static_cast<std::int64_t>(records.size()));
        ASSERT_TRUE(std::equal(records.begin(), records.end(), expected.begin(), expected.end(),
                               [&](auto const& a, auto const& b) { return key(a) == key(b); }))
            << width << " wide by " << step << " around " << middle;
      }
    }
  }
}

// requirement
TEST(Parallel, CancelledJobThrowsWhenPolledOnly) {
  Cancelled const cancelled;
  int calls = 0;
  auto const body = [&](std::int64_t, std::int64_t) { ++calls; };
  EXPECT_NO_THROW(parallelFor(0, 1, body));
  EXPECT_EQ(calls, 1);
  for (std::int64_t n : {1, 1000}) {
    try {
      parallelFor(0, n, body, {.cancellation = Cancellation::kPoll});
      ADD_FAILURE() << "a cancelled job went through";
    } catch (std::runtime_error const& e) { EXPECT_STREQ(e.what(), exceptionMessage); }
  }
  EXPECT_EQ(calls, 1);
  EXPECT_NO_THROW(parallelFor(0, 0, body, {.cancellation = Cancellation::kPoll}));
}

// requirement
TEST(Parallel, ExceptionsOfTheBodyPass) {
  for (int threads : {1, 2}) {
    withThreads(threads, [] {
      EXPECT_THROW(parallelFor(0, 1000,
                               [](std::int64_t b, std::int64_t) {
                                 if (b >= 500) throw std::out_of_range("body");
                               }),
                   std::out_of_range);
    });
  }
}

// requirement
TEST(Parallel, ThreadIndicesStayBelowTheNumberOfThreads) {
  withThreads(2, [] {
    EXPECT_EQ(parallelThreads(), 2);
    parallelFor(0, 1000, [](std::int64_t, std::int64_t) {
      EXPECT_GE(parallelThreadIndex(), 0);
      EXPECT_LT(parallelThreadIndex(), 2);
    });
  });
  EXPECT_GE(parallelThreads(), 1);
}

// regression: what is thrown beside a nested loop, or a nested sort, cuts neither short
TEST(Parallel, RegressionNestedLoopsAreWholeWhereASiblingThrows) {
  constexpr std::int64_t kCount = 200000;
  std::atomic<bool> begun{false}, thrown{false};
  std::atomic<std::int64_t> done{-1};
  bool sorted = false;
  auto const waitFor = [](std::atomic<bool> const& flag) {
    auto const until = std::chrono::steady_clock::now() + std::chrono::seconds(2);
    while (!flag && std::chrono::steady_clock::now() < until) std::this_thread::yield();
  };
  auto const outer = [&](std::int64_t begin, std::int64_t) {
    if (begin == 0) {
      waitFor(begun);
      thrown = true;
      throw std::runtime_error("beside");
    }
    begun = true;
    waitFor(thrown);
    std::this_thread::sleep_for(std::chrono::milliseconds(50)); // until the scheduler has heard of it
    std::atomic<std::int64_t> count{0};
    parallelFor(0, kCount, [&](std::int64_t b, std::int64_t e) { count += e - b; });
    std::vector<SortRecord> records(20000);
    for (std::size_t n = 0; n < records.size(); ++n)
      records[n] = {0, 7919 * n % 20011, static_cast<std::int64_t>(n)};
    parallelSort(records.data(), static_cast<std::int64_t>(records.size()));
    sorted = std::is_sorted(records.begin(), records.end(),
                            [](auto const& a, auto const& b) { return a.low < b.low; });
    done = count.load();
  };
  withThreads(2, [&] { EXPECT_THROW(parallelFor(0, 2, outer), std::runtime_error); });
  if (done < 0) GTEST_SKIP() << "both halves ran on one thread";
  EXPECT_EQ(done, kCount);
  EXPECT_TRUE(sorted);
}
