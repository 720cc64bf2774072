// The broadcaster under concurrency: removals on worker threads while the
// main thread delivers to the listener being removed, listeners destroyed on
// workers during their delivery, broadcasts from the wrong thread, and a
// stress run of every kind of listener coming and going during continuous
// broadcasts.
//
// The in-flight window is made deterministic with handshakes: the handler
// signals that it runs, a worker removes, and the handler does not return
// before the remover is seen waiting. To see that, this executable
// interposes kivcore's Gate::PassThrough and Gate::Open (the definitions
// below are exported from the executable, so the messaging library's calls
// reach them first); they count waiters and openings and forward to
// kivcore's own definitions. A removal that wrongly does not wait then shows
// as a waiter that never comes, which fails a bounded wait instead of
// relying on timing.
#include "TestSupport.h"

#include <TarnMessaging/Broadcaster.h>
#include <TarnMessaging/Listener.h>

#include <kivcore/Gate.h>
#include <kivcore/MainThread.h>

#include <gtest/gtest.h>

#include <dlfcn.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <cstdlib>
#include <memory>
#include <mutex>
#include <random>
#include <thread>
#include <vector>

using messaging_test::AnyListener;
using messaging_test::CallLog;
using messaging_test::ContractDialogRecorder;
using messaging_test::CountedSafeListener;
using messaging_test::ErrorRecorder;
using messaging_test::kDeadline;
using messaging_test::KindParamName;
using messaging_test::Latch;
using messaging_test::ListenerKind;
using messaging_test::MainThreadGuard;
using messaging_test::NumberMessage;
using messaging_test::PingMessage;
using messaging_test::RecordingListener;
using messaging_test::ThreadGroup;
using messaging_test::Watchdog;
using Log = std::vector<std::string>;

namespace {

// What the interposed gate operations saw.
class GateWatch {
public:
  static GateWatch& Get() {
    static GateWatch* watch = new GateWatch;  // never destroyed: gates may be used at exit
    return *watch;
  }
  void Reset() {
    std::lock_guard<std::mutex> lock(mMutex);
    mWaiting = 0;
    mWaits = 0;
    mOpens = 0;
  }
  void EnterWait() {
    std::lock_guard<std::mutex> lock(mMutex);
    ++mWaiting;
    ++mWaits;
    mChanged.notify_all();
  }
  void LeaveWait() {
    std::lock_guard<std::mutex> lock(mMutex);
    --mWaiting;
    mChanged.notify_all();
  }
  void CountOpen() {
    std::lock_guard<std::mutex> lock(mMutex);
    ++mOpens;
  }
  // True when at least inCount threads wait on a gate before the deadline.
  bool WaitForWaiters(int inCount) {
    std::unique_lock<std::mutex> lock(mMutex);
    return mChanged.wait_for(lock, kDeadline, [&] { return mWaiting >= inCount; });
  }
  int Waiting() {
    std::lock_guard<std::mutex> lock(mMutex);
    return mWaiting;
  }
  int Opens() {
    std::lock_guard<std::mutex> lock(mMutex);
    return mOpens;
  }
  int Waits() {
    std::lock_guard<std::mutex> lock(mMutex);
    return mWaits;
  }

private:
  std::mutex mMutex;
  std::condition_variable mChanged;
  int mWaiting = 0;  // threads inside PassThrough; guarded by mMutex
  int mWaits = 0;    // calls of PassThrough since Reset; guarded by mMutex
  int mOpens = 0;    // calls of Open since Reset; guarded by mMutex
};

template <class Function>
Function NextDefinition(const char* inMangledName) {
  void* symbol = ::dlsym(RTLD_NEXT, inMangledName);
  if (symbol == nullptr) {
    std::fprintf(stderr, "interposer: %s not found after the executable\n", inMangledName);
    std::abort();
  }
  return reinterpret_cast<Function>(symbol);
}

}  // namespace

// The real members are reached as plain functions taking the object first,
// which is how the platform's C++ ABI passes `this`.
bool kivcore::threads::Gate::PassThrough(int inTimeoutMilliseconds) {
  static const auto real = NextDefinition<bool (*)(Gate*, int)>("_ZN7kivcore7threads4Gate11PassThroughEi");
  GateWatch::Get().EnterWait();
  const bool open = real(this, inTimeoutMilliseconds);
  GateWatch::Get().LeaveWait();
  return open;
}

void kivcore::threads::Gate::Open() {
  static const auto real = NextDefinition<void (*)(Gate*)>("_ZN7kivcore7threads4Gate4OpenEv");
  GateWatch::Get().CountOpen();
  real(this);
}

namespace {

// True once inWaiters removers wait on a gate; false as soon as one of them
// returns instead (a removal that did not wait), or at the deadline.
bool RemoversWait(int inWaiters, const std::atomic<int>& inReturned) {
  messaging_test::WaitUntil([&] { return GateWatch::Get().Waiting() >= inWaiters || inReturned.load() > 0; });
  return GateWatch::Get().Waiting() >= inWaiters && inReturned.load() == 0;
}

class BroadcasterThreads : public ::testing::Test {
protected:
  BroadcasterThreads() {
    GateWatch::Get().Reset();
    // Computed here, before any worker exists: the first use of a type's ID
    // is not synchronised.
    NumberMessage::StaticMessageID();
    PingMessage::StaticMessageID();
  }

  Watchdog mWatchdog;  // the main thread itself may block if the library is wrong
  MainThreadGuard mMainThread;
  CallLog mLog;
  Tarn::Broadcaster mBroadcaster;
};

class BroadcasterThreadKinds : public BroadcasterThreads, public ::testing::WithParamInterface<ListenerKind> {};

INSTANTIATE_TEST_SUITE_P(AllKinds, BroadcasterThreadKinds, ::testing::ValuesIn(messaging_test::kAllListenerKinds),
                         KindParamName());

class BroadcasterThreadSharedKinds : public BroadcasterThreads, public ::testing::WithParamInterface<ListenerKind> {};

INSTANTIATE_TEST_SUITE_P(SharedKinds, BroadcasterThreadSharedKinds,
                         ::testing::ValuesIn(messaging_test::kSharedListenerKinds), KindParamName());

// What a handler and the removers observed of each other.
struct Handshake {
  Latch mEntered;                      // the handler runs
  std::atomic<bool> mHandlerDone{false};  // set as the handler's last step
  bool mWaitersSeen = false;           // main thread only
  int mOpensBeforeReturn = -1;         // main thread only
};

// ---------------------------------------------------------------------------
// Removal during a delivery

TEST_P(BroadcasterThreadKinds, WorkerRemovalWaitsUntilTheRunningHandlerReturns) {
  AnyListener target(GetParam(), "T", &mLog);
  Handshake handshake;
  std::atomic<int> returned{0};
  std::atomic<bool> removerSawHandlerDone{false};
  target.SetAction([&](const Tarn::Message&) {
    handshake.mEntered.CountDown();
    handshake.mWaitersSeen = RemoversWait(1, returned);
    handshake.mOpensBeforeReturn = GateWatch::Get().Opens();
    handshake.mHandlerDone.store(true);
  });
  target.Attach(mBroadcaster);
  {
    ThreadGroup workers;
    workers.Start([&] {
      ASSERT_TRUE(handshake.mEntered.WaitFor());
      target.Detach(mBroadcaster);
      removerSawHandlerDone.store(handshake.mHandlerDone.load());
      returned.fetch_add(1);
    });
    mBroadcaster.BroadcastMessage(NumberMessage(1));
  }
  EXPECT_TRUE(handshake.mWaitersSeen) << "the remover never waited for the delivery in progress";
  EXPECT_EQ(0, handshake.mOpensBeforeReturn);
  EXPECT_TRUE(removerSawHandlerDone.load());
  mBroadcaster.BroadcastMessage(NumberMessage(2));
  EXPECT_EQ(Log{"T:1"}, mLog.Entries());
  EXPECT_FALSE(mBroadcaster.HasListeners());
}

// The second remover finds no entry any more (the first took it out), yet
// must not return while the handler runs: its caller may destroy the
// listener as soon as it returns.
TEST_P(BroadcasterThreadKinds, TwoWorkersRemovingOneBlockedListenerBothWaitUntilTheHandlerReturns) {
  AnyListener target(GetParam(), "T", &mLog);
  Handshake handshake;
  std::atomic<int> returned{0};
  std::atomic<int> removersThatSawHandlerDone{0};
  target.SetAction([&](const Tarn::Message&) {
    handshake.mEntered.CountDown();
    handshake.mWaitersSeen = RemoversWait(2, returned);
    handshake.mOpensBeforeReturn = GateWatch::Get().Opens();
    handshake.mHandlerDone.store(true);
  });
  target.Attach(mBroadcaster);
  {
    ThreadGroup workers;
    for (int i = 0; i < 2; ++i) {
      workers.Start([&] {
        ASSERT_TRUE(handshake.mEntered.WaitFor());
        target.Detach(mBroadcaster);
        if (handshake.mHandlerDone.load()) removersThatSawHandlerDone.fetch_add(1);
        returned.fetch_add(1);
      });
    }
    mBroadcaster.BroadcastMessage(NumberMessage(1));
  }
  EXPECT_TRUE(handshake.mWaitersSeen) << "fewer than two removers waited for the delivery in progress";
  EXPECT_EQ(0, handshake.mOpensBeforeReturn);
  EXPECT_EQ(2, removersThatSawHandlerDone.load());
  EXPECT_FALSE(mBroadcaster.HasListeners());
}

TEST_F(BroadcasterThreads, ListenerDetachingInItsDestructorIsDestroyedOnAWorkerOnlyAfterItsHandlerReturns) {
  auto target = std::make_unique<RecordingListener>("T", &mLog);
  target->DetachInDestructor(mBroadcaster);
  const auto probe = target->GetProbe();
  Handshake handshake;
  std::atomic<int> returned{0};
  bool destroyedDuringHandler = true;
  std::atomic<bool> destructorSawHandlerDone{false};
  target->SetAction([&](const Tarn::Message&) {
    handshake.mEntered.CountDown();
    handshake.mWaitersSeen = RemoversWait(1, returned);
    destroyedDuringHandler = probe->mDestroyed.load();
    handshake.mHandlerDone.store(true);
  });
  mBroadcaster.AddListener(target.get());
  {
    ThreadGroup workers;
    workers.Start([&] {
      ASSERT_TRUE(handshake.mEntered.WaitFor());
      target.reset();
      destructorSawHandlerDone.store(handshake.mHandlerDone.load());
      returned.fetch_add(1);
    });
    mBroadcaster.BroadcastMessage(NumberMessage(1));
  }
  EXPECT_TRUE(handshake.mWaitersSeen);
  EXPECT_FALSE(destroyedDuringHandler);
  EXPECT_TRUE(destructorSawHandlerDone.load());
  EXPECT_TRUE(probe->mDestroyed.load());
  EXPECT_FALSE(mBroadcaster.HasListeners());
}

TEST_P(BroadcasterThreadSharedKinds, ListenerReleasedOnAWorkerDuringItsDeliveryLivesUntilItsHandlerReturns) {
  AnyListener target(GetParam(), "T", &mLog);
  const auto probe = target.GetProbe();
  Latch entered;
  Latch released;
  bool releasedInTime = false;
  bool destroyedDuringHandler = true;
  target.SetAction([&](const Tarn::Message&) {
    entered.CountDown();
    releasedInTime = released.WaitFor();
    destroyedDuringHandler = probe->mDestroyed.load();
  });
  target.Attach(mBroadcaster);
  {
    ThreadGroup workers;
    workers.Start([&] {
      ASSERT_TRUE(entered.WaitFor());
      target.Destroy();  // the owner's last reference, not a removal: nothing to wait for
      released.CountDown();
    });
    mBroadcaster.BroadcastMessage(NumberMessage(1));
  }
  EXPECT_TRUE(releasedInTime);
  EXPECT_FALSE(destroyedDuringHandler);
  EXPECT_TRUE(probe->mDestroyed.load());  // with the delivery's own reference
  EXPECT_TRUE(mBroadcaster.HasListeners());
  mBroadcaster.BroadcastMessage(NumberMessage(2));
  EXPECT_FALSE(mBroadcaster.HasListeners());
  EXPECT_EQ(1, probe->mCalls.load());
}

TEST_F(BroadcasterThreads, WorkerRemovalWaitsForEveryNestedDeliveryToTheListener) {
  RecordingListener target("T", &mLog);
  Handshake handshake;
  std::atomic<int> returned{0};
  int opensAfterInnerDelivery = -1;
  std::atomic<bool> removerSawHandlerDone{false};
  target.SetAction([&](const Tarn::Message& inMessage) {
    if (static_cast<const NumberMessage&>(inMessage).mValue == 1) {
      mBroadcaster.BroadcastMessage(NumberMessage(2));
      // The inner delivery is over and the nested broadcast ended; the
      // remover still waits for this one.
      opensAfterInnerDelivery = GateWatch::Get().Opens();
      handshake.mHandlerDone.store(true);
      return;
    }
    handshake.mEntered.CountDown();
    handshake.mWaitersSeen = RemoversWait(1, returned);
  });
  mBroadcaster.AddListener(&target);
  {
    ThreadGroup workers;
    workers.Start([&] {
      ASSERT_TRUE(handshake.mEntered.WaitFor());
      mBroadcaster.RemoveListener(&target, true);
      removerSawHandlerDone.store(handshake.mHandlerDone.load());
      returned.fetch_add(1);
    });
    mBroadcaster.BroadcastMessage(NumberMessage(1));
  }
  EXPECT_TRUE(handshake.mWaitersSeen);
  EXPECT_EQ(0, opensAfterInnerDelivery);
  EXPECT_TRUE(removerSawHandlerDone.load());
  EXPECT_EQ((Log{"T:1", "T:2"}), mLog.Entries());
}

// After a handler removes its own listener on the main thread, the
// broadcast's cursor stands on the entry before, which it is not serving. A
// worker removing that entry meanwhile must not be left waiting: it may
// return at once, and at the latest when the broadcast ends.
TEST_F(BroadcasterThreads, WorkerRemovalOfTheEntryBeforeASelfRemovedListenerIsNotLeftWaiting) {
  RecordingListener oldest("Q", &mLog);
  RecordingListener self("L", &mLog);
  RecordingListener newest("P", &mLog);
  Latch removeNewest;
  std::atomic<bool> removerReturned{false};
  bool removalUnderway = false;
  self.SetAction([&](const Tarn::Message&) {
    mBroadcaster.RemoveListener(&self, true);
    removeNewest.CountDown();
    removalUnderway = messaging_test::WaitUntil(
        [&] { return GateWatch::Get().Waiting() >= 1 || removerReturned.load(); });
  });
  mBroadcaster.AddListener(&oldest);
  mBroadcaster.AddListener(&self);
  mBroadcaster.AddListener(&newest);
  {
    ThreadGroup workers;
    workers.Start([&] {
      ASSERT_TRUE(removeNewest.WaitFor());
      mBroadcaster.RemoveListener(&newest, true);
      removerReturned.store(true);
    });
    mBroadcaster.BroadcastMessage(NumberMessage(1));
    workers.JoinAll();  // the deadline turns a remover left waiting into a failure
  }
  EXPECT_TRUE(removalUnderway);
  EXPECT_TRUE(removerReturned.load());
  EXPECT_EQ((Log{"P:1", "L:1", "Q:1"}), mLog.Entries());
  EXPECT_FALSE(mBroadcaster.HasListener(&newest));
  EXPECT_TRUE(mBroadcaster.HasListener(&oldest));
}

// The listener comes back (added again on the main thread) while its first
// removal still waits; removing it again from another worker violates
// "no removal of an equal entry still waits". The report must not leave
// either remover waiting for ever, nor let either return early.
TEST_F(BroadcasterThreads, RemovingAListenerAddedBackWhileItsRemovalWaitsIsReportedAndBothRemoversWait) {
  ContractDialogRecorder dialog;
  ErrorRecorder errors;
  RecordingListener target("T", &mLog);
  Latch entered;
  Latch secondRemoval;
  bool firstWaiterSeen = false;
  bool reportSeen = false;
  bool secondWaiterSeen = false;
  std::atomic<int> returned{0};
  std::atomic<bool> handlerDone{false};
  std::atomic<int> removersThatSawHandlerDone{0};
  int calls = 0;
  target.SetAction([&](const Tarn::Message&) {
    if (++calls > 1) return;
    entered.CountDown();
    firstWaiterSeen = RemoversWait(1, returned);
    mBroadcaster.AddListener(&target);
    secondRemoval.CountDown();
    reportSeen = dialog.WaitForCount(1);
    secondWaiterSeen = RemoversWait(2, returned);
    handlerDone.store(true);
  });
  mBroadcaster.AddListener(&target);
  {
    ThreadGroup workers;
    workers.Start([&] {
      ASSERT_TRUE(entered.WaitFor());
      mBroadcaster.RemoveListener(&target, true);
      if (handlerDone.load()) removersThatSawHandlerDone.fetch_add(1);
      returned.fetch_add(1);
    });
    workers.Start([&] {
      ASSERT_TRUE(secondRemoval.WaitFor());
      mBroadcaster.RemoveListener(&target, true);
      if (handlerDone.load()) removersThatSawHandlerDone.fetch_add(1);
      returned.fetch_add(1);
    });
    mBroadcaster.BroadcastMessage(NumberMessage(1));
    workers.JoinAll();
  }
  EXPECT_TRUE(firstWaiterSeen);
  EXPECT_TRUE(reportSeen);
  EXPECT_TRUE(secondWaiterSeen);
  EXPECT_EQ(2, removersThatSawHandlerDone.load());
  const std::vector<messaging_test::ContractViolation> violations = dialog.Violations();
  ASSERT_EQ(1u, violations.size());
  EXPECT_EQ("mGateMap.find(inListener) == mGateMap.end()", violations[0].condition);
  EXPECT_EQ("Tarn::Broadcaster::RemoveListener", violations[0].function);
  EXPECT_EQ(1u, errors.Count());
  EXPECT_FALSE(mBroadcaster.HasListeners());
  mBroadcaster.BroadcastMessage(NumberMessage(2));
  EXPECT_EQ(1, calls);
}

// A handler that removes its own listener on the main thread does not wait
// (the delivery is on its own stack). A worker that removes, or destroys,
// the same listener while that handler still runs finds no entry any more,
// but must still wait for the handler: its caller may destroy the listener as
// soon as it returns.
TEST_P(BroadcasterThreadKinds, WorkerRemovalAfterTheHandlerRemovedItselfStillWaitsForTheHandler) {
  AnyListener target(GetParam(), "T", &mLog);
  const std::function<void()> detachSelf = target.MakeDetacher(mBroadcaster);
  Latch selfRemoved;
  std::atomic<int> returned{0};
  std::atomic<bool> handlerDone{false};
  std::atomic<bool> removerSawHandlerDone{false};
  bool waiterSeen = false;
  target.SetAction([&](const Tarn::Message&) {
    detachSelf();
    selfRemoved.CountDown();
    waiterSeen = RemoversWait(1, returned);
    handlerDone.store(true);
  });
  target.Attach(mBroadcaster);
  {
    ThreadGroup workers;
    workers.Start([&] {
      ASSERT_TRUE(selfRemoved.WaitFor());
      target.Detach(mBroadcaster);
      removerSawHandlerDone.store(handlerDone.load());
      returned.fetch_add(1);
    });
    mBroadcaster.BroadcastMessage(NumberMessage(1));
  }
  EXPECT_TRUE(waiterSeen) << "the worker's removal returned while the handler was still running";
  EXPECT_TRUE(removerSawHandlerDone.load());
  EXPECT_FALSE(mBroadcaster.HasListeners());
}

// A handler re-adds its listener while a worker removes it. Whichever order
// the worker's back-link update and the re-add land in, the listener must end
// registered exactly when it lists the broadcaster: a registration without its
// back-link outlives the listener, and the next broadcast calls freed memory.
TEST_F(BroadcasterThreads, HandlerReaddingItselfWhileAWorkerRemovesItKeepsItsBackLink) {
  for (int round = 0; round < 50; ++round) {
    SCOPED_TRACE(round);
    GateWatch::Get().Reset();
    auto listener = std::make_unique<RecordingListener>("L");
    Latch entered;
    bool first = true;
    listener->SetAction([&](const Tarn::Message&) {
      if (!first) return;
      first = false;
      entered.CountDown();
      // Odd rounds re-add once the remover waits for this delivery; even
      // rounds as soon as its entry is gone, racing its back-link update.
      if (round % 2 == 1) {
        ASSERT_TRUE(GateWatch::Get().WaitForWaiters(1));
      } else {
        ASSERT_TRUE(messaging_test::WaitUntil([&] { return !mBroadcaster.HasListener(listener.get()); }));
      }
      mBroadcaster.AddListener(listener.get());
    });
    mBroadcaster.AddListener(listener.get());
    {
      ThreadGroup worker;
      worker.Start([&] {
        ASSERT_TRUE(entered.WaitFor());
        mBroadcaster.RemoveListener(listener.get(), true);
      });
      mBroadcaster.BroadcastMessage(PingMessage());
      worker.JoinAll();
    }
    ASSERT_EQ(mBroadcaster.HasListener(listener.get()), listener->HasBroadcaster(&mBroadcaster));
    // Destroying the listener detaches it through its back-links; nothing of
    // it may be left for the next broadcast to call.
    listener.reset();
    EXPECT_FALSE(mBroadcaster.HasListeners());
    mBroadcaster.BroadcastMessage(PingMessage());
  }
}

// ---------------------------------------------------------------------------
// What does not wait

TEST_F(BroadcasterThreads, WorkerRemovalOfAnotherListenerDoesNotWaitForTheRunningHandler) {
  RecordingListener older("Older", &mLog);
  RecordingListener running("Running", &mLog);
  Latch entered;
  Latch removed;
  bool removedInTime = false;
  running.SetAction([&](const Tarn::Message&) {
    entered.CountDown();
    removedInTime = removed.WaitFor();
  });
  mBroadcaster.AddListener(&older);
  mBroadcaster.AddListener(&running);
  {
    ThreadGroup workers;
    workers.Start([&] {
      ASSERT_TRUE(entered.WaitFor());
      mBroadcaster.RemoveListener(&older, true);
      removed.CountDown();
    });
    mBroadcaster.BroadcastMessage(NumberMessage(1));
  }
  EXPECT_TRUE(removedInTime);
  EXPECT_EQ(Log{"Running:1"}, mLog.Entries());  // removed before its turn
  EXPECT_EQ(0, GateWatch::Get().Opens());
}

TEST_F(BroadcasterThreads, ListenerAddedFromAWorkerDuringABroadcastIsServedFirstByTheNextOne) {
  RecordingListener older("Older", &mLog);
  RecordingListener running("Running", &mLog);
  RecordingListener added("New", &mLog);
  Latch entered;
  Latch addedLatch;
  bool addedInTime = false;
  running.SetAction([&](const Tarn::Message& inMessage) {
    if (static_cast<const NumberMessage&>(inMessage).mValue != 1) return;
    entered.CountDown();
    addedInTime = addedLatch.WaitFor();
  });
  mBroadcaster.AddListener(&older);
  mBroadcaster.AddListener(&running);
  {
    ThreadGroup workers;
    workers.Start([&] {
      ASSERT_TRUE(entered.WaitFor());
      mBroadcaster.AddListener(&added);
      addedLatch.CountDown();
    });
    mBroadcaster.BroadcastMessage(NumberMessage(1));
  }
  mBroadcaster.BroadcastMessage(NumberMessage(2));
  EXPECT_TRUE(addedInTime);
  EXPECT_EQ((Log{"Running:1", "Older:1", "New:2", "Running:2", "Older:2"}), mLog.Entries());
}

TEST_F(BroadcasterThreads, BroadcastFromAWorkerDeliversNothing) {
  RecordingListener listener("A", &mLog);
  mBroadcaster.AddListener(&listener);
  {
    ThreadGroup workers;
    workers.Start([&] { mBroadcaster.BroadcastMessage(NumberMessage(1)); });
  }
  EXPECT_TRUE(mLog.Entries().empty());
  mBroadcaster.BroadcastMessage(NumberMessage(2));
  EXPECT_EQ(Log{"A:2"}, mLog.Entries());
}

TEST_F(BroadcasterThreads, WorkerRemovalWhileNoBroadcastRunsReturnsAtOnce) {
  RecordingListener listener("A", &mLog);
  mBroadcaster.AddListener(&listener);
  mBroadcaster.BroadcastMessage(NumberMessage(1));  // leaves no broadcast behind
  {
    ThreadGroup workers;
    workers.Start([&] { mBroadcaster.RemoveListener(&listener, true); });
  }
  EXPECT_FALSE(mBroadcaster.HasListeners());
  EXPECT_EQ(0, GateWatch::Get().Opens());
}

// ---------------------------------------------------------------------------
// Safe listeners dying during resolution

// The last host reference goes on a worker while the main thread resolves
// the weak reference. The resolution may revive the count from zero, and then
// its own release deletes the object; the worker's release, still between
// its decrement and its attempt to mark the object dead, must not touch the
// object any more. Nothing here can pause a thread at that point, so the
// test aligns the two threads on a barrier many times; the sanitizer builds
// report the use of the deleted object when the interleaving occurs.
TEST_F(BroadcasterThreads, LastReleaseRacingAResolutionNeverUsesTheDeletedObject) {
  constexpr int kRounds = 4000;
  const int liveBefore = CountedSafeListener::LiveCount();
  std::atomic<int> arrived{0};
  std::atomic<int> round{-1};
  Tarn::ISafeListenerRef host[2];
  boost::shared_ptr<Tarn::WeakReference> handle[2];
  int resolved = 0;
  {
    ThreadGroup workers;
    workers.Start([&] {
      for (int i = 0; i < kRounds; ++i) {
        while (round.load() < i) std::this_thread::yield();
        arrived.fetch_add(1);
        // Spin, not yield: the two threads must leave the barrier together.
        while (arrived.load() < 2 * (i + 1)) {
        }
        host[i % 2] = nullptr;
      }
    });
    for (int i = 0; i < kRounds; ++i) {
      host[i % 2] = Tarn::ISafeListenerRef(new CountedSafeListener("S"));
      handle[i % 2] = Tarn::GetSafeListenerHandle(host[i % 2]);
      round.store(i);
      arrived.fetch_add(1);
      while (arrived.load() < 2 * (i + 1)) {
      }
      // Slots alternate: the worker finished with this round's slot before
      // it reached the next round's barrier, so the slot is free again two
      // rounds on.
      if (Tarn::ResolveSafeListener(handle[i % 2]) != nullptr) ++resolved;
    }
  }
  host[0] = nullptr;
  host[1] = nullptr;
  EXPECT_EQ(liveBefore, CountedSafeListener::LiveCount());
  EXPECT_LT(handle[0]->mRefCount.load(), 0);
  EXPECT_LT(handle[1]->mRefCount.load(), 0);
  std::printf("resolution won %d of %d races\n", resolved, kRounds);
}

// ---------------------------------------------------------------------------
// Stress

// One listener of a stress run, as its worker sees it. Every field is
// shared with the listener's handler on the main thread.
struct StressSubject {
  std::atomic<bool> mRemoved{false};  // set once its worker's removal has returned
  std::atomic<int> mInHandler{0};     // handler invocations running (nested ones count twice)
};

// Two workers make listeners of every kind, attach them, let a delivery
// begin (half the time), and remove or destroy them, while the main thread
// broadcasts without pause; some handlers broadcast again, some remove their
// own listener (racing the worker's removal of it). Meanwhile
// handlers on the main thread remove and add back a few resident listeners,
// so that the registry also changes under the broadcast's own feet. No call
// may begin after a removal returned, no removal may return while a call to
// its listener runs, and a resident may be called only while registered.
TEST_F(BroadcasterThreads, StressNoListenerIsCalledAfterItsRemovalReturned) {
  constexpr auto kDuration = std::chrono::seconds(2);
  const int safeLiveBefore = CountedSafeListener::LiveCount();

  constexpr int kResidents = 3;
  std::vector<std::unique_ptr<RecordingListener>> residents;
  bool residentRegistered[kResidents] = {};  // main thread only
  long residentViolations = 0;               // main thread only
  std::mt19937 mainRandom(99u);              // main thread only
  // Called by handlers, so on the main thread only: now and then removes a
  // registered resident or adds back a removed one.
  const auto toggleResident = [&] {
    const unsigned which = mainRandom() % kResidents;
    if (mainRandom() % 4 != 0) return;
    if (residentRegistered[which])
      mBroadcaster.RemoveListener(residents[which].get(), true);
    else
      mBroadcaster.AddListener(residents[which].get());
    residentRegistered[which] = !residentRegistered[which];
  };
  for (int i = 0; i < kResidents; ++i) {
    residents.push_back(std::make_unique<RecordingListener>("R" + std::to_string(i)));
    residents.back()->SetAction([&, i](const Tarn::Message&) {
      if (!residentRegistered[i]) ++residentViolations;
      toggleResident();
    });
    mBroadcaster.AddListener(residents.back().get());
    residentRegistered[i] = true;
  }

  std::atomic<bool> stop{false};
  std::atomic<long> lateCalls{0};           // calls that began after the removal returned
  std::atomic<long> removalsDuringCalls{0};  // removals that returned while a call ran
  std::atomic<long> deliveries{0};
  std::atomic<long> cycles[2] = {{0}, {0}};
  std::vector<std::shared_ptr<messaging_test::CallRecorder::Probe>> probes[2];

  auto worker = [&](int inIndex) {
    std::mt19937 random(1234u + static_cast<unsigned>(inIndex));
    while (!stop.load()) {
      const ListenerKind kind = messaging_test::kAllListenerKinds[random() % 4];
      auto listener = std::make_unique<AnyListener>(kind, "S");
      auto subject = std::make_shared<StressSubject>();
      const bool nests = random() % 4 == 0;
      const bool removesItself = random() % 8 == 0;
      const unsigned spinMicroseconds = random() % 50;
      // Captures no part of the handle, which the worker may be destroying.
      const std::function<void()> detachSelf = listener->MakeDetacher(mBroadcaster);
      listener->SetAction([&, subject, nests, removesItself, spinMicroseconds,
                           detachSelf](const Tarn::Message& inMessage) {
        subject->mInHandler.fetch_add(1);
        if (subject->mRemoved.load()) lateCalls.fetch_add(1);
        deliveries.fetch_add(1);
        const auto until = std::chrono::steady_clock::now() + std::chrono::microseconds(spinMicroseconds);
        while (std::chrono::steady_clock::now() < until) {
        }
        const int value = static_cast<const NumberMessage&>(inMessage).mValue;
        if (nests && value == 1) mBroadcaster.BroadcastMessage(NumberMessage(2));
        if (removesItself && value == 1) detachSelf();
        toggleResident();
        subject->mInHandler.fetch_sub(1);
      });
      probes[inIndex].push_back(listener->GetProbe());
      listener->Attach(mBroadcaster);
      // Half the time, let a delivery begin first, so that the removal
      // races a handler more often than not.
      if (random() % 2 == 0) messaging_test::WaitUntil([&] { return listener->Calls() > 0 || stop.load(); },
                                                        std::chrono::milliseconds(100));
      switch (random() % 3) {
        case 0:  // remove, then destroy
          listener->Detach(mBroadcaster);
          subject->mRemoved.store(true);
          if (subject->mInHandler.load() != 0) removalsDuringCalls.fetch_add(1);
          listener.reset();
          break;
        case 1:  // remove twice: the second finds nothing, or waits beside the first
          listener->Detach(mBroadcaster);
          listener->Detach(mBroadcaster);
          subject->mRemoved.store(true);
          if (subject->mInHandler.load() != 0) removalsDuringCalls.fetch_add(1);
          listener.reset();
          break;
        case 2:  // destroy without removing: a plain listener detaches itself; the others die and are pruned
          listener.reset();
          if (kind == ListenerKind::kPlainPointer) {
            subject->mRemoved.store(true);
            if (subject->mInHandler.load() != 0) removalsDuringCalls.fetch_add(1);
          }
          break;
      }
      cycles[inIndex].fetch_add(1);
    }
  };

  long broadcasts = 0;
  {
    ThreadGroup workers;
    workers.Start([&] { worker(0); });
    workers.Start([&] { worker(1); });
    const auto end = std::chrono::steady_clock::now() + kDuration;
    while (std::chrono::steady_clock::now() < end) {
      mBroadcaster.BroadcastMessage(NumberMessage(1));
      ++broadcasts;
    }
    stop.store(true);
  }
  for (auto& resident : residents) mBroadcaster.RemoveListener(resident.get(), true);
  mBroadcaster.BroadcastMessage(NumberMessage(1));  // prunes what died last

  EXPECT_EQ(0, lateCalls.load());
  EXPECT_EQ(0, removalsDuringCalls.load());
  EXPECT_EQ(0, residentViolations);
  EXPECT_FALSE(mBroadcaster.HasListeners());
  EXPECT_EQ(safeLiveBefore, CountedSafeListener::LiveCount());
  long notDestroyed = 0;
  for (const auto& list : probes)
    for (const auto& probe : list) notDestroyed += probe->mDestroyed.load() ? 0 : 1;
  EXPECT_EQ(0, notDestroyed);
  // The run did what it is for: both workers cycled, the main thread
  // delivered throughout.
  EXPECT_GT(cycles[0].load(), 20);
  EXPECT_GT(cycles[1].load(), 20);
  EXPECT_GT(broadcasts, 100);
  EXPECT_GT(deliveries.load(), 100);
  EXPECT_GT(GateWatch::Get().Waits(), 0) << "no removal ever met a delivery in progress";
  std::printf("stress: %ld broadcasts, %ld worker-listener deliveries, %ld + %ld listener cycles, %d gated removals\n",
              broadcasts, deliveries.load(), cycles[0].load(), cycles[1].load(), GateWatch::Get().Waits());
}

}  // namespace
