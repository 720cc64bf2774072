// Gate: a flag under a mutex, with a condition variable for the waiters.
#include <kivcore/Gate.h>

#include <chrono>

namespace kivcore::threads {

Gate::Gate(bool inOpen) : mOpen(inOpen) {}

void Gate::Open() {
  // Notified under the lock: a released waiter may destroy the gate as soon
  // as it can see it open, which it cannot before the lock is let go.
  std::lock_guard<std::mutex> lock(mMutex);
  if (mOpen) return;
  mOpen = true;
  mOpened.notify_all();
}

bool Gate::IsOpen() const {
  std::lock_guard<std::mutex> lock(mMutex);
  return mOpen;
}

bool Gate::PassThrough(int inTimeoutMilliseconds) {
  std::unique_lock<std::mutex> lock(mMutex);
  if (inTimeoutMilliseconds < 0) {
    mOpened.wait(lock, [this] { return mOpen; });
    return true;
  }
  return mOpened.wait_for(lock, std::chrono::milliseconds(inTimeoutMilliseconds), [this] { return mOpen; });
}

}  // namespace kivcore::threads
