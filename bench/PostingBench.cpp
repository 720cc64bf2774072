// Posting from worker threads to the main thread.
//
// Throughput: P producers post 50,000 messages each as fast as they can; the
// figure is posts per second from the first post to the last delivery. Tarn
// posts with StationUtils::PostMessageToUIThread onto a station with one
// listener, the main thread waiting with the adaptor's WaitForPendingCalls
// and running the calls with StationUtils::FlushPostedMessagesOnUIThread.
// Peers: boost::asio::io_context (post, the main thread in run()) and a
// std::mutex + std::deque + std::condition_variable queue of std::function.
//
// Latency: one producer posts 10,000 messages a second (paced with a steady
// clock); the figure is the time from just before the post call to the start
// of the handler, median and 99th percentile.
//
// Both depend on where the operating system puts the threads: with producer
// and consumer on one CPU there is no cross-CPU traffic and no wake-up
// latency, on two CPUs there is, and an unpinned run gets either at random.
// So that every peer is measured alike, the main thread is pinned to the
// first CPU the process may use and every producer to the second (when there
// are two); the main thread's own affinity is restored afterwards.
//
// Every message carries its producer and sequence number; after each run a
// check proves that each was delivered exactly once.
#include "BenchSupport.h"

#include <kivcore/MainThread.h>

#include <pthread.h>
#include <sched.h>

#include <boost/asio/executor_work_guard.hpp>
#include <boost/asio/io_context.hpp>
#include <boost/asio/post.hpp>

#include <algorithm>
#include <chrono>
#include <condition_variable>
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
// A run that takes longer than this has lost a message; it fails instead of
// hanging.
constexpr auto kRunLimit = std::chrono::seconds(30);
constexpr int kWaitSliceMilliseconds = 100;

const kivcore::utility::ImmutableString& PostingStationID() {
  static const kivcore::utility::ImmutableString sStationID = [] {
    const auto id = kivcore::utility::ImmutableString::CreateStatic("tarn.bench.posting");
    Tarn::StationRegistry::RegisterStation(id, nullptr);
    return id;
  }();
  return sStationID;
}

// What the main thread records of the deliveries of one run.
class DeliveryRecord {
public:
  DeliveryRecord(int inProducers, int inPostsPerProducer, bool inStampTimes)
      : mProducers(inProducers),
        mPostsPerProducer(inPostsPerProducer),
        mSeen(static_cast<std::size_t>(inProducers) * static_cast<std::size_t>(inPostsPerProducer), 0),
        mPostTimes(inStampTimes ? mSeen.size() : 0),
        mDeliveryTimes(inStampTimes ? mSeen.size() : 0) {}

  // A message (sequence, producer) as the handler sees it.
  void Deliver(int inSequence, int inProducer) {
    const std::size_t index = Index(inSequence, inProducer);
    if (index < mSeen.size()) {
      ++mSeen[index];
      if (!mDeliveryTimes.empty()) mDeliveryTimes[index] = Clock::now();
    }
    mTally.Add(inSequence, inProducer);
  }
  // The producer's time stamp, taken just before its post call.
  void StampPost(int inSequence, int inProducer) { mPostTimes[Index(inSequence, inProducer)] = Clock::now(); }

  std::int64_t Total() const noexcept { return static_cast<std::int64_t>(mSeen.size()); }
  bool Complete() const noexcept { return mTally.mCalls >= Total(); }

  // Every message delivered exactly once, and nothing else.
  bool ExactlyOnce() const {
    if (mTally.mCalls != Total()) return false;
    if (std::any_of(mSeen.begin(), mSeen.end(), [](std::uint8_t inCount) { return inCount != 1; })) return false;
    const std::int64_t per = mPostsPerProducer;
    const std::int64_t producers = mProducers;
    return mTally.mSum == producers * per * (per - 1) / 2 + per * producers * (producers - 1) / 2;
  }

  // Post-to-delivery latencies in microseconds, sorted.
  std::vector<double> SortedLatencies() const {
    std::vector<double> latencies;
    for (std::size_t i = 0; i < mPostTimes.size(); ++i)
      latencies.push_back(std::chrono::duration<double, std::micro>(mDeliveryTimes[i] - mPostTimes[i]).count());
    std::sort(latencies.begin(), latencies.end());
    return latencies;
  }

private:
  std::size_t Index(int inSequence, int inProducer) const noexcept {
    return static_cast<std::size_t>(inProducer) * static_cast<std::size_t>(mPostsPerProducer) +
           static_cast<std::size_t>(inSequence);
  }

  const int mProducers;
  const int mPostsPerProducer;
  std::vector<std::uint8_t> mSeen;  // deliveries per message; main thread
  std::vector<Clock::time_point> mPostTimes;      // written by the producer before its post
  std::vector<Clock::time_point> mDeliveryTimes;  // main thread
  Tally mTally;                                   // main thread
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

void PinCurrentThread(int inCpu) {
  cpu_set_t set;
  CPU_ZERO(&set);
  CPU_SET(inCpu, &set);
  pthread_setaffinity_np(pthread_self(), sizeof set, &set);
}

// Pins the calling (main) thread to the first CPU it may use and chooses
// another for the producers; restores the thread's affinity when destroyed.
// Without two usable CPUs nothing is pinned (ProducerCpu() is -1).
class ThreadPinning {
public:
  ThreadPinning() {
    CPU_ZERO(&mSaved);
    if (pthread_getaffinity_np(pthread_self(), sizeof mSaved, &mSaved) != 0) return;
    int first = -1;
    for (int cpu = 0; cpu < CPU_SETSIZE; ++cpu) {
      if (!CPU_ISSET(cpu, &mSaved)) continue;
      if (first < 0) {
        first = cpu;
      } else {
        mProducerCpu = cpu;
        break;
      }
    }
    if (mProducerCpu >= 0) PinCurrentThread(first);
  }
  ~ThreadPinning() {
    if (mProducerCpu >= 0) pthread_setaffinity_np(pthread_self(), sizeof mSaved, &mSaved);
  }
  ThreadPinning(const ThreadPinning&) = delete;
  ThreadPinning& operator=(const ThreadPinning&) = delete;
  int ProducerCpu() const noexcept { return mProducerCpu; }

private:
  cpu_set_t mSaved;
  int mProducerCpu = -1;
};

// Producers that start together on a signal and remember when the first of
// them made its first post.
class Producers {
public:
  // inPost(sequence, producer) posts one message. With inCpu >= 0 every
  // producer runs on that CPU.
  Producers(int inCount, int inPostsEach, bool inPaced, DeliveryRecord* inRecord,
            std::function<void(int, int)> inPost, int inCpu = -1)
      : mPost(std::move(inPost)) {
    for (int producer = 0; producer < inCount; ++producer) {
      mThreads.emplace_back([this, producer, inPostsEach, inPaced, inRecord, inCpu] {
        if (inCpu >= 0) PinCurrentThread(inCpu);
        while (!mGo.load(std::memory_order_acquire)) std::this_thread::yield();
        const Clock::time_point start = Clock::now();
        {
          std::lock_guard<std::mutex> lock(mStartMutex);
          if (!mStarted || start < mFirstPost) mFirstPost = start;
          mStarted = true;
        }
        for (int sequence = 0; sequence < inPostsEach; ++sequence) {
          if (inPaced) {
            std::this_thread::sleep_until(start + sequence * kLatencyInterval);
            inRecord->StampPost(sequence, producer);
          }
          mPost(sequence, producer);
        }
      });
    }
  }
  ~Producers() { Join(); }

  void Go() { mGo.store(true, std::memory_order_release); }
  void Join() {
    for (std::thread& thread : mThreads)
      if (thread.joinable()) thread.join();
  }
  Clock::time_point FirstPost() {
    std::lock_guard<std::mutex> lock(mStartMutex);
    return mFirstPost;
  }

private:
  std::function<void(int, int)> mPost;
  std::atomic<bool> mGo{false};
  std::mutex mStartMutex;
  bool mStarted = false;          // guarded by mStartMutex
  Clock::time_point mFirstPost;   // guarded by mStartMutex
  std::vector<std::thread> mThreads;
};

// Calls inExpire on its own thread unless disarmed within the time limit.
class Watchdog {
public:
  explicit Watchdog(std::function<void()> inExpire) : mExpire(std::move(inExpire)) {
    mThread = std::thread([this] {
      std::unique_lock<std::mutex> lock(mMutex);
      if (!mDisarmed.wait_for(lock, kRunLimit, [this] { return mDone; })) mExpire();
    });
  }
  ~Watchdog() {
    {
      std::lock_guard<std::mutex> lock(mMutex);
      mDone = true;
    }
    mDisarmed.notify_all();
    mThread.join();
  }

private:
  std::function<void()> mExpire;
  std::mutex mMutex;
  std::condition_variable mDisarmed;
  bool mDone = false;  // guarded by mMutex
  std::thread mThread;
};

// The simple queue a team might write instead: producers append under a
// mutex; the consumer takes everything queued at once.
class MutexQueue {
public:
  void Post(std::function<void()> inCall) {
    {
      std::lock_guard<std::mutex> lock(mMutex);
      mQueue.push_back(std::move(inCall));
    }
    mQueued.notify_one();
  }
  // Runs every queued call, waiting up to inTimeout for the first.
  void RunFor(std::chrono::milliseconds inTimeout) {
    std::deque<std::function<void()>> batch;
    {
      std::unique_lock<std::mutex> lock(mMutex);
      if (!mQueued.wait_for(lock, inTimeout, [this] { return !mQueue.empty(); })) return;
      batch.swap(mQueue);
    }
    for (std::function<void()>& call : batch) call();
  }

private:
  std::mutex mMutex;
  std::condition_variable mQueued;
  std::deque<std::function<void()>> mQueue;  // guarded by mMutex
};

// One run of Tarn posting; returns the seconds from the first post to the
// last delivery, or a negative value when the run timed out.
double RunTarn(int inProducers, int inPostsEach, bool inPaced, DeliveryRecord& ioRecord, int inCpu) {
  const kivcore::utility::ImmutableString& stationID = PostingStationID();
  RecordingListener listener(&ioRecord);
  Tarn::StationUtils::AddListener(stationID, &listener);
  const auto adaptor = kivcore::threads::GetRegisteredMainThread();
  Producers producers(inProducers, inPostsEach, inPaced, &ioRecord, [&stationID](int inSequence, int inProducer) {
    Tarn::StationUtils::PostMessageToUIThread(stationID, PairMessage(inSequence, inProducer), false);
  }, inCpu);
  const Clock::time_point deadline = Clock::now() + kRunLimit;
  producers.Go();
  while (!ioRecord.Complete() && Clock::now() < deadline) {
    if (adaptor->WaitForPendingCalls(kWaitSliceMilliseconds)) Tarn::StationUtils::FlushPostedMessagesOnUIThread();
  }
  const Clock::time_point end = Clock::now();
  producers.Join();
  Tarn::StationUtils::RemoveListener(stationID, &listener);
  if (!ioRecord.Complete()) return -1.0;
  return std::chrono::duration<double>(end - producers.FirstPost()).count();
}

double RunAsio(int inProducers, int inPostsEach, bool inPaced, DeliveryRecord& ioRecord, int inCpu) {
  boost::asio::io_context context;
  auto work = boost::asio::make_work_guard(context);
  Clock::time_point end;
  Producers producers(inProducers, inPostsEach, inPaced, &ioRecord,
                      [&context, &ioRecord, &work, &end](int inSequence, int inProducer) {
                        boost::asio::post(context, [&ioRecord, &work, &end, inSequence, inProducer] {
                          ioRecord.Deliver(inSequence, inProducer);
                          if (ioRecord.Complete()) {
                            end = Clock::now();
                            work.reset();  // run() returns once nothing is left
                          }
                        });
                      },
                      inCpu);
  {
    Watchdog watchdog([&context] { context.stop(); });
    producers.Go();
    context.run();
  }
  producers.Join();
  if (!ioRecord.Complete()) return -1.0;
  return std::chrono::duration<double>(end - producers.FirstPost()).count();
}

double RunMutexQueue(int inProducers, int inPostsEach, bool inPaced, DeliveryRecord& ioRecord, int inCpu) {
  MutexQueue queue;
  Producers producers(inProducers, inPostsEach, inPaced, &ioRecord, [&queue, &ioRecord](int inSequence, int inProducer) {
    queue.Post([&ioRecord, inSequence, inProducer] { ioRecord.Deliver(inSequence, inProducer); });
  }, inCpu);
  const Clock::time_point deadline = Clock::now() + kRunLimit;
  producers.Go();
  while (!ioRecord.Complete() && Clock::now() < deadline) queue.RunFor(std::chrono::milliseconds(kWaitSliceMilliseconds));
  const Clock::time_point end = Clock::now();
  producers.Join();
  if (!ioRecord.Complete()) return -1.0;
  return std::chrono::duration<double>(end - producers.FirstPost()).count();
}

// (producers, posts each, paced, record, producer CPU or -1)
using RunFunction = double (*)(int, int, bool, DeliveryRecord&, int);

void Throughput(benchmark::State& ioState, RunFunction inRun) {
  if (!VerifyMainThread(ioState)) return;
  const int producerCount = static_cast<int>(ioState.range(0));
  std::int64_t posts = 0;
  const ThreadPinning pinning;
  for (auto _ : ioState) {
    DeliveryRecord record(producerCount, kPostsPerProducer, false);
    const double seconds = inRun(producerCount, kPostsPerProducer, false, record, pinning.ProducerCpu());
    if (!Verify(ioState, seconds >= 0.0, "a post was not delivered within the time limit")) return;
    if (!Verify(ioState, record.ExactlyOnce(), "a post was not delivered exactly once")) return;
    ioState.SetIterationTime(seconds);
    posts += record.Total();
  }
  ioState.SetItemsProcessed(posts);
}

void Latency(benchmark::State& ioState, RunFunction inRun) {
  if (!VerifyMainThread(ioState)) return;
  std::vector<double> latencies;
  const ThreadPinning pinning;
  for (auto _ : ioState) {
    DeliveryRecord record(1, kLatencyPosts, true);
    const double seconds = inRun(1, kLatencyPosts, true, record, pinning.ProducerCpu());
    if (!Verify(ioState, seconds >= 0.0, "a post was not delivered within the time limit")) return;
    if (!Verify(ioState, record.ExactlyOnce(), "a post was not delivered exactly once")) return;
    ioState.SetIterationTime(seconds);
    const std::vector<double> run = record.SortedLatencies();
    latencies.insert(latencies.end(), run.begin(), run.end());
  }
  std::sort(latencies.begin(), latencies.end());
  const auto at = [&latencies](double inFraction) {
    return latencies[static_cast<std::size_t>(inFraction * static_cast<double>(latencies.size() - 1))];
  };
  ioState.counters["p50_us"] = at(0.50);
  ioState.counters["p99_us"] = at(0.99);
  ioState.counters["posts"] = static_cast<double>(latencies.size());
}

const bool sRegistered = [] {
  const std::pair<const char*, RunFunction> rows[] = {
      {"Tarn", &RunTarn}, {"Asio", &RunAsio}, {"MutexQueue", &RunMutexQueue}};
  for (const auto& row : rows) {
    const RunFunction run = row.second;
    WithBestOf(benchmark::RegisterBenchmark((std::string("Posting/") + row.first).c_str(),
                                            [run](benchmark::State& ioState) { Throughput(ioState, run); }))
        ->Arg(1)
        ->Arg(2)
        ->UseManualTime()
        ->MinTime(0.3);
  }
  for (const auto& row : rows) {
    const RunFunction run = row.second;
    WithBestOf(benchmark::RegisterBenchmark((std::string("Latency/") + row.first).c_str(),
                                            [run](benchmark::State& ioState) { Latency(ioState, run); }))
        ->Iterations(1)
        ->UseManualTime();
  }
  return true;
}();

}  // namespace
}  // namespace TarnBench
