#include <TarnMessaging/Station.h>
#include <TarnMessaging/StationRegistry.h>
#include <TarnMessaging/Subscription.h>

#include "BroadcasterCore.h"
#include "StationRetainer.h"

#include <kivcore/MainThread.h>

namespace Tarn {

using kivcore::utility::ImmutableString;

// An entry a registration removes from a broadcaster's core. The core is held weakly, so a broadcaster (or station)
// destroyed first leaves an expired link instead of freed memory; a core
// that is still locked but closed simply has no entry to remove.
struct Registration::Record {
  std::weak_ptr<BroadcasterCore> mCore;
  ListenerEntry mEntry;
};

struct RegistrationFactory {
  // Allocates the record, then has inAttach attach the listener and fill in
  // the entry to remove later; in that order, so that an attach whose record
  // cannot be had throws with nothing attached. inAttach returns false when
  // the broadcaster refused the input (and reported it): the registration is
  // then empty, never one that would remove something else later.
  template <class Attacher>
  static Registration Make(const Broadcaster& inBroadcaster, Attacher inAttach) {
    Registration result(new Registration::Record);
    if (!inAttach(result.mRecord->mEntry)) return Registration();
    result.mRecord->mCore = Registration::CoreOf(inBroadcaster);
    return result;
  }
};

namespace {

Registration AttachPlain(Broadcaster& ioBroadcaster, Listener* inListener) {
  return RegistrationFactory::Make(ioBroadcaster, [&](ListenerEntry& outEntry) {
    ioBroadcaster.AddListener(inListener);
    outEntry.mListener = inListener;
    return inListener != nullptr;
  });
}

template <class WeakPtr>
Registration AttachWeak(Broadcaster& ioBroadcaster, const WeakPtr& inListener, WeakPtr ListenerEntry::*inField) {
  return RegistrationFactory::Make(ioBroadcaster, [&](ListenerEntry& outEntry) {
    ioBroadcaster.AddListener(inListener);
    outEntry.*inField = inListener;
    return !inListener.expired();
  });
}

Registration AttachSafe(Broadcaster& ioBroadcaster, const ISafeListenerRef& inListener) {
  return RegistrationFactory::Make(ioBroadcaster, [&](ListenerEntry& outEntry) {
    ioBroadcaster.AddListener(inListener);
    // The weak-reference block, not a counted reference: the registration
    // must not keep the listener alive.
    outEntry.mSafeListener = GetSafeListenerHandle(inListener);
    return static_cast<bool>(outEntry.mSafeListener);
  });
}

template <class Attacher>
Registration AttachToStation(const ImmutableString& inStationID, Attacher inAttach) {
  StationRetainer station(inStationID);
  if (station.get() == nullptr) return Registration();
  return inAttach(*station.get());
}

}  // namespace

// ---------------------------------------------------------------------------
// Registration

std::weak_ptr<BroadcasterCore> Registration::CoreOf(const Broadcaster& inBroadcaster) { return inBroadcaster.mCore; }

Registration& Registration::operator=(Registration&& ioOther) noexcept {
  if (this != &ioOther) {
    Reset();
    mRecord = std::exchange(ioOther.mRecord, nullptr);
    mOwned = std::exchange(ioOther.mOwned, nullptr);
  }
  return *this;
}

void Registration::Reset() noexcept {
  if (SubscriptionDetail::OwnedListener* const owned = std::exchange(mOwned, nullptr)) owned->Dispose();
  Record* const record = std::exchange(mRecord, nullptr);
  if (record == nullptr) return;
  if (const std::shared_ptr<BroadcasterCore> core = record->mCore.lock()) {
    // Held for the whole removal, which may wait: a broadcaster destroyed
    // meanwhile leaves a closed core, not freed memory. No misuse check: two
    // registrations of one listener may both remove it.
    core->Remove(record->mEntry, record->mEntry.mListener, BroadcasterCore::Wait::kForOtherThreads, false);
  }
  delete record;
}

void Registration::Release() noexcept {
  // A released subscription's listener is deliberately left allocated: it is
  // still attached and may be delivered to for as long as its broadcaster lives.
  mOwned = nullptr;
  delete std::exchange(mRecord, nullptr);
}

Registration Registration::Own(Broadcaster& ioBroadcaster, SubscriptionDetail::OwnedListener* inListener) {
  Registration result(inListener);  // disposes of the listener if the attach throws
  ioBroadcaster.AddListener(inListener);
  return result;
}

Registration Registration::Own(const ImmutableString& inStationID, SubscriptionDetail::OwnedListener* inListener) {
  Registration result(inListener);
  StationRetainer station(inStationID);
  if (station.get() == nullptr) return Registration();  // result disposes of the listener
  station.get()->AddListener(inListener);
  return result;
}

// ---------------------------------------------------------------------------
// Attach

Registration Attach(Broadcaster& ioBroadcaster, Listener* inListener) { return AttachPlain(ioBroadcaster, inListener); }

Registration Attach(Broadcaster& ioBroadcaster, const boost::weak_ptr<Listener>& inListener) {
  return AttachWeak(ioBroadcaster, inListener, &ListenerEntry::mBoostWeakListener);
}

Registration Attach(Broadcaster& ioBroadcaster, const std::weak_ptr<Listener>& inListener) {
  return AttachWeak(ioBroadcaster, inListener, &ListenerEntry::mStdWeakListener);
}

Registration Attach(Broadcaster& ioBroadcaster, const ISafeListenerRef& inListener) {
  return AttachSafe(ioBroadcaster, inListener);
}

Registration Attach(const ImmutableString& inStationID, Listener* inListener) {
  return AttachToStation(inStationID, [&](Broadcaster& ioStation) { return AttachPlain(ioStation, inListener); });
}

Registration Attach(const ImmutableString& inStationID, const boost::weak_ptr<Listener>& inListener) {
  return AttachToStation(inStationID, [&](Broadcaster& ioStation) {
    return AttachWeak(ioStation, inListener, &ListenerEntry::mBoostWeakListener);
  });
}

Registration Attach(const ImmutableString& inStationID, const std::weak_ptr<Listener>& inListener) {
  return AttachToStation(inStationID, [&](Broadcaster& ioStation) {
    return AttachWeak(ioStation, inListener, &ListenerEntry::mStdWeakListener);
  });
}

Registration Attach(const ImmutableString& inStationID, const ISafeListenerRef& inListener) {
  return AttachToStation(inStationID, [&](Broadcaster& ioStation) { return AttachSafe(ioStation, inListener); });
}

// ---------------------------------------------------------------------------
// Subscription listeners

namespace SubscriptionDetail {

// Every derived class detaches in its own destructor, while whole.
OwnedListener::~OwnedListener() = default;

void OwnedListener::Dispose() noexcept {
  DetachFromBroadcasters();
  // The detach above has waited for every delivery to this listener on
  // another thread, so a handler call still counted runs on this very
  // stack, and the handler (with what it captured) must outlive its return.
  // The stack decides, not whether this thread is the main thread now: a
  // handler that made the last Terminate runs on a thread that no longer is.
  if (mDepth > 0) {
    mDisposed = true;
    return;
  }
  delete this;
}

}  // namespace SubscriptionDetail

}  // namespace Tarn
