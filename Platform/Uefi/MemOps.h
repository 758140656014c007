// The byte-block primitives behind the image's memcpy, memmove, memset and
// memcmp. Plain loops: the image is built with -fno-builtin, so the compiler
// cannot turn them back into calls to the very functions they implement.
//
// Whole 64-bit words are moved while at least eight bytes remain; the
// fixed-size __builtin_memcpy only expresses an unaligned load or store and
// always compiles to a single move instruction.
#pragma once

#include <stddef.h>
#include <stdint.h>

namespace UefiMem {

inline uint64_t LoadWord(const uint8_t *Source) {
  uint64_t Word;
  __builtin_memcpy(&Word, Source, sizeof(Word));
  return Word;
}

inline void StoreWord(uint8_t *Destination, uint64_t Word) {
  __builtin_memcpy(Destination, &Word, sizeof(Word));
}

// Lowest address first. Safe for overlapping blocks when Destination lies
// below Source: every word is read before the store that could reach it.
inline void CopyForward(uint8_t *Destination, const uint8_t *Source, size_t Length) {
  while (Length >= sizeof(uint64_t)) {
    StoreWord(Destination, LoadWord(Source));
    Destination += sizeof(uint64_t);
    Source += sizeof(uint64_t);
    Length -= sizeof(uint64_t);
  }
  while (Length > 0) {
    *Destination++ = *Source++;
    Length--;
  }
}

// Highest address first, for overlapping blocks with Destination above Source.
inline void CopyBackward(uint8_t *Destination, const uint8_t *Source, size_t Length) {
  Destination += Length;
  Source += Length;
  while (Length >= sizeof(uint64_t)) {
    Destination -= sizeof(uint64_t);
    Source -= sizeof(uint64_t);
    Length -= sizeof(uint64_t);
    StoreWord(Destination, LoadWord(Source));
  }
  while (Length > 0) {
    *--Destination = *--Source;
    Length--;
  }
}

inline void Move(uint8_t *Destination, const uint8_t *Source, size_t Length) {
  // Unsigned distance: a destination below the source, or at least Length
  // bytes above it, can be copied front to back.
  const uintptr_t Distance =
      reinterpret_cast<uintptr_t>(Destination) - reinterpret_cast<uintptr_t>(Source);
  if (Distance >= Length) {
    CopyForward(Destination, Source, Length);
  } else {
    CopyBackward(Destination, Source, Length);
  }
}

inline void Fill(uint8_t *Destination, uint8_t Value, size_t Length) {
  const uint64_t Word = Value * 0x0101010101010101ULL;
  while (Length >= sizeof(uint64_t)) {
    StoreWord(Destination, Word);
    Destination += sizeof(uint64_t);
    Length -= sizeof(uint64_t);
  }
  while (Length > 0) {
    *Destination++ = Value;
    Length--;
  }
}

// Difference of the first differing bytes, taken as unsigned; 0 when equal.
inline int Compare(const uint8_t *A, const uint8_t *B, size_t Length) {
  for (size_t I = 0; I < Length; I++) {
    if (A[I] != B[I]) {
      return static_cast<int>(A[I]) - static_cast<int>(B[I]);
    }
  }
  return 0;
}

} // namespace UefiMem
