/// @file
/// Tarn::Integration::AsioEventLoop: delivers messages posted to the main
/// thread from a boost::asio::io_context that the main thread runs.
///
/// @code{.cpp}
///   Tarn::Messaging::Initialize();                       // this thread is the main thread
///   boost::asio::io_context context;
///   Tarn::Integration::AsioEventLoop messaging(context);
///   // any thread: Tarn::StationUtils::PostMessageToUIThread(station, Progress(1, 2), false);
///   context.run();                                       // posted messages are delivered in here
/// @endcode
///
/// While the object lives, the first call queued for the main thread after a
/// run posts one handler to the io_context, and that handler runs every call
/// pending by then: a burst of posted messages costs one io_context handler,
/// not one per message (PendingCallRunner.h explains it).
/// ScheduledRuns() counts the handlers posted.
///
/// Idle source: a steady_timer on the io_context expires every idle interval
/// (PendingCallRunner::kDefaultIdleInterval unless SetIdleInterval says
/// otherwise) and posts the idle check behind the handlers ready by then; the
/// check broadcasts Tarn::ApplicationIdleMessage on Tarn::kStation_Idle when
/// no posted message is waiting (PendingCallRunner.h). While the source is on
/// the io_context always has a timer to wait for, so run() returns only once
/// stopped; a host that relies on run() returning when the work is done
/// switches the source off with SetIdleInterval(PendingCallRunner::kIdleOff).
///
/// Threading: construct and destroy the object on the main thread, after
/// Tarn::Messaging::Initialize and before the last Tarn::Messaging::Terminate.
/// Run the io_context on the main thread only: the handler runs the pending
/// calls on whichever thread runs it, and a broadcast off the main thread
/// delivers nothing. Messages may be posted from any thread; the wakeup runs on
/// the posting thread, once per burst, and never blocks on the main thread.
/// An exception thrown by a pending call leaves
/// io_context::run() as any handler's exception does; the calls behind it stay
/// queued and a new handler is posted for them, so calling run() again
/// carries on.
///
/// Ownership: the object refers to the io_context and does not own it; the
/// io_context must outlive the object.
///
/// Replacement and destruction: the newest live integration (of any kind)
/// gets the main thread's wakeups. Building a new one before the old one is
/// destroyed (`loop = std::make_unique<AsioEventLoop>(other)`) moves every
/// later wakeup to the new one, which is woken at once for calls already
/// queued; the old one's destructor leaves the new one's handler in place,
/// and the new one's destructor, if it goes first, hands the wakeups back to
/// the old one. The destructor runs
/// on the calling (main) thread every call still queued, and the follow-ups
/// those calls post, until the queue is empty; a handler that keeps re-posting
/// is cut off after PendingCallRunner::kDrainPasses runs, and what it posted
/// last waits for the next integration, FlushPostedMessagesOnUIThread or the
/// last Tarn::Messaging::Terminate. A handler of ours still queued in the
/// io_context does nothing when it runs. Nothing posted before the destructor
/// returns is lost, and nothing is delivered twice.
#pragma once

#include <TarnMessaging/Integration/PendingCallRunner.h>

#include <boost/asio/io_context.hpp>
#include <boost/asio/post.hpp>
#include <boost/asio/steady_timer.hpp>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <memory>

namespace Tarn::Integration {

/// Runs the main thread's pending calls, and with them the messages posted
/// with Tarn::StationUtils::PostMessageToUIThread, from a
/// boost::asio::io_context run by the main thread, one posted handler per
/// burst of posts.
///
/// Construct and destroy on the main thread after Tarn::Messaging::Initialize
/// and before the last Tarn::Messaging::Terminate; run the io_context on the
/// main thread only. The io_context is not owned and must outlive this
/// object. A newer integration takes the wakeups over from this one while it
/// lives.
class AsioEventLoop {
public:
  /// Installs the wakeup handler and, when calls are already pending, posts
  /// a handler for them.
  /// Precondition: a main thread is registered (Tarn::Messaging::Initialize
  /// has run); otherwise throws std::logic_error.
  explicit AsioEventLoop(boost::asio::io_context& inContext) : mRunner(std::make_shared<Runner>(inContext)) {
    mRunner->Install();
  }

  /// Removes the wakeup handler (unless a newer integration replaced it) and
  /// runs, on the calling (main) thread, the calls still pending and their
  /// follow-ups until none is left (see "Replacement and destruction").
  /// Exceptions of those calls go to kivcore's error manager.
  ~AsioEventLoop() { mRunner->Uninstall(); }

  AsioEventLoop(const AsioEventLoop&) = delete;
  AsioEventLoop& operator=(const AsioEventLoop&) = delete;

  /// Number of handlers posted to the io_context so far. Any thread.
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
    explicit Runner(boost::asio::io_context& inContext)
        : mContext(&inContext), mIdleTimer(std::make_unique<boost::asio::steady_timer>(inContext)) {}

  private:
    void PostRun() override {
      std::shared_ptr<PendingCallRunner> self = shared_from_this();
      boost::asio::post(*mContext, [self] { self->RunPending(kPropagate); });
    }
    // The timer goes here, on the main thread: a wakeup still under way on a
    // worker may hold the last reference on the runner, and the io_context
    // may be gone by then.
    void ForgetLoop() noexcept override {
      mContext = nullptr;
      mIdleTimer.reset();
    }

    // The timer's handler posts the check rather than making it, so that the
    // handlers that became ready with it run first. Each armed wait carries
    // its generation: a wait that completed before a re-arm, a disarm or
    // ForgetLoop could cancel it finds a newer generation and does nothing.
    void ArmIdleCheck(std::chrono::milliseconds inDelay) override {
      if (!mIdleTimer) return;
      const std::uint64_t generation = ++mIdleGeneration;
      // Clamped to what the clock can hold, as GLib and Qt clamp to their
      // timers' range: a longer delay would overflow and fire at once.
      using std::chrono::steady_clock;
      const steady_clock::time_point now = steady_clock::now();
      const auto room = std::chrono::duration_cast<std::chrono::milliseconds>(steady_clock::time_point::max() - now);
      mIdleTimer->expires_at(now + std::min(inDelay, room));
      std::shared_ptr<Runner> self = std::static_pointer_cast<Runner>(shared_from_this());
      auto executor = mIdleTimer->get_executor();
      mIdleTimer->async_wait([self, generation, executor](const boost::system::error_code& inError) {
        if (inError || generation != self->mIdleGeneration) return;
        boost::asio::post(executor, [self, generation] {
          if (generation == self->mIdleGeneration) self->CheckIdle(kPropagate);
        });
      });
    }
    void DisarmIdleCheck() noexcept override {
      ++mIdleGeneration;
      boost::system::error_code ignored;
      if (mIdleTimer) mIdleTimer->cancel(ignored);
    }

    boost::asio::io_context* mContext;  // guarded by the runner's mutex; null after ForgetLoop
    // Main thread only, like the io_context's handlers; null after ForgetLoop.
    std::unique_ptr<boost::asio::steady_timer> mIdleTimer;
    std::uint64_t mIdleGeneration = 0;  // main thread
  };

  std::shared_ptr<Runner> mRunner;
};

}  // namespace Tarn::Integration
