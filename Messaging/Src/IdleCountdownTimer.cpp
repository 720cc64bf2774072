#include <TarnMessaging/IdleCountdownTimer.h>
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
    mListeningForIdle = true;
    StationUtils::AddListener(kStation_Idle, this);
  }
}

void IdleCountdownTimer::ListenToMessage(const Message& inMessage) {
  if (inMessage.GetMessageID() != MessageImpl<ApplicationIdleMessage>::StaticMessageID()) return;
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
