/// @file
/// Tarn::Integration::PendingCallRunner: the part that every event-loop
/// integration shares. It asks a host event loop for one run of the main
/// thread's pending calls per burst of queued calls, runs them when the loop
/// gets to it, and runs what is left when the integration goes away.
///
/// @code{.cpp}
///   class MyLoopRunner : public Tarn::Integration::PendingCallRunner {
///     void PostRun() override { myLoop.Post([self = shared_from_this()] { self->RunPending(kPropagate); }); }
///     void ForgetLoop() noexcept override {}
///   };
///   auto runner = std::make_shared<MyLoopRunner>();
///   runner->Install();   // ... runner->Uninstall() before the loop goes away
/// @endcode
///
/// AsioEventLoop.h and GLibEventLoop.h are the integrations built on it; a
/// host with another loop derives its own runner the same way.
///
/// Coalescing: the main thread's queue calls the wakeup handler once per
/// batch (kivcore/MainThread.h): the first call queued after a run took the
/// queue wakes us, and we post one run. A run that finds the queue already
/// taken (by FlushPostedMessagesOnUIThread, say) returns at once.
///
/// Replacement and destruction: the wakeup handler is tagged with the
/// runner, and the newest installed runner gets the wakeups. Uninstall removes
/// only its own: destroying the newest hands the wakeups back to the newest
/// one left (woken at once for calls already queued), destroying an older
/// one changes nothing for the newest. Installing a handler
/// while calls are queued wakes the new loop for them. Uninstall runs the
/// calls still queued on the main thread until the queue is empty, follow-ups
/// posted by those calls included, for at most kDrainPasses runs; calls a
/// handler keeps re-posting past that stay queued for the next integration,
/// FlushPostedMessagesOnUIThread or the last Tarn::Messaging::Terminate.
///
/// Idle source: a runner whose loop can wait (ArmIdleCheck) broadcasts
/// Tarn::ApplicationIdleMessage on Tarn::kStation_Idle when the loop gets to
/// its idle check and the main thread's queue is empty, at most once per idle
/// interval (kDefaultIdleInterval unless SetIdleInterval says otherwise), so
/// that an armed Tarn::IdleCountdownTimer fires without the host broadcasting
/// anything. The check is armed again before each broadcast, so the interval
/// counts from the start of one broadcast to the next; a check that finds
/// calls queued skips its turn, as the loop has not run out of work. An idle
/// broadcast is never nested in another. SetIdleInterval(kIdleOff) switches
/// the source off.
///
/// Threading: Install, Uninstall, SetIdleInterval, CheckIdle, ArmIdleCheck
/// and DisarmIdleCheck on the main thread. Wakeup runs on whichever thread
/// queues a call, once per batch, and takes mMutex. RunPending on the thread
/// that runs the host loop, which must be the main thread. PostRun and
/// ForgetLoop are called with mMutex held.
#pragma once

#include <TarnMessaging/IdleCountdownTimer.h>
#include <TarnMessaging/StationIDs.h>
#include <TarnMessaging/StationUtils.h>

#include <kivcore/Debug.h>
#include <kivcore/Error.h>
#include <kivcore/MainThread.h>

#include <boost/shared_ptr.hpp>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <memory>
#include <mutex>
#include <stdexcept>

/// @namespace Tarn::Integration
/// Header-only adaptors that run the main thread's pending calls from a host
/// event loop (Boost.Asio, GLib, Qt), and broadcast idle messages when it has
/// nothing else to do.
namespace Tarn::Integration {

/// Base of the event-loop integrations: coalesces wakeups of the main
/// thread's call queue into one run per burst, posted to a host event loop.
///
/// Derived classes say how a run is posted (PostRun) and how the loop is
/// let go (ForgetLoop). Create one with std::make_shared: the wakeup handler
/// and every posted run hold a reference, so the object outlives any run
/// still queued in the host loop after Uninstall.
class PendingCallRunner : public std::enable_shared_from_this<PendingCallRunner> {
public:
  /// What RunPending does with an exception thrown by a pending call.
  enum ExceptionPolicy {
    kPropagate,       ///< Rethrow it to the host loop (after scheduling a run for the calls behind it).
    kToErrorManager,  ///< Hand it to kivcore's error manager and return normally.
  };

  /// Most runs of the final drain in Uninstall.
  static constexpr int kDrainPasses = 64;
  /// The idle interval of a new runner.
  static constexpr std::chrono::milliseconds kDefaultIdleInterval{50};
  /// The idle interval that switches the idle source off.
  static constexpr std::chrono::milliseconds kIdleOff{0};

  PendingCallRunner() = default;
  PendingCallRunner(const PendingCallRunner&) = delete;
  PendingCallRunner& operator=(const PendingCallRunner&) = delete;
  virtual ~PendingCallRunner() = default;

  /// Installs the wakeup handler on the main thread's adaptor and, when calls
  /// are already queued, schedules a run for them.
  /// Precondition: a main thread is registered (Tarn::Messaging::Initialize
  /// has run); otherwise throws std::logic_error and installs nothing. This
  /// runner takes the wakeups over from any installed before, until it is
  /// uninstalled.
  void Install() {
    const boost::shared_ptr<kivcore::threads::AsyncEventLoopAdaptor> adaptor =
        kivcore::threads::GetRegisteredMainThread();
    if (!adaptor) throw std::logic_error("Tarn::Integration: no main thread; call Tarn::Messaging::Initialize first");
    std::shared_ptr<PendingCallRunner> self = shared_from_this();
    mInstalled.store(true, std::memory_order_release);
    try {
      if (mIdleInterval > kIdleOff) ArmIdleCheck(mIdleInterval);
      // Calls already queued wake us from inside this call.
      adaptor->SetWakeupHandler([self] { self->Wakeup(); }, this);
    } catch (...) {
      // Nothing of ours stays armed or installed: the integration's
      // constructor fails, and no destructor will run for it.
      mInstalled.store(false, std::memory_order_release);
      DisarmIdleCheck();
      throw;
    }
  }

  /// Removes this runner's wakeup handler (not one installed since by another
  /// integration), lets the host loop go, and runs on the calling thread the
  /// calls still queued until none is left or kDrainPasses runs have passed,
  /// so that nothing posted before this returns is lost. Exceptions of those
  /// calls go to the error manager. A run still queued in the host loop does
  /// nothing afterwards. Calls are run only on the main thread; after the last
  /// Tarn::Messaging::Terminate there is no adaptor left, and the handler,
  /// unreachable, stays inert. Called off the main thread while one is
  /// registered (outside the contract), it shows the contract dialog.
  void Uninstall() noexcept {
    const boost::shared_ptr<kivcore::threads::AsyncEventLoopAdaptor> adaptor =
        kivcore::threads::GetRegisteredMainThread();
    // Elsewhere the idle check is disarmed while the main thread's handlers
    // may use it, and the final drain is skipped: the host is told, and the
    // rest goes on as well as it can.
    if (adaptor && !kivcore::threads::CurrentThreadIsMainThread()) ReportOffMainThread();
    if (adaptor) adaptor->RemoveWakeupHandler(this);
    DisarmIdleCheck();
    {
      // A wakeup already under way on another thread may be about to post;
      // once this lock is released none will touch the loop again.
      std::lock_guard<std::mutex> lock(mMutex);
      mInstalled.store(false, std::memory_order_release);
      ForgetLoop();
    }
    if (!adaptor || !kivcore::threads::CurrentThreadIsMainThread()) return;
    auto runOnce = [&adaptor] {
      adaptor->RunPendingCalls();
      return 1;
    };
    // The first pass also finishes a run this destructor is nested in. Each
    // later pass runs what the last one left: follow-ups it posted, or the
    // calls behind one that threw. The bound keeps a handler that re-posts
    // for ever from hanging the destructor.
    for (int pass = 0; pass < kDrainPasses && (pass == 0 || adaptor->PendingCallCount() != 0); ++pass)
      kivcore::config::ErrorManager::Get(false)->GuardedCall(runOnce);
  }

  /// The wakeup handler: posts one run to the host loop. Called on the
  /// queuing thread, once per batch. Does nothing after Uninstall. If posting
  /// throws (std::bad_alloc), the queue reports it to the error manager and
  /// calls this again on the next post.
  void Wakeup() {
    std::lock_guard<std::mutex> lock(mMutex);
    if (!mInstalled.load(std::memory_order_acquire)) return;
    PostRun();
    mScheduledRuns.fetch_add(1, std::memory_order_relaxed);
  }

  /// Runs every pending call of the main thread; what a posted run calls, on
  /// the thread running the host loop. Does nothing after Uninstall or while
  /// no main thread is registered. After an exception the queue has already
  /// woken us again for the calls behind the one that threw.
  void RunPending(ExceptionPolicy inPolicy) {
    if (!mInstalled.load(std::memory_order_acquire)) return;
    const boost::shared_ptr<kivcore::threads::AsyncEventLoopAdaptor> adaptor =
        kivcore::threads::GetRegisteredMainThread();
    if (!adaptor) return;
    if (inPolicy == kPropagate) {
      adaptor->RunPendingCalls();
      return;
    }
    kivcore::config::ErrorManager::Get(false)->GuardedCall([&adaptor] {
      adaptor->RunPendingCalls();
      return 1;
    });
  }

  /// Sets the idle interval and re-arms the idle check with it; kIdleOff
  /// switches the idle source off. Main thread; takes effect at once.
  /// Precondition: inInterval >= kIdleOff; otherwise throws
  /// std::invalid_argument and changes nothing.
  void SetIdleInterval(std::chrono::milliseconds inInterval) {
    if (inInterval < kIdleOff) throw std::invalid_argument("Tarn::Integration: the idle interval must not be negative");
    mIdleInterval = inInterval;
    if (!mInstalled.load(std::memory_order_acquire)) return;
    if (inInterval == kIdleOff) DisarmIdleCheck();
    else ArmIdleCheck(inInterval);
  }
  /// The idle interval; kIdleOff while the idle source is off. Main thread.
  std::chrono::milliseconds IdleInterval() const noexcept { return mIdleInterval; }

  /// What an armed idle check calls when it comes due, on the thread running
  /// the host loop (the main thread): arms the next check, then broadcasts
  /// the idle message unless calls are queued or an idle broadcast is under
  /// way (an idle listener running a nested loop). Does nothing after Uninstall.
  void CheckIdle(ExceptionPolicy inPolicy) {
    if (!mInstalled.load(std::memory_order_acquire) || mIdleInterval == kIdleOff) return;
    // Re-arming can fail too (std::bad_alloc), and must not unwind through a
    // C loop either; the source then stays off until SetIdleInterval.
    if (inPolicy == kPropagate) ArmAndBroadcast();
    else kivcore::config::ErrorManager::Get(false)->GuardedCall([this] { return ArmAndBroadcast(); });
  }

  /// Number of runs posted to the host loop so far: one per batch of queued
  /// calls, not one per call. Any thread.
  std::uint64_t ScheduledRuns() const noexcept { return mScheduledRuns.load(std::memory_order_relaxed); }
  /// Number of idle broadcasts made so far. Any thread.
  std::uint64_t IdleBroadcasts() const noexcept { return mIdleBroadcasts.load(std::memory_order_relaxed); }

protected:
  /// Posts one call of RunPending to the host loop, to run on its thread.
  /// Called with mMutex held, only while installed; may throw std::bad_alloc.
  virtual void PostRun() = 0;
  /// Lets go of the host loop; PostRun is not called afterwards. Called once,
  /// with mMutex held, by Uninstall.
  virtual void ForgetLoop() noexcept = 0;
  /// Has the host loop call CheckIdle once, inDelay from now, when it has no
  /// other work ready; replaces a check already armed. Main thread, also from
  /// inside CheckIdle; may throw std::bad_alloc. The default arms nothing: a
  /// runner that does not override it has no idle source.
  virtual void ArmIdleCheck(std::chrono::milliseconds inDelay) { static_cast<void>(inDelay); }
  /// Disarms the idle check; CheckIdle is not called afterwards until the next
  /// ArmIdleCheck. Main thread, also from inside CheckIdle.
  virtual void DisarmIdleCheck() noexcept {}

private:
  // The contract check's report: the dialog, then the error. A destructor
  // has no caller to throw to, so what the error handler throws is printed.
  static void ReportOffMainThread() noexcept {
    try {
      kivcore::debug::BreakAfterContractDialog("kivcore::threads::CurrentThreadIsMainThread()", __FILE__,
                                               "Tarn::Integration::PendingCallRunner::Uninstall", __LINE__);
      const kivcore::config::ReplacementValue none;
      kivcore::config::ThrowError(0, "$$$/kivcore/utility/Error/Contract/InputContractViolation=An input contract "
                                  "violation has occurred!", 105u, 25, true, none, none, none, none);
    } catch (const std::exception& inError) {
      std::fprintf(stderr, "Tarn::Integration: %s\n", inError.what());
    } catch (...) {
    }
  }

  // Armed first, so that an exception leaving the broadcast, or a listener
  // that destroys the integration, leaves the source in a known state.
  int ArmAndBroadcast() {
    ArmIdleCheck(mIdleInterval);
    const boost::shared_ptr<kivcore::threads::AsyncEventLoopAdaptor> adaptor =
        kivcore::threads::GetRegisteredMainThread();
    if (!adaptor || !kivcore::threads::CurrentThreadIsMainThread() || mIdleBroadcasting) return 0;
    if (adaptor->PendingCallCount() != 0) return 0;
    mIdleBroadcasting = true;
    struct Leave {
      bool& mFlag;
      ~Leave() { mFlag = false; }
    } leave{mIdleBroadcasting};
    mIdleBroadcasts.fetch_add(1, std::memory_order_relaxed);
    Tarn::StationUtils::BroadcastMessage(Tarn::kStation_Idle, Tarn::ApplicationIdleMessage());
    return 1;
  }

  std::mutex mMutex;                             // serialises PostRun with Uninstall
  std::atomic<bool> mInstalled{false};           // written under mMutex; read by runs without it
  std::atomic<std::uint64_t> mScheduledRuns{0};  // statistics only
  std::atomic<std::uint64_t> mIdleBroadcasts{0}; // statistics only
  std::chrono::milliseconds mIdleInterval = kDefaultIdleInterval;  // main thread
  bool mIdleBroadcasting = false;                // main thread
};

}  // namespace Tarn::Integration
