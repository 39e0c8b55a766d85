// Indentation of dumps, kept in the stream itself.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "Ostil/String.h"

#include <cstdint>
#include <iosfwd>

/// State of four slots that every stream carries; a stream never configured has pad width 0 and so an empty
/// pad.
/// @threads State belongs to the stream.
namespace VLN::Streaming {

struct IndexInfo {
  std::int32_t indent, padWidth, third, dumpRef;
};

struct DumpInfo {
  Ostil::String pad;
  std::int32_t indent = 0, padWidth = 0, third = 0;
  bool dumpRef = false;
};

/// `out` becomes indent x pad width spaces.
VLN_API void currentPad(std::ostream& os, Ostil::String& out);
/// Adds 1 to the indent, then currentPad().
VLN_API void incPad(std::ostream& os, Ostil::String& out);
/// Takes 1 from the indent, not below 0, then currentPad().
VLN_API void decPad(std::ostream& os, Ostil::String& out);
VLN_API void incIndent(std::ostream& os, long n);
/// Takes `n` from the indent; the indent becomes 0 when `n` exceeds it.
VLN_API void decIndent(std::ostream& os, long n);
/// Spaces for each indent level.
VLN_API void setPadWidth(std::ostream& os, long width);
VLN_API bool dumpRef(std::ostream& os);
VLN_API void setDumpRef(std::ostream& os, bool on);
VLN_API void getDumpInfo(std::ostream& os, DumpInfo& out);
VLN_API void getIndexInfo(IndexInfo& out);

/// The current pad by value.
VLN_API Ostil::String pad(std::ostream& os);

} // namespace VLN::Streaming
