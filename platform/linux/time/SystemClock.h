#pragma once

#include "platform/Clock.h"
#include "platform/RandomSource.h"

namespace tavrin {

// The real clock and a real random source (thread-safe, process-wide).
Clock& SystemClock();
RandomSource& SystemRandom();

}  // namespace tavrin
