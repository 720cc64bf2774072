// A host whose main thread runs a boost::asio::io_context: worker threads
// post progress messages, and the io_context delivers them on the main
// thread through Tarn::Integration::AsioEventLoop, one handler per burst.
#include <TarnMessaging.h>
#include <TarnMessaging/Integration/AsioEventLoop.h>

#include <boost/asio/executor_work_guard.hpp>
#include <boost/asio/io_context.hpp>
#include <boost/asio/steady_timer.hpp>

#include <chrono>
#include <cstdio>
#include <thread>
#include <vector>

struct Progress : Tarn::MessageImpl<Progress> {
  Progress(int inWorker, int inDone) : mWorker(inWorker), mDone(inDone) {}
  int mWorker;
  int mDone;
};

constexpr int kWorkers = 3;
constexpr int kStepsPerWorker = 1000;

int main() {
  Tarn::Messaging::Initialize();  // this thread is the main thread from now on
  int received = 0;
  unsigned long long handlers = 0;
  {
    boost::asio::io_context context;
    // Runs on the main thread, so no lock guards the count; the last message
    // quits the loop.
    Tarn::Registration bar = Tarn::Subscribe<Progress>(Tarn::kStation_StatusBar, [&](const Progress& inProgress) {
      if (inProgress.mDone == kStepsPerWorker) std::printf("worker %d finished\n", inProgress.mWorker);
      if (++received == kWorkers * kStepsPerWorker) context.stop();
    });
    Tarn::Integration::AsioEventLoop messaging(context);

    std::vector<std::thread> workers;
    workers.reserve(kWorkers);
    for (int w = 0; w < kWorkers; ++w) {
      workers.emplace_back([w] {
        for (int step = 1; step <= kStepsPerWorker; ++step)
          Tarn::StationUtils::PostMessageToUIThread(Tarn::kStation_StatusBar, Progress(w, step), false);
      });
    }
    // Keeps run() going while the workers are between posts; a timer ends a
    // run that would otherwise wait for ever.
    auto work = boost::asio::make_work_guard(context);
    boost::asio::steady_timer giveUp(context, std::chrono::seconds(30));
    giveUp.async_wait([&context](const boost::system::error_code& inError) {
      if (!inError) context.stop();
    });
    context.run();
    for (std::thread& worker : workers) worker.join();

    handlers = messaging.ScheduledRuns();
    bar.Reset();
  }  // the integration goes before the library does
  Tarn::Messaging::Terminate();
  std::printf("%d messages received through %llu io_context handlers\n", received, handlers);
  return received == kWorkers * kStepsPerWorker ? 0 : 1;
}
