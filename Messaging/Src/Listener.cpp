#include <TarnMessaging/Broadcaster.h>
#include <TarnMessaging/Listener.h>

#include "BroadcasterCore.h"
#include "TracingState.h"

#include <algorithm>
#include <thread>

namespace Tarn {

namespace {
// Holds a listener's back-link lock for a scope. A spin lock: it guards a few
// list operations, is taken after any core's lock and is never held across a
// call into a core.
class BroadcastersLock {
public:
  explicit BroadcastersLock(std::atomic<bool>& inBusy) noexcept : mBusy(inBusy) {
    while (mBusy.exchange(true, std::memory_order_acquire)) std::this_thread::yield();
  }
  ~BroadcastersLock() { mBusy.store(false, std::memory_order_release); }
  BroadcastersLock(const BroadcastersLock&) = delete;
  BroadcastersLock& operator=(const BroadcastersLock&) = delete;

private:
  std::atomic<bool>& mBusy;
};

template <class WeakPtr>
bool SameOwner(const WeakPtr& inA, const WeakPtr& inB) noexcept {
  return !inA.owner_before(inB) && !inB.owner_before(inA);
}
}  // namespace

Listener::Listener() noexcept = default;

Listener::Listener(const Listener& inOther) noexcept : mListening(inOther.IsListening()) {}

Listener& Listener::operator=(const Listener& inOther) noexcept {
  mListening.store(inOther.IsListening(), std::memory_order_relaxed);
  return *this;
}

Listener::~Listener() { BroadcasterCore::DetachListener(*this, false); }

void Listener::DetachFromBroadcasters() noexcept { BroadcasterCore::DetachListener(*this, true); }

void BroadcasterCore::DetachListener(Listener& ioListener, bool inWhole) noexcept {
  // The link stays in the list until the core takes it out together with the
  // entry, under the core's lock: a broadcaster closing meanwhile on another
  // thread then finds either both or neither.
  for (;;) {
    std::weak_ptr<BroadcasterCore> link;
    {
      BroadcastersLock lock(ioListener.mBroadcastersBusy);
      if (ioListener.mBroadcasters.empty()) return;
      link = ioListener.mBroadcasters.front().mCore;
    }
    if (const std::shared_ptr<BroadcasterCore> core = link.lock()) {
      ListenerEntry entry;
      entry.mListener = &ioListener;
      const Removed removed = core->Remove(entry, &ioListener, Wait::kForOtherThreads, false);
#ifndef NDEBUG
      // From ~Listener the derived part is already destroyed, so the
      // delivery just waited for ran on a half-destroyed listener.
      if (!inWhole && removed == Removed::kWaited) {
        TracingState::ReportMisuse(
            "no delivery runs on another thread when ~Listener starts (call DetachFromBroadcasters() in the "
            "derived destructor)",
            __FILE__, "Tarn::Listener::~Listener", __LINE__);
      }
#else
      (void)removed;
      (void)inWhole;
#endif
    } else {
      // The broadcaster is gone and its core with it; only a link left by a
      // removal that did not update this listener can be in that state.
      ioListener.RemoveBroadcaster(link);
    }
  }
}

void Listener::DispatchMessage(const Message& inMessage) { ListenToMessage(inMessage); }

bool Listener::HasBroadcaster(Broadcaster* inBroadcaster) const {
  BroadcastersLock lock(mBroadcastersBusy);
  return std::any_of(mBroadcasters.begin(), mBroadcasters.end(), [&](const BackLink& inLink) {
    return inLink.mBroadcaster == inBroadcaster && !inLink.mCore.expired();
  });
}

void Listener::AddBroadcaster(Broadcaster* inBroadcaster, const std::weak_ptr<BroadcasterCore>& inCore) {
  BroadcastersLock lock(mBroadcastersBusy);
  for (const BackLink& link : mBroadcasters) {
    if (SameOwner(link.mCore, inCore)) return;
  }
  mBroadcasters.push_back(BackLink{inBroadcaster, inCore});
}

void Listener::RemoveBroadcaster(const std::weak_ptr<BroadcasterCore>& inCore) noexcept {
  BroadcastersLock lock(mBroadcastersBusy);
  mBroadcasters.remove_if([&](const BackLink& inLink) { return SameOwner(inLink.mCore, inCore); });
}

}  // namespace Tarn
