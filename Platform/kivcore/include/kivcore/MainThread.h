/// @file
/// kivcore::threads main-thread services: which thread is the application's
/// main (UI) thread, and the queue of calls it runs for other threads.
///
/// @code{.cpp}
///   auto adaptor = RegisterCurrentThreadAsMainThread();   // on the UI thread
///   // any thread:
///   AsyncCallFromMainThread([] { UpdateUI(); }, 0);
///   // UI thread, in its event loop:
///   if (adaptor->WaitForPendingCalls(50)) adaptor->RunPendingCalls();
/// @endcode
///
/// Threading: a thread is the main thread while anybody holds the adaptor that
/// registered it; once the last holder lets go, no thread is. Calls may be
/// queued from any thread at any time; a call queued while no main thread is
/// registered waits for the next one. RunPendingCalls runs, on the calling
/// thread and in queue order, the calls queued before it started; calls queued
/// while it runs wait for the next run. Each thread's calls run in the order it
/// queued them, also when a call runs pending calls itself (the nested run
/// first finishes the calls the outer run took) and when a call throws. That
/// order holds for runs on one thread; runs on two threads at once (outside
/// the contract: runs belong to the main thread) share out the calls, each
/// still once.
///
/// Wakeups: the wakeup handler is called once per batch, not once per call:
/// by the first call queued after RunPendingCalls took the queue (or after the
/// handler was installed), on the queuing thread, outside every lock of the
/// queue. A handler installed while calls are queued is called at once for
/// them. A handler that throws is reported through kivcore's error manager and
/// called again by the next queued call; the call that woke it stays queued.
#pragma once

#include <kivcore/Export.h>

#include <boost/function.hpp>
#include <boost/shared_ptr.hpp>

#include <cstddef>
#include <functional>

namespace kivcore::threads {

/// The registered main thread's handle on the process-wide queue of calls
/// it runs for other threads. Holding it keeps the thread that registered
/// it the main thread; RunPendingCalls and WaitForPendingCalls are for that
/// thread, the rest may be called from any thread.
class KIVCORE_API AsyncEventLoopAdaptor {
public:
  AsyncEventLoopAdaptor(const AsyncEventLoopAdaptor&) = delete;
  AsyncEventLoopAdaptor& operator=(const AsyncEventLoopAdaptor&) = delete;
  ~AsyncEventLoopAdaptor();

  /// Runs every call queued before this call started, in queue order, on the
  /// calling thread; called from inside such a call, first runs the calls the
  /// outer run has not reached. When a call throws, the calls after it stay
  /// queued (at the front, in order), the wakeup handler is called for them,
  /// and the exception propagates; putting them back takes no storage. The
  /// next run joins them with newer calls before it runs any, and throws
  /// std::bad_alloc, with all of them still queued, when it cannot.
  void RunPendingCalls();

  /// Returns true at once when calls are queued; otherwise blocks until one
  /// is queued (true) or inTimeoutMilliseconds have passed (false); -1 waits
  /// without limit.
  bool WaitForPendingCalls(int inTimeoutMilliseconds);

  /// Installs the process's one wakeup handler, replacing any other: called
  /// on the queuing thread when a call is queued into an empty batch (see
  /// Wakeups above), so that a host event loop can schedule RunPendingCalls.
  /// Called at once, on this thread, when calls are already queued. inOwner
  /// tags the handler for RemoveWakeupHandler. An empty handler removes it.
  /// @{
  void SetWakeupHandler(std::function<void()> inHandler);
  void SetWakeupHandler(std::function<void()> inHandler, const void* inOwner);
  /// @}

  /// Removes the wakeup handler only if it is the one installed with
  /// inOwner, so that an integration going away leaves alone the handler of
  /// one that replaced it. Returns whether it removed it. A handler call
  /// already under way on another thread may still finish after this returns.
  bool RemoveWakeupHandler(const void* inOwner);

  /// Number of calls queued and not yet taken by RunPendingCalls.
  std::size_t PendingCallCount() const;

private:
  friend KIVCORE_API boost::shared_ptr<AsyncEventLoopAdaptor> RegisterCurrentThreadAsMainThread();
  AsyncEventLoopAdaptor() = default;
};

/// Makes the calling thread the main thread and returns the adaptor that keeps
/// it so. A main thread registered earlier and still held is replaced by the
/// caller; all holders share one adaptor.
KIVCORE_API boost::shared_ptr<AsyncEventLoopAdaptor> RegisterCurrentThreadAsMainThread();

/// The registered main thread's adaptor, or empty when none is registered.
KIVCORE_API boost::shared_ptr<AsyncEventLoopAdaptor> GetRegisteredMainThread();

/// True only on the registered main thread. One atomic load and a comparison.
KIVCORE_API bool CurrentThreadIsMainThread() noexcept;

/// Queues a copy of inCall to run once on the main thread. inFlags is
/// reserved (pass 0). Returns true when the call was queued.
KIVCORE_API bool AsyncCallFromMainThread(const boost::function<void()>& inCall, unsigned int inFlags);
/// As above, moving inCall into the queue instead of copying it (one
/// reference-count round trip less for a call that owns shared state).
KIVCORE_API bool AsyncCallFromMainThread(boost::function<void()>&& inCall, unsigned int inFlags);

}  // namespace kivcore::threads
