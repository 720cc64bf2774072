#include <TarnMessaging/Station.h>
#include <TarnMessaging/StationIDs.h>
#include <TarnMessaging/StationRegistry.h>

#include "ContractCheck.h"
#include "DiagnosticReports.h"
#include "PostKinds.h"
#include "StationRetirement.h"

#include <kivcore/Error.h>
#include <kivcore/MainThread.h>

#include <exception>

namespace Tarn {

namespace {

// One station broadcast running on this thread: a record on the
// broadcasting thread's own stack, linked from the innermost outwards.
struct RelayFrame {
  const Station* mStation;
  const Message* mMessage;
  const RelayFrame* mOuter;
};

// The innermost frame of this thread. Per thread, not per station: the main
// thread may change while a broadcast runs (its thread then finishes it), so
// two threads may each have broadcasts on one station running, and each walks
// and unwinds only its own frames. Initial-exec, as kivcore's allocator
// cache: one load or store relative to the thread pointer.
thread_local const RelayFrame* tRelaying __attribute__((tls_model("initial-exec"))) = nullptr;

}  // namespace

Station::Station(const kivcore::utility::ImmutableString& inStationID) : mStationID(inStationID) {}

Station::~Station() {
  // While the station is still whole: a broadcaster on another thread may be
  // about to deliver to the listener part, and must find either a whole
  // station or none (not one whose relay has already become pure virtual).
  DetachFromBroadcasters();
  // The registry removes a station's record before deleting it, so this
  // lookup normally finds nothing; it also makes a registry that is already
  // gone at process exit say so. For an ID registered anew it makes that
  // record's station, and the factory may throw (std::bad_alloc included):
  // a destructor cannot let that out, so the error manager gets it and the
  // destruction goes on.
  kivcore::config::ErrorManager::Get(false)->GuardedCall([this] {
    StationRegistry::FindStation(mStationID);
    return 1;
  });
}

void Station::BroadcastCounted(const Message& inMessage) {
  mBroadcastDepth.fetch_add(1, std::memory_order_seq_cst);
  // A few stack stores: the record of what this station relays lives in the
  // broadcast's own frame, so a relay allocates nothing.
  const RelayFrame frame{this, &inMessage, tRelaying};
  tRelaying = &frame;
  struct Leave {
    Station* mStation;
    const RelayFrame* mOuter;
    ~Leave() {
      tRelaying = mOuter;
      // The outermost broadcast has ended: stations retired meanwhile (this
      // one perhaps) may go now. Nothing of this station is touched after.
      if (mStation->mBroadcastDepth.fetch_sub(1, std::memory_order_seq_cst) == 1) StationRetirement::DrainRetired();
    }
  } leave{this, frame.mOuter};
  // Idle-time posts go out with an idle broadcast that its listeners hear,
  // just before them; inside the count, so that the station outlives them.
  // One that throws (its station's factory, say) does not cost the idle
  // listeners their message: the exception leaves once they have heard it.
  std::exception_ptr idleFailure;
  if (Detail::sIdlePostsWaiting.load(std::memory_order_relaxed) && mStationID == kStation_Idle && IsBroadcasting()) {
    try {
      Detail::RunIdlePosts();
    } catch (...) {
      idleFailure = std::current_exception();
    }
  }
  Broadcaster::BroadcastMessage(inMessage);
  if (idleFailure) std::rethrow_exception(idleFailure);
}

bool Station::IsRelaying(const Message& inMessage) const noexcept {
  // As deep as station broadcasts are nested on this thread: one or two
  // frames in practice.
  for (const RelayFrame* frame = tRelaying; frame != nullptr; frame = frame->mOuter) {
    if (frame->mStation == this && frame->mMessage == &inMessage) return true;
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
  // Off the main thread a relay delivers nothing and needs no count.
  if (!kivcore::threads::CurrentThreadIsMainThread()) return;
  // The same object coming back is a cycle of relays (or a station attached
  // to itself): relaying it again would recurse without end. Everyone below
  // has heard it or will, so dropping the repeat loses nothing.
  if (IsRelaying(inMessage)) {
    TARN_CONTRACT_CHECK(!IsRelaying(inMessage), "Tarn::Station::ListenToMessage");
    return;
  }
  BroadcastCounted(inMessage);
}

}  // namespace Tarn
