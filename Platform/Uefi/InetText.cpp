#include "InetText.h"

namespace {

constexpr uint32_t kIpv6Groups = 8;

bool IsDigit(char C) {
  return C >= '0' && C <= '9';
}

// Value of a hex digit, or -1.
int HexValue(char C) {
  if (C >= '0' && C <= '9') {
    return C - '0';
  }
  if (C >= 'a' && C <= 'f') {
    return C - 'a' + 10;
  }
  if (C >= 'A' && C <= 'F') {
    return C - 'A' + 10;
  }
  return -1;
}

// Dotted quad from Text up to its terminating NUL.
bool ParseDottedQuad(const char *Text, uint8_t Out[4]) {
  const char *P = Text;
  for (uint32_t Part = 0; Part < 4; Part++) {
    if (Part > 0) {
      if (*P != '.') {
        return false;
      }
      P++;
    }
    if (!IsDigit(*P)) {
      return false;
    }
    if (*P == '0' && IsDigit(P[1])) {
      return false; // leading zero
    }
    uint32_t Value = 0;
    uint32_t Digits = 0;
    while (IsDigit(*P)) {
      Value = Value * 10 + static_cast<uint32_t>(*P - '0');
      Digits++;
      P++;
      if (Digits > 3 || Value > 255) {
        return false;
      }
    }
    Out[Part] = static_cast<uint8_t>(Value);
  }
  return *P == '\0';
}

// True when an IPv4 address starts at P: digits running into a '.' before
// any colon or the end.
bool Ipv4Follows(const char *P) {
  while (IsDigit(*P)) {
    P++;
  }
  return *P == '.';
}

} // namespace

bool NwParseInet4(const char *Text, uint8_t Address[4]) {
  if (Text == nullptr || Address == nullptr) {
    return false;
  }
  uint8_t Bytes[4];
  if (!ParseDottedQuad(Text, Bytes)) {
    return false;
  }
  for (uint32_t I = 0; I < 4; I++) {
    Address[I] = Bytes[I];
  }
  return true;
}

bool NwParseInet6(const char *Text, uint8_t Address[16]) {
  if (Text == nullptr || Address == nullptr) {
    return false;
  }
  uint16_t Groups[kIpv6Groups] = {};
  uint32_t Count = 0; // groups written so far
  int32_t GapAt = -1; // group index where "::" stands, or -1
  const char *P = Text;

  if (*P == ':') {
    // Only "::" may start an address.
    if (P[1] != ':') {
      return false;
    }
    GapAt = 0;
    P += 2;
  }

  while (*P != '\0') {
    if (Count == kIpv6Groups) {
      return false; // too many groups
    }
    if (Ipv4Follows(P)) {
      // The embedded IPv4 address fills the last two groups and ends the text.
      if (Count + 2 > kIpv6Groups) {
        return false;
      }
      uint8_t V4[4];
      if (!ParseDottedQuad(P, V4)) {
        return false;
      }
      Groups[Count++] = static_cast<uint16_t>(V4[0] << 8 | V4[1]);
      Groups[Count++] = static_cast<uint16_t>(V4[2] << 8 | V4[3]);
      break;
    }
    uint32_t Value = 0;
    uint32_t Digits = 0;
    int Digit;
    while ((Digit = HexValue(*P)) >= 0) {
      if (++Digits > 4) {
        return false;
      }
      Value = Value << 4 | static_cast<uint32_t>(Digit);
      P++;
    }
    if (Digits == 0) {
      return false; // empty group or a character that is no hex digit
    }
    Groups[Count++] = static_cast<uint16_t>(Value);
    if (*P == '\0') {
      break;
    }
    if (*P != ':') {
      return false;
    }
    P++;
    if (*P == ':') {
      if (GapAt >= 0) {
        return false; // a second "::"
      }
      GapAt = static_cast<int32_t>(Count);
      P++;
    } else if (*P == '\0') {
      return false; // a single trailing colon
    }
  }

  if (GapAt < 0) {
    if (Count != kIpv6Groups) {
      return false;
    }
  } else {
    // "::" stands for at least one zero group: move the groups after it to
    // the end.
    if (Count == kIpv6Groups) {
      return false;
    }
    const uint32_t Tail = Count - static_cast<uint32_t>(GapAt);
    const uint32_t Shift = kIpv6Groups - Count;
    for (uint32_t I = 0; I < Tail; I++) {
      const uint32_t From = Count - 1 - I;
      Groups[From + Shift] = Groups[From];
      Groups[From] = 0;
    }
  }

  for (uint32_t I = 0; I < kIpv6Groups; I++) {
    Address[2 * I] = static_cast<uint8_t>(Groups[I] >> 8);
    Address[2 * I + 1] = static_cast<uint8_t>(Groups[I]);
  }
  return true;
}
