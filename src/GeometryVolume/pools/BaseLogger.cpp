#include "GeometryVolume/pools/BaseLogger.h"

#include "GeometryVolume/core/Base.h"
#include "GeometryVolume/core/LoggerHooks.h"
#include "GeometryVolume/pools/BaseLoggerImpl.h"
#include "GeometryVolume/pools/PoolLogImpl.h"

#include <algorithm>
#include <chrono>
#include <mutex>
#include <set>
#include <shared_mutex>
#include <tbb/concurrent_hash_map.h>
#include <unordered_set>
#include <vector>

namespace VLN {

namespace {

using Internal::LoggerCounter;
using TileTree3D::Internal::writeLine;
using Owners = std::vector<Base const*>;

struct Record {
  std::int64_t ticks;
  std::int32_t number;
  Base const* base;
  /// How often it is incomplete; the report asks for its size at 0 only.
  std::int32_t incomplete;
};

struct HashAddress {
  static std::size_t hash(void const* p) {
    return reinterpret_cast<std::uintptr_t>(p) * std::uint64_t(0x9e3779b97f4a7c15);
  }
  static bool equal(void const* a, void const* b) { return a == b; }
};
using BaseMap = tbb::concurrent_hash_map<Base const*, Record, HashAddress>;
using PointerMap = tbb::concurrent_hash_map<void const*, Owners, HashAddress>;

/// A debugger may break where this registration number is met. No object gets -1.
constexpr std::int32_t kTrap = -1;

/// Never destroyed: objects in statics are destroyed after everything else.
struct State {
  // Hooks take the lock shared, for their operations on the maps can run side by side; a walk takes it for
  // itself. Whoever waits for it holds the gate, so that a walk goes before hooks that come later: else a
  // stream of hooks could keep it out for ever.
  std::mutex gate;
  std::shared_mutex mutex;
  BaseMap baseMap;
  PointerMap pointerMap;
  std::atomic<std::int32_t> copyCounter{0};
  std::array<std::atomic<std::int32_t>, Internal::kLoggerCounterCount> counters{};
  std::atomic<std::int32_t> numberOfCopies{0};
  std::atomic<bool> dumpInProgress{false};
  std::mutex tracedNameMutex;
  Ostil::String tracedName;
};

State& state() {
  static State* const s = new State;
  return *s;
}

class HookLock {
public:
  explicit HookLock(State& s)
      : m_lock(s.mutex, std::defer_lock) {
    std::lock_guard const gate(s.gate);
    m_lock.lock();
  }

private:
  std::shared_lock<std::shared_mutex> m_lock;
};

class WalkLock {
public:
  explicit WalkLock(State& s)
      : m_lock(s.mutex, std::defer_lock) {
    std::lock_guard const gate(s.gate);
    m_lock.lock();
  }

private:
  std::unique_lock<std::shared_mutex> m_lock;
};

void count(LoggerCounter counter) { ++state().counters[counter]; }

bool isTraced(Ostil::String const& name) {
  State& s = state();
  std::lock_guard const lock(s.tracedNameMutex);
  return !name.empty() && name == s.tracedName;
}

/// Whether the first character is one of these letters: readers of old reports rely on it.
bool passesVoxelTest(Ostil::String const& name) { return name.find_first_of("voxel_", 0) == 0; }

// Walks. The caller holds the lock for itself.

std::int32_t activeCopies(State& s, Ostil::String const& name) {
  if (!BaseLogger::enabled() || name == Internal::kPooledName || name == Internal::kScratchName) return 0;
  std::unordered_set<Base const*> bearers;
  for (auto const& [base, record] : s.baseMap)
    if (base->name() == name) bearers.insert(base);
  if (bearers.empty()) return 0;
  bool const traced = isTraced(name);
  std::int32_t blocks = 0;
  for (auto const& [block, owners] : s.pointerMap) {
    std::set<Base const*> found;
    for (Base const* owner : owners)
      if (bearers.contains(owner)) found.insert(owner);
    blocks += found.empty() ? 0 : 1;
    if (traced)
      for (std::size_t i = 0; i < found.size(); ++i) writeLine("Copy for ", name, ": ", block);
  }
  return std::max(0, blocks - 1);
}

std::int32_t activeCopiesOfAll(State& s) {
  std::set<Ostil::String> names;
  for (auto const& [base, record] : s.baseMap) names.insert(base->name());
  std::int32_t sum = 0;
  for (auto const& name : names)
    if (passesVoxelTest(name) && name != Internal::kTreeName && name != Internal::kScratchName)
      sum += activeCopies(s, name);
  return sum;
}

// Hooks

void baseBuilt(Base const* base) {
  State& s = state();
  HookLock const lock(s);
  std::int32_t const number = s.copyCounter.fetch_add(1);
  if (number == kTrap) std::cout << "" << std::flush;
  auto const ticks = std::chrono::steady_clock::now().time_since_epoch().count();
  bool const isNew = s.baseMap.emplace(base, Record{ticks, number, base, 0});
  count(isNew ? Internal::kAllocOK : Internal::kAllocNotOK);
}

void baseDestroyed(Base const* base) {
  State& s = state();
  bool erased;
  {
    HookLock const lock(s);
    erased = s.baseMap.erase(base);
  }
  count(erased ? Internal::kDeAllocOK : Internal::kDeAllocNotOK);
  if (!erased) writeLine("Warning: Base '", base->name(), "' NOT deallocated OK");
}

void changeIncomplete(Base const* base, std::int32_t by) {
  State& s = state();
  HookLock const lock(s);
  BaseMap::accessor entry;
  if (!s.baseMap.find(entry, base)) return;
  // The logger may have been switched on in between.
  entry->second.incomplete = std::max(0, entry->second.incomplete + by);
}
void baseIncomplete(Base const* base) { changeIncomplete(base, 1); }
void baseComplete(Base const* base) { changeIncomplete(base, -1); }

/// @return Whether the block was new.
bool addOwner(State& s, void const* block, Base const* owner) {
  HookLock const lock(s);
  PointerMap::accessor entry;
  bool const isNew = s.pointerMap.insert(entry, block);
  entry->second.push_back(owner);
  return isNew;
}

void hookPointerAllocated(void const* block, Base const* owner) {
  State& s = state();
  Ostil::String const& name = owner->name();
  bool const watched =
      passesVoxelTest(name) && name != Internal::kTreeName && name != "voxel_signed_distance";
  // Counting walks the maps, so it must not lie inside the lock that the insertion takes.
  std::int32_t const before = watched ? BaseLogger::numberOfActiveCopies(name) : 0;
  bool const isNew = addOwner(s, block, owner);
  count(Internal::kVoidAllocOK);
  bool const rose = watched && BaseLogger::numberOfActiveCopies(name) > before;
  if (rose) {
    ++s.numberOfCopies;
    writeLine("WARNING: Extra copy introduced for ", name);
  }
  if (isTraced(name)) {
    writeLine(isNew ? "pointerAllocated.1: " : "pointerAllocated.2 ", name);
    if (rose) writeLine("Extra copy introduced");
  }
}

void hookPointerDeAllocated(void const* block, Base const* owner) {
  State& s = state();
  int outcome;
  {
    HookLock const lock(s);
    PointerMap::accessor entry;
    if (!s.pointerMap.find(entry, block)) {
      outcome = 1;
    } else {
      Owners& owners = entry->second;
      auto const at = std::find(owners.begin(), owners.end(), owner);
      if (at == owners.end()) {
        outcome = 2;
      } else {
        owners.erase(at);
        outcome = owners.empty() ? 3 : 4;
        if (owners.empty()) s.pointerMap.erase(entry);
      }
    }
  }
  count(outcome <= 2 ? Internal::kVoidDeAllocNotOK : Internal::kVoidDeAllocOK);
  if (outcome <= 2)
    writeLine("pointerDeAllocated.", outcome, ": DeAlloc Error");
  else if (isTraced(owner->name()))
    writeLine("pointerDeAllocated.", outcome, ": ", owner->name());
}

void hookPointerReAllocated(void const* from, void const* to) {
  State& s = state();
  HookLock const lock(s);
  Owners owners;
  {
    PointerMap::accessor entry;
    if (!s.pointerMap.find(entry, from)) return count(Internal::kVoidDeAllocNotOK);
    owners = entry->second;
    s.pointerMap.erase(entry);
  }
  count(Internal::kVoidDeAllocOK);
  bool const isNew = s.pointerMap.emplace(to, std::move(owners));
  count(isNew ? Internal::kVoidAllocOK : Internal::kVoidAllocNotOK);
}

constexpr LoggerHooks kHooks{&baseBuilt,
                             &baseDestroyed,
                             &hookPointerAllocated,
                             &hookPointerDeAllocated,
                             &hookPointerReAllocated,
                             &BaseLogger::isDumpInProgress,
                             &baseIncomplete,
                             &baseComplete};

} // namespace

void BaseLogger::enable() {
  state();
  Internal::g_loggerHooks.store(&kHooks, std::memory_order_release);
}
void BaseLogger::disable() { Internal::g_loggerHooks.store(nullptr, std::memory_order_release); }
bool BaseLogger::enabled() { return loggingEnabled(); }

void BaseLogger::clear() {
  if (!enabled()) return;
  State& s = state();
  WalkLock const lock(s);
  s.copyCounter = 0;
  s.baseMap.clear();
  s.pointerMap.clear();
  clearCounters();
}
void BaseLogger::clearCounters() {
  if (!enabled()) return;
  for (auto& counter : state().counters) counter = 0;
}

bool BaseLogger::isDumpInProgress() { return enabled() && state().dumpInProgress; }

void BaseLogger::pointerAllocated(void const* block, Base const* owner) {
  VLN::pointerAllocated(block, owner);
}
void BaseLogger::pointerDeAllocated(void const* block, Base const* owner) {
  VLN::pointerDeAllocated(block, owner);
}
void BaseLogger::pointerReAllocated(void const* from, void const* to) { VLN::pointerReAllocated(from, to); }

std::int32_t BaseLogger::numberOfCopies() { return enabled() ? state().numberOfCopies.load() : 0; }
std::int32_t BaseLogger::numberOfActiveCopies() {
  if (!enabled()) return 0;
  State& s = state();
  WalkLock const lock(s);
  return activeCopiesOfAll(s);
}
std::int32_t BaseLogger::numberOfActiveCopies(Ostil::String const& name) {
  if (!enabled()) return 0;
  State& s = state();
  WalkLock const lock(s);
  return activeCopies(s, name);
}
void BaseLogger::setTracedName(Ostil::String const& name) {
  State& s = state();
  std::lock_guard const lock(s.tracedNameMutex);
  s.tracedName = name;
}

namespace Internal {

std::array<std::int32_t, kLoggerCounterCount> loggerCounters() {
  std::array<std::int32_t, kLoggerCounterCount> values{};
  for (std::size_t i = 0; i < values.size(); ++i) values[i] = state().counters[i];
  return values;
}

std::map<Ostil::String, NameSummary> summarizeNames() {
  State& s = state();
  WalkLock const lock(s);
  std::map<Ostil::String, NameSummary> names;
  for (auto const& [base, record] : s.baseMap) {
    std::uint64_t used = 0, allocated = 0;
    if (record.incomplete == 0)
      base->memUse(used, allocated, false);
    else
      base->Base::memUse(used, allocated, false);
    NameSummary& summary = names[base->name()];
    if (summary.objects++ == 0 || record.number < summary.number)
      summary.base = base, summary.number = record.number, summary.size = used;
    summary.used += used, summary.allocated += allocated;
  }
  for (auto& [name, summary] : names) summary.deepCopies = activeCopies(s, name);
  return names;
}

LoggerDumpScope::LoggerDumpScope() { state().dumpInProgress = true; }
LoggerDumpScope::~LoggerDumpScope() { state().dumpInProgress = false; }

} // namespace Internal
} // namespace VLN
