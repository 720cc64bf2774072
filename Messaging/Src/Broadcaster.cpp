#include <TarnMessaging/Broadcaster.h>
#include <TarnMessaging/Message.h>

#include "ContractCheck.h"

#include <kivcore/Error.h>
#include <kivcore/MainThread.h>

#include <boost/bind/bind.hpp>
#include <boost/function.hpp>
#include <boost/make_shared.hpp>

#include <cstdint>
#include <functional>
#include <limits>
#include <new>

namespace Tarn {

using kivcore::threads::Gate;
using kivcore::threads::RecursiveMutex;

namespace {

constexpr const char* kAddListenerName = "Tarn::Broadcaster::AddListener";
constexpr const char* kRemoveListenerName = "Tarn::Broadcaster::RemoveListener";
constexpr const char* kHasListenerName = "Tarn::Broadcaster::HasListener";

template <class WeakPtr>
bool OwnerEquivalent(const WeakPtr& inA, const WeakPtr& inB) noexcept {
  return !inA.owner_before(inB) && !inB.owner_before(inA);
}

// Unlocks on every way out of a locked region, exceptions included.
class Unlocker {
public:
  explicit Unlocker(RecursiveMutex& inMutex) noexcept : mMutex(&inMutex) {}
  ~Unlocker() { Release(); }
  void Release() noexcept {
    if (mMutex != nullptr) mMutex->Unlock();
    mMutex = nullptr;
  }
  Unlocker(const Unlocker&) = delete;
  Unlocker& operator=(const Unlocker&) = delete;

private:
  RecursiveMutex* mMutex;
};

}  // namespace

// ---------------------------------------------------------------------------
// ListenerEntry

bool ListenerEntry::operator==(const ListenerEntry& inOther) const noexcept {
  return mListener == inOther.mListener && mSafeListener.get() == inOther.mSafeListener.get() &&
         OwnerEquivalent(mBoostWeakListener, inOther.mBoostWeakListener) &&
         OwnerEquivalent(mStdWeakListener, inOther.mStdWeakListener);
}

bool ListenerEntry::operator<(const ListenerEntry& inOther) const noexcept {
  const auto listener = reinterpret_cast<std::uintptr_t>(mListener);
  const auto otherListener = reinterpret_cast<std::uintptr_t>(inOther.mListener);
  if (listener != otherListener) return listener < otherListener;
  if (mSafeListener.owner_before(inOther.mSafeListener)) return true;
  if (inOther.mSafeListener.owner_before(mSafeListener)) return false;
  if (mBoostWeakListener.owner_before(inOther.mBoostWeakListener)) return true;
  if (inOther.mBoostWeakListener.owner_before(mBoostWeakListener)) return false;
  return mStdWeakListener.owner_before(inOther.mStdWeakListener);
}

bool ListenerEntry::IsLive() const {
  if (mListener != nullptr) return true;
  // The temporary references are dropped at once; if they were the last, the
  // listener goes away here.
  if (mSafeListener && ResolveSafeListener(mSafeListener) != nullptr) return true;
  if (!mBoostWeakListener.expired() && mBoostWeakListener.lock()) return true;
  if (!mStdWeakListener.expired() && mStdWeakListener.lock()) return true;
  return false;
}

// ---------------------------------------------------------------------------
// Construction and destruction

struct Broadcaster::BroadcastMessageRecord {
  const ListenerEntry& mEntry;
  const Message& mMessage;
};

Broadcaster::Broadcaster() = default;

Broadcaster::Broadcaster(const Broadcaster& inOther) : mBroadcasting(inOther.IsBroadcasting()) {}

Broadcaster::~Broadcaster() {
  for (const ListenerEntry& entry : mListeners) {
    if (entry.mListener != nullptr) entry.mListener->ForgetBroadcaster(this);
  }
}

// ---------------------------------------------------------------------------
// Registry

std::int32_t Broadcaster::FindEntry(const ListenerEntry& inEntry) const noexcept {
  const std::int32_t count = EntryCount();
  if (inEntry.mListener != nullptr) {
    // Every entry has one field set, so an entry holding this pointer is a
    // plain one and equal to the probe: the pointer alone decides.
    for (std::int32_t position = 0; position < count; ++position) {
      if (EntryAt(position).mListener == inEntry.mListener) return position;
    }
    return -1;
  }
  for (std::int32_t position = 0; position < count; ++position) {
    if (EntryAt(position) == inEntry) return position;
  }
  return -1;
}

bool Broadcaster::AddEntry(const ListenerEntry& inEntry) {
  mMutex.Lock("Broadcaster::AddListener");
  Unlocker unlock(mMutex);
  {
    mMutex.Lock("Broadcaster::HasListener");
    Unlocker unlockSearch(mMutex);
    if (FindEntry(inEntry) >= 0) return false;
  }
  // Positions are 32-bit; a registry that could not be indexed counts as
  // exhausted storage.
  if (mListeners.size() >= static_cast<std::size_t>(std::numeric_limits<std::int32_t>::max())) throw std::bad_alloc();
  mListeners.push_back(inEntry);  // the new front
  // The new entry lies in front of every running broadcast's cursor: each
  // cursor moves with the entry it stands on, and none of those broadcasts
  // will serve the newcomer.
  for (std::int32_t& cursor : mBroadcastCursors) ++cursor;
  return true;
}

void Broadcaster::AddListener(Listener* inListener) {
  TARN_CONTRACT_CHECK(inListener != NULL, kAddListenerName);
  if (inListener == nullptr) return;  // nothing to register and no back-link to make
  ListenerEntry entry;
  entry.mListener = inListener;
  if (!AddEntry(entry)) return;
  try {
    inListener->AddBroadcaster(this);
  } catch (...) {
    // Without its back-link the listener could not detach itself when it
    // dies; take the registration back.
    RemoveEntry(entry);
    throw;
  }
}

void Broadcaster::AddListener(InterfaceRef<ISafeListener> inListener) {
  TARN_CONTRACT_CHECK(inListener != NULL, kAddListenerName);
  if (inListener != nullptr) {
    TARN_CONTRACT_CHECK(IWeakReferenceCapableRef(inListener) != NULL, kAddListenerName);
  }
  ListenerEntry entry;
  entry.mSafeListener = GetSafeListenerHandle(inListener);
  AddEntry(entry);
}

void Broadcaster::AddListener(const boost::weak_ptr<Listener>& inListener) {
  TARN_CONTRACT_CHECK(inListener.lock() != NULL, kAddListenerName);
  ListenerEntry entry;
  entry.mBoostWeakListener = inListener;
  AddEntry(entry);
}

void Broadcaster::AddListener(const std::weak_ptr<Listener>& inListener) {
  TARN_CONTRACT_CHECK(inListener.lock() != NULL, kAddListenerName);
  ListenerEntry entry;
  entry.mStdWeakListener = inListener;
  AddEntry(entry);
}

void Broadcaster::RemoveListener(Listener* inListener, bool inUpdateListener) {
  TARN_CONTRACT_CHECK(inListener != NULL, kRemoveListenerName);
  if (inListener == nullptr) return;  // never follow a null pointer
  ListenerEntry entry;
  entry.mListener = inListener;
  RemoveEntry(entry, inUpdateListener ? inListener : nullptr);
}

void Broadcaster::RemoveListener(InterfaceRef<ISafeListener> inListener) {
  TARN_CONTRACT_CHECK(inListener != NULL, kRemoveListenerName);
  ListenerEntry entry;
  entry.mSafeListener = GetSafeListenerHandle(inListener);
  RemoveEntry(entry);
}

void Broadcaster::RemoveListener(const boost::weak_ptr<Listener>& inListener) {
  TARN_CONTRACT_CHECK(inListener.lock() != NULL, kRemoveListenerName);
  ListenerEntry entry;
  entry.mBoostWeakListener = inListener;
  RemoveEntry(entry);
}

void Broadcaster::RemoveListener(const std::weak_ptr<Listener>& inListener) {
  TARN_CONTRACT_CHECK(inListener.lock() != NULL, kRemoveListenerName);
  ListenerEntry entry;
  entry.mStdWeakListener = inListener;
  RemoveEntry(entry);
}

void Broadcaster::RemoveEntry(const ListenerEntry& inListener, Listener* inUnlink) {
  boost::shared_ptr<Gate> gate;
  bool ownsGateRecord = false;
  ListenerEntry gateKey;

  mMutex.Lock("Broadcaster::RemoveListener1");
  Unlocker unlock(mMutex);

  const std::int32_t position = FindEntry(inListener);
  if (position >= 0) {
    TARN_CONTRACT_CHECK(mGateMap.find(inListener) == mGateMap.end(), kRemoveListenerName);
  }

  // A removal on another thread must not return while a delivery to this
  // listener runs on the main thread: the caller may destroy the listener
  // next. Deliveries are found by what each running broadcast is serving, not
  // only by where its cursor stands, so that this also holds when the entry
  // is already gone (a handler removed itself, or an earlier remover took it
  // out and still waits). The main thread never waits: its deliveries in
  // progress are on its own stack.
  if (!kivcore::threads::CurrentThreadIsMainThread()) {
    std::int32_t uncounted = 0;
    for (const DeliverySlot& slot : mDeliveries) {
      if (slot.mEntry != nullptr && !slot.mCounted && *slot.mEntry == inListener) ++uncounted;
    }
    auto existing = mGateMap.find(inListener);
    if (existing != mGateMap.end() && !existing->second.mGate->IsOpen()) {
      // An earlier removal still waits: share its gate, and let it also wait
      // for the deliveries it did not count.
      gate = existing->second.mGate;
      existing->second.mCount += uncounted;
    } else if (uncounted > 0) {
      // Made (and possibly failing) before anything changes, so that an
      // exhausted allocator leaves the registry as it was.
      gate = boost::allocate_shared<Gate>(kivcore::utility::SmallBlockAllocator::STLAllocator<Gate>(), false);
      gateKey = position >= 0 ? EntryAt(position) : inListener;
      if (existing != mGateMap.end()) {
        // The earlier remover's gate is open and it is about to leave; it
        // erases the record only while the record still holds its gate.
        existing->second = GateRecord{gate, uncounted};
      } else {
        mGateMap.emplace(gateKey, GateRecord{gate, uncounted});
      }
      ownsGateRecord = true;
    }
    if (gate) {
      for (DeliverySlot& slot : mDeliveries) {
        if (slot.mEntry != nullptr && *slot.mEntry == inListener) slot.mCounted = true;
      }
    }
  }

  if (position >= 0) {
    // A cursor on the removed entry steps back to the entry before it, so its
    // broadcast goes on with the entry that followed the removed one; cursors
    // beyond it step back with the entries they stand on.
    for (std::int32_t& cursor : mBroadcastCursors) {
      if (cursor >= position) --cursor;
    }
    mListeners.erase(mListeners.end() - 1 - position);
  }
  unlock.Release();
  // Whether or not an entry was removed; after the wait the listener may
  // already be gone (its owner may destroy it as soon as no delivery runs).
  if (inUnlink != nullptr) inUnlink->RemoveBroadcaster(this);

  if (!gate) return;
  gate->PassThrough(-1);
  if (!ownsGateRecord) return;
  mMutex.Lock("Broadcaster::RemoveListener2");
  Unlocker unlockCleanup(mMutex);
  const auto record = mGateMap.find(gateKey);
  if (record != mGateMap.end() && record->second.mGate == gate) mGateMap.erase(record);
}

bool Broadcaster::HasListener(Listener* inListener) {
  TARN_CONTRACT_CHECK(inListener, kHasListenerName);
  ListenerEntry entry;
  entry.mListener = inListener;
  mMutex.Lock("Broadcaster::HasListener");
  Unlocker unlock(mMutex);
  return FindEntry(entry) >= 0;
}

bool Broadcaster::HasListeners() {
  mMutex.Lock("Broadcaster::HasListener");
  Unlocker unlock(mMutex);
  return !mListeners.empty();
}

// ---------------------------------------------------------------------------
// Delivery

int Broadcaster::DeliverToListener(const BroadcastMessageRecord& inRecord) {
  const ListenerEntry& entry = inRecord.mEntry;
  // An entry has one field set; the strong references taken below keep a
  // weakly held listener alive for its own delivery.
  if (entry.mListener != nullptr) {
    if (entry.mListener->IsListening()) entry.mListener->ProcessMessage(inRecord.mMessage);
    return 0;
  }
  if (entry.mSafeListener) {
    const ISafeListenerRef listener = ResolveSafeListener(entry.mSafeListener);
    if (listener != nullptr) listener->ListenToMessage(inRecord.mMessage);
    return 0;
  }
  if (const boost::shared_ptr<Listener> listener = entry.mBoostWeakListener.lock()) {
    listener->ProcessMessage(inRecord.mMessage);
    return 0;
  }
  if (const std::shared_ptr<Listener> listener = entry.mStdWeakListener.lock()) {
    listener->ProcessMessage(inRecord.mMessage);
  }
  return 0;
}

void Broadcaster::BroadcastMessage(const Message& inMessage) {
  if (!IsBroadcasting() || !kivcore::threads::CurrentThreadIsMainThread()) return;

  kivcore::config::ErrorManager* const errors = kivcore::config::ErrorManager::Get(false);
  ListenerEntry current;  // the entry being served, then the one served last
  bool currentIsPlain = true;  // `current` has no weak field set
  bool cursorPushed = false;
  // Built once: the record refers to `current`, which each pass refills. The
  // bound call fits inside the boost::function, so nothing is allocated.
  const BroadcastMessageRecord record{current, inMessage};
  const boost::function<int()> delivery(boost::bind(&Broadcaster::DeliverToListener, boost::cref(record)));

  for (;;) {
    mMutex.Lock("Broadcaster::BroadcastMessage1");
    Unlocker unlock(mMutex);
    try {
      if (!cursorPushed) {
        // Room for the delivery slot first, so that neither push can fail
        // after the other succeeded.
        mDeliveries.reserve(mBroadcastCursors.size() + 1);
        mBroadcastCursors.push_back(-1);
        mDeliveries.push_back(DeliverySlot{nullptr, false});
        cursorPushed = true;
      } else {
        // A remover on another thread may be waiting for the delivery just
        // made; this broadcast's share of its count ends here.
        DeliverySlot& slot = mDeliveries.back();
        if (slot.mCounted) {
          const auto waiting = mGateMap.find(current);
          if (waiting != mGateMap.end() && --waiting->second.mCount == 0) waiting->second.mGate->Open();
        }
        slot = DeliverySlot{nullptr, false};
      }
      // The cursor is re-read through back() on every step: a nested broadcast
      // pushes behind it (and may move the vector), and removals shift it.
      std::int32_t cursor = ++mBroadcastCursors.back();
      bool plainCopied = false;
      while (cursor < EntryCount()) {
        const ListenerEntry& atCursor = EntryAt(cursor);
        if (atCursor.mListener != nullptr) {
          // Plain pointers are always live. Copying one into a copy whose weak
          // fields are empty is a pointer store: no reference-count traffic.
          if (currentIsPlain) {
            current.mListener = atCursor.mListener;
          } else {
            current = atCursor;
            currentIsPlain = true;
          }
          plainCopied = true;
          break;
        }
        if (!atCursor.mSafeListener) {
          // A weak pointer is tested with expired(), which takes no reference,
          // so no listener can die here, under the lock. One that dies after
          // the test is not called by its delivery and is pruned next time.
          const bool live = atCursor.mBoostWeakListener.empty() ? !atCursor.mStdWeakListener.expired()
                                                                : !atCursor.mBoostWeakListener.expired();
          if (live) break;
          // Prune as the cursor passes: the removal steps this cursor back one.
          const ListenerEntry dead = atCursor;
          RemoveEntry(dead);
          cursor = ++mBroadcastCursors.back();
          continue;
        }
        // A safe listener is resolved, which takes a reference. Test a copy:
        // dropping the test's reference may destroy the listener, whose
        // destructor may change this registry (and move the cursor with the
        // entry it stands on).
        const ListenerEntry candidate = atCursor;
        if (candidate.IsLive()) {
          cursor = mBroadcastCursors.back();
          if (cursor < EntryCount() && EntryAt(cursor) == candidate) break;
          // The candidate itself was removed meanwhile, which stepped the
          // cursor back onto the entry before it: move on past it.
          cursor = ++mBroadcastCursors.back();
          continue;
        }
        // Prune as the cursor passes: the removal steps this cursor back one.
        RemoveEntry(candidate);
        cursor = ++mBroadcastCursors.back();
      }
      if (cursor >= EntryCount()) {
        mBroadcastCursors.pop_back();
        mDeliveries.pop_back();
        cursorPushed = false;
        // Closing sweep, in the same hold of the lock: once no broadcast of
        // this broadcaster runs any more, no delivery can be in progress, so
        // any remover still waiting is released.
        if (mBroadcastCursors.empty() && !mGateMap.empty()) {
          for (auto& element : mGateMap) {
            if (element.second.mCount != 0) element.second.mGate->Open();
          }
        }
        break;
      }
      if (!plainCopied) {
        current = EntryAt(cursor);
        currentIsPlain = current.mListener != nullptr;
      }
      mDeliveries.back().mEntry = &current;
    } catch (...) {
      if (cursorPushed) {
        mBroadcastCursors.pop_back();
        mDeliveries.pop_back();
      }
      throw;
    }
    unlock.Release();

    // No lock is held while the listener runs.
    errors->GuardedCall(delivery);
  }
}

}  // namespace Tarn
