#include "TestSupport.h"

#include <kivcore/Gate.h>
#include <kivcore/RecursiveMutex.h>

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <memory>
#include <stdexcept>

using kivcore::threads::Gate;
using kivcore::threads::RecursiveMutex;
using kivcore::threads::ScopedLock;
using platform_test::Latch;
using platform_test::ThreadGroup;

namespace {

TEST(RecursiveMutex, HolderMayLockAgainAndOthersWaitForTheLastUnlock) {
  RecursiveMutex mutex;
  mutex.Lock("outer");
  mutex.Lock("middle");
  mutex.Lock(nullptr);
  EXPECT_TRUE(mutex.IsHeldByCurrentThread());

  Latch trying(1);
  Latch acquired(1);
  std::atomic<bool> heldByOther{false};
  ThreadGroup threads;
  threads.Start([&] {
    EXPECT_FALSE(mutex.IsHeldByCurrentThread());
    trying.CountDown();
    mutex.Lock("other");
    heldByOther = mutex.IsHeldByCurrentThread();
    acquired.CountDown();
    mutex.Unlock();
  });
  ASSERT_TRUE(trying.WaitFor());
  mutex.Unlock();
  mutex.Unlock();
  // Still held once: the other thread must not have got in.
  EXPECT_FALSE(acquired.IsReleased());
  EXPECT_TRUE(mutex.IsHeldByCurrentThread());
  mutex.Unlock();
  EXPECT_FALSE(mutex.IsHeldByCurrentThread());
  EXPECT_TRUE(acquired.WaitFor());
  threads.JoinAll();
  EXPECT_TRUE(heldByOther.load());
}

TEST(RecursiveMutex, HolderLabelNamesTheOutermostLockUntilReleased) {
  RecursiveMutex mutex;
  EXPECT_EQ(nullptr, mutex.HolderLabel());
  mutex.Lock("Station::Outer");
  mutex.Lock("Station::Inner");
  EXPECT_STREQ("Station::Outer", mutex.HolderLabel());
  mutex.Unlock();
  EXPECT_STREQ("Station::Outer", mutex.HolderLabel());
  mutex.Unlock();
  EXPECT_EQ(nullptr, mutex.HolderLabel());
}

TEST(RecursiveMutex, ExcludesOtherThreadsIncludingNestedSections) {
  constexpr int kThreads = 4;
  constexpr int kRounds = 20000;
  RecursiveMutex mutex;
  long counter = 0;  // guarded by mutex, deliberately not atomic
  std::atomic<int> inside{0};
  std::atomic<int> overlaps{0};
  {
    Latch start(kThreads);
    ThreadGroup threads;
    for (int t = 0; t < kThreads; ++t) {
      threads.Start([&] {
        start.CountDown();
        start.WaitFor();
        for (int i = 0; i < kRounds; ++i) {
          ScopedLock outer(mutex, "outer");
          if (inside.fetch_add(1) != 0) overlaps.fetch_add(1);
          {
            ScopedLock inner(mutex, "inner");
            ++counter;
          }
          ++counter;
          inside.fetch_sub(1);
        }
      });
    }
  }
  EXPECT_EQ(0, overlaps.load());
  EXPECT_EQ(2L * kThreads * kRounds, counter);
}

TEST(RecursiveMutex, ScopedLockUnlocksWhenLeftByAnException) {
  RecursiveMutex mutex;
  try {
    ScopedLock outer(mutex, "outer");
    ScopedLock inner(mutex, "inner");
    throw std::runtime_error("leave");
  } catch (const std::runtime_error&) {
  }
  EXPECT_FALSE(mutex.IsHeldByCurrentThread());
  Latch locked(1);
  ThreadGroup threads;
  threads.Start([&] {
    ScopedLock lock(mutex, "other");
    locked.CountDown();
  });
  EXPECT_TRUE(locked.WaitFor());
}

TEST(Gate, OneOpenReleasesEveryWaiter) {
  constexpr int kWaiters = 5;
  auto gate = std::make_shared<Gate>(false);
  Latch ready(kWaiters);
  std::atomic<int> passed{0};
  ThreadGroup threads;
  for (int i = 0; i < kWaiters; ++i) {
    threads.Start([gate, &ready, &passed] {
      ready.CountDown();
      if (gate->PassThrough(-1)) passed.fetch_add(1);
    });
  }
  ASSERT_TRUE(ready.WaitFor());
  EXPECT_EQ(0, passed.load()) << "nobody passes a closed gate";
  gate->Open();
  threads.JoinAll();
  EXPECT_EQ(kWaiters, passed.load());
}

TEST(Gate, WaiterWithATimeLimitIsReleasedByOpenBeforeTheLimit) {
  Gate gate(false);
  Latch waiting(1);
  std::atomic<bool> result{false};
  std::chrono::steady_clock::duration waited{};
  ThreadGroup threads;
  threads.Start([&] {
    waiting.CountDown();
    const auto start = std::chrono::steady_clock::now();
    result = gate.PassThrough(static_cast<int>(std::chrono::milliseconds(platform_test::kDeadline).count()));
    waited = std::chrono::steady_clock::now() - start;
  });
  ASSERT_TRUE(waiting.WaitFor());
  gate.Open();
  threads.JoinAll();
  EXPECT_TRUE(result.load());
  EXPECT_LT(waited, platform_test::kDeadline);
}

TEST(Gate, PassingAClosedGateTimesOutWithFalse) {
  Gate gate(false);
  EXPECT_FALSE(gate.PassThrough(0));
  const auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(gate.PassThrough(30));
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(30));
  EXPECT_FALSE(gate.IsOpen());
}

TEST(Gate, OpeningTwiceIsHarmlessAndTheGateStaysOpen) {
  Gate gate(false);
  gate.Open();
  gate.Open();
  EXPECT_TRUE(gate.IsOpen());
  EXPECT_TRUE(gate.PassThrough(-1));
  EXPECT_TRUE(gate.PassThrough(0));
}

// The last waiter may destroy the gate as soon as it gets through; Open must
// not touch the gate after that.
TEST(Gate, WaiterMayDestroyTheGateAsSoonAsItPasses) {
  for (int round = 0; round < 200; ++round) {
    auto* gate = new Gate(false);
    Latch waiting(1);
    ThreadGroup threads;
    threads.Start([&] {
      waiting.CountDown();
      gate->PassThrough(-1);
      delete gate;
    });
    ASSERT_TRUE(waiting.WaitFor());
    gate->Open();
    threads.JoinAll();
  }
}

}  // namespace
