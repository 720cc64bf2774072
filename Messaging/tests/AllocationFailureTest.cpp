// Exhausted small-block storage at every allocation of representative
// operations: cloning and posting messages, registering stations, adding
// listeners, making a station on its first retain, disposing of a station
// on a worker, removing a listener on a worker while the main thread
// delivers to it, and nested broadcasts.
//
// Each scenario is attempted with the k-th small-block allocation failing,
// for k = 0, 1, 2, ... until an attempt needs no more than k allocations and
// completes. Every attempt must either complete or raise std::bad_alloc, and
// afterwards the registry and the broadcasters must be consistent (what was
// added is there and works, what failed left no trace, and the operation
// succeeds when tried again) and every small block must be back.
#include "StationTestSupport.h"

#include <TarnMessaging.h>

#include <kivcore/kivcore.h>

#include <gtest/gtest.h>

#include <atomic>
#include <cstdio>
#include <functional>
#include <memory>
#include <new>
#include <string>
#include <vector>

namespace {

using namespace station_test;
using kivcore::utility::SmallBlockAllocator;
using messaging_test::AnyListener;
using messaging_test::ExceptionRecorder;
using messaging_test::kAllListenerKinds;
using messaging_test::KindName;
using messaging_test::ListenerKind;
using messaging_test::PingMessage;
using messaging_test::RecordingListener;
using messaging_test::WaitUntil;
namespace Registry = Tarn::StationRegistry;
namespace Utils = Tarn::StationUtils;

enum class Outcome { kCompleted, kOutOfStorage };

// No scenario here makes more small-block allocations than this.
constexpr long long kMaxFailurePoints = 200;

std::size_t BlocksInUse() { return SmallBlockAllocator::GetStatistics().blocksInUse; }

// Fails every small-block allocation after the first inSucceeding ones, for
// the guard's scope; never leaves a failure armed.
class FailAfter {
public:
  explicit FailAfter(long long inSucceeding) { SmallBlockAllocator::SetFailAfter(inSucceeding); }
  FailAfter(const FailAfter&) = delete;
  FailAfter& operator=(const FailAfter&) = delete;
  ~FailAfter() { SmallBlockAllocator::SetFailAfter(-1); }
};

// Runs inOperation with all but the first inSucceeding small-block
// allocations failing; kOutOfStorage when it raised std::bad_alloc.
template <class Operation>
Outcome Inject(long long inSucceeding, Operation inOperation) {
  FailAfter failing(inSucceeding);
  try {
    inOperation();
  } catch (const std::bad_alloc&) {
    return Outcome::kOutOfStorage;
  }
  return Outcome::kCompleted;
}

class AllocationFailureTest : public RegistryTest {
protected:
  // Attempts inAttempt(k) for k = 0, 1, ... until it completes; checks that
  // each attempt returned every small block. Returns the number of failure
  // points swept.
  long long Sweep(const char* inScenario, const std::function<Outcome(long long)>& inAttempt) {
    for (long long k = 0; k < kMaxFailurePoints; ++k) {
      SCOPED_TRACE(std::string(inScenario) + ", failing after " + std::to_string(k) + " allocations");
      const std::size_t baseline = BlocksInUse();
      const Outcome outcome = inAttempt(k);
      EXPECT_EQ(BlocksInUse(), baseline) << "small blocks leaked";
      if (HasFailure()) return k;
      if (outcome == Outcome::kCompleted) {
        sTotal += k;
        std::printf("[ figures  ] %s: %lld failure points swept (%lld in this suite so far)\n", inScenario, k, sTotal);
        return k;
      }
    }
    ADD_FAILURE() << inScenario << " never completed within " << kMaxFailurePoints << " allocations";
    return kMaxFailurePoints;
  }

  static inline long long sTotal = 0;
};

// ---------------------------------------------------------------------------
// Messages

TEST_F(AllocationFailureTest, CloneEitherCopiesEverythingOrNothing) {
  const TrackedNote note(7, std::string(40, 'c'));
  const long long points = Sweep("Clone", [&](long long inK) -> Outcome {
    const int liveBefore = TrackedNote::Live();
    Tarn::Message* copy = nullptr;
    const Outcome outcome = Inject(inK, [&] { copy = note.Clone(); });
    if (outcome == Outcome::kOutOfStorage) {
      EXPECT_EQ(copy, nullptr);
      EXPECT_EQ(TrackedNote::Live(), liveBefore) << "a half-made copy was left behind";
      return outcome;
    }
    EXPECT_EQ(copy->GetMessageID(), TrackedNote::StaticMessageID());
    EXPECT_EQ(static_cast<TrackedNote*>(copy)->mText, note.mText);
    delete copy;
    EXPECT_EQ(TrackedNote::Live(), liveBefore);
    return outcome;
  });
  EXPECT_GE(points, 1) << "a clone takes a small block";
}

TEST_F(AllocationFailureTest, CallbackThatIsNeverRunFreesItsCopy) {
  const TrackedNote note(8, std::string(40, 'b'));
  const ImmutableString id = RegisterCounted();
  Sweep("CreateCallback", [&](long long inK) -> Outcome {
    const int liveBefore = TrackedNote::Live();
    {
      boost::function<void()> callback;
      const Outcome outcome = Inject(inK, [&] { callback = note.CreateCallback(id); });
      if (outcome == Outcome::kOutOfStorage) {
        EXPECT_TRUE(callback.empty());
        EXPECT_EQ(TrackedNote::Live(), liveBefore);
        return outcome;
      }
      EXPECT_FALSE(callback.empty());
    }
    EXPECT_EQ(TrackedNote::Live(), liveBefore) << "the dropped callback kept its copy";
    return Outcome::kCompleted;
  });
}

// A post either queues exactly one delivery or raises and queues nothing.
TEST_F(AllocationFailureTest, PostFromAWorkerIsDeliveredOnceOrNotAtAll) {
  const ImmutableString id = MakeCounted();
  MessageRecorder recorder;
  Utils::AddListener(id, &recorder);
  // The station's first broadcast keeps its cursor storage for later ones.
  Utils::BroadcastMessage(id, NumberMessage(-1));
  const long long points = Sweep("PostMessageToUIThread from a worker", [&](long long inK) -> Outcome {
    const std::size_t heardBefore = recorder.Count();
    const int liveBefore = TrackedNote::Live();
    Outcome outcome = Outcome::kCompleted;
    // Only the worker allocates while the failure is armed: the main thread
    // waits for it.
    RunOnWorker([&] {
      outcome = Inject(inK, [&] { Utils::PostMessageToUIThread(id, TrackedNote(int(inK), "posted"), false); });
    });
    EXPECT_EQ(Adaptor().PendingCallCount(), outcome == Outcome::kCompleted ? 1u : 0u);
    Utils::FlushPostedMessagesOnUIThread();
    EXPECT_EQ(recorder.Count() - heardBefore, outcome == Outcome::kCompleted ? 1u : 0u);
    if (outcome == Outcome::kCompleted) {
      EXPECT_EQ(recorder.Values().back(), int(inK));
    }
    EXPECT_EQ(TrackedNote::Live(), liveBefore) << "the posted copy outlived its delivery";
    return outcome;
  });
  EXPECT_GE(points, 1) << "a deferred post takes a small block";
  Utils::RemoveListener(id, &recorder);
}

TEST_F(AllocationFailureTest, DeferredPostOnTheMainThreadIsDeliveredOnceOrNotAtAll) {
  const ImmutableString id = MakeCounted();
  MessageRecorder recorder;
  Utils::AddListener(id, &recorder);
  Utils::BroadcastMessage(id, NumberMessage(-1));
  Sweep("PostMessageToUIThread deferred on the main thread", [&](long long inK) -> Outcome {
    const std::size_t heardBefore = recorder.Count();
    const Outcome outcome = Inject(inK, [&] { Utils::PostMessageToUIThread(id, NumberMessage(3), true); });
    EXPECT_EQ(recorder.Count(), heardBefore) << "a deferred post was delivered at once";
    Utils::FlushPostedMessagesOnUIThread();
    EXPECT_EQ(recorder.Count() - heardBefore, outcome == Outcome::kCompleted ? 1u : 0u);
    return outcome;
  });
  Utils::RemoveListener(id, &recorder);
}

// ---------------------------------------------------------------------------
// Registry

TEST_F(AllocationFailureTest, FailedRegistrationLeavesTheIDUnregistered) {
  Sweep("RegisterStation with a factory", [&](long long inK) -> Outcome {
    const ImmutableString id = Registry::UniqueStationID();
    const Outcome outcome = Inject(inK, [&] { Registry::RegisterStation(id, &CountingFactory); });
    Tarn::Station* station = Registry::FindStation(id);
    EXPECT_EQ(station != nullptr, outcome == Outcome::kCompleted) << "registration and outcome disagree";
    Registry::DisposeStation(id);
    EXPECT_EQ(Registry::FindStation(id), nullptr);
    return outcome;
  });
}

TEST_F(AllocationFailureTest, RefusedStationObjectStaysWithItsOwner) {
  Sweep("RegisterStation with a station object", [&](long long inK) -> Outcome {
    const ImmutableString id = Registry::UniqueStationID();
    auto* station = new CountedStation(id);
    const int serial = station->Serial();
    const Outcome outcome = Inject(inK, [&] { Registry::RegisterStation(station); });
    if (outcome == Outcome::kOutOfStorage) {
      EXPECT_EQ(Registry::FindStation(id), nullptr);
      delete station;  // still ours
    } else {
      EXPECT_EQ(Registry::FindStation(id), station);
      Registry::DisposeStation(id);  // the registry's now
    }
    EXPECT_EQ(StationLog::TimesDestroyed(serial), 1);
    return outcome;
  });
}

TEST_F(AllocationFailureTest, FailedUniqueRegistrationLeavesNothingBehind) {
  Sweep("RegisterUniqueStation", [&](long long inK) -> Outcome {
    ImmutableString id;
    const Outcome outcome = Inject(inK, [&] { id = Registry::RegisterUniqueStation(); });
    if (outcome == Outcome::kCompleted) {
      EXPECT_NE(Registry::FindStation(id), nullptr);
      Registry::DisposeStation(id);
    } else {
      EXPECT_TRUE(id.empty());
    }
    return outcome;
  });
}

// A factory that gives each new station a copy of a greeting, which takes a
// small block. The copy is made before the station, so that running out of
// storage leaves no half-made station to delete.
const NumberMessage gGreeting(42);
class GreetedStation : public CountedStation {
public:
  GreetedStation(const ImmutableString& inStationID, std::unique_ptr<Tarn::Message> inGreeting)
      : CountedStation(inStationID), mGreeting(std::move(inGreeting)) {}
  const Tarn::Message& Greeting() const { return *mGreeting; }

private:
  const std::unique_ptr<Tarn::Message> mGreeting;
};
Tarn::Station* GreetingFactory(const ImmutableString& inStationID) {
  std::unique_ptr<Tarn::Message> greeting(gGreeting.Clone());
  return new GreetedStation(inStationID, std::move(greeting));
}

TEST_F(AllocationFailureTest, FirstRetainWhoseFactoryRunsOutOfStorageLeavesTheRegistryUsable) {
  const long long points = Sweep("RetainStation making the station", [&](long long inK) -> Outcome {
    const ImmutableString id = Registry::UniqueStationID();
    Registry::RegisterStation(id, &GreetingFactory);
    Tarn::Station* retained = nullptr;
    const Outcome outcome = Inject(inK, [&] { retained = Registry::RetainStation(id); });
    // The registry's lock was released on the way out: another thread can
    // use the registry at once, and the factory is asked again.
    Tarn::Station* seenByWorker = nullptr;
    RunOnWorker([&] { seenByWorker = Registry::FindStation(id); });
    auto* station = dynamic_cast<GreetedStation*>(seenByWorker);
    if (station == nullptr) {
      ADD_FAILURE() << "the registry cannot make the station after the failure";
      return outcome;
    }
    EXPECT_EQ(static_cast<const NumberMessage&>(station->Greeting()).mValue, 42);
    if (outcome == Outcome::kCompleted) {
      EXPECT_EQ(station, retained);
      Registry::ReleaseStation(id);
    } else {
      EXPECT_EQ(retained, nullptr);
      EXPECT_EQ(StationLog::Constructions(), 1) << "the failed factory made a station";
    }
    MessageRecorder recorder;
    Utils::AddListener(id, &recorder);
    Utils::BroadcastMessage(id, NumberMessage(5));
    EXPECT_EQ(recorder.Values(), std::vector<int>{5});
    // The failed retain gave its caller nothing to release, so it left no
    // count behind: the disposal deletes the station at once.
    Registry::DisposeStation(id);
    EXPECT_EQ(StationLog::Destructions(), 1) << "the failed retain is still counted";
    EXPECT_FALSE(recorder.HasBroadcaster(station));
    StationLog::Reset();
    return outcome;
  });
  EXPECT_GE(points, 1);
}

TEST_F(AllocationFailureTest, FailedDisposalOnAWorkerKeepsTheStationRegistered) {
  const long long points = Sweep("DisposeStation on a worker", [&](long long inK) -> Outcome {
    const ImmutableString id = MakeCounted();
    Tarn::Station* station = Registry::FindStation(id);
    const int serial = SerialOf(station);
    Outcome outcome = Outcome::kCompleted;
    RunOnWorker([&] { outcome = Inject(inK, [&] { Registry::DisposeStation(id); }); });
    EXPECT_EQ(StationLog::TimesDestroyed(serial), 0) << "a worker's disposal deleted the station";
    if (outcome == Outcome::kOutOfStorage) {
      EXPECT_EQ(Registry::FindStation(id), station) << "the failed disposal lost the station";
      Registry::DisposeStation(id);
    } else {
      EXPECT_EQ(Registry::FindStation(id), nullptr);
      DrainPendingStations();
    }
    EXPECT_EQ(StationLog::TimesDestroyed(serial), 1);
    return outcome;
  });
  EXPECT_GE(points, 1) << "a worker's disposal queues the station in small-block storage";
}

// ---------------------------------------------------------------------------
// Listeners

// Adds one listener of each kind to a broadcaster that already has some;
// afterwards each is registered exactly when its add completed.
TEST_F(AllocationFailureTest, AddListenerOfEveryKindRegistersFullyOrNotAtAll) {
  const long long points = Sweep("Broadcaster::AddListener, every kind", [&](long long inK) -> Outcome {
    Tarn::Broadcaster broadcaster;
    RecordingListener first("first");
    RecordingListener second("second");
    broadcaster.AddListener(&first);
    broadcaster.AddListener(&second);
    AnyListener plain(ListenerKind::kPlainPointer, "plain");
    AnyListener boostWeak(ListenerKind::kBoostWeak, "boost");
    AnyListener stdWeak(ListenerKind::kStdWeak, "std");
    AnyListener safe(ListenerKind::kSafe, "safe");
    AnyListener* const added[] = {&plain, &boostWeak, &stdWeak, &safe};
    int completed = 0;
    const Outcome outcome = Inject(inK, [&] {
      for (AnyListener* listener : added) {
        listener->Attach(broadcaster);
        ++completed;
      }
    });
    broadcaster.BroadcastMessage(PingMessage());
    EXPECT_EQ(first.Calls(), 1);
    EXPECT_EQ(second.Calls(), 1);
    for (int i = 0; i < 4; ++i) {
      EXPECT_EQ(added[i]->Calls(), i < completed ? 1 : 0) << KindName(added[i]->Kind()) << " listener";
    }
    // The one whose add failed can be added now.
    for (AnyListener* listener : added) listener->Attach(broadcaster);
    broadcaster.BroadcastMessage(PingMessage());
    for (int i = 0; i < 4; ++i) {
      EXPECT_EQ(added[i]->Calls(), i < completed ? 2 : 1) << KindName(added[i]->Kind()) << " listener, added again";
    }
    return outcome;
  });
  EXPECT_GE(points, 1);
}

// The plain-pointer add also records a back-link in the listener; when that
// fails, the registration is taken back.
TEST_F(AllocationFailureTest, PlainListenerNeverKeepsARegistrationWithoutItsBackLink) {
  Sweep("AddListener by plain pointer", [&](long long inK) -> Outcome {
    Tarn::Broadcaster broadcaster;
    RecordingListener listener("plain");
    const Outcome outcome = Inject(inK, [&] { broadcaster.AddListener(&listener); });
    EXPECT_EQ(broadcaster.HasListener(&listener), outcome == Outcome::kCompleted);
    EXPECT_EQ(listener.HasBroadcaster(&broadcaster), outcome == Outcome::kCompleted);
    broadcaster.RemoveListener(&listener, true);
    return outcome;
  });
}

// One recording listener held the way inKind says, attached to a station
// by its ID.
class ListenerByID {
public:
  explicit ListenerByID(ListenerKind inKind) : mKind(inKind) {
    switch (inKind) {
      case ListenerKind::kPlainPointer:
        mPlain = std::make_unique<RecordingListener>("plain");
        mProbe = mPlain->GetProbe();
        break;
      case ListenerKind::kBoostWeak:
        mBoost = boost::shared_ptr<RecordingListener>(new RecordingListener("boost"));
        mProbe = mBoost->GetProbe();
        break;
      case ListenerKind::kStdWeak:
        mStd = std::make_shared<RecordingListener>("std");
        mProbe = mStd->GetProbe();
        break;
      case ListenerKind::kSafe: {
        auto* object = new messaging_test::CountedSafeListener("safe");
        mProbe = object->GetProbe();
        mSafe = Tarn::ISafeListenerRef(object);
        break;
      }
    }
  }
  void AttachTo(const ImmutableString& inStationID) {
    switch (mKind) {
      case ListenerKind::kPlainPointer:
        Utils::AddListener(inStationID, mPlain.get());
        break;
      case ListenerKind::kBoostWeak:
        Utils::AddListener(inStationID, boost::weak_ptr<Tarn::Listener>(mBoost));
        break;
      case ListenerKind::kStdWeak:
        Utils::AddListener(inStationID, std::weak_ptr<Tarn::Listener>(mStd));
        break;
      case ListenerKind::kSafe:
        Utils::AddListener(inStationID, mSafe);
        break;
    }
  }
  int Calls() const { return mProbe->mCalls.load(); }

private:
  const ListenerKind mKind;
  std::unique_ptr<RecordingListener> mPlain;
  boost::shared_ptr<RecordingListener> mBoost;
  std::shared_ptr<RecordingListener> mStd;
  Tarn::ISafeListenerRef mSafe;
  std::shared_ptr<messaging_test::CallRecorder::Probe> mProbe;
};

TEST_F(AllocationFailureTest, StationUtilsAddListenerOnAStationNotYetMadeBalancesItsRetain) {
  for (ListenerKind kind : kAllListenerKinds) {
    const std::string scenario = std::string("StationUtils::AddListener making the station, ") + KindName(kind);
    const long long points = Sweep(scenario.c_str(), [&](long long inK) -> Outcome {
      const ImmutableString id = RegisterCounted();
      const int destroyedBefore = StationLog::Destructions();
      Outcome outcome;
      {
        ListenerByID listener(kind);
        outcome = Inject(inK, [&] { listener.AttachTo(id); });
        EXPECT_NE(Counted(id), nullptr) << "the first retain did not make the station";
        Utils::BroadcastMessage(id, PingMessage());
        EXPECT_EQ(listener.Calls(), outcome == Outcome::kCompleted ? 1 : 0);
        // The call's retain was released on every way out: a disposal now
        // deletes the station at once.
        Registry::DisposeStation(id);
        EXPECT_EQ(StationLog::Destructions(), destroyedBefore + 1) << "the failed call kept its retain";
      }
      return outcome;
    });
    EXPECT_GE(points, 1) << KindName(kind);
  }
}

// A worker removes a listener while the main thread runs its handler: the
// removal either fails before it changes anything (the listener stays
// registered and is served again) or takes the listener out and returns only
// once the handler has returned.
TEST_F(AllocationFailureTest, RemovalOnAWorkerDuringTheDeliveryFailsCleanlyOrWaitsForTheHandler) {
  for (ListenerKind kind : kAllListenerKinds) {
    const std::string scenario = std::string("RemoveListener on a worker behind a gate, ") + KindName(kind);
    const long long points = Sweep(scenario.c_str(), [&](long long inK) -> Outcome {
      messaging_test::Watchdog watchdog;
      Tarn::Broadcaster broadcaster;
      AnyListener listener(kind, "held");
      Latch entered;
      std::atomic<bool> workerDone{false};
      std::atomic<bool> handlerReturned{false};
      bool firstCall = true;
      listener.SetAction([&](const Tarn::Message&) {
        if (!firstCall) return;
        firstCall = false;
        entered.CountDown();
        // The removal has either failed, or taken the entry out and waits
        // for this handler.
        EXPECT_TRUE(WaitUntil([&] { return workerDone.load() || !broadcaster.HasListeners(); }))
            << "the worker's removal neither failed nor took the entry out";
        handlerReturned.store(true);
      });
      listener.Attach(broadcaster);

      Outcome outcome = Outcome::kCompleted;
      bool returnedBeforeTheHandler = false;
      messaging_test::ThreadGroup worker;
      worker.Start([&] {
        EXPECT_TRUE(entered.WaitFor()) << "the handler never ran";
        outcome = Inject(inK, [&] { listener.Detach(broadcaster); });
        returnedBeforeTheHandler = !handlerReturned.load();
        workerDone.store(true);
      });
      broadcaster.BroadcastMessage(PingMessage());
      worker.JoinAll();

      EXPECT_EQ(listener.Calls(), 1);
      if (outcome == Outcome::kCompleted) {
        EXPECT_FALSE(returnedBeforeTheHandler) << "the removal returned while the handler still ran";
        EXPECT_FALSE(broadcaster.HasListeners());
        broadcaster.BroadcastMessage(PingMessage());
        EXPECT_EQ(listener.Calls(), 1) << "a removed listener was served";
      } else {
        EXPECT_TRUE(broadcaster.HasListeners()) << "the failed removal took the entry out";
        broadcaster.BroadcastMessage(PingMessage());
        EXPECT_EQ(listener.Calls(), 2) << "the listener whose removal failed is no longer served";
        listener.Detach(broadcaster);
        EXPECT_FALSE(broadcaster.HasListeners());
      }
      return outcome;
    });
    EXPECT_EQ(points, 0) << "a removal waiting for a delivery takes small blocks (" << KindName(kind) << ")";
  }
}

// Each broadcast level keeps a cursor in small-block storage. A nested
// broadcast that cannot make its cursor fails inside the handler (where the
// error manager takes the exception) and the outer one goes on; afterwards
// no cursor is left behind.
TEST_F(AllocationFailureTest, NestedBroadcastWithoutStorageLeavesTheOuterOneGoingAndNoCursorBehind) {
  const long long points = Sweep("nested broadcast", [&](long long inK) -> Outcome {
    ExceptionRecorder exceptions;
    Tarn::Broadcaster broadcaster;
    RecordingListener other("other");
    RecordingListener nester("nester");
    int depth = 0;
    nester.SetAction([&](const Tarn::Message&) {
      if (depth != 0) return;
      struct Level {
        int& mDepth;
        ~Level() { --mDepth; }
      } level{++depth};
      broadcaster.BroadcastMessage(PingMessage());
    });
    broadcaster.AddListener(&other);
    broadcaster.AddListener(&nester);
    Outcome outcome = Inject(inK, [&] { broadcaster.BroadcastMessage(PingMessage()); });
    if (outcome == Outcome::kOutOfStorage) {
      EXPECT_EQ(exceptions.Count(), 0u);
      EXPECT_EQ(nester.Calls(), 0) << "the failed broadcast delivered";
      EXPECT_EQ(other.Calls(), 0);
    } else if (exceptions.Count() != 0) {
      outcome = Outcome::kOutOfStorage;
      EXPECT_EQ(exceptions.Messages(), std::vector<std::string>{std::bad_alloc().what()});
      EXPECT_EQ(nester.Calls(), 1);
      EXPECT_EQ(other.Calls(), 1) << "the outer broadcast did not go on";
    } else {
      EXPECT_EQ(nester.Calls(), 2);
      EXPECT_EQ(other.Calls(), 2);
    }
    // A stale cursor would make a worker's removal wait for a delivery that
    // is not running.
    const int nesterBefore = nester.Calls();
    const int otherBefore = other.Calls();
    broadcaster.BroadcastMessage(PingMessage());
    EXPECT_EQ(nester.Calls() - nesterBefore, 2);
    EXPECT_EQ(other.Calls() - otherBefore, 2);
    RunOnWorker([&] { broadcaster.RemoveListener(&other, true); });
    RunOnWorker([&] { broadcaster.RemoveListener(&nester, true); });
    EXPECT_FALSE(broadcaster.HasListeners());
    return outcome;
  });
  EXPECT_EQ(points, 0) << "a nested broadcast takes small blocks";
}

}  // namespace
