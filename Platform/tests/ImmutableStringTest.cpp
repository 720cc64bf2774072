#include <kivcore/ImmutableString.h>

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <string>
#include <utility>
#include <vector>

using kivcore::utility::ImmutableString;

namespace {

TEST(ImmutableStringIdentity, StaticAndDynamicStringsOfOneTextAreEqual) {
  std::string built = "tarn.";
  built += "idle";
  ImmutableString fromLiteral = ImmutableString::CreateStatic("tarn.idle");
  ImmutableString fromBytes = ImmutableString::CreateDynamic(built);
  EXPECT_TRUE(fromLiteral == fromBytes);
  EXPECT_FALSE(fromLiteral != fromBytes);
  // One interned text, so both give the same storage.
  EXPECT_EQ(fromLiteral.c_str(), fromBytes.c_str());
  EXPECT_STREQ("tarn.idle", fromBytes.c_str());
  EXPECT_EQ(9u, fromBytes.size());
}

TEST(ImmutableStringIdentity, DifferentTextsAreDifferentStrings) {
  ImmutableString a = ImmutableString::CreateStatic("tarn.repeat");
  ImmutableString b = ImmutableString::CreateStatic("tarn.repeaT");
  ImmutableString prefix = ImmutableString::CreateStatic("tarn.repea");
  EXPECT_TRUE(a != b);
  EXPECT_TRUE(a != prefix);
  EXPECT_FALSE(a == b);
}

TEST(ImmutableStringIdentity, DynamicTextIsCopiedNotReferenced) {
  std::string source = "tarn.mutable";
  ImmutableString copy = ImmutableString::CreateDynamic(source);
  source[0] = 'X';
  EXPECT_STREQ("tarn.mutable", copy.c_str());
}

TEST(ImmutableStringIdentity, EmbeddedNulBytesArePartOfTheText) {
  const std::string withNul("a\0b", 3);
  const std::string withOtherNul("a\0c", 3);
  ImmutableString s = ImmutableString::CreateDynamic(withNul);
  EXPECT_EQ(3u, s.size());
  EXPECT_TRUE(s != ImmutableString::CreateDynamic(withOtherNul));
  EXPECT_TRUE(s != ImmutableString::CreateStatic("a"));
  EXPECT_TRUE(s == ImmutableString::CreateDynamic(withNul));
}

TEST(ImmutableStringEmpty, EmptyTextIsTheDefaultString) {
  ImmutableString none;
  EXPECT_TRUE(none.empty());
  EXPECT_STREQ("", none.c_str());
  EXPECT_EQ(0u, none.size());
  EXPECT_TRUE(ImmutableString::CreateStatic("") == none);
  EXPECT_TRUE(ImmutableString::CreateDynamic(std::string_view()) == none);
  EXPECT_TRUE(ImmutableString::CreateDynamic("").empty());
  EXPECT_FALSE(ImmutableString::CreateStatic("x").empty());
}

TEST(ImmutableStringEmpty, EmptyStringInternsNothing) {
  const std::size_t before = ImmutableString::InternedCount();
  ImmutableString a = ImmutableString::CreateStatic("");
  ImmutableString b = ImmutableString::CreateDynamic("");
  EXPECT_EQ(before, ImmutableString::InternedCount());
}

TEST(ImmutableStringOrder, LessThanIsAStrictOrderConsistentWithEquality) {
  std::vector<ImmutableString> strings;
  for (int i = 0; i < 50; ++i) strings.push_back(ImmutableString::CreateDynamic("order." + std::to_string(i)));
  strings.push_back(ImmutableString());
  // Equal copies of some entries: they must be neither less nor greater.
  strings.push_back(ImmutableString::CreateStatic("order.7"));
  strings.push_back(ImmutableString::CreateStatic("order.42"));

  for (const ImmutableString& a : strings) {
    EXPECT_FALSE(a < a);
    for (const ImmutableString& b : strings) {
      const bool less = a < b;
      const bool greater = b < a;
      EXPECT_FALSE(less && greater);
      EXPECT_EQ(a == b, !less && !greater) << a.c_str() << " vs " << b.c_str();
    }
  }
  std::vector<ImmutableString> sorted = strings;
  std::sort(sorted.begin(), sorted.end());
  EXPECT_TRUE(std::is_sorted(sorted.begin(), sorted.end()));
  EXPECT_EQ(strings.size() - 2, static_cast<std::size_t>(std::unique(sorted.begin(), sorted.end()) - sorted.begin()));
}

TEST(ImmutableStringLifetime, TextIsFreedWhenItsLastStringGoes) {
  const std::size_t before = ImmutableString::InternedCount();
  {
    ImmutableString a = ImmutableString::CreateDynamic("lifetime.one");
    EXPECT_EQ(before + 1, ImmutableString::InternedCount());
    ImmutableString b = a;
    ImmutableString c = ImmutableString::CreateStatic("lifetime.one");
    EXPECT_EQ(before + 1, ImmutableString::InternedCount());
    a = ImmutableString();
    b = ImmutableString();
    EXPECT_EQ(before + 1, ImmutableString::InternedCount()) << "c still names the text";
  }
  EXPECT_EQ(before, ImmutableString::InternedCount());
}

TEST(ImmutableStringLifetime, TextFreedAndInternedAgainIsUsable) {
  const std::size_t before = ImmutableString::InternedCount();
  { ImmutableString once = ImmutableString::CreateStatic("lifetime.again"); }
  EXPECT_EQ(before, ImmutableString::InternedCount());
  ImmutableString again = ImmutableString::CreateStatic("lifetime.again");
  EXPECT_STREQ("lifetime.again", again.c_str());
  EXPECT_TRUE(again == ImmutableString::CreateDynamic("lifetime.again"));
}

TEST(ImmutableStringValue, SelfAssignmentKeepsTheText) {
  const std::size_t before = ImmutableString::InternedCount();
  {
    ImmutableString s = ImmutableString::CreateDynamic("value.self");
    ImmutableString& alias = s;
    s = alias;
    EXPECT_STREQ("value.self", s.c_str());
    s = std::move(alias);
    EXPECT_STREQ("value.self", s.c_str());
  }
  EXPECT_EQ(before, ImmutableString::InternedCount());
}

TEST(ImmutableStringValue, AssigningOverTheLastReferenceFreesTheOldText) {
  const std::size_t before = ImmutableString::InternedCount();
  ImmutableString s = ImmutableString::CreateDynamic("value.first");
  s = ImmutableString::CreateDynamic("value.second");
  EXPECT_EQ(before + 1, ImmutableString::InternedCount());
  EXPECT_STREQ("value.second", s.c_str());
  ImmutableString other = ImmutableString::CreateDynamic("value.third");
  s = other;
  EXPECT_EQ(before + 1, ImmutableString::InternedCount());
  EXPECT_TRUE(s == other);
}

TEST(ImmutableStringValue, MovingTransfersTheReferenceWithoutCopying) {
  const std::size_t before = ImmutableString::InternedCount();
  {
    ImmutableString source = ImmutableString::CreateDynamic("value.moved");
    ImmutableString target(std::move(source));
    EXPECT_TRUE(source.empty());  // a moved-from string is empty
    EXPECT_STREQ("value.moved", target.c_str());
    ImmutableString assigned;
    assigned = std::move(target);
    EXPECT_TRUE(target.empty());
    EXPECT_EQ(before + 1, ImmutableString::InternedCount());
  }
  EXPECT_EQ(before, ImmutableString::InternedCount());
}

TEST(ImmutableStringValue, LongTextsKeepEveryByte) {
  std::string text(100000, 'q');
  text[54321] = 'z';
  ImmutableString s = ImmutableString::CreateDynamic(text);
  EXPECT_EQ(text.size(), s.size());
  EXPECT_EQ(text, std::string(s.c_str(), s.size()));
  EXPECT_EQ(text.size(), std::strlen(s.c_str()));
}

}  // namespace
