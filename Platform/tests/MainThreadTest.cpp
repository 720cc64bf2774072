#include "MainThreadFixture.h"

#include <kivcore/MainThread.h>

#include <gtest/gtest.h>

#include <chrono>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

using namespace kivcore::threads;
using MainThreadRegistration = platform_test::MainThreadTest;
using MainThreadQueue = platform_test::MainThreadTest;

namespace {

TEST_F(MainThreadRegistration, RegisteringMakesTheCallerTheMainThread) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  ASSERT_TRUE(adaptor);
  EXPECT_TRUE(CurrentThreadIsMainThread());
  EXPECT_EQ(adaptor, GetRegisteredMainThread());
}

TEST_F(MainThreadRegistration, AllHoldersShareOneAdaptorAndTheLastToLetGoEndsTheRegistration) {
  auto first = RegisterCurrentThreadAsMainThread();
  auto second = RegisterCurrentThreadAsMainThread();
  auto looked = GetRegisteredMainThread();
  EXPECT_EQ(first, second);
  EXPECT_EQ(first, looked);
  first.reset();
  second.reset();
  EXPECT_TRUE(CurrentThreadIsMainThread()) << "the looked-up adaptor still holds the registration";
  looked.reset();
  EXPECT_FALSE(CurrentThreadIsMainThread());
  EXPECT_FALSE(GetRegisteredMainThread());
}

TEST_F(MainThreadRegistration, NothingIsMainBeforeAnyRegistration) {
  EXPECT_FALSE(GetRegisteredMainThread());
  EXPECT_FALSE(CurrentThreadIsMainThread());
}

TEST_F(MainThreadQueue, RunPendingCallsRunsEachCallOnceInQueueOrder) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  std::vector<int> ran;
  for (int i = 0; i < 5; ++i) EXPECT_TRUE(AsyncCallFromMainThread([&ran, i] { ran.push_back(i); }, 0));
  EXPECT_EQ(5u, adaptor->PendingCallCount());
  adaptor->RunPendingCalls();
  EXPECT_EQ((std::vector<int>{0, 1, 2, 3, 4}), ran);
  EXPECT_EQ(0u, adaptor->PendingCallCount());
  adaptor->RunPendingCalls();
  EXPECT_EQ(5u, ran.size());
}

TEST_F(MainThreadQueue, EmptyCallIsRefused) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  EXPECT_FALSE(AsyncCallFromMainThread(boost::function<void()>(), 0));
  EXPECT_EQ(0u, adaptor->PendingCallCount());
}

TEST_F(MainThreadQueue, CallIsCopiedAndReleasedOnceItHasRun) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  auto token = std::make_shared<int>(7);
  int seen = 0;
  {
    boost::function<void()> call = [token, &seen] { seen = *token; };
    ASSERT_TRUE(AsyncCallFromMainThread(call, 0));
  }
  EXPECT_EQ(2, token.use_count()) << "the queue holds its own copy";
  adaptor->RunPendingCalls();
  EXPECT_EQ(7, seen);
  EXPECT_EQ(1, token.use_count()) << "the copy goes when it has run";
}

TEST_F(MainThreadQueue, CallsQueuedWithNoMainThreadRunOnTheNextOne) {
  ASSERT_FALSE(GetRegisteredMainThread());
  bool ran = false;
  EXPECT_TRUE(AsyncCallFromMainThread([&ran] { ran = true; }, 0));
  auto adaptor = RegisterCurrentThreadAsMainThread();
  EXPECT_EQ(1u, adaptor->PendingCallCount());
  adaptor->RunPendingCalls();
  EXPECT_TRUE(ran);
}

TEST_F(MainThreadQueue, CallsQueuedWhileRunningWaitForTheNextRun) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  std::vector<std::string> ran;
  AsyncCallFromMainThread(
      [&] {
        ran.push_back("first");
        AsyncCallFromMainThread([&] { ran.push_back("queued by first"); }, 0);
      },
      0);
  AsyncCallFromMainThread([&] { ran.push_back("second"); }, 0);
  adaptor->RunPendingCalls();
  EXPECT_EQ((std::vector<std::string>{"first", "second"}), ran);
  EXPECT_EQ(1u, adaptor->PendingCallCount());
  adaptor->RunPendingCalls();
  EXPECT_EQ((std::vector<std::string>{"first", "second", "queued by first"}), ran);
}

TEST_F(MainThreadQueue, ThrowingCallLeavesTheRestQueuedInFrontOfLaterCalls) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  std::vector<int> ran;
  AsyncCallFromMainThread(
      [&] {
        ran.push_back(1);
        AsyncCallFromMainThread([&] { ran.push_back(5); }, 0);  // queued meanwhile
      },
      0);
  AsyncCallFromMainThread(
      [&] {
        ran.push_back(2);
        throw std::runtime_error("call failed");
      },
      0);
  AsyncCallFromMainThread([&] { ran.push_back(3); }, 0);
  AsyncCallFromMainThread([&] { ran.push_back(4); }, 0);

  EXPECT_THROW(adaptor->RunPendingCalls(), std::runtime_error);
  EXPECT_EQ((std::vector<int>{1, 2}), ran);
  EXPECT_EQ(3u, adaptor->PendingCallCount());
  adaptor->RunPendingCalls();
  EXPECT_EQ((std::vector<int>{1, 2, 3, 4, 5}), ran);
}

TEST_F(MainThreadQueue, CallMayRunPendingCallsItself) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  std::vector<std::string> ran;
  AsyncCallFromMainThread(
      [&] {
        ran.push_back("outer begins");
        AsyncCallFromMainThread([&] { ran.push_back("nested"); }, 0);
        adaptor->RunPendingCalls();
        ran.push_back("outer ends");
      },
      0);
  AsyncCallFromMainThread([&] { ran.push_back("after outer"); }, 0);
  adaptor->RunPendingCalls();
  EXPECT_EQ((std::vector<std::string>{"outer begins", "nested", "outer ends", "after outer"}), ran);
  EXPECT_EQ(0u, adaptor->PendingCallCount());
}

// The nested run's remainder was queued after the outer run's remainder, and
// must stay behind it when both are put back.
TEST_F(MainThreadQueue, ThrowFromANestedRunKeepsBothRemaindersInOrder) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  std::vector<std::string> ran;
  AsyncCallFromMainThread(
      [&] {
        AsyncCallFromMainThread([] { throw std::runtime_error("nested failure"); }, 0);
        AsyncCallFromMainThread([&] { ran.push_back("nested rest"); }, 0);
        adaptor->RunPendingCalls();
      },
      0);
  AsyncCallFromMainThread([&] { ran.push_back("outer rest"); }, 0);
  EXPECT_THROW(adaptor->RunPendingCalls(), std::runtime_error);
  EXPECT_TRUE(ran.empty());
  EXPECT_EQ(2u, adaptor->PendingCallCount());
  adaptor->RunPendingCalls();
  EXPECT_EQ((std::vector<std::string>{"outer rest", "nested rest"}), ran);
}

TEST_F(MainThreadQueue, WaitingReturnsAtOnceWhenCallsAreQueued) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  AsyncCallFromMainThread([] {}, 0);
  EXPECT_TRUE(adaptor->WaitForPendingCalls(-1));
  EXPECT_TRUE(adaptor->WaitForPendingCalls(0));
}

TEST_F(MainThreadQueue, WaitingWithNothingQueuedTimesOutWithFalse) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  EXPECT_FALSE(adaptor->WaitForPendingCalls(0));
  const auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(adaptor->WaitForPendingCalls(30));
  EXPECT_GE(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(30));
}

TEST_F(MainThreadQueue, WakeupHandlerIsCalledForEveryQueuedCallUntilRemoved) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  int wakeups = 0;
  adaptor->SetWakeupHandler([&] { ++wakeups; });
  AsyncCallFromMainThread([] {}, 0);
  AsyncCallFromMainThread([] {}, 0);
  EXPECT_EQ(2, wakeups);
  EXPECT_FALSE(AsyncCallFromMainThread(boost::function<void()>(), 0));
  EXPECT_EQ(2, wakeups) << "a refused call wakes nobody";
  adaptor->SetWakeupHandler(nullptr);
  AsyncCallFromMainThread([] {}, 0);
  EXPECT_EQ(2, wakeups);
}

}  // namespace
