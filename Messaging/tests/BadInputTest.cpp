// Every precondition of the listener registry and the station utilities,
// given a null, expired or never-set argument, with the contract report
// both returning (a host whose error handler only records) and throwing (the
// default handler). Either way the library must stay consistent: good
// listeners are served exactly as before, bad arguments leave no callable
// trace, retains taken for the call are released, a broadcast in progress
// goes on, no remover is left waiting, and every small block comes back.
#include "StationTestSupport.h"

#include <TarnMessaging.h>

#include <kivcore/kivcore.h>

#include <boost/make_shared.hpp>

#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace {

using namespace station_test;
using kivcore::utility::SmallBlockAllocator;
using messaging_test::ContractDialogRecorder;
using messaging_test::DefaultErrorHandlerGuard;
using messaging_test::ErrorRecorder;
using messaging_test::ExceptionRecorder;
using messaging_test::PingMessage;
using messaging_test::RecordingListener;
using messaging_test::WaitUntil;
namespace Registry = Tarn::StationRegistry;
namespace Utils = Tarn::StationUtils;

enum class Reporting { kReturns, kThrows };

std::size_t BlocksInUse() { return SmallBlockAllocator::GetStatistics().blocksInUse; }

// A counted listener that offers ISafeListener but no weak reference: it
// cannot be held safely, so a broadcaster must refuse it.
class NoWeakReference final : public Tarn::ISafeListener {
public:
  std::int32_t AddRef() override { return ++mCount; }
  std::int32_t Release() override {
    const std::int32_t count = --mCount;
    if (count == 0) delete this;
    return count;
  }
  std::int32_t QueryInterface(const Tarn::IID& inIID, void** outInterface) override {
    if (inIID == Tarn::IID_ISafeListener) {
      *outInterface = static_cast<Tarn::ISafeListener*>(this);
      return Tarn::kInterfaceOK;
    }
    *outInterface = nullptr;
    return Tarn::kNoInterface;
  }
  void ListenToMessage(const Tarn::Message&) override { sCalls.fetch_add(1); }
  static inline std::atomic<int> sCalls{0};
  static inline std::atomic<int> sLive{0};
  NoWeakReference() { sLive.fetch_add(1); }

private:
  ~NoWeakReference() { sLive.fetch_sub(1); }

  std::atomic<std::int32_t> mCount{0};
};

// Weak pointers to a listener that is already gone.
struct ExpiredListeners {
  ExpiredListeners() {
    auto boostOwner = boost::make_shared<RecordingListener>("gone");
    auto stdOwner = std::make_shared<RecordingListener>("gone");
    mBoost = boostOwner;
    mStd = stdOwner;
  }
  boost::weak_ptr<Tarn::Listener> mBoost;
  std::weak_ptr<Tarn::Listener> mStd;
};

class BadInputTest : public RegistryTest, public ::testing::WithParamInterface<Reporting> {
protected:
  void SetUp() override {
    RegistryTest::SetUp();
    if (Returns()) mErrors.emplace();
    else mDefaultHandler.emplace();
    mBaseline = BlocksInUse();
    mSafeLiveBefore = messaging_test::CountedSafeListener::LiveCount();
  }
  void TearDown() override {
    mErrors.reset();
    mDefaultHandler.reset();
    RegistryTest::TearDown();
    EXPECT_EQ(BlocksInUse(), mBaseline) << "small blocks leaked";
    EXPECT_EQ(messaging_test::CountedSafeListener::LiveCount(), mSafeLiveBefore);
    EXPECT_EQ(NoWeakReference::sLive.load(), 0);
  }

  bool Returns() const { return GetParam() == Reporting::kReturns; }

  // Runs a misuse: with a returning report it must return, with a throwing
  // one it must throw the core library's error. Returns how many violations
  // it reported.
  template <class Operation>
  std::size_t Misuse(Operation inOperation) {
    const std::size_t before = mDialog.Count();
    if (Returns()) {
      EXPECT_NO_THROW(inOperation());
    } else {
      EXPECT_THROW(inOperation(), kivcore::config::Error);
    }
    return mDialog.Count() - before;
  }

  // After a throwing report, the operation stopped at its first check.
  std::size_t Reports(std::size_t inWhenReturning) const { return Returns() ? inWhenReturning : 1; }

  ContractDialogRecorder mDialog{false};
  std::optional<ErrorRecorder> mErrors;
  std::optional<DefaultErrorHandlerGuard> mDefaultHandler;
  std::size_t mBaseline = 0;
  int mSafeLiveBefore = 0;
};

INSTANTIATE_TEST_SUITE_P(BothReportings, BadInputTest, ::testing::Values(Reporting::kReturns, Reporting::kThrows),
                         [](const ::testing::TestParamInfo<Reporting>& inInfo) {
                           return inInfo.param == Reporting::kReturns ? std::string("ReportReturns")
                                                                      : std::string("ReportThrows");
                         });

// ---------------------------------------------------------------------------
// The broadcaster

TEST_P(BadInputTest, BadAddsLeaveOnlyTheGoodListenersServed) {
  Tarn::Broadcaster broadcaster;
  RecordingListener good("good");
  broadcaster.AddListener(&good);
  const ExpiredListeners expired;
  const int deafCallsBefore = NoWeakReference::sCalls.load();
  {
    Tarn::ISafeListenerRef deaf(new NoWeakReference);
    EXPECT_EQ(Misuse([&] { broadcaster.AddListener(static_cast<Tarn::Listener*>(nullptr)); }), 1u);
    EXPECT_EQ(Misuse([&] { broadcaster.AddListener(Tarn::ISafeListenerRef()); }), Returns() ? 2u : 1u);  // both checks run
    EXPECT_EQ(Misuse([&] { broadcaster.AddListener(deaf); }), 1u);
    EXPECT_EQ(Misuse([&] { broadcaster.AddListener(expired.mBoost); }), 1u);
    EXPECT_EQ(Misuse([&] { broadcaster.AddListener(expired.mStd); }), 1u);
    EXPECT_EQ(Misuse([&] { broadcaster.AddListener(boost::weak_ptr<Tarn::Listener>()); }), 1u);
    EXPECT_EQ(Misuse([&] { broadcaster.AddListener(std::weak_ptr<Tarn::Listener>()); }), 1u);
    broadcaster.BroadcastMessage(PingMessage());
  }
  EXPECT_EQ(good.Calls(), 1) << "the good listener was not served exactly once";
  EXPECT_EQ(NoWeakReference::sCalls.load(), deafCallsBefore) << "a listener without weak reference was called";
  // Whatever the bad adds left was pruned by the broadcast: only the good
  // listener remains.
  broadcaster.RemoveListener(&good, true);
  EXPECT_FALSE(broadcaster.HasListeners()) << "a bad add left a registration that a broadcast does not prune";
  EXPECT_FALSE(good.HasBroadcaster(&broadcaster));
}

TEST_P(BadInputTest, BadRemovesLeaveTheRegistryConsistent) {
  Tarn::Broadcaster broadcaster;
  RecordingListener good("good");
  broadcaster.AddListener(&good);
  auto boostOwner = boost::make_shared<RecordingListener>("boost");
  auto stdOwner = std::make_shared<RecordingListener>("std");
  const boost::weak_ptr<Tarn::Listener> boostWeak(boostOwner);
  const std::weak_ptr<Tarn::Listener> stdWeak(stdOwner);
  broadcaster.AddListener(boostWeak);
  broadcaster.AddListener(stdWeak);
  boostOwner.reset();
  stdOwner.reset();

  EXPECT_EQ(Misuse([&] { broadcaster.RemoveListener(static_cast<Tarn::Listener*>(nullptr), true); }), 1u);
  EXPECT_EQ(Misuse([&] { broadcaster.RemoveListener(static_cast<Tarn::Listener*>(nullptr), false); }), 1u);
  EXPECT_EQ(Misuse([&] { broadcaster.RemoveListener(Tarn::ISafeListenerRef()); }), 1u);
  // An expired weak pointer still names its registration: a returning
  // report lets the removal take it out.
  EXPECT_EQ(Misuse([&] { broadcaster.RemoveListener(boostWeak); }), 1u);
  EXPECT_EQ(Misuse([&] { broadcaster.RemoveListener(stdWeak); }), 1u);
  EXPECT_EQ(Misuse([&] { broadcaster.RemoveListener(boost::weak_ptr<Tarn::Listener>()); }), 1u);

  EXPECT_TRUE(broadcaster.HasListener(&good)) << "a bad removal took out a good listener";
  broadcaster.BroadcastMessage(PingMessage());
  EXPECT_EQ(good.Calls(), 1);
  broadcaster.RemoveListener(&good, true);
  EXPECT_FALSE(broadcaster.HasListeners()) << "dead registrations survived a broadcast";
}

TEST_P(BadInputTest, HasListenerOfNullFindsNothing) {
  Tarn::Broadcaster broadcaster;
  RecordingListener good("good");
  broadcaster.AddListener(&good);
  bool found = true;
  EXPECT_EQ(Misuse([&] { found = broadcaster.HasListener(nullptr); }), 1u);
  if (Returns()) {
    EXPECT_FALSE(found) << "HasListener(nullptr) found a registration";
  }
  EXPECT_TRUE(broadcaster.HasListener(&good));
  broadcaster.RemoveListener(&good, true);
}

// Bad calls made by a handler during a broadcast: a throwing report leaves
// the handler and is met by the error manager; the broadcast serves every
// listener once and leaves no cursor behind, so a worker's removal
// afterwards does not wait.
TEST_P(BadInputTest, BadCallsFromAHandlerLeaveTheBroadcastGoing) {
  ExceptionRecorder exceptions;
  Tarn::Broadcaster broadcaster;
  const ExpiredListeners expired;
  RecordingListener before("before");
  RecordingListener misuser("misuser");
  RecordingListener after("after");
  int depth = 0;
  misuser.SetAction([&](const Tarn::Message&) {
    broadcaster.RemoveListener(expired.mStd);
    broadcaster.AddListener(static_cast<Tarn::Listener*>(nullptr));
    // Nested once, reached only when reports return.
    if (depth++ == 0) broadcaster.BroadcastMessage(PingMessage());
  });
  broadcaster.AddListener(&after);
  broadcaster.AddListener(&misuser);
  broadcaster.AddListener(&before);
  broadcaster.BroadcastMessage(PingMessage());

  // Served: "before", "misuser", then (reports returning) the nested
  // broadcast serves all three, then the outer one serves "after".
  const int nested = Returns() ? 1 : 0;
  EXPECT_EQ(before.Calls(), 1 + nested);
  EXPECT_EQ(after.Calls(), 1 + nested);
  EXPECT_EQ(misuser.Calls(), 1 + nested);
  EXPECT_EQ(exceptions.Count(), Returns() ? 0u : 1u);
  EXPECT_EQ(mDialog.Count(), Returns() ? 4u : 1u);

  misuser.SetAction(nullptr);
  messaging_test::Watchdog watchdog;
  RunOnWorker([&] {
    broadcaster.RemoveListener(&before, true);
    broadcaster.RemoveListener(&misuser, true);
    broadcaster.RemoveListener(&after, true);
  });
  EXPECT_FALSE(broadcaster.HasListeners());
}

// ---------------------------------------------------------------------------
// The station utilities

// Each bad removal is reported by the utilities and (reports returning) by
// the station's broadcaster too; either way the call's retain is released,
// so a disposal afterwards deletes the station at once.
TEST_P(BadInputTest, StationUtilsBadRemovalsReleaseTheirRetain) {
  const ImmutableString id = MakeCounted();
  RecordingListener good("good");
  Utils::AddListener(id, &good);
  const ExpiredListeners expired;
  const ImmutableString unregistered = Registry::UniqueStationID();

  EXPECT_EQ(Misuse([&] { Utils::RemoveListener(id, static_cast<Tarn::Listener*>(nullptr)); }), Reports(2));
  EXPECT_EQ(Misuse([&] { Utils::RemoveListener(id, Tarn::ISafeListenerRef()); }), Reports(2));
  EXPECT_EQ(Misuse([&] { Utils::RemoveListener(id, expired.mBoost); }), Reports(2));
  EXPECT_EQ(Misuse([&] { Utils::RemoveListener(id, expired.mStd); }), Reports(2));
  // An unregistered ID: reported before any lookup, and nothing else.
  EXPECT_EQ(Misuse([&] { Utils::RemoveListener(unregistered, static_cast<Tarn::Listener*>(nullptr)); }), 1u);
  EXPECT_EQ(Misuse([&] { Utils::RemoveListener(unregistered, Tarn::ISafeListenerRef()); }), 1u);
  EXPECT_EQ(Misuse([&] { Utils::RemoveListener(unregistered, expired.mBoost); }), 1u);
  EXPECT_EQ(Misuse([&] { Utils::RemoveListener(unregistered, expired.mStd); }), 1u);
  EXPECT_EQ(Registry::FindStation(unregistered), nullptr) << "a bad removal registered its station ID";

  Utils::BroadcastMessage(id, PingMessage());
  EXPECT_EQ(good.Calls(), 1);
  Tarn::Station* station = Registry::FindStation(id);
  const int serial = SerialOf(station);
  Registry::DisposeStation(id);
  EXPECT_EQ(StationLog::TimesDestroyed(serial), 1) << "a bad call kept its retain on the station";
  EXPECT_FALSE(good.HasBroadcaster(station));
}

TEST_P(BadInputTest, StationUtilsAddListenerWithBadArgumentsReleasesItsRetain) {
  const ImmutableString id = RegisterCounted();
  const ExpiredListeners expired;
  EXPECT_EQ(Misuse([&] { Utils::AddListener(id, static_cast<Tarn::Listener*>(nullptr)); }), 1u);
  EXPECT_EQ(Misuse([&] { Utils::AddListener(id, Tarn::ISafeListenerRef()); }), Returns() ? 2u : 1u);  // both checks run
  EXPECT_EQ(Misuse([&] { Utils::AddListener(id, expired.mBoost); }), 1u);
  EXPECT_EQ(Misuse([&] { Utils::AddListener(id, expired.mStd); }), 1u);
  Utils::BroadcastMessage(id, PingMessage());
  EXPECT_FALSE(Utils::HasListeners(id)) << "a bad add left a registration a broadcast does not prune";
  const int serial = SerialOf(Registry::FindStation(id));
  ASSERT_NE(serial, 0);
  Registry::DisposeStation(id);
  EXPECT_EQ(StationLog::TimesDestroyed(serial), 1) << "a bad call kept its retain on the station";
}

// With an empty station ID on one side the move goes on as far as it can
// when reports return; a throwing report stops it before anything moves. A
// null listener moves nothing.
TEST_P(BadInputTest, SwitchStationWithBadArgumentsMovesOnlyWhatItCan) {
  const ImmutableString from = MakeCounted();
  const ImmutableString to = MakeCounted();
  RecordingListener listener("moved");
  Utils::AddListener(from, &listener);
  Tarn::Station* fromStation = Registry::FindStation(from);
  Tarn::Station* toStation = Registry::FindStation(to);

  EXPECT_EQ(Misuse([&] { Utils::SwitchStation(from, to, nullptr); }), 1u);
  EXPECT_TRUE(fromStation->HasListener(&listener));
  EXPECT_FALSE(toStation->HasListener(&listener));

  EXPECT_EQ(Misuse([&] { Utils::SwitchStation(Tarn::kNoStation, Tarn::kNoStation, nullptr); }), Reports(3));

  // From nowhere: the listener is only added to the target.
  EXPECT_EQ(Misuse([&] { Utils::SwitchStation(Tarn::kNoStation, to, &listener); }), 1u);
  EXPECT_TRUE(fromStation->HasListener(&listener));
  EXPECT_EQ(toStation->HasListener(&listener), Returns());

  // To nowhere: the listener only leaves its source.
  EXPECT_EQ(Misuse([&] { Utils::SwitchStation(from, Tarn::kNoStation, &listener); }), 1u);
  EXPECT_EQ(fromStation->HasListener(&listener), !Returns());
  EXPECT_EQ(listener.HasBroadcaster(fromStation), !Returns()) << "back-link and registration disagree";
  EXPECT_EQ(listener.HasBroadcaster(toStation), Returns()) << "back-link and registration disagree";

  // Every call released its retains: both stations go at once.
  const int fromSerial = SerialOf(fromStation);
  const int toSerial = SerialOf(toStation);
  Registry::DisposeStation(from);
  Registry::DisposeStation(to);
  EXPECT_EQ(StationLog::TimesDestroyed(fromSerial), 1);
  EXPECT_EQ(StationLog::TimesDestroyed(toSerial), 1);
  EXPECT_FALSE(listener.HasBroadcaster(fromStation));
  EXPECT_FALSE(listener.HasBroadcaster(toStation));
}

// ---------------------------------------------------------------------------
// A second removal of a registration whose first removal still waits

// A worker removes a listener while its handler runs and waits; the handler
// adds the listener again; a second worker removes it again. That second
// removal is a misuse (an equal removal is still waiting): it is reported,
// and neither remover may be left waiting once the handler has returned.
TEST_P(BadInputTest, SecondRemovalWhileTheFirstWaitsIsReportedAndNobodyHangs) {
  messaging_test::Watchdog watchdog;
  Tarn::Broadcaster broadcaster;
  auto owner = std::make_shared<RecordingListener>("held");
  const std::weak_ptr<Tarn::Listener> weak(owner);
  Latch entered;
  Latch readded;
  std::atomic<bool> secondDone{false};
  bool firstCall = true;
  owner->SetAction([&](const Tarn::Message&) {
    if (!firstCall) return;
    firstCall = false;
    entered.CountDown();
    EXPECT_TRUE(WaitUntil([&] { return !broadcaster.HasListeners(); })) << "the first removal never took the entry out";
    broadcaster.AddListener(weak);
    readded.CountDown();
    // The second remover has reported (and, reports returning, now waits
    // for this handler too).
    EXPECT_TRUE(mDialog.WaitForCount(1)) << "the second removal was not reported";
    EXPECT_TRUE(WaitUntil([&] { return secondDone.load() || Returns(); }));
  });
  broadcaster.AddListener(weak);

  messaging_test::ThreadGroup workers;
  workers.Start([&] {
    EXPECT_TRUE(entered.WaitFor());
    broadcaster.RemoveListener(weak);
  });
  workers.Start([&] {
    EXPECT_TRUE(readded.WaitFor());
    EXPECT_EQ(Misuse([&] { broadcaster.RemoveListener(weak); }), 1u);
    secondDone.store(true);
  });
  broadcaster.BroadcastMessage(PingMessage());
  workers.JoinAll();

  EXPECT_EQ(owner->Calls(), 1);
  // A returning report let the second removal take the new registration
  // out; a throwing one left it.
  EXPECT_EQ(broadcaster.HasListeners(), !Returns());
  broadcaster.BroadcastMessage(PingMessage());
  EXPECT_EQ(owner->Calls(), Returns() ? 1 : 2);
  broadcaster.RemoveListener(weak);
  EXPECT_FALSE(broadcaster.HasListeners());
}

}  // namespace
