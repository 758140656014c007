// Freestanding helpers shared by the whole image: the firmware tables, pool
// memory, 8-bit and UCS-2 strings, and the project's own formatter.
//
// The image has no C library. Everything here is written against the boot
// services table and plain loops, so it behaves the same in firmware and in
// the hosted environment.
#pragma once

#include "Uefi.h"

// ---------------------------------------------------------------------------
// Firmware tables, kept by the image entry for every module.
// ---------------------------------------------------------------------------
extern EFI_HANDLE gImageHandle;
extern EFI_SYSTEM_TABLE *gST;
extern EFI_BOOT_SERVICES *gBS;
extern EFI_RUNTIME_SERVICES *gRT;

// ---------------------------------------------------------------------------
// Pool memory (boot-services data). Null when the pool is exhausted or the
// tables are not set.
// ---------------------------------------------------------------------------
void *AllocatePool(UINTN Size);
void *AllocateZeroPool(UINTN Size);
void *AllocateCopyPool(UINTN Size, const void *Source);
void FreePool(void *Buffer); // accepts null

void CopyMem(void *Destination, const void *Source, UINTN Length); // overlap-safe
void SetMem(void *Buffer, UINTN Length, UINT8 Value);
void ZeroMem(void *Buffer, UINTN Length);
INTN CompareMem(const void *A, const void *B, UINTN Length);

// ---------------------------------------------------------------------------
// 8-bit strings
// ---------------------------------------------------------------------------
UINTN AsciiStrLen(const CHAR8 *String);
UINTN AsciiStrnLen(const CHAR8 *String, UINTN MaxLength);
INTN AsciiStrCmp(const CHAR8 *A, const CHAR8 *B);
INTN AsciiStrnCmp(const CHAR8 *A, const CHAR8 *B, UINTN Length);
// Copies at most DestMax - 1 characters and always terminates (DestMax > 0).
void AsciiStrCpyS(CHAR8 *Destination, UINTN DestMax, const CHAR8 *Source);
void AsciiStrCatS(CHAR8 *Destination, UINTN DestMax, const CHAR8 *Source);
const CHAR8 *AsciiStrChr(const CHAR8 *String, CHAR8 Character);
// Decimal parse: leading white space, optional sign, digits.
INT64 AsciiStrDecimalToInt(const CHAR8 *String);

// ---------------------------------------------------------------------------
// UCS-2 strings
// ---------------------------------------------------------------------------
UINTN StrLen(const CHAR16 *String);
UINTN StrnLen(const CHAR16 *String, UINTN MaxLength);
INTN StrCmp(const CHAR16 *A, const CHAR16 *B);
INTN StrnCmp(const CHAR16 *A, const CHAR16 *B, UINTN Length);
void StrCpyS(CHAR16 *Destination, UINTN DestMax, const CHAR16 *Source);
void StrCatS(CHAR16 *Destination, UINTN DestMax, const CHAR16 *Source);
const CHAR16 *StrStr(const CHAR16 *String, const CHAR16 *SearchString);
CHAR16 *StrDup(const CHAR16 *String); // pool copy, null on failure
// Pool strings that may hold a secret: every character, the terminator
// included, is cleared before the block goes back to the pool. Null is fine.
void FreeClearedStr(CHAR16 *String);
void FreeClearedAsciiStr(CHAR8 *String);

// Conversions. The 8-bit side is taken as Latin-1; UCS-2 characters above
// 0xFF narrow to '?'. Both always terminate within DestMax characters.
void UnicodeStrToAsciiS(const CHAR16 *Source, CHAR8 *Destination, UINTN DestMax);
CHAR16 *AsciiStrDupToUnicode(const CHAR8 *Source); // pool, length + 1 characters
CHAR8 *UnicodeStrDupToAscii(const CHAR16 *Source); // pool, length + 1 characters
// 8-bit text in the "default" character set (Latin-1) to UTF-16LE bytes, the
// conversion every name on the wire goes through. Writes at most Maximum
// characters (no terminator) and returns the count written.
UINTN strtoUTF16(void *Out, const CHAR8 *Text, UINTN Maximum, const CHAR8 *Codepage);

// ---------------------------------------------------------------------------
// Formatter
//
// printf-style, with the forms the system's texts use. One engine serves the
// three outputs (8-bit buffer, UCS-2 buffer, console), so the firmware and
// the hosted build print the same characters for the same call.
//
// Strings. The width of %s follows the format string: in an 8-bit format %s
// takes an 8-bit string, in a UCS-2 format (UnicodeSPrint, DiagLogW) it takes
// a UCS-2 string. In either kind of format %a and %hs take an 8-bit string
// and %ls and %S a UCS-2 string. A null string prints "(null)". UCS-2
// characters above 0xFF print as '?' in 8-bit output.
//
// Integers: %d %i %u %x %X %o with the flags '-' '0' '+' ' ' '#', width and
// precision (also '*') as in C. Length modifiers: none (int), h (short), hh
// (char), and l, ll, z, j, t, which all take a 64-bit argument. Note that l is
// 64-bit here although UEFI x64 is LLP64: the texts pass 64-bit values with
// %ld and %lx, so every %l... argument must be a 64-bit value.
//
// Others: %c (an int, printed as one character), %p ("0x" and the pointer in
// lower-case hex), %pI4 and %pI6 (an IPv4 or IPv6 address from a pointer to
// its 4 or 16 bytes in network order; IPv6 in the compressed form of
// RFC 5952, as inet_ntop writes it), %% (a percent sign). A conversion the
// formatter does not know is printed verbatim, as is a '%' at the end.
//
// Output is always terminated when the buffer has room for at least the
// terminator; the return value is the count of characters stored, without the
// terminator (output beyond the buffer is dropped).
// ---------------------------------------------------------------------------
UINTN AsciiVSPrint(CHAR8 *Buffer, UINTN BufferSize, const CHAR8 *Format, va_list Args);
UINTN AsciiSPrint(CHAR8 *Buffer, UINTN BufferSize, const CHAR8 *Format, ...);
// UCS-2 output from an 8-bit format.
UINTN UnicodeSPrintAsciiFormat(CHAR16 *Buffer, UINTN BufferChars, const CHAR8 *Format, ...);
// UCS-2 output from a UCS-2 format.
UINTN UnicodeSPrint(CHAR16 *Buffer, UINTN BufferChars, const CHAR16 *Format, ...);
