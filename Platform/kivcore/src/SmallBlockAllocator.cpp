// SmallBlockAllocator: size-classed free lists, cached per thread.
//
// Requests of up to kMaxSmallSize bytes are rounded up to a multiple of
// kGranule and served from that class's free list in the calling thread's
// cache, with no lock and no atomic read-modify-write. An empty thread list
// is refilled with a batch from the class's shared pool; a list that grows
// past two batches hands one batch back. The pool carves new blocks from
// chunks taken from malloc, which are never returned. Larger requests go to
// malloc and free.
//
// Everything global here is trivially destructible and constant-initialized,
// so the allocator keeps working during static destruction. A thread that
// has already flushed its cache at exit (or is in the middle of doing so)
// takes the locked pool path instead of its cache.
//
// Statistics: each thread counts into its own record, written only by that
// thread (relaxed load and store, not read-modify-write, so the fast path
// costs no bus lock) and read by GetStatistics under the registry mutex.
// A thread leaving folds its record into the process totals.
//
// Under AddressSanitizer every block comes straight from malloc, so that the
// sanitizer sees each block's lifetime; statistics and fault injection still
// apply.
#include <kivcore/SmallBlockAllocator.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cstdlib>
#include <mutex>

namespace kivcore::utility {

namespace {

#if defined(__SANITIZE_ADDRESS__)
constexpr bool kBypassPools = true;
#else
constexpr bool kBypassPools = false;
#endif

constexpr std::size_t kGranule = 16;
constexpr std::size_t kClassCount = SmallBlockAllocator::kMaxSmallSize / kGranule;
constexpr std::size_t kChunkSize = std::size_t{64} * 1024;

struct Block {
  Block* next;
};

constexpr std::size_t ClassIndex(std::size_t inSize) noexcept { return (inSize - 1) / kGranule; }
constexpr std::size_t ClassBlockSize(std::size_t inClass) noexcept { return (inClass + 1) * kGranule; }
// Blocks moved between a thread cache and the pool at a time: enough to make
// the pool's lock rare, few enough that an idle thread does not hoard much.
constexpr std::array<std::uint32_t, kClassCount> kBatchSizes = [] {
  std::array<std::uint32_t, kClassCount> sizes{};
  for (std::size_t c = 0; c < kClassCount; ++c)
    sizes[c] = static_cast<std::uint32_t>(std::clamp<std::size_t>(8192 / ClassBlockSize(c), 8, 64));
  return sizes;
}();
constexpr std::uint32_t BatchSize(std::size_t inClass) noexcept { return kBatchSizes[inClass]; }

// ---------------------------------------------------------------------------
// Shared pools, one per size class.

struct Chunk {
  Chunk* previous;  // keeps every chunk reachable for leak checkers
};
constexpr std::size_t kChunkHeader = (sizeof(Chunk) + kGranule - 1) / kGranule * kGranule;

// One cache line each, so that threads working in different size classes do
// not contend for the same line.
struct alignas(64) Pool {
  std::mutex mutex;
  Block* freeList = nullptr;  // guarded by mutex
  char* carveNext = nullptr;  // unused tail of the newest chunk; guarded by mutex
  char* carveEnd = nullptr;   // guarded by mutex
  Chunk* chunks = nullptr;    // guarded by mutex
};

Pool gPools[kClassCount];

// Pops one block from the pool, carving a new chunk when needed. Caller holds
// the pool's mutex.
Block* PopFromPool(Pool& ioPool, std::size_t inBlockSize) noexcept {
  if (Block* block = ioPool.freeList) {
    ioPool.freeList = block->next;
    return block;
  }
  if (ioPool.carveNext == nullptr || static_cast<std::size_t>(ioPool.carveEnd - ioPool.carveNext) < inBlockSize) {
    auto* chunk = static_cast<Chunk*>(std::malloc(kChunkSize));
    if (chunk == nullptr) return nullptr;
    chunk->previous = ioPool.chunks;
    ioPool.chunks = chunk;
    ioPool.carveNext = reinterpret_cast<char*>(chunk) + kChunkHeader;
    ioPool.carveEnd = reinterpret_cast<char*>(chunk) + kChunkSize;
  }
  auto* block = reinterpret_cast<Block*>(ioPool.carveNext);
  ioPool.carveNext += inBlockSize;
  return block;
}

// Takes up to inCount blocks as a linked list (null when storage is
// exhausted); the number obtained is stored in outCount.
Block* TakeBatch(std::size_t inClass, std::uint32_t inCount, std::uint32_t& outCount) noexcept {
  Pool& pool = gPools[inClass];
  const std::size_t blockSize = ClassBlockSize(inClass);
  Block* head = nullptr;
  std::uint32_t taken = 0;
  std::lock_guard<std::mutex> lock(pool.mutex);
  while (taken < inCount) {
    Block* block = PopFromPool(pool, blockSize);
    if (block == nullptr) break;
    block->next = head;
    head = block;
    ++taken;
  }
  outCount = taken;
  return head;
}

// Hands the list inFirst..inLast (linked through next) to the pool.
void GiveBatch(std::size_t inClass, Block* inFirst, Block* inLast) noexcept {
  Pool& pool = gPools[inClass];
  std::lock_guard<std::mutex> lock(pool.mutex);
  inLast->next = pool.freeList;
  pool.freeList = inFirst;
}

// ---------------------------------------------------------------------------
// Statistics.

// Blocks in use are allocations minus disposals, so each call updates two
// counters.
struct Counters {
  std::atomic<std::uint64_t> allocations{0};
  std::atomic<std::uint64_t> disposals{0};
  std::atomic<std::int64_t> bytes{0};  // signed: a thread may free blocks others allocated
};

// A record written only by its own thread.
struct ThreadCounters : Counters {
  ThreadCounters* previous = nullptr;  // links guarded by gRegistryMutex
  ThreadCounters* next = nullptr;

  void CountAllocation(std::size_t inSize) noexcept {
    allocations.store(allocations.load(std::memory_order_relaxed) + 1, std::memory_order_relaxed);
    bytes.store(bytes.load(std::memory_order_relaxed) + static_cast<std::int64_t>(inSize), std::memory_order_relaxed);
  }
  void CountDisposal(std::size_t inSize) noexcept {
    disposals.store(disposals.load(std::memory_order_relaxed) + 1, std::memory_order_relaxed);
    bytes.store(bytes.load(std::memory_order_relaxed) - static_cast<std::int64_t>(inSize), std::memory_order_relaxed);
  }
};

std::mutex gRegistryMutex;
ThreadCounters* gLiveThreads = nullptr;  // guarded by gRegistryMutex
// Counts of exited threads and of calls made without a thread cache; updated
// with read-modify-write since any thread may write them.
Counters gShared;

void CountSharedAllocation(std::size_t inSize) noexcept {
  gShared.allocations.fetch_add(1, std::memory_order_relaxed);
  gShared.bytes.fetch_add(static_cast<std::int64_t>(inSize), std::memory_order_relaxed);
}

void CountSharedDisposal(std::size_t inSize) noexcept {
  gShared.disposals.fetch_add(1, std::memory_order_relaxed);
  gShared.bytes.fetch_sub(static_cast<std::int64_t>(inSize), std::memory_order_relaxed);
}

// ---------------------------------------------------------------------------
// Thread caches.

enum class CacheState : unsigned char { kUnused, kLive, kRetired };

struct FreeList {
  Block* head = nullptr;
  std::uint32_t count = 0;
};

struct ThreadCache {
  FreeList lists[kClassCount];
  ThreadCounters counters;
  CacheState state = CacheState::kUnused;
};

// The cache itself: constant-initialized and trivially destructible; the
// flush at thread exit is done by ThreadCacheRetirer.
thread_local ThreadCache tCache;
// The fast paths reach the cache through this pointer, set while the cache is
// live. Initial-exec makes reading it one load relative to the thread
// pointer; it costs 8 bytes of static TLS, which the loader reserves even
// when the library is opened late.
thread_local ThreadCache* tLiveCache __attribute__((tls_model("initial-exec"))) = nullptr;

void RetireThreadCache() noexcept {
  ThreadCache& cache = tCache;
  if (cache.state != CacheState::kLive) return;
  // From here on this thread's calls take the locked path, including calls
  // made by thread-local destructors that run after this one.
  tLiveCache = nullptr;
  cache.state = CacheState::kRetired;
  for (std::size_t c = 0; c < kClassCount; ++c) {
    FreeList& list = cache.lists[c];
    if (list.head == nullptr) continue;
    Block* last = list.head;
    while (last->next != nullptr) last = last->next;
    GiveBatch(c, list.head, last);
    list.head = nullptr;
    list.count = 0;
  }
  std::lock_guard<std::mutex> lock(gRegistryMutex);
  ThreadCounters& mine = cache.counters;
  gShared.allocations.fetch_add(mine.allocations.load(std::memory_order_relaxed), std::memory_order_relaxed);
  gShared.disposals.fetch_add(mine.disposals.load(std::memory_order_relaxed), std::memory_order_relaxed);
  gShared.bytes.fetch_add(mine.bytes.load(std::memory_order_relaxed), std::memory_order_relaxed);
  if (mine.previous != nullptr) mine.previous->next = mine.next;
  else gLiveThreads = mine.next;
  if (mine.next != nullptr) mine.next->previous = mine.previous;
  mine.previous = mine.next = nullptr;
}

struct ThreadCacheRetirer {
  ~ThreadCacheRetirer() { RetireThreadCache(); }
};

// The calling thread's live cache, started on first use (its counters
// registered, its flush at thread exit arranged); null once the thread has
// begun to exit.
ThreadCache* LiveThreadCache() noexcept {
  ThreadCache& cache = tCache;
  if (cache.state == CacheState::kLive) return &cache;
  if (cache.state == CacheState::kRetired) return nullptr;
  try {
    static thread_local ThreadCacheRetirer retirer;
    (void)retirer;
  } catch (...) {
    return nullptr;  // the runtime could not register the thread-exit hook
  }
  {
    std::lock_guard<std::mutex> lock(gRegistryMutex);
    cache.counters.next = gLiveThreads;
    if (gLiveThreads != nullptr) gLiveThreads->previous = &cache.counters;
    gLiveThreads = &cache.counters;
  }
  cache.state = CacheState::kLive;
  if (!kBypassPools) tLiveCache = &cache;
  return &cache;
}

// ---------------------------------------------------------------------------
// Fault injection.

std::atomic<bool> gFailArmed{false};
std::atomic<long long> gFailRemaining{-1};

// True when this allocation may proceed.
bool ConsumeFailAllowance() noexcept {
  long long remaining = gFailRemaining.load(std::memory_order_relaxed);
  while (remaining >= 0) {
    if (remaining == 0) return false;
    if (gFailRemaining.compare_exchange_weak(remaining, remaining - 1, std::memory_order_relaxed)) return true;
  }
  return true;  // disarmed meanwhile
}

// ---------------------------------------------------------------------------
// Everything but a hit in the thread cache. Out of line so that the fast
// paths stay small.

// True for the sizes the thread caches serve (1 to kMaxSmallSize); 0 wraps
// around and is sent to the slow path.
inline bool IsCachedSize(std::size_t inSize) noexcept {
  return !kBypassPools && inSize - 1 < SmallBlockAllocator::kMaxSmallSize;
}

__attribute__((noinline)) void* AllocateSlow(std::size_t inSize) noexcept {
  // Zero bytes still get a block of their own; statistics count what was asked.
  const std::size_t size = inSize != 0 ? inSize : 1;
  ThreadCache* cache = LiveThreadCache();

  if (kBypassPools || size > SmallBlockAllocator::kMaxSmallSize) {
    void* block = std::malloc(size);
    if (block == nullptr) return nullptr;
    if (cache != nullptr) cache->counters.CountAllocation(inSize);
    else CountSharedAllocation(inSize);
    return block;
  }

  const std::size_t c = ClassIndex(size);
  if (cache == nullptr) {
    Pool& pool = gPools[c];
    Block* block;
    {
      std::lock_guard<std::mutex> lock(pool.mutex);
      block = PopFromPool(pool, ClassBlockSize(c));
    }
    if (block != nullptr) CountSharedAllocation(inSize);
    return block;
  }

  FreeList& list = cache->lists[c];
  if (list.head == nullptr) {
    std::uint32_t count = 0;
    list.head = TakeBatch(c, BatchSize(c), count);
    list.count = count;
    if (list.head == nullptr) return nullptr;
  }
  Block* block = list.head;
  list.head = block->next;
  --list.count;
  cache->counters.CountAllocation(inSize);
  return block;
}

__attribute__((noinline)) void DisposeSlow(void* inBlock, std::size_t inSize) noexcept {
  const std::size_t size = inSize != 0 ? inSize : 1;
  ThreadCache* cache = LiveThreadCache();

  if (kBypassPools || size > SmallBlockAllocator::kMaxSmallSize) {
    std::free(inBlock);
  } else if (cache == nullptr) {
    auto* block = static_cast<Block*>(inBlock);
    GiveBatch(ClassIndex(size), block, block);
  } else {
    FreeList& list = cache->lists[ClassIndex(size)];
    auto* block = static_cast<Block*>(inBlock);
    block->next = list.head;
    list.head = block;
    ++list.count;  // a surplus is trimmed by the next fast-path dispose
  }
  if (cache != nullptr) cache->counters.CountDisposal(inSize);
  else CountSharedDisposal(inSize);
}

// Hands one batch of a list that has grown past two batches back to the
// pool, from the front: the only end reached without walking the list.
__attribute__((noinline)) void TrimList(FreeList& ioList, std::size_t inClass) noexcept {
  const std::uint32_t batch = BatchSize(inClass);
  Block* first = ioList.head;
  Block* last = first;
  for (std::uint32_t i = 1; i < batch; ++i) last = last->next;
  ioList.head = last->next;
  ioList.count -= batch;
  GiveBatch(inClass, first, last);
}

}  // namespace

void* SmallBlockAllocator::Allocate(std::size_t inSize) noexcept {
  if (__builtin_expect(gFailArmed.load(std::memory_order_relaxed), false) && !ConsumeFailAllowance()) return nullptr;
  ThreadCache* cache = tLiveCache;
  if (__builtin_expect(cache != nullptr && IsCachedSize(inSize), true)) {
    FreeList& list = cache->lists[ClassIndex(inSize)];
    if (Block* block = list.head; __builtin_expect(block != nullptr, true)) {
      list.head = block->next;
      --list.count;
      cache->counters.CountAllocation(inSize);
      return block;
    }
  }
  return AllocateSlow(inSize);
}

void SmallBlockAllocator::Dispose(void* inBlock, std::size_t inSize) noexcept {
  if (inBlock == nullptr) return;
  ThreadCache* cache = tLiveCache;
  if (__builtin_expect(cache != nullptr && IsCachedSize(inSize), true)) {
    const std::size_t c = ClassIndex(inSize);
    FreeList& list = cache->lists[c];
    auto* block = static_cast<Block*>(inBlock);
    block->next = list.head;
    list.head = block;
    if (__builtin_expect(++list.count > 2 * BatchSize(c), false)) TrimList(list, c);
    cache->counters.CountDisposal(inSize);
    return;
  }
  DisposeSlow(inBlock, inSize);
}

SmallBlockAllocator::Statistics SmallBlockAllocator::GetStatistics() {
  std::lock_guard<std::mutex> lock(gRegistryMutex);
  std::uint64_t allocations = gShared.allocations.load(std::memory_order_relaxed);
  std::uint64_t disposals = gShared.disposals.load(std::memory_order_relaxed);
  std::int64_t bytes = gShared.bytes.load(std::memory_order_relaxed);
  for (ThreadCounters* t = gLiveThreads; t != nullptr; t = t->next) {
    allocations += t->allocations.load(std::memory_order_relaxed);
    disposals += t->disposals.load(std::memory_order_relaxed);
    bytes += t->bytes.load(std::memory_order_relaxed);
  }
  return Statistics{static_cast<std::size_t>(allocations - disposals), static_cast<std::size_t>(bytes), allocations};
}

void SmallBlockAllocator::SetFailAfter(long long inCount) {
  if (inCount < 0) {
    gFailArmed.store(false, std::memory_order_relaxed);
    gFailRemaining.store(-1, std::memory_order_relaxed);
  } else {
    gFailRemaining.store(inCount, std::memory_order_relaxed);
    gFailArmed.store(true, std::memory_order_release);
  }
}

}  // namespace kivcore::utility
