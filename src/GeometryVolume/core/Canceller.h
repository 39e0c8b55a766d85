// Canceller: ends a test run at a chosen kind of place.
#pragma once

#include "GeometryVolume/core/Export.h"

namespace VLN {

/// Long operations call cancelID() with a fixed ID at their checkpoints; the one that equals the armed ID
/// throws. The environment variable VELORN_TERMINATION_TEST arms an ID at load. Real cancellation is the
/// host's Ostil::isJobCancelled().
/// @threads The armed ID is a plain value: set it while no checkpoint runs.
class VLN_API Canceller {
public:
  enum ID : int { kNone = 0, kTest = 1, kTraverse = 2, kRefine = 3 };

  static int getCancelID();
  static void setCancelID(int id);
  /// @error Throws std::runtime_error with the text VLN::exceptionMessage when `id` is armed.
  static void cancelID(ID const& id);
};

} // namespace VLN
