// What the thread sanitizer must be told of the task scheduler, whose library it does not see into: that what
// the thread which starts a loop has done happens before each chunk, and each chunk before the loop's end.
//
// Without it every loop would look like a race, and the suppressions against that would hide the real ones.
// In other builds nothing of it remains.
#pragma once

#ifndef VLN_THREAD_NOTES // given to the source that is not instrumented
#if defined(__SANITIZE_THREAD__)
#define VLN_THREAD_NOTES 1
#else
#define VLN_THREAD_NOTES 0
#endif
#endif
#if VLN_THREAD_NOTES
#include <sanitizer/tsan_interface.h>
#endif

namespace VLN::Internal {

/// A loop's hand-over. Lives on the starting thread from before the loop to behind it, also when it throws.
class HandOver {
public:
#if VLN_THREAD_NOTES
  HandOver() { __tsan_release(&m_fork); }
  ~HandOver() { __tsan_acquire(&m_join); }
#else
  HandOver() = default;
#endif
  HandOver(HandOver const&) = delete;
  HandOver& operator=(HandOver const&) = delete;

  /// Lives while a chunk runs. Chunks are not ordered among each other: the two ends have an address each.
  class Chunk {
  public:
#if VLN_THREAD_NOTES
    explicit Chunk(HandOver& loop)
        : m_loop(loop) {
      __tsan_acquire(&m_loop.m_fork);
    }
    ~Chunk() { __tsan_release(&m_loop.m_join); }
#else
    explicit Chunk(HandOver&) {}
#endif
    Chunk(Chunk const&) = delete;
    Chunk& operator=(Chunk const&) = delete;

#if VLN_THREAD_NOTES
  private:
    HandOver& m_loop;
#endif
  };

#if VLN_THREAD_NOTES
private:
  char m_fork = 0, m_join = 0;
#endif
};

} // namespace VLN::Internal
