#include "MeteredStation.h"

#include "DemoMessages.h"

#include <kivcore/MainThread.h>

namespace tarn_demo {

namespace {

// The factory is a plain function pointer, so the ledger it counts into is
// handed over here.
DropLedger* sLedger = nullptr;

Tarn::Station* MakeMeteredStation(const kivcore::utility::ImmutableString& inStationID) {
  return new MeteredStation(inStationID, *sLedger);
}

}  // namespace

MeteredStation::MeteredStation(const kivcore::utility::ImmutableString& inStationID, DropLedger& ioLedger)
    : Tarn::Station(inStationID), mLedger(ioLedger) {}

void MeteredStation::BroadcastMessage(const Tarn::Message& inMessage) {
  // Read on the main thread, the only thread that stops and starts the
  // station and the only one on which the broadcast below delivers: the state
  // seen here is the state the broadcast acts on.
  if (inMessage.GetMessageID() == ProgressMessage::StaticMessageID() && kivcore::threads::CurrentThreadIsMainThread()) {
    if (IsBroadcasting()) {
      ++mLedger.mArrivedWhileBroadcasting;
    } else {
      ++mLedger.mDroppedWhileStopped;
    }
  }
  Tarn::Station::BroadcastMessage(inMessage);
}

void InstallMeteredStatusBar(DropLedger* ioLedger) {
  sLedger = ioLedger;
  Tarn::StationRegistry::RegisterStation(Tarn::kStation_StatusBar, &MakeMeteredStation);
}

bool StatusBarIsMetered() {
  return dynamic_cast<MeteredStation*>(Tarn::StationRegistry::FindStation(Tarn::kStation_StatusBar)) != nullptr;
}

}  // namespace tarn_demo
