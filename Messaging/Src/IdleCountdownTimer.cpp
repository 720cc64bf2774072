#include <TarnMessaging/IdleCountdownTimer.h>
#include <TarnMessaging/Station.h>
#include <TarnMessaging/StationIDs.h>
#include <TarnMessaging/StationRegistry.h>
#include <TarnMessaging/StationUtils.h>

#include <TarnFoundation/TimeStamp.h>

#include <kivcore/MainThread.h>

#include "TracingState.h"

#include <new>

namespace Tarn {

IdleCountdownTimer::IdleCountdownTimer() : mStationID(StationRegistry::RegisterUniqueStation()) {}

IdleCountdownTimer::~IdleCountdownTimer() {
#ifndef NDEBUG
  // The timer's state is the main thread's, unguarded: destroyed elsewhere it
  // races with the idle handler. With no main thread registered (after the
  // last Terminate, at exit) nothing can deliver to it.
  if (!kivcore::threads::CurrentThreadIsMainThread() && kivcore::threads::GetRegisteredMainThread()) {
    TracingState::ReportMisuse("the timer is destroyed on the main thread", __FILE__,
                               "Tarn::IdleCountdownTimer::~IdleCountdownTimer", __LINE__);
  }
#endif
  // Detached here, while the timer is whole: ~Listener detaches only once
  // ListenToMessage is pure again, and a delivery reaching the timer then
  // would call a pure function.
  if (mListeningForIdle) {
    try {
      StationUtils::RemoveListener(kStation_Idle, this);
    } catch (const std::bad_alloc&) {
      // The only allocation on this path is the making of an idle station
      // that does not exist yet (after Terminate and Initialize), and the
      // timer cannot be attached to a station that does not exist.
    }
  }
  StationRegistry::DisposeStation(mStationID);
}

std::int64_t IdleCountdownTimer::NowMilliSeconds() {
  // Truncated toward zero. A reading outside +-2^62 ms (a broken clock) is
  // clamped, so that the conversion and the deadline's sum stay defined.
  constexpr double kLimit = 4611686018427387904.0;
  const double now = TimeStamp().GetMilliSeconds();
  if (!(now > -kLimit)) return -static_cast<std::int64_t>(kLimit);
  if (!(now < kLimit)) return static_cast<std::int64_t>(kLimit);
  return static_cast<std::int64_t>(now);
}

kivcore::utility::ImmutableString IdleCountdownTimer::GetStationID() const {
  // Terminate empties the registry; an ID registered already keeps its
  // record, so this is a no-op whenever the library has not been restarted.
  StationRegistry::RegisterStation(mStationID, nullptr);
  return mStationID;
}

void IdleCountdownTimer::ArmTimer() {
  StationRegistry::RegisterStation(mStationID, nullptr);
  mDeadline = NowMilliSeconds() + static_cast<std::int64_t>(mDuration);
  // The idle station's record decides, not a flag of our own: Terminate
  // deletes the station the timer was attached to, and before library
  // initialization the attach does nothing at all.
  Station* idle = StationRegistry::FindStation(kStation_Idle);
  if (idle == nullptr || !HasBroadcaster(idle)) {
    StationUtils::AddListener(kStation_Idle, this);
    idle = StationRegistry::FindStation(kStation_Idle);
  }
  mListeningForIdle = idle != nullptr && HasBroadcaster(idle);
}

void IdleCountdownTimer::ListenToMessage(const Message& inMessage) {
  if (!inMessage.Is<ApplicationIdleMessage>()) return;
  if (!mListeningForIdle) return;
  if (NowMilliSeconds() < mDeadline) return;
  if (mFiring) return;
  mFiring = true;
  // Cleared on every way out, an exception included: a timer whose firing
  // threw once must still fire when armed again.
  struct FiringReset {
    bool& mFlag;
    ~FiringReset() { mFlag = false; }
  } reset{mFiring};
  // Detached before the broadcast, so a handler that re-arms attaches anew.
  StationUtils::RemoveListener(kStation_Idle, this);
  mListeningForIdle = false;
  const IdleCountdownTimerMessage message(mCookie);
  StationUtils::BroadcastMessage(mStationID, message);
}

}  // namespace Tarn
