// Pool, memory and string helpers of the freestanding library.
#include "HostImageFixture.h"

#include <cstring>
#include <string>

namespace {

using BaseLibTest = HostImageTest;

TEST_F(BaseLibTest, PoolCopiesAndFailures) {
  UINT8 *Zeroed = static_cast<UINT8 *>(AllocateZeroPool(100));
  ASSERT_NE(Zeroed, nullptr);
  EXPECT_EQ(std::string(Zeroed, Zeroed + 100), std::string(100, '\0'));
  char *Copy = static_cast<char *>(AllocateCopyPool(8, "copy me"));
  ASSERT_NE(Copy, nullptr);
  EXPECT_STREQ(Copy, "copy me");
  FreePool(Zeroed);
  FreePool(Copy);
  FreePool(nullptr);
  for (auto Allocate : std::initializer_list<void *(*)()>{
           [] { return AllocateZeroPool(8); }, [] { return static_cast<void *>(StrDup(u"x")); },
           [] { return static_cast<void *>(AsciiStrDupToUnicode("x")); },
           [] { return static_cast<void *>(UnicodeStrDupToAscii(u"x")); }}) {
    HostPoolFailAfter(0); // the next allocation fails
    EXPECT_EQ(Allocate(), nullptr);
  }
  EFI_BOOT_SERVICES *Saved = gBS;
  gBS = nullptr;
  EXPECT_EQ(AllocatePool(8), nullptr);
  gBS = Saved;
  EXPECT_EQ(HostPoolOutstanding(), PoolAtStart);
}

TEST_F(BaseLibTest, CopyMemHandlesOverlapAndAlignment) {
  // Every placement of a block inside one buffer, both directions, with
  // source and destination at all relative alignments.
  for (UINTN Source = 0; Source < 12; Source++) {
    for (UINTN Destination = 0; Destination < 12; Destination++) {
      for (UINTN Length = 0; Length < 40; Length += 3) {
        UINT8 Ours[64], Expected[64];
        for (UINTN I = 0; I < sizeof(Ours); I++) {
          Ours[I] = Expected[I] = static_cast<UINT8>(I * 7 + 1);
        }
        CopyMem(Ours + Destination, Ours + Source, Length);
        memmove(Expected + Destination, Expected + Source, Length);
        ASSERT_EQ(memcmp(Ours, Expected, sizeof(Ours)), 0)
            << "source " << Source << " destination " << Destination << " length " << Length;
      }
    }
  }
}

TEST_F(BaseLibTest, BoundedCopiesComparisonsAndConversions) {
  char Narrow[6];
  AsciiStrCpyS(Narrow, sizeof(Narrow), "abcdefgh");
  EXPECT_STREQ(Narrow, "abcde");
  AsciiStrCpyS(Narrow, sizeof(Narrow), "ab");
  AsciiStrCatS(Narrow, sizeof(Narrow), "cdefg");
  EXPECT_STREQ(Narrow, "abcde");
  // A destination with no terminator inside its capacity is cut, not overrun.
  memset(Narrow, 'Z', sizeof(Narrow));
  AsciiStrCatS(Narrow, sizeof(Narrow), "x");
  EXPECT_EQ(AsciiStrnLen(Narrow, sizeof(Narrow)), 5u);
  char16_t Wide[4];
  StrCpyS(Wide, 4, u"a");
  StrCatS(Wide, 4, u"bcd");
  EXPECT_EQ(std::u16string(Wide), u"abc");

  // Characters and bytes compare as unsigned values.
  EXPECT_LT(AsciiStrCmp("a", "\xe9"), 0);
  EXPECT_LT(StrCmp(u"a", u"\u20ac"), 0);
  const UINT8 Low[2] = {1, 0x01}, High[2] = {1, 0xF0};
  EXPECT_LT(CompareMem(Low, High, 2), 0);
  EXPECT_NE(AsciiStrnCmp("CIF", "CIFS", 4), 0);
  const char16_t *Text = u"aaab:\\catalog";
  EXPECT_EQ(StrStr(Text, u"aab"), Text + 1); // after a false start
  EXPECT_EQ(StrStr(Text, u"catalogs"), nullptr);

  // Latin-1 widens without sign extension; beyond it narrows to '?'.
  UnicodeStrToAsciiS(u"\u20ac5 \u00e9t\u00e9!", Narrow, 6);
  EXPECT_STREQ(Narrow, "?5 \xe9t");
  char16_t *Dup = AsciiStrDupToUnicode("caf\xe9");
  char *Back = UnicodeStrDupToAscii(Dup);
  EXPECT_EQ(std::u16string(Dup), u"caf\u00e9");
  EXPECT_STREQ(Back, "caf\xe9");
  FreePool(Dup);
  FreePool(Back);
}

TEST_F(BaseLibTest, DecimalParseSaturates) {
  const struct {
    const char *Text;
    INT64 Value;
  } Cases[] = {{"42", 42},
               {" \t+4", 4},
               {"-12x9", -12},
               {"abc", 0},
               {"+-3", 0},
               {nullptr, 0},
               {"9223372036854775807", INT64_MAX},
               {"99999999999999999999999", INT64_MAX},
               {"-9223372036854775808", INT64_MIN},
               {"-99999999999999999999999", INT64_MIN}};
  for (const auto &Case : Cases) {
    EXPECT_EQ(AsciiStrDecimalToInt(Case.Text), Case.Value) << (Case.Text ? Case.Text : "null");
  }
}

} // namespace
