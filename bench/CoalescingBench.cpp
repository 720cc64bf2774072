// Progress reporting from worker threads, plain posts against coalesced ones:
// two workers each post 500,000 progress updates (1M in all) to one station
// as fast as they can, while the main thread waits for pending calls and
// flushes them.
//   Coalescing/Plain      PostMessageToUIThread: every update is delivered
//   Coalescing/Coalesced  PostCoalescedMessageToUIThread keyed by worker: an
//                         update still queued is replaced, so the main thread
//                         hears only the newest one of each worker per run
// Counters: posts_per_second (from the first post to the last delivery),
// main_thread_ms (CPU time of the main thread over the same span) and
// deliveries. After each run a check proves that each worker's last update
// arrived and that no update arrived after a newer one of the same worker.
#include "BenchSupport.h"

#include <kivcore/MainThread.h>

#include <time.h>

#include <atomic>
#include <chrono>
#include <thread>
#include <vector>

namespace TarnBench {
namespace {

using Clock = std::chrono::steady_clock;

constexpr int kWorkers = 2;
constexpr int kUpdatesEach = 500000;

double ThreadCpuSeconds() {
  timespec now{};
  clock_gettime(CLOCK_THREAD_CPUTIME_ID, &now);
  return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

// What the main thread hears: PairMessage(update, worker), updates from 1.
class ProgressRecord : public Tarn::Listener {
public:
  void ListenToMessage(const Tarn::Message& inMessage) override {
    const PairMessage* update = inMessage.As<PairMessage>();
    if (update == nullptr) return;
    ++mDeliveries;
    int& last = mLast[static_cast<std::size_t>(update->mB)];
    if (update->mA <= last) mStale = true;
    else last = update->mA;
  }
  bool Finished() const {
    for (int last : mLast)
      if (last != kUpdatesEach) return false;
    return true;
  }

  std::vector<int> mLast = std::vector<int>(kWorkers, 0);
  std::int64_t mDeliveries = 0;
  bool mStale = false;  // an update at or below one already heard
};

void Progress(benchmark::State& ioState, bool inCoalesced) {
  if (!VerifyMainThread(ioState)) return;
  const kivcore::utility::ImmutableString& stationID = BenchStationID();
  const auto adaptor = kivcore::threads::GetRegisteredMainThread();
  double mainSeconds = 0, wallSeconds = 0;
  std::int64_t deliveries = 0;
  for (auto _ : ioState) {
    ProgressRecord record;
    Tarn::StationUtils::AddListener(stationID, &record);
    std::atomic<bool> go{false};
    std::vector<std::thread> workers;
    for (int worker = 0; worker < kWorkers; ++worker)
      workers.emplace_back([&, worker] {
        while (!go.load(std::memory_order_acquire)) std::this_thread::yield();
        for (int update = 1; update <= kUpdatesEach; ++update) {
          if (inCoalesced)
            Tarn::StationUtils::PostCoalescedMessageToUIThread(stationID, PairMessage(update, worker),
                                                               static_cast<std::uint64_t>(worker));
          else Tarn::StationUtils::PostMessageToUIThread(stationID, PairMessage(update, worker), false);
        }
      });
    const Clock::time_point start = Clock::now(), deadline = start + std::chrono::seconds(60);
    const double cpuStart = ThreadCpuSeconds();
    go.store(true, std::memory_order_release);
    while (!record.Finished() && Clock::now() < deadline)
      if (adaptor->WaitForPendingCalls(100)) Tarn::StationUtils::FlushPostedMessagesOnUIThread();
    mainSeconds += ThreadCpuSeconds() - cpuStart;
    const double seconds = std::chrono::duration<double>(Clock::now() - start).count();
    for (std::thread& worker : workers) worker.join();
    Tarn::StationUtils::FlushPostedMessagesOnUIThread();
    Tarn::StationUtils::RemoveListener(stationID, &record);
    const bool exact = inCoalesced || record.mDeliveries == std::int64_t{kWorkers} * kUpdatesEach;
    if (!Verify(ioState, record.Finished() && !record.mStale && exact, "an update was lost, repeated or stale"))
      return;
    ioState.SetIterationTime(seconds);
    wallSeconds += seconds;
    deliveries += record.mDeliveries;
  }
  const double runs = static_cast<double>(ioState.iterations());
  ioState.counters["posts_per_second"] = runs * kWorkers * kUpdatesEach / wallSeconds;
  ioState.counters["main_thread_ms"] = 1000 * mainSeconds / runs;
  ioState.counters["deliveries"] = static_cast<double>(deliveries) / runs;
}

const bool sRegistered = [] {
  for (const bool coalesced : {false, true})
    WithBestOf(benchmark::RegisterBenchmark(coalesced ? "Coalescing/Coalesced" : "Coalescing/Plain",
                                            [coalesced](benchmark::State& ioState) { Progress(ioState, coalesced); }))
        ->Iterations(1)
        ->UseManualTime();
  return true;
}();

}  // namespace
}  // namespace TarnBench
