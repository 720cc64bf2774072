// Support for the randomized and soak suites: environment knobs and a
// deterministic random source.
//
// Environment:
//   TARN_LONG_TESTS=1        longer runs
//   TARN_TEST_SEED=N         first seed (replays a failure)
//   TARN_TEST_SEQUENCES=N    number of sequences (1 to replay one)
//   TARN_SOAK_SECONDS=N      duration of the soak suites
//
// Threading: a Random is used by one thread at a time; the functions read
// the environment only.
#pragma once

#include "TestSupport.h"

#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <random>

namespace messaging_test {

// Whether this build runs under a sanitizer: each operation then costs
// twenty to fifty times as much, and the suites scale their volume down.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool kSanitizedBuild = true;
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
constexpr bool kSanitizedBuild = true;
#else
constexpr bool kSanitizedBuild = false;
#endif
#else
constexpr bool kSanitizedBuild = false;
#endif

inline bool LongTestsRequested() {
  const char* value = std::getenv("TARN_LONG_TESTS");
  return value != nullptr && value[0] != '\0' && value[0] != '0';
}

// The value of an unsigned environment variable, or inDefault when it is not
// set or not a number.
inline std::uint64_t EnvironmentNumber(const char* inName, std::uint64_t inDefault) {
  const char* value = std::getenv(inName);
  if (value == nullptr || value[0] == '\0') return inDefault;
  char* end = nullptr;
  const unsigned long long number = std::strtoull(value, &end, 0);
  return end != nullptr && *end == '\0' ? number : inDefault;
}

// Duration of a soak suite: TARN_SOAK_SECONDS, else inDefault (long mode:
// two minutes).
inline std::chrono::milliseconds SoakDuration(std::chrono::milliseconds inDefault) {
  const std::uint64_t seconds = EnvironmentNumber("TARN_SOAK_SECONDS", 0);
  if (seconds != 0) return std::chrono::seconds(seconds);
  return LongTestsRequested() ? std::chrono::milliseconds(std::chrono::minutes(2)) : inDefault;
}

// A seeded generator; std::mt19937_64 and plain arithmetic give the same
// sequence on every platform (the standard distributions do not).
class Random {
public:
  explicit Random(std::uint64_t inSeed) : mEngine(inSeed) {}
  // Uniform in [0, inBound); inBound > 0.
  std::uint32_t Below(std::uint32_t inBound) { return static_cast<std::uint32_t>(mEngine() % inBound); }

private:
  std::mt19937_64 mEngine;
};

}  // namespace messaging_test
