#include "GeometryVolume/pools/ArrayPool.h"

#include "GeometryVolume/core/ElementTypes.h"
#include "GeometryVolume/core/Parallel.h"
#include "GeometryVolume/pools/RecyclingPoolImpl.h"

#include <algorithm>
#include <cmath>

namespace VLN::TileTree3D::ArrayPool {

namespace {

using Internal::RecyclingPool;
using PoolUtils::getMemoryStats;
using PoolUtils::toMB;

/// What the pool must know of an element type.
struct ElementKind {
  char const* name;
  std::uint64_t elementSize;
  std::uint64_t (*size)(void const* array);
  std::uint64_t (*capacity)(void const* array);
  RecyclingPool::Entry (*make)(std::uint64_t capacity, std::uint64_t n, void const* value);
  void (*refill)(void* array, std::uint64_t capacity, std::uint64_t n, void const* value);
};

template <class T>
RecyclingPool::Entry makeArray(std::uint64_t capacity, std::uint64_t n, void const* value) {
  auto array = Ostil::makePtr<Ostil::Array<T>>();
  array->reserve(capacity);
  array->resize(n, *static_cast<T const*>(value));
  return array;
}

template <class T> void refillArray(void* p, std::uint64_t capacity, std::uint64_t n, void const* value) {
  auto& array = *static_cast<Ostil::Array<T>*>(p);
  array.reserve(capacity);
  array.resize(n);
  ParallelOptions options;
  options.grain = std::max<std::int64_t>(1, (std::int64_t(1) << 17) / static_cast<std::int64_t>(sizeof(T)));
  parallelFor(
      0, static_cast<std::int64_t>(n),
      [data = array.data(), v = *static_cast<T const*>(value)](std::int64_t begin, std::int64_t end) {
        std::fill(data + begin, data + end, v);
      },
      options);
}

template <class T> constexpr ElementKind kindOf(char const* name) {
  using Array = Ostil::Array<T>;
  return {name,
          sizeof(T),
          [](void const* a) { return static_cast<Array const*>(a)->size(); },
          [](void const* a) { return static_cast<Array const*>(a)->capacity(); },
          &makeArray<T>,
          &refillArray<T>};
}

#define VLN_KIND(type, name) kindOf<type>(#name),
constexpr ElementKind kKinds[] = {VLN_FOR_EACH_ELEMENT_TYPE(VLN_KIND)};
#undef VLN_KIND

#define VLN_STORE(type, name) kStore_##name,
enum StoreIndex : std::size_t { VLN_FOR_EACH_ELEMENT_TYPE(VLN_STORE) kStoreCount };
#undef VLN_STORE

class Pool final : public RecyclingPool {
public:
  Pool()
      : RecyclingPool(Kind::kArrays, "ArrayPool", "arrays", kStoreCount) {}

  Entry allocate(std::size_t store, std::uint64_t n, void const* value);

private:
  std::uint64_t rank(std::size_t store, Entry const& entry) const override {
    return kKinds[store].capacity(entry.get());
  }
  /// An array tells nobody that it is being changed: beside a holder it cannot be measured.
  bool measure(std::size_t store, Entry const& entry, bool inUse, Measure& result) const override {
    if (inUse) return false;
    result.bytes = rank(store, entry) * kKinds[store].elementSize;
    result.elements = kKinds[store].size(entry.get());
    return true;
  }
  void glance(std::size_t store, Entry const& entry, Measure& result) const override {
    measure(store, entry, false, result);
  }
  std::string describe(std::size_t store, Held const& held) const override;
  bool enoughAfterTry(Need const& need) const override;
  bool enoughFromPartner(Need const& need) const override;
  char const* availableLabel() const override { return " Available = "; }
  char const* totalLabel() const override { return ":Total allocated memory : "; }

  Entry makeNew(std::size_t store, std::uint64_t capacity, std::uint64_t n, void const* value, bool intoPool);
};

RecyclingPool::Entry Pool::allocate(std::size_t store, std::uint64_t n, void const* value) {
  CrossingLock const lock;
  if (!m_enabled) return nullptr;
  ElementKind const& kind = kKinds[store];
  log(" allocate.begin");
  log("allocate<", kind.name, ">( #", n, " number of elements)");
  Stats stats{};
  bool const statsRead = m_requiredFreeEnabled && getMemoryStats(stats);

  Entry array = bestFit(store, n, [&](Held const& held) {
    log("Cannot re-use array because use_count = ", held.entry.useCount());
  });
  std::uint64_t const held = array ? kind.capacity(array.get()) : 0;
  std::uint64_t capacity = array && held >= n ? held : capacityFor(n);

  bool intoPool = true;
  if (statsRead) {
    std::uint64_t const extra = array ? capacity - std::min(capacity, held) : n;
    intoPool = makeRoom(stats, Internal::saturatingMultiply(extra, kind.elementSize));
    if (!intoPool) capacity = n;
  }

  if (array) {
    if (logging()) {
      log(held < n ? " Reallocating array " : " Reusing array ");
      log(" Inserting into pool = ", intoPool);
      logPlain(array.get(), " of type Ostil::Array<", kind.name, ", size = ", kind.size(array.get()),
               ", in_elementCount = ", n, ", capacity = ", held);
    }
    kind.refill(array.get(), capacity, n, value);
    settle(store, array, intoPool);
  } else {
    array = makeNew(store, capacity, n, value, intoPool);
  }
  countHandOut(array.get());
  if (logging()) {
    log(" Stats after allocation.begin");
    dumpBoth();
    log(" Stats after allocation.end");
    log(" allocate.end");
  }
  return array;
}

RecyclingPool::Entry Pool::makeNew(std::size_t store, std::uint64_t capacity, std::uint64_t n,
                                   void const* value, bool intoPool) {
  ElementKind const& kind = kKinds[store];
  Entry array = kind.make(capacity, n, value);
  settle(store, array, intoPool);
  if (logging()) {
    log(" Creating new array ", array.get(), " of type Ostil::Array<", kind.name, ">, and of size ",
        toMB(n * kind.elementSize), "MB and capacity ", toMB(kind.capacity(array.get()) * kind.elementSize),
        "MB");
    log(" Inserting into pool = ", intoPool);
    dump();
  }
  return array;
}

std::string Pool::describe(std::size_t store, Held const& held) const {
  ElementKind const& kind = kKinds[store];
  std::ostringstream line;
  line << held.entry.get() << ": Array<" << kind.name << ">: " << toMB(held.seen.elements * kind.elementSize)
       << "MB, use_count = " << held.entry.useCount() << ")";
  return line.str();
}

bool Pool::enoughAfterTry(Need const& need) const {
  Stats stats{};
  if (!getMemoryStats(stats)) return false;
  float const free = toMB(stats.availablePhysical);
  if (need.metBy(stats)) {
    log(" Enough physical memory is now available: ", free, "MB");
    return true;
  }
  log(" Enough physical memory is still not available: ", free, "MB, need to try again...");
  return false;
}

bool Pool::enoughFromPartner(Need const& need) const {
  RecyclingPool* const channels = enabledPartner();
  Stats stats{};
  // Enough by now is not counted as success: the caller then keeps its array out of the pool.
  if (!channels || !getMemoryStats(stats) || need.metBy(stats)) return false;
  log(" Not enough physical memory available. Calling recursively into ChannelPool.");
  logFreeAndRequired(stats, need);
  channels->freeMemory(need.remaining(stats));
  getMemoryStats(stats);
  bool const enough = need.metBy(stats);
  log(enough ? " Enough" : " Still not enough",
      " physical memory available after calling recursively into ChannelPool.");
  logFreeAndRequired(stats, need);
  return enough;
}

Pool& pool() {
  static Pool* const p = new Pool;
  return *p;
}

} // namespace

std::uint64_t capacityFor(std::uint64_t elementCount) {
  static float const perOctave = 1.0f / std::log(2.0f);
  float const octaves = std::log(static_cast<float>(elementCount)) * perOctave;
  float const capacity = std::pow(2.0f, std::ceil(octaves));
  // 2^64 is no count: no array can be that large.
  return capacity < 18446744073709551616.0f ? static_cast<std::uint64_t>(capacity) : elementCount;
}

#define VLN_ALLOCATE(type, name)                                                                             \
  template <> VLN_API Ostil::Ptr<Ostil::Array<type>> allocate<type>(type value, std::uint64_t n) {           \
    return Ostil::staticCast<Ostil::Array<type>>(pool().allocate(kStore_##name, n, &value));                 \
  }
VLN_FOR_EACH_ELEMENT_TYPE(VLN_ALLOCATE)
#undef VLN_ALLOCATE

void enable() { pool().enable(); }
void disable() { pool().disable(); }
bool enabled() { return pool().enabled(); }
void enableLog() { pool().enableLog(); }
void disableLog() { pool().disableLog(); }
void freeMemory(std::uint64_t bytes) { pool().freeMemory(bytes); }
void freeMemoryNotUsedSinceCount(std::uint64_t count) { pool().freeMemoryNotUsedSinceCount(count); }
void freeAllMemory() { pool().freeAllMemory(); }
void setRequiredFreeSize(std::uint64_t bytes) { pool().setRequiredFreeSize(bytes); }
void addRequiredFreeSize(std::uint64_t bytes) { pool().addRequiredFreeSize(bytes); }
void subtractRequiredFreeSize(std::uint64_t bytes) { pool().subtractRequiredFreeSize(bytes); }
std::uint64_t requiredFreeSize() { return pool().requiredFreeSize(); }
void enableRequiredFreeSize() { pool().enableRequiredFreeSize(); }
void disableRequiredFreeSize() { pool().disableRequiredFreeSize(); }
std::uint64_t allocatedMemory() { return pool().allocatedMemory(); }
std::uint64_t availableMemory() { return pool().availableMemory(); }
std::uint64_t availablePhysicalMemory() { return RecyclingPool::availablePhysicalMemory(); }
std::uint64_t totalPhysicalMemory() { return RecyclingPool::totalPhysicalMemory(); }
std::uint64_t allocationCount() { return pool().allocationCount(); }
void resetAllocationCount() { pool().resetAllocationCount(); }
std::uint64_t freeStoreSize() { return pool().freeStoreSize(); }
std::uint64_t usedStoreSize() { return pool().usedStoreSize(); }
void dump() { pool().dump(); }

} // namespace VLN::TileTree3D::ArrayPool
