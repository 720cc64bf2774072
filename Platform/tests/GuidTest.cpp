#include <kivcore/Guid.h>

#include <gtest/gtest.h>

#include <cctype>
#include <set>
#include <string>

using kivcore::utility::Guid;

namespace {

TEST(Guid, TextIsBracedLowerCaseHexInTheUsualGrouping) {
  for (int i = 0; i < 100; ++i) {
    const std::string text = Guid::CreateUnique().AsUTF8String();
    ASSERT_EQ(38u, text.size()) << text;
    EXPECT_EQ('{', text.front());
    EXPECT_EQ('}', text.back());
    for (std::size_t p = 1; p < 37; ++p) {
      if (p == 9 || p == 14 || p == 19 || p == 24) {
        EXPECT_EQ('-', text[p]) << text;
      } else {
        const char c = text[p];
        EXPECT_TRUE((c >= '0' && c <= '9') || (c >= 'a' && c <= 'f')) << text;
      }
    }
  }
}

TEST(Guid, EveryNewIdentifierDiffersFromTheOthersAndFromTheNilOne) {
  std::set<std::string> seen;
  const Guid nil;
  for (int i = 0; i < 20000; ++i) {
    const Guid guid = Guid::CreateUnique();
    EXPECT_FALSE(guid == nil);
    ASSERT_TRUE(seen.insert(guid.AsUTF8String()).second) << "repeated identifier after " << i;
  }
}

}  // namespace
