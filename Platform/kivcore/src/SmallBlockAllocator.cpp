// SmallBlockAllocator: size-classed free lists, cached per thread.
//
// Requests of up to kMaxSmallSize bytes are rounded up to a multiple of
// kGranule and served from that class's free list in the calling thread's
// cache, with no lock and no atomic read-modify-write. An empty thread list
// is refilled with a batch from the class's shared pool; a list that grows
// past two batches hands one batch back. The pool carves new blocks from
// chunks taken from malloc; ReleaseFreeChunks returns the chunks whose every
// block is back in the pool (after a burst). Larger requests go to malloc
// and free.
//
// Everything global here is trivially destructible and constant-initialized,
// so the allocator keeps working during static destruction. A thread that
// has already flushed its cache at exit (or is in the middle of doing so)
// takes the locked pool path instead of its cache.
//
// A thread's cache lives on the heap, not in thread-local storage, and is
// flushed by a thread-specific-data destructor, not a C++ thread_local one.
// A thread's first allocation may come from another library's
// thread-specific-data destructor (a released object's cleanup), after the
// C++ thread_local destructors have run: a flush registered then would never
// run, and a record kept in thread-local storage would stay linked into the
// registry after the next thread reused that storage. A key set during those
// destructors makes the runtime call ours in a later round. Only a first use
// in the runtime's very last round escapes the flush; its cache then stays
// registered for good: its blocks are stranded, its counts still exact.
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
#include <cstdint>
#include <cstdlib>
#include <functional>
#include <mutex>
#include <new>
#include <vector>

#include <malloc.h>

#include <pthread.h>

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

// One thread's cache. Taken from gSpareCaches or malloc when the thread
// first allocates, handed back to gSpareCaches when it exits; never freed.
struct ThreadCache {
  FreeList lists[kClassCount];  // owned by the thread
  ThreadCounters counters;
  ThreadCache* nextSpare = nullptr;  // guarded by gRegistryMutex
};

ThreadCache* gSpareCaches = nullptr;  // flushed, zeroed caches; guarded by gRegistryMutex

// Constant-initialized and trivially destructible, so that a new thread
// reusing an old thread's storage starts unused.
thread_local CacheState tState = CacheState::kUnused;
thread_local ThreadCache* tCache = nullptr;
// The fast paths reach the cache through this pointer, set while the cache is
// live (and the pools are not bypassed). Initial-exec makes reading it one
// load relative to the thread pointer; it costs 8 bytes of static TLS, which
// the loader reserves even when the library is opened late.
thread_local ThreadCache* tLiveCache __attribute__((tls_model("initial-exec"))) = nullptr;

// The key whose destructor flushes a thread's cache at exit. Never deleted:
// the library is linked not to be unloaded (see Platform/CMakeLists.txt), so
// the destructor stays callable for every thread.
pthread_once_t gRetireKeyOnce = PTHREAD_ONCE_INIT;
pthread_key_t gRetireKey;
bool gRetireKeyMade = false;  // written once under gRetireKeyOnce

// Runs on the exiting thread itself, as its thread-specific data is destroyed.
void RetireThreadCache(void* inCache) noexcept {
  auto* cache = static_cast<ThreadCache*>(inCache);
  // From here on this thread's calls take the locked path, including calls
  // made by thread-specific-data destructors that run after this one.
  tLiveCache = nullptr;
  tCache = nullptr;
  tState = CacheState::kRetired;
  for (std::size_t c = 0; c < kClassCount; ++c) {
    FreeList& list = cache->lists[c];
    if (list.head == nullptr) continue;
    Block* last = list.head;
    while (last->next != nullptr) last = last->next;
    GiveBatch(c, list.head, last);
    list.head = nullptr;
    list.count = 0;
  }
  std::lock_guard<std::mutex> lock(gRegistryMutex);
  ThreadCounters& mine = cache->counters;
  gShared.allocations.fetch_add(mine.allocations.load(std::memory_order_relaxed), std::memory_order_relaxed);
  gShared.disposals.fetch_add(mine.disposals.load(std::memory_order_relaxed), std::memory_order_relaxed);
  gShared.bytes.fetch_add(mine.bytes.load(std::memory_order_relaxed), std::memory_order_relaxed);
  mine.allocations.store(0, std::memory_order_relaxed);
  mine.disposals.store(0, std::memory_order_relaxed);
  mine.bytes.store(0, std::memory_order_relaxed);
  if (mine.previous != nullptr) mine.previous->next = mine.next;
  else gLiveThreads = mine.next;
  if (mine.next != nullptr) mine.next->previous = mine.previous;
  mine.previous = mine.next = nullptr;
  cache->nextSpare = gSpareCaches;
  gSpareCaches = cache;
}

void MakeRetireKey() noexcept { gRetireKeyMade = pthread_key_create(&gRetireKey, &RetireThreadCache) == 0; }

// The calling thread's live cache, started on first use (registered, and its
// flush at thread exit arranged); null once the thread has begun to exit, or
// when no cache can be had (the locked path then serves the thread).
ThreadCache* LiveThreadCache() noexcept {
  if (tState == CacheState::kLive) return tCache;
  if (tState == CacheState::kRetired) return nullptr;
  if (pthread_once(&gRetireKeyOnce, &MakeRetireKey) != 0 || !gRetireKeyMade) return nullptr;
  ThreadCache* cache = nullptr;
  {
    std::lock_guard<std::mutex> lock(gRegistryMutex);
    if ((cache = gSpareCaches) != nullptr) gSpareCaches = cache->nextSpare;
  }
  if (cache == nullptr) {
    void* storage = std::malloc(sizeof(ThreadCache));
    if (storage == nullptr) return nullptr;
    cache = new (storage) ThreadCache;
  }
  const bool arranged = pthread_setspecific(gRetireKey, cache) == 0;
  std::lock_guard<std::mutex> lock(gRegistryMutex);
  if (!arranged) {
    cache->nextSpare = gSpareCaches;
    gSpareCaches = cache;
    return nullptr;
  }
  cache->nextSpare = nullptr;
  cache->counters.next = gLiveThreads;
  if (gLiveThreads != nullptr) gLiveThreads->previous = &cache->counters;
  gLiveThreads = &cache->counters;
  tCache = cache;
  tState = CacheState::kLive;
  if (!kBypassPools) tLiveCache = cache;
  return cache;
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
  // Each record is read while its thread may go on counting, so a disposal
  // can be seen without the allocation another thread made of its block:
  // the figures are clamped at zero rather than wrapped.
  return Statistics{allocations > disposals ? static_cast<std::size_t>(allocations - disposals) : 0,
                    bytes > 0 ? static_cast<std::size_t>(bytes) : 0, allocations};
}

void SmallBlockAllocator::ReleaseFreeChunks() noexcept {
  if (kBypassPools) return;
  bool released = false;
  for (std::size_t c = 0; c < kClassCount; ++c) {
    Pool& pool = gPools[c];
    const std::size_t perChunk = (kChunkSize - kChunkHeader) / ClassBlockSize(c);
    std::vector<char*> gone;
    try {
      std::lock_guard<std::mutex> lock(pool.mutex);
      // The newest chunk is still being carved: it stays.
      if (pool.freeList == nullptr || pool.chunks == nullptr || pool.chunks->previous == nullptr) continue;
      std::vector<char*> starts;
      for (Chunk* chunk = pool.chunks->previous; chunk != nullptr; chunk = chunk->previous)
        starts.push_back(reinterpret_cast<char*>(chunk));
      std::sort(starts.begin(), starts.end());
      // The position in starts of the chunk holding inAddress, or -1. Blocks
      // freed one after the other mostly share a chunk: the last one found
      // is tried first.
      std::size_t last = 0;
      const auto chunkOf = [&starts, &last](const void* inAddress) -> std::ptrdiff_t {
        const char* const address = static_cast<const char*>(inAddress);
        if (address >= starts[last] && address < starts[last] + kChunkSize) return static_cast<std::ptrdiff_t>(last);
        const auto after = std::upper_bound(starts.begin(), starts.end(), address,
                                            [](const char* inA, const char* inB) { return std::less<const char*>()(inA, inB); });
        if (after == starts.begin() || address >= *(after - 1) + kChunkSize) return -1;
        last = static_cast<std::size_t>(after - 1 - starts.begin());
        return static_cast<std::ptrdiff_t>(last);
      };
      std::vector<std::size_t> freeBlocks(starts.size(), 0);
      for (const Block* block = pool.freeList; block != nullptr; block = block->next) {
        const std::ptrdiff_t at = chunkOf(block);
        if (at >= 0) ++freeBlocks[static_cast<std::size_t>(at)];
      }
      for (std::size_t i = 0; i < starts.size(); ++i) {
        if (freeBlocks[i] == perChunk) gone.push_back(starts[i]);
      }
      if (gone.empty()) continue;
      const auto isGone = [&](const void* inAddress) {
        const std::ptrdiff_t at = chunkOf(inAddress);
        return at >= 0 && freeBlocks[static_cast<std::size_t>(at)] == perChunk;
      };
      for (Block** link = &pool.freeList; *link != nullptr;) {
        if (isGone(*link)) *link = (*link)->next;
        else link = &(*link)->next;
      }
      for (Chunk** link = &pool.chunks->previous; *link != nullptr;) {
        if (isGone(*link)) *link = (*link)->previous;
        else link = &(*link)->previous;
      }
    } catch (...) {
      // No storage for the tallies: the chunks stay, unchanged.
      continue;
    }
    for (char* chunk : gone) std::free(chunk);
    released = true;
  }
  // Freed chunks amid the heap go back to the system only when trimmed.
  if (released) ::malloc_trim(0);
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
