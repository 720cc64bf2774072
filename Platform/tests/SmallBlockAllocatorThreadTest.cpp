#include "TestSupport.h"

#include <kivcore/SmallBlockAllocator.h>

#include <gtest/gtest.h>

#include <atomic>
#include <cstdint>
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
};

void Stamp(const Stamped& inBlock) { std::memset(inBlock.block, inBlock.stamp, inBlock.size); }

bool StampIntact(const Stamped& inBlock) {
  const auto* bytes = static_cast<const unsigned char*>(inBlock.block);
  for (std::size_t i = 0; i < inBlock.size; ++i)
    if (bytes[i] != inBlock.stamp) return false;
  return true;
}

TEST(SmallBlockAllocatorThreads, BlocksAllocatedOnOneThreadMayBeDisposedOnAnother) {
  constexpr int kBlocks = 5000;
  const auto before = SmallBlockAllocator::GetStatistics();
  std::vector<Stamped> handedOver;
  Latch allocated(1);
  std::atomic<int> damaged{0};
  {
    ThreadGroup threads;
    threads.Start([&] {
      for (int i = 0; i < kBlocks; ++i) {
        const std::size_t size = 1 + static_cast<std::size_t>(i) % 700;  // small and large
        Stamped s{SmallBlockAllocator::Allocate(size), size, static_cast<unsigned char>(i)};
        if (s.block == nullptr) break;
        Stamp(s);
        handedOver.push_back(s);
      }
      allocated.CountDown();
    });
    threads.Start([&] {
      if (!allocated.WaitFor()) return;
      for (const Stamped& s : handedOver) {
        if (!StampIntact(s)) damaged.fetch_add(1);
        SmallBlockAllocator::Dispose(s.block, s.size);
      }
      // Blocks returned here are reused by this thread's next requests.
      for (int i = 0; i < kBlocks; ++i) {
        void* block = SmallBlockAllocator::Allocate(32);
        SmallBlockAllocator::Dispose(block, 32);
      }
    });
  }
  ASSERT_EQ(static_cast<std::size_t>(kBlocks), handedOver.size());
  EXPECT_EQ(0, damaged.load());
  const auto after = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.blocksInUse, after.blocksInUse);
  EXPECT_EQ(before.bytesInUse, after.bytesInUse);
  EXPECT_EQ(before.allocations + 2 * kBlocks, after.allocations);
}

// Threads allocate, stamp, check and free at random, and pass some blocks to
// the next thread, which frees them; a block handed to two owners at once
// shows up as a damaged stamp.
TEST(SmallBlockAllocatorThreads, ThreadsHammeringTheAllocatorNeverShareABlock) {
  constexpr int kThreads = 4;
  constexpr int kSteps = 40000;
  const auto before = SmallBlockAllocator::GetStatistics();
  std::atomic<int> damaged{0};
  std::atomic<int> refused{0};
  std::atomic<std::uint64_t> made{0};
  std::mutex mailMutex;
  std::vector<Stamped> mail[kThreads];  // guarded by mailMutex
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
          const unsigned roll = random() % 8;
          if (roll < 4 || live.empty()) {
            const std::size_t size = random() % 4 == 0 ? 1 + random() % 1500 : 1 + random() % 128;
            Stamped s{SmallBlockAllocator::Allocate(size), size, static_cast<unsigned char>(random())};
            if (s.block == nullptr) {
              refused.fetch_add(1);
              continue;
            }
            made.fetch_add(1, std::memory_order_relaxed);
            Stamp(s);
            live.push_back(s);
          } else {
            const std::size_t pick = random() % live.size();
            Stamped s = live[pick];
            live[pick] = live.back();
            live.pop_back();
            if (!StampIntact(s)) damaged.fetch_add(1);
            if (roll == 7) {
              std::lock_guard<std::mutex> lock(mailMutex);
              mail[(t + 1) % kThreads].push_back(s);
            } else {
              SmallBlockAllocator::Dispose(s.block, s.size);
            }
          }
          if (step % 1000 == 0) {
            std::vector<Stamped> received;
            {
              std::lock_guard<std::mutex> lock(mailMutex);
              received.swap(mail[t]);
            }
            for (const Stamped& s : received) {
              if (!StampIntact(s)) damaged.fetch_add(1);
              SmallBlockAllocator::Dispose(s.block, s.size);
            }
          }
        }
        for (const Stamped& s : live) {
          if (!StampIntact(s)) damaged.fetch_add(1);
          SmallBlockAllocator::Dispose(s.block, s.size);
        }
      });
    }
  }
  for (auto& box : mail)
    for (const Stamped& s : box) {
      if (!StampIntact(s)) damaged.fetch_add(1);
      SmallBlockAllocator::Dispose(s.block, s.size);
    }
  EXPECT_EQ(0, damaged.load());
  EXPECT_EQ(0, refused.load());
  const auto after = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.blocksInUse, after.blocksInUse);
  EXPECT_EQ(before.bytesInUse, after.bytesInUse);
  EXPECT_EQ(before.allocations + made.load(), after.allocations);
}

TEST(SmallBlockAllocatorThreads, StatisticsOfAnExitedThreadAreKept) {
  const auto before = SmallBlockAllocator::GetStatistics();
  std::vector<void*> leftOver;
  {
    ThreadGroup threads;
    threads.Start([&] {
      for (int i = 0; i < 100; ++i) SmallBlockAllocator::Dispose(SmallBlockAllocator::Allocate(64), 64);
      for (int i = 0; i < 10; ++i) leftOver.push_back(SmallBlockAllocator::Allocate(64));
    });
  }
  auto during = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.allocations + 110, during.allocations);
  EXPECT_EQ(before.blocksInUse + 10, during.blocksInUse);
  EXPECT_EQ(before.bytesInUse + 640, during.bytesInUse);
  // The blocks outlive the thread that allocated them.
  for (void* block : leftOver) {
    std::memset(block, 0x5A, 64);
    SmallBlockAllocator::Dispose(block, 64);
  }
  const auto after = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.blocksInUse, after.blocksInUse);
  EXPECT_EQ(before.bytesInUse, after.bytesInUse);
}

// Allocation from a thread-local destructor that runs after the thread's
// cache has been flushed must still work and be counted.
struct LateUser {
  void* block = nullptr;
  std::atomic<int>* failures = nullptr;
  ~LateUser() {
    SmallBlockAllocator::Dispose(block, 40);
    void* late = SmallBlockAllocator::Allocate(40);
    if (late == nullptr) {
      failures->fetch_add(1);
      return;
    }
    std::memset(late, 1, 40);
    SmallBlockAllocator::Dispose(late, 40);
  }
};

TEST(SmallBlockAllocatorThreads, ThreadLocalDestructorsMayUseTheAllocatorAfterTheCacheIsFlushed) {
  const auto before = SmallBlockAllocator::GetStatistics();
  std::atomic<int> failures{0};
  {
    ThreadGroup threads;
    threads.Start([&] {
      // Constructed before the thread's first allocation, so destroyed after
      // the allocator's own thread-exit flush.
      static thread_local LateUser user;
      user.failures = &failures;
      user.block = SmallBlockAllocator::Allocate(40);
    });
  }
  EXPECT_EQ(0, failures.load());
  const auto after = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(before.blocksInUse, after.blocksInUse);
  EXPECT_EQ(before.bytesInUse, after.bytesInUse);
  EXPECT_EQ(before.allocations + 2, after.allocations);
}

TEST(SmallBlockAllocatorThreads, FailAfterAllowsExactlyTheCountAcrossThreads) {
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
        for (int i = 0; i < kAllowed; ++i) {
          if (void* block = SmallBlockAllocator::Allocate(24)) {
            granted.fetch_add(1);
            blocks[t].push_back(block);
          }
        }
      });
    }
  }
  SmallBlockAllocator::SetFailAfter(-1);
  EXPECT_EQ(kAllowed, granted.load());
  for (auto& list : blocks)
    for (void* block : list) SmallBlockAllocator::Dispose(block, 24);
}

}  // namespace
