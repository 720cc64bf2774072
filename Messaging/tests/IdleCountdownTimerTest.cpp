// Tests of Tarn::IdleCountdownTimer: arming, the deadline on the millisecond
// clock (wrapping included), the one-shot firing and re-arming from a
// handler, nested idle broadcasts, lifetime of the timer and its station, and
// the timer's state after its firing fails.
//
// Time comes from a fake clock installed with TimeStamp::SetClockForTesting,
// so no test waits for real time to pass.
#include "TestSupport.h"

#include <TarnMessaging.h>

#include <TarnFoundation/TimeStamp.h>

#include <kivcore/SmallBlockAllocator.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <functional>
#include <future>
#include <memory>
#include <new>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

namespace {

using Tarn::IdleCountdownTimer;
using Tarn::StationUtils::AddListener;

constexpr double kStart = 1000.0;       // the fake clock's reading when a test begins
constexpr double kWrap = 4294967296.0;  // 2^32 milliseconds: where the timer's clock wraps

// Another message type, for checking that the timer reacts to idle messages
// only.
struct Nudge : Tarn::MessageImpl<Nudge> {};

// Records the cookie of every timer message it hears and the thread that
// delivered it; an optional action runs after each one is recorded.
class FiringRecorder : public Tarn::Listener {
public:
  void ListenToMessage(const Tarn::Message& inMessage) override {
    if (inMessage.GetMessageID() != Tarn::IdleCountdownTimerMessage::StaticMessageID()) {
      ++mOtherMessages;
      return;
    }
    mCookies.push_back(static_cast<const Tarn::IdleCountdownTimerMessage&>(inMessage).GetCookie());
    mThreads.push_back(std::this_thread::get_id());
    if (mOnFiring) mOnFiring();
  }
  std::size_t Firings() const { return mCookies.size(); }

  std::vector<std::uint32_t> mCookies;
  std::vector<std::thread::id> mThreads;
  int mOtherMessages = 0;
  std::function<void()> mOnFiring;
};

// Throws from its handler, as a listener whose save fails would.
class Thrower : public Tarn::Listener {
public:
  void ListenToMessage(const Tarn::Message&) override {
    ++mCalls;
    throw std::runtime_error("autosave failed");
  }
  int mCalls = 0;
};

class IdleCountdownTimerTest : public ::testing::Test {
protected:
  void SetUp() override {
    Tarn::Messaging::Initialize();
    Tarn::TimeStamp::SetClockForTesting([this] { return mNow.load(); });
  }

  void TearDown() override {
    kivcore::utility::SmallBlockAllocator::SetFailAfter(-1);
    Tarn::TimeStamp::SetClockForTesting(std::function<double()>());
    Tarn::Messaging::Terminate();
  }

  void SetNow(double inMilliSeconds) { mNow.store(inMilliSeconds); }

  // What the host's idle processing does.
  static void SendIdle() { Tarn::StationUtils::BroadcastMessage(Tarn::kStation_Idle, Tarn::ApplicationIdleMessage()); }

  // Whether the idle station holds the timer, asked of the station itself
  // and of the timer's own back-links; the two must agree.
  static bool IsAttachedToIdle(IdleCountdownTimer& inTimer) {
    Tarn::Station* idle = Tarn::StationRegistry::FindStation(Tarn::kStation_Idle);
    if (idle == nullptr) return false;
    const bool held = idle->HasListener(&inTimer);
    EXPECT_EQ(held, inTimer.HasBroadcaster(idle)) << "station and timer disagree about the attachment";
    return held;
  }

  std::atomic<double> mNow{kStart};  // read by every TimeStamp made during the test
};

// ---------------------------------------------------------------------------
// Arming and firing

TEST_F(IdleCountdownTimerTest, ANewTimerIsNotArmed) {
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);

  EXPECT_FALSE(IsAttachedToIdle(timer));
  SendIdle();
  SetNow(kStart + 1e6);
  SendIdle();
  // Handed an idle message directly, an unarmed timer still does nothing.
  timer.ListenToMessage(Tarn::ApplicationIdleMessage());

  EXPECT_EQ(recorder.Firings(), 0u);
  EXPECT_EQ(recorder.mOtherMessages, 0);
}

TEST_F(IdleCountdownTimerTest, ZeroDurationFiresAtTheFirstIdleMessage) {
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);
  timer.SetCookie(5);
  timer.ArmTimer();

  SendIdle();

  EXPECT_EQ(recorder.mCookies, std::vector<std::uint32_t>{5});
}

TEST_F(IdleCountdownTimerTest, FiresOnceAtTheDeadlineAndNotBefore) {
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);
  timer.SetDuration(100);
  timer.SetCookie(7);
  timer.ArmTimer();

  for (double now : {kStart, kStart + 50, kStart + 99.999}) {
    SetNow(now);
    SendIdle();
  }
  ASSERT_EQ(recorder.Firings(), 0u) << "fired before its deadline";

  SetNow(kStart + 100);
  SendIdle();
  SendIdle();
  SetNow(kStart + 5000);
  SendIdle();

  EXPECT_EQ(recorder.mCookies, std::vector<std::uint32_t>{7});
}

TEST_F(IdleCountdownTimerTest, AfterFiringItIgnoresIdleMessagesUntilArmedAgain) {
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);
  timer.SetDuration(10);
  timer.ArmTimer();
  SetNow(kStart + 10);
  SendIdle();
  ASSERT_EQ(recorder.Firings(), 1u);

  EXPECT_FALSE(IsAttachedToIdle(timer));
  SetNow(kStart + 1000);
  SendIdle();
  timer.ListenToMessage(Tarn::ApplicationIdleMessage());
  EXPECT_EQ(recorder.Firings(), 1u);

  timer.ArmTimer();
  EXPECT_TRUE(IsAttachedToIdle(timer));
  SetNow(kStart + 1010);
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 2u);
}

TEST_F(IdleCountdownTimerTest, ArmingAnArmedTimerMovesTheDeadlineAndAttachesOnce) {
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);
  timer.SetDuration(100);
  timer.ArmTimer();
  SetNow(kStart + 50);
  timer.ArmTimer();

  SetNow(kStart + 100);  // the first deadline
  SendIdle();
  ASSERT_EQ(recorder.Firings(), 0u);

  SetNow(kStart + 150);
  SendIdle();
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 1u);
  // A second registration would survive the one removal made at firing.
  EXPECT_FALSE(IsAttachedToIdle(timer));
}

TEST_F(IdleCountdownTimerTest, SetDurationAfterArmingKeepsTheCurrentDeadline) {
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);
  timer.SetDuration(100);
  timer.ArmTimer();

  timer.SetDuration(10);
  SetNow(kStart + 10);
  SendIdle();
  ASSERT_EQ(recorder.Firings(), 0u) << "a shorter duration moved the running deadline";

  timer.SetDuration(1000);
  SetNow(kStart + 100);
  SendIdle();
  ASSERT_EQ(recorder.Firings(), 1u) << "a longer duration moved the running deadline";

  // The next arming counts with the new duration.
  timer.ArmTimer();
  SetNow(kStart + 1099);
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 1u);
  SetNow(kStart + 1100);
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 2u);
}

TEST_F(IdleCountdownTimerTest, TheCookieCurrentAtFiringIsSent) {
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);
  timer.SetCookie(1);
  timer.ArmTimer();
  timer.SetCookie(2);

  SendIdle();

  EXPECT_EQ(recorder.mCookies, std::vector<std::uint32_t>{2});
}

TEST_F(IdleCountdownTimerTest, MessagesOfOtherTypesAreIgnoredArmedOrNot) {
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);
  timer.ListenToMessage(Nudge());

  timer.ArmTimer();
  Tarn::StationUtils::BroadcastMessage(Tarn::kStation_Idle, Nudge());
  timer.ListenToMessage(Nudge());
  ASSERT_EQ(recorder.Firings(), 0u);
  EXPECT_TRUE(IsAttachedToIdle(timer)) << "a message of another type disarmed the timer";

  SendIdle();
  EXPECT_EQ(recorder.Firings(), 1u);
  EXPECT_EQ(recorder.mOtherMessages, 0);
}

TEST_F(IdleCountdownTimerTest, EachTimerFiresOnItsOwnStation) {
  FiringRecorder early;
  FiringRecorder late;
  IdleCountdownTimer earlyTimer;
  IdleCountdownTimer lateTimer;
  ASSERT_NE(earlyTimer.GetStationID(), lateTimer.GetStationID());
  AddListener(earlyTimer.GetStationID(), &early);
  AddListener(lateTimer.GetStationID(), &late);
  lateTimer.SetDuration(100);
  earlyTimer.ArmTimer();
  lateTimer.ArmTimer();

  SendIdle();

  EXPECT_EQ(early.Firings(), 1u);
  EXPECT_EQ(late.Firings(), 0u);
  EXPECT_TRUE(IsAttachedToIdle(lateTimer));
}

// ---------------------------------------------------------------------------
// Re-entrancy: handlers of the timer's message, and the idle broadcast that
// the timer leaves while it is being delivered

TEST_F(IdleCountdownTimerTest, AHandlerThatRearmsStartsTheCountdownFromThatMoment) {
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);
  recorder.mOnFiring = [&] {
    if (recorder.Firings() != 1) return;
    SetNow(kStart + 130);  // the handler takes its time before re-arming
    timer.ArmTimer();
  };
  timer.SetDuration(100);
  timer.ArmTimer();

  SetNow(kStart + 100);
  SendIdle();
  ASSERT_EQ(recorder.Firings(), 1u);
  EXPECT_TRUE(IsAttachedToIdle(timer));

  SetNow(kStart + 229);
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 1u) << "the new countdown started before the handler re-armed";
  SetNow(kStart + 230);
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 2u);
}

TEST_F(IdleCountdownTimerTest, RearmingWithZeroDurationFromTheHandlerWaitsForTheNextIdleMessage) {
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);
  recorder.mOnFiring = [&] { timer.ArmTimer(); };
  timer.ArmTimer();

  // The re-attached timer is a newcomer to the idle broadcast in progress,
  // which does not serve it again.
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 1u);
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 2u);
  EXPECT_TRUE(IsAttachedToIdle(timer));
}

TEST_F(IdleCountdownTimerTest, AnIdleMessageBroadcastFromTheHandlerDoesNotFireTheTimerInsideItsOwnFiring) {
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);
  int depth = 0;
  int deepest = 0;
  recorder.mOnFiring = [&] {
    ++depth;
    deepest = std::max(deepest, depth);
    if (recorder.Firings() == 1) {
      // Re-armed and due at once, then an idle message reaches it while its
      // own message is still being broadcast.
      timer.ArmTimer();
      SendIdle();
    }
    --depth;
  };
  timer.ArmTimer();

  SendIdle();
  EXPECT_EQ(recorder.Firings(), 1u);
  EXPECT_EQ(deepest, 1) << "the timer fired inside its own firing";
  EXPECT_TRUE(IsAttachedToIdle(timer)) << "the nested idle message disarmed the timer";

  SendIdle();
  EXPECT_EQ(recorder.Firings(), 2u);
}

TEST_F(IdleCountdownTimerTest, SeveralDueTimersAllFireAtOneIdleMessage) {
  // Each timer leaves the idle station while the broadcast stands on it; the
  // broadcast must still reach the others.
  constexpr int kTimers = 4;
  std::vector<std::unique_ptr<FiringRecorder>> recorders;
  std::vector<std::unique_ptr<IdleCountdownTimer>> timers;
  for (int i = 0; i < kTimers; ++i) {
    recorders.push_back(std::make_unique<FiringRecorder>());
    timers.push_back(std::make_unique<IdleCountdownTimer>());
    timers.back()->SetCookie(static_cast<unsigned int>(i));
    AddListener(timers.back()->GetStationID(), recorders.back().get());
    timers.back()->ArmTimer();
  }

  SendIdle();

  for (int i = 0; i < kTimers; ++i) {
    EXPECT_EQ(recorders[i]->mCookies, std::vector<std::uint32_t>{static_cast<std::uint32_t>(i)}) << "timer " << i;
    EXPECT_FALSE(IsAttachedToIdle(*timers[i])) << "timer " << i;
  }
  EXPECT_FALSE(Tarn::StationUtils::HasListeners(Tarn::kStation_Idle));
}

TEST_F(IdleCountdownTimerTest, AHandlerThatDestroysAnotherDueTimerStopsItFiring) {
  FiringRecorder first;
  FiringRecorder second;
  auto firstTimer = std::make_unique<IdleCountdownTimer>();
  auto secondTimer = std::make_unique<IdleCountdownTimer>();
  AddListener(firstTimer->GetStationID(), &first);
  AddListener(secondTimer->GetStationID(), &second);
  // Whichever fires first destroys the other, whatever order the idle
  // station serves them in.
  first.mOnFiring = [&] { secondTimer.reset(); };
  second.mOnFiring = [&] { firstTimer.reset(); };
  firstTimer->ArmTimer();
  secondTimer->ArmTimer();

  SendIdle();

  EXPECT_EQ(first.Firings() + second.Firings(), 1u);
  EXPECT_EQ((firstTimer != nullptr) + (secondTimer != nullptr), 1);
  EXPECT_FALSE(Tarn::StationUtils::HasListeners(Tarn::kStation_Idle));
  SendIdle();
  EXPECT_EQ(first.Firings() + second.Firings(), 1u);
}

// ---------------------------------------------------------------------------
// Lifetime of the timer and its station

TEST_F(IdleCountdownTimerTest, DestroyingAnArmedTimerDetachesItAndDisposesItsStation) {
  FiringRecorder recorder;
  auto timer = std::make_unique<IdleCountdownTimer>();
  const kivcore::utility::ImmutableString stationID = timer->GetStationID();
  AddListener(stationID, &recorder);
  timer->ArmTimer();
  ASSERT_NE(Tarn::StationRegistry::FindStation(stationID), nullptr);
  ASSERT_TRUE(IsAttachedToIdle(*timer));

  timer.reset();

  EXPECT_EQ(Tarn::StationRegistry::FindStation(stationID), nullptr);
  EXPECT_FALSE(Tarn::StationUtils::HasListeners(Tarn::kStation_Idle));
  // An entry left behind would now point at a destroyed timer.
  SetNow(kStart + 1e6);
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 0u);
}

TEST_F(IdleCountdownTimerTest, DestroyingAnUnarmedTimerDisposesItsStation) {
  auto timer = std::make_unique<IdleCountdownTimer>();
  const kivcore::utility::ImmutableString stationID = timer->GetStationID();
  ASSERT_NE(Tarn::StationRegistry::FindStation(stationID), nullptr);

  timer.reset();

  EXPECT_EQ(Tarn::StationRegistry::FindStation(stationID), nullptr);
}

TEST_F(IdleCountdownTimerTest, ArmingBeforeInitializationAttachesNothingUntilArmedAgain) {
  FiringRecorder recorder;
  Tarn::Messaging::Terminate();  // undoes SetUp's initialization; the test initializes again below
  auto timer = std::make_unique<IdleCountdownTimer>();
  AddListener(timer->GetStationID(), &recorder);
  timer->ArmTimer();  // the idle station is not registered yet
  Tarn::Messaging::Initialize();

  EXPECT_FALSE(IsAttachedToIdle(*timer));
  SetNow(kStart + 1e6);
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 0u);

  // Arming once the library is up attaches the timer after all: the early
  // attempt must not have left it marked as listening.
  timer->ArmTimer();
  EXPECT_TRUE(IsAttachedToIdle(*timer));
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 1u);
  timer.reset();
}

// ---------------------------------------------------------------------------
// The 32-bit millisecond clock wraps every 2^32 ms; deadlines are compared as
// serial numbers, so the wrap neither fires a timer early nor stalls it.

TEST_F(IdleCountdownTimerTest, ADeadlinePastTheWrapIsNotReachedBeforeItsTime) {
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);
  timer.SetDuration(100);
  SetNow(kWrap - 10);
  timer.ArmTimer();  // the deadline wraps to 90

  SendIdle();
  SetNow(kWrap + 89);
  SendIdle();
  ASSERT_EQ(recorder.Firings(), 0u);

  SetNow(kWrap + 90);
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 1u);
}

TEST_F(IdleCountdownTimerTest, AClockThatWrapsAfterArmingFiresOnTime) {
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);
  timer.SetDuration(20);
  SetNow(kWrap - 50);
  timer.ArmTimer();  // the deadline is 2^32 - 30, before the wrap

  SetNow(kWrap - 31);
  SendIdle();
  ASSERT_EQ(recorder.Firings(), 0u);

  SetNow(kWrap + 5);  // the low 32 bits now read 5, 35 ms past the deadline
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 1u);
}

// ---------------------------------------------------------------------------
// Failures during the firing

TEST_F(IdleCountdownTimerTest, AListenerThatThrowsDoesNotStopTheTimerFiringAgain) {
  messaging_test::ExceptionRecorder exceptions;
  FiringRecorder recorder;
  Thrower thrower;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);
  AddListener(timer.GetStationID(), &thrower);
  timer.ArmTimer();

  SendIdle();
  ASSERT_EQ(thrower.mCalls, 1);
  EXPECT_EQ(exceptions.Messages(), std::vector<std::string>{"autosave failed"});
  EXPECT_FALSE(IsAttachedToIdle(timer));

  timer.ArmTimer();
  SendIdle();
  EXPECT_EQ(thrower.mCalls, 2);
  EXPECT_EQ(recorder.Firings(), 2u);
  EXPECT_EQ(exceptions.Count(), 2u);
}

TEST_F(IdleCountdownTimerTest, AFiringWhoseBroadcastThrowsLeavesTheTimerAbleToFireAgain) {
  messaging_test::ExceptionRecorder exceptions;
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  timer.SetDuration(100);
  timer.ArmTimer();
  SendIdle();  // before the deadline
  ASSERT_EQ(recorder.Firings(), 0u);

  SetNow(kStart + 100);
  {
    // The timer's station has never been made: making it needs a block, and
    // with none to be had the broadcast throws out of the timer's handler.
    messaging_test::SmallBlockFailureGuard noStorage(0);
    SendIdle();
  }
  ASSERT_EQ(exceptions.Messages(), std::vector<std::string>{std::bad_alloc().what()})
      << "the firing's broadcast did not fail as the test intends";
  EXPECT_FALSE(IsAttachedToIdle(timer));
  AddListener(timer.GetStationID(), &recorder);

  timer.ArmTimer();
  SetNow(kStart + 200);
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 1u) << "the timer stayed marked as firing after its broadcast threw";
}

// ---------------------------------------------------------------------------
// Threads

TEST_F(IdleCountdownTimerTest, IdleMessagesFromAWorkerReachTheTimerOnlyThroughTheMainThread) {
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);
  timer.ArmTimer();

  auto worker = std::async(std::launch::async, [] {
    // Broadcasts deliver only on the main thread; a post reaches it later.
    SendIdle();
    Tarn::StationUtils::PostMessageToUIThread(Tarn::kStation_Idle, Tarn::ApplicationIdleMessage(), false);
  });
  ASSERT_EQ(worker.wait_for(messaging_test::kDeadline), std::future_status::ready);
  worker.get();
  ASSERT_EQ(recorder.Firings(), 0u);

  Tarn::StationUtils::FlushPostedMessagesOnUIThread();

  EXPECT_EQ(recorder.Firings(), 1u);
  EXPECT_EQ(recorder.mThreads, std::vector<std::thread::id>{std::this_thread::get_id()});
}

}  // namespace
