#include "Velorn/ExceptionMessage.h"

namespace VLN {

char const* const exceptionMessage = "the job was cancelled";

} // namespace VLN
