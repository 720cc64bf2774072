// Tarn::IdleCountdownTimer: the deadline on the millisecond clock for every
// duration, the one-shot firing with re-entrant handlers, the timer across a
// library restart, and the lifetime of the timer and its station. Time comes
// from a fake clock (TimeStamp::SetClockForTesting); no test waits.
#include "TestSupport.h"

#include <TarnMessaging.h>

#include <TarnFoundation/TimeStamp.h>

#include <stdexcept>

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
  IdleCountdownTimerTest() { Tarn::TimeStamp::SetClockForTesting([this] { return mNow; }); }
  ~IdleCountdownTimerTest() override { Tarn::TimeStamp::SetClockForTesting(std::function<double()>()); }
  void SetUp() override { Tarn::Messaging::Initialize(); }
  void TearDown() override { Tarn::Messaging::Terminate(); }

  static void SendIdle() { Tarn::StationUtils::BroadcastMessage(Tarn::kStation_Idle, Tarn::ApplicationIdleMessage()); }
  static bool IsAttachedToIdle(IdleCountdownTimer& inTimer) {
    Tarn::Station* idle = Tarn::StationRegistry::FindStation(Tarn::kStation_Idle);
    return idle != nullptr && idle->HasListener(&inTimer) && inTimer.HasBroadcaster(idle);
  }

  double mNow = kStart;
};

TEST_F(IdleCountdownTimerTest, AnArmedTimerFiresOnceAtTheFirstIdleMessageFromItsDeadlineWithTheCookieThen) {
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);
  timer.SetDuration(100);
  timer.ArmTimer();
  mNow = kStart + 50;
  timer.ArmTimer();       // restarts from now, attached once
  timer.SetDuration(10);  // for the next arming only
  timer.SetCookie(7);
  mNow = kStart + 149;
  SendIdle();
  mNow = kStart + 150;
  Tarn::StationUtils::BroadcastMessage(Tarn::kStation_Idle, messaging_test::PingMessage());
  EXPECT_EQ(recorder.Firings(), 0u);
  SendIdle();
  SendIdle();
  EXPECT_EQ(recorder.mCookies, std::vector<std::uint32_t>{7});
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
  timer.ArmTimer();
  ASSERT_TRUE(IsAttachedToIdle(timer));
  Tarn::Messaging::Terminate();
  Tarn::Messaging::Initialize();
  AddListener(timer.GetStationID(), &recorder);
  timer.ArmTimer();
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 1u);
  // An idle station whose factory gives nothing at its first call: the
  // attach makes it at the second, and the timer listens to that station.
  Tarn::Messaging::Terminate();
  static int sCalls = 0;
  Tarn::StationRegistry::RegisterStation(Tarn::kStation_Idle, [](const kivcore::utility::ImmutableString& inID) {
    return sCalls++ == 0 ? nullptr : new Tarn::Station(inID);
  });
  Tarn::Messaging::Initialize();
  AddListener(timer.GetStationID(), &recorder);
  timer.ArmTimer();
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 2u);
}

TEST_F(IdleCountdownTimerTest, HandlersMayRearmNestIdleMessagesAndThrowWithoutStoppingTheTimer) {
  messaging_test::ExceptionRecorder exceptions;
  FiringRecorder recorder;
  IdleCountdownTimer timer;
  AddListener(timer.GetStationID(), &recorder);
  int depth = 0;
  recorder.mOnFiring = [&] {
    ASSERT_EQ(++depth, 1) << "the timer fired inside its own firing";
    timer.ArmTimer();
    SendIdle();  // due at once, but nested in the timer's own firing
    --depth;
    throw std::runtime_error("autosave failed");
  };
  timer.ArmTimer();
  SendIdle();  // the re-armed timer is a newcomer that this broadcast does not serve
  EXPECT_EQ(recorder.Firings(), 1u);
  SendIdle();
  EXPECT_EQ(recorder.Firings(), 2u);
  EXPECT_EQ(exceptions.Count(), 2u);
  EXPECT_TRUE(IsAttachedToIdle(timer));
}

TEST_F(IdleCountdownTimerTest, DestroyedTimersLeaveTheIdleStationAndTakeTheirStationsWithThem) {
  FiringRecorder first, second;
  auto firstTimer = std::make_unique<IdleCountdownTimer>(), secondTimer = std::make_unique<IdleCountdownTimer>();
  const auto firstStation = firstTimer->GetStationID(), secondStation = secondTimer->GetStationID();
  AddListener(firstStation, &first);
  AddListener(secondStation, &second);
  // Whichever fires first destroys the other, in whatever order the idle
  // station serves them; the survivor is destroyed armed.
  first.mOnFiring = [&] { secondTimer.reset(); };
  second.mOnFiring = [&] { firstTimer.reset(); };
  firstTimer->ArmTimer();
  secondTimer->ArmTimer();
  SendIdle();
  EXPECT_EQ(first.Firings() + second.Firings(), 1u);
  (firstTimer ? firstTimer : secondTimer)->ArmTimer();
  firstTimer.reset();
  secondTimer.reset();
  EXPECT_FALSE(Tarn::StationUtils::HasListeners(Tarn::kStation_Idle));
  EXPECT_EQ(Tarn::StationRegistry::FindStation(firstStation), nullptr);
  EXPECT_EQ(Tarn::StationRegistry::FindStation(secondStation), nullptr);
}

}  // namespace
