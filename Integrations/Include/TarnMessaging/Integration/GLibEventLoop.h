/// @file
/// Tarn::Integration::GLibEventLoop: delivers messages posted to the main
/// thread from a GLib main context that the main thread iterates.
///
/// @code{.cpp}
///   Tarn::Messaging::Initialize();                       // this thread is the main thread
///   GMainLoop* loop = g_main_loop_new(nullptr, FALSE);   // the global default context
///   Tarn::Integration::GLibEventLoop messaging(nullptr);
///   // any thread: Tarn::StationUtils::PostMessageToUIThread(station, Progress(1, 2), false);
///   g_main_loop_run(loop);                               // posted messages are delivered in here
/// @endcode
///
/// While the object lives, the first call queued for the main thread after a
/// run attaches one idle source to the context, and its dispatch runs every
/// call pending by then: a burst of posted messages costs one source, not one
/// per message (PendingCallRunner.h explains it). ScheduledRuns()
/// counts the sources attached.
///
/// Idle source: a timeout source of priority G_PRIORITY_DEFAULT_IDLE comes due
/// every idle interval (PendingCallRunner::kDefaultIdleInterval unless
/// SetIdleInterval says otherwise); GLib dispatches it only in an iteration
/// where no source of higher priority is ready, and it broadcasts
/// Tarn::ApplicationIdleMessage on Tarn::kStation_Idle when no posted message
/// is waiting either (PendingCallRunner.h). SetIdleInterval(
/// PendingCallRunner::kIdleOff) switches it off.
///
/// The source is attached explicitly rather than through
/// g_main_context_invoke: invoke runs the function at once, on the calling
/// thread, whenever that thread can acquire the context, which a worker can
/// for the global default context while the main thread is not iterating it,
/// and a run of the pending calls off the main thread would deliver nothing.
/// From the main thread itself, invoke would run the calls inside
/// PostMessageToUIThread, which a post with inForceAsync must not do.
///
/// Threading: construct and destroy the object on the main thread, after
/// Tarn::Messaging::Initialize and before the last Tarn::Messaging::Terminate.
/// Iterate the context on the main thread only. Messages may be posted from
/// any thread; the wakeup runs on the posting thread, once per burst, and never
/// blocks on the main thread. An exception thrown
/// by a pending call must not unwind through GLib's C frames: it goes to
/// kivcore's error manager, the calls behind it stay queued and a new source is
/// attached for them.
///
/// Ownership: the object holds a reference on the context (g_main_context_ref)
/// from construction to destruction, and each source it attached holds one on
/// the object's internals, so a pending call may destroy the GLibEventLoop
/// while its source is dispatching.
///
/// Replacement and destruction: the newest live integration (of any kind)
/// gets the main thread's wakeups. Building a new one before the old one is
/// destroyed moves every later wakeup to the new one, which is woken at once
/// for calls already queued; the old one's destructor leaves the new one's
/// handler in place, and the new one's destructor, if it goes first, hands
/// the wakeups back to the old one. The
/// destructor destroys the sources it attached that have not run yet, then
/// runs on the calling (main) thread every call still queued, and the
/// follow-ups those calls post, until the queue is empty; a handler that keeps
/// re-posting is cut off after PendingCallRunner::kDrainPasses runs, and what
/// it posted last waits for the next integration,
/// FlushPostedMessagesOnUIThread or the last Tarn::Messaging::Terminate.
/// Nothing posted before the destructor returns is lost, and nothing is
/// delivered twice.
#pragma once

#include <TarnMessaging/Integration/PendingCallRunner.h>

#include <glib.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <memory>
#include <mutex>
#include <vector>

namespace Tarn::Integration {

/// Runs the main thread's pending calls, and with them the messages posted
/// with Tarn::StationUtils::PostMessageToUIThread, from a GLib main context
/// iterated by the main thread, one idle source per burst of posts.
///
/// Construct and destroy on the main thread after Tarn::Messaging::Initialize
/// and before the last Tarn::Messaging::Terminate; iterate the context on the
/// main thread only. Holds a reference on the context while it lives. A newer
/// integration takes the wakeups over from this one while it lives.
class GLibEventLoop {
public:
  /// Installs the wakeup handler for inContext (null: the global default
  /// context) and, when calls are already pending, attaches a source for
  /// them. inPriority is the priority of the sources attached
  /// (G_PRIORITY_DEFAULT, like g_main_context_invoke, by default).
  /// Precondition: a main thread is registered (Tarn::Messaging::Initialize
  /// has run); otherwise throws std::logic_error.
  explicit GLibEventLoop(GMainContext* inContext, int inPriority = G_PRIORITY_DEFAULT)
      : mRunner(std::make_shared<Runner>(inContext != nullptr ? inContext : g_main_context_default(), inPriority)) {
    mRunner->Install();
  }

  /// Removes the wakeup handler (unless a newer integration replaced it),
  /// runs on the calling (main) thread the calls still pending and their
  /// follow-ups until none is left (see "Replacement and destruction"), and
  /// drops the reference on the context. Exceptions of those calls go to
  /// kivcore's error manager.
  ~GLibEventLoop() { mRunner->Uninstall(); }

  GLibEventLoop(const GLibEventLoop&) = delete;
  GLibEventLoop& operator=(const GLibEventLoop&) = delete;

  /// Number of sources attached to the context so far. Any thread.
  std::uint64_t ScheduledRuns() const noexcept { return mRunner->ScheduledRuns(); }
  /// Number of idle broadcasts so far. Any thread.
  std::uint64_t IdleBroadcasts() const noexcept { return mRunner->IdleBroadcasts(); }
  /// Sets the idle interval; PendingCallRunner::kIdleOff switches the idle
  /// source off. Main thread. Precondition: inInterval >= kIdleOff; otherwise
  /// throws std::invalid_argument.
  void SetIdleInterval(std::chrono::milliseconds inInterval) { mRunner->SetIdleInterval(inInterval); }

private:
  class Runner : public PendingCallRunner {
  public:
    Runner(GMainContext* inContext, int inPriority) : mContext(g_main_context_ref(inContext)), mPriority(inPriority) {}
    ~Runner() override {
      // Sources hold the runner, so none is left here; only a runner never
      // uninstalled still holds the context.
      if (mContext != nullptr) g_main_context_unref(mContext);
    }

  private:
    // What a source's callback data holds: a reference on the runner, freed
    // with the source. The runner is also published through an atomic, so
    // that ThreadSanitizer, which does not see GLib's own locks, orders the
    // dispatching thread after the posting thread that made the reference.
    struct SourceReference {
      std::shared_ptr<Runner> mKeep;
      std::atomic<Runner*> mRunner{nullptr};
    };

    // On the thread iterating the context. The dispatch takes a reference of
    // its own: a pending call may destroy the GLibEventLoop, whose Uninstall
    // destroys the sources, while this frame still needs the runner.
    static gboolean Dispatch(gpointer inReference) {
      auto* reference = static_cast<SourceReference*>(inReference);
      Runner* const raw = reference->mRunner.load(std::memory_order_acquire);
      std::shared_ptr<Runner> runner;
      {
        std::lock_guard<std::mutex> lock(raw->mSourcesMutex);
        runner = reference->mKeep;
        runner->ForgetSource(g_main_current_source());
      }
      runner->RunPending(kToErrorManager);
      return G_SOURCE_REMOVE;
    }

    static void FreeReference(gpointer inReference) { delete static_cast<SourceReference*>(inReference); }

    void PostRun() override {
      std::lock_guard<std::mutex> lock(mSourcesMutex);
      // A source not yet dispatched runs this batch too: it takes the whole
      // queue. Without this, a context nobody iterates while the main thread
      // flushes would gather one source per batch.
      if (!mSources.empty()) return;
      // The steps that can throw come before the source exists.
      mSources.reserve(mSources.size() + 1);
      auto reference = std::make_unique<SourceReference>();
      reference->mKeep = std::static_pointer_cast<Runner>(shared_from_this());
      reference->mRunner.store(this, std::memory_order_release);
      GSource* source = g_idle_source_new();
      g_source_set_priority(source, mPriority);
      g_source_set_name(source, "Tarn::Integration::GLibEventLoop");
      g_source_set_callback(source, &Dispatch, reference.release(), &FreeReference);
      mSources.push_back(source);  // our reference, dropped by ForgetSource or DestroySources
      g_source_attach(source, mContext);
    }

    // The idle source is made, dispatched and destroyed on the main thread.
    // Its callback data holds the runner until GLib frees it, which is after
    // the dispatch even when a broadcast destroys the source.
    static gboolean DispatchIdle(gpointer inRunner) {
      std::shared_ptr<Runner> runner = *static_cast<std::shared_ptr<Runner>*>(inRunner);
      runner->CheckIdle(kToErrorManager);
      return G_SOURCE_REMOVE;
    }
    static void FreeRunner(gpointer inRunner) { delete static_cast<std::shared_ptr<Runner>*>(inRunner); }

    void ArmIdleCheck(std::chrono::milliseconds inDelay) override {
      if (mContext == nullptr) return;
      auto keep = std::make_unique<std::shared_ptr<Runner>>(std::static_pointer_cast<Runner>(shared_from_this()));
      DisarmIdleCheck();
      const auto milliseconds = std::min<std::chrono::milliseconds::rep>(inDelay.count(), G_MAXUINT);
      mIdleSource = g_timeout_source_new(static_cast<guint>(milliseconds));
      g_source_set_priority(mIdleSource, G_PRIORITY_DEFAULT_IDLE);
      g_source_set_name(mIdleSource, "Tarn::Integration::GLibEventLoop idle");
      g_source_set_callback(mIdleSource, &DispatchIdle, keep.release(), &FreeRunner);
      g_source_attach(mIdleSource, mContext);
    }
    void DisarmIdleCheck() noexcept override {
      if (mIdleSource == nullptr) return;
      g_source_destroy(mIdleSource);
      g_source_unref(mIdleSource);
      mIdleSource = nullptr;
    }

    void ForgetLoop() noexcept override {
      DestroySources();
      g_main_context_unref(mContext);
      mContext = nullptr;
    }

    // mSourcesMutex held.
    void ForgetSource(GSource* inSource) noexcept {
      for (auto it = mSources.begin(); it != mSources.end(); ++it) {
        if (*it != inSource) continue;
        g_source_unref(inSource);  // GLib holds its own reference while it dispatches
        mSources.erase(it);
        return;
      }
    }

    // Destroying a source frees its reference on the runner, which is not
    // the last one: Uninstall's caller holds the runner.
    void DestroySources() noexcept {
      std::vector<GSource*> sources;
      {
        std::lock_guard<std::mutex> lock(mSourcesMutex);
        sources.swap(mSources);
      }
      for (GSource* source : sources) {
        g_source_destroy(source);
        g_source_unref(source);
      }
    }

    GMainContext* mContext;  // a counted reference; guarded by the runner's mutex; null after ForgetLoop
    const int mPriority;
    std::mutex mSourcesMutex;
    std::vector<GSource*> mSources;  // attached, not yet dispatched, one reference each; guarded by mSourcesMutex
    GSource* mIdleSource = nullptr;  // armed, or dispatched and not yet replaced; one reference; main thread
  };

  std::shared_ptr<Runner> mRunner;
};

}  // namespace Tarn::Integration
