#include "Sorvik/failover/utc_timestamp.h"

#include <cstdio>

namespace sorvik {
namespace {

struct CivilDate {
  int64_t year;
  unsigned month;  // 1..12
  unsigned day;    // 1..31
};

// Proleptic Gregorian date of `days` since 1970-01-01, in whole-number
// arithmetic so that dates before 1970 need nothing from the C library.
// Works on 400-year eras of 146097 days counted from 0000-03-01.
CivilDate civilFromDays(int64_t days) {
  days += 719468;
  const int64_t era = (days >= 0 ? days : days - 146096) / 146097;
  const int64_t dayOfEra = days - era * 146097;                                        // [0, 146096]
  const int64_t yearOfEra = (dayOfEra - dayOfEra / 1460 + dayOfEra / 36524 - dayOfEra / 146096) / 365;  // [0, 399]
  const int64_t dayOfYear = dayOfEra - (365 * yearOfEra + yearOfEra / 4 - yearOfEra / 100);            // [0, 365]
  const int64_t shiftedMonth = (5 * dayOfYear + 2) / 153;                              // [0, 11], March first
  const unsigned day = static_cast<unsigned>(dayOfYear - (153 * shiftedMonth + 2) / 5 + 1);
  const unsigned month = static_cast<unsigned>(shiftedMonth < 10 ? shiftedMonth + 3 : shiftedMonth - 9);
  const int64_t year = yearOfEra + era * 400 + (month <= 2 ? 1 : 0);
  return {year, month, day};
}

}  // namespace

std::string format_utc_timestamp(int32_t seconds) {
  const int64_t total = seconds;
  int64_t days = total / 86400;
  int64_t secondOfDay = total % 86400;
  if (secondOfDay < 0) {
    secondOfDay += 86400;
    --days;
  }
  const CivilDate date = civilFromDays(days);
  char text[48];
  std::snprintf(text, sizeof(text), "%04lld-%02u-%02uT%02d:%02d:%02dZ", static_cast<long long>(date.year),
                date.month, date.day, static_cast<int>(secondOfDay / 3600), static_cast<int>(secondOfDay / 60 % 60),
                static_cast<int>(secondOfDay % 60));
  return text;
}

}  // namespace sorvik
