// Fault injection on the general heap, as SmallBlockAllocator::SetFailAfter
// gives it for small-block storage: this header replaces the global operator
// new and delete of the executable (the library reaches them too), so
// include it from exactly one source file of an executable.
//
//   messaging_test::FailHeapAfter(2);   // this thread: two more allocations, then one std::bad_alloc
//   ...
//   messaging_test::FailHeapAfter(-1);  // disarmed (the default)
//
// Unlike the small-block allowance, only the one allocation fails: what the
// caller does after the failure (a catch block that allocates) succeeds.
//
// Threading: the allowance is per thread; other threads never fail.
#pragma once

#include <cstdlib>
#include <new>

namespace messaging_test {

// Allocations left on this thread before the heap fails; negative: never fails.
inline thread_local long long tHeapAllowance = -1;

inline void FailHeapAfter(long long inSucceeding) { tHeapAllowance = inSucceeding; }

inline void* AllocateOrFail(std::size_t inSize) {
  if (tHeapAllowance >= 0 && tHeapAllowance-- == 0) throw std::bad_alloc();
  if (void* block = std::malloc(inSize == 0 ? 1 : inSize)) return block;
  throw std::bad_alloc();
}

}  // namespace messaging_test

// Every form whose blocks these deletes free is replaced (a sanitizer's own
// would not match them); the array forms pair with each other, or, without a
// sanitizer, the standard library's call these.
void* operator new(std::size_t inSize) { return messaging_test::AllocateOrFail(inSize); }
void* operator new(std::size_t inSize, const std::nothrow_t&) noexcept { return std::malloc(inSize == 0 ? 1 : inSize); }
void operator delete(void* inBlock) noexcept { std::free(inBlock); }
void operator delete(void* inBlock, std::size_t) noexcept { std::free(inBlock); }
void operator delete(void* inBlock, const std::nothrow_t&) noexcept { std::free(inBlock); }
