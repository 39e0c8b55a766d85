// RecyclingPool: what the pool of arrays and the pool of channels have in common.
//
//   store 0   [ entry | entry | entry ]      an entry is a reference on something handed out;
//   store 1   [ entry ]                      with a use count of 1 only the pool holds it: it is idle
//   ...                                      and may be handed out again, or freed
//
// Elements and channels are typed; the pools are not: they see a Ptr<void> and the index of its store, and
// ask their derived class how large an entry is.
//
// The two pools free memory for each other, so an operation that may cross from one into the other takes both
// locks, that of the arrays first. Operations that stay in one pool take its lock only.
#pragma once

#include "GeometryVolume/core/FunctionRef.h"
#include "GeometryVolume/pools/PoolLogImpl.h"
#include "GeometryVolume/pools/PoolUtils.h"
#include "Ostil/Array.h"
#include "Ostil/Ptr.h"

#include <atomic>
#include <cstdint>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

namespace VLN::TileTree3D::Internal {

/// Pools are made on first use and never destroyed.
class RecyclingPool {
public:
  enum class Kind { kArrays = 0, kChannels = 1 };
  using Entry = Ostil::Ptr<void>;

  /// The pool of a kind; null while nobody has used it.
  static RecyclingPool* find(Kind kind);

  RecyclingPool(RecyclingPool const&) = delete;
  RecyclingPool& operator=(RecyclingPool const&) = delete;

  void enable();
  void disable();
  bool enabled() const;
  void enableLog();
  void disableLog();

  void freeMemory(std::uint64_t bytes);
  void freeMemoryNotUsedSinceCount(std::uint64_t count);
  void freeAllMemory();

  void setRequiredFreeSize(std::uint64_t bytes);
  void addRequiredFreeSize(std::uint64_t bytes);
  void subtractRequiredFreeSize(std::uint64_t bytes);
  std::uint64_t requiredFreeSize() const;
  void enableRequiredFreeSize();
  void disableRequiredFreeSize();

  std::uint64_t allocatedMemory() const;
  std::uint64_t availableMemory() const;
  static std::uint64_t availablePhysicalMemory();
  static std::uint64_t totalPhysicalMemory();
  std::uint64_t allocationCount() const;
  void resetAllocationCount();
  std::uint64_t freeStoreSize() const;
  std::uint64_t usedStoreSize() const;
  void dump() const;

protected:
  using Stats = PoolUtils::MemoryStats;

  /// What the pool says of an entry.
  struct Measure {
    std::uint64_t bytes = 0; ///< Held, whether used or not.
    std::uint64_t elements = 0;
    int minDepth = 0, depth = 0;
  };
  struct Held {
    Entry entry;
    /// From the last time that it could be measured: beside a holder who changes it nobody else may look.
    mutable Measure seen{};
  };
  using Store = Ostil::Array<Held>;

  /// What freeMemory() is after: `requested` bytes more than there were before.
  struct Need {
    std::uint64_t requested, before;
    bool metBy(Stats const& stats) const {
      return stats.availablePhysical >= before && stats.availablePhysical - before >= requested;
    }
    /// What the other pool is asked for.
    std::uint64_t remaining(Stats const& stats) const {
      return stats.availablePhysical <= before ? requested : before - stats.availablePhysical + requested;
    }
  };

  /// `name` begins every line of the log, `noun` is what the pool holds.
  RecyclingPool(Kind kind, char const* name, char const* noun, std::size_t storeCount);
  ~RecyclingPool() = default;

  /// @return false, and nothing written, when the entry cannot be measured beside its holder.
  virtual bool measure(std::size_t store, Entry const& entry, bool inUse, Measure& result) const = 0;
  /// What shall be known of an entry that is about to be handed out; cheap.
  virtual void glance(std::size_t store, Entry const& entry, Measure& result) const = 0;
  /// What best fit compares with the request.
  virtual std::uint64_t rank(std::size_t store, Entry const& entry) const = 0;
  /// From the last measurement.
  virtual std::string describe(std::size_t store, Held const& held) const = 0;
  /// Whether enough is free, after a try of freeMemory() has dropped entries.
  virtual bool enoughAfterTry(Need const& need) const = 0;
  /// Last resort of freeMemory(): asks the other pool.
  virtual bool enoughFromPartner(Need const& need) const = 0;
  /// Words of the log that differ.
  virtual char const* availableLabel() const = 0;
  virtual char const* totalLabel() const = 0;

  class CrossingLock;

  /// The idle entry that serves a request of `n` best, null for none. Held by the caller it is no longer
  /// idle: making room does not drop it.
  Entry bestFit(std::size_t store, std::uint64_t n, FunctionRef<void(Held const&)> skipped) const;
  /// An entry is about to be handed out, new or from the store. Outside the pool it leaves the store, the
  /// last entry taking its place; else the pool takes a last look that needs no regard for a holder.
  void settle(std::size_t store, Entry const& entry, bool intoPool);
  /// Makes sure that `extra` more bytes leave the required size free.
  /// @return false when they do not, and could not be made to.
  bool makeRoom(Stats const& stats, std::uint64_t extra);
  bool needsRoom(Stats const& stats, std::uint64_t extra) const;
  void countHandOut(void const* address);
  void dumpBoth() const;
  RecyclingPool* partner() const;
  RecyclingPool* enabledPartner() const;

  /// A line of the log, behind the pool's name and a colon.
  template <class... Parts> void log(Parts const&... parts) const {
    if (m_logEnabled) writeLine(m_name, ":", parts...);
  }
  /// A line of the log as it stands.
  template <class... Parts> void logPlain(Parts const&... parts) const {
    if (m_logEnabled) writeLine(parts...);
  }
  void logFreeAndRequired(Stats const& stats, Need const& need) const;
  bool logging() const { return m_logEnabled; }

  std::vector<Store> m_stores;
  std::uint64_t m_requiredFreeSize = 0;
  bool m_requiredFreeEnabled = false;
  std::atomic<bool> m_enabled{false};

private:
  std::recursive_mutex& mutex() const;
  bool freeMemory(std::uint64_t requested, std::uint64_t physicalBefore);
  void freeRequiredMemory();
  void changeRequiredFreeSize(char const* operation, std::uint64_t bytes, std::uint64_t size);
  /// Idle entries by the bytes that they hold.
  std::multimap<std::uint64_t, void const*> idleEntries() const;
  void dropIdle(std::set<void const*> const& addresses);
  template <class Keep> static void keepEntries(Store& store, Keep const& keep);
  template <class Visit> void forEachEntry(Visit const& visit) const;
  std::uint64_t countEntries(bool idle) const;
  /// Measures again what can be measured.
  Measure const& look(std::size_t store, Held const& held) const;
  /// As allocatedMemory(), beside holders who change what they hold.
  std::uint64_t knownMemory() const;
  void logAmounts() const;
  void logOutcome(bool success, Need const& need) const;

  Kind const m_kind;
  char const* const m_name;
  char const* const m_noun;
  bool m_logEnabled = false;
  bool m_freeInProgress = false;
  std::atomic<std::uint64_t> m_allocationCount{0};
  std::unordered_map<void const*, std::uint64_t> m_lastHandOut;
};

/// Both locks, in the order that holds everywhere.
class RecyclingPool::CrossingLock {
public:
  CrossingLock();
  ~CrossingLock();
  CrossingLock(CrossingLock const&) = delete;
  CrossingLock& operator=(CrossingLock const&) = delete;
};

/// Sums and products of sizes that stay at the largest value instead of wrapping round.
std::uint64_t saturatingAdd(std::uint64_t a, std::uint64_t b);
std::uint64_t saturatingMultiply(std::uint64_t a, std::uint64_t b);

} // namespace VLN::TileTree3D::Internal
