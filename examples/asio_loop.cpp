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

class ProgressBar : public Tarn::Listener {
public:
  explicit ProgressBar(boost::asio::io_context& inContext) : mContext(inContext) {}
  void ListenToMessage(const Tarn::Message& inMessage) override {
    if (inMessage.GetMessageID() != Progress::StaticMessageID()) return;
    const auto& progress = static_cast<const Progress&>(inMessage);
    if (progress.mDone == kStepsPerWorker) std::printf("worker %d finished\n", progress.mWorker);
    // The last message quits the loop; the listener runs on the main thread,
    // so no lock guards the count.
    if (++mReceived == kWorkers * kStepsPerWorker) mContext.stop();
  }
  int mReceived = 0;

private:
  boost::asio::io_context& mContext;
};

int main() {
  Tarn::Messaging::Initialize();  // this thread is the main thread from now on
  int received = 0;
  unsigned long long handlers = 0;
  {
    boost::asio::io_context context;
    ProgressBar bar(context);
    Tarn::StationUtils::AddListener(Tarn::kStation_StatusBar, &bar);
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

    received = bar.mReceived;
    handlers = messaging.ScheduledRuns();
    Tarn::StationUtils::RemoveListener(Tarn::kStation_StatusBar, &bar);
  }  // the integration goes before the library does
  Tarn::Messaging::Terminate();
  std::printf("%d messages received through %llu io_context handlers\n", received, handlers);
  return received == kWorkers * kStepsPerWorker ? 0 : 1;
}
