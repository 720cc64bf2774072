#include "BenchSupport.h"

#include <kivcore/MainThread.h>

#include <malloc.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <new>

namespace TarnBench {

namespace {

std::atomic<bool> gCheckFailed{false};

// The counters of the replaced operator new. Plain globals with constant
// initialization: operator new may run before any dynamic initializer.
std::atomic<int> gCountingScopes{0};
std::atomic<std::uint64_t> gAllocations{0};
std::atomic<std::int64_t> gBytes{0};

class TallySink final : public PairSink {
public:
  explicit TallySink(Tally* inTally) noexcept : mTally(inTally) {}
  void OnPair(const PairArgs& inArgs) override { mTally->Add(inArgs.mA, inArgs.mB); }

private:
  Tally* mTally;
};

}  // namespace

void TarnTallyListener::ListenToMessage(const Tarn::Message& inMessage) {
  if (inMessage.GetMessageID() != PairMessage::StaticMessageID()) return;
  const auto& pair = static_cast<const PairMessage&>(inMessage);
  mTally->Add(pair.mA, pair.mB);
}

PairSink* NewTallySink(Tally* inTally) { return new TallySink(inTally); }

bool AllEqual(const std::vector<Tally>& inTallies, std::int64_t inCalls, std::int64_t inSum) {
  for (const Tally& tally : inTallies) {
    if (tally.mCalls != inCalls || tally.mSum != inSum) return false;
  }
  return true;
}

bool Verify(benchmark::State& ioState, bool inOk, const char* inWhat) {
  if (inOk) return true;
  std::fprintf(stderr, "CHECK FAILED: %s\n", inWhat);
  gCheckFailed.store(true);
  ioState.SkipWithError(inWhat);
  return false;
}

bool AnyCheckFailed() { return gCheckFailed.load(); }

benchmark::internal::Benchmark* WithBestOf(benchmark::internal::Benchmark* ioBenchmark) {
  return ioBenchmark
      ->ComputeStatistics("min", [](const std::vector<double>& inValues) {
        return *std::min_element(inValues.begin(), inValues.end());
      })
      ->ComputeStatistics("max", [](const std::vector<double>& inValues) {
        return *std::max_element(inValues.begin(), inValues.end());
      });
}

bool VerifyMainThread(benchmark::State& ioState) {
  return Verify(ioState, kivcore::threads::CurrentThreadIsMainThread(), "not running on Tarn's main thread");
}

HeapCounts CurrentHeapCounts() noexcept {
  return HeapCounts{gAllocations.load(std::memory_order_relaxed), gBytes.load(std::memory_order_relaxed)};
}

HeapCounting::HeapCounting() noexcept {
  gCountingScopes.fetch_add(1);
  mStart = CurrentHeapCounts();
}

HeapCounting::~HeapCounting() { gCountingScopes.fetch_sub(1); }

std::uint64_t HeapCounting::Allocations() const noexcept { return CurrentHeapCounts().mAllocations - mStart.mAllocations; }

std::int64_t HeapCounting::Bytes() const noexcept { return CurrentHeapCounts().mBytes - mStart.mBytes; }

}  // namespace TarnBench

// ---------------------------------------------------------------------------
// Replaced global allocation functions. They must be visible from the shared
// libraries (the project builds with hidden visibility by default), so that
// allocations made inside TarnMessaging, kivcore and Boost are counted too.

namespace {

void CountNew(void* inBlock) noexcept {
  if (TarnBench::gCountingScopes.load(std::memory_order_relaxed) == 0) return;
  TarnBench::gAllocations.fetch_add(1, std::memory_order_relaxed);
  TarnBench::gBytes.fetch_add(static_cast<std::int64_t>(malloc_usable_size(inBlock)), std::memory_order_relaxed);
}

void CountDelete(void* inBlock) noexcept {
  if (inBlock == nullptr || TarnBench::gCountingScopes.load(std::memory_order_relaxed) == 0) return;
  TarnBench::gBytes.fetch_sub(static_cast<std::int64_t>(malloc_usable_size(inBlock)), std::memory_order_relaxed);
}

void* CountedNew(std::size_t inSize) noexcept {
  void* block = std::malloc(inSize == 0 ? 1 : inSize);
  if (block != nullptr) CountNew(block);
  return block;
}

void* CountedAlignedNew(std::size_t inSize, std::align_val_t inAlignment) noexcept {
  const auto alignment = static_cast<std::size_t>(inAlignment);
  const std::size_t size = ((inSize == 0 ? 1 : inSize) + alignment - 1) / alignment * alignment;
  void* block = std::aligned_alloc(alignment, size);
  if (block != nullptr) CountNew(block);
  return block;
}

void CountedDelete(void* inBlock) noexcept {
  CountDelete(inBlock);
  std::free(inBlock);
}

}  // namespace

#define TARN_BENCH_VISIBLE __attribute__((visibility("default")))

TARN_BENCH_VISIBLE void* operator new(std::size_t inSize) {
  if (void* block = CountedNew(inSize)) return block;
  throw std::bad_alloc();
}
TARN_BENCH_VISIBLE void* operator new[](std::size_t inSize) {
  if (void* block = CountedNew(inSize)) return block;
  throw std::bad_alloc();
}
TARN_BENCH_VISIBLE void* operator new(std::size_t inSize, const std::nothrow_t&) noexcept { return CountedNew(inSize); }
TARN_BENCH_VISIBLE void* operator new[](std::size_t inSize, const std::nothrow_t&) noexcept { return CountedNew(inSize); }
TARN_BENCH_VISIBLE void* operator new(std::size_t inSize, std::align_val_t inAlignment) {
  if (void* block = CountedAlignedNew(inSize, inAlignment)) return block;
  throw std::bad_alloc();
}
TARN_BENCH_VISIBLE void* operator new[](std::size_t inSize, std::align_val_t inAlignment) {
  if (void* block = CountedAlignedNew(inSize, inAlignment)) return block;
  throw std::bad_alloc();
}
TARN_BENCH_VISIBLE void* operator new(std::size_t inSize, std::align_val_t inAlignment, const std::nothrow_t&) noexcept {
  return CountedAlignedNew(inSize, inAlignment);
}
TARN_BENCH_VISIBLE void* operator new[](std::size_t inSize, std::align_val_t inAlignment, const std::nothrow_t&) noexcept {
  return CountedAlignedNew(inSize, inAlignment);
}

TARN_BENCH_VISIBLE void operator delete(void* inBlock) noexcept { CountedDelete(inBlock); }
TARN_BENCH_VISIBLE void operator delete[](void* inBlock) noexcept { CountedDelete(inBlock); }
TARN_BENCH_VISIBLE void operator delete(void* inBlock, std::size_t) noexcept { CountedDelete(inBlock); }
TARN_BENCH_VISIBLE void operator delete[](void* inBlock, std::size_t) noexcept { CountedDelete(inBlock); }
TARN_BENCH_VISIBLE void operator delete(void* inBlock, const std::nothrow_t&) noexcept { CountedDelete(inBlock); }
TARN_BENCH_VISIBLE void operator delete[](void* inBlock, const std::nothrow_t&) noexcept { CountedDelete(inBlock); }
TARN_BENCH_VISIBLE void operator delete(void* inBlock, std::align_val_t) noexcept { CountedDelete(inBlock); }
TARN_BENCH_VISIBLE void operator delete[](void* inBlock, std::align_val_t) noexcept { CountedDelete(inBlock); }
TARN_BENCH_VISIBLE void operator delete(void* inBlock, std::size_t, std::align_val_t) noexcept { CountedDelete(inBlock); }
TARN_BENCH_VISIBLE void operator delete[](void* inBlock, std::size_t, std::align_val_t) noexcept { CountedDelete(inBlock); }
TARN_BENCH_VISIBLE void operator delete(void* inBlock, std::align_val_t, const std::nothrow_t&) noexcept {
  CountedDelete(inBlock);
}
TARN_BENCH_VISIBLE void operator delete[](void* inBlock, std::align_val_t, const std::nothrow_t&) noexcept {
  CountedDelete(inBlock);
}
