#include <TarnMessaging/IdleCountdownTimer.h>
#include <TarnMessaging/Station.h>
#include <TarnMessaging/StationIDs.h>
#include <TarnMessaging/StationRegistry.h>
#include <TarnMessaging/StationUtils.h>

#include <TarnFoundation/TimeStamp.h>

namespace Tarn {

IdleCountdownTimer::IdleCountdownTimer() : mStationID(StationRegistry::RegisterUniqueStation()) {}

IdleCountdownTimer::~IdleCountdownTimer() {
  if (mListeningForIdle) {
    mListeningForIdle = false;
    StationUtils::RemoveListener(kStation_Idle, this);
  }
  StationRegistry::DisposeStation(mStationID);
}

std::uint32_t IdleCountdownTimer::NowMilliSeconds() {
  // Truncated toward zero, then the low 32 bits: the deadline arithmetic
  // wraps modulo 2^32.
  return static_cast<std::uint32_t>(static_cast<std::int64_t>(TimeStamp().GetMilliSeconds()));
}

void IdleCountdownTimer::ArmTimer() {
  mDeadline = NowMilliSeconds() + mDuration;
  if (!mListeningForIdle) {
    StationUtils::AddListener(kStation_Idle, this);
    // Before library initialization the idle station does not exist and the
    // attach does nothing. Marking the timer as listening all the same would
    // make every later ArmTimer skip the attach and leave the timer dead, so
    // the mark follows what actually happened.
    Station* const idle = StationRegistry::FindStation(kStation_Idle);
    mListeningForIdle = idle != nullptr && HasBroadcaster(idle);
  }
}

void IdleCountdownTimer::ListenToMessage(const Message& inMessage) {
  if (inMessage.GetMessageID() != MessageImpl<ApplicationIdleMessage>::StaticMessageID()) return;
  if (!mListeningForIdle) return;
  // Serial-number comparison of the wrapping 32-bit clock: the deadline is
  // reached when now is at most 2^31 ms (24.8 days) before it. A plain
  // unsigned comparison would fire up to a whole duration early when the
  // deadline wraps past 2^32, and stall for 49.7 days when the clock wraps
  // after arming (a monotonic clock that counts from boot does so on machines
  // up for longer than that).
  if (static_cast<std::int32_t>(NowMilliSeconds() - mDeadline) < 0) return;
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
