#pragma once

#include <functional>

namespace VLN::Interop {

/// Told now and then how far long work is: what is being done, and the share that is done, 0 to 1.
/// Empty: nobody is told. It is called by the thread that started the work, never by two threads at once.
using Progress = std::function<void(char const* stage, double done)>;

} // namespace VLN::Interop
