// kivcore::threads::Gate: a one-way barrier; closed until opened, then open
// for good.
//
//   Gate gate(false);
//   // waiter:  gate.PassThrough(-1);   // blocks until Open
//   // opener:  gate.Open();            // releases every waiter
//
// Threading: all operations may be called from any thread. Open on an open
// gate is harmless. The gate must outlive its waiters (hold it by shared_ptr).
#pragma once

#include <kivcore/Export.h>

#include <condition_variable>
#include <mutex>

namespace kivcore::threads {

class KIVCORE_API Gate {
public:
  explicit Gate(bool inOpen);
  Gate(const Gate&) = delete;
  Gate& operator=(const Gate&) = delete;

  void Open();
  bool IsOpen() const;
  // Waits until the gate is open or inTimeoutMilliseconds have passed (-1: no
  // limit). Returns true when the gate is open.
  bool PassThrough(int inTimeoutMilliseconds);

private:
  mutable std::mutex mMutex;
  std::condition_variable mOpened;
  bool mOpen;  // guarded by mMutex
};

}  // namespace kivcore::threads
