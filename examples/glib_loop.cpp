// A host whose main thread runs a GLib main loop: worker threads post
// progress messages, and the loop delivers them on the main thread through
// Tarn::Integration::GLibEventLoop, one idle source per burst.
#include <TarnMessaging.h>
#include <TarnMessaging/Integration/GLibEventLoop.h>

#include <glib.h>

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
  unsigned long long sources = 0;
  {
    GMainContext* context = g_main_context_new();
    GMainLoop* loop = g_main_loop_new(context, FALSE);
    // Runs on the main thread, so no lock guards the count; the last message
    // quits the loop.
    Tarn::Registration bar = Tarn::Subscribe<Progress>(Tarn::kStation_StatusBar, [&](const Progress& inProgress) {
      if (inProgress.mDone == kStepsPerWorker) std::printf("worker %d finished\n", inProgress.mWorker);
      if (++received == kWorkers * kStepsPerWorker) g_main_loop_quit(loop);
    });
    Tarn::Integration::GLibEventLoop messaging(context);  // holds its own reference on the context

    std::vector<std::thread> workers;
    workers.reserve(kWorkers);
    for (int w = 0; w < kWorkers; ++w) {
      workers.emplace_back([w] {
        for (int step = 1; step <= kStepsPerWorker; ++step)
          Tarn::StationUtils::PostMessageToUIThread(Tarn::kStation_StatusBar, Progress(w, step), false);
      });
    }
    // A timeout ends a run that would otherwise wait for ever.
    GSource* giveUp = g_timeout_source_new_seconds(30);
    g_source_set_callback(
        giveUp,
        [](gpointer inLoop) -> gboolean {
          g_main_loop_quit(static_cast<GMainLoop*>(inLoop));
          return G_SOURCE_REMOVE;
        },
        loop, nullptr);
    g_source_attach(giveUp, context);
    g_main_loop_run(loop);
    g_source_destroy(giveUp);
    g_source_unref(giveUp);
    for (std::thread& worker : workers) worker.join();

    sources = messaging.ScheduledRuns();
    bar.Reset();
    g_main_loop_unref(loop);
    g_main_context_unref(context);
  }  // the integration goes before the library does, and drops the last reference on the context
  Tarn::Messaging::Terminate();
  std::printf("%d messages received through %llu idle sources\n", received, sources);
  return received == kWorkers * kStepsPerWorker ? 0 : 1;
}
