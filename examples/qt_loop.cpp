// A host whose main thread runs a QCoreApplication: worker threads post
// progress messages, and Qt's event loop delivers them on the main thread
// through Tarn::Integration::QtEventLoop, one posted event per burst. The
// integration's idle source drives an IdleCountdownTimer that quits the
// application once it has been quiet for a moment after the last message.
#include <TarnMessaging.h>
#include <TarnMessaging/Integration/QtEventLoop.h>

#include <QtCore/QCoreApplication>
#include <QtCore/QTimer>

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
constexpr unsigned kQuietMilliSeconds = 100;

int main(int argc, char** argv) {
  QCoreApplication application(argc, argv);
  Tarn::Messaging::Initialize();  // the QCoreApplication's thread is the main thread from now on
  int received = 0;
  unsigned long long events = 0, idles = 0;
  {
    // Everything here runs on the main thread, so no lock guards the count.
    Tarn::IdleCountdownTimer quiet;
    quiet.SetDuration(kQuietMilliSeconds);
    Tarn::Registration bar = Tarn::Subscribe<Progress>(Tarn::kStation_StatusBar, [&](const Progress& inProgress) {
      if (inProgress.mDone == kStepsPerWorker) std::printf("worker %d finished\n", inProgress.mWorker);
      if (++received == kWorkers * kStepsPerWorker) quiet.ArmTimer();
    });
    Tarn::Registration done = Tarn::Subscribe<Tarn::IdleCountdownTimerMessage>(
        quiet.GetStationID(), [](const Tarn::IdleCountdownTimerMessage&) { QCoreApplication::quit(); });
    Tarn::Integration::QtEventLoop messaging;
    messaging.SetIdleInterval(std::chrono::milliseconds(10));

    std::vector<std::thread> workers;
    workers.reserve(kWorkers);
    for (int w = 0; w < kWorkers; ++w) {
      workers.emplace_back([w] {
        for (int step = 1; step <= kStepsPerWorker; ++step)
          Tarn::StationUtils::PostMessageToUIThread(Tarn::kStation_StatusBar, Progress(w, step), false);
      });
    }
    // A timer ends a run that would otherwise wait for ever.
    QTimer::singleShot(30000, &application, &QCoreApplication::quit);
    QCoreApplication::exec();
    for (std::thread& worker : workers) worker.join();

    events = messaging.ScheduledRuns();
    idles = messaging.IdleBroadcasts();
    bar.Reset();
    done.Reset();
  }  // the integration goes before the library does
  Tarn::Messaging::Terminate();
  std::printf("%d messages received through %llu Qt events; %llu idle broadcasts, the last one after %u ms of quiet\n",
              received, events, idles, kQuietMilliSeconds);
  return received == kWorkers * kStepsPerWorker ? 0 : 1;
}
