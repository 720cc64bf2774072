#include "DemoListeners.h"

#include "DemoMessages.h"

#include <thread>

namespace tarn_demo {

AutosaveScheduler::AutosaveScheduler(std::uint32_t inIdleMilliSeconds) {
  mTimer.SetDuration(inIdleMilliSeconds);
  mTimer.SetCookie(kAutosaveCookie);
}

void AutosaveScheduler::Attach(const std::weak_ptr<Tarn::Listener>& inSelf) {
  Tarn::StationUtils::AddListener(Tarn::kStation_StatusBar, inSelf);
  Tarn::StationUtils::AddListener(mTimer.GetStationID(), inSelf);
}

void AutosaveScheduler::Detach(const std::weak_ptr<Tarn::Listener>& inSelf) {
  Tarn::StationUtils::RemoveListener(Tarn::kStation_StatusBar, inSelf);
  Tarn::StationUtils::RemoveListener(mTimer.GetStationID(), inSelf);
}

void AutosaveScheduler::ListenToMessage(const Tarn::Message& inMessage) {
  if (inMessage.GetMessageID() == ProgressMessage::StaticMessageID()) {
    ++mProgressHeard;
    mTimer.ArmTimer();
    return;
  }
  if (inMessage.GetMessageID() == Tarn::IdleCountdownTimerMessage::StaticMessageID() &&
      static_cast<const Tarn::IdleCountdownTimerMessage&>(inMessage).GetCookie() == kAutosaveCookie) {
    ++mAutosaves;
    if (mOnAutosave) mOnAutosave();
  }
}

void LifecycleListener::ListenToMessage(const Tarn::Message& inMessage) {
  if (inMessage.GetMessageID() == SuspendMessage::StaticMessageID()) {
    ++mSuspends;
    Tarn::StationUtils::StopBroadcasting(Tarn::kStation_StatusBar);
  } else if (inMessage.GetMessageID() == ResumeMessage::StaticMessageID()) {
    ++mResumes;
    Tarn::StationUtils::StartBroadcasting(Tarn::kStation_StatusBar);
  }
}

namespace {

// Polls inDone (yielding) until it is true or inLimit has passed; its result.
template <class Predicate>
bool PollFor(std::chrono::steady_clock::duration inLimit, Predicate inDone) {
  const auto deadline = std::chrono::steady_clock::now() + inLimit;
  while (!inDone()) {
    if (std::chrono::steady_clock::now() >= deadline) return inDone();
    std::this_thread::yield();
  }
  return true;
}

}  // namespace

DetachingListener::~DetachingListener() {
  mProbe->mDestroyedMidDelivery.store(mProbe->mInside.load() != 0);
  mProbe->mRemovalStarted.store(true);
  Tarn::StationUtils::RemoveListener(Tarn::kStation_StatusBar, this);
  // Once the removal has returned, no delivery to this listener runs and
  // none starts; anything else is a fault the summary reports.
  if (mProbe->mInside.load() != 0) mProbe->mViolations.fetch_add(1);
  mProbe->mDestroyed.store(true);
}

bool DetachingListener::WaitUntilHeld(std::chrono::milliseconds inLimit) const {
  return PollFor(inLimit, [this] { return mProbe->mHeld.load(); });
}

void DetachingListener::HoldForRemoval() {
  if (!PollFor(std::chrono::seconds(1), [this] { return mProbe->mRemovalStarted.load(); })) return;
  // The removal has begun; a correct one now waits for this delivery.
  PollFor(std::chrono::milliseconds(5), [this] { return mProbe->mDestroyed.load(); });
}

void DetachingListener::ListenToMessage(const Tarn::Message& inMessage) {
  if (inMessage.GetMessageID() != ProgressMessage::StaticMessageID()) return;
  mProbe->mInside.fetch_add(1);
  if (mProbe->mDestroyed.load()) mProbe->mViolations.fetch_add(1);
  if (mProbe->mRemovalWanted.load() && !mProbe->mHeld.exchange(true)) HoldForRemoval();
  // A little work, as a real handler would do.
  std::uint64_t value = mChecksum + static_cast<const ProgressMessage&>(inMessage).mSequence;
  for (int round = 0; round < 100; ++round) value = value * 6364136223846793005ull + 1442695040888963407ull;
  mChecksum = value;
  mProbe->mHeard.fetch_add(1);
  if (mProbe->mDestroyed.load()) mProbe->mViolations.fetch_add(1);
  mProbe->mInside.fetch_sub(1);
}

}  // namespace tarn_demo
