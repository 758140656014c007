// The pure pieces of the firmware image's platform layer, run on the host:
// address text parsing and calendar conversion, each cross-checked against
// the C library, which implements the same rules. (The block-memory
// primitives are in every firmware test's path.)
//
// The firmware platform's translation units are compiled into this test
// directly; the image's socket and runtime files themselves would clash with
// the host's.
#include "../../Platform/Uefi/EfiTime.cpp"
#include "../../Platform/Uefi/InetText.cpp"

#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <time.h>

#include <cstring>
#include <random>
#include <string>
#include <vector>

namespace {

// --- Address text -------------------------------------------------------------

// Our parser and the C library's must agree on acceptance and on the bytes.
// Size is the address's byte count: 4 for IPv4, 16 for IPv6.
void ExpectSameAsLibc(const std::string &Text, size_t Size) {
  uint8_t Ours[16], Theirs[16];
  std::memset(Ours, 0xAA, sizeof(Ours));
  std::memset(Theirs, 0xAA, sizeof(Theirs));
  const bool Accepted =
      Size == 4 ? NwParseInet4(Text.c_str(), Ours) : NwParseInet6(Text.c_str(), Ours);
  const bool LibcAccepted = inet_pton(Size == 4 ? AF_INET : AF_INET6, Text.c_str(), Theirs) == 1;
  ASSERT_EQ(Accepted, LibcAccepted) << "\"" << Text << "\"";
  EXPECT_EQ(0, std::memcmp(Ours, Theirs, sizeof(Ours))) << "\"" << Text << "\"";
}

// Random texts built from address pieces, so that most are near misses of a
// valid address rather than noise.
TEST(InetText, GeneratedTextsAgreeWithLibc) {
  std::mt19937 Random(20241122);
  const std::vector<std::string> Pieces = {"0",  "1",   "ff", "FFFF",    "12345", "abc",
                                           ":",  "::",  ".",  "1.2.3.4", "255",   "256",
                                           "00", "0.0", "g",  "%",       "9"};
  std::uniform_int_distribution<size_t> PieceOf(0, Pieces.size() - 1);
  std::uniform_int_distribution<int> LengthOf(0, 12);
  for (int Round = 0; Round < 3000; Round++) {
    std::string Text;
    for (int I = LengthOf(Random); I > 0; I--) {
      Text += Pieces[PieceOf(Random)];
    }
    ExpectSameAsLibc(Text, 16);
    ExpectSameAsLibc(Text, 4);
    if (HasFatalFailure()) {
      return;
    }
  }
}

// --- Calendar time --------------------------------------------------------------

EFI_TIME MakeTime(UINT16 Year, UINT8 Month, UINT8 Day, UINT8 Hour = 0, UINT8 Minute = 0,
                  UINT8 Second = 0, INT16 TimeZone = kEfiUnspecifiedTimeZone) {
  return {Year, Month, Day, Hour, Minute, Second, 0, 0, TimeZone, 0, 0};
}

// Every day of the years where the leap rules differ.
TEST(EfiTime, EveryDayOfTheLeapRuleYearsMatchesTimegm) {
  for (int Year : {1900, 1969, 1970, 2000, 2023, 2024, 2100, 2400}) {
    for (int Month = 1; Month <= 12; Month++) {
      for (int Day = 1; Day <= 31; Day++) {
        struct tm Tm = {};
        Tm.tm_year = Year - 1900;
        Tm.tm_mon = Month - 1;
        Tm.tm_mday = Day;
        Tm.tm_hour = 13;
        Tm.tm_min = 59;
        Tm.tm_sec = 58;
        const time_t Expected = timegm(&Tm);
        // timegm normalises 31 April to 1 May; such a date is no EFI_TIME.
        const bool Exists = Tm.tm_mday == Day;
        const EFI_TIME Time = MakeTime(static_cast<UINT16>(Year), static_cast<UINT8>(Month),
                                       static_cast<UINT8>(Day), 13, 59, 58);
        INT64 Seconds = -1;
        ASSERT_EQ(Exists, EfiTimeToUnixSeconds(Time, &Seconds))
            << Year << "-" << Month << "-" << Day;
        if (Exists) {
          ASSERT_EQ(static_cast<INT64>(Expected), Seconds) << Year << "-" << Month << "-" << Day;
        }
      }
    }
  }
}

TEST(EfiTime, ZoneAndDaylightShiftToUtc) {
  INT64 Utc = 0;
  INT64 Seconds = 0;
  ASSERT_TRUE(EfiTimeToUnixSeconds(MakeTime(2026, 11, 22, 18, 43, 0, 0), &Utc));
  // Local time one hour ahead of UTC (zone +60) names the same instant.
  ASSERT_TRUE(EfiTimeToUnixSeconds(MakeTime(2026, 11, 22, 19, 43, 0, 60), &Seconds));
  EXPECT_EQ(Utc, Seconds);
  ASSERT_TRUE(EfiTimeToUnixSeconds(MakeTime(2026, 11, 22, 13, 43, 0, -300), &Seconds));
  EXPECT_EQ(Utc, Seconds);
  // Across midnight and the year boundary.
  ASSERT_TRUE(EfiTimeToUnixSeconds(MakeTime(2027, 1, 1, 0, 30, 0, 120), &Seconds));
  EXPECT_EQ(1798763400 - 7200, Seconds); // 2026-12-31 22:30 UTC

  // In daylight time a known zone's clock runs one more hour ahead.
  EFI_TIME Summer = MakeTime(2026, 7, 1, 14, 0, 0, 60);
  Summer.Daylight = kEfiTimeAdjustDaylight | kEfiTimeInDaylight;
  ASSERT_TRUE(EfiTimeToUnixSeconds(Summer, &Seconds));
  EXPECT_EQ(1782907200, Seconds); // 12:00 UTC
  // With no known zone the clock is taken as UTC, daylight bit or not.
  Summer.TimeZone = kEfiUnspecifiedTimeZone;
  ASSERT_TRUE(EfiTimeToUnixSeconds(Summer, &Seconds));
  EXPECT_EQ(1782914400, Seconds); // 14:00 UTC
}

} // namespace
