// kivcore::threads::RecursiveMutex: a mutex its holder may lock again.
//
//   mMutex.Lock("Broadcaster::AddListener");   // the label names the site
//   ...                                          // for diagnostics only
//   mMutex.Unlock();
//
// Threading: Lock blocks until the mutex is free or held by the caller; each
// Lock is matched by one Unlock on the same thread. An uncontended Lock and
// Unlock cost about as much as a plain std::mutex. Not copyable.
#pragma once

#include <kivcore/Export.h>

#include <atomic>
#include <mutex>

namespace kivcore::threads {

class KIVCORE_API RecursiveMutex {
public:
  RecursiveMutex() noexcept = default;
  RecursiveMutex(const RecursiveMutex&) = delete;
  RecursiveMutex& operator=(const RecursiveMutex&) = delete;

  // inLabel names the locking site ("Class::Operation"); may be null.
  void Lock(const char* inLabel);
  void Unlock();
  // True when the calling thread holds the mutex.
  bool IsHeldByCurrentThread() const noexcept;
  // The label of the outermost Lock of the current holder (diagnostics; may
  // be stale when read by another thread).
  const char* HolderLabel() const noexcept { return mLabel.load(std::memory_order_relaxed); }

private:
  std::mutex mMutex;
  std::atomic<unsigned long> mOwner{0};  // pthread id of the holder, 0 when free
  unsigned int mDepth = 0;               // written only by the holder
  std::atomic<const char*> mLabel{nullptr};
};

// Locks on construction, unlocks on destruction (every way out).
class ScopedLock {
public:
  ScopedLock(RecursiveMutex& inMutex, const char* inLabel) : mMutex(inMutex) { mMutex.Lock(inLabel); }
  ~ScopedLock() { mMutex.Unlock(); }
  ScopedLock(const ScopedLock&) = delete;
  ScopedLock& operator=(const ScopedLock&) = delete;

private:
  RecursiveMutex& mMutex;
};

}  // namespace kivcore::threads
