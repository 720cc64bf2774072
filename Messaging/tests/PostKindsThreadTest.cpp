// Coalesced, cancellable and idle-time posts: where each is delivered, which
// copy, when it is dropped and freed, and the same while workers post, the
// main thread drains and tokens are cancelled at once.
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

// A message whose copies are counted, to see them freed.
struct Counted : Tarn::MessageImpl<Counted> {
  Counted() { ++sLive; }
  Counted(const Counted&) : MessageImpl() { ++sLive; }
  ~Counted() override { --sLive; }
  static inline std::atomic<int> sLive{0};
};

// Initialize on the constructing thread, which becomes the main thread.
struct Library {
  Library() { Tarn::Messaging::Initialize(); }
  ~Library() { Tarn::Messaging::Terminate(); }
};

TEST(PostKindsThreadTest, ACoalescedPostDeliversTheNewestCopyInTheEarliestPlaceOnce) {
  Library library;
  CallLog log;
  RecordingListener a("a", &log), b("b", &log);
  // Posted while its own post is being delivered: queued anew, not lost.
  b.SetAction([](const Tarn::Message& inMessage) { if (ValueOf(inMessage) == 4) PostCoalescedMessageToUIThread(kStation_Repeat, NumberMessage(8)); });
  AddListener(kStation_StatusBar, &a);
  AddListener(kStation_Repeat, &b);
  const std::size_t blocks = BlocksInUse();
  std::thread([] {
    PostCoalescedMessageToUIThread(kStation_StatusBar, NumberMessage(1));
    PostMessageToUIThread(kStation_StatusBar, NumberMessage(2), false);
    PostCoalescedMessageToUIThread(kStation_StatusBar, NumberMessage(3), 7);  // a caller key never meets a type key
    PostCoalescedMessageToUIThread(kStation_Repeat, NumberMessage(4));
    PostCoalescedMessageToUIThread(kStation_StatusBar, NumberMessage(5));
    PostCoalescedMessageToUIThread(kStation_StatusBar, NumberMessage(6), 7);
  }).join();
  EXPECT_EQ(blocks + 4, BlocksInUse()) << "a replaced copy is freed at once";
  FlushPostedMessagesOnUIThread();
  EXPECT_EQ((std::vector<std::string>{"a:5", "a:2", "a:6", "b:4"}), log.Entries());
  FlushPostedMessagesOnUIThread();
  EXPECT_EQ(1u, log.Count("b:8"));
  EXPECT_EQ(blocks, BlocksInUse());
  RemoveListener(kStation_StatusBar, &a);
  RemoveListener(kStation_Repeat, &b);
}

TEST(PostKindsThreadTest, CancelDropsAndFreesEveryUndeliveredPostOfItsTokenAtOnce) {
  Library library;
  CallLog log;
  Tarn::PostCancelToken token, other;
  RecordingListener a("a", &log);
  // On the main thread, inside a delivery of the token: returns at once.
  a.SetAction([token](const Tarn::Message& inMessage) mutable { if (ValueOf(inMessage) == 2) token.Cancel(); });
  AddListener(kStation_StatusBar, &a);
  const std::size_t blocks = BlocksInUse();
  std::thread([&] {
    const Tarn::PostCancelToken copy = token;
    for (int value : {1, 2, 3}) PostMessageToUIThread(kStation_StatusBar, NumberMessage(value), value == 3 ? copy : token);
    PostMessageToUIThread(kStation_StatusBar, NumberMessage(4), other);
    PostMessageToUIThread(kStation_StatusBar, NumberMessage(5), false);
  }).join();
  FlushPostedMessagesOnUIThread();
  EXPECT_EQ((std::vector<std::string>{"a:1", "a:2", "a:4", "a:5"}), log.Entries());
  EXPECT_TRUE(token.IsCancelled());
  EXPECT_EQ(blocks, BlocksInUse());

  PostMessageToUIThread(kStation_StatusBar, NumberMessage(6), other);
  PostMessageToUIThread(kStation_StatusBar, NumberMessage(7), other);
  EXPECT_EQ(blocks + 2, BlocksInUse());
  std::thread([other]() mutable { other.Cancel(); }).join();
  EXPECT_EQ(blocks, BlocksInUse()) << "Cancel frees the copies, not the queue's next run";
  PostMessageToUIThread(kStation_StatusBar, NumberMessage(8), other);
  EXPECT_EQ(blocks, BlocksInUse()) << "a post with a cancelled token copies nothing";
  FlushPostedMessagesOnUIThread();
  EXPECT_EQ(4u, log.Entries().size());
  RemoveListener(kStation_StatusBar, &a);
}

TEST(PostKindsThreadTest, AnIdlePostGoesWithTheNextHeardIdleBroadcastBeforeItsListenersAndTerminateFreesIt) {
  Tarn::Messaging::Initialize();
  CallLog log;
  RecordingListener a("a", &log), idle("idle", &log);
  a.SetAction([](const Tarn::Message& inMessage) { if (ValueOf(inMessage) == 1) PostMessageAtIdleTime(kStation_StatusBar, NumberMessage(3)); });
  AddListener(kStation_StatusBar, &a);
  AddListener(kStation_Idle, &idle);
  HasListeners(kStation_Repeat);  // makes the station, so that no block is its
  const std::size_t blocks = BlocksInUse();
  std::thread([] { for (int value : {1, 2}) PostMessageAtIdleTime(kStation_StatusBar, NumberMessage(value)); }).join();
  FlushPostedMessagesOnUIThread();
  BroadcastMessage(kStation_Repeat, PingMessage());
  StopBroadcasting(kStation_Idle);
  BroadcastMessage(kStation_Idle, PingMessage());
  StartBroadcasting(kStation_Idle);
  std::thread([] { BroadcastMessage(kStation_Idle, PingMessage()); }).join();
  EXPECT_TRUE(log.Entries().empty()) << "only a heard idle broadcast on the main thread delivers";
  BroadcastMessage(kStation_Idle, PingMessage());
  BroadcastMessage(kStation_Idle, PingMessage());
  EXPECT_EQ((std::vector<std::string>{"a:1", "a:2", "idle:ping", "a:3", "idle:ping"}), log.Entries());
  EXPECT_EQ(blocks, BlocksInUse());
  PostMessageAtIdleTime(kStation_StatusBar, Counted());
  EXPECT_EQ(1, Counted::sLive.load());
  Tarn::Messaging::Terminate();
  EXPECT_EQ(0, Counted::sLive.load()) << "Terminate left an idle post behind";
  Tarn::Messaging::Initialize();
  AddListener(kStation_StatusBar, &a);
  BroadcastMessage(kStation_Idle, PingMessage());
  EXPECT_EQ(5u, log.Entries().size());
  Tarn::Messaging::Terminate();
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
