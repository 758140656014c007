#include "EfiTime.h"

namespace {

constexpr INT64 kSecondsPerDay = 86400;

bool IsLeapYear(UINT32 Year) {
  return (Year % 4 == 0 && Year % 100 != 0) || Year % 400 == 0;
}

UINT32 DaysInMonth(UINT32 Year, UINT32 Month) {
  constexpr UINT8 kDays[12] = {31, 28, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
  return Month == 2 && IsLeapYear(Year) ? 29 : kDays[Month - 1];
}

} // namespace

INT64 EfiDaysFromCivil(INT64 Year, UINT32 Month, UINT32 Day) {
  // Count in years that start on 1 March, so that the leap day is the last
  // day of its year, and in 400-year eras of 146097 days.
  const INT64 Y = Month <= 2 ? Year - 1 : Year;
  const INT64 Era = (Y >= 0 ? Y : Y - 399) / 400;
  const INT64 YearOfEra = Y - Era * 400;                                        // 0..399
  const INT64 MonthFromMarch = Month > 2 ? INT64{Month} - 3 : INT64{Month} + 9; // 0..11
  const INT64 DayOfYear = (153 * MonthFromMarch + 2) / 5 + (INT64{Day} - 1);    // 0..365
  const INT64 DayOfEra = YearOfEra * 365 + YearOfEra / 4 - YearOfEra / 100 + DayOfYear;
  // 719468 days lie between 0000-03-01 and 1970-01-01.
  return Era * 146097 + DayOfEra - 719468;
}

bool EfiTimeIsValid(const EFI_TIME &Time) {
  if (Time.Year < 1900 || Time.Year > 9999 || Time.Month < 1 || Time.Month > 12) {
    return false;
  }
  if (Time.Day < 1 || Time.Day > DaysInMonth(Time.Year, Time.Month)) {
    return false;
  }
  if (Time.Hour > 23 || Time.Minute > 59 || Time.Second > 59 || Time.Nanosecond > 999999999) {
    return false;
  }
  return Time.TimeZone == kEfiUnspecifiedTimeZone ||
         (Time.TimeZone >= -1440 && Time.TimeZone <= 1440);
}

bool EfiTimeToUnixSeconds(const EFI_TIME &Time, INT64 *Seconds) {
  if (Seconds == nullptr || !EfiTimeIsValid(Time)) {
    return false;
  }
  INT64 Result = EfiDaysFromCivil(Time.Year, Time.Month, Time.Day) * kSecondsPerDay +
                 Time.Hour * 3600 + Time.Minute * 60 + Time.Second;
  if (Time.TimeZone != kEfiUnspecifiedTimeZone) {
    Result -= static_cast<INT64>(Time.TimeZone) * 60;
    if ((Time.Daylight & kEfiTimeInDaylight) != 0) {
      Result -= 3600;
    }
  }
  *Seconds = Result;
  return true;
}
