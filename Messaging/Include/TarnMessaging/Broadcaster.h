/// @file
/// Tarn::Broadcaster: a registry of listeners and the synchronous broadcast
/// that reaches them.
///
/// @code{.cpp}
///   Tarn::Broadcaster broadcaster;
///   broadcaster.AddListener(&statusLine);              // plain pointer
///   broadcaster.AddListener(std::weak_ptr<Tarn::Listener>(shared));
///   broadcaster.BroadcastMessage(Progress(3, 10));     // main thread only
///   broadcaster.RemoveListener(&statusLine, true);
/// @endcode
///
/// A listener is held in one of four ways, none of which owns it: a plain
/// Listener* (the listener keeps a back-link and detaches itself when
/// destroyed), a boost::weak_ptr or std::weak_ptr (kept alive by the
/// broadcast for its own delivery; pruned by the next broadcast once dead),
/// or a counted ISafeListener (held by its weak reference, SafeListener.h).
///
/// Delivery: BroadcastMessage delivers only on the main thread and only while
/// broadcasting is on, to every registered listener, newest first. A handler
/// may add listeners (not served by the running broadcast, served first by the
/// next), remove any listener including itself (a removed listener not yet
/// served is not called), and broadcast again on the same broadcaster (the
/// nested broadcast serves everyone; the outer one then serves each remaining
/// listener exactly once). An exception from a handler goes to the error
/// manager's GuardedCall and the broadcast goes on with the next listener.
///
/// Threading: every operation except BroadcastMessage may be called from any
/// thread. A removal returns only when no delivery of that listener runs on
/// another thread: it blocks until such a delivery has returned, so the
/// listener may be destroyed right after. It never waits for a delivery on
/// its own thread (a handler removing itself, even after its thread stopped
/// being the main thread) and allocates nothing, so destructors may remove.
/// The broadcaster's lock is never held while a handler runs or while a
/// remover waits.
///
/// Lifetime: the registry lives in a shared core; plain-pointer listeners
/// hold weak links to it. So a broadcaster and a listener may be destroyed at
/// the same time on two threads: ~Broadcaster only closes the core and calls
/// no listener, ~Listener detaches from the cores still open. A broadcaster
/// destroyed by a handler of its own broadcast leaves that broadcast to end
/// on the closed core; a remover waiting on it keeps the core alive. Both are
/// misuse all the same (a derived broadcaster's own members are gone while
/// its broadcast or removal still runs): debug builds report them through the
/// contract check, run inside the error manager's GuardedCall since a
/// destructor cannot throw. Release builds add nothing to the destructor.
///
/// Diagnostics (Tracing.h): a broadcast reads one flag to learn whether a
/// delivery tracer or the removal-wait report is on; a removal that has
/// waited past the removal-wait threshold reports once and goes on waiting.
///
/// Misuse (a null or expired listener) is reported through the contract-check
/// procedure; when the report returns, the call goes on harmlessly.
#pragma once

#include <TarnMessaging/Export.h>
#include <TarnMessaging/Listener.h>
#include <TarnMessaging/SafeListener.h>

#include <boost/shared_ptr.hpp>
#include <boost/weak_ptr.hpp>

#include <atomic>
#include <memory>

namespace Tarn {

class BroadcasterCore;
class Message;

/// One registration. Exactly one field is set.
struct TARN_MESSAGING_API ListenerEntry {
  Listener* mListener = nullptr;                   ///< a listener held by plain pointer
  boost::shared_ptr<WeakReference> mSafeListener;  ///< a safe listener's weak-reference block
  boost::weak_ptr<Listener> mBoostWeakListener;    ///< a listener held by boost::weak_ptr
  std::weak_ptr<Listener> mStdWeakListener;        ///< a listener held by std::weak_ptr

  /// Same plain pointer, same weak-reference block, and owner-equivalent weak
  /// pointers: any weak pointer sharing ownership with the registered one
  /// denotes the same registration.
  /// @{
  bool operator==(const ListenerEntry& inOther) const noexcept;
  bool operator!=(const ListenerEntry& inOther) const noexcept { return !(*this == inOther); }
  /// @}
  /// Whether the listener can still be reached: a plain pointer always; a
  /// safe listener that resolves; a weak pointer that locks.
  bool IsLive() const;
};

/// A registry of listeners and the synchronous broadcast that reaches them,
/// newest first. Holds listeners without owning them: by plain pointer (with a
/// back-link), by weak pointer, or by a safe listener's weak reference.
/// Broadcasts deliver only on the main thread; every other operation may be
/// called from any thread, and a removal waits for a delivery to that
/// listener in progress on another thread.
class TARN_MESSAGING_API Broadcaster {
public:
  /// An empty registry, broadcasting.
  Broadcaster();
  /// A new, empty registry; only the broadcasting state is copied.
  Broadcaster(const Broadcaster& inOther);
  Broadcaster& operator=(const Broadcaster&) = delete;
  /// Closes the core: plain-pointer listeners lose their back-links, weak and
  /// safe ones are not told. Calls no listener and waits for nothing. Debug
  /// builds report a broadcast still running on it or a removal still
  /// waiting on it (see Lifetime above).
  virtual ~Broadcaster();

  /// Delivers inMessage, by reference, to every listener (see above). Does
  /// nothing off the main thread or while broadcasting is stopped.
  virtual void BroadcastMessage(const Message& inMessage);

  /// Registers a listener; registering one already registered does nothing.
  /// Preconditions: inListener != NULL; for a safe listener also
  /// IWeakReferenceCapableRef(inListener) != NULL; for weak pointers
  /// inListener.lock() != NULL.
  /// @{
  void AddListener(Listener* inListener);
  void AddListener(InterfaceRef<ISafeListener> inListener);
  void AddListener(const boost::weak_ptr<Listener>& inListener);
  void AddListener(const std::weak_ptr<Listener>& inListener);
  /// @}

  /// Removes a registration; one that is not registered is ignored. With
  /// inUpdateListener the broadcaster also drops itself from the listener's
  /// back-links (only a listener's own destructor passes false). Blocks while
  /// another thread delivers to that listener; allocates nothing.
  /// Preconditions as for AddListener (inListener != NULL,
  /// inListener.lock() != NULL).
  /// @{
  void RemoveListener(Listener* inListener, bool inUpdateListener);
  void RemoveListener(InterfaceRef<ISafeListener> inListener);
  void RemoveListener(const boost::weak_ptr<Listener>& inListener);
  void RemoveListener(const std::weak_ptr<Listener>& inListener);
  /// @}

  /// Whether inListener is registered by plain pointer (a weak registration
  /// of the same object is not found). Precondition: inListener.
  bool HasListener(Listener* inListener);
  /// Whether any registration exists, dead weak ones not yet pruned included.
  bool HasListeners();

  /// Broadcasts are delivered only while broadcasting is on (the default);
  /// messages broadcast while it is off are dropped, not kept.
  /// @{
  void StartBroadcasting() noexcept { mBroadcasting.store(true, std::memory_order_relaxed); }
  void StopBroadcasting() noexcept { mBroadcasting.store(false, std::memory_order_relaxed); }
  bool IsBroadcasting() const noexcept { return mBroadcasting.load(std::memory_order_relaxed); }
  /// @}

private:
  friend class BroadcasterCore;
  friend class Registration;  // holds mCore weakly, to detach safely after this is gone
  struct BroadcastMessageRecord;
  TARN_MESSAGING_LOCAL static int DeliverToListener(const BroadcastMessageRecord& inRecord);

  // The registry, the running broadcasts and the waiting removals. Shared so
  // that listeners can hold weak links to it: a listener destroyed while this
  // broadcaster is destroyed on another thread finds the core closed instead
  // of freed memory. Set at construction, never changed.
  std::shared_ptr<BroadcasterCore> mCore;
  std::atomic<bool> mBroadcasting{true};  // unguarded; read by the main thread
};

}  // namespace Tarn
