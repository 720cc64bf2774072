#include "MainThreadFixture.h"
#include "TestSupport.h"

#include <kivcore/MainThread.h>

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <thread>
#include <vector>

using namespace kivcore::threads;
using platform_test::kDeadline;
using platform_test::Latch;
using platform_test::ThreadGroup;
using MainThreadAcrossThreads = platform_test::MainThreadTest;

namespace {

int DeadlineMilliseconds() { return static_cast<int>(std::chrono::milliseconds(kDeadline).count()); }

TEST_F(MainThreadAcrossThreads, OnlyTheRegisteredThreadIsMain) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  std::atomic<bool> otherIsMain{true};
  ThreadGroup threads;
  threads.Start([&] { otherIsMain = CurrentThreadIsMainThread(); });
  threads.JoinAll();
  EXPECT_FALSE(otherIsMain.load());
  EXPECT_TRUE(CurrentThreadIsMainThread());
}

TEST_F(MainThreadAcrossThreads, RegisteringFromAnotherThreadMovesTheMainThreadThere) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  std::atomic<bool> otherIsMain{false};
  boost::shared_ptr<AsyncEventLoopAdaptor> otherAdaptor;
  ThreadGroup threads;
  threads.Start([&] {
    otherAdaptor = RegisterCurrentThreadAsMainThread();
    otherIsMain = CurrentThreadIsMainThread();
  });
  threads.JoinAll();
  EXPECT_TRUE(otherIsMain.load());
  EXPECT_EQ(adaptor, otherAdaptor);
  EXPECT_FALSE(CurrentThreadIsMainThread());
}

TEST_F(MainThreadAcrossThreads, NoThreadIsMainOnceTheLastHolderElsewhereLetsGo) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  Latch handedOver(1);
  Latch released(1);
  ThreadGroup threads;
  threads.Start([&, held = adaptor]() mutable {
    handedOver.CountDown();
    if (!released.WaitFor()) return;
    held.reset();
  });
  ASSERT_TRUE(handedOver.WaitFor());
  adaptor.reset();
  EXPECT_TRUE(CurrentThreadIsMainThread()) << "the other thread still holds the adaptor";
  released.CountDown();
  threads.JoinAll();
  EXPECT_FALSE(CurrentThreadIsMainThread());
  EXPECT_FALSE(GetRegisteredMainThread());
}

// An old adaptor's last release races a fresh registration on another thread:
// the fresh registration must survive the old adaptor's destruction. The two
// threads meet at a spin barrier and then one of them waits a little longer
// each round, so that the rounds sweep the registration across the release.
TEST_F(MainThreadAcrossThreads, FreshRegistrationSurvivesTheRacingReleaseOfTheOldAdaptor) {
  constexpr int kRounds = 4000;
  std::atomic<int> lost{0};
  for (int round = 0; round < kRounds; ++round) {
    auto old = RegisterCurrentThreadAsMainThread();
    std::atomic<int> arrived{0};
    Latch oldReleased(1);
    const int registerDelay = round % 200;
    const int releaseDelay = (round / 200) % 2 == 0 ? 0 : 100;
    ThreadGroup threads;
    threads.Start([&] {
      arrived.fetch_add(1);
      while (arrived.load() < 2) std::this_thread::yield();
      for (volatile int spin = 0; spin < registerDelay; ++spin) {
      }
      auto fresh = RegisterCurrentThreadAsMainThread();
      if (!oldReleased.WaitFor()) return;
      if (!CurrentThreadIsMainThread() || GetRegisteredMainThread() != fresh) lost.fetch_add(1);
    });
    arrived.fetch_add(1);
    while (arrived.load() < 2) std::this_thread::yield();
    for (volatile int spin = 0; spin < releaseDelay; ++spin) {
    }
    old.reset();
    oldReleased.CountDown();
    threads.JoinAll();
  }
  EXPECT_EQ(0, lost.load());
}

TEST_F(MainThreadAcrossThreads, CallsFromManyThreadsAllRunOnceOnTheMainThreadInEachSendersOrder) {
  constexpr int kSenders = 4;
  constexpr int kCallsEach = 2000;
  auto adaptor = RegisterCurrentThreadAsMainThread();
  const std::thread::id mainId = std::this_thread::get_id();
  std::vector<int> lastSeen(kSenders, -1);  // touched only by the main thread
  int outOfOrder = 0;
  int offMain = 0;
  int ran = 0;
  ThreadGroup senders;
  for (int s = 0; s < kSenders; ++s) {
    senders.Start([&, s] {
      for (int i = 0; i < kCallsEach; ++i) {
        AsyncCallFromMainThread(
            [&, s, i] {
              if (std::this_thread::get_id() != mainId || !CurrentThreadIsMainThread()) ++offMain;
              if (lastSeen[s] != i - 1) ++outOfOrder;
              lastSeen[s] = i;
              ++ran;
            },
            0);
      }
    });
  }
  const auto giveUp = std::chrono::steady_clock::now() + kDeadline;
  while (ran < kSenders * kCallsEach && std::chrono::steady_clock::now() < giveUp) {
    if (adaptor->WaitForPendingCalls(100)) adaptor->RunPendingCalls();
  }
  senders.JoinAll();
  adaptor->RunPendingCalls();
  EXPECT_EQ(kSenders * kCallsEach, ran);
  EXPECT_EQ(0, outOfOrder);
  EXPECT_EQ(0, offMain);
  EXPECT_EQ(0u, adaptor->PendingCallCount());
}

TEST_F(MainThreadAcrossThreads, WaitingWithoutLimitIsEndedByACallQueuedElsewhere) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  Latch aboutToWait(1);
  std::atomic<bool> result{false};
  ThreadGroup threads;
  threads.Start([&] {
    aboutToWait.CountDown();
    result = adaptor->WaitForPendingCalls(-1);
  });
  ASSERT_TRUE(aboutToWait.WaitFor());
  AsyncCallFromMainThread([] {}, 0);
  threads.JoinAll();  // a waiter that is never woken fails here
  EXPECT_TRUE(result.load());
}

TEST_F(MainThreadAcrossThreads, WaitingWithALimitIsEndedEarlyByACallQueuedElsewhere) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  Latch aboutToWait(1);
  ThreadGroup threads;
  threads.Start([&] {
    if (aboutToWait.WaitFor()) AsyncCallFromMainThread([] {}, 0);
  });
  const auto start = std::chrono::steady_clock::now();
  aboutToWait.CountDown();
  EXPECT_TRUE(adaptor->WaitForPendingCalls(DeadlineMilliseconds()));
  // A waiter that is not woken would only notice the call at its time limit.
  EXPECT_LT(std::chrono::steady_clock::now() - start, kDeadline / 2);
  threads.JoinAll();
}

TEST_F(MainThreadAcrossThreads, WakeupHandlerRunsOnTheQueuingThreadOutsideTheQueueLock) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  std::thread::id handlerThread;
  std::size_t pendingSeen = 0;
  adaptor->SetWakeupHandler([&] {
    handlerThread = std::this_thread::get_id();
    pendingSeen = adaptor->PendingCallCount();  // would deadlock under the queue's lock
  });
  std::thread::id senderThread;
  ThreadGroup threads;
  threads.Start([&] {
    senderThread = std::this_thread::get_id();
    AsyncCallFromMainThread([] {}, 0);
  });
  threads.JoinAll();
  EXPECT_EQ(senderThread, handlerThread);
  EXPECT_EQ(1u, pendingSeen);
}

TEST_F(MainThreadAcrossThreads, ReplacingTheWakeupHandlerWhileOthersQueueIsSafe) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  std::atomic<int> wakeups{0};
  std::atomic<bool> stop{false};
  constexpr int kCalls = 3000;
  ThreadGroup threads;
  threads.Start([&] {
    for (int i = 0; i < kCalls; ++i) AsyncCallFromMainThread([] {}, 0);
    stop = true;
  });
  threads.Start([&] {
    while (!stop.load()) {
      adaptor->SetWakeupHandler([&wakeups] { wakeups.fetch_add(1); });
      adaptor->SetWakeupHandler(nullptr);
    }
  });
  threads.JoinAll();
  EXPECT_EQ(static_cast<std::size_t>(kCalls), adaptor->PendingCallCount());
  EXPECT_LE(wakeups.load(), kCalls);
  adaptor->RunPendingCalls();
}

TEST_F(MainThreadAcrossThreads, TwoThreadsRunningPendingCallsAtOnceRunEachCallOnce) {
  constexpr int kCalls = 20000;
  auto adaptor = RegisterCurrentThreadAsMainThread();
  std::vector<std::atomic<int>> runs(kCalls);
  ThreadGroup threads;
  threads.Start([&] {
    for (int i = 0; i < kCalls; ++i) AsyncCallFromMainThread([&runs, i] { runs[i].fetch_add(1); }, 0);
  });
  for (int r = 0; r < 2; ++r) {
    threads.Start([&] {
      for (int i = 0; i < 2000; ++i) adaptor->RunPendingCalls();
    });
  }
  threads.JoinAll();
  adaptor->RunPendingCalls();
  int wrong = 0;
  for (auto& count : runs) wrong += count.load() != 1;
  EXPECT_EQ(0, wrong);
}

}  // namespace
