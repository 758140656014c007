// Pool, memory and string helpers, with a boot-services table whose pool is
// the C heap and counts what is outstanding.
#include "NwBaseLib.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <string>

namespace {

int gOutstanding;
int gAllocations;
bool gFailAllocations;

EFI_STATUS EFIAPI FakeAllocatePool(EFI_MEMORY_TYPE Type, UINTN Size, void **Buffer) {
  gAllocations++;
  EXPECT_EQ(Type, EfiBootServicesData);
  if (gFailAllocations) {
    return EFI_OUT_OF_RESOURCES;
  }
  *Buffer = malloc(Size == 0 ? 1 : Size);
  gOutstanding++;
  return EFI_SUCCESS;
}

EFI_STATUS EFIAPI FakeFreePool(void *Buffer) {
  free(Buffer);
  gOutstanding--;
  return EFI_SUCCESS;
}

class BaseLibTest : public ::testing::Test {
protected:
  void SetUp() override {
    memset(&Services, 0, sizeof(Services));
    Services.AllocatePool = FakeAllocatePool;
    Services.FreePool = FakeFreePool;
    gBS = &Services;
    gOutstanding = gAllocations = 0;
    gFailAllocations = false;
  }
  void TearDown() override {
    gBS = SavedBS;
    EXPECT_EQ(gOutstanding, 0) << "pool blocks leaked";
  }
  EFI_BOOT_SERVICES Services;
  EFI_BOOT_SERVICES *SavedBS = gBS;
};

TEST_F(BaseLibTest, Pool) {
  UINT8 *Zeroed = static_cast<UINT8 *>(AllocateZeroPool(100));
  ASSERT_NE(Zeroed, nullptr);
  EXPECT_EQ(std::string(Zeroed, Zeroed + 100), std::string(100, '\0'));
  char *Copy = static_cast<char *>(AllocateCopyPool(8, "copy me"));
  ASSERT_NE(Copy, nullptr);
  EXPECT_STREQ(Copy, "copy me");
  FreePool(Zeroed);
  FreePool(Copy);
  FreePool(nullptr);

  gFailAllocations = true;
  EXPECT_EQ(AllocateZeroPool(8), nullptr);
  EXPECT_EQ(StrDup(u"x"), nullptr);
  EXPECT_EQ(AsciiStrDupToUnicode("x"), nullptr);
  EXPECT_EQ(UnicodeStrDupToAscii(u"x"), nullptr);
  gBS = nullptr;
  EXPECT_EQ(AllocatePool(8), nullptr);
  FreePool(&gOutstanding); // no table: nothing is called
  EXPECT_EQ(gAllocations, 6);
}

TEST_F(BaseLibTest, CopyMemHandlesOverlapAndAlignment) {
  // Every placement of a block inside one buffer, both directions, with
  // source and destination at all relative alignments.
  for (UINTN Source = 0; Source < 12; Source++) {
    for (UINTN Destination = 0; Destination < 12; Destination++) {
      for (UINTN Length = 0; Length < 40; Length += 3) {
        UINT8 Ours[64];
        UINT8 Expected[64];
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

TEST_F(BaseLibTest, BoundedCopiesAlwaysTerminate) {
  char Narrow[6];
  AsciiStrCpyS(Narrow, sizeof(Narrow), "abcdefgh");
  EXPECT_STREQ(Narrow, "abcde");
  AsciiStrCpyS(Narrow, 1, "abc");
  EXPECT_STREQ(Narrow, "");
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
}

TEST_F(BaseLibTest, ComparisonsAndSearches) {
  // Characters and bytes compare as unsigned values.
  EXPECT_LT(AsciiStrCmp("a", "\xe9"), 0);
  EXPECT_LT(StrCmp(u"a", u"\u20ac"), 0);
  const UINT8 Low[2] = {1, 0x01};
  const UINT8 High[2] = {1, 0xF0};
  EXPECT_LT(CompareMem(Low, High, 2), 0);
  EXPECT_EQ(CompareMem(Low, High, 1), 0);
  EXPECT_GT(AsciiStrCmp("abcd", "abc"), 0);
  EXPECT_EQ(AsciiStrnCmp("CIFS:x", "CIFS", 4), 0);
  EXPECT_NE(AsciiStrnCmp("CIF", "CIFS", 4), 0);
  EXPECT_EQ(StrnCmp(u"NFS1", u"NFS2", 3), 0);

  const char *Haystack = "aaab:\\catalog";
  EXPECT_EQ(AsciiStrChr(Haystack, ':'), Haystack + 4);
  EXPECT_EQ(AsciiStrChr(Haystack, '\0'), Haystack + 13);
  const char16_t *Wide = u"aaab:\\catalog";
  EXPECT_EQ(StrStr(Wide, u"aab"), Wide + 1); // after a false start
  EXPECT_EQ(StrStr(Wide, u"catalogs"), nullptr);
  EXPECT_EQ(StrStr(Wide, u""), Wide);
}

TEST_F(BaseLibTest, DecimalParse) {
  const struct {
    const char *Text;
    INT64 Value;
  } Cases[] = {{"42", 42},
               {" \t+4", 4},
               {"-12x9", -12},
               {"abc", 0},
               {"+-3", 0},
               {"", 0},
               {nullptr, 0},
               {"9223372036854775807", INT64_MAX},
               {"99999999999999999999999", INT64_MAX},
               {"-9223372036854775808", INT64_MIN},
               {"-99999999999999999999999", INT64_MIN}};
  for (const auto &Case : Cases) {
    EXPECT_EQ(AsciiStrDecimalToInt(Case.Text), Case.Value) << (Case.Text ? Case.Text : "null");
  }
}

TEST_F(BaseLibTest, Conversions) {
  char Narrow[8];
  UnicodeStrToAsciiS(u"\u20ac5 \u00e9t\u00e9!", Narrow, 6);
  EXPECT_STREQ(Narrow, "?5 \xe9t");

  char16_t *Dup = AsciiStrDupToUnicode("ramfs:\\caf\xe9.xml");
  char *Back = UnicodeStrDupToAscii(Dup);
  char16_t *Copy = StrDup(Dup);
  ASSERT_TRUE(Dup != nullptr && Back != nullptr && Copy != nullptr);
  EXPECT_EQ(std::u16string(Dup), u"ramfs:\\caf\u00e9.xml"); // Latin-1, not sign-extended
  EXPECT_STREQ(Back, "ramfs:\\caf\xe9.xml");
  EXPECT_EQ(std::u16string(Copy), std::u16string(Dup));
  FreePool(Dup);
  FreePool(Back);
  FreePool(Copy);
}

} // namespace
