// Shared fixtures of the messaging tests: hooks into kivcore that record
// instead of reporting, small message types, listeners that record their
// calls, and bounded waits so that a deadlock fails a test instead of
// hanging it.
//
//   TEST(Example, ABroadcastReachesTheListener) {
//     messaging_test::MainThreadGuard mainThread;          // this thread broadcasts
//     messaging_test::CallLog log;
//     messaging_test::RecordingListener listener("A", &log);
//     Tarn::Broadcaster broadcaster;
//     broadcaster.AddListener(&listener);
//     broadcaster.BroadcastMessage(messaging_test::NumberMessage(1));
//     EXPECT_EQ(std::vector<std::string>{"A:1"}, log.Entries());
//   }
//
// Every guard restores what it replaced when it goes out of scope, so tests
// stay independent whatever order gtest runs them in. The hooks are
// process-wide: install them on the test's thread before starting workers,
// and let the guard outlive every thread that might report.
//
// Threading: CallLog, the recorders, Latch and the call counters may be used
// from any thread. MainThreadGuard makes the constructing thread the main
// thread; the guards that swap handlers are meant for the test's own thread.
#pragma once

#include <TarnMessaging/Broadcaster.h>
#include <TarnMessaging/Listener.h>
#include <TarnMessaging/MessageImpl.h>
#include <TarnMessaging/SafeListener.h>

#include <kivcore/Debug.h>
#include <kivcore/Error.h>
#include <kivcore/MainThread.h>
#include <kivcore/SmallBlockAllocator.h>

#include <boost/shared_ptr.hpp>
#include <boost/weak_ptr.hpp>

#include "BoundedWait.h"

#include <atomic>
#include <exception>
#include <memory>
#include <string>
#include <type_traits>
#include <utility>

namespace messaging_test {

using namespace tarn_test;  // the bounded waits

// ---------------------------------------------------------------------------
// Process-wide hooks

// Makes the constructing thread the main thread for the guard's lifetime.
// Broadcasts deliver only there. If nothing else holds the main-thread
// adaptor, no thread is the main thread once the guard is gone; a main thread
// registered earlier on another thread is replaced, not restored.
class MainThreadGuard {
public:
  MainThreadGuard() : mAdaptor(kivcore::threads::RegisterCurrentThreadAsMainThread()) {}
  MainThreadGuard(const MainThreadGuard&) = delete;
  MainThreadGuard& operator=(const MainThreadGuard&) = delete;

  kivcore::threads::AsyncEventLoopAdaptor& Adaptor() const { return *mAdaptor; }

private:
  boost::shared_ptr<kivcore::threads::AsyncEventLoopAdaptor> mAdaptor;
};

// One call of the contract dialog, as the dialog was given it.
struct ContractViolation {
  std::string condition;
  std::string file;
  std::string function;
  int line = 0;
};

// An ordered list that any thread may add to and read, each call under the
// list's own mutex.
template <typename Entry>
class LockedList {
public:
  void Add(Entry inEntry) {
    std::lock_guard<std::mutex> lock(mMutex);
    mEntries.push_back(std::move(inEntry));
  }
  std::vector<Entry> Entries() const {
    std::lock_guard<std::mutex> lock(mMutex);
    return mEntries;
  }
  std::size_t Count() const { return Entries().size(); }
  void Clear() {
    std::lock_guard<std::mutex> lock(mMutex);
    mEntries.clear();
  }

private:
  mutable std::mutex mMutex;
  std::vector<Entry> mEntries;  // guarded by mMutex
};

// Swaps a process-wide hook (installed with inSet) for one that records what
// each call was given as an Entry; restores the previous hook when
// destroyed. The hook records on the reporting thread, so Entries and Count
// may be read from any thread meanwhile.
template <typename Entry, typename Handler, Handler (*inSet)(Handler)>
class HookRecorder {
public:
  HookRecorder(const HookRecorder&) = delete;
  HookRecorder& operator=(const HookRecorder&) = delete;
  ~HookRecorder() { inSet(std::move(mPrevious)); }

  std::vector<Entry> Entries() const { return mState->Entries(); }
  std::size_t Count() const { return mState->Count(); }

protected:
  using State = LockedList<Entry>;
  // inMakeHook(state) returns the hook to install; it records through state.
  template <typename MakeHook>
  explicit HookRecorder(MakeHook inMakeHook) : mState(std::make_shared<State>()), mPrevious(inSet(inMakeHook(mState))) {}

private:
  std::shared_ptr<State> mState;  // shared with the installed hook
  Handler mPrevious;
};

// Replaces the contract dialog with one that records every violation and
// answers inAnswer ("break into the debugger?"). The dialog runs on the
// reporting thread, which may hold a broadcaster's lock meanwhile: keep the
// recorder's users off that lock.
class ContractDialogRecorder : public HookRecorder<ContractViolation, kivcore::debug::ContractDialogHandler,
                                                   &kivcore::debug::SetContractDialogHandler> {
public:
  explicit ContractDialogRecorder(bool inAnswer = false)
      : HookRecorder([inAnswer](std::shared_ptr<State> inState) {
          return [inState, inAnswer](const char* inCondition, const char* inFile, const char* inFunction, int inLine) {
            inState->Add(ContractViolation{inCondition != nullptr ? inCondition : "", inFile != nullptr ? inFile : "",
                                           inFunction != nullptr ? inFunction : "", inLine});
            return inAnswer;
          };
        }) {}
};

// Replaces the error handler with one that records every report and
// returns, so that ThrowError returns to the operation that reported.
class ErrorRecorder : public HookRecorder<kivcore::config::ErrorReport, kivcore::config::ErrorHandler,
                                          &kivcore::config::SetErrorHandler> {
public:
  ErrorRecorder()
      : HookRecorder([](std::shared_ptr<State> inState) {
          return [inState](const kivcore::config::ErrorReport& inReport) { inState->Add(inReport); };
        }) {}
};

// Installs the default error handler (ThrowError throws
// kivcore::config::Error) for the guard's lifetime, whatever was installed
// before, and restores that afterwards.
class DefaultErrorHandlerGuard {
public:
  DefaultErrorHandlerGuard() : mPrevious(kivcore::config::SetErrorHandler(nullptr)) {}
  DefaultErrorHandlerGuard(const DefaultErrorHandlerGuard&) = delete;
  DefaultErrorHandlerGuard& operator=(const DefaultErrorHandlerGuard&) = delete;
  ~DefaultErrorHandlerGuard() { kivcore::config::SetErrorHandler(std::move(mPrevious)); }

private:
  kivcore::config::ErrorHandler mPrevious;
};

// Replaces the error manager's exception handler (what GuardedCall does with
// an exception a listener raised) with one that records the exception's
// what() text, or "unknown" for a non-standard exception.
class ExceptionRecorder : public HookRecorder<std::string, kivcore::config::ErrorManager::ExceptionHandler,
                                              &kivcore::config::ErrorManager::SetExceptionHandler> {
public:
  ExceptionRecorder()
      : HookRecorder([](std::shared_ptr<State> inState) {
          return [inState](std::exception_ptr inError) {
            try {
              std::rethrow_exception(inError);
            } catch (const std::exception& e) {
              inState->Add(e.what());
            } catch (...) {
              inState->Add("unknown");
            }
          };
        }) {}
};

// Lets the next inSucceeding small-block allocations succeed and fails every
// one after them, until the guard is destroyed; then allocations never fail
// again (the allocator's default).
class SmallBlockFailureGuard {
public:
  explicit SmallBlockFailureGuard(long long inSucceeding) {
    kivcore::utility::SmallBlockAllocator::SetFailAfter(inSucceeding);
  }
  SmallBlockFailureGuard(const SmallBlockFailureGuard&) = delete;
  SmallBlockFailureGuard& operator=(const SmallBlockFailureGuard&) = delete;
  ~SmallBlockFailureGuard() { kivcore::utility::SmallBlockAllocator::SetFailAfter(-1); }
};

// ---------------------------------------------------------------------------
// Messages

// A message without parameters.
struct PingMessage : Tarn::MessageImpl<PingMessage> {};

// A message with one parameter, handy for telling broadcasts apart.
struct NumberMessage : Tarn::MessageImpl<NumberMessage> {
  explicit NumberMessage(int inValue) : mValue(inValue) {}
  int mValue;
};

// How the call log shows a message: "ping", the number of a NumberMessage,
// or "#<id>" for any other type.
inline std::string Describe(const Tarn::Message& inMessage) {
  if (inMessage.GetMessageID() == PingMessage::StaticMessageID()) return "ping";
  if (inMessage.GetMessageID() == NumberMessage::StaticMessageID())
    return std::to_string(static_cast<const NumberMessage&>(inMessage).mValue);
  return "#" + std::to_string(inMessage.GetMessageID());
}

// ---------------------------------------------------------------------------
// Listeners

// An ordered record of calls, shared by the listeners of a test; entries are
// "<listener name>:<Describe(message)>".
using CallLog = LockedList<std::string>;

// What every recording listener shares, whatever its base class: a name, an
// optional log, a call count, an optional action run after the call is
// recorded, and a probe that outlives the listener (so that a test can still
// read the count, and see the destruction, after the listener is gone).
// Without a log and an action a call allocates nothing.
class CallRecorder {
public:
  using Action = std::function<void(const Tarn::Message&)>;
  struct Probe {
    std::atomic<int> mCalls{0};
    std::atomic<bool> mDestroyed{false};
  };

  explicit CallRecorder(std::string inName, CallLog* inLog)
      : mName(std::move(inName)), mLog(inLog), mProbe(std::make_shared<Probe>()) {}
  CallRecorder(const CallRecorder&) = delete;
  CallRecorder& operator=(const CallRecorder&) = delete;
  ~CallRecorder() { mProbe->mDestroyed.store(true); }

  int Calls() const { return mProbe->mCalls.load(); }
  const std::shared_ptr<Probe>& GetProbe() const { return mProbe; }
  // Runs on every call, on the delivering thread, after the call is logged.
  // Set it before the listener is attached: it is not synchronised.
  void SetAction(Action inAction) { mAction = std::move(inAction); }

protected:
  void RecordCall(const Tarn::Message& inMessage) {
    mProbe->mCalls.fetch_add(1);
    if (mLog != nullptr) mLog->Add(mName + ":" + Describe(inMessage));
    if (mAction) mAction(inMessage);
  }

private:
  const std::string mName;
  CallLog* const mLog;  // not owned; may be null
  Action mAction;
  const std::shared_ptr<Probe> mProbe;
};

// A Tarn::Listener that records its calls. It can detach itself from chosen
// broadcasters in its own destructor, before its derived part is gone: a
// listener that a worker may destroy while the main thread delivers to it
// needs that, since ~Listener would detach only after this class's members
// (the action, the name) were destroyed.
class RecordingListener : public Tarn::Listener, public CallRecorder {
public:
  explicit RecordingListener(std::string inName, CallLog* inLog = nullptr)
      : CallRecorder(std::move(inName), inLog) {}
  ~RecordingListener() override {
    for (Tarn::Broadcaster* broadcaster : mDetachOnDestroy) broadcaster->RemoveListener(this, true);
  }

  void ListenToMessage(const Tarn::Message& inMessage) override { RecordCall(inMessage); }

  // In the destructor, remove this listener from inBroadcaster first (which
  // waits, on a worker, for a delivery in progress). inBroadcaster must
  // outlive this listener.
  void DetachInDestructor(Tarn::Broadcaster& inBroadcaster) {
    for (Tarn::Broadcaster* broadcaster : mDetachOnDestroy)
      if (broadcaster == &inBroadcaster) return;
    mDetachOnDestroy.push_back(&inBroadcaster);
  }

private:
  std::vector<Tarn::Broadcaster*> mDetachOnDestroy;  // owned by the thread that destroys the listener
};

// A counted safe listener that records its calls. Create it with new and
// hold it in a Tarn::ISafeListenerRef at once; it is deleted with its last
// reference. LiveCount() counts the objects of this class not yet deleted.
class CountedSafeListener : public Tarn::SafeListenerBase, public CallRecorder {
public:
  explicit CountedSafeListener(std::string inName, CallLog* inLog = nullptr)
      : CallRecorder(std::move(inName), inLog) {
    sLive.fetch_add(1);
  }

  void ListenToMessage(const Tarn::Message& inMessage) override { RecordCall(inMessage); }

  // The object's reference count as its weak-reference block holds it.
  std::int32_t RefCount() { return GetWeakReference()->mRefCount.load(); }
  static int LiveCount() { return sLive.load(); }

protected:
  ~CountedSafeListener() override { sLive.fetch_sub(1); }

private:
  static inline std::atomic<int> sLive{0};
};

// The four ways a broadcaster can hold a listener.
enum class ListenerKind { kPlainPointer, kBoostWeak, kStdWeak, kSafe };
constexpr ListenerKind kAllListenerKinds[] = {ListenerKind::kPlainPointer, ListenerKind::kBoostWeak,
                                              ListenerKind::kStdWeak, ListenerKind::kSafe};

// One recording listener held the way inKind says, so that one test body can
// run for every kind. The handle owns the listener: a plain-pointer listener
// outright, a weak one through the owning shared pointer, a safe one through
// the host's counted reference. Attach and Detach use the overload of the
// kind; Destroy ends the listener the way its owner would (delete, last
// owner gone, last reference released) without detaching it first.
//
// A plain-pointer listener detaches itself in its destructor from every
// broadcaster it was attached to, so those broadcasters must outlive it (or
// it must be detached first).
class AnyListener {
public:
  AnyListener(ListenerKind inKind, std::string inName, CallLog* inLog = nullptr) : mKind(inKind) {
    switch (inKind) {
      case ListenerKind::kPlainPointer:
        mPlain = std::make_unique<RecordingListener>(std::move(inName), inLog);
        mRecorder = mPlain.get();
        break;
      case ListenerKind::kBoostWeak:
        mBoost = boost::shared_ptr<RecordingListener>(new RecordingListener(std::move(inName), inLog));
        mRecorder = mBoost.get();
        break;
      case ListenerKind::kStdWeak:
        mStd = std::make_shared<RecordingListener>(std::move(inName), inLog);
        mRecorder = mStd.get();
        break;
      case ListenerKind::kSafe: {
        auto* object = new CountedSafeListener(std::move(inName), inLog);
        mRecorder = object;
        mSafe = Tarn::ISafeListenerRef(object);
        break;
      }
    }
    mProbe = mRecorder->GetProbe();
  }
  AnyListener(const AnyListener&) = delete;
  AnyListener& operator=(const AnyListener&) = delete;
  ~AnyListener() { Destroy(); }

  int Calls() const { return mProbe->mCalls.load(); }
  // Set before attaching; see CallRecorder::SetAction.
  void SetAction(CallRecorder::Action inAction) { mRecorder->SetAction(std::move(inAction)); }

  void Attach(Tarn::Broadcaster& inBroadcaster) {
    WithHandle([&](const auto& inHandle) { inBroadcaster.AddListener(inHandle); });
    if (mPlain) mPlain->DetachInDestructor(inBroadcaster);
  }
  void Detach(Tarn::Broadcaster& inBroadcaster) {
    WithHandle([&](const auto& inHandle) {
      if constexpr (std::is_pointer_v<std::decay_t<decltype(inHandle)>>) inBroadcaster.RemoveListener(inHandle, true);
      else inBroadcaster.RemoveListener(inHandle);
    });
  }
  // Calls inCall with what the overloads for the kind take (a broadcaster's,
  // Tarn::Attach's); the handle must still own the listener.
  template <class Call>
  void WithHandle(Call inCall) {
    switch (mKind) {
      case ListenerKind::kPlainPointer: return inCall(static_cast<Tarn::Listener*>(mPlain.get()));
      case ListenerKind::kBoostWeak: return inCall(boost::weak_ptr<Tarn::Listener>(mBoost));
      case ListenerKind::kStdWeak: return inCall(std::weak_ptr<Tarn::Listener>(mStd));
      case ListenerKind::kSafe: return inCall(mSafe);
    }
  }
  // Ends the handle's ownership. The listener itself may live on for a
  // delivery in progress (weak and safe kinds); its recorder's probe tells.
  void Destroy() {
    mRecorder = nullptr;
    mPlain.reset();
    mBoost.reset();
    mStd.reset();
    mSafe = nullptr;
  }

private:
  const ListenerKind mKind;
  CallRecorder* mRecorder = nullptr;  // the listener's recording part, while owned
  std::unique_ptr<RecordingListener> mPlain;
  boost::shared_ptr<RecordingListener> mBoost;
  std::shared_ptr<RecordingListener> mStd;
  Tarn::ISafeListenerRef mSafe;
  std::shared_ptr<CallRecorder::Probe> mProbe;  // outlives the listener
};

}  // namespace messaging_test
