// TimeStamp: the steady clock in milliseconds, or a clock installed by a test.
//
// The real-clock path costs one relaxed load of gTestClockSet beyond reading
// the clock; only while a test clock is installed is the mutex taken.
#include <TarnFoundation/TimeStamp.h>

#include <atomic>
#include <chrono>
#include <mutex>

namespace Tarn {

namespace {

std::atomic<bool> gTestClockSet{false};

struct TestClock {
  std::mutex mutex;
  std::function<double()> clock;  // guarded by mutex
};

// Never destroyed, so that time stamps made during static destruction work.
TestClock& TheTestClock() {
  static TestClock* testClock = new TestClock;
  return *testClock;
}

double SteadyMilliSeconds() noexcept {
  using Milliseconds = std::chrono::duration<double, std::milli>;
  return std::chrono::duration_cast<Milliseconds>(std::chrono::steady_clock::now().time_since_epoch()).count();
}

}  // namespace

TimeStamp::TimeStamp() : mMilliSeconds(0.0) {
  if (gTestClockSet.load(std::memory_order_relaxed)) {
    std::function<double()> clock;
    {
      TestClock& testClock = TheTestClock();
      std::lock_guard<std::mutex> lock(testClock.mutex);
      clock = testClock.clock;
    }
    // Read outside the lock: the clock may itself make time stamps.
    if (clock) {
      mMilliSeconds = clock();
      return;
    }
  }
  mMilliSeconds = SteadyMilliSeconds();
}

void TimeStamp::SetClockForTesting(std::function<double()> inMilliSeconds) {
  TestClock& testClock = TheTestClock();
  std::function<double()> previous;
  {
    std::lock_guard<std::mutex> lock(testClock.mutex);
    previous.swap(testClock.clock);
    testClock.clock = std::move(inMilliSeconds);
    gTestClockSet.store(static_cast<bool>(testClock.clock), std::memory_order_relaxed);
  }
}

}  // namespace Tarn
