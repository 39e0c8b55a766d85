#include "GeometryVolume/core/Streaming.h"

#include <algorithm>
#include <ostream>

namespace VLN::Streaming {

namespace {

IndexInfo const& slots() {
  static IndexInfo const s{std::ios_base::xalloc(), std::ios_base::xalloc(), std::ios_base::xalloc(),
                           std::ios_base::xalloc()};
  return s;
}
// Taken at load, so that a stream configured early and one configured late agree on the slots.
[[maybe_unused]] IndexInfo const& g_takenAtLoad = slots();

long& indent(std::ostream& os) { return os.iword(slots().indent); }

} // namespace

Ostil::String pad(std::ostream& os) {
  // Read one after the other: a look at a further slot may move the storage of all.
  long const levels = indent(os);
  long const spaces = levels * os.iword(slots().padWidth);
  return Ostil::String(static_cast<std::size_t>(std::max(0L, spaces)), ' ');
}

void currentPad(std::ostream& os, Ostil::String& out) { out = pad(os); }

void incPad(std::ostream& os, Ostil::String& out) {
  incIndent(os, 1);
  currentPad(os, out);
}

void decPad(std::ostream& os, Ostil::String& out) {
  decIndent(os, 1);
  currentPad(os, out);
}

void incIndent(std::ostream& os, long n) { indent(os) += n; }

void decIndent(std::ostream& os, long n) { indent(os) = n > indent(os) ? 0 : indent(os) - n; }

void setPadWidth(std::ostream& os, long width) { os.iword(slots().padWidth) = width; }

bool dumpRef(std::ostream& os) { return os.iword(slots().dumpRef) == 1; }

void setDumpRef(std::ostream& os, bool on) { os.iword(slots().dumpRef) = on ? 1 : 0; }

void getDumpInfo(std::ostream& os, DumpInfo& out) {
  out.pad = pad(os);
  out.indent = static_cast<std::int32_t>(indent(os));
  out.padWidth = static_cast<std::int32_t>(os.iword(slots().padWidth));
  out.third = static_cast<std::int32_t>(os.iword(slots().third));
  out.dumpRef = dumpRef(os);
}

void getIndexInfo(IndexInfo& out) { out = slots(); }

} // namespace VLN::Streaming
