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
  constexpr int kTexts = 211;  // prime, so every stride below visits every text
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
// Each thread holds the text only briefly, so its count keeps dropping to
// zero while another thread is interning it again.
TEST(ImmutableStringThreads, ReleasingTheLastReferenceWhileOthersInternTheSameTextIsSafe) {
  constexpr int kRounds = 200000;
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
          // A representation freed under a live string shows up as a wrong
          // length first: the heap reuses the freed block's first words.
          if (s.size() != 10 || std::string_view(s.c_str()) != "churn.same") mismatches.fetch_add(1);
          if (i % 64 == 0) {
            ImmutableString copy = s;
            if (!(copy == s)) mismatches.fetch_add(1);
          }
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
