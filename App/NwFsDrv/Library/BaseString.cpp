// 8-bit and UCS-2 string helpers. Each operation is written once as a
// template over the character type; the exported names are thin wrappers.
//
// Null pointers are tolerated everywhere: a null string reads as empty and a
// null destination is left alone, so a caller's missing check costs a wrong
// answer rather than a fault.
#include "Library/CharCode.h"
#include "NwBaseLib.h"

namespace {

template <typename TChar>
UINTN Length(const TChar *S, UINTN Max) {
  UINTN N = 0;
  if (S != nullptr) {
    while (N < Max && S[N] != 0) {
      N++;
    }
  }
  return N;
}

constexpr UINTN Unbounded = ~static_cast<UINTN>(0);

template <typename TChar>
INTN Compare(const TChar *A, const TChar *B, UINTN Max) {
  static constexpr TChar Empty[1] = {0};
  A = A != nullptr ? A : Empty;
  B = B != nullptr ? B : Empty;
  for (UINTN I = 0; I < Max; I++) {
    if (A[I] != B[I] || A[I] == 0) {
      return static_cast<INTN>(CharCode(A[I])) - static_cast<INTN>(CharCode(B[I]));
    }
  }
  return 0;
}

template <typename TChar>
void CopyBounded(TChar *Destination, UINTN DestMax, const TChar *Source) {
  if (Destination == nullptr || DestMax == 0) {
    return;
  }
  const UINTN N = Length(Source, DestMax - 1);
  for (UINTN I = 0; I < N; I++) {
    Destination[I] = Source[I];
  }
  Destination[N] = 0;
}

template <typename TChar>
void CatBounded(TChar *Destination, UINTN DestMax, const TChar *Source) {
  if (Destination == nullptr || DestMax == 0) {
    return;
  }
  const UINTN Used = Length(Destination, DestMax);
  if (Used == DestMax) {
    // Not terminated within its capacity: terminate it, append nothing.
    Destination[DestMax - 1] = 0;
    return;
  }
  CopyBounded(Destination + Used, DestMax - Used, Source);
}

template <typename TChar>
const TChar *Find(const TChar *String, const TChar *Search) {
  if (String == nullptr || Search == nullptr) {
    return nullptr;
  }
  const UINTN SearchLength = Length(Search, Unbounded);
  for (; *String != 0 || SearchLength == 0; String++) {
    if (Compare(String, Search, SearchLength) == 0) {
      return String;
    }
  }
  return nullptr;
}

template <typename TChar>
TChar *Duplicate(const TChar *Source) {
  if (Source == nullptr) {
    return nullptr;
  }
  const UINTN Bytes = (Length(Source, Unbounded) + 1) * sizeof(TChar);
  return static_cast<TChar *>(AllocateCopyPool(Bytes, Source));
}

// Character conversion: Latin-1 widens as is; anything above 0xFF narrows to
// '?'.
CHAR16 Widen(CHAR8 C) {
  return static_cast<CHAR16>(static_cast<UINT8>(C));
}
CHAR8 Narrow(CHAR16 C) {
  return C > 0xFF ? '?' : static_cast<CHAR8>(C);
}

template <typename TFrom, typename TTo, TTo (*Convert)(TFrom)>
void ConvertBounded(const TFrom *Source, TTo *Destination, UINTN DestMax) {
  if (Destination == nullptr || DestMax == 0) {
    return;
  }
  const UINTN N = Length(Source, DestMax - 1);
  for (UINTN I = 0; I < N; I++) {
    Destination[I] = Convert(Source[I]);
  }
  Destination[N] = 0;
}

template <typename TFrom, typename TTo, TTo (*Convert)(TFrom)>
TTo *ConvertDuplicate(const TFrom *Source) {
  if (Source == nullptr) {
    return nullptr;
  }
  const UINTN Chars = Length(Source, Unbounded) + 1;
  TTo *Copy = static_cast<TTo *>(AllocatePool(Chars * sizeof(TTo)));
  ConvertBounded<TFrom, TTo, Convert>(Source, Copy, Chars);
  return Copy;
}

bool IsSpace(CHAR8 C) {
  return C == ' ' || (C >= '\t' && C <= '\r');
}

} // namespace

// ---------------------------------------------------------------------------
// 8-bit
// ---------------------------------------------------------------------------
UINTN AsciiStrLen(const CHAR8 *String) {
  return Length(String, Unbounded);
}
UINTN AsciiStrnLen(const CHAR8 *String, UINTN MaxLength) {
  return Length(String, MaxLength);
}
INTN AsciiStrCmp(const CHAR8 *A, const CHAR8 *B) {
  return Compare(A, B, Unbounded);
}
INTN AsciiStrnCmp(const CHAR8 *A, const CHAR8 *B, UINTN Length) {
  return Compare(A, B, Length);
}
void AsciiStrCpyS(CHAR8 *Destination, UINTN DestMax, const CHAR8 *Source) {
  CopyBounded(Destination, DestMax, Source);
}
void AsciiStrCatS(CHAR8 *Destination, UINTN DestMax, const CHAR8 *Source) {
  CatBounded(Destination, DestMax, Source);
}

const CHAR8 *AsciiStrChr(const CHAR8 *String, CHAR8 Character) {
  if (String == nullptr) {
    return nullptr;
  }
  for (;; String++) {
    if (*String == Character) {
      return String;
    }
    if (*String == 0) {
      return nullptr;
    }
  }
}

INT64 AsciiStrDecimalToInt(const CHAR8 *String) {
  if (String == nullptr) {
    return 0;
  }
  while (IsSpace(*String)) {
    String++;
  }
  const bool Negative = *String == '-';
  if (*String == '-' || *String == '+') {
    String++;
  }
  // Saturates at the INT64 range instead of wrapping.
  constexpr UINT64 Limit = 0x8000000000000000ULL;
  UINT64 Magnitude = 0;
  for (; *String >= '0' && *String <= '9'; String++) {
    const UINT64 Digit = static_cast<UINT64>(*String - '0');
    Magnitude = Magnitude > (Limit - Digit) / 10 ? Limit : Magnitude * 10 + Digit;
  }
  if (Negative) {
    return Magnitude == Limit ? static_cast<INT64>(-0x7FFFFFFFFFFFFFFFLL - 1)
                              : -static_cast<INT64>(Magnitude);
  }
  return Magnitude >= Limit ? 0x7FFFFFFFFFFFFFFFLL : static_cast<INT64>(Magnitude);
}

// ---------------------------------------------------------------------------
// UCS-2
// ---------------------------------------------------------------------------
UINTN StrLen(const CHAR16 *String) {
  return Length(String, Unbounded);
}
UINTN StrnLen(const CHAR16 *String, UINTN MaxLength) {
  return Length(String, MaxLength);
}
INTN StrCmp(const CHAR16 *A, const CHAR16 *B) {
  return Compare(A, B, Unbounded);
}
INTN StrnCmp(const CHAR16 *A, const CHAR16 *B, UINTN Length) {
  return Compare(A, B, Length);
}
void StrCpyS(CHAR16 *Destination, UINTN DestMax, const CHAR16 *Source) {
  CopyBounded(Destination, DestMax, Source);
}
void StrCatS(CHAR16 *Destination, UINTN DestMax, const CHAR16 *Source) {
  CatBounded(Destination, DestMax, Source);
}
const CHAR16 *StrStr(const CHAR16 *String, const CHAR16 *SearchString) {
  return Find(String, SearchString);
}
CHAR16 *StrDup(const CHAR16 *String) {
  return Duplicate(String);
}

namespace {
template <typename TChar>
void FreeCleared(TChar *String) {
  if (String != nullptr) {
    ZeroMem(String, (Length(String, Unbounded) + 1) * sizeof(TChar));
    FreePool(String);
  }
}
} // namespace

void FreeClearedStr(CHAR16 *String) {
  FreeCleared(String);
}
void FreeClearedAsciiStr(CHAR8 *String) {
  FreeCleared(String);
}

// ---------------------------------------------------------------------------
// Conversions
// ---------------------------------------------------------------------------
void UnicodeStrToAsciiS(const CHAR16 *Source, CHAR8 *Destination, UINTN DestMax) {
  ConvertBounded<CHAR16, CHAR8, Narrow>(Source, Destination, DestMax);
}
CHAR16 *AsciiStrDupToUnicode(const CHAR8 *Source) {
  return ConvertDuplicate<CHAR8, CHAR16, Widen>(Source);
}
CHAR8 *UnicodeStrDupToAscii(const CHAR16 *Source) {
  return ConvertDuplicate<CHAR16, CHAR8, Narrow>(Source);
}

UINTN strtoUTF16(void *Out, const CHAR8 *Text, UINTN Maximum, const CHAR8 *Codepage) {
  (void)Codepage; // "default" is the only character set: Latin-1, one byte per character
  if (Out == nullptr || Text == nullptr) {
    return 0;
  }
  UINT8 *Bytes = static_cast<UINT8 *>(Out);
  UINTN Count = 0;
  while (Count < Maximum && Text[Count] != '\0') {
    Bytes[Count * 2] = static_cast<UINT8>(Text[Count]);
    Bytes[Count * 2 + 1] = 0;
    Count++;
  }
  return Count;
}
