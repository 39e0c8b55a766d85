// The pool against lists that are searched from end to end, under random operations. How much memory is free
// is a pretended figure that the test moves; freeing an array does not change it, so a call that has to make
// room drops all idle arrays and fails.
#include "ArrayPoolFixture.h"
#include "ControlGroup.h"

#include <algorithm>
#include <map>
#include <random>
#include <string>

namespace {

namespace ArrayPool = test::ArrayPool;

struct Known {
  void* address;
  std::uint64_t capacity;
  bool used;
};

struct Model {
  std::map<int, std::vector<Known>> stores; ///< By element size: 1 and 4 bytes.
  std::map<void*, std::uint64_t> lastHandOut;
  std::uint64_t clock = 0, required = 0, free = 0;
  bool requiring = false;

  void dropIdle(void* except = nullptr) {
    for (auto& [size, store] : stores)
      std::erase_if(store, [&](Known const& k) {
        bool const drop = !k.used && k.address != except;
        if (drop) lastHandOut.erase(k.address);
        return drop;
      });
  }
  void keepRequiredFree() {
    if (requiring && free < required) dropIdle();
  }
  static std::uint64_t powerOfTwo(std::uint64_t n) {
    std::uint64_t c = n == 0 ? 0 : 1;
    while (c < n) c *= 2;
    return c;
  }

  struct Expected {
    void* address; ///< Null for a new array.
    std::uint64_t capacity;
    bool inPool;
  };
  Expected allocate(int size, std::uint64_t n) {
    auto& store = stores[size];
    Known* best = nullptr;
    for (Known& k : store) {
      if (k.used) continue;
      bool const sufficient = best && best->capacity >= n;
      if (!best || (!sufficient && k.capacity >= n) ||
          (!sufficient && k.capacity < n && k.capacity > best->capacity) ||
          (best->capacity > n && k.capacity > n && k.capacity < best->capacity))
        best = &k;
    }
    void* const address = best ? best->address : nullptr;
    std::uint64_t const held = best ? best->capacity : 0;
    std::uint64_t capacity = best && held >= n ? held : powerOfTwo(n);
    std::uint64_t const extra = (best ? capacity - held : n) * static_cast<std::uint64_t>(size);
    bool inPool = true;
    if (requiring && free < required + extra) {
      dropIdle(address);
      inPool = false;
      capacity = n;
    }
    // An array never shrinks.
    return {address, std::max(capacity, held), inPool};
  }
  void handedOut(int size, Expected const& expected, void* address) {
    auto& store = stores[size];
    lastHandOut[address] = ++clock;
    auto const known =
        std::find_if(store.begin(), store.end(), [&](Known const& k) { return k.address == address; });
    if (!expected.inPool) {
      if (known == store.end()) return;
      *known = store.back(); // the last takes its place
      store.pop_back();
    } else if (known == store.end()) {
      store.push_back({address, expected.capacity, true});
    } else {
      known->capacity = expected.capacity;
      known->used = true;
    }
  }
  void letGo(int size, void* address) {
    for (Known& k : stores[size])
      if (k.address == address) k.used = false;
  }
  void age(std::uint64_t since) {
    for (auto& [size, store] : stores)
      std::erase_if(store, [&](Known const& k) {
        auto const known = lastHandOut.find(k.address);
        if (known != lastHandOut.end() && known->second >= since) return false;
        if (known != lastHandOut.end()) lastHandOut.erase(known);
        return true;
      });
  }
  std::uint64_t count(bool used) const {
    std::uint64_t n = 0;
    for (auto const& [size, store] : stores)
      n += static_cast<std::uint64_t>(
          std::count_if(store.begin(), store.end(), [&](Known const& k) { return k.used == used; }));
    return n;
  }
  std::uint64_t bytes(bool idleOnly) const {
    std::uint64_t sum = 0;
    for (auto const& [size, store] : stores)
      for (Known const& k : store)
        if (!idleOnly || !k.used) sum += k.capacity * static_cast<std::uint64_t>(size);
    return sum;
  }
};

class ArrayPoolModel : public test::ArrayPoolTest, public ::testing::WithParamInterface<unsigned> {
protected:
  template <class T>
  void allocate(std::uint64_t n, Model& model, std::vector<Ostil::Ptr<Ostil::Array<T>>>& held) {
    auto const expected = model.allocate(sizeof(T), n);
    T const value = static_cast<T>(n % 101);
    auto array = ArrayPool::allocate<T>(value, n);
    ASSERT_TRUE(!expected.address || array.get() == expected.address);
    ASSERT_EQ(array->size(), n);
    ASSERT_EQ(array->capacity(), expected.capacity);
    ASSERT_EQ(std::count(array->begin(), array->end(), value), std::ptrdiff_t(n));
    ASSERT_EQ(array.useCount(), expected.inPool ? 2 : 1);
    model.handedOut(sizeof(T), expected, array.get());
    held.push_back(std::move(array));
  }
  template <class T> void letGo(std::size_t i, Model& model, std::vector<Ostil::Ptr<Ostil::Array<T>>>& held) {
    if (held.empty()) return;
    i %= held.size();
    model.letGo(sizeof(T), held[i].get());
    held[i] = held.back();
    held.pop_back();
  }
};

TEST_P(ArrayPoolModel, FollowsTheModel) {
  SCOPED_TRACE("seed " + std::to_string(GetParam()));
  std::mt19937_64 random(GetParam());
  auto const below = [&](std::uint64_t n) { return random() % n; };
  test::ControlGroup group;
  Model model;
  model.free = test::ControlGroup::kLimit;
  std::vector<Ostil::Ptr<Ostil::Array<unsigned char>>> bytes;
  std::vector<Ostil::Ptr<Ostil::Array<float>>> floats;

  for (int step = 0; step < 25000; ++step) {
    SCOPED_TRACE("step " + std::to_string(step));
    auto const what = below(1000);
    if (what < 450) {
      std::uint64_t const n = below(std::uint64_t(1) << below(12));
      if (below(2))
        allocate<float>(n, model, floats);
      else
        allocate<unsigned char>(n, model, bytes);
    } else if (what < 940) {
      if (below(2))
        letGo(below(1 << 20), model, floats);
      else
        letGo(below(1 << 20), model, bytes);
    } else if (what < 960) {
      std::uint64_t const since = model.clock - std::min(model.clock, below(60));
      ArrayPool::freeMemoryNotUsedSinceCount(since);
      model.age(since);
    } else if (what < 970) {
      model.free = below(10000) + 1000;
      group.setFree(model.free);
    } else if (what < 980) {
      std::uint64_t const size = below(12000);
      if (below(2)) {
        ArrayPool::setRequiredFreeSize(size);
        if (model.requiring) model.required = size, model.keepRequiredFree();
      } else {
        ArrayPool::subtractRequiredFreeSize(size);
        if (model.requiring) model.required -= std::min(model.required, size), model.keepRequiredFree();
      }
    } else if (what < 986) {
      bool const was = model.requiring;
      model.requiring = below(2) == 1;
      model.requiring ? ArrayPool::enableRequiredFreeSize() : ArrayPool::disableRequiredFreeSize();
      if (!was) model.keepRequiredFree();
    } else if (what < 990) {
      std::uint64_t const wanted = below(5000);
      ArrayPool::freeMemory(wanted);
      if (wanted > 0) model.dropIdle();
    } else if (what < 993) {
      ArrayPool::resetAllocationCount();
      model.clock = 0;
      model.lastHandOut.clear();
    } else if (what == 999) {
      ArrayPool::freeAllMemory();
      model.stores.clear();
      model.lastHandOut.clear();
    }
    if (HasFatalFailure()) return;
    ASSERT_EQ(ArrayPool::freeStoreSize(), model.count(false));
    ASSERT_EQ(ArrayPool::usedStoreSize(), model.count(true));
    ASSERT_EQ(ArrayPool::allocationCount(), model.clock);
    ASSERT_EQ(ArrayPool::allocatedMemory(), model.bytes(false));
    ASSERT_EQ(ArrayPool::requiredFreeSize(), model.required);
    if (step % 20 == 0) {
      std::uint64_t const available = model.free + model.bytes(true);
      std::uint64_t const kept = model.requiring ? std::min(available, model.required) : 0;
      ASSERT_EQ(ArrayPool::availableMemory(), available - kept);
    }
  }
}

INSTANTIATE_TEST_SUITE_P(Seeds, ArrayPoolModel, ::testing::Values(11u, 12u, 13u, 14u));

} // namespace
