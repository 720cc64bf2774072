#include <TarnFoundation/TarnFoundation.h>
#include <kivcore/PropList.h>

#include <gtest/gtest.h>

#include <chrono>

namespace {

struct ClockScope {
  ~ClockScope() { Tarn::TimeStamp::SetClockForTesting(nullptr); }
};

TEST(TimeStamp, TestClockIsReadByEveryNewTimeStampUntilRemoved) {
  ClockScope restore;
  double now = 1000.5;
  Tarn::TimeStamp::SetClockForTesting([&now] { return now; });
  EXPECT_EQ(1000.5, Tarn::TimeStamp().GetMilliSeconds());
  now = 2500.25;
  const Tarn::TimeStamp later;
  EXPECT_EQ(2500.25, later.GetMilliSeconds());
  now = 9999.0;
  EXPECT_EQ(2500.25, later.GetMilliSeconds()) << "a time stamp is a value";

  Tarn::TimeStamp::SetClockForTesting(nullptr);
  const double before = std::chrono::duration<double, std::milli>(
                            std::chrono::steady_clock::now().time_since_epoch())
                            .count();
  const double real = Tarn::TimeStamp().GetMilliSeconds();
  const double after = std::chrono::duration<double, std::milli>(
                           std::chrono::steady_clock::now().time_since_epoch())
                           .count();
  EXPECT_LE(before, real);
  EXPECT_LE(real, after);
}

TEST(TimeStamp, TestClockMayItselfMakeTimeStamps) {
  ClockScope restore;
  int depth = 0;
  Tarn::TimeStamp::SetClockForTesting([&depth] {
    if (++depth > 1) return 1.0;
    return Tarn::TimeStamp().GetMilliSeconds() + 1.0;
  });
  EXPECT_EQ(2.0, Tarn::TimeStamp().GetMilliSeconds());
}

TEST(PropList, GivesStoredValuesAndTheDefaultForAbsentKeys) {
  kivcore::proplist::PropList properties;
  EXPECT_FALSE(properties.Has("mode"));
  EXPECT_EQ("fallback", properties.Get("mode", "fallback"));
  EXPECT_EQ("", properties.Get("mode"));
  properties.Set("mode", "batch");
  properties.Set("mode", "headless");
  EXPECT_TRUE(properties.Has("mode"));
  EXPECT_EQ("headless", properties.Get("mode", "fallback"));
  properties.Set("empty", "");
  EXPECT_TRUE(properties.Has("empty"));
  EXPECT_EQ("", properties.Get("empty", "fallback"));
}

}  // namespace
