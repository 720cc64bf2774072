// Main-thread services: the registered main thread and the queue of calls it
// runs for other threads.
//
// The queue belongs to the process, not to an adaptor, so that calls queued
// while no main thread is registered wait for the next one. Producers append
// to one vector; RunPendingCalls swaps it with a spare, empty vector under the
// lock and runs the taken calls with the lock released. The two vectors trade
// places on every run and keep their capacity, so a steady stream of calls
// allocates nothing beyond the copies of the calls themselves.
//
// Invariants, each kept within one hold of the lock:
// - while a wakeup handler is installed, a non-empty queue has had exactly one
//   wakeup since it was last taken: the post that finds the queue un-armed
//   arms it, and the take disarms it;
// - each producer's calls stay in order: a run nested in another on the same
//   thread first finishes the outer run's calls, which were queued earlier,
//   and a run that throws puts the calls it has not run back in front.
//
// Putting calls back allocates nothing, so that a call that throws when
// storage runs short neither loses the calls behind it nor has its exception
// replaced by std::bad_alloc: they stay in the run's vector, which becomes,
// when the run ends, the put-back part of the queue, ahead of the main
// vector. The next run joins the two before it runs anything; when that
// needs storage it cannot have, it throws with both parts as they were.
#include <kivcore/Error.h>
#include <kivcore/MainThread.h>

#include <boost/weak_ptr.hpp>

#include <pthread.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <exception>
#include <iterator>
#include <memory>
#include <mutex>
#include <utility>
#include <vector>

namespace kivcore::threads {

namespace {

using Call = boost::function<void()>;
using WakeupHandler = std::shared_ptr<const std::function<void()>>;

// pthread id of the registered main thread; 0 when none is. Constant-
// initialized and trivially destructible, so the query works at any time.
std::atomic<unsigned long> gMainThreadId{0};

// The calls one RunPendingCalls took from the queue, and how far it got; or
// the calls a run that threw put back, from next on.
struct Run {
  std::vector<Call> calls;
  std::size_t next = 0;
  bool putBack = false;  // a call threw: the rest waits for the next run
};

struct MainThreadState {
  std::mutex mutex;
  std::condition_variable callQueued;  // signalled only while waiters > 0
  std::vector<Call> queue;             // guarded by mutex
  Run putBack;                         // queued ahead of queue; guarded by mutex
  std::size_t heldBack = 0;            // calls put back but still in a run (Run::putBack); guarded by mutex
  std::vector<Call> spare;             // owned by the outermost RunPendingCalls while spareInUse
  bool spareInUse = false;             // guarded by mutex
  int waiters = 0;                     // threads in WaitForPendingCalls; guarded by mutex
  WakeupHandler wakeup;                // guarded by mutex
  const void* wakeupOwner = nullptr;   // the tag wakeup was installed with; guarded by mutex
  bool wakeupArmed = false;            // the queue's wakeup was called since its last take; guarded by mutex
  std::uint64_t armings = 0;           // times wakeupArmed was set; guarded by mutex
  boost::weak_ptr<AsyncEventLoopAdaptor> adaptor;  // the live adaptor, if any; guarded by mutex
};

// Never destroyed: adaptors held by static objects of other modules are
// released during static destruction, and queued calls may be too.
MainThreadState& State() {
  static MainThreadState* state = new MainThreadState;
  return *state;
}

unsigned long CurrentThreadId() noexcept { return static_cast<unsigned long>(pthread_self()); }

// The number of calls queued, put-back ones included. state.mutex held.
std::size_t Waiting(const MainThreadState& inState) noexcept {
  return inState.queue.size() + inState.putBack.calls.size() - inState.putBack.next + inState.heldBack;
}

// Arms the queue's wakeup if it needs one; returns the handler to call (after
// the lock is released), or null. state.mutex held.
WakeupHandler ArmWakeup(MainThreadState& ioState, std::uint64_t& outArming) {
  if (ioState.wakeupArmed || !ioState.wakeup || Waiting(ioState) == 0) return nullptr;
  ioState.wakeupArmed = true;
  outArming = ++ioState.armings;
  return ioState.wakeup;
}

// Calls an armed wakeup handler, outside the lock. Its failure is not the
// caller's: the calls are queued whatever the handler does. The failure goes
// to the error manager and the queue is disarmed again, so that the next post
// retries the wakeup.
void CallWakeup(MainThreadState& ioState, const WakeupHandler& inHandler, std::uint64_t inArming) noexcept {
  if (!inHandler) return;
  const int called = config::ErrorManager::Get(false)->GuardedCall([&inHandler] {
    (*inHandler)();
    return 1;
  });
  if (called != 0) return;
  std::lock_guard<std::mutex> lock(ioState.mutex);
  if (ioState.armings == inArming) ioState.wakeupArmed = false;
}

// The innermost run on this thread. A run nested in it (a call that runs
// pending calls itself) finishes it first: its calls were queued before any
// call the nested run could take.
thread_local Run* tCurrentRun = nullptr;

// Runs what is left of ioRun. When a call throws, the calls after it are put
// back (counted as queued at once, and the wakeup handler is called for
// them) and the exception propagates: a run nested in this one (a call that
// runs pending calls itself) still finishes them first, and otherwise the
// end of the run hands them to the front of the queue (PutBack).
void RunRemaining(MainThreadState& ioState, Run& ioRun) {
  if (ioRun.putBack) {
    std::lock_guard<std::mutex> lock(ioState.mutex);
    ioState.heldBack -= ioRun.calls.size() - ioRun.next;
    ioRun.putBack = false;
  }
  // The run's vector stays in place while the run lives: nested runs only
  // advance next.
  std::size_t running = 0;
  try {
    while (!ioRun.putBack && ioRun.next < ioRun.calls.size()) {
      running = ioRun.next++;
      ioRun.calls[running]();
      // Release what the call holds now rather than at the end of the run.
      ioRun.calls[running].clear();
    }
  } catch (...) {
    // Its destructor is the host's code, run here rather than under the
    // queue's lock later.
    ioRun.calls[running].clear();
    WakeupHandler wakeup;
    std::uint64_t arming = 0;
    {
      std::lock_guard<std::mutex> lock(ioState.mutex);
      // A nested run may have put the rest back already.
      if (!ioRun.putBack) ioState.heldBack += ioRun.calls.size() - ioRun.next;
      ioRun.putBack = true;
      wakeup = ArmWakeup(ioState, arming);
    }
    CallWakeup(ioState, wakeup, arming);
    throw;
  }
}

// At the end of a run, hands the calls it put back to the front of the queue
// (they were queued before anything in it) and calls the wakeup handler for
// them if a run took the queue since. The run's vector goes whole, so
// nothing is allocated.
void PutBack(MainThreadState& ioState, Run& ioRun) noexcept {
  WakeupHandler wakeup;
  std::uint64_t arming = 0;
  std::exception_ptr failure;
  {
    std::lock_guard<std::mutex> lock(ioState.mutex);
    Run& putBack = ioState.putBack;
    ioState.heldBack -= ioRun.calls.size() - ioRun.next;
    if (putBack.next == putBack.calls.size()) {
      putBack.calls.swap(ioRun.calls);
      putBack.next = ioRun.next;
    } else {
      // Calls put back already: only runs on two threads at once, outside
      // the contract, get here. Joining them may fail for want of storage;
      // the calls are then lost, and the failure is reported.
      try {
        putBack.calls.insert(putBack.calls.begin() + static_cast<std::ptrdiff_t>(putBack.next),
                             std::make_move_iterator(ioRun.calls.begin() + static_cast<std::ptrdiff_t>(ioRun.next)),
                             std::make_move_iterator(ioRun.calls.end()));
      } catch (...) {
        failure = std::current_exception();
      }
    }
    ioRun.next = ioRun.calls.size();
    wakeup = ArmWakeup(ioState, arming);
  }
  if (failure) {
    config::ErrorManager::Get(false)->GuardedCall([&failure]() -> int { std::rethrow_exception(failure); });
  }
  CallWakeup(ioState, wakeup, arming);
}

}  // namespace

AsyncEventLoopAdaptor::~AsyncEventLoopAdaptor() {
  MainThreadState& state = State();
  std::lock_guard<std::mutex> lock(state.mutex);
  // A new adaptor may have been registered between our count reaching zero
  // and this destructor taking the lock; its main thread must stay.
  if (state.adaptor.expired()) gMainThreadId.store(0, std::memory_order_release);
}

void AsyncEventLoopAdaptor::RunPendingCalls() {
  MainThreadState& state = State();
  if (tCurrentRun != nullptr) RunRemaining(state, *tCurrentRun);

  Run run;
  bool usingSpare = false;
  {
    std::lock_guard<std::mutex> lock(state.mutex);
    Run& putBack = state.putBack;
    if (putBack.next != putBack.calls.size()) {
      // Calls put back come first. When the queue cannot join them for want
      // of storage, this throws with both as they were (the run-out calls
      // dropped first hold nothing).
      if (!state.queue.empty()) {
        putBack.calls.erase(putBack.calls.begin(), putBack.calls.begin() + static_cast<std::ptrdiff_t>(putBack.next));
        putBack.next = 0;
        putBack.calls.insert(putBack.calls.end(), std::make_move_iterator(state.queue.begin()),
                             std::make_move_iterator(state.queue.end()));
        state.queue.clear();
      }
      run.calls.swap(putBack.calls);
      run.next = std::exchange(putBack.next, 0);
    } else {
      if (state.queue.empty()) return;
      if (!state.spareInUse) {
        state.spareInUse = true;
        usingSpare = true;
        run.calls.swap(state.spare);
      }
      run.calls.swap(state.queue);
    }
    // The first call queued from now on wakes the host loop for the next run.
    state.wakeupArmed = false;
  }

  // On every way out, puts back the calls a throw left unrun, destroys the
  // run (and moved-from) calls outside the lock, since their destructors may
  // queue calls or drop the last adaptor, and hands the spare vector back.
  struct Finish {
    MainThreadState& state;
    Run& run;
    Run* outer;
    bool usingSpare;
    ~Finish() {
      tCurrentRun = outer;
      if (run.putBack) PutBack(state, run);
      run.calls.clear();
      if (!usingSpare) return;
      std::lock_guard<std::mutex> lock(state.mutex);
      state.spare.swap(run.calls);
      state.spareInUse = false;
    }
  } finish{state, run, tCurrentRun, usingSpare};
  tCurrentRun = &run;

  RunRemaining(state, run);
}

bool AsyncEventLoopAdaptor::WaitForPendingCalls(int inTimeoutMilliseconds) {
  MainThreadState& state = State();
  std::unique_lock<std::mutex> lock(state.mutex);
  if (Waiting(state) != 0) return true;
  ++state.waiters;
  auto queued = [&state] { return Waiting(state) != 0; };
  bool result = true;
  if (inTimeoutMilliseconds < 0) state.callQueued.wait(lock, queued);
  else result = state.callQueued.wait_for(lock, std::chrono::milliseconds(inTimeoutMilliseconds), queued);
  --state.waiters;
  return result;
}

void AsyncEventLoopAdaptor::SetWakeupHandler(std::function<void()> inHandler) {
  SetWakeupHandler(std::move(inHandler), nullptr);
}

void AsyncEventLoopAdaptor::SetWakeupHandler(std::function<void()> inHandler, const void* inOwner) {
  WakeupHandler handler;
  if (inHandler) handler = std::make_shared<const std::function<void()>>(std::move(inHandler));
  MainThreadState& state = State();
  WakeupHandler wakeup;
  std::uint64_t arming = 0;
  {
    std::lock_guard<std::mutex> lock(state.mutex);
    state.wakeup.swap(handler);
    state.wakeupOwner = inOwner;
    // Calls already queued were announced to the previous handler, if to
    // anyone; the new one must hear of them.
    state.wakeupArmed = false;
    wakeup = ArmWakeup(state, arming);
  }
  CallWakeup(state, wakeup, arming);
  // The previous handler is destroyed here, outside the lock.
}

bool AsyncEventLoopAdaptor::RemoveWakeupHandler(const void* inOwner) {
  MainThreadState& state = State();
  WakeupHandler handler;
  {
    std::lock_guard<std::mutex> lock(state.mutex);
    if (!state.wakeup || state.wakeupOwner != inOwner) return false;
    state.wakeup.swap(handler);
    state.wakeupOwner = nullptr;
    state.wakeupArmed = false;
  }
  return true;
}

std::size_t AsyncEventLoopAdaptor::PendingCallCount() const {
  MainThreadState& state = State();
  std::lock_guard<std::mutex> lock(state.mutex);
  return Waiting(state);
}

boost::shared_ptr<AsyncEventLoopAdaptor> RegisterCurrentThreadAsMainThread() {
  MainThreadState& state = State();
  {
    std::lock_guard<std::mutex> lock(state.mutex);
    if (boost::shared_ptr<AsyncEventLoopAdaptor> adaptor = state.adaptor.lock()) {
      gMainThreadId.store(CurrentThreadId(), std::memory_order_release);
      return adaptor;
    }
  }
  // Made outside the lock: when its count block cannot be allocated, boost
  // deletes the new adaptor at once, and the adaptor's destructor takes the
  // lock. Declared before the lock below, so that an adaptor made in vain
  // (another thread registered first) also goes after the lock is released.
  boost::shared_ptr<AsyncEventLoopAdaptor> made(new AsyncEventLoopAdaptor());
  std::lock_guard<std::mutex> lock(state.mutex);
  boost::shared_ptr<AsyncEventLoopAdaptor> adaptor = state.adaptor.lock();
  if (!adaptor) {
    adaptor = made;
    state.adaptor = adaptor;
  }
  gMainThreadId.store(CurrentThreadId(), std::memory_order_release);
  return adaptor;
}

boost::shared_ptr<AsyncEventLoopAdaptor> GetRegisteredMainThread() {
  MainThreadState& state = State();
  std::lock_guard<std::mutex> lock(state.mutex);
  return state.adaptor.lock();
}

bool CurrentThreadIsMainThread() noexcept {
  const unsigned long id = gMainThreadId.load(std::memory_order_acquire);
  return id != 0 && id == CurrentThreadId();
}

bool AsyncCallFromMainThread(const boost::function<void()>& inCall, unsigned int inFlags) {
  return AsyncCallFromMainThread(boost::function<void()>(inCall), inFlags);
}

bool AsyncCallFromMainThread(boost::function<void()>&& inCall, unsigned int /*inFlags*/) {
  if (inCall.empty()) return false;
  MainThreadState& state = State();
  WakeupHandler wakeup;
  std::uint64_t arming = 0;
  {
    std::lock_guard<std::mutex> lock(state.mutex);
    state.queue.push_back(std::move(inCall));
    if (state.waiters > 0) state.callQueued.notify_all();
    wakeup = ArmWakeup(state, arming);
  }
  CallWakeup(state, wakeup, arming);
  return true;
}

}  // namespace kivcore::threads
