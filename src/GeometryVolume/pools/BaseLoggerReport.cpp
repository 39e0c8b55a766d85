#include "GeometryVolume/pools/BaseLogger.h"
#include "GeometryVolume/pools/BaseLoggerImpl.h"
#include "GeometryVolume/pools/Jemalloc.h"
#include "GeometryVolume/pools/PoolLogImpl.h"
#include "GeometryVolume/pools/PoolUtils.h"
#include "GeometryVolume/pools/RecyclingPoolImpl.h"

#include <charconv>
#include <optional>
#include <string_view>

namespace VLN {

namespace {

using TileTree3D::Internal::RecyclingPool;
using TileTree3D::Internal::writeLine;
using TileTree3D::PoolUtils::toMB;

std::uint64_t less(std::uint64_t a, std::uint64_t b) { return a > b ? a - b : 0; }

/// The number of bytes behind a label of the statistics text.
std::optional<std::uint64_t> bytesAfter(std::string_view text, std::string_view label) {
  auto at = text.find(label);
  if (at == std::string_view::npos) return {};
  at = text.find_first_not_of(" \t", at + label.size());
  if (at == std::string_view::npos) return {};
  std::uint64_t value = 0;
  auto const [end, error] = std::from_chars(text.data() + at, text.data() + text.size(), value);
  return error == std::errc{} ? std::optional(value) : std::nullopt;
}

class TextStream final : public Internal::jemalloc_stream {
public:
  void write(char const* text, std::uint64_t length) override { all.append(text, length); }
  Ostil::String all;
};

/// Bytes that data takes: the objects, and the channels of the pool beside them.
struct DataUse {
  std::uint64_t used = 0, allocated = 0, pooled = 0;
  std::uint64_t total() const { return allocated + pooled; }
};

void reportCounters() {
  constexpr char const* kNames[] = {"numAllocOK",       "numAllocNotOK",      "numDeAllocOK",
                                    "numDeAllocNotOK",  "numVoidAllocOK",     "numVoidAllocNotOK",
                                    "numVoidDeAllocOK", "numVoidDeAllocNotOK"};
  static_assert(std::size(kNames) == Internal::kLoggerCounterCount);
  writeLine("BaseLogger.allocationStats.begin");
  auto const values = Internal::loggerCounters();
  for (std::size_t i = 0; i < values.size(); ++i) writeLine(" ", kNames[i], " = ", values[i]);
  writeLine("BaseLogger.allocationStats.end");
}

DataUse reportNames() {
  DataUse data;
  writeLine("BaseLogger.names.begin");
  for (auto const& [name, s] : Internal::summarizeNames()) {
    writeLine("size = ", toMB(s.size), "MB base = ", name, ", #shallow copies (incl orig) = ", s.objects,
              ", #deep copies (excl orig) = ", s.deepCopies,
              ", total mem usage (incl all deep copies) = ", toMB(s.used), "MB");
    if (name != Internal::kScratchName && name != Internal::kPooledName)
      data.used += s.used, data.allocated += s.allocated;
  }
  writeLine("BaseLogger.names.end");
  return data;
}

void reportData(DataUse const& data) {
  writeLine("Total mem occupied by data: used = ", toMB(data.used), "MB (allocated = ", toMB(data.allocated),
            ")");
  if (data.pooled == 0)
    writeLine("Total mem occupied by channel pool = 0");
  else
    writeLine("Total mem occupied by channel pool = ", toMB(data.pooled),
              "MB = ", 100.0f * static_cast<float>(data.pooled) / static_cast<float>(data.total()),
              "% of total mem usage");
}

void reportAllocator(DataUse const& data) {
  TextStream text;
  Internal::jemalloc_dumpStats(text);
  auto const active = bytesAfter(text.all, "active:"), mapped = bytesAfter(text.all, "mapped:");
  if (!active || !mapped) return;
  writeLine("Total jemalloc mem active = ", toMB(*active), "MB");
  writeLine("Total jemalloc mem mapped = ", toMB(*mapped), "MB");
  if (*active < data.total()) return writeLine("Jemalloc does not appear to be used by data");
  std::uint64_t const activeOverhead = *active - data.total(), mappedOverhead = less(*mapped, data.total());
  writeLine("Total jemalloc mem occupied by data: used = ", toMB(data.used + data.pooled),
            "MB (allocated = ", toMB(data.total()), ")");
  writeLine("Total jemalloc mem overhead (active) = ", toMB(activeOverhead), "MB");
  writeLine("Total jemalloc mem overhead (mapped) = ", toMB(mappedOverhead), "MB");
  writeLine("Total mem occupied by data and jemalloc overhead = ", toMB(data.total() + activeOverhead),
            "MB (active),  ", toMB(data.total() + mappedOverhead), "MB (mapped)");
}

void reportPhysical(DataUse const& data) {
  std::uint64_t const available = RecyclingPool::availablePhysicalMemory();
  std::uint64_t const total = RecyclingPool::totalPhysicalMemory();
  writeLine("Total physical mem available = ", toMB(available), "MB");
  writeLine("Total used mem not used by data = ", toMB(less(less(total, available), data.total())), "MB");
}

} // namespace

void BaseLogger::dump() {
  Internal::LoggerDumpScope const scope;
  reportCounters();
  DataUse data = reportNames();
  // Asked outside the logger's lock: the pool's own lock is held while channels are made.
  if (auto const* channels = RecyclingPool::find(RecyclingPool::Kind::kChannels))
    data.pooled = channels->allocatedMemory();
  writeLine("BaseLogger.stats.begin");
  reportData(data);
  reportAllocator(data);
  reportPhysical(data);
  writeLine("Number of copies registered = ", numberOfCopies());
  writeLine("Number of active copies = ", numberOfActiveCopies());
  writeLine("=================");
  writeLine("=================");
  writeLine("BaseLogger.stats.end");
}

} // namespace VLN
