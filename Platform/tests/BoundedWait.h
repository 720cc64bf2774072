// Bounded waits shared by the test suites: a deadline, a latch, polling with
// a deadline, a group of threads that must finish in time, and a watchdog. A
// deadlock then fails (or stops) the test with a message naming it, instead
// of hanging the run. None of the classes can be copied or moved: each holds
// a mutex.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <mutex>
#include <thread>
#include <vector>

namespace tarn_test {

// Long enough never to expire on a loaded machine (sanitizer builds
// included); short enough that a deadlock is reported well within the ctest
// timeout.
constexpr std::chrono::seconds kDeadline{20};

// ---------------------------------------------------------------------------
// Bounded waits

// Counts down to zero once; waiters wait for zero, with a deadline.
class Latch {
public:
  explicit Latch(int inCount = 1) : mCount(inCount) {}

  void CountDown() {
    std::lock_guard<std::mutex> lock(mMutex);
    if (mCount > 0 && --mCount == 0) mReached.notify_all();
  }
  // True when the count reached zero before inTimeout passed.
  bool WaitFor(std::chrono::milliseconds inTimeout = kDeadline) {
    std::unique_lock<std::mutex> lock(mMutex);
    return mReached.wait_for(lock, inTimeout, [this] { return mCount == 0; });
  }
  bool IsReleased() {
    std::lock_guard<std::mutex> lock(mMutex);
    return mCount == 0;
  }

private:
  std::mutex mMutex;
  std::condition_variable mReached;
  int mCount;  // guarded by mMutex
};

// Polls inDone until it returns true or inTimeout passes; true when it did.
// For conditions that nothing signals (a registry becoming empty, a count
// kept by the library); the polling interval grows to one millisecond, so
// the result never depends on how long the wait took.
template <class Predicate>
bool WaitUntil(Predicate inDone, std::chrono::milliseconds inTimeout = kDeadline) {
  const auto deadline = std::chrono::steady_clock::now() + inTimeout;
  std::chrono::microseconds pause{1};
  while (!inDone()) {
    if (std::chrono::steady_clock::now() >= deadline) return inDone();
    std::this_thread::sleep_for(pause);
    if (pause < std::chrono::milliseconds(1)) pause *= 2;
  }
  return true;
}

namespace detail {
inline void AbortNamingTheTest(const char* inWhat) {
  const ::testing::TestInfo* test = ::testing::UnitTest::GetInstance()->current_test_info();
  std::fprintf(stderr, "%s.%s: %s\n", test != nullptr ? test->test_suite_name() : "?",
               test != nullptr ? test->name() : "?", inWhat);
  std::fflush(stderr);
  std::abort();
}
}  // namespace detail

// Threads that must all finish within the deadline. A thread still running
// then can be neither joined nor abandoned safely (it uses the test's
// stack), so the process stops with a message naming the test.
class ThreadGroup {
public:
  ~ThreadGroup() { JoinAll(); }

  void Start(std::function<void()> inBody) {
    mThreads.emplace_back([this, body = std::move(inBody)] {
      body();
      std::lock_guard<std::mutex> lock(mMutex);
      ++mFinished;
      mChanged.notify_all();
    });
  }

  void JoinAll() {
    std::unique_lock<std::mutex> lock(mMutex);
    if (!mChanged.wait_for(lock, kDeadline, [this] { return mFinished == mThreads.size(); }))
      detail::AbortNamingTheTest("threads still running after the deadline (deadlock?)");
    lock.unlock();
    for (std::thread& thread : mThreads) thread.join();
    mThreads.clear();
    mFinished = 0;
  }

private:
  std::vector<std::thread> mThreads;
  std::mutex mMutex;
  std::condition_variable mChanged;
  std::size_t mFinished = 0;  // guarded by mMutex
};

// Stops the process, naming the test, if it is still alive after inLimit:
// for tests whose main thread could itself block (a broadcast that never
// ends), where no bounded wait of the test's own would get a chance to run.
class Watchdog {
public:
  explicit Watchdog(std::chrono::seconds inLimit = kDeadline * 2)
      : mThread([this, inLimit] {
          std::unique_lock<std::mutex> lock(mMutex);
          if (!mDisarmed.wait_for(lock, inLimit, [this] { return mDone; }))
            detail::AbortNamingTheTest("still running when the watchdog expired (deadlock?)");
        }) {}
  ~Watchdog() {
    std::unique_lock<std::mutex> lock(mMutex);
    mDone = true;
    lock.unlock();
    mDisarmed.notify_all();
    mThread.join();
  }

private:
  std::mutex mMutex;
  std::condition_variable mDisarmed;
  bool mDone = false;  // guarded by mMutex
  std::thread mThread;  // last: starts once the members above exist
};

}  // namespace tarn_test
