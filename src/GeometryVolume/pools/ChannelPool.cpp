#include "GeometryVolume/pools/ChannelPool.h"

#include "GeometryVolume/pools/ChannelPoolImpl.h"
#include "GeometryVolume/pools/Jemalloc.h"
#include "GeometryVolume/pools/RecyclingPoolImpl.h"

#include <array>

namespace VLN::TileTree3D::ChannelPool {

namespace {

using Internal::ChannelKind;
using Internal::Request;
using PoolUtils::getMemoryStats;
using PoolUtils::toMB;
using TileTree3D::Internal::RecyclingPool;

ChannelBase& channelOf(RecyclingPool::Entry const& entry) { return *static_cast<ChannelBase*>(entry.get()); }

class CoutStream final : public VLN::Internal::jemalloc_stream {
public:
  void write(char const* text, std::uint64_t length) override {
    std::cout.write(text, static_cast<std::streamsize>(length)).flush();
  }
};

class Pool final : public RecyclingPool {
public:
  Pool()
      : RecyclingPool(Kind::kChannels, "ChannelPool", "channels", Internal::kStoreCount) {}

  Ostil::Ptr<ChannelBase> allocate(ChannelKind const& kind, Request const& request);

private:
  std::uint64_t rank(std::size_t, Entry const& entry) const override {
    return static_cast<std::uint64_t>(channelOf(entry).tileCount(-1));
  }
  bool measure(std::size_t store, Entry const& entry, bool inUse, Measure& result) const override;
  void glance(std::size_t, Entry const& entry, Measure& result) const override {
    readDepths(channelOf(entry), result);
    if (logging()) result.elements = channelOf(entry).size();
  }
  std::string describe(std::size_t store, Held const& held) const override;
  bool enoughAfterTry(Need const& need) const override;
  bool enoughFromPartner(Need const& need) const override;
  char const* availableLabel() const override { return " Available physical and pool (minus required) = "; }
  char const* totalLabel() const override { return ":Total allocated memory:"; }

  static void readDepths(ChannelBase const& channel, Measure& result) {
    result.minDepth = channel.minDepth();
    result.depth = channel.depth();
  }
  void logRequest(ChannelKind const& kind, Request const& request) const;
  bool checkMemory(Stats const& stats, ChannelKind const& kind, std::uint64_t n, Entry const& best);
  void reconfigure(ChannelKind const& kind, Request const& request, ChannelBase& channel) const;
  void flush(Stats const& stats, Need const& need) const;

  /// The kind of a store, once something was asked of it.
  std::array<ChannelKind const*, Internal::kStoreCount> m_kinds{};
};

void Pool::logRequest(ChannelKind const& kind, Request const& r) const {
  log(" allocate.begin");
  log("allocate<", kind.traitsName, ", ", kind.typeName, ", ", kind.E, ", ", kind.H, ">(in_defaultValue, ",
      r.useStaticAllocation, ", ", r.callElementConstructor, ", ", r.minDepth, ", ", r.depth, ", ",
      r.tileCount, ")");
  log(" MyTileDataTraits::kE = ", kind.extended);
  log(" MyTileDataTraits::kH = ", kind.H);
  log(" TDW - Traits::kTileDataWidth = ", kind.extended);
  log(" H = ", kind.H);
  log(" traitsIndex = ", kind.traitsIndex);
  log(" TileDataTraitsIndex = ", kind.layoutIndex);
  log(" typeIndex = ", kind.typeIndex);
}

bool Pool::checkMemory(Stats const& stats, ChannelKind const& kind, std::uint64_t n, Entry const& best) {
  std::uint64_t const held = best ? rank(kind.store(), best) : 0;
  std::uint64_t const extra = TileTree3D::Internal::saturatingMultiply(n - std::min(n, held), kind.tileBytes);
  log(" estimatedExtraMemUsage = ", extra, ", data.m_requiredFreeSize = ", m_requiredFreeSize);
  log(" physical free = ", stats.availablePhysical);
  if (needsRoom(stats, extra)) log(" attempting to free temporary buffers..");
  return makeRoom(stats, extra);
}

void Pool::reconfigure(ChannelKind const& kind, Request const& r, ChannelBase& channel) const {
  log(" Re-using channel ", &channel);
  log(" Call-element constructor ", r.callElementConstructor, " ", kind.callElementConstructor(channel));
  log(" MinDepth ", r.minDepth, " ", channel.minDepth());
  log(" Depth ", r.depth, " ", channel.depth());
  log(" Re-using channel ", &channel);
  kind.configure(channel, r.defaultValue, r.callElementConstructor);
  // Without a component, the channel's own counts: new depths stay empty.
  Component const& source = r.component ? *r.component : channel;
  channel.setMinDepth(r.minDepth, source);
  channel.setDepth(r.depth, source);
  if (r.callElementConstructor) kind.reset(channel, r.defaultValue, channel.layout().maxDepth);
}

Ostil::Ptr<ChannelBase> Pool::allocate(ChannelKind const& kind, Request const& r) {
  CrossingLock const lock;
  if (!m_enabled) return nullptr;
  std::size_t const store = kind.store();
  m_kinds[store] = &kind;
  if (logging()) logRequest(kind, r);
  Stats stats{};
  bool const statsRead = m_requiredFreeEnabled && getMemoryStats(stats);

  Entry entry = bestFit(store, r.tileCount, [&](Held const& held) {
    if (!logging()) return;
    if (ChangeGate::Measurement const gate(channelOf(held.entry).changeGate()); gate)
      readDepths(channelOf(held.entry), held.seen);
    log("Cannot re-use channel because use_count = ", held.entry.useCount(),
        ", ptr->depth() = ", held.seen.depth, ", in_maxDepth = ", r.depth,
        ", ptr->minDepth() = ", held.seen.minDepth, ", in_minDepth = ", r.minDepth);
  });

  bool intoPool = true;
  if (statsRead)
    intoPool = checkMemory(stats, kind, r.tileCount, entry);
  else
    log(" Warning - memStats NOT OK");

  if (entry) {
    reconfigure(kind, r, channelOf(entry));
  } else {
    entry = kind.make(r.defaultValue, r.useStaticAllocation, r.callElementConstructor, r.minDepth, r.depth);
    log(" Creating channel ", entry.get());
  }
  settle(store, entry, intoPool);
  log(" Inserting into pool = ", intoPool);
  countHandOut(entry.get());
  if (logging()) {
    log(" Stats after allocation.begin");
    dumpBoth();
    log(" Stats after allocation.end");
    log(" allocate.end");
  }
  return Ostil::staticCast<ChannelBase>(entry);
}

/// A channel in use is measured as an idle one, unless its holder changes it at this moment.
bool Pool::measure(std::size_t, Entry const& entry, bool, Measure& result) const {
  ChannelBase const& channel = channelOf(entry);
  ChangeGate::Measurement const gate(channel.changeGate());
  if (!gate) return false;
  std::uint64_t used = 0;
  channel.memUse(used, result.bytes, false);
  result.elements = channel.size();
  readDepths(channel, result);
  return true;
}

std::string Pool::describe(std::size_t store, Held const& held) const {
  ChannelKind const& kind = *m_kinds[store];
  std::ostringstream line;
  line << "ChannelPool:Channel<" << kind.typeName << ", " << kind.E << ", " << kind.H << ">("
       << held.seen.minDepth << ", " << held.seen.depth << ", #" << held.seen.elements << ", "
       << toMB(held.seen.elements) << "MB, use_count = " << held.entry.useCount() << ")";
  return line.str();
}

/// Memory that other threads freed stays in their caches until it is flushed.
void Pool::flush(Stats const& stats, Need const& need) const {
  CoutStream out;
  if (logging()) {
    log(" Flushing jemalloc because not enough physical memory was available");
    logPlain(" Physical free = ", toMB(stats.availablePhysical), "MB");
    logPlain(" Physical required = ", toMB(TileTree3D::Internal::saturatingAdd(need.before, need.requested)),
             "MB");
    log(" jemalloc stats before flushing:");
    VLN::Internal::jemalloc_dumpStats(out);
  }
  jemalloc_flushCache();
  if (logging()) {
    log(" jemalloc stats after flushing:");
    VLN::Internal::jemalloc_dumpStats(out);
  }
}

bool Pool::enoughAfterTry(Need const& need) const {
  Stats stats{};
  if (!getMemoryStats(stats)) {
    if (logging()) dump();
    return false;
  }
  if (!need.metBy(stats)) flush(stats, need);
  bool const enough = getMemoryStats(stats) && need.metBy(stats);
  log(enough ? " Enough physical memory is now available: "
             : " Enough physical memory is still not available, need to try again...");
  logFreeAndRequired(stats, need);
  return enough;
}

bool Pool::enoughFromPartner(Need const& need) const {
  RecyclingPool* const arrays = enabledPartner();
  Stats stats{};
  if (!arrays || !getMemoryStats(stats) || need.metBy(stats)) return false;
  flush(stats, need);
  // Enough by now is not counted as success: the caller then keeps its channel out of the pool.
  if (getMemoryStats(stats) && need.metBy(stats)) return false;
  log(" Not enough physical memory available. Calling recursively into ArrayPool.");
  logFreeAndRequired(stats, need);
  arrays->freeMemory(need.remaining(stats));
  getMemoryStats(stats);
  bool const enough = need.metBy(stats);
  log(enough ? " Enough" : " Still not enough",
      " physical memory available after calling recursively into ArrayPool.");
  logFreeAndRequired(stats, need);
  return enough;
}

Pool& pool() {
  static Pool* const p = new Pool;
  return *p;
}

} // namespace

Ostil::Ptr<ChannelBase> Internal::allocate(ChannelKind const& kind, Request const& request) {
  return pool().allocate(kind, request);
}

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

} // namespace VLN::TileTree3D::ChannelPool
