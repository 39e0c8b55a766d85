#pragma once

#include "Ostil/Export.h"
