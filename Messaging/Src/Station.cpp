#include <TarnMessaging/Station.h>
#include <TarnMessaging/StationRegistry.h>

namespace Tarn {

Station::Station(const kivcore::utility::ImmutableString& inStationID) : mStationID(inStationID) {}

Station::~Station() {
  // The registry removes a station's record before deleting it, so this
  // lookup normally finds nothing; it also makes a registry that is already
  // gone at process exit say so.
  StationRegistry::FindStation(mStationID);
}

void Station::BroadcastMessage(const Message& inMessage) { Broadcaster::BroadcastMessage(inMessage); }

void Station::ListenToMessage(const Message& inMessage) { Broadcaster::BroadcastMessage(inMessage); }

}  // namespace Tarn
