// Conversion of the firmware's calendar time (EFI_TIME) to seconds since
// 1970-01-01 00:00:00 UTC. Pure code.
#pragma once

#include "Uefi.h"

constexpr INT16 kEfiUnspecifiedTimeZone = 0x07FF;
constexpr UINT8 kEfiTimeAdjustDaylight = 0x01;
constexpr UINT8 kEfiTimeInDaylight = 0x02;

// Days from 1970-01-01 to the given proleptic Gregorian date (negative
// before it). Month 1-12, Day 1-31; not validated.
INT64 EfiDaysFromCivil(INT64 Year, UINT32 Month, UINT32 Day);

// True when every field is within its documented range: year 1900-9999,
// month 1-12, a day that exists in that month, hour 0-23, minute and second
// 0-59, nanosecond below 10^9, time zone -1440..1440 or unspecified.
bool EfiTimeIsValid(const EFI_TIME &Time);

// Seconds since the epoch, UTC. TimeZone is the local time's offset from UTC
// in minutes (local = UTC + TimeZone); an unspecified zone means the clock
// keeps local time with no known offset, taken as UTC. With the in-daylight
// bit and a known zone the clock runs one hour ahead of the zone's standard
// time. False (and Seconds untouched) for an invalid time.
bool EfiTimeToUnixSeconds(const EFI_TIME &Time, INT64 *Seconds);
