// What an event-loop integration costs per posted message, against the
// plain loop of WaitForPendingCalls and FlushPostedMessagesOnUIThread.
//
//   tarn-integration-cost [messages] [repetitions]
//
// Three figures per way of running the main thread, each the median of the
// repetitions, in nanoseconds per message:
//   post     a worker posts every message while the main thread waits (the
//            wakeup handler runs on every post; its cost shows here)
//   drain    the main thread then delivers them all (one run per burst)
//   stream   a worker posts while the main thread runs its loop, from the
//            first post to the last delivery; with it, how many messages
//            each scheduled run delivered (0 for the plain loop)
#include <TarnMessaging.h>
#include <TarnMessaging/Integration/AsioEventLoop.h>
#if TARN_HAVE_GLIB_INTEGRATION
#include <TarnMessaging/Integration/GLibEventLoop.h>
#endif
#if TARN_HAVE_QT_INTEGRATION
#include <TarnMessaging/Integration/QtEventLoop.h>

#include <QtCore/QCoreApplication>
#endif

#include <kivcore/MainThread.h>

#include <boost/asio/executor_work_guard.hpp>
#include <boost/asio/io_context.hpp>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <vector>

namespace {

using Clock = std::chrono::steady_clock;

struct Tick : Tarn::MessageImpl<Tick> {
  explicit Tick(int inValue) : mValue(inValue) {}
  int mValue;
};

class Counter : public Tarn::Listener {
public:
  void ListenToMessage(const Tarn::Message& inMessage) override {
    if (inMessage.GetMessageID() != Tick::StaticMessageID()) return;
    if (++mCount == mTarget && mOnTarget) mOnTarget();
  }
  int mCount = 0;  // main thread only
  int mTarget = 0;
  std::function<void()> mOnTarget;
};

// How the main thread runs: set up around a counter, then either drained
// once or run until the counter reaches its target.
class MainLoop {
public:
  virtual ~MainLoop() = default;
  virtual const char* Name() const = 0;
  virtual void Drain() = 0;
  virtual void RunUntilDone(Counter& inCounter) = 0;
  // Runs scheduled on the host loop so far; 0 for the plain loop.
  virtual std::uint64_t ScheduledRuns() const { return 0; }
};

class PlainLoop : public MainLoop {
public:
  const char* Name() const override { return "plain flush"; }
  void Drain() override { Tarn::StationUtils::FlushPostedMessagesOnUIThread(); }
  void RunUntilDone(Counter& inCounter) override {
    const auto adaptor = kivcore::threads::GetRegisteredMainThread();
    while (inCounter.mCount < inCounter.mTarget)
      if (adaptor->WaitForPendingCalls(100)) Tarn::StationUtils::FlushPostedMessagesOnUIThread();
  }
};

class AsioLoop : public MainLoop {
public:
  AsioLoop() : mMessaging(mContext) {}
  const char* Name() const override { return "asio"; }
  void Drain() override {
    mContext.restart();
    mContext.poll();
  }
  void RunUntilDone(Counter& inCounter) override {
    inCounter.mOnTarget = [this] { mContext.stop(); };
    auto work = boost::asio::make_work_guard(mContext);
    mContext.restart();
    mContext.run();
    inCounter.mOnTarget = nullptr;
  }

  std::uint64_t ScheduledRuns() const override { return mMessaging.ScheduledRuns(); }

private:
  boost::asio::io_context mContext;
  Tarn::Integration::AsioEventLoop mMessaging;
};

#if TARN_HAVE_GLIB_INTEGRATION
class GLibLoop : public MainLoop {
public:
  GLibLoop() : mContext(g_main_context_new()), mLoop(g_main_loop_new(mContext, FALSE)), mMessaging(mContext) {}
  ~GLibLoop() override {
    g_main_loop_unref(mLoop);
    g_main_context_unref(mContext);
  }
  const char* Name() const override { return "glib"; }
  void Drain() override {
    while (g_main_context_iteration(mContext, FALSE)) {
    }
  }
  void RunUntilDone(Counter& inCounter) override {
    inCounter.mOnTarget = [this] { g_main_loop_quit(mLoop); };
    g_main_loop_run(mLoop);
    inCounter.mOnTarget = nullptr;
  }

  std::uint64_t ScheduledRuns() const override { return mMessaging.ScheduledRuns(); }

private:
  GMainContext* mContext;
  GMainLoop* mLoop;
  Tarn::Integration::GLibEventLoop mMessaging;
};
#endif

#if TARN_HAVE_QT_INTEGRATION
// Needs the QCoreApplication that main makes.
class QtLoop : public MainLoop {
public:
  const char* Name() const override { return "qt"; }
  void Drain() override { QCoreApplication::sendPostedEvents(); }
  void RunUntilDone(Counter& inCounter) override {
    inCounter.mOnTarget = [] { QCoreApplication::quit(); };
    QCoreApplication::exec();
    inCounter.mOnTarget = nullptr;
  }

  std::uint64_t ScheduledRuns() const override { return mMessaging.ScheduledRuns(); }

private:
  Tarn::Integration::QtEventLoop mMessaging;
};
#endif

double NanosecondsPer(Clock::duration inElapsed, int inMessages) {
  return std::chrono::duration<double, std::nano>(inElapsed).count() / inMessages;
}

double Median(std::vector<double> inValues) {
  std::sort(inValues.begin(), inValues.end());
  return inValues[inValues.size() / 2];
}

void PostAll(int inMessages) {
  for (int i = 0; i < inMessages; ++i)
    Tarn::StationUtils::PostMessageToUIThread(Tarn::kStation_StatusBar, Tick(i), false);
}

struct Figures {
  std::vector<double> mPost, mDrain, mStream;
  std::vector<double> mStreamBurst;  // messages per scheduled run while streaming
};

// One repetition of the three measurements on a fresh loop.
void MeasureOnce(MainLoop& inLoop, int inMessages, Figures& outFigures) {
  Counter counter;
  Tarn::StationUtils::AddListener(Tarn::kStation_StatusBar, &counter);
  counter.mTarget = inMessages;
  Clock::duration posting{};
  std::thread worker([&posting, inMessages] {
    const Clock::time_point start = Clock::now();
    PostAll(inMessages);
    posting = Clock::now() - start;
  });
  worker.join();
  outFigures.mPost.push_back(NanosecondsPer(posting, inMessages));
  const Clock::time_point drainStart = Clock::now();
  inLoop.Drain();
  outFigures.mDrain.push_back(NanosecondsPer(Clock::now() - drainStart, inMessages));
  if (counter.mCount != inMessages) {
    std::fprintf(stderr, "%s: drained %d of %d\n", inLoop.Name(), counter.mCount, inMessages);
    std::exit(1);
  }

  counter.mCount = 0;
  const std::uint64_t runsBefore = inLoop.ScheduledRuns();
  const Clock::time_point streamStart = Clock::now();
  std::thread streamer([inMessages] { PostAll(inMessages); });
  inLoop.RunUntilDone(counter);
  outFigures.mStream.push_back(NanosecondsPer(Clock::now() - streamStart, inMessages));
  streamer.join();
  const std::uint64_t runs = inLoop.ScheduledRuns() - runsBefore;
  outFigures.mStreamBurst.push_back(runs == 0 ? 0.0 : static_cast<double>(inMessages) / static_cast<double>(runs));
  Tarn::StationUtils::RemoveListener(Tarn::kStation_StatusBar, &counter);
}

struct Contender {
  const char* mName;
  std::function<std::unique_ptr<MainLoop>()> mMake;
  Figures mFigures;
};

}  // namespace

int main(int argc, char** argv) {
  const int messages = argc > 1 ? std::max(1, std::atoi(argv[1])) : 200000;
  const int repetitions = argc > 2 ? std::max(1, std::atoi(argv[2])) : 5;
#if TARN_HAVE_QT_INTEGRATION
  QCoreApplication application(argc, argv);
#endif
  Tarn::Messaging::Initialize();
  std::printf("%d messages, median of %d repetitions, ns per message\n", messages, repetitions);
  std::vector<Contender> contenders;
  contenders.push_back({"plain flush", [] { return std::make_unique<PlainLoop>(); }, {}});
  contenders.push_back({"asio", [] { return std::make_unique<AsioLoop>(); }, {}});
#if TARN_HAVE_GLIB_INTEGRATION
  contenders.push_back({"glib", [] { return std::make_unique<GLibLoop>(); }, {}});
#endif
#if TARN_HAVE_QT_INTEGRATION
  contenders.push_back({"qt", [] { return std::make_unique<QtLoop>(); }, {}});
#endif
  // Round robin, so that a change of machine load hits every contender alike;
  // one integration exists at a time.
  for (int rep = 0; rep < repetitions; ++rep) {
    for (Contender& contender : contenders) {
      std::unique_ptr<MainLoop> loop = contender.mMake();
      MeasureOnce(*loop, messages, contender.mFigures);
    }
  }
  for (const Contender& contender : contenders) {
    std::printf("%-12s post %7.1f   drain %7.1f   stream %7.1f   messages per run while streaming %9.1f\n",
                contender.mName, Median(contender.mFigures.mPost), Median(contender.mFigures.mDrain),
                Median(contender.mFigures.mStream), Median(contender.mFigures.mStreamBurst));
  }
  Tarn::Messaging::Terminate();
  return 0;
}
