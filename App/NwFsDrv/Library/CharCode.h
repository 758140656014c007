// Character helpers shared by the string functions and the formatter.
#pragma once

#include "Uefi.h"

// A character's code as an unsigned value, whatever the character type.
template <typename TChar>
constexpr UINT32 CharCode(TChar C) {
  if constexpr (sizeof(TChar) == 1) {
    return static_cast<UINT8>(C);
  } else {
    return static_cast<UINT16>(C);
  }
}

// Stores a character code in a character type: the 8-bit side is Latin-1, so
// anything that does not fit narrows to '?' (as does anything beyond UCS-2).
template <typename TChar>
constexpr TChar CharFromCode(UINT32 Code) {
  constexpr UINT32 Largest = sizeof(TChar) == 1 ? 0xFF : 0xFFFF;
  return static_cast<TChar>(Code > Largest ? '?' : Code);
}
