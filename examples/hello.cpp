// The smallest complete use of the library: a message type, a typed
// subscription to a well-known station, a post from a worker thread, and the
// main thread running its pending calls.
#include <TarnMessaging.h>

#include <cstdio>
#include <thread>

struct Progress : Tarn::MessageImpl<Progress> {
  Progress(int inDone, int inTotal) : mDone(inDone), mTotal(inTotal) {}
  int mDone;
  int mTotal;
};

int main() {
  Tarn::Messaging::Initialize();  // this thread is the main thread from now on
  int received = 0;
  Tarn::Registration line =
      Tarn::Subscribe<Progress>(Tarn::kStation_StatusBar, [&received](const Progress& inProgress) {
        std::printf("received Progress %d/%d on the main thread\n", inProgress.mDone, inProgress.mTotal);
        ++received;
      });

  Tarn::StationUtils::BroadcastMessage(Tarn::kStation_StatusBar, Progress(0, 3));  // delivered at once
  std::thread worker([] {
    for (int i = 1; i <= 3; ++i)
      Tarn::StationUtils::PostMessageToUIThread(Tarn::kStation_StatusBar, Progress(i, 3), false);
  });
  worker.join();
  Tarn::StationUtils::FlushPostedMessagesOnUIThread();  // the three posts arrive here

  line.Reset();  // detached before the library goes
  Tarn::Messaging::Terminate();
  std::printf("%d messages received\n", received);
  return received == 4 ? 0 : 1;
}
