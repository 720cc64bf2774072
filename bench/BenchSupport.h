// What every benchmark of this folder shares: the message, the handlers that
// consume it, the correctness checks, and the general-heap allocation
// counter.
//
//   TarnBench::Tally tally;                          // one per handler
//   TarnBench::TarnTallyListener listener(&tally);   // a Tarn::Listener
//   ...                                              // broadcast K times
//   TarnBench::Verify(state, TarnBench::AllEqual(tallies, K), "missed a call");
//
// The message is a struct of two ints; every handler, whatever library calls
// it, adds the two into its Tally and counts the call, so that a check after
// the run can prove that each handler was called exactly as often as it had
// to be. A benchmark that fails its check is reported as an error (with
// SkipWithError) and makes the program exit non-zero, so a fast wrong result
// never reaches the table.
//
// Threading: Tally and the handlers are not synchronised; each is touched by
// the thread that delivers to it (the main thread in every scenario) and read
// after the run. The allocation counter is process-wide and thread-safe.
#pragma once

#include <TarnMessaging.h>

#include <benchmark/benchmark.h>

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <vector>

namespace TarnBench {

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
// another translation unit so the compiler cannot see the concrete type at
// the call site and must make a real virtual call, as a library would.
class PairSink {
public:
  virtual ~PairSink() = default;
  virtual void OnPair(const PairArgs& inArgs) = 0;
};
PairSink* NewTallySink(Tally* inTally);

// True when every tally counted exactly inCalls calls and summed inSum.
bool AllEqual(const std::vector<Tally>& inTallies, std::int64_t inCalls, std::int64_t inSum);

// Reports a failed check as the benchmark's error and remembers that the
// program must exit non-zero. Returns inOk.
bool Verify(benchmark::State& ioState, bool inOk, const char* inWhat);
// Whether any check has failed so far.
bool AnyCheckFailed();

// Adds "min" and "max" over the repetitions to a benchmark's aggregates. On a
// shared machine other work only ever slows a run down, so the fastest
// repetition estimates the undisturbed cost; the table shows it beside the
// median.
benchmark::internal::Benchmark* WithBestOf(benchmark::internal::Benchmark* ioBenchmark);

// Ensures the calling thread is Tarn's main thread; a benchmark that runs
// elsewhere would measure a broadcast that does nothing.
bool VerifyMainThread(benchmark::State& ioState);

// Counts of the replaced global operator new, process-wide. Counting is off
// unless a HeapCounting scope is open, so that timed benchmarks pay one
// relaxed load per allocation and nothing more.
struct HeapCounts {
  std::uint64_t mAllocations;
  std::int64_t mBytes;  // allocated minus freed, as usable sizes
};
HeapCounts CurrentHeapCounts() noexcept;

class HeapCounting {
public:
  HeapCounting() noexcept;
  ~HeapCounting();
  HeapCounting(const HeapCounting&) = delete;
  HeapCounting& operator=(const HeapCounting&) = delete;
  // Counts since this scope opened.
  std::uint64_t Allocations() const noexcept;
  std::int64_t Bytes() const noexcept;

private:
  HeapCounts mStart;
};

}  // namespace TarnBench
