// RecursiveMutex: a plain mutex plus the holder's thread id and a depth.
//
// Only the holder ever stores its own id in mOwner, so a thread that reads
// its own id there holds the mutex, and one that does not cannot be the
// holder: a relaxed load answers "do I hold it?" without racing anyone.
#include <kivcore/RecursiveMutex.h>

#include <pthread.h>

namespace kivcore::threads {

namespace {
unsigned long CurrentThreadId() noexcept { return static_cast<unsigned long>(pthread_self()); }
}  // namespace

void RecursiveMutex::Lock(const char* inLabel) {
  const unsigned long self = CurrentThreadId();
  if (mOwner.load(std::memory_order_relaxed) == self) {
    ++mDepth;
    return;
  }
  mMutex.lock();
  mOwner.store(self, std::memory_order_relaxed);
  mDepth = 1;
  mLabel.store(inLabel, std::memory_order_relaxed);
}

void RecursiveMutex::Unlock() {
  if (--mDepth != 0) return;
  mLabel.store(nullptr, std::memory_order_relaxed);
  mOwner.store(0, std::memory_order_relaxed);
  mMutex.unlock();
}

bool RecursiveMutex::IsHeldByCurrentThread() const noexcept {
  return mOwner.load(std::memory_order_relaxed) == CurrentThreadId();
}

}  // namespace kivcore::threads
