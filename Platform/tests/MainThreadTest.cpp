// The main thread's registration and its queue of calls: who is main, the
// order calls run in (nested runs and throwing calls included), and when the
// wakeup handler is called.
#include <kivcore/Error.h>
#include <kivcore/MainThread.h>

#include <gtest/gtest.h>

#include <chrono>
#include <new>
#include <stdexcept>
#include <string>
#include <thread>

namespace {

using namespace kivcore::threads;

// Each test ends with no main thread, an empty queue and no wakeup handler:
// all three are process-wide.
class MainThreadTest : public ::testing::Test {
protected:
  void TearDown() override {
    auto adaptor = RegisterCurrentThreadAsMainThread();
    adaptor->SetWakeupHandler(nullptr);
    while (adaptor->PendingCallCount() != 0) adaptor->RunPendingCalls();
  }
  std::string mLog;
  bool Queue(const char* inName, bool inThrows = false) {
    return AsyncCallFromMainThread([this, inName, inThrows] { if ((mLog += inName), inThrows) throw std::runtime_error(inName); }, 0);
  }
};

TEST_F(MainThreadTest, TheMainThreadIsTheLatestRegistrationWhileAnyoneHoldsIt) {
  auto first = RegisterCurrentThreadAsMainThread();
  EXPECT_EQ(first, RegisterCurrentThreadAsMainThread());
  EXPECT_TRUE(CurrentThreadIsMainThread());
  std::thread([] {
    EXPECT_FALSE(CurrentThreadIsMainThread());
    auto moved = RegisterCurrentThreadAsMainThread();
    EXPECT_TRUE(CurrentThreadIsMainThread());
  }).join();
  EXPECT_FALSE(CurrentThreadIsMainThread()) << "the worker registered last";
  EXPECT_EQ(first, GetRegisteredMainThread());
  first.reset();
  EXPECT_FALSE(GetRegisteredMainThread());
  EXPECT_FALSE(AsyncCallFromMainThread(boost::function<void()>(), 0)) << "an empty call is refused";
}

// A call that runs pending calls itself (a progress dialog flushing) must not
// let calls queued during the outer run overtake the outer run's own.
TEST_F(MainThreadTest, ANestedRunFinishesTheOuterRunsCallsBeforeNewerOnes) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  AsyncCallFromMainThread(
      [&] {
        mLog += "a";
        Queue("c");
        adaptor->RunPendingCalls();
        mLog += "|";
      },
      0);
  Queue("b");
  adaptor->RunPendingCalls();
  EXPECT_EQ("abc|", mLog);
}

TEST_F(MainThreadTest, AThrowingCallLeavesTheRestInFrontAndWakesTheLoopForThem) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  int wakeups = 0;
  adaptor->SetWakeupHandler([&wakeups] { ++wakeups; });
  // The throw comes from a nested run, inside the outer run's calls: what is
  // left of them goes back in front of newer calls all the same.
  AsyncCallFromMainThread([&] { adaptor->RunPendingCalls(); }, 0);
  Queue("a");
  Queue("b", true);
  Queue("c");
  EXPECT_EQ(1, wakeups) << "one wakeup per batch";
  EXPECT_THROW(adaptor->RunPendingCalls(), std::runtime_error);
  Queue("d");
  EXPECT_EQ(2, wakeups) << "one more for the calls put back, none for d";
  adaptor->RunPendingCalls();
  EXPECT_EQ("abcd", mLog);
  EXPECT_EQ(0u, adaptor->PendingCallCount());
}

// A post is queued before its wakeup runs: a wakeup that fails must not make
// the post look failed (a poster retrying would deliver twice). Of two
// integrations, the newest holds the wakeups whichever goes first: the newer
// one's removal hands them back to the older one, still running, and the
// older one's removal leaves the newer one's alone.
TEST_F(MainThreadTest, WakeupsFailWithoutFailingThePostAndGoToTheNewestLiveOwner) {
  auto adaptor = RegisterCurrentThreadAsMainThread();
  int exceptions = 0, older = 0, newer = 0;
  auto previous = kivcore::config::ErrorManager::SetExceptionHandler([&exceptions](std::exception_ptr) { ++exceptions; });
  adaptor->SetWakeupHandler([&older] { if (++older == 1) throw std::bad_alloc(); }, &older);
  EXPECT_TRUE(Queue("a")) << "queued, although its wakeup failed";
  EXPECT_EQ(1, exceptions);
  Queue("b");
  EXPECT_EQ(2, older) << "the next call retries the failed wakeup";
  kivcore::config::ErrorManager::SetExceptionHandler(previous);
  adaptor->SetWakeupHandler([&newer] { ++newer; }, &newer);
  EXPECT_EQ(1, newer) << "installed while calls were queued";
  EXPECT_TRUE(adaptor->RemoveWakeupHandler(&newer));
  EXPECT_EQ(3, older) << "handed back while calls were queued";
  adaptor->RunPendingCalls();
  adaptor->SetWakeupHandler([&newer] { ++newer; }, &newer);
  EXPECT_TRUE(adaptor->RemoveWakeupHandler(&older));
  EXPECT_FALSE(adaptor->RemoveWakeupHandler(&older));
  Queue("c");
  EXPECT_EQ(2, newer);
  EXPECT_EQ(3, older);
  EXPECT_TRUE(adaptor->RemoveWakeupHandler(&newer));
  adaptor->RunPendingCalls();
  EXPECT_FALSE(adaptor->WaitForPendingCalls(0));
  std::thread late([this] {
    std::this_thread::sleep_for(std::chrono::milliseconds(5));  // most likely while the main thread waits
    Queue("d");
  });
  EXPECT_TRUE(adaptor->WaitForPendingCalls(-1));
  late.join();
  EXPECT_EQ(2, newer);
  EXPECT_EQ(3, older);
  adaptor->RunPendingCalls();
  EXPECT_EQ("abcd", mLog);
}

}  // namespace
