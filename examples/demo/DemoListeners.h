// The listeners of tarn-demo beside the status bar:
//
//   ProgressTally       a typed subscription to kStation_StatusBar's progress
//   AutosaveScheduler   held by std::weak_ptr on kStation_StatusBar and on
//                       its timer's station
//   LifecycleListener   a counted safe listener on kStation_AppSuspend and
//                       kStation_AppResume
//   DetachingListener   a plain pointer on kStation_StatusBar, destroyed by a
//                       worker while the main thread may be delivering to it
//
// Threading: handlers run on the main thread. Only DetachingListener is
// destroyed elsewhere; its probe is atomic for that reason.
#pragma once

#include "DemoMessages.h"

#include <TarnMessaging.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>

namespace tarn_demo {

// Counts the progress messages it hears; its count must match the status
// bar's. Not a listener: Tarn::Subscribe calls OnProgress for progress only.
class ProgressTally {
public:
  void OnProgress(const ProgressMessage&) { ++mHeard; }
  std::uint64_t Heard() const { return mHeard; }

private:
  std::uint64_t mHeard = 0;  // main thread
};

// Autosaves a set time after the last burst of work: every progress message
// re-arms an idle countdown timer, which fires at the first idle moment once
// that much time has passed without progress.
class AutosaveScheduler : public Tarn::Listener {
public:
  explicit AutosaveScheduler(std::uint32_t inIdleMilliSeconds);

  // inSelf is a weak pointer to this object, owned by a std::shared_ptr.
  void Attach(const std::weak_ptr<Tarn::Listener>& inSelf);
  void Detach(const std::weak_ptr<Tarn::Listener>& inSelf);

  // Runs at each autosave, on the main thread, inside the timer's broadcast.
  void SetOnAutosave(std::function<void()> inAction) { mOnAutosave = std::move(inAction); }
  // Starts the countdown again from now.
  void Rearm() { mTimer.ArmTimer(); }

  void ListenToMessage(const Tarn::Message& inMessage) override;

  std::uint64_t Autosaves() const { return mAutosaves; }
  std::uint64_t ProgressHeard() const { return mProgressHeard; }

private:
  Tarn::IdleCountdownTimer mTimer;
  std::function<void()> mOnAutosave;
  std::uint64_t mAutosaves = 0;      // main thread
  std::uint64_t mProgressHeard = 0;  // main thread
};

// The application's reaction to being suspended and resumed: the status bar
// stops broadcasting while the application is suspended.
class LifecycleListener : public Tarn::SafeListenerBase {
public:
  void ListenToMessage(const Tarn::Message& inMessage) override;
  std::uint64_t Suspends() const { return mSuspends; }
  std::uint64_t Resumes() const { return mResumes; }

private:
  ~LifecycleListener() override = default;  // deleted by the last Release

  std::uint64_t mSuspends = 0;  // main thread
  std::uint64_t mResumes = 0;   // main thread
};

// What a DetachingListener leaves behind for the summary, and the handshake
// between the worker that destroys it and the main thread that delivers to
// it; it outlives the listener.
struct DetachProbe {
  std::atomic<int> mInside{0};                     // deliveries to the listener running now
  std::atomic<bool> mRemovalWanted{false};         // the worker is about to destroy it
  std::atomic<bool> mHeld{false};                  // a delivery is holding on for the removal
  std::atomic<bool> mRemovalStarted{false};        // the destructor has begun
  std::atomic<bool> mDestroyed{false};             // the removal has returned
  std::atomic<bool> mDestroyedMidDelivery{false};  // a delivery was running when the removal began
  std::atomic<std::uint64_t> mHeard{0};            // progress messages it heard
  std::atomic<std::uint64_t> mViolations{0};       // deliveries that ran on after its removal returned
};

// A listener that a worker destroys while the main thread is delivering to
// it. It detaches itself in its own destructor: there, on a worker, the
// removal waits until the delivery in progress has returned, and the object
// is still whole. (~Listener would detach only after this class's part is
// gone.)
//
// The worker makes the overlap happen rather than hope for it:
//
//   doomed->AskForRemoval();             // the next delivery holds on
//   ... post a message ...
//   doomed->WaitUntilHeld(limit);        // that delivery is running now
//   doomed.reset();                      // must wait for it to return
//
// The held delivery stays until the removal has begun and a few milliseconds
// more; if the removal returns meanwhile, it did not wait, and the summary
// reports a violation.
class DetachingListener : public Tarn::Listener {
public:
  explicit DetachingListener(std::shared_ptr<DetachProbe> inProbe) : mProbe(std::move(inProbe)) {}
  ~DetachingListener() override;
  DetachingListener(const DetachingListener&) = delete;
  DetachingListener& operator=(const DetachingListener&) = delete;

  void ListenToMessage(const Tarn::Message& inMessage) override;

  // Worker: the next delivery holds on for the removal.
  void AskForRemoval() { mProbe->mRemovalWanted.store(true); }
  // Worker: true once a delivery holds on; false after inLimit (no delivery
  // came, the station being stopped, say). Polls: the wait is short.
  bool WaitUntilHeld(std::chrono::milliseconds inLimit) const;

private:
  // Main thread, once: keeps the delivery running until the removal has
  // begun, then a little longer, or until the removal (wrongly) returns.
  void HoldForRemoval();

  const std::shared_ptr<DetachProbe> mProbe;
  std::uint64_t mChecksum = 0;  // main thread; keeps the handler's work from being optimised away
};

}  // namespace tarn_demo
