// The smallest complete use of the library: a message type, a listener on a
// well-known station, a post from a worker thread, and the main thread
// running its pending calls.
#include <TarnMessaging.h>

#include <cstdio>
#include <thread>

struct Progress : Tarn::MessageImpl<Progress> {
  Progress(int inDone, int inTotal) : mDone(inDone), mTotal(inTotal) {}
  int mDone;
  int mTotal;
};

class StatusLine : public Tarn::Listener {
public:
  void ListenToMessage(const Tarn::Message& inMessage) override {
    if (inMessage.GetMessageID() != Progress::StaticMessageID()) return;
    const auto& progress = static_cast<const Progress&>(inMessage);
    std::printf("received Progress %d/%d on the main thread\n", progress.mDone, progress.mTotal);
    ++mReceived;
  }
  int mReceived = 0;
};

int main() {
  Tarn::Messaging::Initialize();  // this thread is the main thread from now on
  StatusLine line;
  Tarn::StationUtils::AddListener(Tarn::kStation_StatusBar, &line);

  Tarn::StationUtils::BroadcastMessage(Tarn::kStation_StatusBar, Progress(0, 3));  // delivered at once
  std::thread worker([] {
    for (int i = 1; i <= 3; ++i)
      Tarn::StationUtils::PostMessageToUIThread(Tarn::kStation_StatusBar, Progress(i, 3), false);
  });
  worker.join();
  Tarn::StationUtils::FlushPostedMessagesOnUIThread();  // the three posts arrive here

  Tarn::StationUtils::RemoveListener(Tarn::kStation_StatusBar, &line);
  Tarn::Messaging::Terminate();
  std::printf("%d messages received\n", line.mReceived);
  return line.mReceived == 4 ? 0 : 1;
}
