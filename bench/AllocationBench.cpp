// Allocations: how many general-heap blocks (the replaced global operator
// new of this program) and how many small-block allocator blocks one
// delivery, one post and one registered listener cost.
//
// Each benchmark runs once per repetition (the time it reports is not a
// figure of interest), warms up first so that containers that keep their
// capacity have reached it, then counts over many operations and reports the
// average per operation as counters:
//   heap_allocs_per_op    general-heap allocations per delivery or post
//   small_blocks_per_op   small-block allocations per delivery or post
//   heap_bytes_per_listener, small_block_bytes_per_listener, heap_allocs_per_listener
// The small-block figures are read from SmallBlockAllocator::GetStatistics
// while no other thread allocates, when they are exact.
#include "BenchSupport.h"

#include <kivcore/MainThread.h>

#include <boost/asio/io_context.hpp>
#include <boost/asio/post.hpp>
#include <boost/signals2/signal.hpp>

#if defined(TARN_BENCH_HAVE_SIGC)
#include <sigc++/sigc++.h>
#endif

#include <condition_variable>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

namespace TarnBench {
namespace {

using kivcore::utility::SmallBlockAllocator;

constexpr int kA = 7;
constexpr int kB = 8;
constexpr int kDeliveryListeners = 100;
constexpr int kBroadcasts = 1000;
constexpr int kPosts = 10000;
constexpr int kRegisteredListeners = 1000;

const kivcore::utility::ImmutableString& AllocationStationID() {
  static const kivcore::utility::ImmutableString sStationID = [] {
    const auto id = kivcore::utility::ImmutableString::CreateStatic("tarn.bench.allocation");
    Tarn::StationRegistry::RegisterStation(id, nullptr);
    return id;
  }();
  return sStationID;
}

// Counts both allocators over one scope.
class AllocationCounts {
public:
  AllocationCounts() : mSmallStart(SmallBlockAllocator::GetStatistics()) {}
  std::uint64_t HeapAllocations() const noexcept { return mHeap.Allocations(); }
  std::int64_t HeapBytes() const noexcept { return mHeap.Bytes(); }
  std::uint64_t SmallBlocks() const { return SmallBlockAllocator::GetStatistics().allocations - mSmallStart.allocations; }
  std::int64_t SmallBytes() const {
    return static_cast<std::int64_t>(SmallBlockAllocator::GetStatistics().bytesInUse) -
           static_cast<std::int64_t>(mSmallStart.bytesInUse);
  }

private:
  SmallBlockAllocator::Statistics mSmallStart;
  HeapCounting mHeap;
};

void ReportPerOperation(benchmark::State& ioState, std::uint64_t inHeap, std::uint64_t inSmall, std::int64_t inOperations) {
  ioState.counters["heap_allocs_per_op"] = static_cast<double>(inHeap) / static_cast<double>(inOperations);
  ioState.counters["small_blocks_per_op"] = static_cast<double>(inSmall) / static_cast<double>(inOperations);
}

// ---------------------------------------------------------------------------
// Per delivery: kBroadcasts broadcasts to kDeliveryListeners listeners.

template <class Broadcast>
void CountDeliveries(benchmark::State& ioState, const std::vector<Tally>& inTallies, Broadcast inBroadcast) {
  for (auto _ : ioState) {
    inBroadcast();  // warm-up: first-use allocations are not per delivery
    AllocationCounts counts;
    for (int i = 0; i < kBroadcasts; ++i) inBroadcast();
    const std::uint64_t heap = counts.HeapAllocations();
    const std::uint64_t small = counts.SmallBlocks();
    // One iteration per run (Iterations(1)): the warm-up and the counted broadcasts.
    const std::int64_t rounds = kBroadcasts + 1;
    if (!Verify(ioState, AllEqual(inTallies, rounds, rounds * (kA + kB)), "a listener was not called once per broadcast"))
      return;
    ReportPerOperation(ioState, heap, small, static_cast<std::int64_t>(kBroadcasts) * kDeliveryListeners);
  }
}

void DeliveryTarnPlain(benchmark::State& ioState) {
  if (!VerifyMainThread(ioState)) return;
  std::vector<Tally> tallies(kDeliveryListeners);
  std::vector<std::unique_ptr<TarnTallyListener>> listeners;
  Tarn::Broadcaster broadcaster;
  for (Tally& tally : tallies) {
    listeners.push_back(std::make_unique<TarnTallyListener>(&tally));
    broadcaster.AddListener(listeners.back().get());
  }
  const PairMessage message(kA, kB);
  CountDeliveries(ioState, tallies, [&] { broadcaster.BroadcastMessage(message); });
}

void DeliveryTarnWeak(benchmark::State& ioState) {
  if (!VerifyMainThread(ioState)) return;
  std::vector<Tally> tallies(kDeliveryListeners);
  std::vector<std::shared_ptr<TarnTallyListener>> listeners;
  Tarn::Broadcaster broadcaster;
  for (Tally& tally : tallies) {
    listeners.push_back(std::make_shared<TarnTallyListener>(&tally));
    broadcaster.AddListener(std::weak_ptr<Tarn::Listener>(listeners.back()));
  }
  const PairMessage message(kA, kB);
  CountDeliveries(ioState, tallies, [&] { broadcaster.BroadcastMessage(message); });
}

void DeliveryTarnStation(benchmark::State& ioState) {
  if (!VerifyMainThread(ioState)) return;
  std::vector<Tally> tallies(kDeliveryListeners);
  std::vector<std::unique_ptr<TarnTallyListener>> listeners;
  for (Tally& tally : tallies) {
    listeners.push_back(std::make_unique<TarnTallyListener>(&tally));
    Tarn::StationUtils::AddListener(AllocationStationID(), listeners.back().get());
  }
  const PairMessage message(kA, kB);
  CountDeliveries(ioState, tallies, [&] { Tarn::StationUtils::BroadcastMessage(AllocationStationID(), message); });
}

void DeliverySignals2(benchmark::State& ioState) {
  std::vector<Tally> tallies(kDeliveryListeners);
  boost::signals2::signal<void(const PairArgs&)> signal;
  for (Tally& tally : tallies) {
    Tally* target = &tally;
    signal.connect([target](const PairArgs& inArgs) { target->Add(inArgs.mA, inArgs.mB); });
  }
  CountDeliveries(ioState, tallies, [&] { signal(PairArgs{kA, kB}); });
}

#if defined(TARN_BENCH_HAVE_SIGC)
void DeliverySigc(benchmark::State& ioState) {
  std::vector<Tally> tallies(kDeliveryListeners);
  sigc::signal<void(const PairArgs&)> signal;
  for (Tally& tally : tallies) {
    Tally* target = &tally;
    signal.connect([target](const PairArgs& inArgs) { target->Add(inArgs.mA, inArgs.mB); });
  }
  CountDeliveries(ioState, tallies, [&] { signal.emit(PairArgs{kA, kB}); });
}
#endif

// ---------------------------------------------------------------------------
// Per post.

// The direct path: on the main thread with inForceAsync false the post is a
// broadcast.
void DirectPostTarn(benchmark::State& ioState) {
  if (!VerifyMainThread(ioState)) return;
  std::vector<Tally> tallies(1);
  TarnTallyListener listener(&tallies[0]);
  Tarn::StationUtils::AddListener(AllocationStationID(), &listener);
  const auto post = [] {
    Tarn::StationUtils::PostMessageToUIThread(AllocationStationID(), PairMessage(kA, kB), false);
  };
  for (auto _ : ioState) {
    post();
    AllocationCounts counts;
    for (int i = 0; i < kPosts; ++i) post();
    const std::uint64_t heap = counts.HeapAllocations();
    const std::uint64_t small = counts.SmallBlocks();
    const std::int64_t rounds = kPosts + 1;
    if (!Verify(ioState, AllEqual(tallies, rounds, rounds * (kA + kB)), "a direct post was not delivered once")) break;
    ReportPerOperation(ioState, heap, small, kPosts);
  }
  Tarn::StationUtils::RemoveListener(AllocationStationID(), &listener);
}

// A thread that runs one job when told to and then waits to be let go, so
// that its creation and exit stay outside the counted scope.
class WorkerThread {
public:
  explicit WorkerThread(std::function<void()> inJob) : mJob(std::move(inJob)) {
    mThread = std::thread([this] {
      Await(1);
      mJob();
      Advance(2);
      Await(3);
    });
  }
  ~WorkerThread() {
    Advance(3);
    mThread.join();
  }
  // Runs the job on the worker and returns once it is done.
  void RunJob() {
    Advance(1);
    Await(2);
  }

private:
  void Advance(int inStep) {
    {
      std::lock_guard<std::mutex> lock(mMutex);
      mStep = inStep;
    }
    mChanged.notify_all();
  }
  void Await(int inStep) {
    std::unique_lock<std::mutex> lock(mMutex);
    mChanged.wait(lock, [this, inStep] { return mStep >= inStep; });
  }

  std::function<void()> mJob;
  std::mutex mMutex;
  std::condition_variable mChanged;
  int mStep = 0;  // guarded by mMutex
  std::thread mThread;
};

// inPost(i) posts message i from the calling thread; inRun delivers on the
// main thread everything posted. With inFromWorker the posts are made by a
// worker thread, otherwise by the main thread. Two warm-up rounds let both of
// the main-thread queue's vectors reach their capacity.
template <class Post, class Run>
void CountPosts(benchmark::State& ioState, const Tally& inTally, bool inFromWorker, Post inPost, Run inRun) {
  const auto postAll = [&inPost] {
    for (int i = 0; i < kPosts; ++i) inPost(i);
  };
  for (auto _ : ioState) {
    std::uint64_t heap = 0;
    std::uint64_t small = 0;
    for (int round = 0; round < 3; ++round) {
      std::unique_ptr<WorkerThread> worker;
      if (inFromWorker) worker = std::make_unique<WorkerThread>(postAll);
      AllocationCounts counts;
      if (worker) worker->RunJob();
      else postAll();
      inRun();
      heap = counts.HeapAllocations();
      small = counts.SmallBlocks();
    }
    const std::int64_t posts = 3 * kPosts;
    if (!Verify(ioState, inTally.mCalls == posts, "a post was not delivered exactly once")) return;
    ReportPerOperation(ioState, heap, small, kPosts);
  }
}

void DeferredPostTarn(benchmark::State& ioState, bool inFromWorker) {
  if (!VerifyMainThread(ioState)) return;
  std::vector<Tally> tallies(1);
  TarnTallyListener listener(&tallies[0]);
  Tarn::StationUtils::AddListener(AllocationStationID(), &listener);
  CountPosts(
      ioState, tallies[0], inFromWorker,
      [inFromWorker](int) {
        Tarn::StationUtils::PostMessageToUIThread(AllocationStationID(), PairMessage(kA, kB), !inFromWorker);
      },
      [] { Tarn::StationUtils::FlushPostedMessagesOnUIThread(); });
  Tarn::StationUtils::RemoveListener(AllocationStationID(), &listener);
}

void WorkerPostAsio(benchmark::State& ioState) {
  Tally tally;
  boost::asio::io_context context;
  CountPosts(
      ioState, tally, true,
      [&context, &tally](int) { boost::asio::post(context, [&tally] { tally.Add(kA, kB); }); },
      [&context] {
        context.run();
        context.restart();
      });
}

void WorkerPostMutexQueue(benchmark::State& ioState) {
  Tally tally;
  std::mutex mutex;
  std::deque<std::function<void()>> queue;
  CountPosts(
      ioState, tally, true,
      [&](int) {
        std::lock_guard<std::mutex> lock(mutex);
        queue.push_back([&tally] { tally.Add(kA, kB); });
      },
      [&] {
        std::deque<std::function<void()>> batch;
        {
          std::lock_guard<std::mutex> lock(mutex);
          batch.swap(queue);
        }
        for (auto& call : batch) call();
      });
}

// ---------------------------------------------------------------------------
// Per registered listener: kRegisteredListeners attached to one broadcaster.

template <class Attach>
void CountListenerBytes(benchmark::State& ioState, Attach inAttach) {
  for (auto _ : ioState) {
    AllocationCounts counts;
    inAttach();
    // Read before the counters are written: writing them allocates.
    const double smallBytes = static_cast<double>(counts.SmallBytes());
    const double heapBytes = static_cast<double>(counts.HeapBytes());
    const double heapAllocations = static_cast<double>(counts.HeapAllocations());
    ioState.counters["small_block_bytes_per_listener"] = smallBytes / kRegisteredListeners;
    ioState.counters["heap_bytes_per_listener"] = heapBytes / kRegisteredListeners;
    ioState.counters["heap_allocs_per_listener"] = heapAllocations / kRegisteredListeners;
  }
}

void ListenerBytesTarnPlain(benchmark::State& ioState) {
  std::vector<Tally> tallies(kRegisteredListeners);
  std::vector<std::unique_ptr<TarnTallyListener>> listeners;
  for (Tally& tally : tallies) listeners.push_back(std::make_unique<TarnTallyListener>(&tally));
  auto broadcaster = std::make_unique<Tarn::Broadcaster>();
  CountListenerBytes(ioState, [&] {
    for (auto& listener : listeners) broadcaster->AddListener(listener.get());
  });
  broadcaster->BroadcastMessage(PairMessage(kA, kB));
  Verify(ioState, AllEqual(tallies, 1, kA + kB), "a registered listener was not called once");
}

void ListenerBytesTarnWeak(benchmark::State& ioState) {
  std::vector<Tally> tallies(kRegisteredListeners);
  std::vector<std::shared_ptr<TarnTallyListener>> listeners;
  std::vector<std::weak_ptr<Tarn::Listener>> weak;
  for (Tally& tally : tallies) {
    listeners.push_back(std::make_shared<TarnTallyListener>(&tally));
    weak.emplace_back(listeners.back());
  }
  auto broadcaster = std::make_unique<Tarn::Broadcaster>();
  CountListenerBytes(ioState, [&] {
    for (auto& listener : weak) broadcaster->AddListener(listener);
  });
  broadcaster->BroadcastMessage(PairMessage(kA, kB));
  Verify(ioState, AllEqual(tallies, 1, kA + kB), "a registered listener was not called once");
}

void ListenerBytesSignals2(benchmark::State& ioState) {
  std::vector<Tally> tallies(kRegisteredListeners);
  auto signal = std::make_unique<boost::signals2::signal<void(const PairArgs&)>>();
  CountListenerBytes(ioState, [&] {
    for (Tally& tally : tallies) {
      Tally* target = &tally;
      signal->connect([target](const PairArgs& inArgs) { target->Add(inArgs.mA, inArgs.mB); });
    }
  });
  (*signal)(PairArgs{kA, kB});
  Verify(ioState, AllEqual(tallies, 1, kA + kB), "a connected slot was not called once");
}

#if defined(TARN_BENCH_HAVE_SIGC)
void ListenerBytesSigc(benchmark::State& ioState) {
  std::vector<Tally> tallies(kRegisteredListeners);
  auto signal = std::make_unique<sigc::signal<void(const PairArgs&)>>();
  CountListenerBytes(ioState, [&] {
    for (Tally& tally : tallies) {
      Tally* target = &tally;
      signal->connect([target](const PairArgs& inArgs) { target->Add(inArgs.mA, inArgs.mB); });
    }
  });
  signal->emit(PairArgs{kA, kB});
  Verify(ioState, AllEqual(tallies, 1, kA + kB), "a connected slot was not called once");
}
#endif

void Register(const char* inName, std::function<void(benchmark::State&)> inFunction) {
  benchmark::RegisterBenchmark(inName, [inFunction](benchmark::State& ioState) { inFunction(ioState); })
      ->Iterations(1);
}

const bool sRegistered = [] {
  Register("Alloc/Delivery/Signals2", &DeliverySignals2);
#if defined(TARN_BENCH_HAVE_SIGC)
  Register("Alloc/Delivery/Sigc", &DeliverySigc);
#endif
  Register("Alloc/Delivery/TarnPlain", &DeliveryTarnPlain);
  Register("Alloc/Delivery/TarnWeak", &DeliveryTarnWeak);
  Register("Alloc/Delivery/TarnStation", &DeliveryTarnStation);
  Register("Alloc/Post/TarnDirect", &DirectPostTarn);
  Register("Alloc/Post/TarnDeferredMain", [](benchmark::State& ioState) { DeferredPostTarn(ioState, false); });
  Register("Alloc/Post/TarnDeferredWorker", [](benchmark::State& ioState) { DeferredPostTarn(ioState, true); });
  Register("Alloc/Post/AsioWorker", &WorkerPostAsio);
  Register("Alloc/Post/MutexQueueWorker", &WorkerPostMutexQueue);
  Register("Alloc/Listener/Signals2", &ListenerBytesSignals2);
#if defined(TARN_BENCH_HAVE_SIGC)
  Register("Alloc/Listener/Sigc", &ListenerBytesSigc);
#endif
  Register("Alloc/Listener/TarnPlain", &ListenerBytesTarnPlain);
  Register("Alloc/Listener/TarnWeak", &ListenerBytesTarnWeak);
  return true;
}();

}  // namespace
}  // namespace TarnBench
