#include "GeometryVolume/pools/RecyclingPoolImpl.h"

#include "GeometryVolume/core/YieldPointImpl.h"

#include <algorithm>
#include <chrono>
#include <limits>
#include <utility>

namespace VLN::TileTree3D::Internal {

namespace {

constexpr std::uint64_t kMost = std::numeric_limits<std::uint64_t>::max();

constinit std::atomic<RecyclingPool*> g_pools[2]{nullptr, nullptr};

/// Never destroyed, as the pools.
std::recursive_mutex& poolMutex(RecyclingPool::Kind kind) {
  static auto* const mutexes = new std::recursive_mutex[2];
  return mutexes[static_cast<std::size_t>(kind)];
}

bool isIdle(RecyclingPool::Entry const& entry) { return entry.useCount() == 1; }

using PoolUtils::getMemoryStats;
using PoolUtils::toMB;

} // namespace

std::uint64_t saturatingAdd(std::uint64_t a, std::uint64_t b) { return a > kMost - b ? kMost : a + b; }
std::uint64_t saturatingMultiply(std::uint64_t a, std::uint64_t b) {
  return b != 0 && a > kMost / b ? kMost : a * b;
}

RecyclingPool::CrossingLock::CrossingLock() {
  VLN_YIELD_POINT();
  poolMutex(Kind::kArrays).lock();
  VLN_YIELD_POINT(); // one of the two is held
  poolMutex(Kind::kChannels).lock();
}
RecyclingPool::CrossingLock::~CrossingLock() {
  poolMutex(Kind::kChannels).unlock();
  poolMutex(Kind::kArrays).unlock();
}

RecyclingPool::RecyclingPool(Kind kind, char const* name, char const* noun, std::size_t storeCount)
    : m_stores(storeCount)
    , m_kind(kind)
    , m_name(name)
    , m_noun(noun) {
  g_pools[static_cast<std::size_t>(kind)].store(this, std::memory_order_release);
}

RecyclingPool* RecyclingPool::find(Kind kind) {
  return g_pools[static_cast<std::size_t>(kind)].load(std::memory_order_acquire);
}
RecyclingPool* RecyclingPool::partner() const {
  return find(m_kind == Kind::kArrays ? Kind::kChannels : Kind::kArrays);
}
RecyclingPool* RecyclingPool::enabledPartner() const {
  RecyclingPool* const p = partner();
  return p && p->enabled() ? p : nullptr;
}
std::recursive_mutex& RecyclingPool::mutex() const { return poolMutex(m_kind); }

// Switches

void RecyclingPool::enable() {
  std::lock_guard const lock(mutex());
  m_enabled = true;
}
void RecyclingPool::disable() {
  CrossingLock const lock;
  freeAllMemory();
  m_enabled = false;
}
bool RecyclingPool::enabled() const {
  std::lock_guard const lock(mutex());
  return m_enabled;
}
void RecyclingPool::enableLog() {
  CrossingLock const lock;
  m_logEnabled = true;
}
void RecyclingPool::disableLog() {
  CrossingLock const lock;
  m_logEnabled = false;
}

// The size to keep free

void RecyclingPool::changeRequiredFreeSize(char const* operation, std::uint64_t bytes, std::uint64_t size) {
  log(operation, toMB(bytes), "MB");
  m_requiredFreeSize = size;
  freeRequiredMemory();
}

void RecyclingPool::setRequiredFreeSize(std::uint64_t bytes) {
  CrossingLock const lock;
  if (m_enabled && m_requiredFreeEnabled) changeRequiredFreeSize("setRequiredFreeSize of ", bytes, bytes);
}
void RecyclingPool::addRequiredFreeSize(std::uint64_t bytes) {
  CrossingLock const lock;
  if (m_enabled && m_requiredFreeEnabled)
    changeRequiredFreeSize("addRequiredFreeSize of ", bytes, saturatingAdd(m_requiredFreeSize, bytes));
}
void RecyclingPool::subtractRequiredFreeSize(std::uint64_t bytes) {
  CrossingLock const lock;
  // Readers of logs know this operation under the name of the one before.
  if (m_enabled && m_requiredFreeEnabled)
    changeRequiredFreeSize("addRequiredFreeSize of ", bytes,
                           m_requiredFreeSize - std::min(m_requiredFreeSize, bytes));
}
std::uint64_t RecyclingPool::requiredFreeSize() const {
  std::lock_guard const lock(mutex());
  return m_enabled ? m_requiredFreeSize : 0;
}
void RecyclingPool::enableRequiredFreeSize() {
  CrossingLock const lock;
  if (!m_enabled || m_requiredFreeEnabled) return;
  log("enableRequiredFreeSize");
  m_requiredFreeEnabled = true;
  freeRequiredMemory();
}
void RecyclingPool::disableRequiredFreeSize() {
  CrossingLock const lock;
  if (!m_enabled) return;
  log("disableRequiredFreeSize");
  m_requiredFreeEnabled = false;
}

void RecyclingPool::freeRequiredMemory() {
  log(" freeRequiredMemory.begin");
  logPlain("freeRequiredMemory of ", toMB(m_requiredFreeSize), "MB begin");
  Stats stats{};
  if (m_requiredFreeEnabled && getMemoryStats(stats)) {
    if (stats.availablePhysical >= m_requiredFreeSize)
      log("Not necessary to free required memory: free physical memory = ", toMB(stats.availablePhysical),
          "MB, required = ", toMB(m_requiredFreeSize), "MB");
    else
      freeMemory(m_requiredFreeSize - stats.availablePhysical, stats.availablePhysical);
  }
  logPlain("freeRequiredMemory of ", toMB(m_requiredFreeSize), "MB end");
  if (m_logEnabled) dumpBoth();
  log(" freeRequiredMemory.end");
}

// Queries

template <class Visit> void RecyclingPool::forEachEntry(Visit const& visit) const {
  for (std::size_t s = 0; s < m_stores.size(); ++s)
    for (Held const& held : m_stores[s]) visit(s, held);
}

RecyclingPool::Measure const& RecyclingPool::look(std::size_t store, Held const& held) const {
  measure(store, held.entry, !isIdle(held.entry), held.seen);
  return held.seen;
}
std::uint64_t RecyclingPool::knownMemory() const {
  std::uint64_t sum = 0;
  forEachEntry([&](std::size_t s, Held const& held) { sum += look(s, held).bytes; });
  return sum;
}

std::uint64_t RecyclingPool::allocatedMemory() const {
  if (!m_enabled) return 0;
  std::lock_guard const lock(mutex());
  std::uint64_t sum = 0;
  forEachEntry([&](std::size_t s, Held const& held) {
    Measure now = held.seen;
    measure(s, held.entry, false, now);
    sum += now.bytes;
  });
  return sum;
}

std::uint64_t RecyclingPool::availableMemory() const {
  if (!m_enabled) return 0;
  Stats stats{};
  std::uint64_t sum = getMemoryStats(stats) ? stats.availablePhysical : 0;
  std::lock_guard const lock(mutex());
  forEachEntry([&](std::size_t s, Held const& held) {
    if (isIdle(held.entry)) sum += look(s, held).bytes;
  });
  return m_requiredFreeEnabled ? sum - std::min(sum, m_requiredFreeSize) : sum;
}

std::uint64_t RecyclingPool::availablePhysicalMemory() {
  Stats stats{};
  return getMemoryStats(stats) ? stats.availablePhysical : 0;
}
std::uint64_t RecyclingPool::totalPhysicalMemory() {
  Stats stats{};
  return getMemoryStats(stats) ? stats.totalPhysical : 0;
}

std::uint64_t RecyclingPool::allocationCount() const {
  std::lock_guard const lock(mutex());
  return m_enabled ? m_allocationCount.load() : 0;
}
void RecyclingPool::resetAllocationCount() {
  std::lock_guard const lock(mutex());
  m_allocationCount = 0;
  m_lastHandOut.clear();
}

std::uint64_t RecyclingPool::countEntries(bool idle) const {
  std::lock_guard const lock(mutex());
  std::uint64_t count = 0;
  if (m_enabled)
    forEachEntry([&](std::size_t, Held const& held) { count += isIdle(held.entry) == idle ? 1 : 0; });
  return count;
}
std::uint64_t RecyclingPool::freeStoreSize() const { return countEntries(true); }
std::uint64_t RecyclingPool::usedStoreSize() const { return countEntries(false); }

// Handing out

RecyclingPool::Entry RecyclingPool::bestFit(std::size_t store, std::uint64_t n,
                                            FunctionRef<void(Held const&)> skipped) const {
  Entry const* best = nullptr;
  std::uint64_t c = 0;
  for (Held const& held : m_stores[store]) {
    Entry const& entry = held.entry;
    if (!isIdle(entry)) {
      skipped(held);
    } else {
      std::uint64_t const e = rank(store, entry);
      bool const better =
          !best || (c < n && e >= n) || (c < n && e < n && e > c) || (c > n && e > n && e < c);
      if (better) best = &entry, c = e;
    }
  }
  VLN_YIELD_POINT(); // holders may let entries go, and copy what they hold
  return best ? *best : nullptr;
}

void RecyclingPool::settle(std::size_t store, Entry const& entry, bool intoPool) {
  VLN_YIELD_POINT();
  Store& entries = m_stores[store];
  auto at =
      std::find_if(entries.begin(), entries.end(), [&](Held const& held) { return held.entry == entry; });
  if (!intoPool) {
    if (at == entries.end()) return;
    std::swap(*at, entries.back());
    return entries.removeLast();
  }
  if (at == entries.end()) {
    entries.append({entry});
    at = entries.end() - 1;
  }
  glance(store, entry, at->seen);
}

bool RecyclingPool::needsRoom(Stats const& stats, std::uint64_t extra) const {
  return stats.availablePhysical < saturatingAdd(m_requiredFreeSize, extra);
}
bool RecyclingPool::makeRoom(Stats const& stats, std::uint64_t extra) {
  return !needsRoom(stats, extra) ||
         freeMemory(saturatingAdd(m_requiredFreeSize, extra) - stats.availablePhysical,
                    stats.availablePhysical);
}

void RecyclingPool::countHandOut(void const* address) { m_lastHandOut[address] = ++m_allocationCount; }

// Freeing

template <class Keep> void RecyclingPool::keepEntries(Store& store, Keep const& keep) {
  // In place: a list that had to grow could fail with half of the entries moved.
  std::uint64_t kept = 0;
  for (std::uint64_t n = 0; n < store.size(); ++n) {
    if (!keep(store[n].entry)) continue;
    if (n != kept) std::swap(store[n], store[kept]);
    ++kept;
  }
  while (store.size() > kept) store.removeLast();
}

void RecyclingPool::freeMemoryNotUsedSinceCount(std::uint64_t count) {
  std::lock_guard const lock(mutex());
  if (!m_enabled) return;
  log(" freeMemoryNotUsedSinceCount.begin");
  for (Store& store : m_stores) {
    keepEntries(store, [&](Entry const& entry) {
      auto const known = m_lastHandOut.find(entry.get());
      if (known == m_lastHandOut.end()) return false;
      if (known->second >= count) return true;
      m_lastHandOut.erase(known);
      return false;
    });
  }
  log(" freeMemoryNotUsedSinceCount.end");
}

void RecyclingPool::freeAllMemory() {
  std::lock_guard const lock(mutex());
  if (!m_enabled) return;
  log(" freeAllMemory.begin");
  for (Store& store : m_stores) Store().swap(store);
  m_lastHandOut.clear();
  log(" freeAllMemory.end");
}

void RecyclingPool::freeMemory(std::uint64_t bytes) {
  if (bytes == 0) return;
  CrossingLock const lock;
  if (!m_enabled) return;
  freeMemory(bytes, availablePhysicalMemory());
}

std::multimap<std::uint64_t, void const*> RecyclingPool::idleEntries() const {
  std::multimap<std::uint64_t, void const*> idle;
  forEachEntry([&](std::size_t s, Held const& held) {
    if (isIdle(held.entry)) idle.emplace(look(s, held).bytes, held.entry.get());
  });
  return idle;
}

void RecyclingPool::dropIdle(std::set<void const*> const& addresses) {
  for (Store& store : m_stores) {
    keepEntries(store, [&](Entry const& entry) {
      if (!isIdle(entry) || !addresses.contains(entry.get())) return true;
      m_lastHandOut.erase(entry.get());
      return false;
    });
  }
}

bool RecyclingPool::freeMemory(std::uint64_t requested, std::uint64_t physicalBefore) {
  if (requested == 0) return true;
  CrossingLock const lock;
  if (!m_enabled || m_freeInProgress) {
    if (m_freeInProgress) log(" Terminating freeMemory early as freeing is already in progress");
    return false;
  }
  struct Flag {
    bool& flag;
    explicit Flag(bool& f)
        : flag(f) {
      flag = true;
    }
    ~Flag() { flag = false; }
  } const inProgress(m_freeInProgress);

  Need const need{requested, physicalBefore};
  if (m_logEnabled) {
    log(" freeMemory.begin");
    log("freeMemory of ", toMB(requested), "MB");
    logAmounts();
    if (m_kind == Kind::kChannels) log(" Physical memory free before = ", toMB(physicalBefore), "MB");
  }

  auto candidates = idleEntries();
  VLN_YIELD_POINT(); // an idle entry may be taken by who holds it in another way
  bool success = false;
  for (int tries = 1; !candidates.empty() && !success; ++tries) {
    log("Attempting freeing of memory, try #", tries);
    log(" potentialRemoveMap.size() = ", candidates.size());
    // The whole amount on every try: what was dropped before has not been enough.
    std::set<void const*> addresses;
    std::uint64_t taken = 0;
    while (taken < requested && !candidates.empty()) {
      auto const smallest = candidates.begin();
      taken = saturatingAdd(taken, smallest->first);
      addresses.insert(smallest->second);
      candidates.erase(smallest);
    }
    log(" removing ", addresses.size(), " ", m_noun, " of total size ", toMB(taken), "MB");
    VLN_YIELD_POINT();
    dropIdle(addresses);
    success = enoughAfterTry(need);
  }
  if (!success) success = enoughFromPartner(need);
  if (m_logEnabled) logOutcome(success, need);
  return success;
}

// Reports

void RecyclingPool::logFreeAndRequired(Stats const& stats, Need const& need) const {
  logPlain(" Physical free = ", toMB(stats.availablePhysical), "MB");
  logPlain(" Required free = ", toMB(saturatingAdd(need.before, need.requested)), "MB");
}

void RecyclingPool::logAmounts() const {
  log(" Allocated = ", toMB(knownMemory()), "MB");
  log(availableLabel(), toMB(availableMemory()), "MB");
  log(" Available physical = ", toMB(availablePhysicalMemory()), "MB");
}

void RecyclingPool::logOutcome(bool success, Need const& need) const {
  Stats stats{};
  getMemoryStats(stats);
  log(success ? "OK: Enough physical memory now available ("
              : "Warning: NOT enough physical memory available (");
  logFreeAndRequired(stats, need);
  logAmounts();
  log(" Available physical before = ", toMB(need.before), "MB");
  log(" Requested total free amount = ", toMB(need.requested), "MB");
  log(" Satisfied free amount = ",
      toMB(stats.availablePhysical - std::min(stats.availablePhysical, need.before)), "MB");
  log(" freeMemory.end");
}

void RecyclingPool::dumpBoth() const {
  dump();
  if (auto const* p = partner()) p->dump();
}

void RecyclingPool::dump() const {
  if (!m_enabled) return;
  using Clock = std::chrono::steady_clock;
  Stats stats{};
  auto const begin = Clock::now();
  bool const known = getMemoryStats(stats);
  std::chrono::duration<double> const took = Clock::now() - begin;

  CrossingLock const lock;
  if (known)
    writeLine(m_name, ":Total physical memory = ", toMB(stats.totalPhysical),
              "MB, available physical memory = ", toMB(stats.availablePhysical), "MB. Retrieving stats took ",
              took.count(), " seconds");
  else
    writeLine(m_name, ":Unable to retrieve memory stats");
  auto const rule = [&] { writeLine(m_name, ":========================"); };
  rule();
  writeLine(m_name, ":Content of ", m_kind == Kind::kArrays ? "array" : "channel", " pool:");
  writeLine(m_name, totalLabel(), toMB(knownMemory()), "MB");
  rule();
  forEachEntry([&](std::size_t s, Held const& held) { writeLine(describe(s, held)); });
  rule();
}

} // namespace VLN::TileTree3D::Internal
