// Coalesced, cancellable and idle-time posts: what handlers do to their own
// post, and the races of workers posting while the main thread drains and
// tokens are cancelled. Each kind against a model on seeded sequences: the
// operations harness (OperationsHarness.h).
#include "TestSupport.h"

#include <TarnMessaging.h>

#include <algorithm>
#include <numeric>
#include <random>

namespace {

using namespace messaging_test;
using namespace Tarn::StationUtils;
using Tarn::kStation_Idle;
using Tarn::kStation_Repeat;
using Tarn::kStation_StatusBar;

std::size_t BlocksInUse() { return kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse; }
int ValueOf(const Tarn::Message& inMessage) { return inMessage.Is<NumberMessage>() ? inMessage.As<NumberMessage>()->mValue : -1; }

// Initialize on the constructing thread, which becomes the main thread. The
// listeners of a test, made after it, detach themselves as they go.
struct Library { Library() { Tarn::Messaging::Initialize(); } ~Library() { Tarn::Messaging::Terminate(); } };

// What handlers do to the post being delivered: a coalesced post of the same
// key is queued anew (not merged into the delivery under way, and not lost);
// cancelling its token on the main thread returns at once and drops the
// rest; an idle-time post waits for the next idle broadcast, which, made by
// the handler itself, first finishes the posts made before (7 once came
// after 6).
TEST(PostKindsThreadTest, HandlersPostingOrCancellingDuringTheirOwnDeliveryAffectOnlyLaterPosts) {
  Library library;
  CallLog log;
  Tarn::PostCancelToken token;
  RecordingListener a("a", &log);
  a.SetAction([token](const Tarn::Message& inMessage) mutable {
    const int value = ValueOf(inMessage);
    if (value == 1) PostCoalescedMessageToUIThread(kStation_StatusBar, NumberMessage(2));
    if (value == 3) token.Cancel();
    if (value != 5) return;
    PostMessageAtIdleTime(kStation_StatusBar, NumberMessage(6));
    BroadcastMessage(kStation_Idle, PingMessage());
  });
  AddListener(kStation_StatusBar, &a);
  std::thread([&token] {
    PostCoalescedMessageToUIThread(kStation_StatusBar, NumberMessage(1));
    for (int value : {3, 4}) PostMessageToUIThread(kStation_StatusBar, NumberMessage(value), Tarn::PostCancelToken(token));
    for (int value : {5, 7}) PostMessageAtIdleTime(kStation_StatusBar, NumberMessage(value));
    BroadcastMessage(kStation_Idle, PingMessage());  // off the main thread: delivers nothing
  }).join();
  FlushPostedMessagesOnUIThread();
  EXPECT_EQ((std::vector<std::string>{"a:1", "a:3"}), log.Entries());
  for (int run = 0; run < 2; ++run) FlushPostedMessagesOnUIThread(), BroadcastMessage(kStation_Idle, PingMessage());
  EXPECT_EQ((std::vector<std::string>{"a:1", "a:3", "a:2", "a:5", "a:7", "a:6"}), log.Entries());
}

TEST(PostKindsThreadTest, CancelOnAWorkerWaitsForTheRunningDeliveryAndNoneFollows) {
  Library library;
  Watchdog watchdog;
  for (int round = 0; round < 20; ++round) {
    Tarn::PostCancelToken token;
    std::atomic<int> cancelled{0}, delivered{0}, late{0};
    Latch entered;
    RecordingListener a("a");
    a.SetAction([&](const Tarn::Message&) {
      if (cancelled.load()) late.fetch_add(1);
      if (delivered.fetch_add(1) == 0 && round == 0) {
        // The one handshake: the worker cancels while this delivery runs.
        entered.CountDown();
        std::this_thread::sleep_for(std::chrono::milliseconds(30));
        EXPECT_FALSE(cancelled.load()) << "Cancel returned while a delivery of its token ran";
      }
    });
    AddListener(kStation_StatusBar, &a);
    const std::size_t blocks = BlocksInUse();
    ThreadGroup threads;
    for (int worker = 0; worker < 2; ++worker)
      threads.Start([&] { for (int i = 0; i < 500 && !cancelled.load(); ++i) PostMessageToUIThread(kStation_StatusBar, NumberMessage(i), token); });
    threads.Start([&] {
      round == 0 ? entered.WaitFor() : WaitUntil([&] { return delivered.load() > 10 * round; }, std::chrono::milliseconds(200));
      token.Cancel();
      cancelled.store(1);  // nothing may be heard from here on
    });
    while (!cancelled.load()) FlushPostedMessagesOnUIThread();
    threads.JoinAll();
    FlushPostedMessagesOnUIThread();
    EXPECT_EQ(0, late.load()) << "round " << round;
    EXPECT_EQ(blocks, BlocksInUse()) << "round " << round;
  }
}

// Each worker makes coalesced posts (one under its station's type key, the
// other under a caller key) and idle-time posts, while the main thread
// flushes and broadcasts idle messages.
TEST(PostKindsThreadTest, CoalescedAndIdlePostsRacingDrainsAndIdleBroadcastsArriveNewestOnlyOrAllInOrder) {
  Library library;
  constexpr int kPosts = 20000;
  const ImmutableString* stations[] = {&kStation_StatusBar, &kStation_Repeat};
  int begun = 0, heardIdle = 0, misplaced = 0;
  std::vector<int> coalesced[2], idle[2];
  RecordingListener idleListener("idle"), listeners[] = {RecordingListener("a"), RecordingListener("b")};
  idleListener.SetAction([&](const Tarn::Message&) { ++heardIdle; });
  AddListener(kStation_Idle, &idleListener);
  for (int w = 0; w < 2; ++w) {
    listeners[w].SetAction([&, w](const Tarn::Message& inMessage) {
      const int value = ValueOf(inMessage);
      if (value > 0) return coalesced[w].push_back(value);
      // Idle-time: inside an idle broadcast, before its listeners.
      if (heardIdle != begun - 1) ++misplaced;
      idle[w].push_back(-value);
    });
    AddListener(*stations[w], &listeners[w]);
  }
  const std::size_t blocks = BlocksInUse();
  std::atomic<int> done{0};
  ThreadGroup threads;
  for (int w = 0; w < 2; ++w)
    threads.Start([&, w] {
      for (int i = 1; i <= kPosts; ++i) {
        w == 0 ? PostCoalescedMessageToUIThread(*stations[w], NumberMessage(i)) : PostCoalescedMessageToUIThread(*stations[w], NumberMessage(i), 42);
        PostMessageAtIdleTime(*stations[w], NumberMessage(-i));
      }
      done.fetch_add(1);
    });
  const auto drain = [&] { FlushPostedMessagesOnUIThread(), ++begun, BroadcastMessage(kStation_Idle, PingMessage()); };
  while (done.load() < 2) drain();
  threads.JoinAll();
  drain();
  EXPECT_EQ(blocks, BlocksInUse());
  EXPECT_EQ(0, misplaced) << "an idle-time post went outside an idle broadcast, or after its listeners";
  std::vector<int> all(kPosts);
  std::iota(all.begin(), all.end(), 1);
  for (int w = 0; w < 2; ++w) {
    EXPECT_EQ(all, idle[w]);
    EXPECT_EQ(kPosts, coalesced[w].empty() ? 0 : coalesced[w].back()) << "the newest coalesced post was lost";
    EXPECT_TRUE(std::is_sorted(coalesced[w].begin(), coalesced[w].end(), std::less_equal<int>())) << "a copy went twice, or an older after a newer";
  }
}

}  // namespace
