// The event-loop integrations, one scenario body for each loop: posts arrive
// once and in order across a replacement of the integration, the destructor
// runs follow-ups, and a pending call may destroy the integration.
#include "IntegrationTestSupport.h"

#include <kivcore/Error.h>

#include <mutex>
#include <stdexcept>
#include <vector>

namespace {

using namespace integration_test;

// Hears Numbered messages; main thread only (a broadcast delivers nowhere else).
class Heard : public Tarn::Listener {
public:
  void ListenToMessage(const Tarn::Message& inMessage) override {
    const auto& message = static_cast<const Numbered&>(inMessage);
    message.mHeard = true;
    if (std::this_thread::get_id() != mMainThread) ++mOffMainThread;
    if (mLast.size() <= static_cast<std::size_t>(message.mProducer)) mLast.resize(message.mProducer + 1, -1);
    if (message.mSequence != mLast[message.mProducer] + 1) ++mOutOfOrder;
    mLast[message.mProducer] = message.mSequence;
    ++mTotal;
    if (mAction) mAction(message);
  }
  std::function<void(const Numbered&)> mAction;
  std::vector<int> mLast;
  int mTotal = 0, mOutOfOrder = 0, mOffMainThread = 0;
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

using Loops = ::testing::Types<AsioLoop
#if TARN_HAVE_GLIB_INTEGRATION
                               ,
                               GLibLoop
#endif
                               >;
TYPED_TEST_SUITE(EventLoopTest, Loops);

// `loop = make_unique(...)` builds the new integration before the old one
// goes; the old one's removal must not take the new one's wakeups with it.
TYPED_TEST(EventLoopTest, PostsArriveOnceInOrderOnTheMainThreadAfterTheIntegrationIsReplaced) {
  constexpr int kProducers = 3, kEach = 500;
  TypeParam first;
  auto integration = first.Make();
  integration = this->mLoop.Make();
  tarn_test::ThreadGroup producers;
  for (int p = 0; p < kProducers; ++p)
    producers.Start([this, p] {
      for (int i = 0; i < kEach; ++i) Tarn::StationUtils::PostMessageToUIThread(this->mStation, Numbered(p, i), false);
    });
  EXPECT_TRUE(PollUntil(this->mLoop, [this] { return this->mHeard.mTotal == kProducers * kEach; }))
      << this->mHeard.mTotal << " of " << kProducers * kEach << " delivered";
  producers.JoinAll();
  first.Poll();
  EXPECT_EQ(kProducers * kEach, this->mHeard.mTotal) << "nothing twice, also through the old loop";
  EXPECT_EQ(0, this->mHeard.mOutOfOrder);
  EXPECT_EQ(0, this->mHeard.mOffMainThread);
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
  this->mHeard.mLast.clear();
  integration = this->mLoop.Make();
  Tarn::StationUtils::PostMessageToUIThread(this->mStation, Numbered(0, 0), true);
  integration.reset();
  EXPECT_EQ(4 + Tarn::Integration::PendingCallRunner::kDrainPasses, this->mHeard.mTotal);
  EXPECT_EQ(1u, kivcore::threads::GetRegisteredMainThread()->PendingCallCount());
  hops = 0;
  Tarn::StationUtils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(0, this->mHeard.mOutOfOrder);
}

// The first call destroys the integration while its run is on the stack; the
// second throws; the third must still run, once.
TYPED_TEST(EventLoopTest, APendingCallMayDestroyTheIntegrationWhileALaterOneThrows) {
  int exceptions = 0, ran = 0;
  auto previous = kivcore::config::ErrorManager::SetExceptionHandler([&](std::exception_ptr) { ++exceptions; });
  auto integration = this->mLoop.Make();
  kivcore::threads::AsyncCallFromMainThread([&] { integration.reset(); }, 0);
  kivcore::threads::AsyncCallFromMainThread([] { throw std::runtime_error("second"); }, 0);
  kivcore::threads::AsyncCallFromMainThread([&] { ++ran; }, 0);
  try {
    this->mLoop.Poll();
  } catch (const std::runtime_error&) {
    ++exceptions;
  }
  this->mLoop.Poll();
  kivcore::config::ErrorManager::SetExceptionHandler(previous);
  EXPECT_FALSE(integration);
  EXPECT_EQ(1, exceptions);
  EXPECT_EQ(1, ran);
}

}  // namespace
