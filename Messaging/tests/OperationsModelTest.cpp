// The operations harness (OperationsHarness.h) on fixed seeded sequences,
// and the library under workers' tear-down while the main thread
// broadcasts, and workers' calls while it terminates. A failing sequence prints its seed and the operations that led
// to the failure; TARN_TEST_SEED=<seed> TARN_TEST_SEQUENCES=1 replays it
// alone, TARN_LONG_TESTS=1 runs a hundred times as many.
#include "DiagnosticsTestSupport.h"
#include "ModelTestSupport.h"
#include "OperationsHarness.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <cstdio>
#include <string>

namespace {

// Sanitized builds run a quarter of the volume: each operation costs twenty to fifty times as much there.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr std::uint64_t kShare = 4;
#else
constexpr std::uint64_t kShare = 1;
#endif

class SeededChoices : public operations_harness::Choices {
public:
  explicit SeededChoices(std::uint64_t inSeed) : mSeed(inSeed), mRandom(inSeed) {}
  std::uint32_t Below(std::uint32_t inBound) override { return mRandom.Below(inBound); }
  bool Exhausted() override { return false; }
  std::string Replay() override { return "seed " + std::to_string(mSeed) + ": replay with TARN_TEST_SEQUENCES=1 TARN_TEST_SEED=" + std::to_string(mSeed); }

private:
  const std::uint64_t mSeed;
  messaging_test::Random mRandom;
};

std::uint64_t Volume(std::uint64_t inNormal) {
  return (messaging_test::LongTestsRequested() ? inNormal * 100 : inNormal) / kShare;
}

TEST(OperationsModelTest, SeededSequencesAgreeWithTheModel) {
  tarn_test::Watchdog watchdog(std::chrono::seconds(100));
  // The sequences end with stations retained on purpose; the harness fails on any report.
  const messaging_test::SilentFailureReportsSetting quiet(Tarn::Diagnostics::SilentFailureReports::kOff);
  const std::uint64_t first = messaging_test::EnvironmentNumber("TARN_TEST_SEED", 0x5eed0000);
  const std::uint64_t sequences = messaging_test::EnvironmentNumber("TARN_TEST_SEQUENCES", Volume(6000));
  for (std::uint64_t seed = first; seed < first + sequences; ++seed) {
    SeededChoices choices(seed);
    const std::string failure = operations_harness::RunSequence(choices, 20 + static_cast<int>(seed % 41));
    ASSERT_EQ(failure, "") << choices.Replay();
  }
  const operations_harness::Statistics& ran = operations_harness::sStatistics;  // for the record
  std::printf("%llu sequences; %lld calls drew a failing allocation, %lld threw std::bad_alloc; the main thread moved %lld times\n",
              static_cast<unsigned long long>(sequences), ran.mFailingCalls, ran.mThrown, ran.mMoves);
}

TEST(OperationsModelTest, StationsAndListenersTornDownOnWorkersWhileTheMainThreadBroadcastsAndTerminates) {
  tarn_test::Watchdog watchdog(std::chrono::seconds(100));
  // The sequences end with stations retained on purpose; the harness fails on any report.
  const messaging_test::SilentFailureReportsSetting quiet(Tarn::Diagnostics::SilentFailureReports::kOff);
  const auto seed = static_cast<std::uint32_t>(messaging_test::EnvironmentNumber("TARN_TEST_SEED", 0x5eed0000));
  EXPECT_EQ(operations_harness::RunConcurrent(static_cast<int>(Volume(8000)), seed), "");
}

}  // namespace
