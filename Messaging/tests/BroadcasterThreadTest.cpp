// Broadcaster across threads: a removal returns only when no delivery of
// that listener runs on another thread, whoever removes it and however; and
// a broadcaster and its listeners may die at the same time on two threads.
#include "TestSupport.h"

#include <TarnMessaging/Messaging.h>

#include <optional>

namespace {

using namespace messaging_test;

TEST(BroadcasterThreads, NoDeliveryRunsOrStartsAfterARemovalReturned) {
  messaging_test::MainThreadGuard mainThread;
  Tarn::Broadcaster broadcaster;
  std::atomic<bool> stop{false};
  std::atomic<int> violations{0};
  ThreadGroup workers;
  for (messaging_test::ListenerKind kind : messaging_test::kAllListenerKinds) {
    workers.Start([&, kind] {
      for (int round = 0; round < 300 && !stop.load(); ++round) {
        AnyListener listener(kind, "L");
        auto removed = std::make_shared<std::atomic<bool>>(false);
        listener.SetAction([&, removed](const Tarn::Message&) {
          const bool before = removed->load();
          std::this_thread::yield();  // widen the window a returning remover would hit
          if (before || removed->load()) violations.fetch_add(1);
        });
        listener.Attach(broadcaster);
        while (listener.Calls() == 0 && !stop.load()) std::this_thread::yield();
        listener.Detach(broadcaster);
        removed->store(true);
      }
    });
  }
  std::thread watcher([&] {
    workers.JoinAll();
    stop.store(true);
  });
  while (!stop.load()) broadcaster.BroadcastMessage(NumberMessage(1));
  watcher.join();
  EXPECT_EQ(violations.load(), 0) << "a handler ran after its removal had returned";
  EXPECT_FALSE(broadcaster.HasListeners());
}

// Two removers and a destroying thread, all while the handler is held on
// the main thread, and with no small block to be had: none may return
// first, and none may need storage (a destructor cannot report failure).
// The handler then destroys the broadcaster, so the waiting removals wake on
// a closed core that only they still hold.
TEST(BroadcasterThreads, RemoversAndDestructorsWaitForTheRunningHandlerAndNeedNoStorage) {
  messaging_test::MainThreadGuard mainThread;
  auto* broadcaster = new Tarn::Broadcaster;
  Latch entered, armed, release;
  std::atomic<int> returned{0};
  auto* held = new messaging_test::RecordingListener("H");
  held->SetAction([&](const Tarn::Message&) {
    entered.CountDown();
    EXPECT_TRUE(release.WaitFor());
    delete broadcaster;
  });
  held->DetachInDestructor(*broadcaster);  // while whole, as a worker-destroyed listener must
  broadcaster->AddListener(held);
  std::optional<messaging_test::SmallBlockFailureGuard> noStorage;
  ThreadGroup workers;
  for (int remover = 0; remover < 3; ++remover) {
    workers.Start([&, remover] {
      ASSERT_TRUE(armed.WaitFor());
      if (remover < 2) {
        EXPECT_NO_THROW(broadcaster->RemoveListener(held, true));
      } else {
        delete held;
      }
      returned.fetch_add(1);
    });
  }
  std::thread releaser([&] {
    EXPECT_TRUE(entered.WaitFor());
    noStorage.emplace(0);
    armed.CountDown();
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    EXPECT_EQ(returned.load(), 0) << "a remover returned while the handler ran";
    release.CountDown();
  });
  broadcaster->BroadcastMessage(NumberMessage(1));
  releaser.join();
  workers.JoinAll();
  noStorage.reset();
  EXPECT_EQ(returned.load(), 3);
}

// A listener added again while a removal of it still waits, and removed a
// second time from another thread: the contract check reports the second
// removal, and both return once the delivery has ended. The report goes out
// with the broadcaster's lock let go: the main thread uses the broadcaster
// while the dialog shows (it once waited for the dialog to close).
TEST(BroadcasterThreads, ASecondRemovalWhileAnEarlierOneWaitsIsReported) {
  messaging_test::MainThreadGuard mainThread;
  Latch inDialog;
  std::atomic<int> dialogs{0};
  std::atomic<bool> used{false};
  auto previous = kivcore::debug::SetContractDialogHandler([&](const char*, const char*, const char*, int) {
    dialogs.fetch_add(1);
    inDialog.CountDown();
    EXPECT_TRUE(messaging_test::WaitUntil([&] { return used.load(); }, std::chrono::seconds(2)));
    return false;
  });
  messaging_test::ErrorRecorder errors;
  Tarn::Broadcaster broadcaster;
  messaging_test::RecordingListener held("H");
  Latch entered;
  std::atomic<int> returned{0};
  const auto remove = [&] {
    broadcaster.RemoveListener(&held, true);
    returned.fetch_add(1);
  };
  std::thread first([&] {
    ASSERT_TRUE(entered.WaitFor());
    remove();
  }), second;
  held.SetAction([&](const Tarn::Message&) {
    entered.CountDown();
    std::this_thread::sleep_for(std::chrono::milliseconds(100));  // the first removal is waiting by now
    broadcaster.AddListener(&held);
    second = std::thread(remove);
    ASSERT_TRUE(inDialog.WaitFor());
    EXPECT_TRUE(broadcaster.HasListener(&held));
    used = true;
    EXPECT_TRUE(messaging_test::WaitUntil([&] { return errors.Count() == 1; }));
    EXPECT_EQ(returned.load(), 0);
  });
  broadcaster.AddListener(&held);
  broadcaster.BroadcastMessage(NumberMessage(1));
  first.join();
  second.join();
  kivcore::debug::SetContractDialogHandler(std::move(previous));
  EXPECT_EQ(returned.load(), 2);
  EXPECT_EQ(dialogs.load(), 1);
  EXPECT_FALSE(broadcaster.HasListeners());
}

// The main thread moves while a handler runs: L1's handler makes the last
// Terminate and, while another thread (initialized anew) delivers L2 on the
// same broadcaster, removes L2; L2's handler there removes L1, whose
// delivery waits for it. Both once waited for ever; now the removal that
// closes the circle is reported and returns.
TEST(BroadcasterThreads, RemovalsInHandlersOnTwoThreadsNeverWaitInACircle) {
  messaging_test::Watchdog watchdog;
  messaging_test::ContractDialogRecorder dialog;
  messaging_test::ErrorRecorder errors;
  Tarn::Messaging::Initialize();
  Tarn::Broadcaster broadcaster;
  messaging_test::RecordingListener first("L1"), second("L2");
  Latch delivering;
  ThreadGroup mover;
  first.SetAction([&](const Tarn::Message&) {
    if (first.Calls() != 1) return;
    Tarn::Messaging::Terminate();
    mover.Start([&] {
      Tarn::Messaging::Initialize();
      broadcaster.BroadcastMessage(NumberMessage(2));
      Tarn::Messaging::Terminate();
    });
    EXPECT_TRUE(delivering.WaitFor());
    broadcaster.RemoveListener(&second, true);
  });
  second.SetAction([&](const Tarn::Message&) {
    delivering.CountDown();
    broadcaster.RemoveListener(&first, true);
  });
  broadcaster.AddListener(&second);
  broadcaster.AddListener(&first);
  broadcaster.BroadcastMessage(NumberMessage(1));
  mover.JoinAll();
  EXPECT_EQ(dialog.Count(), 1u);
  EXPECT_EQ(first.Calls() + second.Calls(), 3);
  EXPECT_FALSE(broadcaster.HasListeners());
}

// One listener attached to and detached from two broadcasters on two threads
// at once: both change its list of back-links, behind the list's own lock.
TEST(BroadcasterThreads, OneListenerAttachedAndDetachedOnTwoThreadsKeepsExactBackLinks) {
  messaging_test::RecordingListener listener("L");
  Tarn::Broadcaster first, second;
  // Many links make each change of the list a long walk, so that the two
  // threads' changes overlap often.
  std::vector<Tarn::Broadcaster> others(64);
  for (Tarn::Broadcaster& other : others) other.AddListener(&listener);
  Latch ready(2);
  ThreadGroup threads;
  for (Tarn::Broadcaster* broadcaster : {&first, &second}) {
    threads.Start([&, broadcaster] {
      ready.CountDown();
      ASSERT_TRUE(ready.WaitFor());
      for (int round = 0; round < 250000; ++round) {
        broadcaster->AddListener(&listener);
        broadcaster->RemoveListener(&listener, true);
      }
      broadcaster->AddListener(&listener);
    });
  }
  threads.JoinAll();
  EXPECT_TRUE(listener.HasBroadcaster(&first) && listener.HasBroadcaster(&second));
  first.RemoveListener(&listener, true);
  EXPECT_FALSE(listener.HasBroadcaster(&first));
  EXPECT_TRUE(listener.HasBroadcaster(&second));
}

// ~Broadcaster on the main thread and ~Listener on a worker at the same
// moment: each once walked the other's list unguarded (use after free).
TEST(BroadcasterThreads, BroadcasterAndListenerDestroyedAtOnceOnTwoThreads) {
  std::atomic<int> turn{0};
  std::atomic<Tarn::Listener*> handed{nullptr};
  std::thread worker([&] {
    for (int round = 1; round <= 2000; ++round) {
      while (turn.load() != round) std::this_thread::yield();
      delete handed.load();
      turn.store(-round);
    }
  });
  for (int round = 1; round <= 2000; ++round) {
    auto* broadcaster = new Tarn::Broadcaster;
    auto* listener = new messaging_test::RecordingListener("L");
    broadcaster->AddListener(listener);
    Tarn::Broadcaster other;
    other.AddListener(listener);
    handed.store(listener);
    turn.store(round);
    delete broadcaster;
    while (turn.load() != -round) std::this_thread::yield();
    EXPECT_FALSE(other.HasListeners());
  }
  worker.join();
}

}  // namespace
