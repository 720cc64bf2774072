// Shared set-up of the main-thread tests: the main thread and its queue are
// process-wide, so each test starts and ends with no main thread registered,
// an empty queue and no wakeup handler.
#pragma once

#include <kivcore/MainThread.h>

#include <gtest/gtest.h>

namespace platform_test {

class MainThreadTest : public ::testing::Test {
protected:
  void SetUp() override {
    Reset();
    ASSERT_FALSE(kivcore::threads::GetRegisteredMainThread()) << "a main thread is still registered";
    ASSERT_FALSE(kivcore::threads::CurrentThreadIsMainThread());
  }
  void TearDown() override { Reset(); }

private:
  static void Reset() {
    auto adaptor = kivcore::threads::RegisterCurrentThreadAsMainThread();
    adaptor->SetWakeupHandler(nullptr);
    while (adaptor->PendingCallCount() != 0) {
      try {
        adaptor->RunPendingCalls();
      } catch (...) {
      }
    }
  }
};

}  // namespace platform_test
