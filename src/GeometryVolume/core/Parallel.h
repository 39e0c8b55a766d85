// Parallel loops on the shared task scheduler, behind type-erased bodies that are called once for a range.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "GeometryVolume/core/FunctionRef.h"

#include <cstdint>
#include <utility>
#include <vector>

namespace VLN {

/// Body of a parallel loop: handles the half-open range [begin, end).
using RangeBody = FunctionRef<void(std::int64_t begin, std::int64_t end)>;

/// Keeps the ranges of repeated loops over one sequence on the same cores. Not to be shared by concurrent
/// loops.
class VLN_API AffinityPartitioner {
public:
  AffinityPartitioner();
  ~AffinityPartitioner();
  AffinityPartitioner(AffinityPartitioner const&) = delete;
  AffinityPartitioner& operator=(AffinityPartitioner const&) = delete;

  struct Impl;
  Impl& impl() const { return *m_impl; }

private:
  Impl* m_impl;
};

enum class Cancellation : bool { kPoll, kSuppress };

struct ParallelOptions {
  std::int64_t grain = 1;
  /// kPoll asks the host before each chunk, leaves out the rest once the job is cancelled, and makes the loop
  /// throw.
  Cancellation cancellation = Cancellation::kSuppress;
  AffinityPartitioner* affinity = nullptr;
};

/// Runs `body` over disjoint ranges that cover [begin, end).
/// The loop is isolated: a thread that waits in it never picks up a task from outside.
/// @error With Cancellation::kPoll, std::runtime_error(VLN::exceptionMessage) after the pass of a cancelled
/// job. What a body throws is passed on.
VLN_API void parallelFor(std::int64_t begin, std::int64_t end, RangeBody body, ParallelOptions options = {});

/// Runs `body(chunk, begin, end)` over consecutive chunks of `grain` items each, so that a caller may keep a
/// result for each chunk and join them in order: the outcome does not depend on the number of threads.
VLN_API void parallelChunks(std::int64_t begin, std::int64_t end, std::int64_t grain,
                            FunctionRef<void(std::int64_t chunk, std::int64_t begin, std::int64_t end)> body,
                            Cancellation cancellation = Cancellation::kSuppress);
inline std::int64_t chunkCount(std::int64_t begin, std::int64_t end, std::int64_t grain) {
  return end <= begin ? 0 : (end - begin + grain - 1) / grain;
}

/// Deterministic reduction: `map(begin, end)` for each chunk, then `join` from left to right.
template <class T, class Map, class Join>
T parallelReduce(std::int64_t begin, std::int64_t end, std::int64_t grain, T identity, Map const& map,
                 Join const& join, Cancellation cancellation = Cancellation::kSuppress) {
  struct Part { // so that parts of bool are objects of their own too
    T value;
  };
  std::vector<Part> parts(chunkCount(begin, end, grain), Part{identity});
  parallelChunks(
      begin, end, grain,
      [&](std::int64_t chunk, std::int64_t b, std::int64_t e) { parts[chunk].value = map(b, e); },
      cancellation);
  T result = std::move(identity);
  for (Part& part : parts) result = join(std::move(result), std::move(part.value));
  return result;
}

/// Sorts the positions `order[0..n)` so that less(order[a], order[a + 1]) never fails to hold the other way
/// round. Positions that compare equal keep rising order, so the result does not depend on the number of
/// threads.
VLN_API void parallelSortPositions(std::uint64_t* order, std::int64_t n,
                                   FunctionRef<bool(std::uint64_t, std::uint64_t)> less);

/// A 128-bit key with a value that sorts along.
struct SortRecord {
  std::uint64_t high, low;
  std::int64_t value;
};
/// Sorts by key and then by value: the result does not depend on the number of threads.
/// @cost Serial below 500 records.
VLN_API void parallelSort(SortRecord* records, std::int64_t n);

/// Runs `body` with at most `threads` threads of the scheduler (the calling one included).
VLN_API void withThreads(int threads, FunctionRef<void()> body);
/// Number of threads that a loop started here may use.
VLN_API int parallelThreads();
/// Index of the calling thread among those of a running loop, below parallelThreads() of the loop's caller.
VLN_API int parallelThreadIndex();

} // namespace VLN
