#include "TestSupport.h"

#include <kivcore/ImmutableString.h>

#include <atomic>
#include <string>
#include <string_view>

using kivcore::utility::ImmutableString;

namespace {

// Texts are compared whole, embedded NUL bytes included, and copied in.
// Copies, assignments (to itself too) and moves keep the count exact: a text
// goes with its last string.
TEST(ImmutableString, EqualTextsShareOneIdentityAndGoWithTheirLastString) {
  const std::size_t before = ImmutableString::InternedCount();
  {
    std::string built = "tarn.idle";
    ImmutableString a = ImmutableString::CreateDynamic(built);
    built[0] = 'X';
    ImmutableString b = ImmutableString::CreateStatic("tarn.idle");
    EXPECT_TRUE(a == b && !(a < b) && !(b < a) && std::string_view(b.c_str()) == "tarn.idle");
    for (const char* other : {"", "a", "tarn.idl", "tarn.idlE", "tarn.idle."})
      EXPECT_TRUE(a != ImmutableString::CreateStatic(other) && other != std::string_view(a.c_str())) << other;
    const ImmutableString nul = ImmutableString::CreateDynamic(std::string("a\0b", 3));
    EXPECT_TRUE(nul.size() == 3 && nul != ImmutableString::CreateStatic("a") &&
                ImmutableString::CreateStatic("").empty());
    EXPECT_EQ(before + 2, ImmutableString::InternedCount()) << "the empty text is not interned";
    ImmutableString& alias = b;
    b = alias;
    ImmutableString c(std::move(a));
    b = ImmutableString::CreateDynamic("tarn.busy");
    EXPECT_TRUE(a.empty() && c != b && c.size() == 9);
    c = b;
    EXPECT_EQ(before + 2, ImmutableString::InternedCount()) << "the last tarn.idle was assigned over";
    a = std::move(c);
    EXPECT_TRUE(c.empty() && a == b);
  }
  EXPECT_EQ(before, ImmutableString::InternedCount());
}

// Each thread interns the same texts in its own order, then churns one text:
// its last release keeps racing another thread's new intern of it, and a
// string obtained while the old representation is freed must be a live one
// (a freed one shows up as a wrong length, the heap reusing its first words,
// or under the sanitizers). One identity per text.
TEST(ImmutableStringThreads, ThreadsInterningAndReleasingTheSameTextsAgreeOnLiveIdentities) {
  constexpr int kThreads = 4;
  constexpr int kTexts = 211;  // prime, so every stride below visits every text
  const std::size_t before = ImmutableString::InternedCount();
  std::vector<ImmutableString> results[kThreads];
  std::atomic<int> mismatches{0};
  {
    platform_test::ThreadGroup threads;
    for (int t = 0; t < kThreads; ++t) {
      threads.Start([&, t] {
        results[t].resize(kTexts);
        for (int k = 0, i = 0; k < kTexts; i = ++k * (2 * t + 1) % kTexts) {
          const std::string text = "concurrent." + std::to_string(i);
          results[t][i] =
              k % 2 == 0 ? ImmutableString::CreateDynamic(text) : ImmutableString::CreateStatic(text.c_str());
        }
        for (int i = 0; i < 100000; ++i) {
          const ImmutableString made = ImmutableString::CreateDynamic("churn.same");
          if (made.size() != 10 || std::string_view(made.c_str()) != "churn.same") mismatches.fetch_add(1);
        }
      });
    }
  }
  EXPECT_EQ(0, mismatches.load());
  EXPECT_EQ(before + kTexts, ImmutableString::InternedCount());
  for (int i = 0; i < kTexts * kThreads; ++i)
    ASSERT_TRUE(results[i / kTexts][i % kTexts] == results[0][i % kTexts] &&
                results[0][i % kTexts].c_str() == "concurrent." + std::to_string(i % kTexts))
        << i;
}

}  // namespace
