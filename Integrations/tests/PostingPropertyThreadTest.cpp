// The posting promise as one property, on random runs with fixed seeds:
// producers post numbered messages while the main thread's handlers flush
// re-entrantly, post follow-ups, stop and start stations and swap the
// event-loop integration, which its idle broadcasts do as well; Terminate
// comes with posts still queued. For every
// producer, what is heard is exactly what it posted, in order, minus drops
// that a stopped station or Terminate explains; nothing twice; every copy
// freed.
#include "IntegrationTestSupport.h"

#include <kivcore/SmallBlockAllocator.h>

#include <algorithm>
#include <atomic>
#include <numeric>
#include <random>

namespace {

using namespace integration_test;

constexpr int kProducers = 3, kStations = 3;
// The main thread's own posts count as two more producers: queued, and
// broadcast at once (a post on the main thread without inForceAsync).
constexpr int kFollowUps = kProducers, kDirect = kProducers + 1;

// Main-thread state of one run; the hooks below reach it through sRun.
struct Scenario {
  std::mt19937 mRandom;
  std::vector<kivcore::utility::ImmutableString> mStations;
  std::vector<bool> mStopped = std::vector<bool>(kStations, false);
  std::vector<std::vector<int>> mHeard{kProducers + 2}, mDropped{kProducers + 2};  // by producer, in order
  int mUnexplainedDrops = 0, mDepth = 0, mNestedIdles = 0;
  int mPosted[2] = {0, 0};  // by handlers so far: queued, at once
  bool mTerminating = false;
  std::atomic<int> mSettled{0};  // posts heard or dropped, for the producers' pacing
  decltype(TupleOf(AllLoops())) mLoops;
  std::shared_ptr<void> mIntegration;

  int Pick(int inBound) { return std::uniform_int_distribution<int>(0, inBound - 1)(mRandom); }
  // Of a kind picked at random.
  std::shared_ptr<void> MakeIntegration() {
    std::shared_ptr<void> made;
    int skip = Pick(std::tuple_size<decltype(mLoops)>::value);
    auto make = [&](auto& ioLoop) { return skip-- == 0 && (made = QuickIdle(ioLoop.Make())); };
    std::apply([&](auto&... inLoop) { static_cast<void>((make(inLoop) || ...)); }, mLoops);
    return made;
  }
  // Either order: the new integration built before the old one goes, or after.
  void SwapIntegration() {
    if (Pick(2) == 0) mIntegration.reset();
    mIntegration = MakeIntegration();
  }
  void Poll() {
    std::apply([](auto&... inLoop) { (inLoop.Poll(), ...); }, mLoops);
  }
};
Scenario* sRun = nullptr;

// A copy dropped unheard: only a stopped station or Terminate may explain it.
void RecordDrop(const Numbered& inMessage) {
  sRun->mDropped[inMessage.mProducer].push_back(inMessage.mSequence);
  sRun->mSettled.fetch_add(1);
  if (!sRun->mStopped[inMessage.mSequence % kStations] && !sRun->mTerminating) ++sRun->mUnexplainedDrops;
}

class Handler : public Tarn::Listener {
  void ListenToMessage(const Tarn::Message& inMessage) override {
    const auto& message = static_cast<const Numbered&>(inMessage);
    message.mHeard = true;
    Scenario& run = *sRun;
    run.mHeard[message.mProducer].push_back(message.mSequence);
    run.mSettled.fetch_add(1);
    if (run.mTerminating) return;
    ++run.mDepth;
    switch (run.Pick(16)) {
      case 0:
        if (run.mDepth < 4) Tarn::StationUtils::FlushPostedMessagesOnUIThread();
        break;
      case 1:
      case 2: {
        // At once only to a running station: a direct broadcast leaves no copy to report its drop.
        const bool atOnce = run.Pick(2) == 0 && !run.mStopped[run.mPosted[1] % kStations];
        const int sequence = run.mPosted[atOnce]++;
        Tarn::StationUtils::PostMessageToUIThread(run.mStations[sequence % kStations], Numbered(atOnce ? kDirect : kFollowUps, sequence), !atOnce);
        break;
      }
      case 3: {
        // Stopped stations restart at the next toggle, whichever it picks.
        int station = 0;
        while (station < kStations && !run.mStopped[station]) ++station;
        if (station == kStations) station = run.Pick(kStations);
        run.mStopped[station] = !run.mStopped[station];
        if (run.mStopped[station]) Tarn::StationUtils::StopBroadcasting(run.mStations[station]);
        else Tarn::StationUtils::StartBroadcasting(run.mStations[station]);
        break;
      }
      case 4:
        if (run.mDepth == 1) run.SwapIntegration();
        break;
    }
    --run.mDepth;
  }
};

// An idle broadcast comes only between deliveries, and may swap the
// integration whose idle source made it.
class IdleHandler : public Tarn::Listener {
  void ListenToMessage(const Tarn::Message&) override {
    Scenario& run = *sRun;
    if (run.mTerminating) return;
    run.mNestedIdles += run.mDepth++ != 0;
    if (run.Pick(4) == 0) run.SwapIntegration();
    --run.mDepth;
  }
};

class PostingPropertyTest : public ::testing::TestWithParam<unsigned> {};

TEST_P(PostingPropertyTest, EachProducersPostsAreHeardOnceInOrderOrDroppedForAReason) {
  constexpr int kEach = 400;
  tarn_test::Watchdog watchdog;
  const std::size_t baseline = kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse;
  Tarn::Messaging::Initialize();
  Scenario run;
  run.mRandom.seed(GetParam());
  sRun = &run;
  gOnUnheardCopy = &RecordDrop;
  Handler handler;
  IdleHandler idle;
  Tarn::StationUtils::AddListener(Tarn::kStation_Idle, &idle);
  for (int s = 0; s < kStations; ++s) {
    run.mStations.push_back(Tarn::StationRegistry::RegisterUniqueStation());
    Tarn::StationUtils::AddListener(run.mStations.back(), &handler);
  }
  run.mIntegration = run.MakeIntegration();
  std::atomic<int> posted{0};
  std::atomic<bool> stopped{false};
  {
    tarn_test::ThreadGroup producers;
    for (int p = 0; p < kProducers; ++p)
      producers.Start([&, p] {
        for (int i = 0; i < kEach; ++i) {
          // Sequence i goes to station i % kStations, so a drop names its station.
          Tarn::StationUtils::PostMessageToUIThread(run.mStations[i % kStations], Numbered(p, i), p % 2 == 0);
          posted.fetch_add(1);
          // Keep within reach of the main thread until it stops, so that its
          // handlers run among the posts rather than after them.
          while (!stopped.load() && posted.load() > run.mSettled.load() + 32) std::this_thread::yield();
        }
      });
    // The loop stops at a random point; the integration's destructor drains
    // what is queued then, and what the producers post afterwards waits for
    // Terminate.
    const int stopAt = kProducers * kEach * 3 / 4 + run.Pick(kProducers * kEach / 4);
    EXPECT_TRUE(tarn_test::WaitUntil([&] {
      run.Poll();
      return posted.load() >= stopAt;
    }));
    stopped.store(true);
    run.mIntegration.reset();
    producers.JoinAll();
  }
  run.mTerminating = true;
  for (int s = 0; s < kStations; ++s) Tarn::StationUtils::RemoveListener(run.mStations[s], &handler);
  Tarn::StationUtils::RemoveListener(Tarn::kStation_Idle, &idle);
  Tarn::Messaging::Terminate();
  gOnUnheardCopy = nullptr;

  EXPECT_EQ(0, run.mUnexplainedDrops);
  EXPECT_EQ(0, run.mNestedIdles) << "idle broadcasts nested in deliveries";
  for (int p = 0; p <= kDirect; ++p) {
    std::vector<int> all(run.mHeard[p]), each(p < kProducers ? kEach : run.mPosted[p - kFollowUps]);
    all.insert(all.end(), run.mDropped[p].begin(), run.mDropped[p].end());
    std::sort(all.begin(), all.end());
    std::iota(each.begin(), each.end(), 0);
    EXPECT_EQ(each, all) << "producer " << p << ": heard and dropped must be each post exactly once";
    EXPECT_TRUE(std::is_sorted(run.mHeard[p].begin(), run.mHeard[p].end())) << "producer " << p << " heard out of order";
  }
  EXPECT_EQ(baseline, kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse);
}

INSTANTIATE_TEST_SUITE_P(Seeds, PostingPropertyTest, ::testing::Values(1u, 2u, 3u, 4u));

}  // namespace
