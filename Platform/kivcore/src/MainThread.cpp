// Main-thread services: the registered main thread and the queue of calls it
// runs for other threads.
//
// The queue belongs to the process, not to an adaptor, so that calls queued
// while no main thread is registered wait for the next one. Producers append
// to one vector; RunPendingCalls swaps it with a spare, empty vector under the
// lock and runs the taken calls with the lock released. The two vectors trade
// places on every run and keep their capacity, so a steady stream of calls
// allocates nothing beyond the copies of the calls themselves.
#include <kivcore/MainThread.h>

#include <boost/weak_ptr.hpp>

#include <pthread.h>

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <iterator>
#include <memory>
#include <mutex>
#include <vector>

namespace kivcore::threads {

namespace {

using Call = boost::function<void()>;
using WakeupHandler = std::shared_ptr<const std::function<void()>>;

// pthread id of the registered main thread; 0 when none is. Constant-
// initialized and trivially destructible, so the query works at any time.
std::atomic<unsigned long> gMainThreadId{0};

struct MainThreadState {
  std::mutex mutex;
  std::condition_variable callQueued;  // signalled only while waiters > 0
  std::vector<Call> queue;             // guarded by mutex
  std::vector<Call> spare;             // owned by the outermost RunPendingCalls while spareInUse
  bool spareInUse = false;             // guarded by mutex
  int waiters = 0;                     // threads in WaitForPendingCalls; guarded by mutex
  WakeupHandler wakeup;                // guarded by mutex
  boost::weak_ptr<AsyncEventLoopAdaptor> adaptor;  // the live adaptor, if any; guarded by mutex
};

// Never destroyed: adaptors held by static objects of other modules are
// released during static destruction, and queued calls may be too.
MainThreadState& State() {
  static MainThreadState* state = new MainThreadState;
  return *state;
}

unsigned long CurrentThreadId() noexcept { return static_cast<unsigned long>(pthread_self()); }

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
  std::vector<Call> local;
  std::vector<Call>* batch = &local;
  bool usingSpare = false;
  {
    std::lock_guard<std::mutex> lock(state.mutex);
    if (state.queue.empty()) return;
    // A call that runs pending calls itself gets a vector of its own.
    if (!state.spareInUse) {
      state.spareInUse = true;
      usingSpare = true;
      batch = &state.spare;
    }
    batch->swap(state.queue);
  }

  // On every way out, destroys the run (and moved-from) calls outside the
  // lock, since their destructors may queue calls or drop the last adaptor,
  // and hands the spare vector back.
  struct Finish {
    MainThreadState& state;
    std::vector<Call>& batch;
    bool usingSpare;
    ~Finish() {
      batch.clear();
      if (usingSpare) {
        std::lock_guard<std::mutex> lock(state.mutex);
        state.spareInUse = false;
      }
    }
  } finish{state, *batch, usingSpare};

  std::size_t next = 0;
  try {
    for (; next < batch->size(); ++next) {
      (*batch)[next]();
      // Release what the call holds now rather than at the end of the run.
      (*batch)[next].clear();
    }
  } catch (...) {
    std::lock_guard<std::mutex> lock(state.mutex);
    // The calls not yet run were queued before anything queued since, so
    // they go back in front of it.
    state.queue.insert(state.queue.begin(), std::make_move_iterator(batch->begin() + static_cast<std::ptrdiff_t>(next + 1)),
                       std::make_move_iterator(batch->end()));
    throw;
  }
}

bool AsyncEventLoopAdaptor::WaitForPendingCalls(int inTimeoutMilliseconds) {
  MainThreadState& state = State();
  std::unique_lock<std::mutex> lock(state.mutex);
  if (!state.queue.empty()) return true;
  ++state.waiters;
  auto queued = [&state] { return !state.queue.empty(); };
  bool result = true;
  if (inTimeoutMilliseconds < 0) state.callQueued.wait(lock, queued);
  else result = state.callQueued.wait_for(lock, std::chrono::milliseconds(inTimeoutMilliseconds), queued);
  --state.waiters;
  return result;
}

void AsyncEventLoopAdaptor::SetWakeupHandler(std::function<void()> inHandler) {
  WakeupHandler handler;
  if (inHandler) handler = std::make_shared<const std::function<void()>>(std::move(inHandler));
  MainThreadState& state = State();
  {
    std::lock_guard<std::mutex> lock(state.mutex);
    state.wakeup.swap(handler);
  }
  // The previous handler is destroyed here, outside the lock.
}

std::size_t AsyncEventLoopAdaptor::PendingCallCount() const {
  MainThreadState& state = State();
  std::lock_guard<std::mutex> lock(state.mutex);
  return state.queue.size();
}

boost::shared_ptr<AsyncEventLoopAdaptor> RegisterCurrentThreadAsMainThread() {
  MainThreadState& state = State();
  std::lock_guard<std::mutex> lock(state.mutex);
  boost::shared_ptr<AsyncEventLoopAdaptor> adaptor = state.adaptor.lock();
  if (!adaptor) {
    adaptor.reset(new AsyncEventLoopAdaptor());
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
  {
    std::lock_guard<std::mutex> lock(state.mutex);
    state.queue.push_back(std::move(inCall));
    if (state.waiters > 0) state.callQueued.notify_all();
    wakeup = state.wakeup;
  }
  if (wakeup) (*wakeup)();
  return true;
}

}  // namespace kivcore::threads
