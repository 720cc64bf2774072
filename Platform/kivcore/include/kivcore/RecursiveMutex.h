/// @file
/// kivcore::threads::RecursiveMutex: a mutex its holder may lock again.
///
/// @code{.cpp}
///   mMutex.Lock("Broadcaster::AddListener");   // the label names the site
///   ...                                          // for diagnostics only
///   mMutex.Unlock();
/// @endcode
///
/// Threading: Lock blocks until the mutex is free or held by the caller; each
/// Lock is matched by one Unlock on the same thread. The uncontended paths are
/// inline: one compare-and-swap to lock and one exchange to unlock, with no
/// call. A waiter spins briefly, then sleeps in the kernel. The mutex is
/// constant-initialised and trivially destructible, so a global one can be used
/// at any point of static initialisation or destruction. Not copyable.
#pragma once

#include <kivcore/Export.h>

#include <atomic>
#include <cstdint>

namespace kivcore::threads {

/// An identifier of the calling thread, unique among live threads: the
/// thread pointer, read from a register with no call.
inline std::uintptr_t CurrentThreadToken() noexcept {
  return reinterpret_cast<std::uintptr_t>(__builtin_thread_pointer());
}

/// A mutex its holder may lock again; each Lock is matched by one Unlock on
/// the same thread. Constant-initialised and trivially destructible, so a
/// global one works at any point of static initialisation or destruction.
class KIVCORE_API RecursiveMutex {
public:
  constexpr RecursiveMutex() noexcept = default;
  RecursiveMutex(const RecursiveMutex&) = delete;
  RecursiveMutex& operator=(const RecursiveMutex&) = delete;

  /// inLabel names the locking site ("Class::Operation"); may be null.
  void Lock(const char* inLabel) {
    const std::uintptr_t self = CurrentThreadToken();
    if (mOwner.load(std::memory_order_relaxed) == self) {
      ++mDepth;
      return;
    }
    int expected = kFree;
    if (!mState.compare_exchange_strong(expected, kLocked, std::memory_order_acquire, std::memory_order_relaxed)) {
      LockContended();
    }
    mOwner.store(self, std::memory_order_relaxed);
    mDepth = 1;
    mLabel.store(inLabel, std::memory_order_relaxed);
  }

  /// Undoes one Lock of the calling thread, which must hold the mutex; the
  /// last one frees it and wakes one waiter.
  void Unlock() {
    if (--mDepth != 0) return;
    mLabel.store(nullptr, std::memory_order_relaxed);
    mOwner.store(0, std::memory_order_relaxed);
    if (mState.exchange(kFree, std::memory_order_release) == kLockedWithWaiters) WakeOne();
  }

  /// True when the calling thread holds the mutex.
  bool IsHeldByCurrentThread() const noexcept {
    return mOwner.load(std::memory_order_relaxed) == CurrentThreadToken();
  }
  /// The label of the outermost Lock of the current holder (diagnostics; may
  /// be stale when read by another thread).
  const char* HolderLabel() const noexcept { return mLabel.load(std::memory_order_relaxed); }

private:
  enum : int { kFree = 0, kLocked = 1, kLockedWithWaiters = 2 };
  // The slow paths: spin briefly, then sleep on the state word (futex).
  void LockContended();
  void WakeOne() noexcept;

  std::atomic<int> mState{kFree};
  // Only the holder stores its own token here, so a thread that reads its
  // own token holds the mutex and one that does not cannot be the holder.
  std::atomic<std::uintptr_t> mOwner{0};
  unsigned int mDepth = 0;  // written only by the holder
  std::atomic<const char*> mLabel{nullptr};
};

/// Locks on construction, unlocks on destruction (every way out).
class ScopedLock {
public:
  /// Locks inMutex, naming the site inLabel; the mutex must outlive the lock.
  ScopedLock(RecursiveMutex& inMutex, const char* inLabel) : mMutex(inMutex) { mMutex.Lock(inLabel); }
  ~ScopedLock() { mMutex.Unlock(); }
  ScopedLock(const ScopedLock&) = delete;
  ScopedLock& operator=(const ScopedLock&) = delete;

private:
  RecursiveMutex& mMutex;
};

/// The opposite for a scope inside a held lock: lets go of one level of
/// inMutex on construction and takes it again on destruction (every way out,
/// an exception included), for code that must not run under the lock (a
/// host's handler or report, a wait for another thread). The caller must
/// hold inMutex, and what the lock guards may change meanwhile.
class ScopedUnlock {
public:
  /// Unlocks inMutex; the destructor locks it again, naming the site inLabel.
  ScopedUnlock(RecursiveMutex& inMutex, const char* inLabel) : mMutex(inMutex), mLabel(inLabel) { mMutex.Unlock(); }
  ~ScopedUnlock() { mMutex.Lock(mLabel); }
  ScopedUnlock(const ScopedUnlock&) = delete;
  ScopedUnlock& operator=(const ScopedUnlock&) = delete;

private:
  RecursiveMutex& mMutex;
  const char* mLabel;
};

}  // namespace kivcore::threads
