// A process that hands its work over to a child and ends as the child does.
#pragma once

#include <sys/types.h>

namespace VLN::Interop {

/// Whether goOnInReader() was called, and this process has no threads but those that it had then: others
/// would not exist in a child.
bool mayGoOn();
/// Tells that this process is the child, which goes on once only.
void goneOn();

/// Tells the child by a byte to go on, waits for it, and ends as it does, by the same code or signal. Signals
/// that are sent to this process alone are passed on; those of the terminal reach the child by themselves.
[[noreturn]] void endAs(pid_t child, int end);

} // namespace VLN::Interop
