// The formatter: C-compatible integer and string forms (checked against the C
// library; the system's messages use no other), the system's own forms (%a,
// %ls, %S, %pI4, %pI6), the two format widths, truncation and unknown
// conversions.
#include "NwBaseLib.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>

#include <cinttypes>
#include <cstdio>
#include <string>

namespace {

template <typename... Args>
std::string Ours(const char *Format, Args... Values) {
  char Buffer[512];
  const UINTN Count = AsciiSPrint(Buffer, sizeof(Buffer), Format, Values...);
  EXPECT_EQ(Count, std::string(Buffer).size()) << Format;
  return Buffer;
}

template <typename... Args>
std::u16string OursWide(const char16_t *Format, Args... Values) {
  char16_t Buffer[512];
  const UINTN Count = UnicodeSPrint(Buffer, 512, Format, Values...);
  EXPECT_EQ(Count, std::u16string(Buffer).size());
  return Buffer;
}

#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
#pragma GCC diagnostic ignored "-Wformat-security"
template <typename... Args>
std::string Libc(const char *Format, Args... Values) {
  char Buffer[512];
  snprintf(Buffer, sizeof(Buffer), Format, Values...);
  return Buffer;
}
#pragma GCC diagnostic pop

// The same call through our formatter and the C library.
#define EXPECT_LIKE_LIBC(...) EXPECT_EQ(Ours(__VA_ARGS__), Libc(__VA_ARGS__)) << #__VA_ARGS__

TEST(FormatTest, IntegersMatchTheCLibrary) {
  EXPECT_LIKE_LIBC("%d|%d|%d|%d", 0, -1, INT32_MIN, INT32_MAX);
  EXPECT_LIKE_LIBC("%i %u", -7, 4000000000u);
  EXPECT_LIKE_LIBC("[%5d][%-5d][%05d][%+d][% d][%+05d]", 42, 42, -42, 5, 5, 7);
  EXPECT_LIKE_LIBC("[%.3d][%.0d][%8.3d][%-8.3d][%08.3d]", 7, 0, -7, -7, 7);
  EXPECT_LIKE_LIBC("[%x][%X][%#x][%#x][%#X][%#o][%#o][%o]", 0xdeadbeefu, 0xabcu, 0u, 255u, 255u, 8u,
                   0u, 8u);
  EXPECT_LIKE_LIBC("[%#010x][%-#10x][%#.5x]", 0x1fu, 0x1fu, 0x1fu);
  EXPECT_LIKE_LIBC("[%*d][%-*d][%*d][%.*d][%.*d]", 5, 42, 5, 42, -5, 42, 4, 3, -1, 3);
  EXPECT_LIKE_LIBC("[%hd][%hu][%hhd][%hhu][%hhX][%hx][%04hX][%02hhX]", 70000, -1, 200, 300, 0x1ff,
                   0x12345, 2, 7);
}

TEST(FormatTest, SixtyFourBitForms) {
  EXPECT_LIKE_LIBC("%lld %lld %llu", INT64_MIN, INT64_MAX, UINT64_MAX);
  EXPECT_LIKE_LIBC("%llx %llX %#llx", UINT64_MAX, 0x0123456789ABCDEFull, 0x8000000000000000ull);
  EXPECT_LIKE_LIBC("%zu %zx %jd", static_cast<size_t>(SIZE_MAX), static_cast<size_t>(4096),
                   static_cast<intmax_t>(-5));
  // l is 64-bit in this formatter (as in the C library of the build host).
  EXPECT_LIKE_LIBC("%ld %lx 0x%lx %lu", static_cast<long>(INT64_MIN), static_cast<long>(-1),
                   static_cast<long>(0x80000000000000EL), static_cast<long>(1) << 40);
  EXPECT_LIKE_LIBC("%08lX %20lld|%-20lld|", static_cast<long>(0x12AB), INT64_MIN, INT64_MIN);
}

TEST(FormatTest, StringsAndCharactersMatchTheCLibrary) {
  EXPECT_LIKE_LIBC("[%s][%5s][%-5s][%.2s][%5.1s][%-*s]", "abc", "ab", "ab", "abcdef", "xyz", 4,
                   "q");
  EXPECT_LIKE_LIBC("[%c][%3c][%-3c][%%][%5d%%]", 'A', 'b', 'c', 50);
}

TEST(FormatTest, StringWidthFollowsTheFormat) {
  // 8-bit format: %s and %a are 8-bit, %ls and %S UCS-2.
  EXPECT_EQ(Ours("%s|%a|%ls|%S|%hs", "one", "two", u"three", u"four", "five"),
            "one|two|three|four|five");
  // UCS-2 format: %s is UCS-2, %a and %hs stay 8-bit.
  EXPECT_EQ(OursWide(u"%s %s %s:", u"map", u"CIFS", u"fs3"), u"map CIFS fs3:");
  EXPECT_EQ(OursWide(u"%a|%ls|%S|%hs|%-4s|", "x", u"y", u"z", "w", u"ab"), u"x|y|z|w|ab  |");
  // UCS-2 output from an 8-bit format.
  char16_t Wide[32];
  EXPECT_EQ(UnicodeSPrintAsciiFormat(Wide, 32, "%s=%ls %d", "k", u"v\u00e9", -3), 7u);
  EXPECT_EQ(std::u16string(Wide), u"k=v\u00e9 -3");
  // Characters above 0xFF survive in UCS-2 output and narrow to '?' in 8-bit.
  EXPECT_EQ(OursWide(u"%s%c", u"\u20ac", 0x263A), u"\u20ac\u263a");
  EXPECT_EQ(Ours("%ls%c%c", u"a\u20acb", 0x263A, 0xE9), "a?b?\xe9");
  // Wide format characters themselves pass through to UCS-2 output.
  EXPECT_EQ(OursWide(u"\u00fc%d\u20ac", 1), u"\u00fc1\u20ac");
}

TEST(FormatTest, Addresses) {
  const UINT8 Loopback[4] = {127, 0, 0, 1};
  const UINT8 Wide[4] = {255, 255, 10, 200};
  // Width applies; the address form does not swallow what follows it.
  EXPECT_EQ(Ours("%pI4|%-16pI4|%16pI4:%d", Wide, Loopback, Loopback, 445),
            "255.255.10.200|127.0.0.1       |       127.0.0.1:445");
  EXPECT_EQ(OursWide(u"%pI4", Loopback), u"127.0.0.1");

  const char *Texts[] = {"::",
                         "::1",
                         "2001:db8::1",
                         "2001:db8:0:0:1:0:0:1", // equal runs: the first is compressed
                         "1:0:0:2:0:0:0:3",      // the longer run wins
                         "2001:db8:0:1:1:1:1:1", // a single zero group stays
                         "::ffff:192.0.2.1",     // IPv4-mapped
                         "::192.0.2.1",          // IPv4-compatible
                         "::ffff:0:1",           // not mapped: the run is not 5 long
                         "0:1:0:1:0:1:0:1",
                         "1:2:3:4:5:6::"};
  for (const char *Text : Texts) {
    UINT8 Bytes[16];
    ASSERT_EQ(inet_pton(AF_INET6, Text, Bytes), 1) << Text;
    char Expected[INET6_ADDRSTRLEN];
    ASSERT_NE(inet_ntop(AF_INET6, Bytes, Expected, sizeof(Expected)), nullptr);
    EXPECT_EQ(Ours("%pI6", Bytes), Expected) << Text;
  }
  UINT8 Longest[16];
  ASSERT_EQ(inet_pton(AF_INET6, "ffff:ffff:ffff:ffff:ffff:ffff:255.255.255.255", Longest), 1);
  EXPECT_EQ(Ours("[%pI6]", Longest), "[ffff:ffff:ffff:ffff:ffff:ffff:ffff:ffff]");
}

TEST(FormatTest, UnknownConversionsPrintVerbatim) {
  EXPECT_EQ(Ours("%y|%5k|%-08.3w|%q%d", 7), "%y|%5k|%-08.3w|%q7");
  EXPECT_EQ(Ours("100%"), "100%");
  EXPECT_EQ(Ours("%-5"), "%-5");
  EXPECT_EQ(Ours("%n%d", 3), "%n3");
  EXPECT_EQ(Ours("%pX", reinterpret_cast<void *>(0x10)), "0x10X");
  EXPECT_EQ(OursWide(u"%y%"), u"%y%");
}

TEST(FormatTest, TruncationAlwaysTerminates) {
  char Buffer[16];
  memset(Buffer, 'Z', sizeof(Buffer));
  EXPECT_EQ(AsciiSPrint(Buffer, 5, "hello %s", "world"), 4u);
  EXPECT_STREQ(Buffer, "hell");
  EXPECT_EQ(Buffer[5], 'Z');

  EXPECT_EQ(AsciiSPrint(Buffer, 1, "abc"), 0u);
  EXPECT_STREQ(Buffer, "");

  memset(Buffer, 'Z', sizeof(Buffer));
  EXPECT_EQ(AsciiSPrint(Buffer, 0, "abc"), 0u);
  EXPECT_EQ(Buffer[0], 'Z');

  // Cut inside padding and inside a number.
  EXPECT_EQ(AsciiSPrint(Buffer, 6, "%10d", 1), 5u);
  EXPECT_STREQ(Buffer, "     ");
  EXPECT_EQ(AsciiSPrint(Buffer, 4, "%lld", INT64_MIN), 3u);
  EXPECT_STREQ(Buffer, "-92");
  // Huge fields into a small buffer end at once.
  EXPECT_EQ(AsciiSPrint(Buffer, 4, "%*d%99999999999s", 0x7FFFFFFF, 1, "x"), 3u);

  char16_t Wide[4];
  EXPECT_EQ(UnicodeSPrint(Wide, 4, u"%s", u"abcdef"), 3u);
  EXPECT_EQ(std::u16string(Wide), u"abc");
  EXPECT_EQ(UnicodeSPrintAsciiFormat(Wide, 4, "%d", 123456), 3u);
  EXPECT_EQ(std::u16string(Wide), u"123");

  // Precision bounds the read of an unterminated string.
  const char Unterminated[3] = {'x', 'y', 'z'};
  EXPECT_EQ(Ours("%.3s|%.*a", Unterminated, 2, Unterminated), "xyz|xy");
}

} // namespace
