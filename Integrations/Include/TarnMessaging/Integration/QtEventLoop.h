/// @file
/// Tarn::Integration::QtEventLoop: delivers messages posted to the main
/// thread from the event loop of a QCoreApplication (or QGuiApplication,
/// QApplication) whose thread is the main thread.
///
/// @code{.cpp}
///   QCoreApplication app(argc, argv);                    // on the main thread
///   Tarn::Messaging::Initialize();                       // the same thread
///   Tarn::Integration::QtEventLoop messaging;
///   // any thread: Tarn::StationUtils::PostMessageToUIThread(station, Progress(1, 2), false);
///   return app.exec();                                   // posted messages are delivered in here
/// @endcode
///
/// While the object lives, the first call queued for the main thread after a
/// run posts one event (QCoreApplication::postEvent) to a receiver object
/// living on the main thread, and its handler runs every call pending by
/// then: a burst of posted messages costs one Qt event, not one per message
/// (PendingCallRunner.h explains it). ScheduledRuns() counts the events
/// posted. A plain QEvent is posted rather than a queued functor, so that no
/// data of ours travels with it from the posting thread to the main thread;
/// the event itself is published through an atomic of the receiver as well,
/// so that ThreadSanitizer, which does not see Qt's own locks, orders the
/// main thread's handling and freeing of it after the posting thread that
/// made it. Qt's own posted-event list, locked with futexes ThreadSanitizer
/// does not see, still shows as races inside libQt5Core in a host built with
/// it; the suppression `called_from_lib:libQt5Core.so` hides those and no
/// others.
///
/// Idle source: a precise timer of the receiver comes due every idle interval
/// (PendingCallRunner::kDefaultIdleInterval unless SetIdleInterval says
/// otherwise) and broadcasts Tarn::ApplicationIdleMessage on
/// Tarn::kStation_Idle when no posted message is waiting
/// (PendingCallRunner.h). SetIdleInterval(PendingCallRunner::kIdleOff)
/// switches it off.
///
/// Threading: construct and destroy the object on the main thread, which must
/// be the QCoreApplication's thread, after Tarn::Messaging::Initialize and
/// before the last Tarn::Messaging::Terminate; the QCoreApplication must
/// outlive the object. Messages may be posted from any thread; the wakeup runs
/// on the posting thread, once per burst, and never blocks on the main thread.
/// An exception thrown by a pending call must not unwind through Qt's event
/// handling: it goes to kivcore's error manager, the calls behind it stay
/// queued and a new event is posted for them.
///
/// Ownership: the receiver belongs to the object's internals and is deleted on
/// the main thread when the object goes; a pending call or idle listener may
/// destroy the QtEventLoop while the receiver is handling an event, and the
/// receiver then deletes itself once the handler is done, as deleteLater
/// would.
///
/// Replacement and destruction: as for the other integrations, the newest live
/// one gets the wakeups. The destructor drops the events and the timer of its
/// receiver, then runs on the calling (main) thread every
/// call still queued, and the follow-ups those calls post, until the queue is
/// empty or PendingCallRunner::kDrainPasses runs have passed. Nothing posted
/// before the destructor returns is lost, and nothing is delivered twice.
#pragma once

#include <TarnMessaging/Integration/PendingCallRunner.h>

#include <QtCore/QCoreApplication>
#include <QtCore/QEvent>
#include <QtCore/QObject>
#include <QtCore/QThread>
#include <QtCore/QTimerEvent>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <memory>
#include <stdexcept>

namespace Tarn::Integration {

/// Runs the main thread's pending calls, and with them the messages posted
/// with Tarn::StationUtils::PostMessageToUIThread, from the event loop of the
/// QCoreApplication, one posted event per burst of posts.
///
/// Construct and destroy on the QCoreApplication's thread, which is the main
/// thread, after Tarn::Messaging::Initialize and before the last
/// Tarn::Messaging::Terminate. A newer integration takes the wakeups over
/// from this one while it lives.
class QtEventLoop {
public:
  /// Installs the wakeup handler and, when calls are already pending, posts
  /// an event for them.
  /// Precondition: a QCoreApplication exists and this is its thread, and a
  /// main thread is registered (Tarn::Messaging::Initialize has run) and
  /// this is it; otherwise throws std::logic_error.
  QtEventLoop() : mRunner(std::make_shared<Runner>()) { mRunner->Install(); }

  /// Removes the wakeup handler (unless a newer integration replaced it),
  /// drops the receiver's events and timer, and runs on the calling (main)
  /// thread the calls still pending and their follow-ups until none is left.
  /// Exceptions of those calls go to kivcore's error manager.
  ~QtEventLoop() { mRunner->Uninstall(); }

  QtEventLoop(const QtEventLoop&) = delete;
  QtEventLoop& operator=(const QtEventLoop&) = delete;

  /// Number of events posted so far. Any thread.
  std::uint64_t ScheduledRuns() const noexcept { return mRunner->ScheduledRuns(); }
  /// Number of idle broadcasts so far. Any thread.
  std::uint64_t IdleBroadcasts() const noexcept { return mRunner->IdleBroadcasts(); }
  /// Sets the idle interval; PendingCallRunner::kIdleOff switches the idle
  /// source off. Main thread. Precondition: inInterval >= kIdleOff; otherwise
  /// throws std::invalid_argument.
  void SetIdleInterval(std::chrono::milliseconds inInterval) { mRunner->SetIdleInterval(inInterval); }

private:
  class Runner;

  // Lives on the main thread; receives the run events and the idle timer.
  // Needs no meta-object of its own: it overrides the event handlers only.
  class Receiver : public QObject {
  public:
    explicit Receiver(std::weak_ptr<Runner> inRunner) : mRunner(std::move(inRunner)) {}

    static QEvent::Type RunEventType() {
      static const QEvent::Type sType = static_cast<QEvent::Type>(QEvent::registerEventType());
      return sType;
    }

    // Main thread. A receiver let go while one of its handlers runs deletes
    // itself when the outermost handler returns.
    void LetGo() noexcept {
      QCoreApplication::removePostedEvents(this, RunEventType());
      StopIdleTimer();
      if (mDepth == 0) delete this;
      else mLetGo = true;
    }

    void StartIdleTimer(std::chrono::milliseconds inDelay) {
      StopIdleTimer();
      const int milliseconds = static_cast<int>(std::min<std::chrono::milliseconds::rep>(inDelay.count(), 0x7fffffff));
      mIdleTimer = startTimer(milliseconds, Qt::PreciseTimer);
      if (mIdleTimer == 0) throw std::runtime_error("Tarn::Integration::QtEventLoop: no timer for the idle source");
    }
    void StopIdleTimer() noexcept {
      if (mIdleTimer != 0) killTimer(mIdleTimer);
      mIdleTimer = 0;
    }

    // Posting thread, under the runner's mutex.
    void Post() {
      QEvent* const event = new QEvent(RunEventType());
      mPublished.fetch_add(1, std::memory_order_release);
      QCoreApplication::postEvent(this, event);
    }

  protected:
    bool event(QEvent* inEvent) override {
      mPublished.load(std::memory_order_acquire);
      if (inEvent->type() != RunEventType()) return QObject::event(inEvent);
      Handle([](Runner& inRunner) { inRunner.RunPending(PendingCallRunner::kToErrorManager); });
      return true;
    }
    void timerEvent(QTimerEvent* inEvent) override {
      if (inEvent->timerId() != mIdleTimer) return;
      // One-shot: CheckIdle arms the next one.
      StopIdleTimer();
      Handle([](Runner& inRunner) { inRunner.CheckIdle(PendingCallRunner::kToErrorManager); });
    }

  private:
    // The handler holds the runner, which a call destroying the QtEventLoop
    // would otherwise free under it.
    template <class Action>
    void Handle(Action inAction) {
      std::shared_ptr<Runner> runner = mRunner.lock();
      if (!runner) return;
      ++mDepth;
      inAction(*runner);
      runner.reset();
      if (--mDepth == 0 && mLetGo) delete this;
    }

    const std::weak_ptr<Runner> mRunner;
    std::atomic<std::uint64_t> mPublished{0};  // see Post
    int mDepth = 0;        // handlers of this receiver on the stack; main thread
    bool mLetGo = false;   // main thread
    int mIdleTimer = 0;    // Qt's timer id, 0 when none; main thread
  };

  class Runner : public PendingCallRunner {
  public:
    // Checks the Qt side of the preconditions, then installs.
    void Install() {
      const QCoreApplication* const application = QCoreApplication::instance();
      if (application == nullptr || QThread::currentThread() != application->thread())
        throw std::logic_error("Tarn::Integration::QtEventLoop: construct it on the thread of the QCoreApplication");
      if (!kivcore::threads::CurrentThreadIsMainThread())
        throw std::logic_error(
            "Tarn::Integration::QtEventLoop: the QCoreApplication's thread is not the main thread; call "
            "Tarn::Messaging::Initialize there");
      mReceiver = new Receiver(std::static_pointer_cast<Runner>(shared_from_this()));
      try {
        PendingCallRunner::Install();
      } catch (...) {
        mReceiver->LetGo();
        mReceiver = nullptr;
        throw;
      }
    }

  private:
    void PostRun() override { mReceiver->Post(); }
    void ForgetLoop() noexcept override {
      Receiver* const receiver = mReceiver;
      mReceiver = nullptr;
      if (receiver != nullptr) receiver->LetGo();
    }
    void ArmIdleCheck(std::chrono::milliseconds inDelay) override {
      if (mReceiver != nullptr) mReceiver->StartIdleTimer(inDelay);
    }
    void DisarmIdleCheck() noexcept override {
      if (mReceiver != nullptr) mReceiver->StopIdleTimer();
    }

    // Owned; guarded by the runner's mutex, and used on the main thread only
    // besides PostRun.
    Receiver* mReceiver = nullptr;
  };

  std::shared_ptr<Runner> mRunner;
};

}  // namespace Tarn::Integration
