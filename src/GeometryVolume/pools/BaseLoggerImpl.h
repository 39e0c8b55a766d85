// What the accounting and the report of the object logger share.
#pragma once

#include "GeometryVolume/core/FunctionRef.h"
#include "Ostil/String.h"

#include <array>
#include <atomic>
#include <cstdint>
#include <map>

namespace VLN {

class Base;

namespace Internal {

/// In the order of the report.
enum LoggerCounter : std::size_t {
  kAllocOK,
  kAllocNotOK,
  kDeAllocOK,
  kDeAllocNotOK,
  kVoidAllocOK,
  kVoidAllocNotOK,
  kVoidDeAllocOK,
  kVoidDeAllocNotOK,
  kLoggerCounterCount
};

std::array<std::int32_t, kLoggerCounterCount> loggerCounters();

/// All objects of one name.
struct NameSummary {
  void const* base = nullptr; ///< The one registered first.
  std::int32_t number = 0;    ///< Its registration number.
  std::uint64_t size = 0;     ///< Bytes in use of that object.
  std::int32_t objects = 0;
  std::int32_t deepCopies = 0;
  std::uint64_t used = 0, allocated = 0; ///< Bytes of all of them.
};

/// Measures all registered objects.
/// @pre The logger is on, else the deep copies read 0.
std::map<Ostil::String, NameSummary> summarizeNames();

class LoggerDumpScope {
public:
  LoggerDumpScope();
  ~LoggerDumpScope();
  LoggerDumpScope(LoggerDumpScope const&) = delete;
  LoggerDumpScope& operator=(LoggerDumpScope const&) = delete;
};

inline constexpr char const* kPooledName = "channel_pool";
inline constexpr char const* kScratchName = "voxel_tile_tree_thread_local";
inline constexpr char const* kTreeName = "voxel_tile_tree";

} // namespace Internal
} // namespace VLN
