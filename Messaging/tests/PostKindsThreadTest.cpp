// Coalesced, cancellable and idle-time posts while workers post, the main
// thread drains and tokens are cancelled at once, and what handlers do to
// their own post. PostKindsModelTest checks each kind on its own.
#include "TestSupport.h"

#include <TarnMessaging.h>

#include <kivcore/SmallBlockAllocator.h>

#include <algorithm>
#include <numeric>

namespace {

using namespace messaging_test;
using namespace Tarn::StationUtils;
using Tarn::kStation_Idle;
using Tarn::kStation_Repeat;
using Tarn::kStation_StatusBar;

std::size_t BlocksInUse() { return kivcore::utility::SmallBlockAllocator::GetStatistics().blocksInUse; }
int ValueOf(const Tarn::Message& inMessage) { return inMessage.Is<NumberMessage>() ? inMessage.As<NumberMessage>()->mValue : -1; }

// Initialize on the constructing thread, which becomes the main thread.
struct Library {
  Library() { Tarn::Messaging::Initialize(); }
  ~Library() { Tarn::Messaging::Terminate(); }
};

// What handlers do to the post being delivered: a coalesced post of the same
// key is queued anew (not merged into the delivery under way, and not lost);
// cancelling its token on the main thread returns at once and drops the
// rest; an idle-time post waits for the next idle broadcast.
TEST(PostKindsThreadTest, HandlersPostingOrCancellingDuringTheirOwnDeliveryAffectOnlyLaterPosts) {
  Library library;
  CallLog log;
  Tarn::PostCancelToken token;
  RecordingListener a("a", &log);
  a.SetAction([token](const Tarn::Message& inMessage) mutable {
    const int value = ValueOf(inMessage);
    if (value == 1) PostCoalescedMessageToUIThread(kStation_StatusBar, NumberMessage(2));
    if (value == 3) token.Cancel();
    if (value == 5) PostMessageAtIdleTime(kStation_StatusBar, NumberMessage(6));
  });
  AddListener(kStation_StatusBar, &a);
  std::thread([&token] {
    PostCoalescedMessageToUIThread(kStation_StatusBar, NumberMessage(1));
    for (int value : {3, 4}) PostMessageToUIThread(kStation_StatusBar, NumberMessage(value), Tarn::PostCancelToken(token));
    PostMessageAtIdleTime(kStation_StatusBar, NumberMessage(5));
    BroadcastMessage(kStation_Idle, PingMessage());  // off the main thread: delivers nothing
  }).join();
  FlushPostedMessagesOnUIThread();
  EXPECT_EQ((std::vector<std::string>{"a:1", "a:3"}), log.Entries());
  FlushPostedMessagesOnUIThread();
  BroadcastMessage(kStation_Idle, PingMessage());
  BroadcastMessage(kStation_Idle, PingMessage());
  EXPECT_EQ((std::vector<std::string>{"a:1", "a:3", "a:2", "a:5", "a:6"}), log.Entries());
  RemoveListener(kStation_StatusBar, &a);
}

TEST(PostKindsThreadTest, CancelOnAWorkerWaitsForTheRunningDeliveryAndNoneFollows) {
  Library library;
  Watchdog watchdog;
  for (int round = 0; round < 20; ++round) {
    Tarn::PostCancelToken token;
    std::atomic<bool> cancelled{false};
    std::atomic<int> delivered{0}, late{0};
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
      if (round == 0) entered.WaitFor();
      else WaitUntil([&] { return delivered.load() > 10 * round; }, std::chrono::milliseconds(200));
      token.Cancel();
      cancelled.store(true);
    });
    while (!cancelled.load()) FlushPostedMessagesOnUIThread();
    threads.JoinAll();
    FlushPostedMessagesOnUIThread();
    EXPECT_EQ(0, late.load()) << "round " << round;
    EXPECT_EQ(blocks, BlocksInUse()) << "round " << round;
    RemoveListener(kStation_StatusBar, &a);
  }
}

TEST(PostKindsThreadTest, CoalescedPostsRacingTheDrainDeliverEachKeysNewestOnceAndInOrder) {
  Library library;
  constexpr int kPosts = 20000;
  std::vector<int> heard[2];
  RecordingListener listeners[2] = {RecordingListener("a"), RecordingListener("b")};
  for (int worker = 0; worker < 2; ++worker) {
    listeners[worker].SetAction([&heard, worker](const Tarn::Message& inMessage) { heard[worker].push_back(ValueOf(inMessage)); });
    AddListener(worker == 0 ? kStation_StatusBar : kStation_Repeat, &listeners[worker]);
  }
  const std::size_t blocks = BlocksInUse();
  std::atomic<int> done{0};
  ThreadGroup threads;
  for (int worker = 0; worker < 2; ++worker)
    threads.Start([&, worker] {
      for (int i = 1; i <= kPosts; ++i) {
        if (worker == 0) PostCoalescedMessageToUIThread(kStation_StatusBar, NumberMessage(i));
        else PostCoalescedMessageToUIThread(kStation_Repeat, NumberMessage(i), 42);
      }
      done.fetch_add(1);
    });
  while (done.load() < 2) FlushPostedMessagesOnUIThread();
  threads.JoinAll();
  FlushPostedMessagesOnUIThread();
  EXPECT_EQ(blocks, BlocksInUse());
  for (int worker = 0; worker < 2; ++worker) {
    ASSERT_FALSE(heard[worker].empty());
    EXPECT_EQ(kPosts, heard[worker].back()) << "the last post was lost";
    EXPECT_TRUE(std::is_sorted(heard[worker].begin(), heard[worker].end(), std::less_equal<int>())) << "a copy went twice, or an older one after a newer";
    RemoveListener(worker == 0 ? kStation_StatusBar : kStation_Repeat, &listeners[worker]);
  }
}

TEST(PostKindsThreadTest, IdleBroadcastsWhilePostsArriveDeliverEachPostOnceInOrderBeforeTheIdleListeners) {
  Library library;
  constexpr int kPosts = 20000;
  std::atomic<int> done{0};
  int begun = 0, heardIdle = 0, misplaced = 0;
  std::vector<int> heard[2];
  RecordingListener idle("idle"), listeners[2] = {RecordingListener("a"), RecordingListener("b")};
  idle.SetAction([&](const Tarn::Message&) { ++heardIdle; });
  AddListener(kStation_Idle, &idle);
  for (int worker = 0; worker < 2; ++worker) {
    listeners[worker].SetAction([&, worker](const Tarn::Message& inMessage) {
      if (heardIdle != begun - 1) ++misplaced;
      heard[worker].push_back(ValueOf(inMessage));
    });
    AddListener(worker == 0 ? kStation_StatusBar : kStation_Repeat, &listeners[worker]);
  }
  ThreadGroup threads;
  for (int worker = 0; worker < 2; ++worker)
    threads.Start([&, worker] {
      for (int i = 0; i < kPosts; ++i) PostMessageAtIdleTime(worker == 0 ? kStation_StatusBar : kStation_Repeat, NumberMessage(i));
      done.fetch_add(1);
    });
  auto idleBroadcast = [&] { ++begun, BroadcastMessage(kStation_Idle, PingMessage()); };
  while (done.load() < 2) FlushPostedMessagesOnUIThread(), idleBroadcast();
  threads.JoinAll();
  idleBroadcast();
  EXPECT_EQ(0, misplaced) << "an idle post went outside an idle broadcast, or after its listeners";
  for (int worker = 0; worker < 2; ++worker) {
    std::vector<int> expected(kPosts);
    std::iota(expected.begin(), expected.end(), 0);
    EXPECT_EQ(expected, heard[worker]);
    RemoveListener(worker == 0 ? kStation_StatusBar : kStation_Repeat, &listeners[worker]);
  }
  RemoveListener(kStation_Idle, &idle);
}

}  // namespace
