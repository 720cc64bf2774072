// Posting from worker threads to the main thread, for Tarn
// (StationUtils::PostMessageToUIThread onto a station with one listener, the
// main thread waiting with the adaptor's WaitForPendingCalls and running
// FlushPostedMessagesOnUIThread), boost::asio::io_context (post, run), a
// std::mutex + std::deque + std::condition_variable queue of std::function,
// and Qt 5 (QMetaObject::invokeMethod with Qt::QueuedConnection, a
// QEventLoop on the main thread).
//   Posting/<peer>/P     P producers post 50,000 messages each as fast as
//                        they can: posts per second from the first post to
//                        the last delivery
//   Latency/<peer>       one producer posts 10,000 messages a second: the
//                        time from just before the post call to the start of
//                        the handler, p50 and p99
//   Alloc/Post/<case>    allocations per post, 10,000 posts delivered
//   Burst/Tarn           two producers post 4,000,000 messages while the
//                        main thread runs nothing, then it runs them all:
//                        resident memory before, at the peak and once they
//                        have run (MiB), and the high-water reports made
//
// Every message carries its producer and sequence number; after each run a
// check proves that each was delivered exactly once.
//
// Where the operating system puts the threads decides these figures (one
// CPU: no wake-up latency and no cross-CPU traffic; two: both), so the main
// thread is pinned to the first CPU the process may use and every producer
// to the second, for every peer alike.
#include "BenchSupport.h"

#include <kivcore/Error.h>
#include <kivcore/MainThread.h>

#include <pthread.h>
#include <sched.h>
#include <unistd.h>

#include <boost/asio/io_context.hpp>
#include <boost/asio/post.hpp>
#include <boost/asio/steady_timer.hpp>

#if defined(TARN_BENCH_HAVE_QT)
#include <QEventLoop>
#include <QTimer>
#endif

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <deque>
#include <functional>
#include <mutex>
#include <thread>
#include <vector>

namespace TarnBench {
namespace {

using Clock = std::chrono::steady_clock;

constexpr int kPostsPerProducer = 50000;
constexpr int kLatencyPosts = 5000;
constexpr auto kLatencyInterval = std::chrono::microseconds(100);  // 10,000 posts a second
constexpr int kAllocPosts = 10000;
constexpr int kBurstPosts = 4000000;
// A run that takes longer than this has lost a message: it fails instead of
// hanging.
constexpr auto kRunLimit = std::chrono::seconds(30);

// What the main thread records of the deliveries of one run.
class DeliveryRecord {
public:
  DeliveryRecord(int inProducers, int inPostsEach, bool inStampTimes)
      : mPostsEach(inPostsEach),
        mSeen(static_cast<std::size_t>(inProducers * inPostsEach), 0),
        mPostTimes(inStampTimes ? mSeen.size() : 0),
        mDeliveryTimes(mPostTimes.size()) {}

  // Returns true for the delivery that completes the run.
  bool Deliver(int inSequence, int inProducer) {
    const std::size_t index = Index(inSequence, inProducer);
    if (index < mSeen.size() && mSeen[index]++ == 0) ++mDistinct;
    else mExtra = true;
    if (!mDeliveryTimes.empty() && index < mSeen.size()) mDeliveryTimes[index] = Clock::now();
    if (!Complete()) return false;
    mEnd = Clock::now();
    return true;
  }
  // Taken by the producer just before its post call.
  void StampPost(int inSequence, int inProducer) { mPostTimes[Index(inSequence, inProducer)] = Clock::now(); }

  std::int64_t Total() const noexcept { return static_cast<std::int64_t>(mSeen.size()); }
  bool Complete() const noexcept { return mDistinct == mSeen.size(); }
  bool ExactlyOnce() const noexcept { return Complete() && !mExtra; }
  Clock::time_point End() const noexcept { return mEnd; }

  std::vector<double> LatenciesMicroseconds() const {
    std::vector<double> latencies;
    for (std::size_t i = 0; i < mPostTimes.size(); ++i)
      latencies.push_back(std::chrono::duration<double, std::micro>(mDeliveryTimes[i] - mPostTimes[i]).count());
    return latencies;
  }

private:
  std::size_t Index(int inSequence, int inProducer) const noexcept {
    return static_cast<std::size_t>(inProducer * mPostsEach + inSequence);
  }

  const int mPostsEach;
  std::vector<std::uint8_t> mSeen;                // main thread
  std::size_t mDistinct = 0;                      // main thread
  bool mExtra = false;                            // a duplicate or unknown message; main thread
  Clock::time_point mEnd;                         // main thread
  std::vector<Clock::time_point> mPostTimes;      // each slot written by its producer before the post
  std::vector<Clock::time_point> mDeliveryTimes;  // main thread
};

class RecordingListener : public Tarn::Listener {
public:
  explicit RecordingListener(DeliveryRecord* inRecord) noexcept : mRecord(inRecord) {}
  void ListenToMessage(const Tarn::Message& inMessage) override {
    if (inMessage.GetMessageID() != PairMessage::StaticMessageID()) return;
    const auto& pair = static_cast<const PairMessage&>(inMessage);
    mRecord->Deliver(pair.mA, pair.mB);
  }

private:
  DeliveryRecord* mRecord;
};

void Pin(pthread_t inThread, int inCpu) {
  cpu_set_t set;
  CPU_ZERO(&set);
  CPU_SET(inCpu, &set);
  pthread_setaffinity_np(inThread, sizeof set, &set);
}

// Pins the main thread to its first allowed CPU and chooses the second for
// the producers (-1, nothing pinned, with fewer than two); restores the
// main thread's affinity when destroyed.
class ThreadPinning {
public:
  ThreadPinning() {
    if (pthread_getaffinity_np(pthread_self(), sizeof mSaved, &mSaved) != 0) return;
    std::vector<int> cpus;
    for (int cpu = 0; cpu < CPU_SETSIZE && cpus.size() < 2; ++cpu)
      if (CPU_ISSET(cpu, &mSaved)) cpus.push_back(cpu);
    if (cpus.size() < 2) return;
    Pin(pthread_self(), cpus[0]);
    mProducerCpu = cpus[1];
  }
  ~ThreadPinning() {
    if (mProducerCpu >= 0) pthread_setaffinity_np(pthread_self(), sizeof mSaved, &mSaved);
  }
  ThreadPinning(const ThreadPinning&) = delete;
  ThreadPinning& operator=(const ThreadPinning&) = delete;
  int mProducerCpu = -1;

private:
  cpu_set_t mSaved;
};

// One run: producers that start together, each calling inPost(sequence,
// producer) for its messages, while inServe(deadline) delivers on the main
// thread. Returns the seconds from the first post to the last delivery, or
// -1 when the run did not complete in time.
double RunProducers(int inProducers, int inPostsEach, bool inPaced, int inCpu, DeliveryRecord& ioRecord,
                    const std::function<void(int, int)>& inPost,
                    const std::function<void(Clock::time_point)>& inServe) {
  std::atomic<bool> go{false};
  std::atomic<Clock::rep> firstPost{Clock::time_point::max().time_since_epoch().count()};
  std::vector<std::thread> threads;
  for (int producer = 0; producer < inProducers; ++producer) {
    threads.emplace_back([&, producer] {
      if (inCpu >= 0) Pin(pthread_self(), inCpu);
      while (!go.load(std::memory_order_acquire)) std::this_thread::yield();
      const Clock::time_point start = Clock::now();
      Clock::rep first = firstPost.load();
      while (start.time_since_epoch().count() < first &&
             !firstPost.compare_exchange_weak(first, start.time_since_epoch().count())) {
      }
      for (int sequence = 0; sequence < inPostsEach; ++sequence) {
        if (inPaced) {
          std::this_thread::sleep_until(start + sequence * kLatencyInterval);
          ioRecord.StampPost(sequence, producer);
        }
        inPost(sequence, producer);
      }
    });
  }
  go.store(true, std::memory_order_release);
  inServe(Clock::now() + kRunLimit);
  for (std::thread& thread : threads) thread.join();
  if (!ioRecord.Complete()) return -1.0;
  return std::chrono::duration<double>(ioRecord.End() - Clock::time_point(Clock::duration(firstPost.load()))).count();
}

double RunTarn(int inProducers, int inPostsEach, bool inPaced, int inCpu, DeliveryRecord& ioRecord) {
  const kivcore::utility::ImmutableString& stationID = BenchStationID();
  RecordingListener listener(&ioRecord);
  Tarn::StationUtils::AddListener(stationID, &listener);
  const auto adaptor = kivcore::threads::GetRegisteredMainThread();
  const double seconds = RunProducers(
      inProducers, inPostsEach, inPaced, inCpu, ioRecord,
      [&stationID](int inSequence, int inProducer) {
        Tarn::StationUtils::PostMessageToUIThread(stationID, PairMessage(inSequence, inProducer), false);
      },
      [&](Clock::time_point inDeadline) {
        while (!ioRecord.Complete() && Clock::now() < inDeadline)
          if (adaptor->WaitForPendingCalls(100)) Tarn::StationUtils::FlushPostedMessagesOnUIThread();
      });
  Tarn::StationUtils::RemoveListener(stationID, &listener);
  return seconds;
}

double RunAsio(int inProducers, int inPostsEach, bool inPaced, int inCpu, DeliveryRecord& ioRecord) {
  boost::asio::io_context context;
  boost::asio::steady_timer limit(context);  // keeps run() going until stopped
  return RunProducers(
      inProducers, inPostsEach, inPaced, inCpu, ioRecord,
      [&context, &ioRecord](int inSequence, int inProducer) {
        boost::asio::post(context, [&context, &ioRecord, inSequence, inProducer] {
          if (ioRecord.Deliver(inSequence, inProducer)) context.stop();
        });
      },
      [&](Clock::time_point inDeadline) {
        limit.expires_at(inDeadline);
        limit.async_wait([&context](const boost::system::error_code&) { context.stop(); });
        context.run();
      });
}

// The simple queue a team might write instead: producers append under a
// mutex; the consumer takes everything queued at once.
double RunMutexQueue(int inProducers, int inPostsEach, bool inPaced, int inCpu, DeliveryRecord& ioRecord) {
  std::mutex mutex;
  std::condition_variable queued;
  std::deque<std::function<void()>> queue;  // guarded by mutex
  return RunProducers(
      inProducers, inPostsEach, inPaced, inCpu, ioRecord,
      [&](int inSequence, int inProducer) {
        {
          std::lock_guard<std::mutex> lock(mutex);
          queue.push_back([&ioRecord, inSequence, inProducer] { ioRecord.Deliver(inSequence, inProducer); });
        }
        queued.notify_one();
      },
      [&](Clock::time_point inDeadline) {
        while (!ioRecord.Complete() && Clock::now() < inDeadline) {
          std::deque<std::function<void()>> batch;
          {
            std::unique_lock<std::mutex> lock(mutex);
            queued.wait_until(lock, inDeadline, [&queue] { return !queue.empty(); });
            batch.swap(queue);
          }
          for (std::function<void()>& call : batch) call();
        }
      });
}

#if defined(TARN_BENCH_HAVE_QT)
double RunQt(int inProducers, int inPostsEach, bool inPaced, int inCpu, DeliveryRecord& ioRecord) {
  QObject receiver;  // lives on the main thread, so its queued calls run there
  QEventLoop loop;
  return RunProducers(
      inProducers, inPostsEach, inPaced, inCpu, ioRecord,
      [&](int inSequence, int inProducer) {
        QMetaObject::invokeMethod(
            &receiver,
            [&ioRecord, &loop, inSequence, inProducer] {
              if (ioRecord.Deliver(inSequence, inProducer)) loop.quit();
            },
            Qt::QueuedConnection);
      },
      [&](Clock::time_point inDeadline) {
        QTimer::singleShot(std::chrono::duration_cast<std::chrono::milliseconds>(inDeadline - Clock::now()), &loop,
                           &QEventLoop::quit);
        loop.exec();
      });
}
#endif

using RunFunction = double (*)(int, int, bool, int, DeliveryRecord&);

void Throughput(benchmark::State& ioState, RunFunction inRun) {
  if (!VerifyMainThread(ioState)) return;
  const int producers = static_cast<int>(ioState.range(0));
  const ThreadPinning pinning;
  for (auto _ : ioState) {
    DeliveryRecord record(producers, kPostsPerProducer, false);
    const double seconds = inRun(producers, kPostsPerProducer, false, pinning.mProducerCpu, record);
    if (!Verify(ioState, seconds >= 0.0 && record.ExactlyOnce(), "a post was not delivered exactly once in time"))
      return;
    ioState.SetIterationTime(seconds);
  }
  ioState.SetItemsProcessed(static_cast<std::int64_t>(ioState.iterations()) * producers * kPostsPerProducer);
}

void Latency(benchmark::State& ioState, RunFunction inRun) {
  if (!VerifyMainThread(ioState)) return;
  std::vector<double> latencies;
  const ThreadPinning pinning;
  for (auto _ : ioState) {
    DeliveryRecord record(1, kLatencyPosts, true);
    const double seconds = inRun(1, kLatencyPosts, true, pinning.mProducerCpu, record);
    if (!Verify(ioState, seconds >= 0.0 && record.ExactlyOnce(), "a post was not delivered exactly once in time"))
      return;
    ioState.SetIterationTime(seconds);
    const std::vector<double> run = record.LatenciesMicroseconds();
    latencies.insert(latencies.end(), run.begin(), run.end());
  }
  std::sort(latencies.begin(), latencies.end());
  const auto at = [&latencies](double inFraction) {
    return latencies[static_cast<std::size_t>(inFraction * static_cast<double>(latencies.size() - 1))];
  };
  ioState.counters["p50_us"] = at(0.50);
  ioState.counters["p99_us"] = at(0.99);
}

// Allocations per post: inPost() posts one message from the calling thread,
// inRun() delivers on the main thread what was posted. With inFromWorker the
// posts come from a worker started before counting begins. Three rounds: the
// first two let the queues reach the capacity they keep.
template <class Post, class Run>
void CountPosts(benchmark::State& ioState, const Tally& inTally, bool inFromWorker, Post inPost, Run inRun) {
  for (auto _ : ioState) {
    double heap = 0, small = 0;
    for (int round = 0; round < 3; ++round) {
      std::atomic<int> step{0};
      const auto postAll = [&] {
        for (int i = 0; i < kAllocPosts; ++i) inPost();
      };
      std::thread worker;
      if (inFromWorker)
        worker = std::thread([&] {
          while (step.load() == 0) std::this_thread::yield();
          postAll();
          step.store(2);
        });
      {
        AllocationCounts counts;
        step.store(1);
        if (inFromWorker)
          while (step.load() != 2) std::this_thread::yield();
        else postAll();
        inRun();
        heap = static_cast<double>(counts.HeapAllocations());
        small = static_cast<double>(counts.SmallBlocks());
      }
      if (worker.joinable()) worker.join();
    }
    if (!Verify(ioState, inTally.mCalls == 3 * kAllocPosts, "a post was not delivered exactly once")) return;
    ioState.counters["heap_allocs_per_op"] = heap / kAllocPosts;
    ioState.counters["small_blocks_per_op"] = small / kAllocPosts;
  }
}

// Tarn: deferred from a worker or from the main thread, or direct (on the
// main thread with inForceAsync false the post is a broadcast).
void AllocTarnPost(benchmark::State& ioState, bool inFromWorker, bool inForceAsync) {
  if (!VerifyMainThread(ioState)) return;
  Tally tally;
  TarnTallyListener listener(&tally);
  Tarn::StationUtils::AddListener(BenchStationID(), &listener);
  CountPosts(
      ioState, tally, inFromWorker,
      [inForceAsync] {
        Tarn::StationUtils::PostMessageToUIThread(BenchStationID(), PairMessage(kA, kB), inForceAsync);
      },
      [] { Tarn::StationUtils::FlushPostedMessagesOnUIThread(); });
  Tarn::StationUtils::RemoveListener(BenchStationID(), &listener);
}

void AllocAsioPost(benchmark::State& ioState) {
  Tally tally;
  boost::asio::io_context context;
  CountPosts(
      ioState, tally, true, [&] { boost::asio::post(context, [&tally] { tally.Add(kA, kB); }); },
      [&context] {
        context.run();
        context.restart();
      });
}

// The process's resident set, in MiB.
double ResidentMiB() {
  long pages = 0, resident = 0;
  if (FILE* const statm = std::fopen("/proc/self/statm", "r")) {
    if (std::fscanf(statm, "%ld %ld", &pages, &resident) != 2) resident = 0;
    std::fclose(statm);
  }
  return static_cast<double>(resident) * static_cast<double>(sysconf(_SC_PAGESIZE)) / (1024.0 * 1024.0);
}

void Burst(benchmark::State& ioState) {
  if (!VerifyMainThread(ioState)) return;
  Tally tally;
  TarnTallyListener listener(&tally);
  Tarn::StationUtils::AddListener(BenchStationID(), &listener);
  std::atomic<int> reports{0};
  const std::string key = kivcore::threads::kPendingCallHighWaterKey;
  const auto handler = kivcore::config::SetErrorHandler([&](const kivcore::config::ErrorReport& inReport) {
    if (inReport.key.compare(0, key.size(), key) == 0) ++reports;
  });
  for (auto _ : ioState) {
    const double before = ResidentMiB();
    std::thread producers[2];
    for (std::thread& producer : producers) {
      producer = std::thread([] {
        for (int i = 0; i < kBurstPosts / 2; ++i)
          Tarn::StationUtils::PostMessageToUIThread(BenchStationID(), PairMessage(kA, kB), false);
      });
    }
    for (std::thread& producer : producers) producer.join();
    const double peak = ResidentMiB();
    Tarn::StationUtils::FlushPostedMessagesOnUIThread();
    ioState.counters["rss_before_mib"] = before;
    ioState.counters["rss_peak_mib"] = peak;
    ioState.counters["rss_after_mib"] = ResidentMiB();
    ioState.counters["small_blocks_in_use"] =
        static_cast<double>(kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse);
  }
  kivcore::config::SetErrorHandler(handler);
  Tarn::StationUtils::RemoveListener(BenchStationID(), &listener);
  ioState.counters["high_water_reports"] = reports.load();
  Verify(ioState, tally.mCalls == kBurstPosts, "a post of the burst was not delivered exactly once");
}

const bool sRegistered = [] {
  const std::pair<const char*, RunFunction> peers[] = {{"Tarn", &RunTarn},
                                                       {"Asio", &RunAsio},
                                                       {"MutexQueue", &RunMutexQueue},
#if defined(TARN_BENCH_HAVE_QT)
                                                       {"Qt", &RunQt}
#endif
  };
  for (const auto& [name, run] : peers) {
    WithBestOf(benchmark::RegisterBenchmark((std::string("Posting/") + name).c_str(),
                                            [run = run](benchmark::State& ioState) { Throughput(ioState, run); }))
        ->Arg(1)
        ->Arg(2)
        ->UseManualTime()
        ->MinTime(0.3);
    WithBestOf(benchmark::RegisterBenchmark((std::string("Latency/") + name).c_str(),
                                            [run = run](benchmark::State& ioState) { Latency(ioState, run); }))
        ->Iterations(1)
        ->UseManualTime();
  }
  const auto once = [](const char* inName, auto inFunction) {
    benchmark::RegisterBenchmark(inName, inFunction)->Iterations(1)->Repetitions(1);
  };
  once("Alloc/Post/TarnDirect", [](benchmark::State& ioState) { AllocTarnPost(ioState, false, false); });
  once("Alloc/Post/TarnDeferredMain", [](benchmark::State& ioState) { AllocTarnPost(ioState, false, true); });
  once("Alloc/Post/TarnDeferredWorker", [](benchmark::State& ioState) { AllocTarnPost(ioState, true, false); });
  once("Alloc/Post/AsioWorker", &AllocAsioPost);
  once("Burst/Tarn", &Burst);
  return true;
}();

}  // namespace
}  // namespace TarnBench
