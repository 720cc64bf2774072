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
/// Replacement and destruction: the main thread's queue has one wakeup
/// handler for the whole process, and the newest integration (of any kind)
/// holds it. Building a new one before the old one is destroyed
/// (`loop = std::make_unique<AsioEventLoop>(other)`) moves every later wakeup
/// to the new one, which is woken at once for calls already queued; the old
/// one's destructor leaves the new one's handler in place. The destructor runs
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
/// object. A newer integration takes the wakeups over from this one.
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

private:
  class Runner : public PendingCallRunner {
  public:
    explicit Runner(boost::asio::io_context& inContext) : mContext(&inContext) {}

  private:
    void PostRun() override {
      std::shared_ptr<PendingCallRunner> self = shared_from_this();
      boost::asio::post(*mContext, [self] { self->RunPending(kPropagate); });
    }
    void ForgetLoop() noexcept override { mContext = nullptr; }

    boost::asio::io_context* mContext;  // guarded by the runner's mutex; null after ForgetLoop
  };

  std::shared_ptr<Runner> mRunner;
};

}  // namespace Tarn::Integration
