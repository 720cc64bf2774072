// RecursiveMutex slow paths: a three-state futex lock (free, locked, locked
// with waiters). The fast paths are inline in the header.
#include <kivcore/RecursiveMutex.h>

#include <linux/futex.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <thread>

namespace kivcore::threads {

namespace {

void FutexWait(std::atomic<int>& inWord, int inExpected) noexcept {
  ::syscall(SYS_futex, reinterpret_cast<int*>(&inWord), FUTEX_WAIT_PRIVATE, inExpected, nullptr, nullptr, 0);
}

void FutexWakeOne(std::atomic<int>& inWord) noexcept {
  ::syscall(SYS_futex, reinterpret_cast<int*>(&inWord), FUTEX_WAKE_PRIVATE, 1, nullptr, nullptr, 0);
}

}  // namespace

void RecursiveMutex::LockContended() {
  // Locks are held for a handful of instructions (a broadcaster picking its
  // next listener), so a short spin usually wins without a system call.
  for (int spin = 0; spin < 100; ++spin) {
    int expected = kFree;
    if (mState.load(std::memory_order_relaxed) == kFree &&
        mState.compare_exchange_weak(expected, kLocked, std::memory_order_acquire, std::memory_order_relaxed)) {
      return;
    }
#if defined(__x86_64__) || defined(__i386__)
    __builtin_ia32_pause();
#endif
  }
  // Marking the state "with waiters" makes the holder's Unlock wake one of
  // us; whoever takes the lock from here keeps the mark, since others may
  // still sleep.
  while (mState.exchange(kLockedWithWaiters, std::memory_order_acquire) != kFree) {
    FutexWait(mState, kLockedWithWaiters);
  }
}

void RecursiveMutex::WakeOne() noexcept { FutexWakeOne(mState); }

}  // namespace kivcore::threads
