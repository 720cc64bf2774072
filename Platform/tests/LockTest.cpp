#include "TestSupport.h"

#include <kivcore/Gate.h>
#include <kivcore/RecursiveMutex.h>

#include <atomic>

using namespace kivcore::threads;

namespace {

// The holder may lock again; others get in only after its last unlock. Under
// contention enough for waiters to sleep in the kernel, a lost wake-up hangs
// (and fails on the deadline) and a broken exclusion loses increments.
TEST(RecursiveMutex, HolderMayLockAgainAndOthersGetInOnlyAfterItsLastUnlock) {
  RecursiveMutex mutex;
  long counter = 0;  // guarded by mutex, deliberately not atomic
  mutex.Lock("Station::Outer");
  mutex.Lock("Station::Inner");
  platform_test::Latch started(4);
  platform_test::ThreadGroup threads;
  for (int t = 0; t < 4; ++t) {
    threads.Start([&] {
      started.CountDown();
      for (int i = 0; i < 20000; ++i) {
        ScopedLock outer(mutex, "outer");
        const long seen = counter;
        ScopedLock inner(mutex, "inner");
        if (i % 1000 == 0) std::this_thread::yield();  // let waiters queue up
        counter = seen + 1;
      }
    });
  }
  ASSERT_TRUE(started.WaitFor());
  mutex.Unlock();
  EXPECT_TRUE(mutex.IsHeldByCurrentThread());
  EXPECT_EQ(0, counter) << "another thread got in while the mutex was still held";
  mutex.Unlock();
  threads.JoinAll();
  EXPECT_EQ(4 * 20000L, counter);
}

// One Open releases every waiter, bounded or not, and the last waiter may
// destroy the gate the moment it passes; a closed gate times out with false.
TEST(Gate, OpenReleasesEveryWaiterAndTheLastMayDestroyTheGate) {
  for (int round = 0; round < 50; ++round) {
    auto* gate = new Gate(false);
    std::atomic<int> passed{0};
    platform_test::ThreadGroup threads;
    for (int i = 0; i < 4; ++i) {
      threads.Start([&, i] {
        if (gate->PassThrough(i % 2 == 0 ? -1 : 60000) && ++passed == 4) delete gate;
      });
    }
    EXPECT_FALSE(gate->PassThrough(round == 0 ? 20 : 0) || gate->IsOpen());
    EXPECT_EQ(0, passed.load()) << "nobody passes a closed gate";
    gate->Open();
    threads.JoinAll();
    EXPECT_EQ(4, passed.load());
  }
}

}  // namespace
