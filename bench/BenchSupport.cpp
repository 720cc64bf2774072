// The shared pieces of BenchSupport.h, the counting global operator new, and
// the program's entry point.
//
// main() makes its own thread Tarn's main thread (and, with Qt, the thread of
// the QCoreApplication) before any benchmark runs; Google Benchmark runs
// every single-threaded benchmark on that thread, so broadcasts and flushes
// happen where they would in a host. The exit status is non-zero when any
// benchmark failed its correctness check, so that run.sh never prints a
// table built on a wrong result.
#include "BenchSupport.h"

#include <kivcore/MainThread.h>

#if defined(TARN_BENCH_HAVE_QT)
#include <QCoreApplication>
#endif

#include <malloc.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <new>

namespace TarnBench {
namespace {

std::atomic<bool> gCheckFailed{false};

// Constant-initialized: operator new may run before any dynamic initializer.
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

bool AllCalled(const std::vector<Tally>& inTallies, std::int64_t inCalls) {
  return std::all_of(inTallies.begin(), inTallies.end(), [inCalls](const Tally& inTally) {
    return inTally.mCalls == inCalls && inTally.mSum == inCalls * (kA + kB);
  });
}

bool Verify(benchmark::State& ioState, bool inOk, const char* inWhat) {
  if (inOk) return true;
  std::fprintf(stderr, "CHECK FAILED: %s\n", inWhat);
  gCheckFailed.store(true);
  ioState.SkipWithError(inWhat);
  return false;
}

benchmark::internal::Benchmark* WithBestOf(benchmark::internal::Benchmark* ioBenchmark) {
  return ioBenchmark
      ->ComputeStatistics(
          "min",
          [](const std::vector<double>& inValues) { return *std::min_element(inValues.begin(), inValues.end()); })
      ->ComputeStatistics("max", [](const std::vector<double>& inValues) {
        return *std::max_element(inValues.begin(), inValues.end());
      });
}

bool VerifyMainThread(benchmark::State& ioState) {
  return Verify(ioState, kivcore::threads::CurrentThreadIsMainThread(), "not running on Tarn's main thread");
}

const kivcore::utility::ImmutableString& BenchStationID() {
  static const kivcore::utility::ImmutableString sStationID = [] {
    const auto id = kivcore::utility::ImmutableString::CreateStatic("tarn.bench");
    Tarn::StationRegistry::RegisterStation(id, nullptr);
    return id;
  }();
  return sStationID;
}

AllocationCounts::AllocationCounts() noexcept
    : mHeapStart(gAllocations.load()),
      mHeapBytesStart(gBytes.load()),
      mSmallStart(kivcore::utility::SmallBlockAllocator::GetStatistics()) {
  gCountingScopes.fetch_add(1);
}

AllocationCounts::~AllocationCounts() { gCountingScopes.fetch_sub(1); }

std::uint64_t AllocationCounts::HeapAllocations() const noexcept { return gAllocations.load() - mHeapStart; }

std::int64_t AllocationCounts::HeapBytes() const noexcept { return gBytes.load() - mHeapBytesStart; }

std::uint64_t AllocationCounts::SmallBlocks() const {
  return kivcore::utility::SmallBlockAllocator::GetStatistics().allocations - mSmallStart.allocations;
}

std::int64_t AllocationCounts::SmallBytes() const {
  return static_cast<std::int64_t>(kivcore::utility::SmallBlockAllocator::GetStatistics().bytesInUse) -
         static_cast<std::int64_t>(mSmallStart.bytesInUse);
}

}  // namespace TarnBench

int main(int argc, char** argv) {
  Tarn::Messaging::Initialize();
#if defined(TARN_BENCH_HAVE_QT)
  // Queued calls need an event dispatcher on this thread.
  const auto application = std::make_unique<QCoreApplication>(argc, argv);
#endif
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 2;
  benchmark::RunSpecifiedBenchmarks();
  benchmark::Shutdown();
  Tarn::Messaging::Terminate();
  if (TarnBench::gCheckFailed.load()) {
    std::fputs("tarn-bench: at least one benchmark failed its correctness check\n", stderr);
    return 1;
  }
  return 0;
}

// ---------------------------------------------------------------------------
// Replaced global allocation functions. They are visible from the shared
// libraries (the project builds with hidden visibility by default), so that
// allocations made inside TarnMessaging, kivcore, Boost and Qt count too.

namespace {

void* CountedNew(std::size_t inSize, std::size_t inAlignment = 0) noexcept {
  const std::size_t size = inSize == 0 ? 1 : inSize;
  void* block = inAlignment == 0
                    ? std::malloc(size)
                    : std::aligned_alloc(inAlignment, (size + inAlignment - 1) / inAlignment * inAlignment);
  if (block != nullptr && TarnBench::gCountingScopes.load(std::memory_order_relaxed) != 0) {
    TarnBench::gAllocations.fetch_add(1, std::memory_order_relaxed);
    TarnBench::gBytes.fetch_add(static_cast<std::int64_t>(malloc_usable_size(block)), std::memory_order_relaxed);
  }
  return block;
}

void* CountedNewOrThrow(std::size_t inSize, std::size_t inAlignment = 0) {
  if (void* block = CountedNew(inSize, inAlignment)) return block;
  throw std::bad_alloc();
}

void CountedDelete(void* inBlock) noexcept {
  if (inBlock != nullptr && TarnBench::gCountingScopes.load(std::memory_order_relaxed) != 0)
    TarnBench::gBytes.fetch_sub(static_cast<std::int64_t>(malloc_usable_size(inBlock)), std::memory_order_relaxed);
  std::free(inBlock);
}

std::size_t Size(std::align_val_t inAlignment) { return static_cast<std::size_t>(inAlignment); }

}  // namespace

#define TARN_BENCH_VISIBLE __attribute__((visibility("default")))

TARN_BENCH_VISIBLE void* operator new(std::size_t inSize) { return CountedNewOrThrow(inSize); }
TARN_BENCH_VISIBLE void* operator new[](std::size_t inSize) { return CountedNewOrThrow(inSize); }
TARN_BENCH_VISIBLE void* operator new(std::size_t inSize, const std::nothrow_t&) noexcept { return CountedNew(inSize); }
TARN_BENCH_VISIBLE void* operator new[](std::size_t inSize, const std::nothrow_t&) noexcept {
  return CountedNew(inSize);
}
TARN_BENCH_VISIBLE void* operator new(std::size_t inSize, std::align_val_t inAlign) {
  return CountedNewOrThrow(inSize, Size(inAlign));
}
TARN_BENCH_VISIBLE void* operator new[](std::size_t inSize, std::align_val_t inAlign) {
  return CountedNewOrThrow(inSize, Size(inAlign));
}
TARN_BENCH_VISIBLE void* operator new(std::size_t inSize, std::align_val_t inAlign, const std::nothrow_t&) noexcept {
  return CountedNew(inSize, Size(inAlign));
}
TARN_BENCH_VISIBLE void* operator new[](std::size_t inSize, std::align_val_t inAlign, const std::nothrow_t&) noexcept {
  return CountedNew(inSize, Size(inAlign));
}
TARN_BENCH_VISIBLE void operator delete(void* inBlock) noexcept { CountedDelete(inBlock); }
TARN_BENCH_VISIBLE void operator delete[](void* inBlock) noexcept { CountedDelete(inBlock); }
TARN_BENCH_VISIBLE void operator delete(void* inBlock, std::size_t) noexcept { CountedDelete(inBlock); }
TARN_BENCH_VISIBLE void operator delete[](void* inBlock, std::size_t) noexcept { CountedDelete(inBlock); }
TARN_BENCH_VISIBLE void operator delete(void* inBlock, const std::nothrow_t&) noexcept { CountedDelete(inBlock); }
TARN_BENCH_VISIBLE void operator delete[](void* inBlock, const std::nothrow_t&) noexcept { CountedDelete(inBlock); }
TARN_BENCH_VISIBLE void operator delete(void* inBlock, std::align_val_t) noexcept { CountedDelete(inBlock); }
TARN_BENCH_VISIBLE void operator delete[](void* inBlock, std::align_val_t) noexcept { CountedDelete(inBlock); }
TARN_BENCH_VISIBLE void operator delete(void* inBlock, std::size_t, std::align_val_t) noexcept {
  CountedDelete(inBlock);
}
TARN_BENCH_VISIBLE void operator delete[](void* inBlock, std::size_t, std::align_val_t) noexcept {
  CountedDelete(inBlock);
}
TARN_BENCH_VISIBLE void operator delete(void* inBlock, std::align_val_t, const std::nothrow_t&) noexcept {
  CountedDelete(inBlock);
}
TARN_BENCH_VISIBLE void operator delete[](void* inBlock, std::align_val_t, const std::nothrow_t&) noexcept {
  CountedDelete(inBlock);
}
