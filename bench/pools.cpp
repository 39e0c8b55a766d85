// Pools against what they stand in for: making channels, arrays and blocks anew; and what the object logger's
// hooks cost while it is off.
#include "GeometryVolume/channels/Channel.h"
#include "GeometryVolume/core/Base.h"
#include "GeometryVolume/core/LoggerHooks.h"
#include "GeometryVolume/pools/ArrayPool.h"
#include "GeometryVolume/pools/BaseLogger.h"
#include "GeometryVolume/pools/ChannelMemoryPool.h"
#include "GeometryVolume/pools/ChannelPool.h"
#include "vljemalloc/vljemalloc.h"

#include <benchmark/benchmark.h>

#include <cstring>
#include <new>

namespace {

using namespace VLN::TileTree3D;
using Density = Channel<PowerOfTwoTraits, float, 4, 1>;

/// So many tiles at the deepest depth.
class Tiles final : public Component {
public:
  explicit Tiles(std::int64_t n)
      : m_n(n) {}
  std::uint64_t size() const override { return static_cast<std::uint64_t>(m_n); }
  void update(VLN::Component const&) override {}
  std::int64_t elementCount(int depth) const override { return tileCount(depth) * Density::kSize; }
  int elementCount(TreeIndex const&) const override { return Density::kSize; }
  std::int64_t tileCount(int depth) const override { return depth == -1 || depth == 28 ? m_n : 0; }

private:
  std::int64_t m_n;
};

void perElement(benchmark::State& state, std::int64_t elements) {
  state.SetItemsProcessed(state.iterations() * elements);
}

// Channels: made, brought into step with a tree, filled with their default value.

void newChannel(benchmark::State& state) {
  Tiles const tiles(state.range(0));
  for (auto _ : state) {
    float const value = 1.0f;
    Density channel("density", &value, kInitializeDefaultValue, state.range(1) != 0, true, 0, 28);
    channel.update(tiles);
    benchmark::DoNotOptimize(channel.tileCount(28));
  }
  perElement(state, state.range(0) * Density::kSize);
}
BENCHMARK(newChannel)->ArgNames({"tiles", "static"})->ArgsProduct({{1000, 20000}, {0, 1}})->UseRealTime();

void pooledChannel(benchmark::State& state) {
  ChannelPool::enable();
  Tiles const tiles(state.range(0));
  for (auto _ : state) {
    auto const channel = ChannelPool::allocate<PowerOfTwoTraits, float, 4, 1>(
        1.0f, state.range(1) != 0, true, 0, 28, static_cast<std::uint64_t>(state.range(0)), nullptr);
    channel->update(tiles);
    benchmark::DoNotOptimize(channel->tileCount(28));
  }
  ChannelPool::disable();
  perElement(state, state.range(0) * Density::kSize);
}
BENCHMARK(pooledChannel)->ArgNames({"tiles", "static"})->ArgsProduct({{1000, 20000}, {0, 1}})->UseRealTime();

/// As above, for a caller that writes every element itself.
void pooledChannelUnfilled(benchmark::State& state) {
  ChannelPool::enable();
  Tiles const tiles(state.range(0));
  for (auto _ : state) {
    auto const channel = ChannelPool::allocate<PowerOfTwoTraits, float, 4, 1>(
        1.0f, false, false, 0, 28, static_cast<std::uint64_t>(state.range(0)), nullptr);
    channel->update(tiles);
    benchmark::DoNotOptimize(channel->tileCount(28));
  }
  ChannelPool::disable();
  perElement(state, state.range(0) * Density::kSize);
}
BENCHMARK(pooledChannelUnfilled)->ArgName("tiles")->Arg(1000)->Arg(20000)->UseRealTime();

// Arrays

void newArray(benchmark::State& state) {
  auto const n = static_cast<std::uint64_t>(state.range(0));
  for (auto _ : state) {
    auto const array = Ostil::makePtr<Ostil::Array<float>>(n, 1.0f);
    benchmark::DoNotOptimize(array->data());
  }
  perElement(state, state.range(0));
}
BENCHMARK(newArray)->ArgName("elements")->Arg(1000)->Arg(100000)->Arg(10000000)->UseRealTime();

void pooledArray(benchmark::State& state) {
  ArrayPool::enable();
  for (auto _ : state) {
    auto const array = ArrayPool::allocate<float>(1.0f, static_cast<std::uint64_t>(state.range(0)));
    benchmark::DoNotOptimize(array->data());
  }
  ArrayPool::disable();
  perElement(state, state.range(0));
}
BENCHMARK(pooledArray)->ArgName("elements")->Arg(1000)->Arg(100000)->Arg(10000000)->UseRealTime();

// Blocks: taken, one byte of each page written, given back.

void touch(void* block, std::int64_t bytes) {
  for (std::int64_t at = 0; at < bytes; at += 4096) static_cast<volatile char*>(block)[at] = 1;
}

void plainBlock(benchmark::State& state) {
  auto const bytes = static_cast<std::size_t>(state.range(0));
  for (auto _ : state) {
    void* const block = vlje_aligned_alloc(64, bytes);
    touch(block, state.range(0));
    vlje_free(block);
  }
}
BENCHMARK(plainBlock)->ArgName("bytes")->Arg(4 << 10)->Arg(256 << 10)->Arg(4 << 20)->Arg(64 << 20);

void pooledBlock(benchmark::State& state) {
  for (auto _ : state) {
    void* const block = ChannelMemoryPool::allocate(static_cast<std::uint64_t>(state.range(0)));
    touch(block, state.range(0));
    ChannelMemoryPool::deallocate(block);
  }
  ChannelMemoryPool::freeAllMemory();
}
BENCHMARK(pooledBlock)->ArgName("bytes")->Arg(4 << 10)->Arg(256 << 10)->Arg(4 << 20)->Arg(64 << 20);

// The logger

/// What a Base holds and calls, without the registration: its constructor and destructor are functions too.
struct Bare {
  [[gnu::noinline]] Bare() {}
  [[gnu::noinline]] virtual ~Bare() {}
  Ostil::String name;
};

template <class T> void makeOne(benchmark::State& state) {
  alignas(T) unsigned char place[sizeof(T)];
  for (auto _ : state) {
    auto* const object = new (place) T();
    benchmark::DoNotOptimize(object);
    object->~T();
  }
}
void objectWithoutHooks(benchmark::State& state) { makeOne<Bare>(state); }
BENCHMARK(objectWithoutHooks);
void objectLoggerOff(benchmark::State& state) { makeOne<VLN::Base>(state); }
BENCHMARK(objectLoggerOff);
void objectLoggerOn(benchmark::State& state) {
  VLN::BaseLogger::enable();
  makeOne<VLN::Base>(state);
  VLN::BaseLogger::clear();
  VLN::BaseLogger::disable();
}
BENCHMARK(objectLoggerOn);

void hookLoggerOff(benchmark::State& state) {
  VLN::Base const owner;
  for (auto _ : state) VLN::pointerAllocated(&state, &owner);
}
BENCHMARK(hookLoggerOff);

} // namespace
