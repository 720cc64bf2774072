// Posting from worker threads: posts wait for the main thread, carry the
// values of the moment they were posted, arrive exactly once and in order,
// and free their copies whatever becomes of their station.
#include "StationTestSupport.h"

#include <cinttypes>
#include <cstdio>
#include <set>
#include <typeinfo>

namespace {

using namespace station_test;
namespace Registry = Tarn::StationRegistry;
namespace Utils = Tarn::StationUtils;
using messaging_test::ThreadGroup;

class PostingThreadTest : public RegistryTest {
protected:
  void SetUp() override {
    RegistryTest::SetUp();
    // A message type caches its ID on first use. Make that first use here,
    // on one thread, so that the cases below watch posting and not the
    // cache; the cache's first use on several threads at once has a case of
    // its own (WorkersPostingATypeNobodyUsedBeforeAgreeOnItsId).
    NumberMessage::StaticMessageID();
    TrackedNote::StaticMessageID();
    Sequenced::StaticMessageID();
  }

  void TearDown() override {
    RegistryTest::TearDown();
    EXPECT_EQ(TrackedNote::Live(), 0) << "a posted copy was never freed";
  }
};

// Checks the numbered messages of several producers on arrival: each number
// once, each producer's numbers in the order they were posted, and all on
// the thread that was the main thread when the checker was made.
class SequenceChecker : public Tarn::Listener {
public:
  SequenceChecker(int inProducers, std::uint32_t inPerProducer)
      : mPerProducer(inPerProducer),
        mNext(static_cast<std::size_t>(inProducers), 0),
        mSeen(static_cast<std::size_t>(inProducers), std::vector<bool>(inPerProducer, false)),
        mMainThread(std::this_thread::get_id()) {}

  void ListenToMessage(const Tarn::Message& inMessage) override {
    if (std::this_thread::get_id() != mMainThread) ++mOffMainThread;
    if (inMessage.GetMessageID() != Sequenced::StaticMessageID()) {
      ++mForeign;
      return;
    }
    const auto& message = static_cast<const Sequenced&>(inMessage);
    if (message.mProducer < 0 || static_cast<std::size_t>(message.mProducer) >= mSeen.size() ||
        message.mSequence >= mPerProducer) {
      ++mForeign;
      return;
    }
    const auto producer = static_cast<std::size_t>(message.mProducer);
    if (mSeen[producer][message.mSequence]) {
      ++mDuplicates;
    } else {
      mSeen[producer][message.mSequence] = true;
    }
    if (message.mSequence != mNext[producer]) ++mOutOfOrder;
    mNext[producer] = message.mSequence + 1;
    ++mDelivered;
  }

  std::uint64_t Delivered() const { return mDelivered; }
  std::uint64_t Duplicates() const { return mDuplicates; }
  std::uint64_t OutOfOrder() const { return mOutOfOrder; }
  std::uint64_t Foreign() const { return mForeign; }
  std::uint64_t OffMainThread() const { return mOffMainThread; }
  std::uint64_t Missing() const {
    std::uint64_t missing = 0;
    for (const std::vector<bool>& seen : mSeen)
      for (bool one : seen) missing += one ? 0 : 1;
    return missing;
  }

private:
  // Touched only by the main thread, which delivers.
  const std::uint32_t mPerProducer;
  std::vector<std::uint32_t> mNext;
  std::vector<std::vector<bool>> mSeen;
  const std::thread::id mMainThread;
  std::uint64_t mDelivered = 0;
  std::uint64_t mDuplicates = 0;
  std::uint64_t mOutOfOrder = 0;
  std::uint64_t mForeign = 0;
  std::uint64_t mOffMainThread = 0;
};

// A type whose first use is on the workers of the case below.
struct FirstUsedOnWorkers : Tarn::MessageImpl<FirstUsedOnWorkers> {
  explicit FirstUsedOnWorkers(int inValue) : mValue(inValue) {}
  int mValue;
};

// Two workers post a message type that nobody used before at the same
// moment: both compute and cache its ID concurrently. The cache must be safe
// for that (under ThreadSanitizer a plain shared variable is reported), and
// the main thread must recognise every copy.
TEST_F(PostingThreadTest, WorkersPostingATypeNobodyUsedBeforeAgreeOnItsId) {
  const ImmutableString id = MakeCounted();
  std::atomic<int> recognised{0};
  std::atomic<int> heard{0};
  messaging_test::RecordingListener listener("listener");
  Latch start(1);
  {
    ThreadGroup workers;
    for (int worker = 0; worker < 2; ++worker) {
      workers.Start([&, worker] {
        if (start.WaitFor()) Utils::PostMessageToUIThread(id, FirstUsedOnWorkers(worker), false);
      });
    }
    start.CountDown();
  }
  listener.SetAction([&](const Tarn::Message& inMessage) {
    heard.fetch_add(1);
    if (inMessage.GetMessageID() == FirstUsedOnWorkers::StaticMessageID()) recognised.fetch_add(1);
  });
  Utils::AddListener(id, &listener);
  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(heard.load(), 2);
  EXPECT_EQ(recognised.load(), 2);
  EXPECT_EQ(FirstUsedOnWorkers::StaticMessageID(),
            Tarn::HashMessageTypeNameToMessageID(typeid(FirstUsedOnWorkers).name()));
}

TEST_F(PostingThreadTest, WorkerPostsWaitForTheFlushAndCarryTheValuesOfTheMomentOfPosting) {
  const ImmutableString id = MakeCounted();
  MessageRecorder listener;
  Utils::AddListener(id, &listener);

  RunOnWorker([&] {
    TrackedNote changed(1, "one");
    Utils::PostMessageToUIThread(id, changed, false);
    changed.mValue = 100;
    changed.mText = "changed";
    auto destroyed = std::make_unique<TrackedNote>(2, "two");
    Utils::PostMessageToUIThread(id, *destroyed, true);
    destroyed.reset();
  });
  // The main thread has run no pending calls yet.
  EXPECT_EQ(listener.Count(), 0u);
  EXPECT_EQ(Adaptor().PendingCallCount(), 2u);
  EXPECT_EQ(TrackedNote::Live(), 2);

  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(listener.Values(), (std::vector<int>{1, 2}));
  EXPECT_EQ(listener.Texts(), (std::vector<std::string>{"one", "two"}));
  for (std::thread::id thread : listener.Threads()) EXPECT_EQ(thread, std::this_thread::get_id());
  EXPECT_EQ(TrackedNote::Live(), 0);

  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(listener.Count(), 2u) << "a post was delivered twice";
}

TEST_F(PostingThreadTest, PostsOfSeveralWorkersAreAllDeliveredByOneFlush) {
  constexpr int kWorkers = 4;
  constexpr int kPostsEach = 250;
  const ImmutableString id = MakeCounted();
  MessageRecorder listener;
  Utils::AddListener(id, &listener);

  {
    ThreadGroup workers;
    for (int worker = 0; worker < kWorkers; ++worker) {
      workers.Start([&, worker] {
        for (int i = 0; i < kPostsEach; ++i) Utils::PostMessageToUIThread(id, NumberMessage(worker * kPostsEach + i), i % 2 == 0);
      });
    }
  }
  EXPECT_EQ(listener.Count(), 0u);
  ASSERT_EQ(Adaptor().PendingCallCount(), static_cast<std::size_t>(kWorkers * kPostsEach));

  Utils::FlushPostedMessagesOnUIThread();
  const std::vector<int> values = listener.Values();
  EXPECT_EQ(values.size(), static_cast<std::size_t>(kWorkers * kPostsEach));
  EXPECT_EQ(std::set<int>(values.begin(), values.end()).size(), static_cast<std::size_t>(kWorkers * kPostsEach));
}

TEST_F(PostingThreadTest, TwoProducersPostingAHundredThousandMessagesAreEachDeliveredOnceAndInOrder) {
  constexpr int kProducers = 2;
  constexpr std::uint32_t kPerProducer = 50000;
  constexpr std::uint64_t kTotal = std::uint64_t{kProducers} * kPerProducer;
  const ImmutableString id = MakeCounted();
  SequenceChecker checker(kProducers, kPerProducer);
  Utils::AddListener(id, &checker);

  Latch start;
  ThreadGroup producers;
  for (int producer = 0; producer < kProducers; ++producer) {
    producers.Start([&, producer] {
      if (!start.WaitFor()) return;
      for (std::uint32_t sequence = 0; sequence < kPerProducer; ++sequence) {
        Utils::PostMessageToUIThread(id, Sequenced(producer, sequence), false);
      }
    });
  }

  // The main thread sleeps in the adaptor until calls are queued, then runs
  // them, as a host event loop would.
  const auto began = std::chrono::steady_clock::now();
  const auto deadline = began + std::chrono::seconds(90);
  start.CountDown();
  while (checker.Delivered() < kTotal && std::chrono::steady_clock::now() < deadline) {
    if (Adaptor().WaitForPendingCalls(100)) Utils::FlushPostedMessagesOnUIThread();
  }
  const double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - began).count();
  producers.JoinAll();
  Utils::FlushPostedMessagesOnUIThread();

  EXPECT_EQ(checker.Delivered(), kTotal);
  EXPECT_EQ(checker.Missing(), 0u);
  EXPECT_EQ(checker.Duplicates(), 0u);
  EXPECT_EQ(checker.OutOfOrder(), 0u);
  EXPECT_EQ(checker.Foreign(), 0u);
  EXPECT_EQ(checker.OffMainThread(), 0u);
  const double rate = seconds > 0 ? static_cast<double>(checker.Delivered()) / seconds : 0.0;
  std::printf("[ posting  ] %" PRIu64 " posts from %d threads delivered in %.3f s: %.0f posts per second\n",
              checker.Delivered(), kProducers, seconds, rate);
  RecordProperty("posts_per_second", std::to_string(static_cast<long long>(rate)));
}

TEST_F(PostingThreadTest, WorkerPostToAStationGoneBeforeTheFlushDeliversNothingAndIsFreed) {
  const ImmutableString id = MakeCounted();
  MessageRecorder listener;
  Utils::AddListener(id, &listener);
  RunOnWorker([&] { Utils::PostMessageToUIThread(id, TrackedNote(1, std::string(64, 'y')), false); });
  Registry::DisposeStation(id);
  const std::size_t blocks = kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse;
  Utils::FlushPostedMessagesOnUIThread();

  EXPECT_EQ(listener.Count(), 0u);
  EXPECT_EQ(TrackedNote::Live(), 0);
  EXPECT_EQ(kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse, blocks - 1)
      << "the post's block was not returned";
}

TEST_F(PostingThreadTest, WorkerPostUnderExhaustedStorageThrowsOnThePosterAndQueuesNothing) {
  const ImmutableString id = MakeCounted();
  MessageRecorder listener;
  Utils::AddListener(id, &listener);
  bool threw = false;
  {
    messaging_test::SmallBlockFailureGuard exhausted(0);
    RunOnWorker([&] {
      try {
        Utils::PostMessageToUIThread(id, TrackedNote(1), false);
      } catch (const std::bad_alloc&) {
        threw = true;
      }
    });
  }
  EXPECT_TRUE(threw);
  EXPECT_EQ(Adaptor().PendingCallCount(), 0u);
  Utils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(listener.Count(), 0u);
}

// While workers post, the main thread runs the posts and now and then
// disposes of the station and registers it anew. Each post is delivered at
// most once, to whichever station holds the ID when it runs, and every copy
// is freed.
TEST_F(PostingThreadTest, PostsRacingWithTheirStationBeingReplacedArriveAtMostOnceAndAreAllFreed) {
  constexpr int kWorkers = 2;
  constexpr int kPostsEach = 3000;
  const ImmutableString id = MakeCounted();
  MessageRecorder listener;
  Utils::AddListener(id, &listener);

  std::atomic<int> finished{0};
  ThreadGroup workers;
  for (int worker = 0; worker < kWorkers; ++worker) {
    workers.Start([&, worker] {
      for (int i = 0; i < kPostsEach; ++i) {
        Utils::PostMessageToUIThread(id, TrackedNote(worker * kPostsEach + i), (i % 3) == 0);
      }
      finished.fetch_add(1);
    });
  }
  int round = 0;
  const auto deadline = std::chrono::steady_clock::now() + kDeadline;
  while ((finished.load() < kWorkers || Adaptor().PendingCallCount() != 0) &&
         std::chrono::steady_clock::now() < deadline) {
    if (Adaptor().WaitForPendingCalls(10)) Utils::FlushPostedMessagesOnUIThread();
    if (round++ % 7 == 0) {
      Registry::DisposeStation(id);
      Registry::RegisterStation(id, &CountingFactory);
      Utils::AddListener(id, &listener);
    }
  }
  workers.JoinAll();
  Utils::FlushPostedMessagesOnUIThread();

  const std::vector<int> values = listener.Values();
  EXPECT_LE(values.size(), static_cast<std::size_t>(kWorkers * kPostsEach));
  EXPECT_EQ(std::set<int>(values.begin(), values.end()).size(), values.size()) << "a post arrived twice";
  EXPECT_EQ(TrackedNote::Live(), 0);
  EXPECT_GT(StationLog::Destructions(), 0) << "the station was never replaced while posts ran";
}

}  // namespace
