// Support for the randomized, model-based and soak suites: how many random
// sequences to run and from which seed, a helper thread that runs one
// operation at a time for a single-threaded test, and a deterministic random
// source.
//
//   const messaging_test::RandomRun run = messaging_test::RandomRun::FromEnvironment(10000, 0x5eed);
//   messaging_test::SequentialExecutor other;       // the "not main" thread
//   for (std::uint64_t i = 0; i < run.mSequences; ++i) {
//     const std::uint64_t seed = run.SeedOf(i);
//     SCOPED_TRACE(messaging_test::ReplayHint(seed));
//     messaging_test::Random random(seed);
//     other.Run([&] { /* one operation, off the main thread */ });
//   }
//
// Environment:
//   TARN_LONG_TESTS=1        many more sequences (and a random first seed)
//   TARN_TEST_SEED=N         first sequence's seed (replays a failure)
//   TARN_TEST_SEQUENCES=N    number of sequences (1 to replay one)
//   TARN_SOAK_SECONDS=N      duration of the soak suites
//
// Threading: SequentialExecutor::Run is called from one thread (the test's);
// it hands the operation to its own thread and waits for it, so the
// operations of a sequence never overlap and the sequence stays
// deterministic. An operation that does not return within the deadline
// stops the process, naming the test (a deadlock must not hang the run).
#pragma once

#include "TestSupport.h"

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <functional>
#include <mutex>
#include <random>
#include <string>
#include <thread>
#include <utility>

namespace messaging_test {

// ---------------------------------------------------------------------------
// Environment

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

// How many random sequences a suite runs and where their seeds start. Each
// sequence's seed is the first seed plus its index, so any failing sequence
// can be replayed alone with TARN_TEST_SEED=<its seed> TARN_TEST_SEQUENCES=1.
struct RandomRun {
  std::uint64_t mFirstSeed;
  std::uint64_t mSequences;

  // inSequences in the normal run (a fixed first seed, so that CI is
  // reproducible; a fifth of them under a sanitizer), a hundred times as
  // many in long mode (from a fresh seed each time, so that long runs
  // explore new ground).
  static RandomRun FromEnvironment(std::uint64_t inSequences, std::uint64_t inDefaultSeed) {
    const bool longRun = LongTestsRequested();
    if (kSanitizedBuild) inSequences /= 5;
    const std::uint64_t firstSeed =
        EnvironmentNumber("TARN_TEST_SEED", longRun ? (std::uint64_t{std::random_device{}()} << 32) ^ std::random_device{}()
                                                    : inDefaultSeed);
    const std::uint64_t sequences = EnvironmentNumber("TARN_TEST_SEQUENCES", longRun ? inSequences * 100 : inSequences);
    return RandomRun{firstSeed, sequences};
  }
  std::uint64_t SeedOf(std::uint64_t inIndex) const { return mFirstSeed + inIndex; }
};

// The line a failing sequence prints: how to run it again by itself.
inline std::string ReplayHint(std::uint64_t inSeed) {
  return "replay with TARN_TEST_SEED=" + std::to_string(inSeed) + " TARN_TEST_SEQUENCES=1";
}

// Duration of a soak suite: TARN_SOAK_SECONDS, else inDefault (long mode:
// two minutes).
inline std::chrono::milliseconds SoakDuration(std::chrono::milliseconds inDefault) {
  const std::uint64_t seconds = EnvironmentNumber("TARN_SOAK_SECONDS", 0);
  if (seconds != 0) return std::chrono::seconds(seconds);
  return LongTestsRequested() ? std::chrono::milliseconds(std::chrono::minutes(2)) : inDefault;
}

// ---------------------------------------------------------------------------
// Random source

// A seeded generator with the few draws the suites need. std::mt19937_64 and
// the arithmetic below give the same sequence on every platform (the standard
// distributions do not).
class Random {
public:
  explicit Random(std::uint64_t inSeed) : mEngine(inSeed) {}

  // Uniform in [0, inBound); inBound > 0.
  std::uint32_t Below(std::uint32_t inBound) { return static_cast<std::uint32_t>(mEngine() % inBound); }
  // Uniform in [inLow, inHigh].
  int Between(int inLow, int inHigh) {
    return inLow + static_cast<int>(Below(static_cast<std::uint32_t>(inHigh - inLow + 1)));
  }
  // True with probability inPercent / 100.
  bool Percent(std::uint32_t inPercent) { return Below(100) < inPercent; }
  std::uint64_t Next() { return mEngine(); }

  // An index drawn with the given weights (which must not all be 0).
  template <std::size_t N>
  std::size_t Weighted(const std::uint32_t (&inWeights)[N]) {
    std::uint32_t total = 0;
    for (std::uint32_t weight : inWeights) total += weight;
    std::uint32_t pick = Below(total);
    for (std::size_t i = 0; i < N; ++i) {
      if (pick < inWeights[i]) return i;
      pick -= inWeights[i];
    }
    return N - 1;
  }

private:
  std::mt19937_64 mEngine;
};

// ---------------------------------------------------------------------------
// The other thread of a single-threaded sequence

// A thread that runs the operations handed to it one at a time, while the
// handing thread waits. It lets a deterministic test call the library "from
// another thread" without any concurrency. An exception thrown by an
// operation is rethrown by Run on the handing thread.
//
// Both sides spin briefly before they sleep: a random sequence hands over
// tens of thousands of operations, and a condition variable's wake-up alone
// would dominate its running time.
class SequentialExecutor {
public:
  SequentialExecutor() : mThread([this] { Serve(); }) {}
  SequentialExecutor(const SequentialExecutor&) = delete;
  SequentialExecutor& operator=(const SequentialExecutor&) = delete;
  ~SequentialExecutor() {
    {
      std::lock_guard<std::mutex> lock(mMutex);
      mQuit.store(true);
    }
    mChanged.notify_all();
    mThread.join();
  }

  // Runs inOperation on the executor's thread and returns when it has
  // returned (or rethrows what it threw).
  void Run(std::function<void()> inOperation) {
    mOperation = std::move(inOperation);
    mError = nullptr;
    {
      std::lock_guard<std::mutex> lock(mMutex);
      mRequested.fetch_add(1, std::memory_order_release);
    }
    mChanged.notify_all();
    const std::uint64_t wanted = mRequested.load(std::memory_order_relaxed);
    if (!SpinUntil([&] { return mCompleted.load(std::memory_order_acquire) == wanted; })) {
      std::unique_lock<std::mutex> lock(mMutex);
      if (!mChanged.wait_for(lock, kDeadline, [&] { return mCompleted.load(std::memory_order_acquire) == wanted; })) {
        detail::AbortNamingTheTest("an operation on the helper thread did not return (deadlock?)");
      }
    }
    mOperation = nullptr;
    if (mError) std::rethrow_exception(std::exchange(mError, nullptr));
  }

  std::thread::id Id() const { return mThread.get_id(); }

private:
  template <class Predicate>
  static bool SpinUntil(Predicate inDone) {
    for (int round = 0; round < 2000; ++round) {
      if (inDone()) return true;
      std::this_thread::yield();
    }
    return inDone();
  }

  void Serve() {
    std::uint64_t served = 0;
    for (;;) {
      const auto pending = [&] { return mQuit.load() || mRequested.load(std::memory_order_acquire) != served; };
      if (!SpinUntil(pending)) {
        std::unique_lock<std::mutex> lock(mMutex);
        mChanged.wait(lock, pending);
      }
      if (mQuit.load()) return;
      ++served;
      std::function<void()> operation = mOperation;
      try {
        operation();
      } catch (...) {
        mError = std::current_exception();
      }
      operation = nullptr;  // whatever the operation captured is released here, on this thread
      {
        std::lock_guard<std::mutex> lock(mMutex);
        mCompleted.store(served, std::memory_order_release);
      }
      mChanged.notify_all();
    }
  }

  // Handed over through mRequested and mCompleted: written by one side
  // while the other waits.
  std::function<void()> mOperation;
  std::exception_ptr mError;
  std::mutex mMutex;
  std::condition_variable mChanged;
  std::atomic<std::uint64_t> mRequested{0};
  std::atomic<std::uint64_t> mCompleted{0};
  std::atomic<bool> mQuit{false};
  std::thread mThread;  // last: starts once the members above exist
};

// Runs the seeded sequences of a model test, inSequences of them by default
// (the environment may change the count and the first seed): each of 20 to 60
// random steps, then its final checks; after each, no small block may be
// left in use. Prints the figures. Sequence is made from (seed, helper) and
// has Run(steps) and Finish().
template <class Sequence>
void RunRandomSequences(const char* inWhat, std::uint64_t inSequences, std::uint64_t inFirstSeed) {
  const RandomRun run = RandomRun::FromEnvironment(inSequences, inFirstSeed);
  SequentialExecutor helper;
  const std::size_t baseline = kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse;
  const auto start = std::chrono::steady_clock::now();
  std::uint64_t steps = 0;
  std::uint64_t index = 0;
  for (; index < run.mSequences && !::testing::Test::HasFailure(); ++index) {
    const std::uint64_t seed = run.SeedOf(index);
    SCOPED_TRACE(ReplayHint(seed));
    {
      Sequence sequence(seed, helper);
      const int length = Random(seed ^ 0x9e3779b97f4a7c15ull).Between(20, 60);
      sequence.Run(length);
      steps += static_cast<std::uint64_t>(length);
      sequence.Finish();
    }
    ASSERT_EQ(kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse, baseline)
        << "small blocks leaked by the sequence";
  }
  const double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  std::printf("[ figures  ] %llu random %s sequences (%llu steps) in %.2f s, first seed %llu\n",
              static_cast<unsigned long long>(index), inWhat, static_cast<unsigned long long>(steps), seconds,
              static_cast<unsigned long long>(run.mFirstSeed));
}

}  // namespace messaging_test
