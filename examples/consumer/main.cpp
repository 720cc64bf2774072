// Built against an installed TarnMessaging: a listener on a private station
// hears one message broadcast on the main thread and one posted from a worker.
#include <TarnFoundation/TarnFoundation.h>
#include <TarnMessaging.h>
#include <kivcore/kivcore.h>

#include <cstdio>
#include <thread>

namespace {

struct Ping : Tarn::MessageImpl<Ping> {
  explicit Ping(int inValue) : mValue(inValue) {}
  int mValue;
};

class Counter : public Tarn::Listener {
public:
  void ListenToMessage(const Tarn::Message& inMessage) override {
    if (inMessage.GetMessageID() == Ping::StaticMessageID()) mSum += static_cast<const Ping&>(inMessage).mValue;
  }
  int mSum = 0;
};

}  // namespace

int main() {
  Tarn::Messaging::Initialize();
  const kivcore::utility::ImmutableString station = Tarn::StationRegistry::RegisterUniqueStation();
  Counter counter;
  Tarn::StationUtils::AddListener(station, &counter);
  Tarn::StationUtils::BroadcastMessage(station, Ping(1));
  std::thread worker([&station] { Tarn::StationUtils::PostMessageToUIThread(station, Ping(2), false); });
  worker.join();
  Tarn::StationUtils::FlushPostedMessagesOnUIThread();
  Tarn::StationUtils::RemoveListener(station, &counter);
  Tarn::StationRegistry::DisposeStation(station);
  Tarn::Messaging::Terminate();
  std::printf("consumer: sum %d (expected 3)\n", counter.mSum);
  return counter.mSum == 3 ? 0 : 1;
}
