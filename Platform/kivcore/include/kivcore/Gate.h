/// @file
/// kivcore::threads::Gate: a one-way barrier; closed until opened, then open
/// for good.
///
/// @code{.cpp}
///   Gate gate(false);
///   // waiter:  gate.PassThrough(-1);   // blocks until Open
///   // opener:  gate.Open();            // releases every waiter
/// @endcode
///
/// Threading: all operations may be called from any thread. Open on an open
/// gate is harmless. The gate must outlive its waiters (hold it by shared_ptr).
#pragma once

#include <kivcore/Export.h>

#include <condition_variable>
#include <mutex>

namespace kivcore::threads {

/// A one-way barrier, closed until opened and then open for good. Every
/// operation may be called from any thread; hold the gate by shared_ptr so
/// that it outlives its waiters.
class KIVCORE_API Gate {
public:
  /// A gate that starts open when inOpen is true, closed otherwise.
  explicit Gate(bool inOpen);
  Gate(const Gate&) = delete;
  Gate& operator=(const Gate&) = delete;

  /// Opens the gate and releases every waiter; harmless on an open gate.
  void Open();
  /// Whether the gate has been opened.
  bool IsOpen() const;
  /// Waits until the gate is open or inTimeoutMilliseconds have passed (-1: no
  /// limit). Returns true when the gate is open.
  bool PassThrough(int inTimeoutMilliseconds);

private:
  mutable std::mutex mMutex;
  std::condition_variable mOpened;
  bool mOpen;  // guarded by mMutex
};

}  // namespace kivcore::threads
