#include "TestSupport.h"

#include <kivcore/Guid.h>

#include <gtest/gtest.h>

#include <set>
#include <string>
#include <vector>

using kivcore::utility::Guid;
using platform_test::Latch;
using platform_test::ThreadGroup;

namespace {

TEST(GuidThreads, IdentifiersMadeOnSeveralThreadsAtOnceAreAllDistinct) {
  constexpr int kThreads = 4;
  constexpr int kEach = 5000;
  std::vector<std::string> made[kThreads];
  {
    Latch start(kThreads);
    ThreadGroup threads;
    for (int t = 0; t < kThreads; ++t) {
      threads.Start([&, t] {
        start.CountDown();
        start.WaitFor();
        for (int i = 0; i < kEach; ++i) made[t].push_back(Guid::CreateUnique().AsUTF8String());
      });
    }
  }
  std::set<std::string> all;
  for (const auto& list : made) all.insert(list.begin(), list.end());
  EXPECT_EQ(static_cast<std::size_t>(kThreads * kEach), all.size());
}

}  // namespace
