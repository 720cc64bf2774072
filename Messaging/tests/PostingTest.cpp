// Posting to the main thread, seen from the main thread itself: the direct
// path, deferred posts and their copies, what decides at run time whether a
// post reaches anyone, and exhausted storage.
#include "StationTestSupport.h"

namespace {

using namespace station_test;
namespace Registry = Tarn::StationRegistry;
namespace Utils = Tarn::StationUtils;
using kivcore::utility::SmallBlockAllocator;
using messaging_test::RecordingListener;

class PostingTest : public RegistryTest {
protected:
  void SetUp() override {
    RegistryTest::SetUp();
    mStation = MakeCounted();
    Utils::AddListener(mStation, &mListener);
    // A station's first broadcast sets up storage that it keeps; do it now so
    // that the allocation counts below see only what posting costs.
    Utils::BroadcastMessage(mStation, TrackedNote(-1));
    mListener.Reset();
  }

  void TearDown() override {
    RegistryTest::TearDown();
    EXPECT_EQ(TrackedNote::Live(), 0) << "a posted copy was never freed";
  }

  static std::size_t BlocksInUse() { return SmallBlockAllocator::GetStatistics().blocksInUse; }
  static std::uint64_t Allocations() { return SmallBlockAllocator::GetStatistics().allocations; }

  // A MessageRecorder whose record can be emptied.
  class ResettableRecorder : public MessageRecorder {
  public:
    void Reset() { mOffset = Count(); }
    std::vector<int> Heard() const {
      std::vector<int> values = Values();
      return std::vector<int>(values.begin() + static_cast<std::ptrdiff_t>(mOffset), values.end());
    }
    std::vector<const Tarn::Message*> Objects() const {
      std::vector<const Tarn::Message*> addresses = Addresses();
      return std::vector<const Tarn::Message*>(addresses.begin() + static_cast<std::ptrdiff_t>(mOffset),
                                               addresses.end());
    }

  private:
    std::size_t mOffset = 0;
  };

  ImmutableString mStation;
  ResettableRecorder mListener;
};

// ---------------------------------------------------------------------------
// Direct and deferred

TEST_F(PostingTest, MainThreadPostDeliversBeforeReturningAndAllocatesNothing) {
  const TrackedNote note(7, "seven");
  const std::size_t blocks = BlocksInUse();
  const std::uint64_t allocations = Allocations();

  Utils::PostMessageToUIThread(mStation, note, false);
  EXPECT_EQ(Allocations(), allocations) << "the direct path allocated";
  EXPECT_EQ(BlocksInUse(), blocks);
  EXPECT_EQ(mListener.Heard(), std::vector<int>{7});
  EXPECT_EQ(mListener.Objects(), std::vector<const Tarn::Message*>{&note}) << "the direct path copied the message";
  EXPECT_EQ(Adaptor().PendingCallCount(), 0u);
}

TEST_F(PostingTest, ForcedAsyncPostDeliversOnlyWhenThePendingCallsRun) {
  {
    const TrackedNote note(3, "three");
    Utils::PostMessageToUIThread(mStation, note, true);
    EXPECT_EQ(mListener.Heard(), std::vector<int>{});
    EXPECT_EQ(Adaptor().PendingCallCount(), 1u);
    EXPECT_EQ(TrackedNote::Live(), 2) << "the post holds no copy of its own";
  }
  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(mListener.Heard(), std::vector<int>{3});
  EXPECT_EQ(mListener.Texts().back(), "three");
  EXPECT_EQ(TrackedNote::Live(), 0) << "the copy outlived its delivery";

  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(mListener.Heard(), std::vector<int>{3}) << "a post was delivered twice";
}

TEST_F(PostingTest, DeferredPostDeliversTheValuesTheMessageHadWhenPosted) {
  auto note = std::make_unique<TrackedNote>(1, "before");
  Utils::PostMessageToUIThread(mStation, *note, true);
  note->mValue = 2;
  note->mText = "after";
  note.reset();

  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(mListener.Heard(), std::vector<int>{1});
  EXPECT_EQ(mListener.Texts().back(), "before");
}

TEST_F(PostingTest, DeferredPostCostsOneSmallBlockAndReturnsIt) {
  const NumberMessage message(5);
  const std::size_t blocks = BlocksInUse();
  const std::uint64_t allocations = Allocations();

  Utils::PostMessageToUIThread(mStation, message, true);
  EXPECT_EQ(Allocations(), allocations + 1);
  EXPECT_EQ(BlocksInUse(), blocks + 1);

  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(BlocksInUse(), blocks);
  EXPECT_EQ(mListener.Heard(), std::vector<int>{5});
}

TEST_F(PostingTest, SeveralDeferredPostsRunInPostingOrderInOneFlush) {
  for (int i = 0; i < 50; ++i) Utils::PostMessageToUIThread(mStation, NumberMessage(i), true);
  Utils::FlushPostedMessagesOnUIThread();
  std::vector<int> expected;
  for (int i = 0; i < 50; ++i) expected.push_back(i);
  EXPECT_EQ(mListener.Heard(), expected);
}

// ---------------------------------------------------------------------------
// Decided when the post runs

TEST_F(PostingTest, PostToAnUnregisteredIdDeliversNothingAndFreesItsCopy) {
  const ImmutableString nowhere = Registry::UniqueStationID();
  const std::size_t blocks = BlocksInUse();
  Utils::PostMessageToUIThread(nowhere, TrackedNote(1, std::string(200, 'x')), true);
  EXPECT_EQ(TrackedNote::Live(), 1);

  EXPECT_NO_THROW(Utils::FlushPostedMessagesOnUIThread());
  EXPECT_EQ(TrackedNote::Live(), 0);
  EXPECT_EQ(BlocksInUse(), blocks);
  EXPECT_EQ(Registry::FindStation(nowhere), nullptr);
}

TEST_F(PostingTest, PostToAStationDisposedBeforeItRunsDeliversNothing) {
  Utils::PostMessageToUIThread(mStation, TrackedNote(1), true);
  Registry::DisposeStation(mStation);
  ASSERT_EQ(StationLog::Destructions(), 1);
  const std::size_t blocks = BlocksInUse();

  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(mListener.Heard(), std::vector<int>{});
  EXPECT_EQ(TrackedNote::Live(), 0);
  EXPECT_EQ(BlocksInUse(), blocks - 1) << "the post's block was not returned";
}

TEST_F(PostingTest, PostToAStoppedStationIsDroppedAndNotDeliveredAfterRestarting) {
  Utils::StopBroadcasting(mStation);
  const std::size_t blocks = BlocksInUse();
  Utils::PostMessageToUIThread(mStation, TrackedNote(1), true);
  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(mListener.Heard(), std::vector<int>{});
  EXPECT_EQ(BlocksInUse(), blocks) << "the dropped post's block was not returned";

  Utils::StartBroadcasting(mStation);
  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(mListener.Heard(), std::vector<int>{}) << "a dropped post came back";
  EXPECT_EQ(TrackedNote::Live(), 0);

  Utils::PostMessageToUIThread(mStation, TrackedNote(2), true);
  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(mListener.Heard(), std::vector<int>{2});
}

TEST_F(PostingTest, PostReachesTheListenersAttachedWhenItRuns) {
  RecordingListener late("late");
  Utils::PostMessageToUIThread(mStation, NumberMessage(1), true);
  Utils::AddListener(mStation, &late);
  Utils::RemoveListener(mStation, &mListener);

  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(late.Calls(), 1);
  EXPECT_EQ(mListener.Heard(), std::vector<int>{});
}

// ---------------------------------------------------------------------------
// Handlers that post

TEST_F(PostingTest, HandlerPostingOnTheMainThreadDeliversAtOnceOrQueuesForTheNextRun) {
  const ImmutableString echoes = MakeCounted();
  MessageRecorder echoListener;
  Utils::AddListener(echoes, &echoListener);
  RecordingListener poster("poster");
  poster.SetAction([&](const Tarn::Message& inMessage) {
    if (inMessage.GetMessageID() != NumberMessage::StaticMessageID()) return;
    const int value = static_cast<const NumberMessage&>(inMessage).mValue;
    Utils::PostMessageToUIThread(echoes, NumberMessage(value * 10), false);
    Utils::PostMessageToUIThread(echoes, NumberMessage(value * 100), true);
  });
  Utils::AddListener(mStation, &poster);

  Utils::PostMessageToUIThread(mStation, NumberMessage(1), true);
  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(poster.Calls(), 1);
  EXPECT_EQ(echoListener.Values(), std::vector<int>{10});

  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(echoListener.Values(), (std::vector<int>{10, 100}));
}

// ---------------------------------------------------------------------------
// The callback itself

TEST_F(PostingTest, CallbackDestroyedWithoutRunningFreesItsCopy) {
  const TrackedNote note(4, "four");
  const std::size_t blocks = BlocksInUse();
  {
    boost::function<void()> callback = note.CreateCallback(mStation);
    boost::function<void()> copy = callback;
    EXPECT_EQ(TrackedNote::Live(), 2) << "copies of the function share one copy of the message";
    EXPECT_EQ(BlocksInUse(), blocks + 1);
  }
  EXPECT_EQ(TrackedNote::Live(), 1);
  EXPECT_EQ(BlocksInUse(), blocks);
  EXPECT_EQ(mListener.Heard(), std::vector<int>{});
}

TEST_F(PostingTest, RunningACallbackBroadcastsItsCopyOnTheStationNamedAtCreation) {
  const ImmutableString other = MakeCounted();
  MessageRecorder otherListener;
  Utils::AddListener(other, &otherListener);
  TrackedNote note(8, "eight");
  boost::function<void()> callback = note.CreateCallback(mStation);
  note.mValue = 9;

  callback();
  EXPECT_EQ(mListener.Heard(), std::vector<int>{8});
  EXPECT_NE(mListener.Objects().back(), &note);
  EXPECT_EQ(otherListener.Count(), 0u);
}

TEST_F(PostingTest, ExhaustedStorageMakesTheDeferredPostThrowAndQueuesNothing) {
  const TrackedNote note(1);
  const std::size_t blocks = BlocksInUse();
  const std::size_t pending = Adaptor().PendingCallCount();
  {
    messaging_test::SmallBlockFailureGuard exhausted(0);
    EXPECT_THROW(Utils::PostMessageToUIThread(mStation, note, true), std::bad_alloc);
    EXPECT_THROW(note.CreateCallback(mStation), std::bad_alloc);
  }
  EXPECT_EQ(Adaptor().PendingCallCount(), pending);
  EXPECT_EQ(BlocksInUse(), blocks);
  EXPECT_EQ(TrackedNote::Live(), 1);

  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(mListener.Heard(), std::vector<int>{});
  // The direct path needs no storage, so it still works meanwhile.
  messaging_test::SmallBlockFailureGuard exhausted(0);
  Utils::PostMessageToUIThread(mStation, note, false);
  EXPECT_EQ(mListener.Heard(), std::vector<int>{1});
}

// ---------------------------------------------------------------------------
// No main thread

TEST_F(PostingTest, FlushWithNoMainThreadRegisteredDoesNothing) {
  mMainThread.reset();
  ASSERT_FALSE(kivcore::threads::GetRegisteredMainThread());

  // Not on the main thread now, so even a post without inForceAsync queues.
  Utils::PostMessageToUIThread(mStation, NumberMessage(1), false);
  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(mListener.Heard(), std::vector<int>{});

  mMainThread.emplace();
  EXPECT_EQ(Adaptor().PendingCallCount(), 1u);
  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(mListener.Heard(), std::vector<int>{1});
}

}  // namespace
