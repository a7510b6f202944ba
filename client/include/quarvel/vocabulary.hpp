#pragma once

// The codes that messages and sessions carry, and the service's names for them.
#include "base/Vocabulary.h"
