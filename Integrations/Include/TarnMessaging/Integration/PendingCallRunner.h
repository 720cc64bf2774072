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
/// Coalescing: an atomic "scheduled" flag stands between the queue and the
/// loop. The wakeup that finds it clear sets it and posts one run; every later
/// wakeup finds it set and posts nothing. The run clears the flag before it
/// takes the queued calls, so a call queued while they run (by a worker, or by
/// a handler posting with inForceAsync) schedules the next run instead of
/// waiting for an unrelated wakeup. The one redundant run this allows (a call
/// queued before the run takes the queue but whose wakeup comes after the flag
/// is cleared) finds the queue empty and returns at once.
///
/// Threading: Install and Uninstall on the main thread. Wakeup runs on
/// whichever thread queues a call; it takes mMutex only when it posts a run.
/// RunPending on the thread that runs the host loop, which must be the main
/// thread. PostRun and ForgetLoop are called with mMutex held.
#pragma once

#include <kivcore/Error.h>
#include <kivcore/MainThread.h>

#include <boost/shared_ptr.hpp>

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <stdexcept>

/// @namespace Tarn::Integration
/// Header-only adaptors that run the main thread's pending calls from a host
/// event loop (Boost.Asio, GLib).
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

  PendingCallRunner() = default;
  PendingCallRunner(const PendingCallRunner&) = delete;
  PendingCallRunner& operator=(const PendingCallRunner&) = delete;
  virtual ~PendingCallRunner() = default;

  /// Installs the wakeup handler on the main thread's adaptor and, when calls
  /// are already queued, schedules a run for them.
  /// Precondition: a main thread is registered (Tarn::Messaging::Initialize
  /// has run); otherwise throws std::logic_error and installs nothing. The
  /// adaptor holds one wakeup handler for the whole process: this replaces
  /// any handler installed before.
  void Install() {
    const boost::shared_ptr<kivcore::threads::AsyncEventLoopAdaptor> adaptor =
        kivcore::threads::GetRegisteredMainThread();
    if (!adaptor) throw std::logic_error("Tarn::Integration: no main thread; call Tarn::Messaging::Initialize first");
    mInstalled.store(true, std::memory_order_release);
    std::shared_ptr<PendingCallRunner> self = shared_from_this();
    adaptor->SetWakeupHandler([self] { self->Wakeup(); });
    // Calls queued before the handler was in place had no one to wake.
    if (adaptor->PendingCallCount() != 0) Wakeup();
  }

  /// Removes the wakeup handler, lets the host loop go, and runs on the
  /// calling thread every call still queued, so that nothing posted before
  /// this returns is lost. Exceptions of those calls go to the error manager.
  /// A run still queued in the host loop does nothing afterwards. Calls are
  /// run only on the main thread; after the last Tarn::Messaging::Terminate
  /// there is no adaptor left, and the handler, unreachable, stays inert.
  void Uninstall() noexcept {
    const boost::shared_ptr<kivcore::threads::AsyncEventLoopAdaptor> adaptor =
        kivcore::threads::GetRegisteredMainThread();
    if (adaptor) adaptor->SetWakeupHandler(nullptr);
    {
      // A wakeup already past the flag on another thread may be about to
      // post; once this lock is released none will touch the loop again.
      std::lock_guard<std::mutex> lock(mMutex);
      mInstalled.store(false, std::memory_order_release);
      ForgetLoop();
    }
    if (!adaptor || !kivcore::threads::CurrentThreadIsMainThread()) return;
    // A call that throws leaves the calls behind it queued; each further pass
    // picks up after it.
    auto runOnce = [&adaptor] {
      adaptor->RunPendingCalls();
      return 1;
    };
    while (adaptor->PendingCallCount() != 0 && kivcore::config::ErrorManager::Get(false)->GuardedCall(runOnce) == 0) {
    }
  }

  /// The wakeup handler: posts one run unless one is already scheduled.
  /// Called on the queuing thread. If posting throws (std::bad_alloc), the
  /// flag is cleared again so that the next wakeup retries, and the
  /// exception propagates to the queuing thread.
  void Wakeup() {
    // A load first: during a burst the flag is already set, and reading it
    // keeps the cache line shared instead of taking it over on every post.
    if (mScheduled.load(std::memory_order_acquire)) return;
    if (mScheduled.exchange(true, std::memory_order_acq_rel)) return;
    std::lock_guard<std::mutex> lock(mMutex);
    if (!mInstalled.load(std::memory_order_acquire)) return;
    try {
      PostRun();
    } catch (...) {
      mScheduled.store(false, std::memory_order_release);
      throw;
    }
    mScheduledRuns.fetch_add(1, std::memory_order_relaxed);
  }

  /// Runs every pending call of the main thread; what a posted run calls, on
  /// the thread running the host loop. Does nothing after Uninstall or while
  /// no main thread is registered.
  void RunPending(ExceptionPolicy inPolicy) {
    if (!mInstalled.load(std::memory_order_acquire)) return;
    // Cleared before the queue is taken: see "Coalescing" above.
    mScheduled.store(false, std::memory_order_release);
    const boost::shared_ptr<kivcore::threads::AsyncEventLoopAdaptor> adaptor =
        kivcore::threads::GetRegisteredMainThread();
    if (!adaptor) return;
    if (inPolicy == kPropagate) {
      try {
        adaptor->RunPendingCalls();
      } catch (...) {
        // The calls behind the one that threw are back in the queue, and no
        // wakeup will come for them.
        if (adaptor->PendingCallCount() != 0) Wakeup();
        throw;
      }
      return;
    }
    const int completed = kivcore::config::ErrorManager::Get(false)->GuardedCall([&adaptor] {
      adaptor->RunPendingCalls();
      return 1;
    });
    if (completed == 0 && adaptor->PendingCallCount() != 0) Wakeup();
  }

  /// Number of runs posted to the host loop so far: one per burst of queued
  /// calls, not one per call. Any thread.
  std::uint64_t ScheduledRuns() const noexcept { return mScheduledRuns.load(std::memory_order_relaxed); }

protected:
  /// Posts one call of RunPending to the host loop, to run on its thread.
  /// Called with mMutex held, only while installed; may throw std::bad_alloc.
  virtual void PostRun() = 0;
  /// Lets go of the host loop; PostRun is not called afterwards. Called once,
  /// with mMutex held, by Uninstall.
  virtual void ForgetLoop() noexcept = 0;

private:
  std::mutex mMutex;                             // serialises PostRun with Uninstall
  std::atomic<bool> mInstalled{false};           // written under mMutex; read by runs without it
  std::atomic<bool> mScheduled{false};           // set by the wakeup that posts a run; cleared by that run
  std::atomic<std::uint64_t> mScheduledRuns{0};  // statistics only
};

}  // namespace Tarn::Integration
