#include "GeometryVolume/pools/BaseLogger.h"

#include "GeometryVolume/core/Base.h"
#include "GeometryVolume/core/LoggerHooks.h"
#include "GeometryVolume/core/YieldPointImpl.h"
#include "GeometryVolume/pools/BaseLoggerImpl.h"
#include "GeometryVolume/pools/PoolLogImpl.h"

#include <algorithm>
#include <chrono>
#include <functional>
#include <memory>
#include <mutex>
#include <set>
#include <shared_mutex>
#include <tbb/concurrent_hash_map.h>
#include <thread>
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
  /// Whether it has ever told that it is complete.
  bool announced;
  std::thread::id maker;
  /// The object's own may be changed at any moment.
  Ostil::String name;
  /// It died while the logger was off. Its key stays until an object comes to live there, or clear().
  bool dead = false;
};

struct HashAddress {
  static std::size_t hash(void const* p) {
    return reinterpret_cast<std::uintptr_t>(p) * std::uint64_t(0x9e3779b97f4a7c15);
  }
  static bool equal(void const* a, void const* b) { return a == b; }
};
// The standard allocator: leak checkers see what it hands out, and follow it.
template <class Key, class Value>
using Map = tbb::concurrent_hash_map<Key, Value, HashAddress, std::allocator<std::pair<Key const, Value>>>;
using BaseMap = Map<Base const*, Record>;
using PointerMap = Map<void const*, Owners>;

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

/// A walk of this thread. What the hooks are told meanwhile, by objects that make others to measure
/// themselves, waits until the maps may change.
struct Walk {
  std::vector<std::function<void()>> later;
  std::unordered_set<Base const*> destroyed;
};
thread_local Walk* t_walk = nullptr;

class HookLock {
public:
  explicit HookLock(State& s)
      : m_lock(s.mutex, std::defer_lock) {
    VLN_YIELD_POINT();
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
    if (t_walk) return;
    VLN_YIELD_POINT();
    std::lock_guard const gate(s.gate);
    VLN_YIELD_POINT(); // hooks that come later wait, those that are in go on
    m_lock.lock();
    t_walk = &m_walk;
  }
  ~WalkLock() {
    if (!m_lock) return;
    t_walk = nullptr;
    m_lock.unlock();
    for (auto const& hook : m_walk.later) hook();
  }
  WalkLock(WalkLock const&) = delete;
  WalkLock& operator=(WalkLock const&) = delete;

private:
  std::unique_lock<std::shared_mutex> m_lock;
  Walk m_walk;
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
    if (!record.dead && record.name == name) bearers.insert(base);
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
  for (auto const& [base, record] : s.baseMap)
    if (!record.dead) names.insert(record.name);
  std::int32_t sum = 0;
  for (auto const& name : names)
    if (passesVoxelTest(name) && name != Internal::kTreeName && name != Internal::kScratchName)
      sum += activeCopies(s, name);
  return sum;
}

// Hooks. They throw nothing: where there is no memory the object is not accounted for.

template <class Body> void attempt(LoggerCounter failed, Body const& body) noexcept {
  try {
    body();
  } catch (...) { count(failed); }
}
/// Runs `body` now, or, copied, after the walk of this thread.
template <class Body> void hook(LoggerCounter failed, Body const& body) noexcept {
  attempt(failed, [&] {
    if (t_walk)
      t_walk->later.emplace_back([failed, body] { attempt(failed, body); });
    else
      body();
  });
}

void baseBuilt(Base const* base) {
  // The name is taken along: the object may be gone when its turn comes.
  attempt(Internal::kAllocNotOK, [&] {
    hook(Internal::kAllocNotOK, [base, name = base->name(), maker = std::this_thread::get_id()] {
      State& s = state();
      HookLock const lock(s);
      std::int32_t const number = s.copyCounter.fetch_add(1);
      if (number == kTrap) std::cout << "" << std::flush;
      auto const ticks = std::chrono::steady_clock::now().time_since_epoch().count();
      BaseMap::accessor entry;
      bool const isNew = s.baseMap.insert(entry, base);
      VLN_YIELD_POINT(); // it can be found, and says nothing yet
      entry->second = Record{ticks, number, base, 0, false, maker, name};
      count(isNew ? Internal::kAllocOK : Internal::kAllocNotOK);
    });
  });
}

bool forget(Base const* base) {
  State& s = state();
  HookLock const lock(s);
  return s.baseMap.erase(base);
}

void baseDestroyed(Base const* base) {
  if (t_walk) attempt(Internal::kDeAllocNotOK, [&] { t_walk->destroyed.insert(base); });
  attempt(Internal::kDeAllocNotOK, [&] {
    hook(Internal::kDeAllocNotOK, [base, name = base->name()] {
      bool const erased = forget(base);
      count(erased ? Internal::kDeAllocOK : Internal::kDeAllocNotOK);
      if (!erased) writeLine("Warning: Base '", name, "' NOT deallocated OK");
    });
  });
}

void changeRecord(Base const* base, FunctionRef<void(Record&)> change) {
  State& s = state();
  HookLock const lock(s);
  BaseMap::accessor entry;
  if (s.baseMap.find(entry, base)) change(entry->second);
}
void baseIncomplete(Base const* base) {
  hook(Internal::kAllocNotOK, [base] { changeRecord(base, [](Record& record) { ++record.incomplete; }); });
}
void baseComplete(Base const* base) {
  hook(Internal::kAllocNotOK, [base] {
    changeRecord(base, [](Record& record) {
      // The logger may have been switched on in between.
      record.incomplete = std::max(0, record.incomplete - 1);
      record.announced = true;
    });
  });
}
void baseRenamed(Base const* base) {
  attempt(Internal::kAllocNotOK, [&] {
    hook(Internal::kAllocNotOK,
         [base, name = base->name()] { changeRecord(base, [&](Record& record) { record.name = name; }); });
  });
}

/// @return Whether the block was new.
bool addOwner(State& s, void const* block, Base const* owner) {
  HookLock const lock(s);
  PointerMap::accessor entry;
  bool const isNew = s.pointerMap.insert(entry, block);
  entry->second.push_back(owner);
  return isNew;
}

void accountBlock(void const* block, Base const* owner, Ostil::String const& name) {
  State& s = state();
  bool const watched =
      passesVoxelTest(name) && name != Internal::kTreeName && name != "voxel_signed_distance";
  // Counting walks the maps, so it must not lie inside the lock that the insertion takes.
  std::int32_t const before = watched ? BaseLogger::numberOfActiveCopies(name) : 0;
  VLN_YIELD_POINT();
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
void hookPointerAllocated(void const* block, Base const* owner) {
  attempt(Internal::kVoidAllocNotOK, [&] {
    hook(Internal::kVoidAllocNotOK,
         [block, owner, name = owner->name()] { accountBlock(block, owner, name); });
  });
}

/// @return 1 for an unknown block, 2 for one of others, 3 for the last owner, 4 for another.
int removeOwner(void const* block, Base const* owner) {
  State& s = state();
  HookLock const lock(s);
  PointerMap::accessor entry;
  if (!s.pointerMap.find(entry, block)) return 1;
  VLN_YIELD_POINT();
  Owners& owners = entry->second;
  auto const at = std::find(owners.begin(), owners.end(), owner);
  if (at == owners.end()) return 2;
  owners.erase(at);
  if (!owners.empty()) return 4;
  s.pointerMap.erase(entry);
  return 3;
}

void hookPointerDeAllocated(void const* block, Base const* owner) {
  attempt(Internal::kVoidDeAllocNotOK, [&] {
    hook(Internal::kVoidDeAllocNotOK, [block, owner, name = owner->name()] {
      int const outcome = removeOwner(block, owner);
      count(outcome <= 2 ? Internal::kVoidDeAllocNotOK : Internal::kVoidDeAllocOK);
      if (outcome <= 2)
        writeLine("pointerDeAllocated.", outcome, ": DeAlloc Error");
      else if (isTraced(name))
        writeLine("pointerDeAllocated.", outcome, ": ", name);
    });
  });
}

/// Moves the owners of a block to another.
/// @return Whether the first was known, and whether the second is new.
std::pair<bool, bool> moveOwners(void const* from, void const* to) {
  State& s = state();
  HookLock const lock(s);
  Owners owners;
  {
    PointerMap::accessor entry;
    if (!s.pointerMap.find(entry, from)) return {false, false};
    owners = entry->second;
    s.pointerMap.erase(entry);
  }
  VLN_YIELD_POINT(); // neither block is known
  return {true, s.pointerMap.emplace(to, std::move(owners))};
}

void hookPointerReAllocated(void const* from, void const* to) {
  hook(Internal::kVoidAllocNotOK, [from, to] {
    auto const [known, isNew] = moveOwners(from, to);
    count(known ? Internal::kVoidDeAllocOK : Internal::kVoidDeAllocNotOK);
    if (known) count(isNew ? Internal::kVoidAllocOK : Internal::kVoidAllocNotOK);
  });
}

// While the logger is off: what it knows must not outlive what it knows it of. Nothing is counted or said.

template <class Body> void quietly(Body const& body) noexcept {
  try {
    body();
  } catch (...) {}
}
void baseDestroyedOff(Base const* base) {
  quietly([&] { changeRecord(base, [](Record& record) { record.dead = true; }); });
}
void baseRenamedOff(Base const* base) {
  quietly([&] { changeRecord(base, [&](Record& record) { record.name = base->name(); }); });
}
void pointerDeAllocatedOff(void const* block, Base const* owner) {
  quietly([&] { removeOwner(block, owner); });
}
void pointerReAllocatedOff(void const* from, void const* to) {
  quietly([&] { moveOwners(from, to); });
}

constexpr LoggerHooks kHooks{&baseBuilt,
                             &baseDestroyed,
                             &hookPointerAllocated,
                             &hookPointerDeAllocated,
                             &hookPointerReAllocated,
                             &BaseLogger::isDumpInProgress,
                             &baseIncomplete,
                             &baseComplete,
                             &baseRenamed};
constexpr LoggerHooks kOffHooks{
    nullptr, &baseDestroyedOff, nullptr, &pointerDeAllocatedOff, &pointerReAllocatedOff,
    nullptr, nullptr,           nullptr, &baseRenamedOff,        false};

} // namespace

void BaseLogger::enable() {
  state();
  Internal::g_loggerHooks.storeRelease(&kHooks);
}
void BaseLogger::disable() {
  if (enabled()) Internal::g_loggerHooks.storeRelease(&kOffHooks);
}
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
    if (record.dead) continue;
    std::uint64_t used = sizeof(Base), allocated = sizeof(Base);
    bool const gone = t_walk->destroyed.contains(base);
    bool const known = record.announced || record.maker == std::this_thread::get_id();
    if (!gone && known && record.incomplete == 0) {
      VLN_YIELD_POINT(); // the object must not go before it has told its size
      try {
        base->memUse(used, allocated, false);
      } catch (...) { used = allocated = sizeof(Base); }
    }
    NameSummary& summary = names[record.name];
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
