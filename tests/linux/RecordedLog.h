#pragma once

#include <string>

#include "tests/linux/Collected.h"

namespace quarvel {

/// The error lines written so far; it takes the log's place in this program.
Collected<std::string>& RecordedErrors();

}  // namespace quarvel
