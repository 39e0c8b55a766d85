#include "GeometryVolume/sampling/VoxelSamplerLogger.h"

#include <algorithm>
#include <array>
#include <deque>
#include <iostream>
#include <set>
#include <vector>

#include <tbb/concurrent_hash_map.h>

namespace VLN::TileTree3D {

namespace {

using Log = tbb::concurrent_hash_map<std::uint64_t, std::vector<TreeIndex>>;

// Never destroyed: a thread that ends late may still log.
Log& theLog() {
  static Log* const log = new Log;
  return *log;
}

constexpr std::size_t kCacheSizes = 20;

std::uint64_t missesOf(std::vector<TreeIndex> const& accesses, std::size_t size) {
  std::deque<TreeIndex> cache;
  std::uint64_t misses = 0;
  for (TreeIndex const& tile : accesses) {
    if (std::find(cache.begin(), cache.end(), tile) != cache.end()) continue;
    ++misses;
    cache.push_back(tile);
    if (cache.size() > size) cache.pop_front();
  }
  return misses;
}

} // namespace

VoxelSamplerLogger& VoxelSamplerLogger::operator=(VoxelSamplerLogger const&) = default;
VoxelSamplerLogger& VoxelSamplerLogger::operator=(VoxelSamplerLogger&&) noexcept = default;

void VoxelSamplerLogger::beginLog() { theLog().clear(); }

void VoxelSamplerLogger::logTile(TreeIndex const& tile, std::uint64_t key) {
  Log::accessor entry;
  theLog().insert(entry, key);
  entry->second.push_back(tile);
}

void VoxelSamplerLogger::endLog() {
  Log& log = theLog();
  std::cout << "Found " << log.size() << " number of logs" << std::endl;
  std::uint64_t total = 0, unique = 0;
  std::array<std::uint64_t, kCacheSizes> misses{};
  for (auto const& entry : log) {
    auto const& accesses = entry.second;
    total += accesses.size();
    unique += std::set<TreeIndex>(accesses.begin(), accesses.end()).size();
    for (std::size_t size = 0; size < kCacheSizes; ++size) misses[size] += missesOf(accesses, size);
  }
  if (total > 0) {
    std::cout << " num accesses per tile = " << static_cast<float>(total) / static_cast<float>(unique)
              << std::endl;
    for (std::size_t size = 0; size < kCacheSizes; ++size)
      std::cout << " cache miss percentage with LRU cache size " << size << " = "
                << static_cast<float>(misses[size]) / static_cast<float>(unique) - 1.0f << std::endl;
  }
  log.clear();
}

} // namespace VLN::TileTree3D
