// A soak of the whole library under concurrency, for a bounded time: the
// main thread broadcasts, runs the posted messages and disposes of stations
// while worker threads post numbered messages, attach, detach and destroy
// listeners of all four kinds, and retain and release stations.
//
// The bookkeeping makes every outcome decidable:
//  - "stable" stations (two well-known ones) are never disposed of or
//    stopped, and a counting listener hears them from the start: every
//    message posted to them must be delivered exactly once;
//  - "churn" stations are disposed of (on the main thread and on workers),
//    registered again and stopped and started while the soak runs: a message
//    posted to them is delivered at most once;
//  - every worker listener hears one station only; once its removal has
//    returned it must never be called again;
//  - a watchdog fails the run, naming what each thread was doing, if any
//    thread stops making progress;
//  - at the end, after the library's Terminate, every small block is back.
//
// TARN_SOAK_SECONDS sets the duration (3 s by default, so that the suite also
// fits the sanitizer runs; two minutes with TARN_LONG_TESTS=1).
#include "ModelTestSupport.h"

#include <TarnMessaging.h>

#include <kivcore/kivcore.h>

#include <boost/make_shared.hpp>
#include <boost/shared_ptr.hpp>

#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace {

using kivcore::utility::ImmutableString;
using kivcore::utility::SmallBlockAllocator;
using messaging_test::Random;
namespace Registry = Tarn::StationRegistry;
namespace Utils = Tarn::StationUtils;
using Clock = std::chrono::steady_clock;

constexpr int kWorkers = 3;
constexpr int kStableStations = 2;
constexpr int kChurnStations = 2;
constexpr int kStations = kStableStations + kChurnStations;
constexpr int kMainProducer = kWorkers;  // the main thread posts too, always deferred
constexpr std::size_t kMaxQueued = 2000;  // posters wait while the main thread's queue is this long
constexpr int kListenersPerWorker = 6;
// No thread may go this long without progress (sanitizer builds included).
constexpr std::chrono::seconds kStallLimit{20};

bool IsStable(int inStation) { return inStation < kStableStations; }

// A posted message: who posted it, its number, and the station it was for.
struct SoakPost : Tarn::MessageImpl<SoakPost> {
  SoakPost(int inProducer, std::uint32_t inSequence, int inStation)
      : mProducer(inProducer), mSequence(inSequence), mStation(inStation) {}
  int mProducer;
  std::uint32_t mSequence;
  int mStation;
};

// Broadcast directly by the main thread.
struct SoakProbe : Tarn::MessageImpl<SoakProbe> {};

// What one thread is doing, for the watchdog.
struct ThreadState {
  std::atomic<std::uint64_t> mProgress{0};
  std::atomic<const char*> mActivity{"starting"};
  std::atomic<std::uint64_t> mOperations{0};

  void Doing(const char* inActivity) {
    mActivity.store(inActivity, std::memory_order_relaxed);
    mProgress.fetch_add(1, std::memory_order_relaxed);
  }
  void Did() { mOperations.fetch_add(1, std::memory_order_relaxed); }
};

// What every listener reports into.
struct Findings {
  std::atomic<std::uint64_t> mLateCalls{0};       // a listener called after its removal returned
  std::atomic<std::uint64_t> mWrongStation{0};    // a post delivered by another station than its own
  std::atomic<std::uint64_t> mWorkerDeliveries{0};
};

// ---------------------------------------------------------------------------
// Listeners

// The main thread's counter on one station: how often each posted message
// reached it. Runs on the main thread only, so its tallies need no lock.
class PostCounter : public Tarn::Listener {
public:
  PostCounter(int inStation, Findings& inFindings) : mStation(inStation), mFindings(inFindings) {}
  void ListenToMessage(const Tarn::Message& inMessage) override {
    if (inMessage.GetMessageID() != SoakPost::StaticMessageID()) return;
    const auto& post = static_cast<const SoakPost&>(inMessage);
    if (post.mStation != mStation) mFindings.mWrongStation.fetch_add(1);
    std::vector<std::uint8_t>& tally = mTallies[post.mProducer];
    if (tally.size() <= post.mSequence) tally.resize(post.mSequence + 1024, 0);
    if (tally[post.mSequence] < 255) ++tally[post.mSequence];
  }
  int Times(int inProducer, std::uint32_t inSequence) const {
    const std::vector<std::uint8_t>& tally = mTallies[inProducer];
    return inSequence < tally.size() ? tally[inSequence] : 0;
  }

private:
  const int mStation;
  Findings& mFindings;
  std::array<std::vector<std::uint8_t>, kWorkers + 1> mTallies;
};

// A worker's listener. It hears one station; once the worker's removal of
// it has returned, it is marked detached and must not be called again. A
// plain one removes itself in its own destructor, before its derived part is
// gone, so that a worker may simply delete it.
class SoakListener : public Tarn::Listener {
public:
  SoakListener(Findings& inFindings, ImmutableString inStationID, bool inDetachInDestructor)
      : mFindings(inFindings), mStationID(std::move(inStationID)), mDetachInDestructor(inDetachInDestructor) {}
  ~SoakListener() override {
    if (mDetachInDestructor && !mDetached.load()) {
      Utils::RemoveListener(mStationID, this);
      mDetached.store(true);
    }
  }
  void ListenToMessage(const Tarn::Message&) override {
    if (mDetached.load()) mFindings.mLateCalls.fetch_add(1);
    mFindings.mWorkerDeliveries.fetch_add(1, std::memory_order_relaxed);
  }
  void MarkDetached() { mDetached.store(true); }

private:
  Findings& mFindings;
  const ImmutableString mStationID;
  const bool mDetachInDestructor;
  std::atomic<bool> mDetached{false};
};

class SoakSafeListener : public Tarn::SafeListenerBase {
public:
  explicit SoakSafeListener(Findings& inFindings) : mFindings(inFindings) { sLive.fetch_add(1); }
  void ListenToMessage(const Tarn::Message&) override {
    if (mDetached.load()) mFindings.mLateCalls.fetch_add(1);
    mFindings.mWorkerDeliveries.fetch_add(1, std::memory_order_relaxed);
  }
  void MarkDetached() { mDetached.store(true); }
  static int Live() { return sLive.load(); }

protected:
  ~SoakSafeListener() override { sLive.fetch_sub(1); }

private:
  Findings& mFindings;
  std::atomic<bool> mDetached{false};
  static inline std::atomic<int> sLive{0};
};

enum class Kind { kPlain, kBoost, kStd, kSafe };

// One attachment a worker holds.
struct Held {
  Kind mKind = Kind::kPlain;
  int mStation = 0;
  std::unique_ptr<SoakListener> mPlain;
  boost::shared_ptr<SoakListener> mBoost;
  std::shared_ptr<SoakListener> mStd;
  Tarn::ISafeListenerRef mSafe;
  SoakSafeListener* mSafeObject = nullptr;  // valid while mSafe holds it
};

// ---------------------------------------------------------------------------
// The soak

class Soak {
public:
  Soak() {
    mStationIDs[0] = Tarn::kStation_AppSuspend;
    mStationIDs[1] = Tarn::kStation_StatusBar;
    for (int churn = kStableStations; churn < kStations; ++churn) mStationIDs[churn] = Registry::UniqueStationID();
    for (int station = 0; station < kStations; ++station)
      mCounters[station] = std::make_unique<PostCounter>(station, mFindings);
  }

  void Run(Clock::duration inDuration, std::uint64_t inSeed) {
    for (int station = 0; station < kStations; ++station) {
      Registry::RegisterStation(mStationIDs[station], nullptr);
      Utils::AddListener(mStationIDs[station], mCounters[station].get());
    }
    const Clock::time_point start = Clock::now();
    std::thread watchdog([this] { Watch(); });
    std::vector<std::thread> workers;
    for (int worker = 0; worker < kWorkers; ++worker)
      workers.emplace_back([this, worker, inSeed] { Work(worker, inSeed + 1 + static_cast<std::uint64_t>(worker)); });

    MainLoop(start + inDuration, inSeed);

    mStop.store(true);
    mMain.Doing("joining the workers");
    for (std::thread& worker : workers) worker.join();
    mMain.Doing("running the last posted messages");
    const auto adaptor = kivcore::threads::GetRegisteredMainThread();
    for (int round = 0; round < 1000 && adaptor->PendingCallCount() != 0; ++round) {
      Utils::FlushPostedMessagesOnUIThread();
      mMain.Did();
    }
    mSeconds = std::chrono::duration<double>(Clock::now() - start).count();
    {
      std::lock_guard<std::mutex> lock(mWatchMutex);
      mWatchDone = true;
    }
    mWatchChanged.notify_all();
    watchdog.join();
    EXPECT_EQ(adaptor->PendingCallCount(), 0u) << "posted messages still queued";
  }

  void Check() {
    EXPECT_EQ(mFindings.mLateCalls.load(), 0u) << "listeners called after their removal had returned";
    EXPECT_EQ(mFindings.mWrongStation.load(), 0u) << "posts delivered by a station they were not posted to";
    std::uint64_t stablePosts = 0;
    std::uint64_t churnPosts = 0;
    std::uint64_t churnDelivered = 0;
    int reported = 0;
    for (int producer = 0; producer <= kWorkers; ++producer) {
      const std::vector<std::uint8_t>& posted = mPosted[producer];
      for (std::uint32_t sequence = 0; sequence < posted.size(); ++sequence) {
        const int station = posted[sequence];
        const int times = mCounters[station]->Times(producer, sequence);
        if (IsStable(station)) {
          ++stablePosts;
          if (times != 1 && reported++ < 10)
            ADD_FAILURE() << "post " << producer << "/" << sequence << " to stable station " << station << " delivered "
                          << times << " times";
        } else {
          ++churnPosts;
          churnDelivered += times == 1 ? 1 : 0;
          if (times > 1 && reported++ < 10)
            ADD_FAILURE() << "post " << producer << "/" << sequence << " to churn station " << station << " delivered "
                          << times << " times";
        }
        // A counter that heard a post for another station has counted it
        // under that station's number: make sure no other counter did.
        for (int other = 0; other < kStations; ++other) {
          if (other != station && mCounters[other]->Times(producer, sequence) != 0 && reported++ < 10)
            ADD_FAILURE() << "post " << producer << "/" << sequence << " reached station " << other;
        }
      }
    }
    std::uint64_t operations = mMain.mOperations.load();
    for (const ThreadState& worker : mWorkerStates) operations += worker.mOperations.load();
    std::printf("[ figures  ] soak: %.1f s, %llu operations (%.0f per second); %llu posts to stable stations all "
                "delivered once, %llu of %llu posts to churn stations delivered; %llu deliveries to worker listeners; "
                "%llu churn disposals\n",
                mSeconds, static_cast<unsigned long long>(operations), operations / std::max(mSeconds, 1e-9),
                static_cast<unsigned long long>(stablePosts), static_cast<unsigned long long>(churnDelivered),
                static_cast<unsigned long long>(churnPosts),
                static_cast<unsigned long long>(mFindings.mWorkerDeliveries.load()),
                static_cast<unsigned long long>(mChurnDisposals.load()));
    EXPECT_GT(stablePosts, 0u) << "the soak posted nothing";
  }

  // The counters are plain listeners of the main thread: they go once every
  // station has.
  void DestroyCounters() {
    for (auto& counter : mCounters) counter.reset();
  }

private:
  // --- the main thread

  void MainLoop(Clock::time_point inEnd, std::uint64_t inSeed) {
    Random random(inSeed);
    std::uint32_t sequence = 0;
    while (Clock::now() < inEnd) {
      static const std::uint32_t kWeights[] = {40, 25, 10, 10, 8, 7};
      const int station = static_cast<int>(random.Below(kStations));
      const int churn = kStableStations + static_cast<int>(random.Below(kChurnStations));
      switch (random.Weighted(kWeights)) {
        case 0:
          mMain.Doing("FlushPostedMessagesOnUIThread");
          Utils::FlushPostedMessagesOnUIThread();
          break;
        case 1:
          mMain.Doing("StationUtils::BroadcastMessage");
          Utils::BroadcastMessage(mStationIDs[station], SoakProbe());
          break;
        case 2:
          // Deferred even on the main thread; counted like the workers' posts.
          mMain.Doing("PostMessageToUIThread (deferred, main thread)");
          if (kivcore::threads::GetRegisteredMainThread()->PendingCallCount() < kMaxQueued) {
            mPosted[kMainProducer].push_back(static_cast<std::uint8_t>(station));
            Utils::PostMessageToUIThread(mStationIDs[station], SoakPost(kMainProducer, sequence++, station), true);
          }
          break;
        case 3:
          // Disposal, then a fresh registration whose station is made on
          // first use; the counter joins the new station (a retained, still
          // registered station keeps it).
          mMain.Doing("DisposeStation and RegisterStation");
          Registry::DisposeStation(mStationIDs[churn]);
          Registry::RegisterStation(mStationIDs[churn], nullptr);
          Utils::AddListener(mStationIDs[churn], mCounters[churn].get());
          mChurnDisposals.fetch_add(1, std::memory_order_relaxed);
          break;
        case 4:
          mMain.Doing("StopBroadcasting or StartBroadcasting");
          if (random.Percent(50)) Utils::StopBroadcasting(mStationIDs[churn]);
          else Utils::StartBroadcasting(mStationIDs[churn]);
          break;
        case 5:
          mMain.Doing("StationUtils::HasListeners");
          EXPECT_TRUE(Utils::HasListeners(mStationIDs[random.Below(kStableStations)])) << "a stable station lost its counter";
          break;
      }
      mMain.Did();
    }
  }

  // --- the workers

  void Work(int inWorker, std::uint64_t inSeed) {
    ThreadState& state = mWorkerStates[inWorker];
    std::vector<std::uint8_t>& posted = mPosted[inWorker];
    Random random(inSeed);
    std::vector<Held> held;
    std::uint32_t sequence = 0;
    while (!mStop.load(std::memory_order_relaxed)) {
      static const std::uint32_t kWeights[] = {40, 15, 12, 6, 15, 2, 5};
      const int station = static_cast<int>(random.Below(kStations));
      switch (random.Weighted(kWeights)) {
        case 0: {
          state.Doing("PostMessageToUIThread");
          const auto adaptor = kivcore::threads::GetRegisteredMainThread();
          if (adaptor && adaptor->PendingCallCount() < kMaxQueued) {
            posted.push_back(static_cast<std::uint8_t>(station));
            Utils::PostMessageToUIThread(mStationIDs[station], SoakPost(inWorker, sequence++, station), random.Percent(50));
          } else {
            std::this_thread::yield();  // let the main thread catch up
          }
          break;
        }
        case 1:
          if (held.size() < static_cast<std::size_t>(kListenersPerWorker)) held.push_back(Attach(random, state));
          break;
        case 2:
          if (!held.empty()) {
            const std::size_t which = random.Below(static_cast<std::uint32_t>(held.size()));
            DetachAndDestroy(held[which], state);
            held.erase(held.begin() + static_cast<std::ptrdiff_t>(which));
          }
          break;
        case 3:
          if (!held.empty()) {
            const std::size_t which = random.Below(static_cast<std::uint32_t>(held.size()));
            state.Doing("destroying a listener without detaching it");
            held.erase(held.begin() + static_cast<std::ptrdiff_t>(which));
          }
          break;
        case 4: {
          state.Doing("RetainStation and ReleaseStation");
          // Only a retain that reached a station is released.
          if (Tarn::Station* retained = Registry::RetainStation(mStationIDs[station])) {
            retained->HasListeners();
            Registry::ReleaseStation(mStationIDs[station]);
          }
          break;
        }
        case 5:
          state.Doing("DisposeStation (worker)");
          Registry::DisposeStation(mStationIDs[kStableStations + static_cast<int>(random.Below(kChurnStations))]);
          mChurnDisposals.fetch_add(1, std::memory_order_relaxed);
          break;
        case 6:
          // Delivers nothing off the main thread.
          state.Doing("StationUtils::BroadcastMessage (worker)");
          Utils::BroadcastMessage(mStationIDs[station], SoakProbe());
          break;
      }
      state.Did();
    }
    state.Doing("destroying its listeners");
    for (Held& attachment : held) DetachAndDestroy(attachment, state);
    state.Doing("finished");
  }

  // A new listener of a random kind on a random station. Plain listeners
  // hear stable stations only: a plain back-link to a station that another
  // thread deletes meanwhile is outside the library's contract.
  Held Attach(Random& ioRandom, ThreadState& ioState) {
    Held attachment;
    attachment.mKind = static_cast<Kind>(ioRandom.Below(4));
    attachment.mStation = static_cast<int>(ioRandom.Below(attachment.mKind == Kind::kPlain ? kStableStations : kStations));
    const ImmutableString& id = mStationIDs[attachment.mStation];
    switch (attachment.mKind) {
      case Kind::kPlain:
        ioState.Doing("AddListener (plain)");
        attachment.mPlain = std::make_unique<SoakListener>(mFindings, id, true);
        Utils::AddListener(id, attachment.mPlain.get());
        break;
      case Kind::kBoost:
        ioState.Doing("AddListener (boost weak)");
        attachment.mBoost = boost::make_shared<SoakListener>(mFindings, id, false);
        Utils::AddListener(id, boost::weak_ptr<Tarn::Listener>(attachment.mBoost));
        break;
      case Kind::kStd:
        ioState.Doing("AddListener (std weak)");
        attachment.mStd = std::make_shared<SoakListener>(mFindings, id, false);
        Utils::AddListener(id, std::weak_ptr<Tarn::Listener>(attachment.mStd));
        break;
      case Kind::kSafe:
        ioState.Doing("AddListener (safe)");
        attachment.mSafeObject = new SoakSafeListener(mFindings);
        attachment.mSafe = Tarn::ISafeListenerRef(attachment.mSafeObject);
        Utils::AddListener(id, attachment.mSafe);
        break;
    }
    return attachment;
  }

  // Removes the listener (which waits for a delivery to it in progress on
  // the main thread), marks it detached, then lets it go.
  void DetachAndDestroy(Held& ioAttachment, ThreadState& ioState) {
    const ImmutableString& id = mStationIDs[ioAttachment.mStation];
    switch (ioAttachment.mKind) {
      case Kind::kPlain:
        ioState.Doing("RemoveListener (plain)");
        Utils::RemoveListener(id, ioAttachment.mPlain.get());
        ioAttachment.mPlain->MarkDetached();
        ioState.Doing("deleting a plain listener");
        ioAttachment.mPlain.reset();
        break;
      case Kind::kBoost:
        ioState.Doing("RemoveListener (boost weak)");
        Utils::RemoveListener(id, boost::weak_ptr<Tarn::Listener>(ioAttachment.mBoost));
        ioAttachment.mBoost->MarkDetached();
        ioAttachment.mBoost.reset();
        break;
      case Kind::kStd:
        ioState.Doing("RemoveListener (std weak)");
        Utils::RemoveListener(id, std::weak_ptr<Tarn::Listener>(ioAttachment.mStd));
        ioAttachment.mStd->MarkDetached();
        ioAttachment.mStd.reset();
        break;
      case Kind::kSafe:
        ioState.Doing("RemoveListener (safe)");
        Utils::RemoveListener(id, ioAttachment.mSafe);
        ioAttachment.mSafeObject->MarkDetached();
        ioAttachment.mSafe = nullptr;
        break;
    }
  }

  // --- the watchdog

  // Every thread must make progress within the stall limit; when one does
  // not, says what each was doing and stops the process.
  void Watch() {
    std::array<std::uint64_t, kWorkers + 1> last{};
    std::array<Clock::time_point, kWorkers + 1> since;
    since.fill(Clock::now());
    std::unique_lock<std::mutex> lock(mWatchMutex);
    while (!mWatchChanged.wait_for(lock, std::chrono::milliseconds(100), [this] { return mWatchDone; })) {
      const Clock::time_point now = Clock::now();
      for (int thread = 0; thread <= kWorkers; ++thread) {
        const ThreadState& state = thread == kWorkers ? mMain : mWorkerStates[thread];
        const std::uint64_t progress = state.mProgress.load();
        const bool finished = std::string(state.mActivity.load()) == "finished";
        if (progress != last[thread] || finished) {
          last[thread] = progress;
          since[thread] = now;
        } else if (now - since[thread] > kStallLimit) {
          std::fprintf(stderr, "soak watchdog: no progress for %lld s\n",
                       static_cast<long long>(std::chrono::duration_cast<std::chrono::seconds>(kStallLimit).count()));
          for (int other = 0; other <= kWorkers; ++other) {
            const ThreadState& report = other == kWorkers ? mMain : mWorkerStates[other];
            std::fprintf(stderr, "  %s %d: %s (step %llu)\n", other == kWorkers ? "main thread" : "worker", other,
                         report.mActivity.load(), static_cast<unsigned long long>(report.mProgress.load()));
          }
          messaging_test::detail::AbortNamingTheTest("the soak stalled (deadlock?)");
        }
      }
    }
  }

  std::array<ImmutableString, kStations> mStationIDs;
  Findings mFindings;
  std::array<std::unique_ptr<PostCounter>, kStations> mCounters;
  std::array<std::vector<std::uint8_t>, kWorkers + 1> mPosted;  // station of each post, by producer; each written by its producer only
  std::array<ThreadState, kWorkers> mWorkerStates;
  ThreadState mMain;
  std::atomic<bool> mStop{false};
  std::atomic<std::uint64_t> mChurnDisposals{0};
  std::mutex mWatchMutex;
  std::condition_variable mWatchChanged;
  bool mWatchDone = false;  // guarded by mWatchMutex
  double mSeconds = 0;
};

TEST(SoakThreadTest, PostsAttachmentsAndDisposalsUnderLoadLoseNothingAndLeakNothing) {
  SmallBlockAllocator::SetFailAfter(-1);
  const std::size_t baseline = SmallBlockAllocator::GetStatistics().blocksInUse;
  const std::uint64_t seed = messaging_test::EnvironmentNumber("TARN_TEST_SEED", std::random_device{}());
  SCOPED_TRACE("soak seed " + std::to_string(seed));
  const auto duration = messaging_test::SoakDuration(std::chrono::seconds(3));
  {
    Tarn::Messaging::Initialize();
    Soak soak;
    soak.Run(duration, seed);
    soak.Check();
    // Stations disposed of by workers wait for a main-thread disposal.
    const ImmutableString drain = Registry::UniqueStationID();
    Registry::RegisterStation(drain, nullptr);
    Registry::DisposeStation(drain);
    Tarn::Messaging::Terminate();
    soak.DestroyCounters();
  }
  EXPECT_EQ(SoakSafeListener::Live(), 0) << "safe listeners outlived their last reference";
  EXPECT_EQ(SmallBlockAllocator::GetStatistics().blocksInUse, baseline) << "small blocks leaked by the soak";
}

}  // namespace
