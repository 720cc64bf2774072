#include "TestSupport.h"

#include <kivcore/ImmutableString.h>

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <string>
#include <vector>

using kivcore::utility::ImmutableString;
using platform_test::Latch;
using platform_test::ThreadGroup;

namespace {

constexpr int kThreads = 4;

TEST(ImmutableStringThreads, ThreadsInterningTheSameTextsAtOnceGetOneIdentityPerText) {
  constexpr int kTexts = 200;
  const std::size_t before = ImmutableString::InternedCount();
  std::array<std::vector<ImmutableString>, kThreads> results;
  {
    Latch start(kThreads);
    ThreadGroup threads;
    for (int t = 0; t < kThreads; ++t) {
      threads.Start([&, t] {
        start.CountDown();
        start.WaitFor();
        // Each thread walks the texts in a different order, half of them
        // made statically and half dynamically.
        std::vector<ImmutableString>& mine = results[t];
        mine.resize(kTexts);
        for (int k = 0; k < kTexts; ++k) {
          const int i = (k * (2 * t + 1)) % kTexts;
          const std::string text = "concurrent.intern." + std::to_string(i);
          mine[i] = (k + t) % 2 == 0 ? ImmutableString::CreateDynamic(text) : ImmutableString::CreateStatic(text.c_str());
        }
      });
    }
  }
  EXPECT_EQ(before + kTexts, ImmutableString::InternedCount());
  for (int i = 0; i < kTexts; ++i) {
    for (int t = 1; t < kThreads; ++t) EXPECT_TRUE(results[0][i] == results[t][i]) << "text " << i << " thread " << t;
    EXPECT_EQ("concurrent.intern." + std::to_string(i), results[0][i].c_str());
  }
  for (auto& r : results) r.clear();
  EXPECT_EQ(before, ImmutableString::InternedCount());
}

// The last release of a text races new interns of the same text: a string
// obtained while the old representation is being freed must be a live one.
TEST(ImmutableStringThreads, ReleasingTheLastReferenceWhileOthersInternTheSameTextIsSafe) {
  constexpr int kRounds = 20000;
  const std::size_t before = ImmutableString::InternedCount();
  std::atomic<int> mismatches{0};
  {
    Latch start(kThreads);
    ThreadGroup threads;
    for (int t = 0; t < kThreads; ++t) {
      threads.Start([&] {
        start.CountDown();
        start.WaitFor();
        for (int i = 0; i < kRounds; ++i) {
          ImmutableString s = (i % 2 == 0) ? ImmutableString::CreateStatic("churn.same")
                                           : ImmutableString::CreateDynamic("churn.same");
          ImmutableString copy = s;
          if (std::string_view(copy.c_str()) != "churn.same" || !(copy == s)) mismatches.fetch_add(1);
          // Both go here, often as the last references to the text.
        }
      });
    }
  }
  EXPECT_EQ(0, mismatches.load());
  EXPECT_EQ(before, ImmutableString::InternedCount());
}

TEST(ImmutableStringThreads, CopiesSharedAcrossThreadsAreCountedExactly) {
  constexpr int kCopies = 5000;
  const std::size_t before = ImmutableString::InternedCount();
  {
    ImmutableString shared = ImmutableString::CreateDynamic("shared.copies");
    ThreadGroup threads;
    for (int t = 0; t < kThreads; ++t) {
      threads.Start([&] {
        std::vector<ImmutableString> copies(kCopies, shared);
        for (ImmutableString& c : copies) c = ImmutableString(c);
      });
    }
    threads.JoinAll();
    EXPECT_EQ(before + 1, ImmutableString::InternedCount());
    EXPECT_STREQ("shared.copies", shared.c_str());
  }
  EXPECT_EQ(before, ImmutableString::InternedCount());
}

}  // namespace
