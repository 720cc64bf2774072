// Tarn::IdleCountdownTimer: the deadline on the millisecond clock for every
// duration, the one-shot firing with re-entrant handlers, the timer across a
// library restart, and the lifetime of the timer and its station. Time comes
// from a fake clock (TimeStamp::SetClockForTesting); no test waits.
#include "TestSupport.h"

#include <TarnMessaging.h>

#include <TarnFoundation/TimeStamp.h>

#include <gtest/gtest.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <stdexcept>
#include <vector>

namespace {

using Tarn::IdleCountdownTimer;
using Tarn::StationUtils::AddListener;

constexpr double kStart = 1000.0;
constexpr double kWrap = 4294967296.0;  // 2^32 ms, where a 32-bit millisecond count wraps

// Records the cookie of every timer message; an optional action follows.
class FiringRecorder : public Tarn::Listener {
public:
  void ListenToMessage(const Tarn::Message& inMessage) override {
    const auto* firing = inMessage.As<Tarn::IdleCountdownTimerMessage>();
    ASSERT_NE(firing, nullptr) << "a timer's station carried another message";
    mCookies.push_back(firing->GetCookie());
    if (mOnFiring) mOnFiring();
  }
  std::size_t Firings() const { return mCookies.size(); }

  std::vector<std::uint32_t> mCookies;
  std::function<void()> mOnFiring;
};

class IdleCountdownTimerTest : public ::testing::Test {
protected:
  void SetUp() override {
    Tarn::Messaging::Initialize();
    Tarn::TimeStamp::SetClockForTesting([this] { return mNow; });
  }
  void TearDown() override {
    Tarn::TimeStamp::SetClockForTesting(std::function<double()>());
    Tarn::Messaging::Terminate();
  }

  static void SendIdle() { Tarn::StationUtils::BroadcastMessage(Tarn::kStation_Idle, Tarn::ApplicationIdleMessage()); }
  static bool IsAttachedToIdle(IdleCountdownTimer& inTimer) {
    Tarn::Station* idle = Tarn::StationRegistry::FindStation(Tarn::kStation_Idle);
    return idle != nullptr && idle->HasListener(&inTimer) && inTimer.HasBroadcaster(idle);
  }

  double mNow = kStart;
};

TEST_F(IdleCountdownTimerTest, ArmedTimerFiresOnceAtTheFirstIdleMessageFromItsDeadlineWithTheCookieOfThatMoment) {
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);
  SendIdle();  // not armed
  timer.SetDuration(100);
  timer.ArmTimer();
  mNow = kStart + 50;
  timer.ArmTimer();       // restarts from now, attached once
  timer.SetDuration(10);  // only for the next arming
  timer.SetCookie(7);
  mNow = kStart + 149;
  SendIdle();
  Tarn::StationUtils::BroadcastMessage(Tarn::kStation_Idle, messaging_test::PingMessage());
  EXPECT_EQ(recorder.Firings(), 0u);
  mNow = kStart + 150;
  SendIdle();
  SendIdle();
  EXPECT_EQ(recorder.mCookies, std::vector<std::uint32_t>{7});
  EXPECT_FALSE(IsAttachedToIdle(timer));
}

// Durations of 2^31 ms and more fired at the first idle message, since the
// deadline was compared as a 32-bit serial number.
TEST_F(IdleCountdownTimerTest, EveryDurationFiresNoEarlierThanItsLengthWhereverTheClockWraps) {
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);
  for (const double start : {kStart, kWrap - 10, kWrap / 2, 3 * kWrap - 1}) {
    for (const std::uint32_t duration : {0u, 1u, 0x7FFFFFFFu, 0x80000000u, 0xC0000000u, 0xFFFFFFFFu}) {
      SCOPED_TRACE("start " + std::to_string(start) + ", duration " + std::to_string(duration));
      recorder.mCookies.clear();
      mNow = start;
      timer.SetDuration(duration);
      timer.ArmTimer();
      for (const double early : {0.0, duration / 2.0, duration - 1.0}) {
        if (early < 0 || duration == 0) continue;
        mNow = start + early;
        SendIdle();
        ASSERT_EQ(recorder.Firings(), 0u) << "at " << early;
      }
      mNow = start + duration;
      SendIdle();
      ASSERT_EQ(recorder.Firings(), 1u);
    }
  }
}

// A timer alive across Terminate and Initialize stayed dead: it believed it
// was still attached, and its own station was never registered again.
TEST_F(IdleCountdownTimerTest, ATimerWorksAgainOnceTheLibraryIsInitializedAnew) {
  FiringRecorder recorder;
  Tarn::Messaging::Terminate();
  IdleCountdownTimer timer;
  timer.ArmTimer();  // nothing to attach to yet
  Tarn::Messaging::Initialize();
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 0u);
  for (int restart = 0; restart < 2; ++restart) {
    timer.ArmTimer();
    ASSERT_TRUE(IsAttachedToIdle(timer));
    Tarn::Messaging::Terminate();
    Tarn::Messaging::Initialize();
    AddListener(timer.GetStationID(), &recorder);
    timer.ArmTimer();
    SendIdle();
    ASSERT_EQ(recorder.Firings(), static_cast<std::size_t>(restart + 1));
  }
}

TEST_F(IdleCountdownTimerTest, HandlersMayRearmNestIdleMessagesAndThrowWithoutStoppingTheTimer) {
  messaging_test::ExceptionRecorder exceptions;
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);
  int depth = 0;
  recorder.mOnFiring = [&] {
    ASSERT_EQ(++depth, 1) << "the timer fired inside its own firing";
    mNow += 30;  // the handler takes its time: the new countdown starts when it re-arms
    timer.ArmTimer();
    SendIdle();  // due at once, but nested in its own firing
    --depth;
    if (recorder.Firings() == 2) throw std::runtime_error("autosave failed");
  };
  timer.SetDuration(0);
  timer.ArmTimer();
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 1u);
  EXPECT_TRUE(IsAttachedToIdle(timer));
  timer.SetDuration(100);
  SendIdle();  // due: the duration counts from the next arming only
  EXPECT_EQ(recorder.Firings(), 2u);
  EXPECT_EQ(exceptions.Count(), 1u);
  mNow += 99;
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 2u);
  mNow += 1;
  recorder.mOnFiring = nullptr;
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 3u);
}

TEST_F(IdleCountdownTimerTest, DestroyedTimersLeaveTheIdleStationAndTakeTheirStationsWithThem) {
  FiringRecorder first;
  FiringRecorder second;
  auto firstTimer = std::make_unique<IdleCountdownTimer>();
  auto secondTimer = std::make_unique<IdleCountdownTimer>();
  auto unarmed = std::make_unique<IdleCountdownTimer>();
  const std::vector<kivcore::utility::ImmutableString> stations = {
      firstTimer->GetStationID(), secondTimer->GetStationID(), unarmed->GetStationID()};
  AddListener(stations[0], &first);
  AddListener(stations[1], &second);
  // Whichever fires first destroys the other, in whatever order the idle
  // station serves them.
  first.mOnFiring = [&] { secondTimer.reset(); };
  second.mOnFiring = [&] { firstTimer.reset(); };
  firstTimer->ArmTimer();
  secondTimer->ArmTimer();
  SendIdle();
  EXPECT_EQ(first.Firings() + second.Firings(), 1u);
  IdleCountdownTimer* survivor = firstTimer ? firstTimer.get() : secondTimer.get();
  survivor->ArmTimer();
  firstTimer.reset();
  secondTimer.reset();
  unarmed.reset();
  EXPECT_FALSE(Tarn::StationUtils::HasListeners(Tarn::kStation_Idle));
  for (const auto& station : stations) EXPECT_EQ(Tarn::StationRegistry::FindStation(station), nullptr);
  SendIdle();
  EXPECT_EQ(first.Firings() + second.Firings(), 1u);
}

}  // namespace
