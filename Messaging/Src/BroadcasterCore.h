// The shared state behind a Tarn::Broadcaster: its registry of listeners, the
// broadcasts running on it and the removals waiting for them.
//
// The broadcaster owns its core through a shared_ptr; listeners held by plain
// pointer keep weak links to it. So a broadcaster and a listener destroyed at
// the same time on two threads never call into each other's freed memory:
// ~Broadcaster only closes the core (dropping the back-links of its listeners
// under the core's lock), and ~Listener locks each link and detaches from the
// cores that still exist. Entries and back-links change together under the
// core's lock; a listener's own list lock is always taken last.
//
// A running broadcast is a Frame on the broadcasting thread's stack, linked
// into the core: {newest serial not yet due, entry being delivered, thread}.
// Entries carry rising serials, so the next entry a broadcast serves is the
// newest one older than the last it served, whatever was added or removed
// meanwhile. A removal erases the entry and then waits on one condition
// variable until no frame on another thread delivers that listener: nothing
// is allocated, and no thread ever waits for its own stack. Nor in a circle:
// once the main thread has moved, two threads may each deliver inside a
// handler, and a removal that would wait for a delivery whose thread waits,
// through any chain of removals, for a delivery on the remover's own stack
// is reported as misuse and returns at once instead.
#pragma once

#include <TarnMessaging/Broadcaster.h>
#include <TarnMessaging/Tracing.h>

#include <kivcore/RecursiveMutex.h>
#include <kivcore/SmallBlockAllocator.h>

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <vector>

namespace Tarn {

class BroadcasterCore {
public:
  // One running broadcast; lives on the broadcasting thread's stack.
  struct Frame {
    std::uint64_t mNextBelow = 0;     // serves entries older than this serial
    std::size_t mPosition = 0;        // where that serial was last seen; a hint
    ListenerEntry mCurrent;           // the entry being delivered (a copy)
    bool mDelivering = false;         // mCurrent is being delivered right now
    std::uintptr_t mThread = 0;       // the broadcasting thread
    Frame* mNext = nullptr;           // the next running broadcast
    // A traced broadcast's broadcaster, station and message type, fixed
    // before the frame is linked; null when untraced.
    const Tracing::Delivery* mTrace = nullptr;
    // The core it runs on, and the broadcasting thread's next outer frame
    // (of any core): the thread's own deliveries, innermost first.
    const BroadcasterCore* mCore = nullptr;
    const Frame* mOuter = nullptr;
  };
  // A removal waiting for deliveries of an equal entry; on the remover's stack.
  struct Waiter {
    const ListenerEntry* mEntry;
    Waiter* mNext;
  };
  // The removals that still wait, with the lookup the misuse check reads.
  struct WaiterList {
    Waiter* mFirst = nullptr;
    const Waiter* find(const ListenerEntry& inEntry) const noexcept;
    const Waiter* end() const noexcept { return nullptr; }
  };
  enum class Wait { kForOtherThreads, kNever };

  // The core of inOwner, from the small-block allocator.
  static std::shared_ptr<BroadcasterCore> Make(Broadcaster* inOwner);
  explicit BroadcasterCore(Broadcaster* inOwner) noexcept : mOwner(inOwner) {}
  BroadcasterCore(const BroadcasterCore&) = delete;
  BroadcasterCore& operator=(const BroadcasterCore&) = delete;

  // Inserts inEntry as the newest unless an equal one exists. For a plain
  // listener the back-link is recorded in the same hold of the lock. True
  // when inserted.
  bool Add(const ListenerEntry& inEntry);
  // Erases an equal entry, if any. inUnlink (a plain listener) also loses its
  // back-link to this core, whether or not an entry was found. With
  // kForOtherThreads, returns only once no other thread delivers to an equal
  // entry. Allocates nothing, so destructors may call it (without inCheck it
  // throws nothing).
  // inCheck runs the misuse check of a public removal (a second removal of
  // an equal entry while an earlier one still waits); it reports with the
  // core's lock let go, and may throw.
  // Returns kWaited when a delivery on another thread had to end first.
  enum class Removed { kAtOnce, kWaited };
  Removed Remove(const ListenerEntry& inListener, Listener* inUnlink, Wait inWait, bool inCheck);
  bool Contains(const ListenerEntry& inEntry);
  bool IsEmpty();
  // The broadcast itself; see Broadcaster::BroadcastMessage. The traced
  // one also tells the tracer and publishes each delivery (Tracing.h).
  void Broadcast(const Message& inMessage);
  void BroadcastTraced(const Message& inMessage, const Broadcaster& inOwner);
  // The owner is being destroyed: plain listeners lose their back-links and
  // every registration goes. Waits for nothing. In debug builds, reports a
  // broadcast still running on the core or a removal still waiting on it.
  void Close() noexcept;
  // The registrations of inBroadcaster, dead weak ones not yet pruned
  // included, for the registry's snapshot. Takes the core's lock.
  static std::size_t CountListeners(Broadcaster& inBroadcaster);
  // Detaches ioListener from every core that holds it by plain pointer.
  // inWhole is false from ~Listener, once the derived part is gone: debug
  // builds then report a delivery that was still running on another thread.
  static void DetachListener(Listener& ioListener, bool inWhole) noexcept;

private:
  template <class T>
  using Alloc = kivcore::utility::SmallBlockAllocator::STLAllocator<T>;
  struct StoredEntry {
    ListenerEntry mEntry;
    std::uint64_t mSerial;
  };
  using EntryVector = std::vector<StoredEntry, Alloc<StoredEntry>>;
  // Orders registrations by identity, agreeing with ListenerEntry's equality:
  // the plain pointer, then the safe listener's block, then the weak
  // pointers' owners.
  struct IdentityOrder {
    bool operator()(const ListenerEntry& inA, const ListenerEntry& inB) const noexcept;
  };
  // Each registration's serial, found by identity.
  using EntryIndex = std::map<ListenerEntry, std::uint64_t, IdentityOrder,
                              Alloc<std::pair<const ListenerEntry, std::uint64_t>>>;

  // The position in mEntries of an equal entry, or -1. mMutex must be held.
  std::ptrdiff_t Find(const ListenerEntry& inEntry) const noexcept;
  // The position of the entry with inSerial, or of the first newer one.
  std::size_t PositionOf(std::uint64_t inSerial) const noexcept;
  bool OtherThreadDelivers(const ListenerEntry& inEntry, std::uintptr_t inSelf) const noexcept;
  // The walk of a broadcast; Policy is untraced (does nothing) or traced.
  template <class Policy>
  void Walk(const Message& inMessage, Policy& ioPolicy);
  // The removal-wait report of a remover that has waited inWaited for
  // another thread's delivery of inEntry. mMutex must be held; it is let go
  // while the report runs and held again on return.
  void ReportWait(const ListenerEntry& inEntry, std::uintptr_t inSelf, std::chrono::milliseconds inWaited) noexcept;
  // Ends a frame's delivery and wakes waiting removers. mMutex must be held.
  void EndDelivery(Frame& ioFrame) noexcept;
  void Unlink(Frame& ioFrame) noexcept;

  // A weak link to this core, set once by Make: every back-link is a copy
  // of it, and removals compare with it, so attaching and detaching take no
  // reference count of their own beyond the back-link's.
  std::weak_ptr<BroadcasterCore> mSelf;
  kivcore::threads::RecursiveMutex mMutex;
  Broadcaster* mOwner;                // guarded by mMutex; null once closed
  EntryVector mEntries;               // guarded by mMutex; oldest first, serials rising
  EntryIndex mIndex;                  // guarded by mMutex; exactly the entries of mEntries
  std::uint64_t mNextSerial = 1;      // guarded by mMutex
  Frame* mFrames = nullptr;           // guarded by mMutex
  WaiterList mGateMap;                // guarded by mMutex; removals still waiting
  // Removers sleep on these; a delivery that ends bumps the generation.
  // Taken inside mMutex, never the other way round.
  std::mutex mWakeMutex;
  std::condition_variable mDeliveryEnded;   // waited on with mWakeMutex
  std::uint64_t mWakeGeneration = 0;        // guarded by mWakeMutex
};

}  // namespace Tarn
