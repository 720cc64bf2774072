// Tarn::Integration::GLibEventLoop: posted messages reach their listeners
// exactly once, on the thread iterating the GLib context, with one source
// per burst of posts, and none is lost when the integration goes.
#include "IntegrationTestSupport.h"

#include <TarnMessaging/Integration/GLibEventLoop.h>

#include <glib.h>

#include <gtest/gtest.h>

#include <cstdint>
#include <numeric>
#include <stdexcept>
#include <vector>

namespace {

using namespace integration_test;
using Tarn::Integration::GLibEventLoop;

// A context of the test's own with a loop on it; both are freed with it.
class OwnContext {
public:
  OwnContext() : mContext(g_main_context_new()), mLoop(g_main_loop_new(mContext, FALSE)) {}
  ~OwnContext() {
    g_main_loop_unref(mLoop);
    g_main_context_unref(mContext);
  }
  OwnContext(const OwnContext&) = delete;
  OwnContext& operator=(const OwnContext&) = delete;

  GMainContext* Context() const { return mContext; }
  void Quit() { g_main_loop_quit(mLoop); }

  // Runs the loop until something quits it, or until kDeadline has passed;
  // false when the deadline quit it.
  bool RunWithDeadline() {
    struct Deadline {
      GMainLoop* loop;
      bool expired;
    } deadline{mLoop, false};
    GSource* timeout = g_timeout_source_new_seconds(static_cast<guint>(kDeadline.count()));
    g_source_set_callback(
        timeout,
        [](gpointer inDeadline) -> gboolean {
          auto* state = static_cast<Deadline*>(inDeadline);
          state->expired = true;
          g_main_loop_quit(state->loop);
          return G_SOURCE_REMOVE;
        },
        &deadline, nullptr);
    g_source_attach(timeout, mContext);
    g_main_loop_run(mLoop);
    g_source_destroy(timeout);
    g_source_unref(timeout);
    return !deadline.expired;
  }

  // Dispatches what is ready, without blocking; the number of iterations
  // that dispatched something.
  int Iterate() { return IterateContext(mContext); }

  static int IterateContext(GMainContext* inContext) {
    int dispatched = 0;
    while (g_main_context_iteration(inContext, FALSE)) ++dispatched;
    return dispatched;
  }

private:
  GMainContext* mContext;
  GMainLoop* mLoop;
};

using GLibEventLoopTest = MessagingTest;

TEST_F(GLibEventLoopTest, EveryPostIsDeliveredOnceOnTheThreadIteratingTheContext) {
  constexpr int kWorkers = 4;
  constexpr int kPerWorker = 2000;
  OwnContext own;
  DeliveryLog log(kWorkers, kPerWorker);
  log.OnDelivery([&own](int inTotal) {
    if (inTotal == kWorkers * kPerWorker) own.Quit();
  });
  Tarn::StationUtils::AddListener(mStation, &log);
  {
    GLibEventLoop messaging(own.Context());
    WorkerGroup workers;
    for (int w = 0; w < kWorkers; ++w) workers.Start([this, w] { PostNumbered(mStation, w, 0, kPerWorker); });
    ASSERT_TRUE(own.RunWithDeadline()) << log.Total() << " of " << kWorkers * kPerWorker << " delivered";
    workers.JoinAll();
    // Whatever source is still attached must not deliver again.
    own.Iterate();

    EXPECT_EQ(kWorkers * kPerWorker, log.Total());
    EXPECT_EQ(0, log.NotExactlyOnce());
    EXPECT_EQ(0, log.OffLoopThread());
    EXPECT_EQ(0, log.OutOfOrder()) << "one worker's posts arrived out of order";
    EXPECT_GE(messaging.ScheduledRuns(), 1u);
    EXPECT_LE(messaging.ScheduledRuns(), static_cast<std::uint64_t>(kWorkers * kPerWorker));
  }
  Tarn::StationUtils::RemoveListener(mStation, &log);
}

TEST_F(GLibEventLoopTest, EachBurstPostedWhileTheLoopIsBusyCostsOneSource) {
  constexpr int kWorkers = 3;
  constexpr int kRounds = 20;
  constexpr int kBurst = 100;
  OwnContext own;
  DeliveryLog log(kWorkers, kRounds * kBurst);
  Tarn::StationUtils::AddListener(mStation, &log);
  {
    GLibEventLoop messaging(own.Context());
    for (int round = 0; round < kRounds; ++round) {
      // The main thread is busy (here: joining) while the workers post.
      WorkerGroup workers;
      for (int w = 0; w < kWorkers; ++w)
        workers.Start([this, w, round] { PostNumbered(mStation, w, round * kBurst, kBurst); });
      workers.JoinAll();

      EXPECT_EQ(1, own.Iterate()) << "round " << round << ": iterations that dispatched";
      EXPECT_EQ((round + 1) * kWorkers * kBurst, log.Total()) << "round " << round;
      EXPECT_EQ(static_cast<std::uint64_t>(round + 1), messaging.ScheduledRuns()) << "round " << round;
    }
  }
  EXPECT_EQ(0, log.NotExactlyOnce());
  EXPECT_EQ(0, log.OffLoopThread());
  Tarn::StationUtils::RemoveListener(mStation, &log);
}

TEST_F(GLibEventLoopTest, ACallQueuedDuringARunSchedulesTheNextRun) {
  constexpr int kHops = 10;
  OwnContext own;
  Relay relay(mStation, kHops);
  relay.mOnLastHop = [&own] { own.Quit(); };
  Tarn::StationUtils::AddListener(mStation, &relay);
  {
    GLibEventLoop messaging(own.Context());
    Tarn::StationUtils::PostMessageToUIThread(mStation, Numbered(0, 0), true);
    EXPECT_EQ(0u, relay.mHeard.size()) << "an asynchronous post from the main thread ran inside the post";
    // A hop queued during a run and left without a run of its own hits the deadline.
    EXPECT_TRUE(own.RunWithDeadline()) << relay.mHeard.size() << " of " << kHops << " hops heard";
    std::vector<int> expected(kHops);
    std::iota(expected.begin(), expected.end(), 0);
    EXPECT_EQ(expected, relay.mHeard);
    EXPECT_EQ(static_cast<std::uint64_t>(kHops), messaging.ScheduledRuns());
  }
  Tarn::StationUtils::RemoveListener(mStation, &relay);
}

// A worker that could acquire the context (the global default one, while the
// main thread is not iterating it) must still leave the run to the main
// thread: run on the worker, the broadcasts would deliver nothing.
TEST_F(GLibEventLoopTest, PostsToTheIdleDefaultContextAreDeliveredOnTheMainThread) {
  constexpr int kPerWorker = 200;
  DeliveryLog log(1, kPerWorker);
  Tarn::StationUtils::AddListener(mStation, &log);
  {
    GLibEventLoop messaging(nullptr);
    WorkerGroup workers;
    workers.Start([this] { PostNumbered(mStation, 0, 0, kPerWorker); });
    workers.JoinAll();
    EXPECT_EQ(0, log.Total()) << "delivered before the main thread iterated the context";
    EXPECT_EQ(static_cast<std::size_t>(kPerWorker), PendingCalls());
    OwnContext::IterateContext(g_main_context_default());
    EXPECT_EQ(kPerWorker, log.Total());
    EXPECT_EQ(1u, messaging.ScheduledRuns());
  }
  EXPECT_EQ(0, log.NotExactlyOnce());
  EXPECT_EQ(0, log.OffLoopThread());
  Tarn::StationUtils::RemoveListener(mStation, &log);
}

TEST_F(GLibEventLoopTest, MessagesStillPendingAreDeliveredWhenTheIntegrationIsDestroyed) {
  constexpr int kWorkers = 2;
  constexpr int kPerWorker = 500;
  OwnContext own;
  DeliveryLog log(kWorkers, kPerWorker);
  Tarn::StationUtils::AddListener(mStation, &log);
  {
    GLibEventLoop messaging(own.Context());
    WorkerGroup workers;
    for (int w = 0; w < kWorkers; ++w) workers.Start([this, w] { PostNumbered(mStation, w, 0, kPerWorker); });
    workers.JoinAll();
    EXPECT_EQ(0, log.Total()) << "delivered before the context was iterated";
    EXPECT_EQ(1u, messaging.ScheduledRuns());
  }
  EXPECT_EQ(kWorkers * kPerWorker, log.Total()) << "lost at shutdown";
  EXPECT_EQ(0u, PendingCalls());
  // The source attached for the burst went with the integration.
  EXPECT_EQ(0, own.Iterate());
  EXPECT_EQ(0, log.NotExactlyOnce());
  EXPECT_EQ(0, log.OffLoopThread());
  Tarn::StationUtils::RemoveListener(mStation, &log);
}

TEST_F(GLibEventLoopTest, MessagesPostedBeforeTheIntegrationExistedAreScheduledByIt) {
  constexpr int kPerWorker = 300;
  OwnContext own;
  DeliveryLog log(1, kPerWorker);
  Tarn::StationUtils::AddListener(mStation, &log);
  {
    WorkerGroup workers;
    workers.Start([this] { PostNumbered(mStation, 0, 0, kPerWorker); });
    workers.JoinAll();
  }
  {
    GLibEventLoop messaging(own.Context());
    EXPECT_EQ(1, own.Iterate());
    EXPECT_EQ(kPerWorker, log.Total());
    EXPECT_EQ(1u, messaging.ScheduledRuns());
  }
  EXPECT_EQ(0, log.NotExactlyOnce());
  Tarn::StationUtils::RemoveListener(mStation, &log);
}

TEST_F(GLibEventLoopTest, AfterDestructionPostsNoLongerReachTheContext) {
  OwnContext own;
  DeliveryLog log(1, 1);
  Tarn::StationUtils::AddListener(mStation, &log);
  { GLibEventLoop messaging(own.Context()); }
  {
    WorkerGroup workers;
    workers.Start([this] { PostNumbered(mStation, 0, 0, 1); });
    workers.JoinAll();
  }
  EXPECT_EQ(0, own.Iterate()) << "the wakeup handler outlived the integration";
  EXPECT_EQ(0, log.Total());
  EXPECT_EQ(1u, PendingCalls());
  Tarn::StationUtils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(1, log.Total());
  Tarn::StationUtils::RemoveListener(mStation, &log);
}

TEST_F(GLibEventLoopTest, ACallThatThrowsGoesToTheErrorManagerAndTheCallsBehindItRunNext) {
  OwnContext own;
  DeliveryLog log(1, 1);
  ExceptionRecorder exceptions;
  Tarn::StationUtils::AddListener(mStation, &log);
  {
    GLibEventLoop messaging(own.Context());
    kivcore::threads::AsyncCallFromMainThread([] { throw std::runtime_error("from a pending call"); }, 0);
    Tarn::StationUtils::PostMessageToUIThread(mStation, Numbered(0, 0), true);
    // The first source runs into the exception; the second, attached by the
    // integration itself since no new post arrives, runs the rest.
    EXPECT_EQ(2, own.Iterate());
    EXPECT_EQ(1u, exceptions.Count());
    EXPECT_EQ(1, log.Total()) << "the call behind the throwing one was stranded";
    EXPECT_EQ(2u, messaging.ScheduledRuns());
  }
  Tarn::StationUtils::RemoveListener(mStation, &log);
}

TEST_F(GLibEventLoopTest, TheIntegrationKeepsItsContextAlive) {
  DeliveryLog log(1, 1);
  Tarn::StationUtils::AddListener(mStation, &log);
  GMainContext* context = g_main_context_new();
  {
    GLibEventLoop messaging(context);
    g_main_context_unref(context);  // the integration's reference is the last one now
    WorkerGroup workers;
    workers.Start([this] { PostNumbered(mStation, 0, 0, 1); });
    workers.JoinAll();
    EXPECT_EQ(1, OwnContext::IterateContext(context));
    EXPECT_EQ(1, log.Total());
  }
  Tarn::StationUtils::RemoveListener(mStation, &log);
}

TEST(GLibEventLoopWithoutMainThreadTest, ConstructionThrowsLogicError) {
  ASSERT_FALSE(kivcore::threads::GetRegisteredMainThread());
  GMainContext* context = g_main_context_new();
  EXPECT_THROW(GLibEventLoop messaging(context), std::logic_error);
  EXPECT_EQ(0, OwnContext::IterateContext(context));
  g_main_context_unref(context);
}

}  // namespace
