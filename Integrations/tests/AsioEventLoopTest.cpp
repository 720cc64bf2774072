// Tarn::Integration::AsioEventLoop: posted messages reach their listeners
// exactly once, on the thread running the io_context, with one io_context
// handler per burst of posts, and none is lost when the integration goes.
#include "IntegrationTestSupport.h"

#include <TarnMessaging/Integration/AsioEventLoop.h>

#include <boost/asio/executor_work_guard.hpp>
#include <boost/asio/io_context.hpp>
#include <boost/asio/steady_timer.hpp>

#include <gtest/gtest.h>

#include <cstdint>
#include <numeric>
#include <stdexcept>
#include <vector>

namespace {

using namespace integration_test;
using Tarn::Integration::AsioEventLoop;

// Runs inContext until something stops it, or until kDeadline has passed;
// false when the deadline stopped it.
bool RunWithDeadline(boost::asio::io_context& inContext) {
  bool timedOut = false;
  boost::asio::steady_timer deadline(inContext, kDeadline);
  deadline.async_wait([&](const boost::system::error_code& inError) {
    if (inError) return;
    timedOut = true;
    inContext.stop();
  });
  auto work = boost::asio::make_work_guard(inContext);
  inContext.restart();
  inContext.run();
  deadline.cancel();
  // The cancelled wait is still queued; it must not outlive this frame.
  inContext.restart();
  inContext.poll();
  return !timedOut;
}

using AsioEventLoopTest = MessagingTest;

TEST_F(AsioEventLoopTest, EveryPostIsDeliveredOnceOnTheThreadRunningTheLoop) {
  constexpr int kWorkers = 4;
  constexpr int kPerWorker = 2000;
  boost::asio::io_context context;
  DeliveryLog log(kWorkers, kPerWorker);
  log.OnDelivery([&context](int inTotal) {
    if (inTotal == kWorkers * kPerWorker) context.stop();
  });
  Tarn::StationUtils::AddListener(mStation, &log);
  {
    AsioEventLoop messaging(context);
    WorkerGroup workers;
    for (int w = 0; w < kWorkers; ++w) workers.Start([this, w] { PostNumbered(mStation, w, 0, kPerWorker); });
    ASSERT_TRUE(RunWithDeadline(context)) << log.Total() << " of " << kWorkers * kPerWorker << " delivered";
    workers.JoinAll();
    // Whatever is still queued in the io_context must not deliver again.
    context.restart();
    context.poll();

    EXPECT_EQ(kWorkers * kPerWorker, log.Total());
    EXPECT_EQ(0, log.NotExactlyOnce());
    EXPECT_EQ(0, log.OffLoopThread());
    EXPECT_EQ(0, log.OutOfOrder()) << "one worker's posts arrived out of order";
    EXPECT_GE(messaging.ScheduledRuns(), 1u);
    EXPECT_LE(messaging.ScheduledRuns(), static_cast<std::uint64_t>(kWorkers * kPerWorker));
  }
  Tarn::StationUtils::RemoveListener(mStation, &log);
}

TEST_F(AsioEventLoopTest, EachBurstPostedWhileTheLoopIsBusyCostsOneHandler) {
  constexpr int kWorkers = 3;
  constexpr int kRounds = 20;
  constexpr int kBurst = 100;
  boost::asio::io_context context;
  DeliveryLog log(kWorkers, kRounds * kBurst);
  Tarn::StationUtils::AddListener(mStation, &log);
  {
    AsioEventLoop messaging(context);
    for (int round = 0; round < kRounds; ++round) {
      // The main thread is busy (here: joining) while the workers post.
      WorkerGroup workers;
      for (int w = 0; w < kWorkers; ++w)
        workers.Start([this, w, round] { PostNumbered(mStation, w, round * kBurst, kBurst); });
      workers.JoinAll();

      context.restart();
      EXPECT_EQ(1u, context.poll()) << "round " << round << ": io_context handlers run";
      EXPECT_EQ((round + 1) * kWorkers * kBurst, log.Total()) << "round " << round;
      EXPECT_EQ(static_cast<std::uint64_t>(round + 1), messaging.ScheduledRuns()) << "round " << round;
    }
  }
  EXPECT_EQ(0, log.NotExactlyOnce());
  EXPECT_EQ(0, log.OffLoopThread());
  Tarn::StationUtils::RemoveListener(mStation, &log);
}

TEST_F(AsioEventLoopTest, ACallQueuedDuringARunSchedulesTheNextRun) {
  constexpr int kHops = 10;
  boost::asio::io_context context;
  Relay relay(mStation, kHops);
  relay.mOnLastHop = [&context] { context.stop(); };
  Tarn::StationUtils::AddListener(mStation, &relay);
  {
    AsioEventLoop messaging(context);
    Tarn::StationUtils::PostMessageToUIThread(mStation, Numbered(0, 0), true);
    // A hop queued during a run and left without a run of its own hits the deadline.
    EXPECT_TRUE(RunWithDeadline(context)) << relay.mHeard.size() << " of " << kHops << " hops heard";
    std::vector<int> expected(kHops);
    std::iota(expected.begin(), expected.end(), 0);
    EXPECT_EQ(expected, relay.mHeard);
    EXPECT_EQ(static_cast<std::uint64_t>(kHops), messaging.ScheduledRuns());
  }
  Tarn::StationUtils::RemoveListener(mStation, &relay);
}

TEST_F(AsioEventLoopTest, MessagesStillPendingAreDeliveredWhenTheIntegrationIsDestroyed) {
  constexpr int kWorkers = 2;
  constexpr int kPerWorker = 500;
  boost::asio::io_context context;
  DeliveryLog log(kWorkers, kPerWorker);
  Tarn::StationUtils::AddListener(mStation, &log);
  {
    AsioEventLoop messaging(context);
    WorkerGroup workers;
    for (int w = 0; w < kWorkers; ++w) workers.Start([this, w] { PostNumbered(mStation, w, 0, kPerWorker); });
    workers.JoinAll();
    EXPECT_EQ(0, log.Total()) << "delivered before the loop ran";
    EXPECT_EQ(1u, messaging.ScheduledRuns());
  }
  EXPECT_EQ(kWorkers * kPerWorker, log.Total()) << "lost at shutdown";
  EXPECT_EQ(0u, PendingCalls());
  // The handler posted for the burst is still in the io_context; it must not
  // deliver anything again.
  context.restart();
  EXPECT_EQ(1u, context.poll());
  EXPECT_EQ(0, log.NotExactlyOnce());
  EXPECT_EQ(0, log.OffLoopThread());
  Tarn::StationUtils::RemoveListener(mStation, &log);
}

TEST_F(AsioEventLoopTest, MessagesPostedBeforeTheIntegrationExistedAreScheduledByIt) {
  constexpr int kPerWorker = 300;
  boost::asio::io_context context;
  DeliveryLog log(1, kPerWorker);
  Tarn::StationUtils::AddListener(mStation, &log);
  {
    WorkerGroup workers;
    workers.Start([this] { PostNumbered(mStation, 0, 0, kPerWorker); });
    workers.JoinAll();
  }
  {
    AsioEventLoop messaging(context);
    context.restart();
    EXPECT_EQ(1u, context.poll());
    EXPECT_EQ(kPerWorker, log.Total());
    EXPECT_EQ(1u, messaging.ScheduledRuns());
  }
  EXPECT_EQ(0, log.NotExactlyOnce());
  Tarn::StationUtils::RemoveListener(mStation, &log);
}

TEST_F(AsioEventLoopTest, AfterDestructionPostsNoLongerReachTheLoop) {
  boost::asio::io_context context;
  DeliveryLog log(1, 1);
  Tarn::StationUtils::AddListener(mStation, &log);
  { AsioEventLoop messaging(context); }
  {
    WorkerGroup workers;
    workers.Start([this] { PostNumbered(mStation, 0, 0, 1); });
    workers.JoinAll();
  }
  context.restart();
  EXPECT_EQ(0u, context.poll()) << "the wakeup handler outlived the integration";
  EXPECT_EQ(0, log.Total());
  EXPECT_EQ(1u, PendingCalls());
  Tarn::StationUtils::FlushPostedMessagesOnUIThread();
  EXPECT_EQ(1, log.Total());
  Tarn::StationUtils::RemoveListener(mStation, &log);
}

TEST_F(AsioEventLoopTest, ACallThatThrowsLeavesRunAndTheCallsBehindItRunNext) {
  boost::asio::io_context context;
  DeliveryLog log(1, 1);
  Tarn::StationUtils::AddListener(mStation, &log);
  {
    AsioEventLoop messaging(context);
    kivcore::threads::AsyncCallFromMainThread([] { throw std::runtime_error("from a pending call"); }, 0);
    Tarn::StationUtils::PostMessageToUIThread(mStation, Numbered(0, 0), true);
    context.restart();
    EXPECT_THROW(context.poll(), std::runtime_error);
    EXPECT_EQ(0, log.Total());
    // No new post arrives: the integration itself must schedule the rest.
    context.restart();
    context.poll();
    EXPECT_EQ(1, log.Total()) << "the call behind the throwing one was stranded";
    EXPECT_EQ(2u, messaging.ScheduledRuns());
  }
  Tarn::StationUtils::RemoveListener(mStation, &log);
}

TEST(AsioEventLoopWithoutMainThreadTest, ConstructionThrowsLogicError) {
  ASSERT_FALSE(kivcore::threads::GetRegisteredMainThread());
  boost::asio::io_context context;
  EXPECT_THROW(AsioEventLoop messaging(context), std::logic_error);
  EXPECT_EQ(0u, context.poll());
}

}  // namespace
