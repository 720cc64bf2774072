#include <TarnMessaging/Station.h>
#include <TarnMessaging/StationIDs.h>
#include <TarnMessaging/StationRegistry.h>

#include "PostKinds.h"
#include "StationRetirement.h"

#include <kivcore/MainThread.h>

namespace Tarn {

Station::Station(const kivcore::utility::ImmutableString& inStationID) : mStationID(inStationID) {}

Station::~Station() {
  // While the station is still whole: a broadcaster on another thread may be
  // about to deliver to the listener part, and must find either a whole
  // station or none (not one whose relay has already become pure virtual).
  DetachFromBroadcasters();
  // The registry removes a station's record before deleting it, so this
  // lookup normally finds nothing; it also makes a registry that is already
  // gone at process exit say so.
  StationRegistry::FindStation(mStationID);
}

void Station::BroadcastCounted(const Message& inMessage) {
  // Off the main thread a broadcast delivers nothing and needs no count.
  if (!kivcore::threads::CurrentThreadIsMainThread()) return;
  mBroadcastDepth.fetch_add(1, std::memory_order_seq_cst);
  struct Leave {
    Station* mStation;
    ~Leave() {
      // The outermost broadcast has ended: stations retired meanwhile (this
      // one perhaps) may go now. Nothing of this station is touched after.
      if (mStation->mBroadcastDepth.fetch_sub(1, std::memory_order_seq_cst) == 1) StationRetirement::DrainRetired();
    }
  } leave{this};
  // Idle-time posts go out with an idle broadcast that its listeners hear,
  // just before them; inside the count, so that the station outlives them.
  if (Detail::sIdlePostsWaiting.load(std::memory_order_relaxed) && mStationID == kStation_Idle && IsBroadcasting())
    Detail::RunIdlePosts();
  Broadcaster::BroadcastMessage(inMessage);
}

void Station::BroadcastMessage(const Message& inMessage) { BroadcastCounted(inMessage); }

void Station::ListenToMessage(const Message& inMessage) { BroadcastCounted(inMessage); }

}  // namespace Tarn
