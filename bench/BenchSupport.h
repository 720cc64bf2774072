// What every benchmark of this folder shares: the message, the handler that
// consumes it, the correctness check, and the general-heap allocation
// counter.
//
// The message is a struct of two ints; every handler, whatever library calls
// it, adds the two into its Tally and counts the call, so that a check after
// the run proves that each handler was called exactly as often as it had to
// be. A benchmark that fails its check is reported as an error (with
// SkipWithError) and makes the program exit non-zero, so a fast wrong result
// never reaches the table.
//
// Threading: a Tally and its handler are touched by the thread that delivers
// to it (the main thread in every scenario) and read after the run. The
// allocation counter is process-wide and thread-safe.
#pragma once

#include <TarnMessaging.h>

#include <kivcore/SmallBlockAllocator.h>

#include <benchmark/benchmark.h>

#include <cstdint>
#include <vector>

namespace TarnBench {

constexpr int kA = 3;
constexpr int kB = 4;

// The peers' message.
struct PairArgs {
  int mA;
  int mB;
};

// Tarn's message: the same two ints.
struct PairMessage : Tarn::MessageImpl<PairMessage> {
  PairMessage(int inA, int inB) : mA(inA), mB(inB) {}
  int mA;
  int mB;
};

// What a handler does with one message.
struct Tally {
  std::int64_t mSum = 0;
  std::int64_t mCalls = 0;
  void Add(int inA, int inB) noexcept {
    mSum += inA + inB;
    ++mCalls;
  }
};

// A Tarn listener, recognising the message by its ID as host code does.
class TarnTallyListener : public Tarn::Listener {
public:
  explicit TarnTallyListener(Tally* inTally) noexcept : mTally(inTally) {}
  void ListenToMessage(const Tarn::Message& inMessage) override;

private:
  Tally* mTally;  // not owned
};

// The floor: a plain interface called through a vector of pointers. Made in
// another translation unit so that the call site cannot see the concrete
// type and makes a real virtual call, as a library would.
class PairSink {
public:
  virtual ~PairSink() = default;
  virtual void OnPair(const PairArgs& inArgs) = 0;
};
PairSink* NewTallySink(Tally* inTally);

// True when every tally counted exactly inCalls calls of (kA, kB).
bool AllCalled(const std::vector<Tally>& inTallies, std::int64_t inCalls);

// Reports a failed check as the benchmark's error and remembers that the
// program must exit non-zero. Returns inOk.
bool Verify(benchmark::State& ioState, bool inOk, const char* inWhat);

// Adds "min" and "max" over the repetitions to a benchmark's aggregates: on
// a shared machine other work only slows a run down, so the best repetition
// is shown beside the median.
benchmark::internal::Benchmark* WithBestOf(benchmark::internal::Benchmark* ioBenchmark);

// A Tarn scenario off the main thread would measure a broadcast that does
// nothing; this makes it fail instead.
bool VerifyMainThread(benchmark::State& ioState);

// A station of the bench's own, registered on first use.
const kivcore::utility::ImmutableString& BenchStationID();

// Allocations through the replaced global operator new, and small-block
// allocations, since construction. Counting of the former is off outside
// such a scope, so that timed benchmarks pay one relaxed load per
// allocation. The small-block figures are exact while no other thread
// allocates.
class AllocationCounts {
public:
  AllocationCounts() noexcept;
  ~AllocationCounts();
  AllocationCounts(const AllocationCounts&) = delete;
  AllocationCounts& operator=(const AllocationCounts&) = delete;
  std::uint64_t HeapAllocations() const noexcept;
  std::int64_t HeapBytes() const noexcept;  // allocated minus freed, as usable sizes
  std::uint64_t SmallBlocks() const;
  std::int64_t SmallBytes() const;

private:
  std::uint64_t mHeapStart;
  std::int64_t mHeapBytesStart;
  kivcore::utility::SmallBlockAllocator::Statistics mSmallStart;
};

}  // namespace TarnBench
