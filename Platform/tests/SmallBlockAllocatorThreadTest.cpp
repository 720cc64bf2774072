#include "TestSupport.h"

#include <kivcore/SmallBlockAllocator.h>

#include <pthread.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <cstring>
#include <random>
#include <set>

using kivcore::utility::SmallBlockAllocator;

namespace {

// A block filled with one byte: a block shorter than asked, or handed to two
// owners at once, shows up as a damaged stamp.
using Stamped = std::pair<unsigned char*, std::size_t>;  // a block and its size

Stamped Make(std::size_t inSize, int inStamp) {
  auto* block = static_cast<unsigned char*>(SmallBlockAllocator::Allocate(inSize));
  if (block != nullptr) std::memset(block, inStamp, inSize + (inSize == 0));
  return Stamped{block, inSize};
}

// Disposes of the block; false when it was null, misaligned or damaged.
bool DisposeIntact(const Stamped& inBlock) {
  const auto [block, size] = inBlock;
  bool intact = block != nullptr && reinterpret_cast<std::uintptr_t>(block) % alignof(std::max_align_t) == 0;
  for (std::size_t i = 1; intact && i < size; ++i) intact = block[i] == block[0];
  SmallBlockAllocator::Dispose(block, size);
  return intact;
}

// The statistics now, against inBefore: blocks and bytes in use, and
// allocations made since.
void ExpectCounts(const SmallBlockAllocator::Statistics& inBefore, std::size_t inBlocks, std::size_t inBytes,
                  std::uint64_t inAllocations) {
  const auto now = SmallBlockAllocator::GetStatistics();
  EXPECT_EQ(inBefore.blocksInUse + inBlocks, now.blocksInUse);
  EXPECT_EQ(inBefore.bytesInUse + inBytes, now.bytesInUse);
  EXPECT_EQ(inBefore.allocations + inAllocations, now.allocations);
}

// Small and large requests use up the allowance alike; refusals are not
// counted; disposal goes on; a negative count ends the failures. The adaptor
// turns a refusal (or an impossible size) into std::bad_alloc and leaves its
// container as it was.
TEST(SmallBlockAllocator, FailAfterRefusesAllocationsOnceTheAllowanceIsUsedUp) {
  std::vector<int, SmallBlockAllocator::STLAllocator<int>> numbers{1, 2, 3};
  const auto before = SmallBlockAllocator::GetStatistics();
  SmallBlockAllocator::SetFailAfter(2);
  const Stamped granted[] = {Make(16, 1), Make(2000, 2)};
  for (std::size_t size : {16u, 2000u, 0u}) EXPECT_EQ(nullptr, SmallBlockAllocator::Allocate(size)) << size;
  EXPECT_THROW(numbers.reserve(100), std::bad_alloc);
  ExpectCounts(before, 2, 2016, 2);
  EXPECT_TRUE(DisposeIntact(granted[0]) && DisposeIntact(granted[1]));
  SmallBlockAllocator::SetFailAfter(-1);
  EXPECT_TRUE(DisposeIntact(Make(8, 4)) && numbers.size() == 3 && numbers[2] == 3);
  EXPECT_THROW(SmallBlockAllocator::STLAllocator<std::uint64_t>().allocate(std::size_t{1} << 62), std::bad_alloc);
  SmallBlockAllocator::Dispose(nullptr, 24);
  ExpectCounts(before, 0, 0, 3);
}

// With the system out of memory for a new chunk, an allocation gives null,
// both when the thread cache refills and when the pool carves, instead of
// carving from a null chunk. Run in a child whose address space is capped;
// the sanitizers' runtimes cannot live under such a cap.
TEST(SmallBlockAllocator, ASystemOutOfMemoryGivesNullInsteadOfACrash) {
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
  GTEST_SKIP() << "the sanitizer runtimes reserve more address space than the cap allows";
#else
  const pid_t child = ::fork();
  ASSERT_NE(child, -1);
  if (child == 0) {
    long pages = 0;
    if (std::FILE* statm = std::fopen("/proc/self/statm", "r")) {
      if (std::fscanf(statm, "%ld", &pages) != 1) pages = 0;
      std::fclose(statm);
    }
    const rlim_t cap = static_cast<rlim_t>(pages) * static_cast<rlim_t>(::sysconf(_SC_PAGESIZE)) + (rlim_t{8} << 20);
    const rlimit limit{cap, cap};
    if (pages == 0 || ::setrlimit(RLIMIT_AS, &limit) != 0) ::_exit(2);
    // Blocks past the small limit come from the heap: one refused is not counted.
    const auto before = SmallBlockAllocator::GetStatistics().blocksInUse;
    std::size_t large = 0;
    while (large < 4096 && SmallBlockAllocator::Allocate(std::size_t{1} << 20) != nullptr) ++large;
    if (large == 4096 || SmallBlockAllocator::GetStatistics().blocksInUse != before + large) ::_exit(4);
    for (long made = 0; made < (1L << 24); ++made) {
      if (SmallBlockAllocator::Allocate(48) == nullptr) ::_exit(0);
    }
    ::_exit(3);  // the cap never bit
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "child status " << status;
#endif
}

// Each thread takes bursts of blocks (spanning several pool chunks, and
// overflowing its cache when they come back), then allocates, checks and
// frees sizes up to beyond the small limit at random, and leaves the rest
// to outlive it, freed here; one also returns the wholly free chunks now
// and then. No block is shared or freed under its owner, every block is
// aligned, and the counts of threads (and caches) that are gone still add up.
TEST(SmallBlockAllocatorThreads, ThreadsNeverShareABlockAndTheirCountsOutliveThem) {
  const auto before = SmallBlockAllocator::GetStatistics();
  std::atomic<std::size_t> made{0};
  std::atomic<int> damaged{0};
  std::vector<Stamped> leftOver[4];  // each thread's, once it is gone
  platform_test::ThreadGroup threads;
  for (unsigned t = 0; t < 4; ++t) {
    threads.Start([&, t] {
      std::mt19937 random(t);
      std::vector<Stamped> live;
      for (int step = 0; step < 40000; ++step) {
        if (t == 0 && step % 500 == 0) SmallBlockAllocator::ReleaseFreeChunks();
        // 3000 blocks of 48 bytes taken, all returned, 1000 taken again; then at random.
        const bool burst = step < 7000;
        if (burst ? step < 3000 || step >= 6000 : random() % 2 == 0 || live.empty()) {
          live.push_back(Make(burst ? 48 : random() % 4 == 0 ? random() % 1500 : random() % 128, step));
          made.fetch_add(1);
        } else {
          std::swap(live[burst ? 0 : random() % live.size()], live.back());
          damaged.fetch_add(!DisposeIntact(live.back()));
          live.pop_back();
        }
      }
      leftOver[t] = std::move(live);
    });
  }
  threads.JoinAll();
  for (int t = 1; t < 4; ++t) leftOver[0].insert(leftOver[0].end(), leftOver[t].begin(), leftOver[t].end());
  std::size_t bytes = 0;
  for (const Stamped& s : leftOver[0]) bytes += s.second;
  ExpectCounts(before, leftOver[0].size(), bytes, made);
  for (const Stamped& s : leftOver[0]) EXPECT_TRUE(DisposeIntact(s));
  EXPECT_EQ(0, damaged.load());
  ExpectCounts(before, 0, 0, made);

  // Two threads free each other's blocks while the counts are read: a read
  // may see a disposal and not its allocation, yet never a count below zero.
  std::atomic<void*> slots[2] = {};
  std::atomic<int> finished{0};
  platform_test::ThreadGroup pair;
  for (int t = 0; t < 2; ++t)
    pair.Start([&, t] {
      for (int i = 0; i < 100000; ++i) {
        if (void* mine = slots[t].exchange(SmallBlockAllocator::Allocate(32))) SmallBlockAllocator::Dispose(mine, 32);
        if (void* other = slots[1 - t].exchange(nullptr)) SmallBlockAllocator::Dispose(other, 32);
      }
      finished.fetch_add(1);
    });
  std::size_t most = 0;
  while (finished < 2) most = std::max(most, SmallBlockAllocator::GetStatistics().blocksInUse);  // they never wait
  pair.JoinAll();
  for (auto& slot : slots) SmallBlockAllocator::Dispose(slot.load(), 32);
  EXPECT_LT(most, before.blocksInUse + 64) << "a count below zero wrapped";
}

std::atomic<void*> sLateBlock{nullptr};

// A thread-specific-data destructor (a GLib or Boost cleanup releasing
// objects): for its thread, the first use of the allocator, or a use after
// the thread's cache is retired (the allocator's key is older, so its
// destructor runs first).
void ExitCleanup(void*) {
  SmallBlockAllocator::Dispose(SmallBlockAllocator::Allocate(1000), 1000);
  SmallBlockAllocator::Dispose(SmallBlockAllocator::Allocate(24), 24);
  sLateBlock = SmallBlockAllocator::Allocate(40);
}

// Such a cleanup runs after the C++ thread_local destructors. A cache it
// starts must still be retired with the thread: otherwise the next thread,
// reusing that thread's storage, corrupts the registry of caches (lost
// counts, then GetStatistics looping for ever).
TEST(SmallBlockAllocatorThreads, AllocationsInAThreadExitCleanupAreCountedAndRetiredWithTheThread) {
  tarn_test::Watchdog watchdog;
  SmallBlockAllocator::Dispose(SmallBlockAllocator::Allocate(8), 8);  // the allocator's key first
  pthread_key_t key;
  ASSERT_EQ(0, pthread_key_create(&key, &ExitCleanup));
  const auto before = SmallBlockAllocator::GetStatistics();
  for (int round = 1; round <= 20; ++round) {
    std::thread([key, round] {
      pthread_setspecific(key, &sLateBlock);
      if (round % 2 == 0) SmallBlockAllocator::Dispose(SmallBlockAllocator::Allocate(24), 24);
    }).join();
    std::thread([] { SmallBlockAllocator::Dispose(SmallBlockAllocator::Allocate(24), 24); }).join();
    SmallBlockAllocator::Dispose(sLateBlock.exchange(nullptr), 40);
    ExpectCounts(before, 0, 0, 4 * round + round / 2);
    ASSERT_FALSE(HasFailure()) << "round " << round;
  }
  pthread_key_delete(key);
}

// The cache of a thread that has exited serves the next thread empty: the
// blocks it held went to the pool, and none is handed out twice.
TEST(SmallBlockAllocatorThreads, ARetiredCacheServesTheNextThreadEmpty) {
  std::thread([] {
    void* blocks[20];
    for (void*& block : blocks) block = SmallBlockAllocator::Allocate(32);
    for (void* block : blocks) SmallBlockAllocator::Dispose(block, 32);
  }).join();
  std::vector<void*> theirs, mine;
  std::thread([&theirs] {
    for (int i = 0; i < 200; ++i) theirs.push_back(SmallBlockAllocator::Allocate(32));
  }).join();
  for (int i = 0; i < 200; ++i) mine.push_back(SmallBlockAllocator::Allocate(32));
  const std::set<void*> taken(theirs.begin(), theirs.end());
  EXPECT_EQ(taken.size(), theirs.size());
  EXPECT_TRUE(std::none_of(mine.begin(), mine.end(), [&](void* inBlock) { return taken.count(inBlock) != 0; }))
      << "a block was handed out twice";
  for (void* block : theirs) SmallBlockAllocator::Dispose(block, 32);
  for (void* block : mine) SmallBlockAllocator::Dispose(block, 32);
}

}  // namespace
