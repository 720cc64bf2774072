// The process-wide station registry: when stations are made, how retains
// protect them, where and when disposal deletes them, what Terminate does,
// and how the registry copes with factories that fail and with station
// destructors that call back into it.
#include "StationTestSupport.h"

#include <algorithm>
#include <map>
#include <random>
#include <set>
#include <typeinfo>

namespace {

using namespace station_test;
namespace Registry = Tarn::StationRegistry;

class StationRegistryTest : public RegistryTest {};

// ---------------------------------------------------------------------------
// Making and finding

TEST_F(StationRegistryTest, RegisteringMakesNoStation) {
  RegisterCounted();
  EXPECT_EQ(StationLog::Factories(), 0);
  EXPECT_EQ(StationLog::Constructions(), 0);
}

TEST_F(StationRegistryTest, FirstFindMakesTheStationOnceAndLeavesItUnretained) {
  const ImmutableString id = RegisterCounted();
  Tarn::Station* first = Registry::FindStation(id);
  Tarn::Station* second = Registry::FindStation(id);
  ASSERT_NE(first, nullptr);
  EXPECT_EQ(first, second);
  EXPECT_EQ(StationLog::Factories(), 1);
  EXPECT_EQ(first->GetStationID(), id);

  // Finding counted no retain, so a disposal deletes the station at once.
  Registry::DisposeStation(id);
  EXPECT_EQ(StationLog::Destructions(), 1);
  EXPECT_EQ(Registry::FindStation(id), nullptr);
}

TEST_F(StationRegistryTest, RetainMakesANeverMadeStationAndCountsOne) {
  const ImmutableString id = RegisterCounted();
  Tarn::Station* station = Registry::RetainStation(id);
  ASSERT_NE(station, nullptr);
  EXPECT_EQ(StationLog::Factories(), 1);
  EXPECT_EQ(Registry::FindStation(id), station);

  Registry::DisposeStation(id);
  EXPECT_EQ(StationLog::Destructions(), 0) << "a retained station was deleted by DisposeStation";
  EXPECT_EQ(Registry::FindStation(id), station);

  Registry::ReleaseStation(id);
  EXPECT_EQ(StationLog::Destructions(), 1) << "one release did not balance one retain";
  EXPECT_EQ(Registry::FindStation(id), nullptr);
}

TEST_F(StationRegistryTest, RetainAndReleaseWithoutDisposalLeaveTheStationUnretained) {
  const ImmutableString id = MakeCounted();
  Tarn::Station* station = Registry::FindStation(id);
  EXPECT_EQ(Registry::RetainStation(id), station);
  EXPECT_EQ(Registry::RetainStation(id), station);
  Registry::ReleaseStation(id);
  Registry::ReleaseStation(id);
  EXPECT_EQ(StationLog::Destructions(), 0);
  EXPECT_EQ(Registry::FindStation(id), station);

  Registry::DisposeStation(id);
  EXPECT_EQ(StationLog::Destructions(), 1);
}

TEST_F(StationRegistryTest, LastReleaseAfterDisposalDeletesTheStationOnTheReleasingThread) {
  const ImmutableString id = RegisterCounted();
  Tarn::Station* station = Registry::RetainStation(id);
  ASSERT_NE(station, nullptr);
  ASSERT_EQ(Registry::RetainStation(id), station);

  Registry::DisposeStation(id);
  EXPECT_EQ(Registry::FindStation(id), station) << "a station with a pending disposal must stay registered";
  Registry::ReleaseStation(id);
  EXPECT_EQ(StationLog::Destructions(), 0) << "deleted while one retain was still standing";
  EXPECT_EQ(Registry::FindStation(id), station);

  std::thread::id releaser;
  RunOnWorker([&] {
    releaser = std::this_thread::get_id();
    Registry::ReleaseStation(id);
  });
  const std::vector<Destruction> destroyed = StationLog::DestroyedStations();
  ASSERT_EQ(destroyed.size(), 1u);
  EXPECT_EQ(destroyed[0].mThread, releaser);
  EXPECT_EQ(Registry::FindStation(id), nullptr);
}

TEST_F(StationRegistryTest, FindAndRetainOfAnUnregisteredIdReturnNullAndCountNothing) {
  const ImmutableString id = Registry::UniqueStationID();
  EXPECT_EQ(Registry::FindStation(id), nullptr);
  EXPECT_EQ(Registry::RetainStation(id), nullptr);
  Registry::ReleaseStation(id);
  Registry::DisposeStation(id);
  EXPECT_EQ(Registry::FindStation(id), nullptr) << "a lookup registered the ID";

  // A registration afterwards starts from a count of 0: nothing was counted
  // against the ID while it was not registered.
  Registry::RegisterStation(id, &CountingFactory);
  ASSERT_NE(Registry::FindStation(id), nullptr);
  Registry::DisposeStation(id);
  EXPECT_EQ(StationLog::Destructions(), 1);
}

TEST_F(StationRegistryTest, ReleaseOfANeverMadeStationChangesNothing) {
  const ImmutableString id = RegisterCounted();
  Registry::ReleaseStation(id);
  EXPECT_EQ(StationLog::Factories(), 0) << "a release made the station";

  // Had the release counted, the count would have wrapped below 0 and the
  // disposal would wait for four billion releases.
  ASSERT_NE(Registry::FindStation(id), nullptr);
  Registry::DisposeStation(id);
  EXPECT_EQ(StationLog::Destructions(), 1);
}

TEST_F(StationRegistryTest, SecondRegistrationOfAnIdKeepsTheFirstFactory) {
  const ImmutableString plain = Registry::UniqueStationID();
  Registry::RegisterStation(plain, nullptr);
  Registry::RegisterStation(plain, &CountingFactory);
  Tarn::Station* plainStation = Registry::FindStation(plain);
  ASSERT_NE(plainStation, nullptr);
  EXPECT_EQ(typeid(*plainStation), typeid(Tarn::Station));
  EXPECT_EQ(StationLog::Factories(), 0);

  const ImmutableString counted = RegisterCounted();
  Registry::RegisterStation(counted, nullptr);
  EXPECT_NE(Counted(counted), nullptr);

  // A registration after the station was made keeps the station too.
  Registry::RegisterStation(plain, &CountingFactory);
  EXPECT_EQ(Registry::FindStation(plain), plainStation);
}

TEST_F(StationRegistryTest, RegisteringAStationObjectHandsItToTheRegistry) {
  const ImmutableString id = Registry::UniqueStationID();
  auto* station = new CountedStation(id);
  const int serial = station->Serial();
  Registry::RegisterStation(station);
  EXPECT_EQ(Registry::FindStation(id), station);
  EXPECT_EQ(StationLog::Factories(), 0);

  Registry::DisposeStation(id);
  EXPECT_EQ(StationLog::DestroyedSerials(), std::vector<int>{serial});
  EXPECT_EQ(Registry::FindStation(id), nullptr);
}

TEST_F(StationRegistryTest, RegisteringAStationObjectUnderATakenIdLeavesItWithTheCaller) {
  const ImmutableString id = MakeCounted();
  Tarn::Station* registered = Registry::FindStation(id);
  const int registeredSerial = SerialOf(registered);
  auto mine = std::make_unique<CountedStation>(id);

  Registry::RegisterStation(mine.get());
  EXPECT_EQ(Registry::FindStation(id), registered);

  // The registry deletes its own station and not the caller's.
  Registry::Terminate();
  EXPECT_EQ(StationLog::DestroyedSerials(), std::vector<int>{registeredSerial});
  mine.reset();
  EXPECT_EQ(StationLog::Destructions(), 2);
}

TEST_F(StationRegistryTest, RegisteringANullStationObjectRegistersNothing) {
  Registry::RegisterStation(static_cast<Tarn::Station*>(nullptr));
  EXPECT_EQ(Registry::FindStation(Tarn::kNoStation), nullptr);
}

// ---------------------------------------------------------------------------
// Disposal

TEST_F(StationRegistryTest, MainThreadDisposalDeletesAtOnceThenTheQueuedStationsInQueueOrder) {
  const ImmutableString a = MakeCounted();
  const ImmutableString b = MakeCounted();
  const ImmutableString c = MakeCounted();
  const ImmutableString d = MakeCounted();
  const int serialA = Counted(a)->Serial();
  const int serialB = Counted(b)->Serial();
  const int serialC = Counted(c)->Serial();
  const int serialD = Counted(d)->Serial();

  RunOnWorker([&] { Registry::DisposeStation(b); });
  RunOnWorker([&] {
    Registry::DisposeStation(c);
    Registry::DisposeStation(a);
  });
  EXPECT_EQ(StationLog::Destructions(), 0) << "a disposal off the main thread deleted its station";

  Registry::DisposeStation(d);
  EXPECT_EQ(StationLog::DestroyedSerials(), (std::vector<int>{serialD, serialB, serialC, serialA}));
  for (const Destruction& destruction : StationLog::DestroyedStations()) {
    EXPECT_EQ(destruction.mThread, std::this_thread::get_id()) << destruction.mStationID;
  }
}

TEST_F(StationRegistryTest, WorkerDisposalUnregistersAtOnceAndKeepsTheStationUntilTheNextMainThreadDisposal) {
  const ImmutableString id = MakeCounted();
  CountedStation* station = Counted(id);
  messaging_test::RecordingListener listener("listener");
  station->AddListener(&listener);

  RunOnWorker([&] { Registry::DisposeStation(id); });
  EXPECT_EQ(Registry::FindStation(id), nullptr);
  EXPECT_EQ(StationLog::Destructions(), 0);
  EXPECT_TRUE(listener.HasBroadcaster(station)) << "the queued station is gone already";

  // A main-thread disposal that removes no record deletes nothing.
  Registry::DisposeStation(Registry::UniqueStationID());
  EXPECT_EQ(StationLog::Destructions(), 0);

  // Neither does Terminate touch the queued station.
  Registry::Terminate();
  EXPECT_EQ(StationLog::Destructions(), 0);

  DrainPendingStations();
  EXPECT_EQ(StationLog::Destructions(), 1);
  EXPECT_FALSE(listener.HasBroadcaster(station));
}

TEST_F(StationRegistryTest, DisposalWhileNoMainThreadIsRegisteredOnlyQueues) {
  const ImmutableString id = MakeCounted();
  mMainThread.reset();
  ASSERT_FALSE(kivcore::threads::CurrentThreadIsMainThread());

  Registry::DisposeStation(id);
  EXPECT_EQ(Registry::FindStation(id), nullptr);
  EXPECT_EQ(StationLog::Destructions(), 0);

  mMainThread.emplace();
  DrainPendingStations();
  EXPECT_EQ(StationLog::Destructions(), 1);
}

TEST_F(StationRegistryTest, DisposalOfANeverMadeStationRemovesTheRecordWithoutMakingIt) {
  const ImmutableString id = RegisterCounted();
  Registry::DisposeStation(id);
  EXPECT_EQ(Registry::FindStation(id), nullptr);
  EXPECT_EQ(StationLog::Factories(), 0);
  EXPECT_EQ(StationLog::Destructions(), 0);

  // A new registration of the ID starts over.
  Registry::RegisterStation(id, &CountingFactory);
  EXPECT_NE(Registry::FindStation(id), nullptr);
  EXPECT_EQ(StationLog::Factories(), 1);
}

TEST_F(StationRegistryTest, MainThreadDisposalOfANeverMadeStationStillDeletesTheQueuedStations) {
  const ImmutableString queued = MakeCounted();
  const ImmutableString unmade = RegisterCounted();
  RunOnWorker([&] { Registry::DisposeStation(queued); });

  Registry::DisposeStation(unmade);
  EXPECT_EQ(StationLog::Destructions(), 1);
  EXPECT_EQ(StationLog::Factories(), 1) << "the never-made station was made by its disposal";
}

// A station deleted from the pending list may dispose of another station
// from its destructor, which deletes that one at once and runs the
// pending-list deletion again inside the first one.
TEST_F(StationRegistryTest, StationDestructorDisposingOthersDuringThePendingDeletionLosesAndRepeatsNothing) {
  const ImmutableString victim = MakeCounted();
  const ImmutableString secondVictim = MakeCounted();
  const ImmutableString first = MakeCounted();
  const ImmutableString second = MakeCounted();
  const ImmutableString third = MakeCounted();
  const ImmutableString trigger = MakeCounted();
  const int serialVictim = Counted(victim)->Serial();
  const int serialSecondVictim = Counted(secondVictim)->Serial();
  const int serialFirst = Counted(first)->Serial();
  const int serialSecond = Counted(second)->Serial();
  const int serialThird = Counted(third)->Serial();
  const int serialTrigger = Counted(trigger)->Serial();
  Counted(first)->OnDestroy([victim] { Registry::DisposeStation(victim); });
  // Nested one level deeper: the victim's destructor disposes of another.
  Counted(victim)->OnDestroy([secondVictim] { Registry::DisposeStation(secondVictim); });

  RunOnWorker([&] {
    Registry::DisposeStation(first);
    Registry::DisposeStation(second);
    Registry::DisposeStation(third);
  });
  ASSERT_EQ(StationLog::Destructions(), 0);

  Registry::DisposeStation(trigger);
  for (int serial : {serialVictim, serialSecondVictim, serialFirst, serialSecond, serialThird, serialTrigger}) {
    EXPECT_EQ(StationLog::TimesDestroyed(serial), 1) << "station " << serial;
  }
  EXPECT_EQ(StationLog::Constructions(), StationLog::Destructions());
  // A destructor logs after its action, so the victims appear before the
  // station that disposed of them.
  EXPECT_EQ(StationLog::DestroyedSerials(),
            (std::vector<int>{serialTrigger, serialSecondVictim, serialVictim, serialFirst, serialSecond, serialThird}));

  // Nothing is left queued for a later disposal to delete again.
  DrainPendingStations();
  EXPECT_EQ(StationLog::Destructions(), 6);
}

// ---------------------------------------------------------------------------
// Factories that fail

TEST_F(StationRegistryTest, FactoryReturningNullLeavesTheRecordWithoutStationAndIsAskedAgain) {
  const ImmutableString id = Registry::UniqueStationID();
  FlakyFactory::sFailuresLeft = 2;
  Registry::RegisterStation(id, &FlakyFactory::Make);

  EXPECT_EQ(Registry::FindStation(id), nullptr);
  EXPECT_EQ(FlakyFactory::sCalls, 1);
  EXPECT_EQ(Registry::RetainStation(id), nullptr);
  EXPECT_EQ(FlakyFactory::sCalls, 2);

  Tarn::Station* station = Registry::FindStation(id);
  ASSERT_NE(station, nullptr);
  EXPECT_EQ(FlakyFactory::sCalls, 3);
  EXPECT_EQ(Registry::FindStation(id), station);
  EXPECT_EQ(FlakyFactory::sCalls, 3);
}

TEST_F(StationRegistryTest, FactoryThrowingPassesTheExceptionOnWithTheRegistryUnlocked) {
  const ImmutableString id = Registry::UniqueStationID();
  ThrowingFactory::sThrowsLeft = 2;
  Registry::RegisterStation(id, &ThrowingFactory::Make);

  EXPECT_THROW(Registry::FindStation(id), std::runtime_error);
  // Had the lock stayed with this thread, the worker would block for ever.
  RunOnWorker([] {
    const ImmutableString other = Registry::RegisterUniqueStation();
    EXPECT_NE(Registry::FindStation(other), nullptr);
  });
  EXPECT_THROW(Registry::RetainStation(id), std::runtime_error);
  RunOnWorker([] { Registry::FindStation(Registry::UniqueStationID()); });

  Tarn::Station* station = Registry::FindStation(id);
  ASSERT_NE(station, nullptr) << "the record lost its factory after it threw";
  EXPECT_EQ(ThrowingFactory::sCalls, 3);
}

// A station whose own constructor fails is destroyed inside its factory, and
// the destructor's lookup of its ID must not call that factory again: it used
// to recurse until the stack overflowed.
struct StationFailingConstruction : Tarn::Station {
  static inline std::atomic<int> sAttempts{0};
  explicit StationFailingConstruction(const ImmutableString& inStationID) : Tarn::Station(inStationID) {
    sAttempts.fetch_add(1);
    throw std::runtime_error("station construction failed");
  }
  static Tarn::Station* Make(const ImmutableString& inStationID) {
    return new StationFailingConstruction(inStationID);
  }
};

TEST_F(StationRegistryTest, StationWhoseConstructionFailsIsNotMadeAgainByItsOwnDestructor) {
  StationFailingConstruction::sAttempts = 0;
  const ImmutableString id = Registry::UniqueStationID();
  Registry::RegisterStation(id, &StationFailingConstruction::Make);

  EXPECT_THROW(Registry::RetainStation(id), std::runtime_error);
  EXPECT_EQ(StationFailingConstruction::sAttempts.load(), 1);
  EXPECT_THROW(Registry::FindStation(id), std::runtime_error);
  EXPECT_EQ(StationFailingConstruction::sAttempts.load(), 2);

  // The failed retain was taken back, so a disposal removes the record at once.
  Registry::DisposeStation(id);
  EXPECT_EQ(Registry::FindStation(id), nullptr);
  EXPECT_EQ(StationFailingConstruction::sAttempts.load(), 2);
}

// ---------------------------------------------------------------------------
// Terminate

TEST_F(StationRegistryTest, TerminateDeletesEveryStationWhateverItsCountAndEmptiesTheRegistry) {
  const ImmutableString retained = MakeCounted();
  Registry::RetainStation(retained);
  const ImmutableString disposalPending = MakeCounted();
  Registry::RetainStation(disposalPending);
  Registry::DisposeStation(disposalPending);
  const ImmutableString unmade = RegisterCounted();
  const ImmutableString plain = MakeCounted();
  const std::set<int> expected = {Counted(retained)->Serial(), Counted(disposalPending)->Serial(),
                                  Counted(plain)->Serial()};

  Registry::Terminate();
  const std::vector<int> destroyed = StationLog::DestroyedSerials();
  EXPECT_EQ(std::set<int>(destroyed.begin(), destroyed.end()), expected);
  EXPECT_EQ(destroyed.size(), 3u);
  for (const Destruction& destruction : StationLog::DestroyedStations()) {
    EXPECT_EQ(destruction.mThread, std::this_thread::get_id());
  }
  for (const ImmutableString& id : {retained, disposalPending, unmade, plain}) {
    EXPECT_EQ(Registry::FindStation(id), nullptr);
  }
  EXPECT_EQ(StationLog::Factories(), 3) << "Terminate made the never-made station";

  // The registry is usable afterwards; old retains are forgotten.
  Registry::RegisterStation(retained, &CountingFactory);
  Tarn::Station* fresh = Registry::FindStation(retained);
  ASSERT_NE(fresh, nullptr);
  EXPECT_EQ(SerialOf(fresh), 4);
  Registry::DisposeStation(retained);
  EXPECT_EQ(StationLog::TimesDestroyed(4), 1);
}

TEST_F(StationRegistryTest, TerminateDeletesStationsInKeyOrder) {
  std::vector<ImmutableString> ids;
  for (int i = 0; i < 8; ++i) ids.push_back(MakeCounted());
  std::vector<ImmutableString> sorted = ids;
  std::sort(sorted.begin(), sorted.end());
  std::vector<int> expected;
  for (const ImmutableString& id : sorted) expected.push_back(Counted(id)->Serial());

  Registry::Terminate();
  EXPECT_EQ(StationLog::DestroyedSerials(), expected);
}

TEST_F(StationRegistryTest, TerminateDeletesStationsWithTheRegistryUnlocked) {
  const ImmutableString id = MakeCounted();
  const ImmutableString other = Registry::RegisterUniqueStation();
  std::thread prober;
  Latch gotThrough;
  bool reached = false;
  Counted(id)->OnDestroy([&] {
    // Another thread must be able to use the registry while Terminate deletes.
    prober = std::thread([&] {
      Registry::FindStation(other);
      gotThrough.CountDown();
    });
    reached = gotThrough.WaitFor(std::chrono::seconds(5));
  });

  Registry::Terminate();
  prober.join();
  EXPECT_TRUE(reached) << "Terminate held the registry's lock while deleting stations";
}

// ---------------------------------------------------------------------------
// Unique IDs

TEST_F(StationRegistryTest, UniqueStationIdsAreDistinctAndRegisterNothing) {
  constexpr int kCount = 500;
  std::vector<ImmutableString> ids;
  std::set<std::string> texts;
  for (int i = 0; i < kCount; ++i) {
    ids.push_back(Registry::UniqueStationID());
    EXPECT_FALSE(ids.back().empty());
    texts.insert(ids.back().c_str());
  }
  EXPECT_EQ(texts.size(), static_cast<std::size_t>(kCount));
  for (const ImmutableString& id : ids) EXPECT_EQ(Registry::FindStation(id), nullptr);
}

TEST_F(StationRegistryTest, RegisterUniqueStationMakesAPlainStationOnFind) {
  const ImmutableString id = Registry::RegisterUniqueStation();
  const ImmutableString other = Registry::RegisterUniqueStation();
  EXPECT_NE(id, other);

  Tarn::Station* station = Registry::FindStation(id);
  ASSERT_NE(station, nullptr);
  EXPECT_EQ(typeid(*station), typeid(Tarn::Station));
  EXPECT_EQ(station->GetStationID(), id);
  EXPECT_NE(Registry::FindStation(other), station);
}

// ---------------------------------------------------------------------------
// Threads meeting in the registry

// The last release of a station whose disposal is pending may come from a
// worker while the main thread delivers to that station as a listener. The
// station's destructor then waits for that delivery; the handler must still
// be able to use the registry meanwhile, or both threads wait for ever.
TEST_F(StationRegistryTest, WorkerReleaseDeletingAStationLeavesTheRegistryUsableToTheDeliveryItWaitsFor) {
  messaging_test::Watchdog watchdog;
  const ImmutableString id = RegisterCounted();
  const ImmutableString other = Registry::RegisterUniqueStation();
  CountedStation* station = dynamic_cast<CountedStation*>(Registry::RetainStation(id));
  ASSERT_NE(station, nullptr);
  Registry::DisposeStation(id);  // pending: the retain above stands

  Tarn::Broadcaster source;
  source.AddListener(static_cast<Tarn::Listener*>(station));
  Latch delivering;
  Latch deleting;
  bool handlerReachedRegistry = false;
  messaging_test::RecordingListener handler("handler");
  handler.SetAction([&](const Tarn::Message&) {
    delivering.CountDown();
    if (!deleting.WaitFor()) return;
    Registry::FindStation(other);
    handlerReachedRegistry = true;
  });
  station->AddListener(&handler);
  station->OnDestroy([&] { deleting.CountDown(); });

  std::thread::id releaser;
  messaging_test::ThreadGroup worker;
  worker.Start([&] {
    releaser = std::this_thread::get_id();
    if (delivering.WaitFor()) Registry::ReleaseStation(id);
  });
  source.BroadcastMessage(NumberMessage(1));
  worker.JoinAll();

  EXPECT_TRUE(handlerReachedRegistry);
  EXPECT_EQ(handler.Calls(), 1);
  const std::vector<Destruction> destroyed = StationLog::DestroyedStations();
  ASSERT_EQ(destroyed.size(), 1u);
  EXPECT_EQ(destroyed[0].mThread, releaser);
  EXPECT_FALSE(source.HasListeners());
  EXPECT_FALSE(handler.HasBroadcaster(station));
}

}  // namespace
