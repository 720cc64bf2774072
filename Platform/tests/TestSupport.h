// Handshakes with bounded waits for the threaded tests: a test that would
// deadlock fails (or aborts with a message) instead of hanging.
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

namespace platform_test {

// Long enough never to fire on a loaded machine; short enough that a
// deadlock is reported within the ctest timeout.
constexpr std::chrono::seconds kDeadline{20};

// Counts down to zero once; waiters wait for zero, with a deadline.
class Latch {
public:
  explicit Latch(int inCount) : mCount(inCount) {}

  void CountDown() {
    std::lock_guard<std::mutex> lock(mMutex);
    if (mCount > 0 && --mCount == 0) mReached.notify_all();
  }
  // True when the count reached zero before the deadline.
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
  int mCount;
};

// Threads that must all finish within the deadline. A thread still running
// then cannot be joined or abandoned safely (it uses the test's stack), so
// the process is stopped with a message naming the test.
class ThreadGroup {
public:
  ThreadGroup() = default;
  ThreadGroup(const ThreadGroup&) = delete;
  ThreadGroup& operator=(const ThreadGroup&) = delete;
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
    {
      std::unique_lock<std::mutex> lock(mMutex);
      if (!mChanged.wait_for(lock, kDeadline, [this] { return mFinished == mThreads.size(); })) {
        const ::testing::TestInfo* test = ::testing::UnitTest::GetInstance()->current_test_info();
        std::fprintf(stderr, "%s.%s: %zu of %zu threads still running after the deadline (deadlock?)\n",
                     test != nullptr ? test->test_suite_name() : "?", test != nullptr ? test->name() : "?",
                     mThreads.size() - mFinished, mThreads.size());
        std::fflush(stderr);
        std::abort();
      }
    }
    for (std::thread& thread : mThreads)
      if (thread.joinable()) thread.join();
  }

private:
  std::vector<std::thread> mThreads;
  std::mutex mMutex;
  std::condition_variable mChanged;
  std::size_t mFinished = 0;
};

}  // namespace platform_test
