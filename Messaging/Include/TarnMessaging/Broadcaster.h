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
/// thread. RemoveListener on a thread other than the main thread blocks until
/// a delivery to that listener running on the main thread has returned, so a
/// listener may be destroyed right after its removal; on the main thread it
/// never blocks. The broadcaster's lock is never held while a handler runs or
/// while a remover waits. A broadcaster must not be destroyed while a
/// broadcast on it runs or a remover waits on it.
///
/// Misuse (a null or expired listener) is reported through the contract-check
/// procedure; when the report returns, the call goes on harmlessly.
#pragma once

#include <TarnMessaging/Export.h>
#include <TarnMessaging/Listener.h>
#include <TarnMessaging/SafeListener.h>

#include <kivcore/Gate.h>
#include <kivcore/RecursiveMutex.h>
#include <kivcore/SmallBlockAllocator.h>

#include <boost/shared_ptr.hpp>
#include <boost/weak_ptr.hpp>

#include <atomic>
#include <cstdint>
#include <map>
#include <memory>
#include <utility>
#include <vector>

namespace Tarn {

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
  /// Lexicographic over the plain pointer and the owners of the three others.
  bool operator<(const ListenerEntry& inOther) const noexcept;
  /// Whether the listener can still be reached: a plain pointer always; a
  /// safe listener that resolves; a weak pointer that locks.
  bool IsLive() const;
};

/// A registry of listeners and the synchronous broadcast that reaches them,
/// newest first. Holds listeners without owning them: by plain pointer (with a
/// back-link), by weak pointer, or by a safe listener's weak reference.
/// Broadcasts deliver only on the main thread; every other operation may be
/// called from any thread, and a removal off the main thread waits for a
/// delivery to that listener in progress on the main thread.
class TARN_MESSAGING_API Broadcaster {
public:
  /// An empty registry, broadcasting.
  Broadcaster();
  /// A new, empty registry; only the broadcasting state is copied.
  Broadcaster(const Broadcaster& inOther);
  Broadcaster& operator=(const Broadcaster&) = delete;
  /// Drops the back-links of plain-pointer listeners; tells no weak or safe
  /// listener. Takes no lock and waits for nothing.
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
  /// back-links (only a listener's own destructor passes false). Blocks off
  /// the main thread while the main thread delivers to that listener.
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
  template <class T>
  using Alloc = kivcore::utility::SmallBlockAllocator::STLAllocator<T>;
  struct GateRecord {
    boost::shared_ptr<kivcore::threads::Gate> mGate;
    std::int32_t mCount;  // deliveries to the removed entry still running
  };
  // Stored oldest first, so that adding the newest entry is an append and
  // reading position p (0 = newest) is one subtraction: index size-1-p.
  using EntryQueue = std::vector<ListenerEntry, Alloc<ListenerEntry>>;
  using GateMap = std::map<ListenerEntry, GateRecord, std::less<ListenerEntry>,
                           Alloc<std::pair<const ListenerEntry, GateRecord>>>;
  using CursorVector = std::vector<std::int32_t, Alloc<std::int32_t>>;
  // What one running broadcast is delivering right now, beside its cursor.
  struct DeliverySlot {
    const ListenerEntry* mEntry;  // the broadcast's copy of the entry it serves; null between deliveries
    bool mCounted;                // a waiting remover counts this delivery in its gate record
  };
  using DeliveryVector = std::vector<DeliverySlot, Alloc<DeliverySlot>>;

  struct BroadcastMessageRecord;
  TARN_MESSAGING_LOCAL static int DeliverToListener(const BroadcastMessageRecord& inRecord);

  // Inserts inEntry at the front unless an equal entry exists; true when
  // inserted.
  TARN_MESSAGING_LOCAL bool AddEntry(const ListenerEntry& inEntry);
  // The one removal path (also used to prune dead entries). A non-null
  // inUnlink drops this broadcaster from that listener's back-links once the
  // entry is out and before any wait, while a running delivery still keeps
  // the listener in existence.
  TARN_MESSAGING_LOCAL void RemoveEntry(const ListenerEntry& inListener, Listener* inUnlink = nullptr);
  // Linear search from the front (newest); the position, or -1 when absent.
  // mMutex must be held.
  TARN_MESSAGING_LOCAL std::int32_t FindEntry(const ListenerEntry& inEntry) const noexcept;
  // The entry at a position counted from the front. mMutex must be held.
  const ListenerEntry& EntryAt(std::int32_t inPosition) const noexcept {
    return mListeners[mListeners.size() - 1 - static_cast<std::size_t>(inPosition)];
  }
  std::int32_t EntryCount() const noexcept { return static_cast<std::int32_t>(mListeners.size()); }

  kivcore::threads::RecursiveMutex mMutex;
  EntryQueue mListeners;           // guarded by mMutex; position 0 (the front) = newest
  GateMap mGateMap;                // guarded by mMutex; removals waiting on a delivery
  CursorVector mBroadcastCursors;  // guarded by mMutex; one per running broadcast, outermost first
  DeliveryVector mDeliveries;      // guarded by mMutex; parallel to mBroadcastCursors
  std::atomic<bool> mBroadcasting{true};  // unguarded; read by the main thread
};

}  // namespace Tarn
