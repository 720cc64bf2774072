/// @file
/// kivcore::utility::SmallBlockAllocator: fast storage for small objects.
///
/// Blocks up to kMaxSmallSize bytes come from per-size-class free lists kept
/// per thread; a thread takes blocks from, and returns surplus blocks to, a
/// shared pool in batches, so the common path takes no lock. Larger blocks
/// come from the general heap. Dispose must be given the size that Allocate
/// was given. A block may be disposed on another thread than it was allocated.
///
/// @code{.cpp}
///   void* p = SmallBlockAllocator::Allocate(24);   // null when exhausted
///   SmallBlockAllocator::Dispose(p, 24);
///   std::vector<int, SmallBlockAllocator::STLAllocator<int>> v;
///   struct Node : SmallBlockAllocator::Allocated<Node> { int mValue; };
/// @endcode
///
/// Threading: all functions may be called from any thread, until the thread's
/// very end: its thread_local and thread-specific-data destructors may
/// allocate and dispose too. The adaptors turn a null block into
/// std::bad_alloc; Allocate itself never throws.
#pragma once

#include <kivcore/Export.h>

#include <cstddef>
#include <cstdint>
#include <new>

namespace kivcore::utility {

/// The process's allocator for small blocks: Allocate and Dispose, and the
/// adaptors that put standard containers and classes on it. Every function
/// may be called from any thread; a block may be disposed of on another
/// thread than the one that allocated it.
class KIVCORE_API SmallBlockAllocator {
public:
  /// Blocks up to this size come from per-size pools; larger ones from the heap.
  static constexpr std::size_t kMaxSmallSize = 512;

  /// A block of at least inSize bytes, aligned for any fundamental type, or
  /// null when storage is exhausted (or a fail-after count has run out).
  static void* Allocate(std::size_t inSize) noexcept;
  /// Returns a block from Allocate; inSize must be the size it was asked for.
  /// A null inBlock is ignored.
  static void Dispose(void* inBlock, std::size_t inSize) noexcept;

  /// Allocation figures of the whole process.
  struct Statistics {
    std::size_t blocksInUse;     ///< blocks allocated and not yet disposed
    std::size_t bytesInUse;      ///< their requested sizes, summed
    std::uint64_t allocations;   ///< successful Allocate calls since load
  };
  /// Process-wide figures, summed over every thread; exact when no other
  /// thread allocates meanwhile, and otherwise off by the blocks allocated
  /// or disposed of during the call, never below zero.
  static Statistics GetStatistics();

  /// Returns to the system the pools' chunks whose every block is free and
  /// back in its pool (not held in a thread's cache); for after a burst of
  /// allocations has been freed. Takes each pool's lock in turn while it
  /// walks that pool's free blocks. Does nothing under AddressSanitizer,
  /// where every block comes from malloc.
  static void ReleaseFreeChunks() noexcept;

  /// Fault injection: the next inCount allocations succeed, then every
  /// Allocate returns null. A negative count (the default) never fails.
  static void SetFailAfter(long long inCount);

  /// Adaptor for standard containers.
  template <class T>
  class STLAllocator {
  public:
    using value_type = T;  ///< the element type
    STLAllocator() noexcept = default;
    /// Converts from the allocator of another type; all are interchangeable.
    template <class U>
    STLAllocator(const STLAllocator<U>&) noexcept {}
    /// Storage for inCount elements; throws std::bad_alloc when none is left.
    T* allocate(std::size_t inCount) {
      // A named constant: T is often a pointer, and sizeof on it is meant.
      constexpr std::size_t kElementSize = sizeof(T);
      if (inCount > static_cast<std::size_t>(-1) / kElementSize) throw std::bad_alloc();
      void* block = SmallBlockAllocator::Allocate(inCount * kElementSize);
      if (block == nullptr) throw std::bad_alloc();
      return static_cast<T*>(block);
    }
    /// Returns storage from allocate, with the same inCount.
    void deallocate(T* inBlock, std::size_t inCount) noexcept {
      constexpr std::size_t kElementSize = sizeof(T);
      SmallBlockAllocator::Dispose(inBlock, inCount * kElementSize);
    }
    /// The allocator of another element type.
    template <class U>
    struct rebind {
      using other = STLAllocator<U>;  ///< the allocator of elements of type U
    };
    /// Every instance can free what another allocated.
    /// @{
    friend bool operator==(const STLAllocator&, const STLAllocator&) noexcept { return true; }
    friend bool operator!=(const STLAllocator&, const STLAllocator&) noexcept { return false; }
    /// @}
  };

  /// Mix-in that gives a class (and the classes derived from it) small-block
  /// storage through class-specific operator new and delete. The sized delete
  /// receives the size of the complete object, so a delete through a base
  /// with a virtual destructor returns the exact block.
  template <class T>
  class Allocated {
  public:
    /// Small-block storage for one object; throws std::bad_alloc when none is left.
    static void* operator new(std::size_t inSize) {
      void* block = SmallBlockAllocator::Allocate(inSize);
      if (block == nullptr) throw std::bad_alloc();
      return block;
    }
    /// Returns the object's block, whose size is that of the complete object.
    static void operator delete(void* inBlock, std::size_t inSize) noexcept {
      SmallBlockAllocator::Dispose(inBlock, inSize);
    }
    /// Placement new, hidden otherwise by the class-specific operator new.
    static void* operator new(std::size_t, void* inPlace) noexcept { return inPlace; }
    /// Matches placement new; does nothing.
    static void operator delete(void*, void*) noexcept {}
  };
};

}  // namespace kivcore::utility
