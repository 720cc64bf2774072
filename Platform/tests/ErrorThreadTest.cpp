#include "TestSupport.h"

#include <kivcore/Debug.h>
#include <kivcore/Error.h>

#include <gtest/gtest.h>

#include <atomic>
#include <stdexcept>
#include <string>

using namespace kivcore;
using platform_test::Latch;
using platform_test::ThreadGroup;

namespace {

void Report(const char* inKey) {
  config::ThrowError(0, inKey, 105, 25, true, config::ReplacementValue(), config::ReplacementValue(),
                     config::ReplacementValue(), config::ReplacementValue());
}

TEST(ErrorReportingThreads, AContractFailureIsReportedOnlyOnTheThreadThatSawIt) {
  Latch recorded(1);
  Latch reported(1);
  std::string otherWhat;
  std::string ownWhat;
  ThreadGroup threads;
  threads.Start([&] {
    debug::BreakAfterContractDialog("mine", "t.cpp", "Worker::Check", 3);
    recorded.CountDown();
    if (!reported.WaitFor()) return;
    try {
      Report("$$$/Test=Failed");
    } catch (const config::Error& e) {
      ownWhat = e.what();
    }
  });
  ASSERT_TRUE(recorded.WaitFor());
  try {
    Report("$$$/Test=Failed");
  } catch (const config::Error& e) {
    otherWhat = e.what();
  }
  reported.CountDown();
  threads.JoinAll();
  EXPECT_EQ("Failed", otherWhat);
  EXPECT_EQ("Failed: mine in Worker::Check at t.cpp:3", ownWhat);
}

TEST(ErrorReportingThreads, EachReportReachesExactlyOneHandlerWhileHandlersAreSwapped) {
  constexpr int kReporters = 3;
  constexpr int kReports = 5000;
  std::atomic<int> toFirst{0};
  std::atomic<int> toSecond{0};
  std::atomic<int> escaped{0};
  std::atomic<int> reportersDone{0};
  config::SetErrorHandler([&](const config::ErrorReport&) { toFirst.fetch_add(1); });
  {
    ThreadGroup threads;
    threads.Start([&] {
      bool first = false;
      while (reportersDone.load() < kReporters) {
        if (first) config::SetErrorHandler([&](const config::ErrorReport&) { toFirst.fetch_add(1); });
        else config::SetErrorHandler([&](const config::ErrorReport&) { toSecond.fetch_add(1); });
        first = !first;
      }
    });
    for (int r = 0; r < kReporters; ++r) {
      threads.Start([&] {
        for (int i = 0; i < kReports; ++i) {
          try {
            Report("$$$/Test=Swapped");
          } catch (...) {
            escaped.fetch_add(1);
          }
        }
        reportersDone.fetch_add(1);
      });
    }
  }
  config::SetErrorHandler(nullptr);
  EXPECT_EQ(0, escaped.load());
  EXPECT_EQ(kReporters * kReports, toFirst.load() + toSecond.load());
}

TEST(ErrorReportingThreads, GuardedCallsOnSeveralThreadsEachReachTheExceptionHandlerOnce) {
  constexpr int kThreads = 4;
  constexpr int kCalls = 2000;
  std::atomic<int> handled{0};
  config::ErrorManager::SetExceptionHandler([&](std::exception_ptr) { handled.fetch_add(1); });
  {
    ThreadGroup threads;
    for (int t = 0; t < kThreads; ++t) {
      threads.Start([] {
        for (int i = 0; i < kCalls; ++i)
          config::ErrorManager::Get(false)->GuardedCall([]() -> int { throw std::runtime_error("x"); });
      });
    }
  }
  config::ErrorManager::SetExceptionHandler(nullptr);
  EXPECT_EQ(kThreads * kCalls, handled.load());
}

}  // namespace
