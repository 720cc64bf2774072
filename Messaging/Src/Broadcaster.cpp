#include <TarnMessaging/Broadcaster.h>
#include <TarnMessaging/Message.h>

#include <TarnMessaging/Station.h>

#include "BroadcasterCore.h"
#include "ContractCheck.h"
#include "DiagnosticReports.h"
#include "TracingState.h"

#include <kivcore/Error.h>
#include <kivcore/MainThread.h>

#include <boost/function.hpp>
#include <boost/make_shared.hpp>
#include <boost/ref.hpp>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <exception>
#include <functional>
#include <limits>
#include <mutex>
#include <new>
#include <string>
#include <thread>
#include <type_traits>
#include <typeinfo>

namespace Tarn {

using kivcore::threads::RecursiveMutex;

namespace {

constexpr const char* kAddListenerName = "Tarn::Broadcaster::AddListener";
constexpr const char* kRemoveListenerName = "Tarn::Broadcaster::RemoveListener";
constexpr const char* kHasListenerName = "Tarn::Broadcaster::HasListener";

template <class WeakPtr>
bool OwnerEquivalent(const WeakPtr& inA, const WeakPtr& inB) noexcept {
  return !inA.owner_before(inB) && !inB.owner_before(inA);
}

template <class WeakPtr>
bool HasOwner(const WeakPtr& inWeak) noexcept {
  return inWeak.owner_before(WeakPtr()) || WeakPtr().owner_before(inWeak);
}

// An entry has exactly one field set.
Tracing::ListenerKind KindOf(const ListenerEntry& inEntry) noexcept {
  if (inEntry.mListener != nullptr) return Tracing::ListenerKind::kPlain;
  if (inEntry.mSafeListener) return Tracing::ListenerKind::kSafe;
  return HasOwner(inEntry.mBoostWeakListener) ? Tracing::ListenerKind::kBoostWeak : Tracing::ListenerKind::kStdWeak;
}

// Holds a core's lock for a scope, exceptions included.
class Locked {
public:
  Locked(RecursiveMutex& inMutex, const char* inLabel) : mMutex(inMutex) { mMutex.Lock(inLabel); }
  ~Locked() { mMutex.Unlock(); }
  Locked(const Locked&) = delete;
  Locked& operator=(const Locked&) = delete;

private:
  RecursiveMutex& mMutex;
};

// The innermost broadcast running on this thread (of any core). Initial-
// exec, as kivcore's allocator cache: one load or store relative to the
// thread pointer, once per broadcast.
thread_local const BroadcasterCore::Frame* tInnermostFrame __attribute__((tls_model("initial-exec"))) = nullptr;

// A removal that waits while deliveries run on its own thread's stack (a
// handler's removal, once another thread delivers too). Only such removals
// can wait for one another in a circle: a thread with no delivery on its
// stack is never waited for. They are listed process-wide while they wait;
// a listed thread is blocked, so its frames stand still and others may read
// them under sWaitsMutex, which is taken inside a core's lock, never the
// other way round.
struct WaitNode {
  const BroadcasterCore* mCore;
  const ListenerEntry* mEntry;
  const BroadcasterCore::Frame* mInnermost;  // the remover's own deliveries
  bool mReached;                             // for WaitsInACircle
  WaitNode* mNext;
};
std::mutex sWaitsMutex;
WaitNode* sWaits = nullptr;  // guarded by sWaitsMutex

bool Delivers(const BroadcasterCore::Frame* inInnermost, const BroadcasterCore* inCore, const ListenerEntry& inEntry) {
  for (const BroadcasterCore::Frame* frame = inInnermost; frame != nullptr; frame = frame->mOuter) {
    if (frame->mDelivering && frame->mCore == inCore && frame->mCurrent == inEntry) return true;
  }
  return false;
}

// Whether ioStart, listed, waits for a delivery whose thread waits, through
// a chain of listed removals, for a delivery on ioStart's own stack: none of
// them would ever return. Every edge runs between blocked threads and stays
// while they wait, so a circle is always found by the removal that closes
// it. sWaitsMutex must be held.
bool WaitsInACircle(WaitNode& ioStart) {
  for (WaitNode* node = sWaits; node != nullptr; node = node->mNext) node->mReached = false;
  ioStart.mReached = true;
  for (bool grew = true; grew;) {
    grew = false;
    for (const WaitNode* waiter = sWaits; waiter != nullptr; waiter = waiter->mNext) {
      if (!waiter->mReached) continue;
      for (WaitNode* other = sWaits; other != nullptr; other = other->mNext) {
        if (other == waiter || !Delivers(other->mInnermost, waiter->mCore, *waiter->mEntry)) continue;
        if (other == &ioStart) return true;
        if (!other->mReached) grew = other->mReached = true;
      }
    }
  }
  return false;
}

void Unlist(const WaitNode& inNode) noexcept {
  std::lock_guard<std::mutex> guard(sWaitsMutex);
  for (WaitNode** link = &sWaits; *link != nullptr; link = &(*link)->mNext) {
    if (*link == &inNode) {
      *link = inNode.mNext;
      return;
    }
  }
}

}  // namespace

// ---------------------------------------------------------------------------
// ListenerEntry

bool ListenerEntry::operator==(const ListenerEntry& inOther) const noexcept {
  return mListener == inOther.mListener && mSafeListener.get() == inOther.mSafeListener.get() &&
         OwnerEquivalent(mBoostWeakListener, inOther.mBoostWeakListener) &&
         OwnerEquivalent(mStdWeakListener, inOther.mStdWeakListener);
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
// The core

struct Broadcaster::BroadcastMessageRecord {
  const ListenerEntry& mEntry;
  const Message& mMessage;
  bool* mGone;  // set when a weak or safe listener no longer exists
};

const BroadcasterCore::Waiter* BroadcasterCore::WaiterList::find(const ListenerEntry& inEntry) const noexcept {
  for (const Waiter* waiter = mFirst; waiter != nullptr; waiter = waiter->mNext) {
    if (*waiter->mEntry == inEntry) return waiter;
  }
  return nullptr;
}

bool BroadcasterCore::IdentityOrder::operator()(const ListenerEntry& inA, const ListenerEntry& inB) const noexcept {
  if (inA.mListener != inB.mListener) return std::less<Listener*>()(inA.mListener, inB.mListener);
  if (inA.mSafeListener.get() != inB.mSafeListener.get())
    return std::less<WeakReference*>()(inA.mSafeListener.get(), inB.mSafeListener.get());
  // Owners compare by their control blocks, which the indexed weak pointer
  // keeps alive: the order holds after the listener has died.
  if (inA.mBoostWeakListener.owner_before(inB.mBoostWeakListener)) return true;
  if (inB.mBoostWeakListener.owner_before(inA.mBoostWeakListener)) return false;
  return inA.mStdWeakListener.owner_before(inB.mStdWeakListener);
}

std::size_t BroadcasterCore::PositionOf(std::uint64_t inSerial) const noexcept {
  const auto at = std::lower_bound(mEntries.begin(), mEntries.end(), inSerial,
                                   [](const StoredEntry& inStored, std::uint64_t inKey) { return inStored.mSerial < inKey; });
  return static_cast<std::size_t>(at - mEntries.begin());
}

std::ptrdiff_t BroadcasterCore::Find(const ListenerEntry& inEntry) const noexcept {
  const auto found = mIndex.find(inEntry);
  if (found == mIndex.end()) return -1;
  return static_cast<std::ptrdiff_t>(PositionOf(found->second));
}

bool BroadcasterCore::OtherThreadDelivers(const ListenerEntry& inEntry, std::uintptr_t inSelf) const noexcept {
  for (const Frame* frame = mFrames; frame != nullptr; frame = frame->mNext) {
    if (frame->mDelivering && frame->mThread != inSelf && frame->mCurrent == inEntry) return true;
  }
  return false;
}

void BroadcasterCore::EndDelivery(Frame& ioFrame) noexcept {
  if (!ioFrame.mDelivering) return;
  ioFrame.mDelivering = false;
  if (mGateMap.mFirst == nullptr) return;
  std::lock_guard<std::mutex> wake(mWakeMutex);
  ++mWakeGeneration;
  mDeliveryEnded.notify_all();
}

void BroadcasterCore::Unlink(Frame& ioFrame) noexcept {
  EndDelivery(ioFrame);
  for (Frame** link = &mFrames; *link != nullptr; link = &(*link)->mNext) {
    if (*link == &ioFrame) {
      *link = ioFrame.mNext;
      return;
    }
  }
}

bool BroadcasterCore::Add(const ListenerEntry& inEntry) {
  Locked lock(mMutex, "Broadcaster::AddListener");
  // A registry larger than a 32-bit count counts as exhausted storage.
  if (mEntries.size() >= static_cast<std::size_t>(std::numeric_limits<std::int32_t>::max())) throw std::bad_alloc();
  const auto inserted = mIndex.emplace(inEntry, mNextSerial);
  if (!inserted.second) return false;
  bool stored = false;
  try {
    const MessageID hearsOnly = inEntry.mListener != nullptr ? inEntry.mListener->mHearsOnly : 0;
    mEntries.push_back(StoredEntry{inEntry, mNextSerial, hearsOnly});
    stored = true;
    if (inEntry.mListener != nullptr) inEntry.mListener->AddBroadcaster(mOwner, mSelf);
  } catch (...) {
    // Out of storage, or without its back-link the listener could not
    // detach itself when it dies: take the whole registration back.
    if (stored) mEntries.pop_back();
    mIndex.erase(inserted.first);
    throw;
  }
  // Running broadcasts serve only entries older than where they started, so
  // the newcomer waits for the next broadcast.
  mNextSerial += 2;
  return true;
}

void BroadcasterCore::EraseAt(std::size_t inPosition) noexcept {
  // Running broadcasts hold serials, not positions: neither erasing nor
  // compacting moves anything they depend on. Both free storage and allocate
  // none.
  constexpr std::size_t kEraseSpan = 8;      // entries an erase may move
  constexpr std::size_t kCompactFloor = 16;  // marked entries always allowed
  if (mEntries.size() - inPosition <= kEraseSpan) {
    mEntries.erase(mEntries.begin() + static_cast<std::ptrdiff_t>(inPosition));
    return;
  }
  StoredEntry& stored = mEntries[inPosition];
  stored.mEntry = ListenerEntry();
  stored.mSerial |= kRemovedMark;
  if (++mRemovedCount <= kCompactFloor || mRemovedCount * 2 <= mEntries.size()) return;
  mEntries.erase(std::remove_if(mEntries.begin(), mEntries.end(),
                                [](const StoredEntry& inStored) { return (inStored.mSerial & kRemovedMark) != 0; }),
                 mEntries.end());
  mRemovedCount = 0;
}

BroadcasterCore::Removed BroadcasterCore::Remove(const ListenerEntry& inListener, Listener* inUnlink, Wait inWait,
                                                 bool inCheck) {
  // Declared before the lock, so that it is let go after the lock is.
  std::shared_ptr<BroadcasterCore> keep;
  Locked lock(mMutex, "Broadcaster::RemoveListener1");
  auto found = mIndex.find(inListener);
  const bool noEarlierRemovalWaits = !inCheck || found == mIndex.end() || mGateMap.find(inListener) == mGateMap.end();
  if (!noEarlierRemovalWaits) {
    // No host code runs under the core's lock: the contract dialog and the
    // error handler may block, or use this broadcaster. The report goes out
    // with the lock let go (taken again however the report ends), and the
    // entry is looked up anew after.
    {
      const kivcore::threads::ScopedUnlock unlocked(mMutex, "Broadcaster::RemoveListener1");
      TARN_CONTRACT_CHECK(noEarlierRemovalWaits, kRemoveListenerName);
    }
    found = mIndex.find(inListener);
  }
  if (found != mIndex.end()) {
    // Running broadcasts hold serials, not positions: erasing or marking
    // moves nothing they depend on, and allocates nothing.
    EraseAt(PositionOf(found->second));
    mIndex.erase(found);
  }
  if (inUnlink != nullptr) inUnlink->RemoveBroadcaster(mSelf);
  if (inWait == Wait::kNever) return Removed::kAtOnce;
  // The caller may destroy the listener next, so no delivery to it may still
  // run elsewhere. Deliveries on this thread are on the caller's own stack
  // (a handler removing itself, or anything it calls): waiting for them
  // would never end. Threads are compared, not main-thread registration,
  // which a handler may drop meanwhile.
  const std::uintptr_t self = kivcore::threads::CurrentThreadToken();
  if (!OtherThreadDelivers(inListener, self)) return Removed::kAtOnce;
  WaitNode node{this, &inListener, tInnermostFrame, false, nullptr};
  if (node.mInnermost != nullptr) {
    bool circle = false;
    {
      std::lock_guard<std::mutex> guard(sWaitsMutex);
      node.mNext = sWaits;
      sWaits = &node;
      circle = WaitsInACircle(node);
      if (circle) sWaits = node.mNext;
    }
    if (circle) {
      // The entry is gone, so no new delivery of it starts; the running one
      // ends after the delivery on this stack does. The report runs without
      // the lock, as host code must.
      const kivcore::threads::ScopedUnlock unlocked(mMutex, "Broadcaster::RemoveListener2");
      TracingState::ReportMisuse("a removal inside a handler never waits for a delivery whose thread waits for that handler",
                                 __FILE__, kRemoveListenerName, __LINE__);
      return Removed::kAtOnce;
    }
  }
  // Unlisted on every way out of the wait below, which throws nothing.
  struct Listed {
    const WaitNode& mNode;
    ~Listed() {
      if (mNode.mInnermost != nullptr) Unlist(mNode);
    }
  } listed{node};
  // The lock is let go while this removal waits, and a handler on the
  // delivering thread may destroy the broadcaster meanwhile: the removal
  // holds the core itself from here, so that it finds a closed core rather
  // than freed memory. The delivering broadcast holds the core now, so the
  // reference can be had.
  keep = mSelf.lock();
  Waiter waiter{&inListener, mGateMap.mFirst};
  mGateMap.mFirst = &waiter;
  // Read only once this removal has to wait, so that removals that do not
  // wait pay nothing for the report.
  const std::chrono::milliseconds threshold = TracingState::RemovalWaitThreshold();
  const auto start = std::chrono::steady_clock::now();
  bool reportDue = threshold.count() > 0;
  do {
    bool late = false;
    {
      // The generation is read before the core's lock is let go, and bumped
      // only after a delivery ended under that lock: no wake-up is missed.
      std::unique_lock<std::mutex> wake(mWakeMutex);
      const std::uint64_t seen = mWakeGeneration;
      mMutex.Unlock();
      const auto ended = [&] { return mWakeGeneration != seen; };
      if (reportDue) {
        late = !mDeliveryEnded.wait_until(wake, start + threshold, ended);
      } else {
        mDeliveryEnded.wait(wake, ended);
      }
    }
    mMutex.Lock("Broadcaster::RemoveListener2");
    if (late && OtherThreadDelivers(inListener, self)) {
      // Once per removal; the wait goes on, since a handler may
      // legitimately be slow.
      reportDue = false;
      ReportWait(inListener, self,
                 std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - start));
    }
  } while (OtherThreadDelivers(inListener, self));
  for (Waiter** link = &mGateMap.mFirst; *link != nullptr; link = &(*link)->mNext) {
    if (*link == &waiter) {
      *link = waiter.mNext;
      break;
    }
  }
  return Removed::kWaited;
}

void BroadcasterCore::ReportWait(const ListenerEntry& inEntry, std::uintptr_t inSelf,
                                 std::chrono::milliseconds inWaited) noexcept {
  std::string text;
  try {
    // Everything the report names from this core is copied under its lock;
    // the report itself runs without it, since an error handler may call
    // anything, this broadcaster included.
    const Frame* delivering = mFrames;
    while (delivering != nullptr &&
           !(delivering->mDelivering && delivering->mThread != inSelf && delivering->mCurrent == inEntry)) {
      delivering = delivering->mNext;
    }
    const void* listener = inEntry.mListener;
    if (inEntry.mSafeListener) listener = inEntry.mSafeListener->mObject;
    std::string where;
    if (delivering != nullptr && delivering->mTrace != nullptr) {
      where = TracingState::DescribeBroadcaster(delivering->mTrace->mBroadcaster, delivering->mTrace->mStationID) +
              ", delivering " + Tracing::ReadableTypeName(delivering->mTrace->mMessageType);
    } else {
      where = TracingState::DescribeBroadcaster(mOwner, kivcore::utility::ImmutableString());
    }
    text = "A removal of " + TracingState::DescribeListener(listener, KindOf(inEntry)) + " from " + where +
           " has waited " + std::to_string(inWaited.count()) +
           " ms for that listener's delivery on another thread to return, and goes on waiting. ";
  } catch (...) {
    return;  // no storage for the text: the removal matters more than its report
  }
  mMutex.Unlock();
  try {
    text += TracingState::DescribeCurrentDelivery();
  } catch (...) {
  }
  TracingState::ReportRemovalWait(text);
  mMutex.Lock("Broadcaster::RemoveListener2");
}

bool BroadcasterCore::Contains(const ListenerEntry& inEntry) {
  Locked lock(mMutex, "Broadcaster::HasListener");
  return Find(inEntry) >= 0;
}

bool BroadcasterCore::IsEmpty() {
  Locked lock(mMutex, "Broadcaster::HasListener");
  return mEntries.size() == mRemovedCount;
}

void BroadcasterCore::Close() noexcept {
#ifndef NDEBUG
  bool inUse = false;
#endif
  {
    Locked lock(mMutex, "Broadcaster::~Broadcaster");
#ifndef NDEBUG
    inUse = mFrames != nullptr || mGateMap.mFirst != nullptr;
#endif
    for (const StoredEntry& stored : mEntries) {
      if (stored.mEntry.mListener != nullptr) stored.mEntry.mListener->RemoveBroadcaster(mSelf);
    }
    mEntries.clear();
    mIndex.clear();
    mRemovedCount = 0;
    mOwner = nullptr;
  }
#ifndef NDEBUG
  // Harmless here (the broadcast ends on the closed core, the remover holds
  // it), but the owner of the broadcaster has lost track of its life: a
  // derived broadcaster's own members are gone already.
  if (inUse) {
    TracingState::ReportMisuse("no broadcast runs on the broadcaster and no removal waits on it", __FILE__,
                               "Tarn::Broadcaster::~Broadcaster", __LINE__);
  }
#endif
}

std::size_t BroadcasterCore::CountListeners(Broadcaster& inBroadcaster) {
  BroadcasterCore& core = *inBroadcaster.mCore;
  Locked lock(core.mMutex, "Broadcaster::CountListeners");
  return core.mEntries.size() - core.mRemovedCount;
}

namespace {

// The walk of an untraced broadcast: the walk calls each listener itself and
// hands what it throws to the error manager (see Walk).
struct Untraced {};

// Raises the exception being handled again, inside the error manager's
// guarded call, so that the manager's handler receives it exactly as if the
// delivery had run inside that call.
struct RethrowCurrent {
  int operator()() const { throw; }
};

// The walk of a traced broadcast: each delivery is published for the
// removal-wait report and, with a tracer, timed and told to it.
struct Traced {
  Tracing::Delivery mDelivery;            // the fixed part is set before the walk; main thread only
  Tracing::DeliveryTracer* mTracer;       // read once, for the whole broadcast
  const boost::function<int()>* mInner = nullptr;

  void Deliver(kivcore::config::ErrorManager* inErrors, const boost::function<int()>& inDelivery,
               const ListenerEntry& inEntry) {
    mDelivery.mListenerKind = KindOf(inEntry);
    switch (mDelivery.mListenerKind) {
      case Tracing::ListenerKind::kPlain: mDelivery.mListener = inEntry.mListener; break;
      case Tracing::ListenerKind::kSafe: mDelivery.mListener = inEntry.mSafeListener->mObject; break;  // not followed
      // The reference taken here is dropped at once; if it was the last, the
      // listener goes here rather than in its delivery, which finds it gone.
      case Tracing::ListenerKind::kBoostWeak: mDelivery.mListener = inEntry.mBoostWeakListener.lock().get(); break;
      case Tracing::ListenerKind::kStdWeak: mDelivery.mListener = inEntry.mStdWeakListener.lock().get(); break;
    }
    const TracingState::CurrentDelivery current(mDelivery);
    if (mTracer == nullptr) {
      inErrors->GuardedCall(inDelivery);
      return;
    }
    mInner = &inDelivery;
    // Held by reference, so that the function stores a pointer and
    // allocates nothing.
    inErrors->GuardedCall(boost::function<int()>(boost::ref(*this)));
  }

  // The tracer's calls and the delivery, in one guarded call: whatever
  // throws, the broadcast goes on with the next listener. A tracer that
  // throws before the delivery does not cost the listener its message: its
  // exception goes to the error manager once the delivery has run (unless
  // the handler's own exception goes instead).
  int operator()() {
    std::exception_ptr tracerFailure;
    try {
      const TracingState::TracerCall inside;
      mTracer->DeliveryBegins(mDelivery);
    } catch (...) {
      tracerFailure = std::current_exception();
    }
    const auto start = std::chrono::steady_clock::now();
    try {
      (*mInner)();
    } catch (...) {
      Ended(start);
      throw;
    }
    Ended(start);
    if (tracerFailure) std::rethrow_exception(tracerFailure);
    return 0;
  }

  void Ended(std::chrono::steady_clock::time_point inStart) {
    const auto took = std::chrono::steady_clock::now() - inStart;
    const TracingState::TracerCall inside;
    mTracer->DeliveryEnded(mDelivery, std::chrono::duration_cast<std::chrono::nanoseconds>(took));
  }
};

}  // namespace

void BroadcasterCore::Broadcast(const Message& inMessage) {
  Untraced policy;
  Walk(inMessage, policy);
}

void BroadcasterCore::BroadcastTraced(const Message& inMessage, const Broadcaster& inOwner) {
  Traced policy{Tracing::Delivery(), TracingState::CurrentTracer()};
  policy.mDelivery.mBroadcaster = &inOwner;
  if (const Station* station = dynamic_cast<const Station*>(&inOwner)) policy.mDelivery.mStationID = station->GetStationID();
  policy.mDelivery.mMessageID = inMessage.GetMessageID();
  policy.mDelivery.mMessageType = typeid(inMessage).name();
  policy.mDelivery.mThread = std::this_thread::get_id();
  Walk(inMessage, policy);
}

template <class Policy>
void BroadcasterCore::Walk(const Message& inMessage, Policy& ioPolicy) {
  kivcore::config::ErrorManager* const errors = kivcore::config::ErrorManager::Get(false);
  Frame frame;
  frame.mThread = kivcore::threads::CurrentThreadToken();
  frame.mCore = this;
  frame.mOuter = tInnermostFrame;
  if constexpr (std::is_same<Policy, Traced>::value) frame.mTrace = &ioPolicy.mDelivery;
  bool currentIsPlain = true;  // frame.mCurrent has no weak field set
  bool gone = false;
  // Built once: the record refers to frame.mCurrent, which each pass
  // refills.
  const Broadcaster::BroadcastMessageRecord record{frame.mCurrent, inMessage, &gone};
  const MessageID messageID = inMessage.GetMessageID();
  // The traced walk hands each delivery to its policy as a call. It names
  // the delivery directly (no function pointer to follow) and fits inside
  // the boost::function, so nothing is allocated.
  struct Deliver {
    const Broadcaster::BroadcastMessageRecord* mRecord;
    int operator()() const { return Broadcaster::DeliverToListener(*mRecord); }
  };
  // Unlinks the frame on every way out, so that no remover waits for a
  // broadcast that has ended. Only a delivery can throw, and none runs under
  // the lock, so the scope never finds the lock held by the walk.
  struct FrameScope {
    BroadcasterCore& mCore;
    Frame& mFrame;
    bool mLinked = false;
    ~FrameScope() {
      tInnermostFrame = mFrame.mOuter;
      if (!mLinked) return;
      Locked lock(mCore.mMutex, "Broadcaster::BroadcastMessage2");
      mCore.Unlink(mFrame);
    }
  } scope{*this, frame};
  tInnermostFrame = &frame;

  // One hold of the lock links the frame and picks the first entry; each
  // later hold ends one delivery and picks the next.
  mMutex.Lock("Broadcaster::BroadcastMessage1");
  frame.mNextBelow = mNextSerial;
  frame.mPosition = mEntries.size();
  frame.mNext = mFrames;
  mFrames = &frame;
  scope.mLinked = true;
  for (;;) {
    {
      EndDelivery(frame);
      // The newest entry older than the last one served. Unless entries
      // were added or removed meanwhile, it sits just below where the last
      // one was; the hint is checked, and searched for when it fails.
      std::size_t position = frame.mPosition;
      const std::size_t count = mEntries.size();
      if (position > count || (position > 0 && mEntries[position - 1].mSerial >= frame.mNextBelow) ||
          (position < count && mEntries[position].mSerial < frame.mNextBelow)) {
        position = PositionOf(frame.mNextBelow);
      }
      // Entries marked removed, and listeners that hear another message type
      // only, are passed over under the same hold: nothing is called or
      // traced for them.
      const StoredEntry* next = nullptr;
      while (position > 0) {
        next = &mEntries[--position];
        if ((next->mSerial & kRemovedMark) == 0 && (next->mHearsOnly == 0 || next->mHearsOnly == messageID)) break;
        next = nullptr;
      }
      if (next == nullptr) {
        Unlink(frame);
        scope.mLinked = false;
        mMutex.Unlock();
        return;
      }
      frame.mPosition = position;
      frame.mNextBelow = next->mSerial;
      if (next->mEntry.mListener != nullptr && currentIsPlain) {
        // Copying a plain pointer into a copy without weak fields is a
        // pointer store: no reference-count traffic.
        frame.mCurrent.mListener = next->mEntry.mListener;
      } else {
        // Only weak references are copied under the lock, and the copy that
        // is replaced holds only weak ones too: no listener can die here.
        frame.mCurrent = next->mEntry;
        currentIsPlain = frame.mCurrent.mListener != nullptr;
      }
      frame.mDelivering = true;
    }
    mMutex.Unlock();
    // No lock is held while the listener runs.
    gone = false;
    if constexpr (std::is_same<Policy, Untraced>::value) {
      // The error manager's guarded call, inline: a plain listener is called
      // straight from here, and only an exception goes through the manager.
      try {
        Listener* const listener = frame.mCurrent.mListener;
        if (listener == nullptr) {
          Broadcaster::DeliverToListener(record);
        } else if (listener->IsListening()) {
          listener->ProcessMessage(inMessage);
        }
      } catch (...) {
        errors->GuardedCall(boost::function<int()>(RethrowCurrent()));
      }
    } else {
      ioPolicy.Deliver(errors, boost::function<int()>(Deliver{&record}), frame.mCurrent);
    }
    // A weak or safe listener found gone is pruned as the broadcast passes.
    if (gone) Remove(frame.mCurrent, nullptr, Wait::kNever, false);
    mMutex.Lock("Broadcaster::BroadcastMessage1");
  }
}

// ---------------------------------------------------------------------------
// Broadcaster

std::shared_ptr<BroadcasterCore> BroadcasterCore::Make(Broadcaster* inOwner) {
  std::shared_ptr<BroadcasterCore> core =
      std::allocate_shared<BroadcasterCore>(kivcore::utility::SmallBlockAllocator::STLAllocator<BroadcasterCore>(), inOwner);
  core->mSelf = core;
  return core;
}

Broadcaster::Broadcaster() : mCore(BroadcasterCore::Make(this)) {}

Broadcaster::Broadcaster(const Broadcaster& inOther) : Broadcaster() {
  mBroadcasting.store(inOther.IsBroadcasting(), std::memory_order_relaxed);
}

Broadcaster::~Broadcaster() { mCore->Close(); }

void Broadcaster::AddListener(Listener* inListener) {
  TARN_CONTRACT_CHECK(inListener != NULL, kAddListenerName);
  if (inListener == nullptr) return;  // nothing to register and no back-link to make
  ListenerEntry entry;
  entry.mListener = inListener;
  mCore->Add(entry);
}

void Broadcaster::AddListener(InterfaceRef<ISafeListener> inListener) {
  TARN_CONTRACT_CHECK(inListener != NULL, kAddListenerName);
  // The conversion of a null reference is null, so both checks run.
  TARN_CONTRACT_CHECK(IWeakReferenceCapableRef(inListener) != NULL, kAddListenerName);
  ListenerEntry entry;
  entry.mSafeListener = GetSafeListenerHandle(inListener);
  mCore->Add(entry);
}

void Broadcaster::AddListener(const boost::weak_ptr<Listener>& inListener) {
  TARN_CONTRACT_CHECK(inListener.lock() != NULL, kAddListenerName);
  ListenerEntry entry;
  entry.mBoostWeakListener = inListener;
  mCore->Add(entry);
}

void Broadcaster::AddListener(const std::weak_ptr<Listener>& inListener) {
  TARN_CONTRACT_CHECK(inListener.lock() != NULL, kAddListenerName);
  ListenerEntry entry;
  entry.mStdWeakListener = inListener;
  mCore->Add(entry);
}

// A removal that has to wait holds the core from then on (see
// BroadcasterCore::Remove).
void Broadcaster::RemoveListener(Listener* inListener, bool inUpdateListener) {
  TARN_CONTRACT_CHECK(inListener != NULL, kRemoveListenerName);
  if (inListener == nullptr) return;  // never follow a null pointer
  ListenerEntry entry;
  entry.mListener = inListener;
  mCore->Remove(entry, inUpdateListener ? inListener : nullptr, BroadcasterCore::Wait::kForOtherThreads, true);
}

void Broadcaster::RemoveListener(InterfaceRef<ISafeListener> inListener) {
  TARN_CONTRACT_CHECK(inListener != NULL, kRemoveListenerName);
  ListenerEntry entry;
  entry.mSafeListener = GetSafeListenerHandle(inListener);
  mCore->Remove(entry, nullptr, BroadcasterCore::Wait::kForOtherThreads, true);
}

void Broadcaster::RemoveListener(const boost::weak_ptr<Listener>& inListener) {
  TARN_CONTRACT_CHECK(inListener.lock() != NULL, kRemoveListenerName);
  ListenerEntry entry;
  entry.mBoostWeakListener = inListener;
  mCore->Remove(entry, nullptr, BroadcasterCore::Wait::kForOtherThreads, true);
}

void Broadcaster::RemoveListener(const std::weak_ptr<Listener>& inListener) {
  TARN_CONTRACT_CHECK(inListener.lock() != NULL, kRemoveListenerName);
  ListenerEntry entry;
  entry.mStdWeakListener = inListener;
  mCore->Remove(entry, nullptr, BroadcasterCore::Wait::kForOtherThreads, true);
}

bool Broadcaster::HasListener(Listener* inListener) {
  TARN_CONTRACT_CHECK(inListener, kHasListenerName);
  ListenerEntry entry;
  entry.mListener = inListener;
  return mCore->Contains(entry);
}

bool Broadcaster::HasListeners() { return !mCore->IsEmpty(); }

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
    if (listener != nullptr) {
      listener->ListenToMessage(inRecord.mMessage);
      return 0;
    }
  } else if (const boost::shared_ptr<Listener> listener = entry.mBoostWeakListener.lock()) {
    listener->ProcessMessage(inRecord.mMessage);
    return 0;
  } else if (const std::shared_ptr<Listener> listener = entry.mStdWeakListener.lock()) {
    listener->ProcessMessage(inRecord.mMessage);
    return 0;
  }
  *inRecord.mGone = true;
  return 0;
}

void Broadcaster::BroadcastMessage(const Message& inMessage) {
  if (!IsBroadcasting()) return;
  if (!kivcore::threads::CurrentThreadIsMainThread()) {
    Diagnostics::Detail::ReportSilentFailure(Diagnostics::Detail::Failure::kBroadcastOffMainThread, TARN_CALL_SITE(),
                                             "Tarn::Broadcaster::BroadcastMessage", kivcore::utility::ImmutableString());
    return;
  }
  // Held for the whole broadcast: a handler that destroys this broadcaster
  // leaves the broadcast a closed, empty core to finish on.
  const std::shared_ptr<BroadcasterCore> core = mCore;
  // The one read tracing costs an untraced broadcast.
  if (TracingState::sActive.load(std::memory_order_relaxed) && !TracingState::InsideTracer()) {
    core->BroadcastTraced(inMessage, *this);
  } else {
    core->Broadcast(inMessage);
  }
}

}  // namespace Tarn
