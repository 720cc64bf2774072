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
///
/// Bound: none. A call queued while the main thread does not run its calls
/// (a host loop that has stopped calling RunPendingCalls, or no main thread
/// registered) stays queued, with everything it holds, until a run takes it;
/// a million queued posts of a small message take 90 MiB or more. When a
/// queued call makes the queue longer than the high-water mark (see
/// SetPendingCallHighWaterMark), the queue is reported once, through
/// ThrowError with the key kPendingCallHighWaterKey followed by a text that
/// gives the count and what is queued (the census a library installs with
/// SetPendingCallCensus; TarnMessaging's counts posts by station and message
/// type). The report runs on the queuing thread, outside every lock of the
/// queue, inside the error manager's GuardedCall; the next one comes only once
/// a run has taken a queue of at most half the mark. The count itself costs a
/// queued call one comparison; the census walks the queue once, under the
/// queue's lock, when the report is made.
///
/// Storage: a run that takes a burst (storage for more than four times what
/// recent runs took, and than kKeptCallStorage calls) and leaves the queue
/// drained (under a quarter of what it took) gives the burst's storage back,
/// and the small-block chunks left wholly free (see
/// SmallBlockAllocator::ReleaseFreeChunks), so a burst's memory goes back once
/// the burst has been run. A steady stream keeps the storage it needs.
#pragma once

#include <kivcore/Export.h>

#include <boost/function.hpp>
#include <boost/shared_ptr.hpp>

#include <cstddef>
#include <functional>
#include <string>

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

  /// Installs a wakeup handler on top of those installed before: the newest
  /// one is called when a call is queued into an empty batch (see Wakeups
  /// above), on the queuing thread, so that a host event loop can schedule
  /// RunPendingCalls. Called at once, on this thread, when calls are already
  /// queued. inOwner tags the handler: a handler installed before with the
  /// same tag is removed, and an empty handler only removes it.
  /// @{
  void SetWakeupHandler(std::function<void()> inHandler);
  void SetWakeupHandler(std::function<void()> inHandler, const void* inOwner);
  /// @}

  /// Removes the wakeup handler installed with inOwner, wherever it is among
  /// the installed ones. Removing the newest hands the wakeups back to the
  /// newest one left, which is called at once when calls are queued: an
  /// integration going away leaves an older one still running woken, and one
  /// that replaced it alone. Returns whether inOwner had a handler. A handler
  /// call already under way on another thread may still finish after this
  /// returns.
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

/// The high-water mark until one is set: 1,048,576 queued calls.
constexpr std::size_t kDefaultPendingCallHighWaterMark = std::size_t{1} << 20;
/// The key of the high-water report; the text follows the '='.
constexpr const char* kPendingCallHighWaterKey = "$$$/kivcore/MainThread/PendingCallHighWater=";
/// Queue storage, in calls, that a run keeps for the next ones in any case.
constexpr std::size_t kKeptCallStorage = 4096;

/// Sets the number of queued calls past which the queue is reported (0: never)
/// and returns the previous mark. The report is armed again at once. Any
/// thread.
KIVCORE_API std::size_t SetPendingCallHighWaterMark(std::size_t inMark) noexcept;

/// Says what inCount queued calls from inCalls are, for the high-water
/// report. Called under the queue's lock: it must not queue calls, take a
/// lock the queue's users may hold, or call host code. It may throw (the
/// report then gives the count alone).
using PendingCallCensus = std::string (*)(const boost::function<void()>* inCalls, std::size_t inCount);
/// Installs the census of the high-water report (null: the count alone) and
/// returns the previous one. For a library that queues calls; any thread.
KIVCORE_API PendingCallCensus SetPendingCallCensus(PendingCallCensus inCensus) noexcept;

/// True only on the registered main thread. One atomic load and a comparison.
KIVCORE_API bool CurrentThreadIsMainThread() noexcept;

/// Queues a copy of inCall to run once on the main thread. inFlags is
/// reserved (pass 0). Returns true when the call was queued.
KIVCORE_API bool AsyncCallFromMainThread(const boost::function<void()>& inCall, unsigned int inFlags);
/// As above, moving inCall into the queue instead of copying it (one
/// reference-count round trip less for a call that owns shared state).
KIVCORE_API bool AsyncCallFromMainThread(boost::function<void()>&& inCall, unsigned int inFlags);

}  // namespace kivcore::threads
