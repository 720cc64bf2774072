// The event-loop integrations, one scenario body for each loop: posts arrive
// once and in order across a replacement of the integration, the destructor
// runs follow-ups, and a pending call may destroy the integration.
#include "IntegrationTestSupport.h"

#include <kivcore/Error.h>

#include <stdexcept>
#include <thread>
#include <type_traits>

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

#if TARN_HAVE_GLIB_INTEGRATION
using Loops = ::testing::Types<AsioLoop, GLibLoop>;
#else
using Loops = ::testing::Types<AsioLoop>;
#endif
TYPED_TEST_SUITE(EventLoopTest, Loops);

// `loop = make_unique(...)` builds the new integration before the old one
// goes; the old one's removal must not take the new one's wakeups with it.
TYPED_TEST(EventLoopTest, PostsArriveOnceInOrderOnTheMainThreadAfterTheIntegrationIsReplaced) {
  constexpr int kPosts = 1000;
  TypeParam first;
  auto integration = first.Make();
  integration = this->mLoop.Make();
  std::thread producer([this] {
    for (int i = 0; i < kPosts; ++i) Tarn::StationUtils::PostMessageToUIThread(this->mStation, Numbered(0, i), false);
  });
  EXPECT_TRUE(PollUntil(this->mLoop, [this] { return this->mHeard.mTotal == kPosts; })) << this->mHeard.mTotal << " delivered";
  EXPECT_LE(1u, integration->ScheduledRuns());
  producer.join();
  first.Poll();
  EXPECT_EQ(kPosts, this->mHeard.mTotal) << "nothing twice, also through the old loop";
  EXPECT_TRUE(this->mHeard.mInOrder);
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

}  // namespace
