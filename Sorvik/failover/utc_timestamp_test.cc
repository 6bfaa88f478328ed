#include "Sorvik/failover/utc_timestamp.h"

#include <cstdint>
#include <ctime>
#include <random>

#include <gtest/gtest.h>

namespace sorvik {
namespace {

std::string viaGmtime(int32_t seconds) {
  const time_t t = seconds;
  std::tm parts{};
  gmtime_r(&t, &parts);
  char text[32];
  std::strftime(text, sizeof(text), "%Y-%m-%dT%H:%M:%SZ", &parts);
  return text;
}

TEST(UtcTimestampTest, KnownInstantsAcrossTheWholeRange) {
  EXPECT_EQ(format_utc_timestamp(1700000000), "2023-11-14T22:13:20Z");
  EXPECT_EQ(format_utc_timestamp(1700003600), "2023-11-14T23:13:20Z");
  EXPECT_EQ(format_utc_timestamp(0), "1970-01-01T00:00:00Z");
  EXPECT_EQ(format_utc_timestamp(-1), "1969-12-31T23:59:59Z");
  EXPECT_EQ(format_utc_timestamp(-86400), "1969-12-31T00:00:00Z");
  EXPECT_EQ(format_utc_timestamp(-86401), "1969-12-30T23:59:59Z");
  EXPECT_EQ(format_utc_timestamp(INT32_MIN), "1901-12-13T20:45:52Z");
  EXPECT_EQ(format_utc_timestamp(INT32_MAX), "2038-01-19T03:14:07Z");
  // Leap days after and before 1970.
  EXPECT_EQ(format_utc_timestamp(951782400), "2000-02-29T00:00:00Z");
  EXPECT_EQ(format_utc_timestamp(951868800), "2000-03-01T00:00:00Z");
  EXPECT_EQ(format_utc_timestamp(-2146608000), "1901-12-24T00:00:00Z");
  EXPECT_EQ(format_utc_timestamp(-1924992000), "1909-01-01T00:00:00Z");
  EXPECT_EQ(format_utc_timestamp(-2077660800), "1904-03-01T00:00:00Z");
  EXPECT_EQ(format_utc_timestamp(-2077702155), "1904-02-29T12:30:45Z");
  EXPECT_EQ(format_utc_timestamp(-616866650), "1950-06-15T08:09:10Z");
  EXPECT_EQ(format_utc_timestamp(-3599), "1969-12-31T23:00:01Z");
}

TEST(UtcTimestampTest, AgreesWithGmtimeAndStaysMonotonic) {
  std::mt19937 random(1234);
  std::uniform_int_distribution<int32_t> any(INT32_MIN, INT32_MAX);
  std::string previous = format_utc_timestamp(INT32_MIN);
  // Every day boundary of the range, one second before and after it.
  for (int64_t day = INT32_MIN / 86400 - 1; day <= INT32_MAX / 86400 + 1; ++day) {
    for (int64_t offset : {-1, 0, 1}) {
      const int64_t s = day * 86400 + offset;
      if (s < INT32_MIN || s > INT32_MAX) continue;
      const std::string text = format_utc_timestamp(static_cast<int32_t>(s));
      ASSERT_EQ(text.size(), 20u) << s;
      // Fixed-width text: lexical order is time order.
      ASSERT_LT(previous, text) << s;
      previous = text;
      if (s >= 0) {
        ASSERT_EQ(text, viaGmtime(static_cast<int32_t>(s))) << s;
      }
    }
  }
  for (int i = 0; i < 200000; ++i) {
    const int32_t s = any(random);
    if (s >= 0) {
      ASSERT_EQ(format_utc_timestamp(s), viaGmtime(s)) << s;
    }
  }
}

}  // namespace
}  // namespace sorvik
