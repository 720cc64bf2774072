// Strings made in two shared libraries from the same text are one identity:
// the intern table lives once per process, inside kivcore. With hidden
// visibility, a table kept in header templates would give each module its own.
#include <kivcore/ImmutableString.h>

#include <gtest/gtest.h>

#include <string>

extern "C" void InternModuleMakeStatic(const char* inText, kivcore::utility::ImmutableString* outString);
extern "C" void InternModuleMakeDynamic(const char* inText, kivcore::utility::ImmutableString* outString);

namespace {

using kivcore::utility::ImmutableString;

TEST(InternAcrossModules, SameTextMadeInAnotherLibraryIsTheSameString) {
  ImmutableString fromModule;
  InternModuleMakeStatic("tarn.test.across.modules", &fromModule);
  const ImmutableString here = ImmutableString::CreateDynamic(std::string("tarn.test.across.") + "modules");
  EXPECT_TRUE(here == fromModule);
  EXPECT_FALSE(here < fromModule || fromModule < here);
  EXPECT_STREQ("tarn.test.across.modules", fromModule.c_str());
}

TEST(InternAcrossModules, DifferentTextsFromTwoLibrariesStayDistinctAndOrdered) {
  ImmutableString first;
  ImmutableString second;
  InternModuleMakeDynamic("tarn.test.first", &first);
  InternModuleMakeStatic("tarn.test.second", &second);
  const ImmutableString secondHere = ImmutableString::CreateStatic("tarn.test.second");
  EXPECT_FALSE(first == second);
  EXPECT_TRUE(second == secondHere);
  EXPECT_NE(first < second, second < first);
}

TEST(InternAcrossModules, ATextReleasedInOneLibraryIsFreedForAll) {
  const std::size_t before = ImmutableString::InternedCount();
  {
    ImmutableString fromModule;
    InternModuleMakeDynamic("tarn.test.released.across.modules", &fromModule);
    const ImmutableString here = ImmutableString::CreateStatic("tarn.test.released.across.modules");
    EXPECT_EQ(before + 1, ImmutableString::InternedCount());
  }
  EXPECT_EQ(before, ImmutableString::InternedCount());
}

}  // namespace
