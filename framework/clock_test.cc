#include "framework/clock.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <cstring>
#include <optional>
#include <string>

namespace fw {
namespace {

// Runs each test in a chosen time zone and restores the previous one.
class MordelTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (const char* tz = getenv("TZ")) {
      saved_tz_ = tz;
    }
    UseZone("UTC");
  }
  void TearDown() override {
    if (saved_tz_) {
      setenv("TZ", saved_tz_->c_str(), 1);
    } else {
      unsetenv("TZ");
    }
    tzset();
  }

  static void UseZone(const char* tz) {
    setenv("TZ", tz, 1);
    tzset();
  }

  // Writes t into a larger buffer so a stray terminator or overrun shows.
  static std::string Write(time_t t) {
    char out[20];
    std::memset(out, '#', sizeof(out));
    TimeSince70ToMordel(t, out);
    EXPECT_EQ(std::string(4, '#'), std::string(out + 16, 4)) << "wrote past 16 characters";
    return std::string(out, 16);
  }

 private:
  std::optional<std::string> saved_tz_;
};

constexpr time_t k2009 = 1230768000;  // 2009-01-01 00:00:00 UTC

TEST_F(MordelTest, WritesYearsSince1900AndZeroMilliseconds) {
  EXPECT_EQ("1090101000000000", Write(k2009));
  EXPECT_EQ("1000101000000000", Write(946684800));   // 2000-01-01 00:00:00
  EXPECT_EQ("0991231235959000", Write(946684799));   // 1999-12-31 23:59:59
  EXPECT_EQ("1231114221320000", Write(1700000000));  // 2023-11-14 22:13:20
}

// The form is local time: five hours west of UTC, 2009 has not begun yet.
TEST_F(MordelTest, UsesLocalTime) {
  UseZone("EST5");
  EXPECT_EQ("1081231190000000", Write(k2009));
  EXPECT_EQ(k2009, MordelToTimeSince70("1081231190000000"));
}

TEST_F(MordelTest, RoundTrips) {
  for (time_t t :
       {k2009, time_t{946684799}, time_t{1700000000}, time_t{2147483647}, time_t{4102444800}}) {
    EXPECT_EQ(t, MordelToTimeSince70(Write(t).c_str())) << t;
  }
}

// Only 16 characters are read (fields are not terminated) and the last three are ignored.
TEST_F(MordelTest, ReadsSixteenCharactersIgnoringMilliseconds) {
  EXPECT_EQ(k2009, MordelToTimeSince70("1090101000000999"));
  EXPECT_EQ(k2009, MordelToTimeSince70("10901010000000001234"));
}

TEST_F(MordelTest, ReadRejectsTextWithoutSixNumbers) {
  EXPECT_EQ(-1, MordelToTimeSince70(nullptr));
  EXPECT_EQ(-1, MordelToTimeSince70(""));
  EXPECT_EQ(-1, MordelToTimeSince70("10901x1000000000"));
  EXPECT_EQ(-1, MordelToTimeSince70("1090101"));
}

TEST(ClockTest, InjectedClockAndRestore) {
  SetClockForTesting([] { return time_t{42}; });
  EXPECT_EQ(42, Now());
  SetClockForTesting({});
  const time_t real = time(nullptr);
  EXPECT_LE(real, Now());
  EXPECT_LE(Now(), real + 5);
}

}  // namespace
}  // namespace fw
