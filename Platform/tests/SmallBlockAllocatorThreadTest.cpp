#include "TestSupport.h"

#include <kivcore/SmallBlockAllocator.h>

#include <gtest/gtest.h>

#include <pthread.h>

#include <atomic>
#include <cstring>
#include <mutex>
#include <random>
#include <thread>
#include <vector>

using kivcore::utility::SmallBlockAllocator;
using platform_test::Latch;
using platform_test::ThreadGroup;

namespace {

struct Stamped {
  void* block;
  std::size_t size;
  unsigned char stamp;

  bool Intact() const {
    for (std::size_t i = 0; i < size; ++i)
      if (static_cast<const unsigned char*>(block)[i] != stamp) return false;
    return true;
  }
};

// Threads allocate, stamp, check and free at random, mail some blocks to the
// next thread to free, and leave the rest to outlive them. A block handed to
// two owners at once shows up as a damaged stamp; the statistics must still
// add up once the threads (and their caches) are gone.
TEST(SmallBlockAllocatorThreads, ThreadsNeverShareABlockAndTheirCountsOutliveThem) {
  constexpr int kThreads = 4;
  constexpr int kSteps = 30000;
  const auto before = SmallBlockAllocator::GetStatistics();
  std::atomic<int> damaged{0};
  std::atomic<std::uint64_t> made{0};
  std::mutex mutex;
  std::vector<Stamped> mail[kThreads];  // guarded by mutex
  std::vector<Stamped> leftOver;        // guarded by mutex
  {
    Latch start(kThreads);
    ThreadGroup threads;
    for (int t = 0; t < kThreads; ++t) {
      threads.Start([&, t] {
        std::mt19937 random(1234u + static_cast<unsigned>(t));
        std::vector<Stamped> live;
        start.CountDown();
        start.WaitFor();
        for (int step = 0; step < kSteps; ++step) {
          if (random() % 2 == 0 || live.empty()) {
            const std::size_t size = random() % 4 == 0 ? 1 + random() % 1500 : 1 + random() % 128;
            Stamped s{SmallBlockAllocator::Allocate(size), size, static_cast<unsigned char>(random())};
            if (s.block == nullptr) {  // storage is not short here: a refusal is a fault
              damaged.fetch_add(1);
              continue;
            }
            made.fetch_add(1);
            std::memset(s.block, s.stamp, s.size);
            live.push_back(s);
            continue;
          }
          const std::size_t pick = random() % live.size();
          const Stamped s = live[pick];
          live[pick] = live.back();
          live.pop_back();
          if (!s.Intact()) damaged.fetch_add(1);
          std::vector<Stamped> received;
          {
            std::lock_guard<std::mutex> lock(mutex);
            if (step % 4 == 0) mail[(t + 1) % kThreads].push_back(s);
            received.swap(mail[t]);
          }
          if (step % 4 != 0) SmallBlockAllocator::Dispose(s.block, s.size);
          for (const Stamped& r : received) {
            if (!r.Intact()) damaged.fetch_add(1);
            SmallBlockAllocator::Dispose(r.block, r.size);
          }
        }
        std::lock_guard<std::mutex> lock(mutex);
        leftOver.insert(leftOver.end(), live.begin(), live.end());
      });
    }
  }
  for (auto& box : mail) leftOver.insert(leftOver.end(), box.begin(), box.end());
  std::size_t bytes = 0;
  for (const Stamped& s : leftOver) bytes += s.size;
  const auto during = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.allocations + made.load(), during.allocations);
  EXPECT_EQ(before.blocksInUse + leftOver.size(), during.blocksInUse);
  EXPECT_EQ(before.bytesInUse + bytes, during.bytesInUse);
  for (const Stamped& s : leftOver) {
    if (!s.Intact()) damaged.fetch_add(1);
    SmallBlockAllocator::Dispose(s.block, s.size);
  }
  EXPECT_EQ(0, damaged.load());
  const auto after = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.blocksInUse, after.blocksInUse);
  EXPECT_EQ(before.bytesInUse, after.bytesInUse);
}

std::atomic<void*> sLateBlock{nullptr};

// Allocates as its thread exits, after the thread's first allocation: being
// constructed first, it is destroyed last.
struct LateUser {
  ~LateUser() { sLateBlock.store(SmallBlockAllocator::Allocate(40)); }
};

// A thread's first allocation may come from a thread-specific-data
// destructor (a GLib or Boost cleanup releasing an object), after the C++
// thread_local destructors have run. Its cache must still be retired with the
// thread: otherwise the next thread, reusing that thread's storage, corrupts
// the registry of caches (lost counts, then GetStatistics looping for ever).
TEST(SmallBlockAllocatorThreads, AllocationsWhileAThreadExitsAreCountedAndRetiredWithIt) {
  tarn_test::Watchdog watchdog;
  pthread_key_t key;
  ASSERT_EQ(0, pthread_key_create(&key, [](void*) { sLateBlock.store(SmallBlockAllocator::Allocate(40)); }));
  const auto before = SmallBlockAllocator::GetStatistics();
  for (int round = 1; round <= 20; ++round) {
    std::thread([key] { pthread_setspecific(key, &sLateBlock); }).join();
    void* fromKeyDestructor = sLateBlock.exchange(nullptr);
    std::thread([] {
      static thread_local LateUser user;
      SmallBlockAllocator::Dispose(SmallBlockAllocator::Allocate(24), 24);
    }).join();
    void* fromThreadLocal = sLateBlock.exchange(nullptr);
    ASSERT_TRUE(fromKeyDestructor != nullptr && fromThreadLocal != nullptr);
    EXPECT_EQ(before.blocksInUse + 2, SmallBlockAllocator::GetStatistics().blocksInUse) << "round " << round;
    SmallBlockAllocator::Dispose(fromKeyDestructor, 40);
    SmallBlockAllocator::Dispose(fromThreadLocal, 40);
    const auto now = SmallBlockAllocator::GetStatistics();
    ASSERT_EQ(before.blocksInUse, now.blocksInUse) << "round " << round;
    ASSERT_EQ(before.allocations + 3 * round, now.allocations) << "round " << round;
  }
  pthread_key_delete(key);
}

TEST(SmallBlockAllocatorThreads, FailAfterGrantsExactlyTheAllowanceAcrossThreads) {
  constexpr int kThreads = 4;
  constexpr int kAllowed = 300;
  std::atomic<int> granted{0};
  std::vector<void*> blocks[kThreads];
  SmallBlockAllocator::SetFailAfter(kAllowed);
  {
    Latch start(kThreads);
    ThreadGroup threads;
    for (int t = 0; t < kThreads; ++t) {
      threads.Start([&, t] {
        start.CountDown();
        start.WaitFor();
        for (int i = 0; i < kAllowed; ++i)
          if (void* block = SmallBlockAllocator::Allocate(24)) blocks[t].push_back(block);
        granted.fetch_add(static_cast<int>(blocks[t].size()));
      });
    }
  }
  SmallBlockAllocator::SetFailAfter(-1);
  EXPECT_EQ(kAllowed, granted.load());
  for (auto& list : blocks)
    for (void* block : list) SmallBlockAllocator::Dispose(block, 24);
}

}  // namespace
