#include <TarnMessaging/Broadcaster.h>
#include <TarnMessaging/Listener.h>

#include <algorithm>
#include <thread>

namespace Tarn {

namespace {
// Holds a listener's back-link lock for a scope. The lock is a spin lock:
// it guards a few list operations only and is never held across a call into
// a broadcaster.
class BroadcastersLock {
public:
  BroadcastersLock(std::atomic<bool>& inBusy) noexcept : mBusy(inBusy) {
    while (mBusy.exchange(true, std::memory_order_acquire)) std::this_thread::yield();
  }
  ~BroadcastersLock() { mBusy.store(false, std::memory_order_release); }
  BroadcastersLock(const BroadcastersLock&) = delete;
  BroadcastersLock& operator=(const BroadcastersLock&) = delete;

private:
  std::atomic<bool>& mBusy;
};
}  // namespace

Listener::Listener() noexcept = default;

Listener::Listener(const Listener& inOther) noexcept : mListening(inOther.IsListening()) {}

Listener& Listener::operator=(const Listener& inOther) noexcept {
  mListening.store(inOther.IsListening(), std::memory_order_relaxed);
  return *this;
}

Listener::~Listener() {
  // Take one broadcaster at a time out of the list and detach from it with
  // the lock released: the removal may wait for the main thread, and a
  // broadcaster destroyed meanwhile on another thread must still be able to
  // drop its own link (then it is never called here).
  for (;;) {
    Broadcaster* broadcaster = nullptr;
    {
      BroadcastersLock lock(mBroadcastersBusy);
      if (mBroadcasters.empty()) break;
      broadcaster = mBroadcasters.front();
      mBroadcasters.pop_front();
    }
    // false: the broadcaster must not touch the list we are emptying.
    if (broadcaster != nullptr) broadcaster->RemoveListener(this, false);
  }
}

void Listener::DispatchMessage(const Message& inMessage) { ListenToMessage(inMessage); }

bool Listener::HasBroadcaster(Broadcaster* inBroadcaster) const {
  BroadcastersLock lock(mBroadcastersBusy);
  return std::find(mBroadcasters.begin(), mBroadcasters.end(), inBroadcaster) != mBroadcasters.end();
}

void Listener::AddBroadcaster(Broadcaster* inBroadcaster) {
  BroadcastersLock lock(mBroadcastersBusy);
  mBroadcasters.push_back(inBroadcaster);
}

void Listener::RemoveBroadcaster(Broadcaster* inBroadcaster) noexcept {
  BroadcastersLock lock(mBroadcastersBusy);
  const auto found = std::find(mBroadcasters.begin(), mBroadcasters.end(), inBroadcaster);
  if (found != mBroadcasters.end()) mBroadcasters.erase(found);
}

void Listener::ForgetBroadcaster(Broadcaster* inBroadcaster) noexcept {
  BroadcastersLock lock(mBroadcastersBusy);
  mBroadcasters.remove(inBroadcaster);
}

}  // namespace Tarn
