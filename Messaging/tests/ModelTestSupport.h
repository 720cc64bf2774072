// Support for the randomized and soak suites: environment knobs and a
// deterministic random source.
//
// Environment:
//   TARN_LONG_TESTS=1        longer runs
//   TARN_TEST_SEED=N         first seed (replays a failure)
//   TARN_TEST_SEQUENCES=N    number of sequences (1 to replay one)
//
// Threading: a Random is used by one thread at a time; the functions only
// read the environment.
#pragma once

#include "TestSupport.h"

#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <random>

namespace messaging_test {

// The value of an unsigned environment variable, or inDefault when it is not
// set or not a number.
inline std::uint64_t EnvironmentNumber(const char* inName, std::uint64_t inDefault) {
  const char* value = std::getenv(inName);
  char* end = nullptr;
  const unsigned long long number = value != nullptr ? std::strtoull(value, &end, 0) : 0;
  return end != nullptr && end != value && *end == '\0' ? number : inDefault;
}

inline bool LongTestsRequested() { return EnvironmentNumber("TARN_LONG_TESTS", 0) != 0; }

// A seeded generator; std::mt19937_64 and plain arithmetic give the same
// sequence on every platform (the standard distributions do not).
class Random {
public:
  explicit Random(std::uint64_t inSeed) : mEngine(inSeed) {}
  std::uint32_t Below(std::uint32_t inBound) { return static_cast<std::uint32_t>(mEngine() % inBound); }  // inBound > 0

private:
  std::mt19937_64 mEngine;
};

}  // namespace messaging_test
