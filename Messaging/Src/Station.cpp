#include <TarnMessaging/Station.h>
#include <TarnMessaging/StationRegistry.h>

#include "ContractCheck.h"
#include "DiagnosticReports.h"
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
  mBroadcastDepth.fetch_add(1, std::memory_order_seq_cst);
  // Two stack stores: the record of what this station relays lives in the
  // broadcast's own frame, so a relay allocates nothing.
  const RelayFrame frame{&inMessage, mRelaying};
  mRelaying = &frame;
  struct Leave {
    Station* mStation;
    const RelayFrame* mOuter;
    ~Leave() {
      mStation->mRelaying = mOuter;
      // The outermost broadcast has ended: stations retired meanwhile (this
      // one perhaps) may go now. Nothing of this station is touched after.
      if (mStation->mBroadcastDepth.fetch_sub(1, std::memory_order_seq_cst) == 1) StationRetirement::DrainRetired();
    }
  } leave{this, frame.mOuter};
  Broadcaster::BroadcastMessage(inMessage);
}

bool Station::IsRelaying(const Message& inMessage) const noexcept {
  for (const RelayFrame* frame = mRelaying; frame != nullptr; frame = frame->mOuter) {
    if (frame->mMessage == &inMessage) return true;
  }
  return false;
}

void Station::BroadcastMessage(const Message& inMessage) {
  // Off the main thread a broadcast delivers nothing and needs no count.
  if (!kivcore::threads::CurrentThreadIsMainThread()) {
    Diagnostics::Detail::ReportSilentFailure(Diagnostics::Detail::Failure::kBroadcastOffMainThread, TARN_CALL_SITE(),
                                             "Tarn::Station::BroadcastMessage", mStationID);
    return;
  }
  BroadcastCounted(inMessage);
}

void Station::ListenToMessage(const Message& inMessage) {
  // Relays run inside a broadcast, on the main thread; mRelaying belongs to
  // that thread.
  if (!kivcore::threads::CurrentThreadIsMainThread()) return;
  // The same object coming back is a cycle of relays (or a station attached
  // to itself): relaying it again would recurse without end. Everyone below
  // has heard it or will, so dropping the repeat loses nothing.
  if (mRelaying != nullptr && IsRelaying(inMessage)) {
    TARN_CONTRACT_CHECK(!IsRelaying(inMessage), "Tarn::Station::ListenToMessage");
    return;
  }
  BroadcastCounted(inMessage);
}

}  // namespace Tarn
