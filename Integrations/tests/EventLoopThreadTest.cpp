// The event-loop integrations, one scenario body for each loop: posts arrive
// once and in order across a replacement of the integration, the destructor
// runs follow-ups, a pending call or an idle listener may destroy the
// integration, and the idle source broadcasts when the loop runs dry, also
// while a worker posts, but never while messages are queued.
#include "IntegrationTestSupport.h"

#include <kivcore/Error.h>

#include <atomic>
#include <stdexcept>
#include <type_traits>

#if TARN_HAVE_QT_INTEGRATION && defined(__SANITIZE_THREAD__)
// Qt is not built with ThreadSanitizer and locks its posted-event list with
// futexes it cannot see, so the allocations and copies Qt makes of that list
// on the posting and the main thread would show as races. Only calls made
// from inside Qt's library are ignored: our handlers that Qt calls are still
// checked.
extern "C" __attribute__((visibility("default"))) const char* __tsan_default_suppressions() {
  return "called_from_lib:libQt5Core.so\n";
}
#endif

namespace {

using namespace integration_test;

// Hears one producer's Numbered messages; they must come in order, on the
// main thread.
class Heard : public Tarn::Listener {
public:
  void ListenToMessage(const Tarn::Message& inMessage) override {
    const auto& message = static_cast<const Numbered&>(inMessage);
    mInOrder = mInOrder && message.mSequence == mNext && std::this_thread::get_id() == mMainThread;
    mNext = message.mSequence + 1;
    ++mTotal;
    if (mAction) mAction(message);
  }
  std::function<void(const Numbered&)> mAction;
  int mTotal = 0, mNext = 0;
  bool mInOrder = true;
  const std::thread::id mMainThread = std::this_thread::get_id();
};

template <class Loop>
class EventLoopTest : public ::testing::Test {
protected:
  void SetUp() override {
    Tarn::Messaging::Initialize();
    mStation = Tarn::StationRegistry::RegisterUniqueStation();
    Tarn::StationUtils::AddListener(mStation, &mHeard);
  }
  void TearDown() override {
    Tarn::StationUtils::RemoveListener(mStation, &mHeard);
    Tarn::Messaging::Terminate();
  }
  tarn_test::Watchdog mWatchdog;
  kivcore::utility::ImmutableString mStation;
  Heard mHeard;
  Loop mLoop;
};

// Hears the idle station, and counts as wrong a broadcast off the main
// thread or nested in another.
struct IdleHeard {
  std::function<void()> mAction;
  int mTotal = 0, mWrong = 0;
  bool mInside = false;
  const std::thread::id mMainThread = std::this_thread::get_id();
  Tarn::Registration mRegistration =
      Tarn::Subscribe<Tarn::ApplicationIdleMessage>(Tarn::kStation_Idle, [this](const Tarn::ApplicationIdleMessage&) {
        ++mTotal;
        mWrong += mInside || std::this_thread::get_id() != mMainThread;
        mInside = true;
        if (mAction) mAction();
        mInside = false;
      });
};

using Loops = decltype(TypesOf(AllLoops()));
TYPED_TEST_SUITE(EventLoopTest, Loops);

// Two integrations of any kinds, the second built while the first runs, and
// either one destroyed while a worker posts: the survivor gets the wakeups,
// delivers every post once and in order, and its idle source goes on.
TYPED_TEST(EventLoopTest, TheSurvivorOfTwoIntegrationsOfAnyKindsDeliversAndGoesIdle) {
  static constexpr int kPosts = 200;
  decltype(TupleOf(AllLoops())) others;
  auto replace = [this](auto& ioOther) {
    for (const bool newerGoesFirst : {true, false}) {
      auto older = QuickIdle(this->mLoop.Make());
      auto newer = QuickIdle(ioOther.Make());
      this->mHeard.mTotal = this->mHeard.mNext = 0;
      // Half the posts come before the destruction, half after it.
      std::atomic<int> posted{0};
      std::atomic<bool> gone{false};
      std::thread producer([&] {
        for (; posted < kPosts; ++posted) {
          if (posted == kPosts / 2 && !tarn_test::WaitUntil([&] { return gone.load(); })) ADD_FAILURE();
          Tarn::StationUtils::PostMessageToUIThread(this->mStation, Numbered(0, posted), false);
        }
      });
      EXPECT_TRUE(PollUntil(ioOther, [&] { return posted == kPosts / 2; }));
      auto survive = [&](auto& ioLoop, auto& ioSurvivor, auto& ioGone) {
        ioGone.reset();
        gone = true;
        const std::uint64_t idleBefore = ioSurvivor->IdleBroadcasts();
        auto idle = [&] { return ioSurvivor->IdleBroadcasts() - idleBefore; };
        EXPECT_TRUE(PollUntil(ioLoop, [&] { return this->mHeard.mTotal == kPosts && idle() > 0; }))
            << this->mHeard.mTotal << " delivered, " << idle() << " idle; newer gone first: " << newerGoesFirst;
      };
      if (newerGoesFirst) survive(this->mLoop, older, newer);
      else survive(ioOther, newer, older);
      producer.join();
      this->mLoop.Poll();
      ioOther.Poll();
      EXPECT_EQ(kPosts, this->mHeard.mTotal) << "nothing twice, also through the other loop";
      EXPECT_TRUE(this->mHeard.mInOrder);
    }
  };
  std::apply([&replace](auto&... inOther) { (replace(inOther), ...); }, others);
}

// A handler posting a follow-up while the destructor drains: the follow-up is
// delivered before the destructor returns; one that re-posts for ever is cut
// off, and its last post stays queued.
TYPED_TEST(EventLoopTest, TheDestructorDeliversFollowUpsAndEndsEndlessReposting) {
  int hops = 3;
  this->mHeard.mAction = [&](const Numbered& inMessage) {
    if (inMessage.mSequence < hops) Tarn::StationUtils::PostMessageToUIThread(this->mStation, Numbered(0, inMessage.mSequence + 1), true);
  };
  auto integration = this->mLoop.Make();
  Tarn::StationUtils::PostMessageToUIThread(this->mStation, Numbered(0, 0), true);
  integration.reset();
  EXPECT_EQ(4, this->mHeard.mTotal);

  hops = 1 << 30;
  this->mHeard.mNext = 0;
  integration = this->mLoop.Make();
  Tarn::StationUtils::PostMessageToUIThread(this->mStation, Numbered(0, 0), true);
  integration.reset();
  this->mLoop.Poll();  // a run the destroyed integration had scheduled does nothing
  EXPECT_EQ(4 + Tarn::Integration::PendingCallRunner::kDrainPasses, this->mHeard.mTotal);
  EXPECT_EQ(1u, kivcore::threads::GetRegisteredMainThread()->PendingCallCount());
  hops = 0;
  Tarn::StationUtils::FlushPostedMessagesOnUIThread();
  EXPECT_TRUE(this->mHeard.mInOrder);
}

// A call throws in an ordinary run: Asio propagates it out of the loop,
// GLib reports it. Then a call destroys the integration while its run is on
// the stack, and the next one throws; the last must still run, once.
TYPED_TEST(EventLoopTest, APendingCallMayDestroyTheIntegrationWhileALaterOneThrows) {
  int caught = 0, reported = 0, ran = 0;
  auto previous = kivcore::config::ErrorManager::SetExceptionHandler([&](std::exception_ptr) { ++reported; });
  auto integration = this->mLoop.Make();
  kivcore::threads::AsyncCallFromMainThread([] { throw std::runtime_error("first"); }, 0);
  kivcore::threads::AsyncCallFromMainThread([&] { integration.reset(); }, 0);
  kivcore::threads::AsyncCallFromMainThread([] { throw std::runtime_error("second"); }, 0);
  kivcore::threads::AsyncCallFromMainThread([&] { ++ran; }, 0);
  try {
    this->mLoop.Poll();
  } catch (const std::runtime_error&) {
    ++caught;
  }
  this->mLoop.Poll();
  kivcore::config::ErrorManager::SetExceptionHandler(previous);
  EXPECT_EQ((std::is_same<TypeParam, AsioLoop>::value ? 1 : 0), caught);
  EXPECT_EQ(2, caught + reported);
  EXPECT_EQ(1, ran);
}

// A worker posts in bursts with pauses for a few idle intervals: with the
// integration's defaults, idle broadcasts come often enough for an
// IdleCountdownTimer to fire without help, no more often than the interval
// allows, and no post is lost. Switched off or at the longest interval, none
// comes; switched on while a handler keeps one message queued for several
// intervals, none comes before the handler stops.
TYPED_TEST(EventLoopTest, IdleBroadcastsComeOnlyWhenNothingIsQueuedAndStopWhenSwitchedOff) {
  using namespace std::chrono;
  constexpr int kPosts = 1600;
  constexpr milliseconds kInterval{2};
  IdleHeard idle;
  Tarn::IdleCountdownTimer timer;
  bool fired = false;
  Tarn::Registration firing = Tarn::Subscribe<Tarn::IdleCountdownTimerMessage>(
      timer.GetStationID(), [&](const Tarn::IdleCountdownTimerMessage&) { fired = true; });
  auto integration = this->mLoop.Make();
  timer.SetDuration(20);
  const auto start = steady_clock::now();
  timer.ArmTimer();
  std::thread producer([this] {
    for (int i = 0; i < kPosts; ++i) {
      Tarn::StationUtils::PostMessageToUIThread(this->mStation, Numbered(0, i), false);
      if (i % 200 == 199) std::this_thread::sleep_for(milliseconds(15));
    }
  });
  EXPECT_TRUE(PollUntil(this->mLoop, [&] { return fired && this->mHeard.mTotal == kPosts; }));
  producer.join();
  EXPECT_EQ(static_cast<std::uint64_t>(idle.mTotal), integration->IdleBroadcasts());
  EXPECT_LE(idle.mTotal, (steady_clock::now() - start) / Tarn::Integration::PendingCallRunner::kDefaultIdleInterval + 1)
      << "the interval must throttle the broadcasts";

  EXPECT_THROW(integration->SetIdleInterval(milliseconds(-1)), std::invalid_argument);
  integration->SetIdleInterval(Tarn::Integration::PendingCallRunner::kIdleOff);
  const int before = idle.mTotal;
  PollUntil(this->mLoop, [] { return false; }, 10 * kInterval);
  EXPECT_EQ(before, idle.mTotal) << "switched off";
  integration->SetIdleInterval(milliseconds::max());
  PollUntil(this->mLoop, [] { return false; }, 10 * kInterval);
  EXPECT_EQ(before, idle.mTotal) << "the longest interval must not overflow into none";
  const auto until = steady_clock::now() + milliseconds(15);
  this->mHeard.mAction = [&](const Numbered& inMessage) {
    if (steady_clock::now() < until)
      Tarn::StationUtils::PostMessageToUIThread(this->mStation, Numbered(0, inMessage.mSequence + 1), true);
  };
  Tarn::StationUtils::PostMessageToUIThread(this->mStation, Numbered(0, kPosts), true);
  integration->SetIdleInterval(kInterval);
  EXPECT_TRUE(PollUntil(this->mLoop, [&] { return idle.mTotal > before; }));
  EXPECT_LE(until, steady_clock::now()) << "an idle broadcast while a message was queued";
  EXPECT_LT(kPosts + 1, this->mHeard.mTotal);
  EXPECT_TRUE(this->mHeard.mInOrder);
  EXPECT_EQ(0, idle.mWrong) << "idle heard off the main thread or nested";
}

// An idle listener runs a nested loop, in which idle checks come due, then
// posts a message and destroys the integration during the broadcast: no
// broadcast nests, the destructor delivers the post, the source stops with
// the integration.
TYPED_TEST(EventLoopTest, AnIdleListenerMayNestTheLoopAndDestroyTheIntegration) {
  IdleHeard idle;
  auto integration = QuickIdle(this->mLoop.Make());
  idle.mAction = [&] {
    PollUntil(this->mLoop, [] { return false; }, std::chrono::milliseconds(5));
    Tarn::StationUtils::PostMessageToUIThread(this->mStation, Numbered(0, 0), true);
    integration.reset();
  };
  EXPECT_TRUE(PollUntil(this->mLoop, [&] { return integration == nullptr; }));
  EXPECT_EQ(1, this->mHeard.mTotal);
  idle.mAction = nullptr;
  PollUntil(this->mLoop, [] { return false; }, std::chrono::milliseconds(10));
  EXPECT_EQ(1, idle.mTotal) << "the source must go with its integration";
  EXPECT_EQ(0, idle.mWrong);
}

// Destroying an integration off the main thread is outside the contract, and
// reported as such. A GLib context nobody iterates while the main thread
// flushes batch after batch holds one run source, not one per batch: GLib
// numbers a context's sources in order, so two markers count those between.
TEST(EventLoopEdges, ADestructionOnAWorkerIsReportedAndAnIdleContextHoldsOneRunSource) {
  Tarn::Messaging::Initialize();
  int reports = 0;
  auto previous = kivcore::config::SetErrorHandler([&reports](const kivcore::config::ErrorReport&) { ++reports; });
  AsioLoop asio;
  auto integration = asio.Make();
  std::thread([&integration] { integration.reset(); }).join();
  kivcore::config::SetErrorHandler(previous);
  EXPECT_EQ(1, reports);
#if TARN_HAVE_GLIB_INTEGRATION
  GLibLoop glib;
  auto unpolled = glib.Make();
  auto marker = [&glib] {
    GSource* const source = g_idle_source_new();
    const guint id = g_source_attach(source, glib.mContext);
    return g_source_unref(source), id;
  };
  const guint before = marker();
  for (int batch = 0; batch < 10; ++batch) {
    kivcore::threads::AsyncCallFromMainThread([] {}, 0);
    Tarn::StationUtils::FlushPostedMessagesOnUIThread();
  }
  EXPECT_EQ(before + 2, marker());
  unpolled.reset();
#endif
  Tarn::Messaging::Terminate();
}

}  // namespace
