// What the library tells the object logger. The logger itself lives elsewhere and installs its table once it
// is enabled; with no table each hook costs one test. Switched off again it leaves a table that does not
// record, so that it still hears which of the objects that it knows are gone.
#pragma once

#include "GeometryVolume/core/Export.h"
#include "GeometryVolume/core/detail/Atomic.h"

namespace VLN {

class Base;

struct LoggerHooks {
  void (*baseBuilt)(Base const*);
  void (*baseDestroyed)(Base const*);
  void (*pointerAllocated)(void const* block, Base const* owner);
  void (*pointerDeAllocated)(void const* block, Base const* owner);
  void (*pointerReAllocated)(void const* from, void const* to);
  bool (*isDumpInProgress)();
  /// May be null in a table of one's own.
  void (*baseIncomplete)(Base const*) = nullptr;
  void (*baseComplete)(Base const*) = nullptr;
  void (*baseRenamed)(Base const*) = nullptr;
  /// Without it nothing is told but destruction, new names, and blocks that go or move.
  bool recording = true;
};

namespace Internal {
/// Null until logging is first turned on. Readers only test and call: the table is never freed.
extern VLN_API VLN::Internal::Atomic<LoggerHooks const*> g_loggerHooks;
} // namespace Internal

namespace Internal {
inline LoggerHooks const* anyLoggerHooks() { return g_loggerHooks.loadRelaxed(); }
} // namespace Internal

/// Null while logging is off.
inline LoggerHooks const* loggerHooks() {
  auto const* hooks = Internal::anyLoggerHooks();
  return hooks && hooks->recording ? hooks : nullptr;
}

inline bool loggingEnabled() { return loggerHooks() != nullptr; }
inline bool loggerDumpInProgress() {
  auto const* hooks = loggerHooks();
  return hooks && hooks->isDumpInProgress();
}
/// Every class of ours whose memUse() reads members tells when it is complete. One that never does is
/// measured by reports of the thread that made it; other threads cannot know when it is. Between
/// objectIncomplete() and objectComplete(), which may nest, a report that another thread writes does not ask
/// the object for its size. A base class tells the first in its constructors; the class that completes it
/// tells the second at the end of its constructors, and the first again at the beginning of its destructor.
inline void objectIncomplete(Base const* base) {
  if (auto const* hooks = loggerHooks(); hooks && hooks->baseIncomplete) hooks->baseIncomplete(base);
}
inline void objectComplete(Base const* base) {
  if (auto const* hooks = loggerHooks(); hooks && hooks->baseComplete) hooks->baseComplete(base);
}
/// Both, around a change.
class ObjectChange {
public:
  explicit ObjectChange(Base const* base)
      : m_base(base) {
    objectIncomplete(base);
  }
  ~ObjectChange() { objectComplete(m_base); }
  ObjectChange(ObjectChange const&) = delete;
  ObjectChange& operator=(ObjectChange const&) = delete;

private:
  Base const* m_base;
};

inline void pointerAllocated(void const* block, Base const* owner) {
  if (auto const* hooks = loggerHooks()) hooks->pointerAllocated(block, owner);
}
inline void pointerDeAllocated(void const* block, Base const* owner) {
  if (auto const* hooks = Internal::anyLoggerHooks()) hooks->pointerDeAllocated(block, owner);
}
inline void pointerReAllocated(void const* from, void const* to) {
  if (auto const* hooks = Internal::anyLoggerHooks()) hooks->pointerReAllocated(from, to);
}

} // namespace VLN
