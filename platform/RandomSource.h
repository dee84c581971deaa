#pragma once

#include <cstdint>

namespace tavrin {

// Source of randomness, replaceable in tests.
class RandomSource {
 public:
  virtual ~RandomSource() = default;
  // A uniformly distributed integer in [0, bound); bound > 0.
  virtual uint64_t UniformBelow(uint64_t bound) = 0;
};

}  // namespace tavrin
