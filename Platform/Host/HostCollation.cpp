// Unicode Collation 2 of the hosted environment, on a handle of its own.
//
// Case mapping covers Basic Latin and Latin-1, which is what firmware's
// English collation covers. The language list starts with "eng" as a
// three-letter group of its own, so that a caller matching the first three
// letters of its language against each three-letter group finds it.
#include "HostCore.h"

namespace {

CHAR8 gSupportedLanguages[] = "eng;en";
EFI_HANDLE gCollationHandle = nullptr;

CHAR16 ToUpper(CHAR16 C) {
  if ((C >= u'a' && C <= u'z') || (C >= 0xE0 && C <= 0xFE && C != 0xF7)) {
    return static_cast<CHAR16>(C - 0x20);
  }
  return C == 0xFF ? static_cast<CHAR16>(0x178) : C;
}

CHAR16 ToLower(CHAR16 C) {
  if ((C >= u'A' && C <= u'Z') || (C >= 0xC0 && C <= 0xDE && C != 0xD7)) {
    return static_cast<CHAR16>(C + 0x20);
  }
  return C == 0x178 ? static_cast<CHAR16>(0xFF) : C;
}

INTN EFIAPI CollStriColl(EFI_UNICODE_COLLATION_PROTOCOL *, CHAR16 *Str1, CHAR16 *Str2) {
  const CHAR16 Empty[1] = {0};
  const CHAR16 *A = Str1 != nullptr ? Str1 : Empty;
  const CHAR16 *B = Str2 != nullptr ? Str2 : Empty;
  while (*A != 0 && ToUpper(*A) == ToUpper(*B)) {
    A++;
    B++;
  }
  return static_cast<INTN>(ToUpper(*A)) - static_cast<INTN>(ToUpper(*B));
}

// Matches one pattern element ('?', a "[...]" set or a literal) against C.
// Length receives the element's size; a set without its ']' matches nothing.
bool MatchElement(CHAR16 C, const CHAR16 *Pattern, size_t &Length) {
  CHAR16 Upper = ToUpper(C);
  if (*Pattern == u'?') {
    Length = 1;
    return true;
  }
  if (*Pattern != u'[') {
    Length = 1;
    return ToUpper(*Pattern) == Upper;
  }
  bool Found = false;
  const CHAR16 *P = Pattern + 1;
  while (*P != 0 && *P != u']') {
    CHAR16 Low = ToUpper(*P);
    CHAR16 High = Low;
    if (P[1] == u'-' && P[2] != 0 && P[2] != u']') {
      High = ToUpper(P[2]);
      P += 3;
    } else {
      P++;
    }
    Found = Found || (Upper >= Low && Upper <= High);
  }
  if (*P != u']') {
    Length = 0;
    return false;
  }
  Length = static_cast<size_t>(P + 1 - Pattern);
  return Found;
}

BOOLEAN EFIAPI CollMetaiMatch(EFI_UNICODE_COLLATION_PROTOCOL *, CHAR16 *String, CHAR16 *Pattern) {
  if (String == nullptr || Pattern == nullptr) {
    return FALSE;
  }
  const CHAR16 *S = String;
  const CHAR16 *P = Pattern;
  const CHAR16 *StarPattern = nullptr; // just after the last '*' met
  const CHAR16 *StarString = nullptr;  // where that '*' currently stops
  while (*S != 0) {
    size_t Length = 0;
    if (*P == u'*') {
      StarPattern = ++P;
      StarString = S;
    } else if (*P != 0 && MatchElement(*S, P, Length)) {
      S++;
      P += Length;
    } else if (StarPattern != nullptr) {
      P = StarPattern; // let the last '*' swallow one more character
      S = ++StarString;
    } else {
      return FALSE;
    }
  }
  while (*P == u'*') {
    P++;
  }
  return *P == 0 ? TRUE : FALSE;
}

void EFIAPI CollStrLwr(EFI_UNICODE_COLLATION_PROTOCOL *, CHAR16 *Str) {
  for (CHAR16 *P = Str; P != nullptr && *P != 0; P++) {
    *P = ToLower(*P);
  }
}

void EFIAPI CollStrUpr(EFI_UNICODE_COLLATION_PROTOCOL *, CHAR16 *Str) {
  for (CHAR16 *P = Str; P != nullptr && *P != 0; P++) {
    *P = ToUpper(*P);
  }
}

void EFIAPI CollFatToStr(EFI_UNICODE_COLLATION_PROTOCOL *, UINTN FatSize, CHAR8 *Fat,
                         CHAR16 *String) {
  if (String == nullptr) {
    return;
  }
  UINTN I = 0;
  for (; Fat != nullptr && I < FatSize && Fat[I] != 0; I++) {
    String[I] = static_cast<UINT8>(Fat[I]);
  }
  String[I] = 0;
}

bool FatValid(CHAR16 C) {
  if ((C >= u'A' && C <= u'Z') || (C >= u'a' && C <= u'z') || (C >= u'0' && C <= u'9')) {
    return true;
  }
  for (const char *P = "$%'-_@~`!(){}^#&"; *P != 0; P++) {
    if (C == static_cast<CHAR16>(*P)) {
      return true;
    }
  }
  return false;
}

// Periods and spaces are dropped; characters a FAT name cannot hold become
// '_', and the result then says that the conversion was lossy.
BOOLEAN EFIAPI CollStrToFat(EFI_UNICODE_COLLATION_PROTOCOL *, CHAR16 *String, UINTN FatSize,
                            CHAR8 *Fat) {
  bool Substituted = false;
  for (const CHAR16 *S = String; S != nullptr && Fat != nullptr && *S != 0 && FatSize != 0; S++) {
    if (*S == u'.' || *S == u' ') {
      continue;
    }
    if (FatValid(*S)) {
      *Fat++ = static_cast<CHAR8>(ToUpper(*S));
    } else {
      *Fat++ = '_';
      Substituted = true;
    }
    FatSize--;
  }
  return Substituted ? TRUE : FALSE;
}

EFI_UNICODE_COLLATION_PROTOCOL gCollation = {CollStriColl,       CollMetaiMatch, CollStrLwr,
                                             CollStrUpr,         CollFatToStr,   CollStrToFat,
                                             gSupportedLanguages};

} // namespace

void HostCollationInstall() {
  gCollationHandle = nullptr;
  HostSystemTable()->BootServices->InstallProtocolInterface(
      &gCollationHandle, &gEfiUnicodeCollation2ProtocolGuid, EFI_NATIVE_INTERFACE, &gCollation);
}

void HostCollationUninstall() {
  if (gCollationHandle != nullptr) {
    HostSystemTable()->BootServices->UninstallProtocolInterface(
        gCollationHandle, &gEfiUnicodeCollation2ProtocolGuid, &gCollation);
    gCollationHandle = nullptr;
  }
}
