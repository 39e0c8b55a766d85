#include "GeometryVolume/core/Canceller.h"

#include "Velorn/ExceptionMessage.h"

#include <cstdlib>
#include <stdexcept>

namespace VLN {

namespace {

int armedAtLoad() {
  char const* value = std::getenv("VELORN_TERMINATION_TEST");
  return value ? std::atoi(value) : 0;
}

int g_armed = armedAtLoad();

} // namespace

int Canceller::getCancelID() { return g_armed; }
void Canceller::setCancelID(int id) { g_armed = id; }

void Canceller::cancelID(ID const& id) {
  if (id == g_armed) throw std::runtime_error(exceptionMessage);
}

} // namespace VLN
