// Broadcaster on one thread: the delivery rules under re-entrancy, the
// back-links between broadcasters and plain listeners, pruning of listeners
// that die during a broadcast, and the storage the registry takes.
#include "TestSupport.h"

#include <algorithm>
#include <new>

namespace {

using kivcore::utility::SmallBlockAllocator;
using namespace messaging_test;
using Log = std::vector<std::string>;

struct Quiet : Tarn::Listener {
  void ListenToMessage(const Tarn::Message&) override {}
};

class BroadcasterTest : public ::testing::Test {
protected:
  messaging_test::MainThreadGuard mMainThread;
  CallLog mLog;
};

TEST_F(BroadcasterTest, HandlersAddRemoveAndNestWithoutBreakingTheNewestFirstWalk) {
  Tarn::Broadcaster broadcaster;
  RecordingListener a("A", &mLog), b("B", &mLog), c("C", &mLog), late("D", &mLog);
  int nested = 0;
  c.SetAction([&](const Tarn::Message&) {
    if (nested++ != 0) return;
    broadcaster.AddListener(&late);             // not served by running walks
    broadcaster.RemoveListener(&a, true);       // not served yet: never served
    broadcaster.BroadcastMessage(NumberMessage(2));  // serves everyone there now
    broadcaster.RemoveListener(&c, true);       // itself: no wait, walk goes on
  });
  broadcaster.AddListener(&a);
  broadcaster.AddListener(&b);
  broadcaster.AddListener(&c);
  broadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ(mLog.Entries(), (Log{"C:1", "D:2", "C:2", "B:2", "B:1"}));
  EXPECT_FALSE(a.HasBroadcaster(&broadcaster));
  EXPECT_FALSE(c.HasBroadcaster(&broadcaster));
  mLog.Clear();
  broadcaster.BroadcastMessage(NumberMessage(3));
  EXPECT_EQ(mLog.Entries(), (Log{"D:3", "B:3"}));
}

// A removal that leaves the listener's back-link (only ~Listener passes
// false) followed by a new registration used to leave one stale link after
// the final removal, and the listener's destructor then called into the
// deleted broadcaster.
TEST_F(BroadcasterTest, BackLinksStayExactWhateverTheRemovalsAndDestructionOrder) {
  RecordingListener listener("L");
  auto broadcaster = std::make_unique<Tarn::Broadcaster>();
  broadcaster->RemoveListener(&listener, false);
  broadcaster->AddListener(&listener);
  broadcaster->RemoveListener(&listener, false);
  broadcaster->AddListener(&listener);
  broadcaster->AddListener(&listener);
  broadcaster->RemoveListener(&listener, true);
  EXPECT_FALSE(listener.HasBroadcaster(broadcaster.get()));
  EXPECT_FALSE(broadcaster->HasListener(&listener));

  broadcaster->AddListener(&listener);
  Tarn::Broadcaster* const gone = broadcaster.get();
  broadcaster.reset();  // detaches the listener; its destructor must not call back
  EXPECT_FALSE(listener.HasBroadcaster(gone));
}

// A safe listener that lets go of its own last reference when it is asked
// for ISafeListener, so that the broadcast's resolution holds the final one:
// dropping it destroys the listener, whose destructor removes it from the
// broadcaster. Deciding liveness under the broadcaster's lock once moved the
// walk before the front entry and read past the end of the registry.
class SelfReleasingListener : public messaging_test::CountedSafeListener {
public:
  SelfReleasingListener(Tarn::Broadcaster& inBroadcaster) : CountedSafeListener("S"), mBroadcaster(inBroadcaster) {}
  std::int32_t QueryInterface(const Tarn::IID& inIID, void** outInterface) override {
    if (inIID == Tarn::IID_ISafeListener) mSelf = Tarn::ISafeListenerRef();
    return CountedSafeListener::QueryInterface(inIID, outInterface);
  }
  ~SelfReleasingListener() override { mBroadcaster.RemoveListener(Tarn::ISafeListenerRef(this)); }
  Tarn::ISafeListenerRef mSelf;
  Tarn::Broadcaster& mBroadcaster;
};

TEST_F(BroadcasterTest, ListenersDyingWhileTheWalkResolvesThemArePrunedAndNothingIsReadOutOfRange) {
  Tarn::Broadcaster broadcaster;
  auto* object = new SelfReleasingListener(broadcaster);
  object->mSelf = Tarn::ISafeListenerRef(object);
  broadcaster.AddListener(object->mSelf);
  const int liveBefore = messaging_test::CountedSafeListener::LiveCount();
  auto shared = std::make_shared<RecordingListener>("W", &mLog);
  broadcaster.AddListener(std::weak_ptr<Tarn::Listener>(shared));
  shared.reset();
  // An entry of each kind is live exactly while its listener is.
  RecordingListener probe("P");
  boost::shared_ptr<Tarn::Listener> boostOwner(new RecordingListener("B"));
  auto stdOwner = std::make_shared<RecordingListener>("S");
  Tarn::ISafeListenerRef safeOwner(new messaging_test::CountedSafeListener("C"));
  Tarn::ListenerEntry plain, boostWeak, stdWeak, safe;
  plain.mListener = &probe;
  boostWeak.mBoostWeakListener = boostOwner;
  stdWeak.mStdWeakListener = stdOwner;
  safe.mSafeListener = Tarn::GetSafeListenerHandle(safeOwner);
  EXPECT_TRUE(plain.IsLive() && boostWeak.IsLive() && stdWeak.IsLive() && safe.IsLive());
  boostOwner.reset();
  stdOwner.reset();
  safeOwner = Tarn::ISafeListenerRef();
  EXPECT_FALSE(boostWeak.IsLive() || stdWeak.IsLive() || safe.IsLive()) << "an entry outlived its listener";
  broadcaster.BroadcastMessage(NumberMessage(1));
  EXPECT_EQ(messaging_test::CountedSafeListener::LiveCount(), liveBefore - 1) << "the listener was not served once";
  EXPECT_FALSE(broadcaster.HasListeners()) << "a dead listener was not pruned";
  EXPECT_TRUE(mLog.Entries().empty());
}

TEST_F(BroadcasterTest, DeliveryTakesNoStorageAndTheRegistryGivesBackEverySmallBlock) {
  RecordingListener plain("plain");
  auto stdOwner = std::make_shared<RecordingListener>("std");
  const Tarn::ISafeListenerRef safe(new messaging_test::CountedSafeListener("safe"));
  const SmallBlockAllocator::Statistics before = SmallBlockAllocator::GetStatistics();
  {
    Tarn::Broadcaster broadcaster;
    broadcaster.AddListener(&plain);
    broadcaster.AddListener(std::weak_ptr<Tarn::Listener>(stdOwner));
    broadcaster.AddListener(safe);
    const SmallBlockAllocator::Statistics registered = SmallBlockAllocator::GetStatistics();
    broadcaster.BroadcastMessage(NumberMessage(1));
    EXPECT_EQ(SmallBlockAllocator::GetStatistics().allocations, registered.allocations) << "a delivery allocated";
    broadcaster.RemoveListener(safe);
  }
  EXPECT_EQ(SmallBlockAllocator::GetStatistics().blocksInUse, before.blocksInUse) << "small blocks leaked";
  EXPECT_EQ(plain.Calls() + stdOwner->Calls(), 2);
}

// Registrations are found through an index kept beside the walk's entries:
// re-adds and removals inside a broadcast, owners reached through another
// weak pointer, prunes and failed registrations must leave the two in step.
TEST_F(BroadcasterTest, TheIndexStaysInStepWithTheEntriesThroughEveryChange) {
  Tarn::Broadcaster broadcaster;
  RecordingListener a("A", &mLog), b("B", &mLog), c("C", &mLog);
  auto owner = std::make_shared<RecordingListener>("W", &mLog);
  std::shared_ptr<Tarn::Listener> alias(owner, &a);  // same owner, another address
  broadcaster.AddListener(std::weak_ptr<Tarn::Listener>(owner));
  broadcaster.AddListener(std::weak_ptr<Tarn::Listener>(alias));  // already there
  broadcaster.AddListener(&a);
  broadcaster.AddListener(&b);
  b.SetAction([&](const Tarn::Message&) {
    if (b.Calls() != 1) return;
    broadcaster.RemoveListener(&a, true);
    broadcaster.AddListener(&a);  // newer than the walk: served from the next one
    broadcaster.RemoveListener(std::weak_ptr<Tarn::Listener>(alias));
    broadcaster.AddListener(std::weak_ptr<Tarn::Listener>(owner));
  });
  broadcaster.BroadcastMessage(NumberMessage(1));
  for (int succeeding = 0; !broadcaster.HasListener(&c); ++succeeding) {
    messaging_test::SmallBlockFailureGuard failing(succeeding);
    try {
      broadcaster.AddListener(&c);
    } catch (const std::bad_alloc&) {
      EXPECT_FALSE(broadcaster.HasListener(&c) || c.HasBroadcaster(&broadcaster)) << "a failed add left a half";
    }
  }
  alias.reset();
  owner.reset();  // pruned by the next walk
  broadcaster.BroadcastMessage(NumberMessage(2));
  EXPECT_EQ(mLog.Entries(), (Log{"B:1", "C:2", "A:2", "B:2"}));
  for (RecordingListener* listener : {&a, &b, &c}) broadcaster.RemoveListener(listener, true);
  EXPECT_FALSE(broadcaster.HasListeners()) << "an entry outlived its removal or prune";
}

// Removals away from the newest end used to erase from the middle of the
// registry, moving every newer entry: detaching listeners oldest first was
// quadratic (1,000 of 64,000 took ~60 times as long as 1,000 of 1,000). They
// now mark the entry, and the walk must pass marked entries and compactions
// made in the middle of it.
TEST_F(BroadcasterTest, DetachingOldestFirstCostsTheSameAtAnyCountAndKeepsTheWalk) {
  Tarn::Broadcaster broadcaster;
  std::vector<std::unique_ptr<RecordingListener>> listeners;
  for (int i = 0; i < 64; ++i) {
    listeners.push_back(std::make_unique<RecordingListener>(std::to_string(i), &mLog));
    broadcaster.AddListener(listeners.back().get());
  }
  RecordingListener late("late", &mLog);
  listeners[63]->SetAction([&](const Tarn::Message&) {
    if (listeners[63]->Calls() != 1) return;
    for (int i = 0; i < 41; ++i) broadcaster.RemoveListener(listeners[i].get(), true);  // compacts
    broadcaster.RemoveListener(listeners[50].get(), true);  // not served yet: never served
    broadcaster.AddListener(&late);
  });
  broadcaster.BroadcastMessage(NumberMessage(1));
  broadcaster.BroadcastMessage(NumberMessage(2));
  Log expected;
  for (int round = 1; round <= 2; ++round) {
    if (round == 2) expected.push_back("late:2");
    for (int i = 63; i > 40; --i)
      if (i != 50) expected.push_back(std::to_string(i) + ":" + std::to_string(round));
  }
  EXPECT_EQ(mLog.Entries(), expected);

  constexpr std::size_t kDetached = 1000;
  // The quickest of five tries, so that a busy machine does not fail it. Each
  // try detaches the oldest kDetached and attaches them again as the newest.
  const auto detachOldest = [](std::size_t inCount) {
    std::vector<Quiet> quiet(inCount);
    Tarn::Broadcaster many;
    for (Quiet& listener : quiet) many.AddListener(&listener);
    auto best = std::chrono::steady_clock::duration::max();
    for (std::size_t attempt = 0; attempt < 5; ++attempt) {
      const auto start = std::chrono::steady_clock::now();
      for (std::size_t i = 0; i < kDetached; ++i) many.RemoveListener(&quiet[(attempt * kDetached + i) % inCount], true);
      best = std::min(best, std::chrono::steady_clock::now() - start);
      EXPECT_FALSE(many.HasListener(&quiet[(attempt * kDetached) % inCount]));
      for (std::size_t i = 0; i < kDetached; ++i) many.AddListener(&quiet[(attempt * kDetached + i) % inCount]);
    }
    return best;
  };
  const auto few = detachOldest(kDetached), many = detachOldest(64 * kDetached);
  EXPECT_LT(many, few * 10) << "detaching the oldest of 64,000 took " << std::chrono::duration<double>(many).count()
                            << " s, of 1,000: " << std::chrono::duration<double>(few).count() << " s";
}

// A copy, made or assigned, takes the listen state and none of the
// original's broadcasters; an assigned listener keeps its own.
TEST(ListenerCopy, ACopyTakesTheListenStateButNoBroadcaster) {
  Tarn::Broadcaster broadcaster, other;
  Quiet original, assigned;
  broadcaster.AddListener(&original);
  other.AddListener(&assigned);
  original.StopListening();
  Quiet copy(original);
  assigned = original;
  EXPECT_FALSE(copy.IsListening() || assigned.IsListening());
  EXPECT_TRUE(original.HasBroadcaster(&broadcaster) && !copy.HasBroadcaster(&broadcaster) &&
              !assigned.HasBroadcaster(&broadcaster) && assigned.HasBroadcaster(&other));
  original.StartListening();
  assigned = original;
  EXPECT_TRUE(assigned.IsListening());
}

}  // namespace
