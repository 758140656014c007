// Parsing of numeric IP address text, as inet_pton does it: IPv4 in
// dotted-quad form and IPv6 in the RFC 4291 text forms (with "::"
// compression and a trailing embedded IPv4 address). Pure code, shared by
// every platform that has no parser of its own.
#pragma once

#include <stdint.h>

// Four decimal numbers 0-255 separated by dots, nothing before or after; a
// number may not carry a leading zero (so "010" is refused rather than read
// as octal or decimal). On success Address receives the four bytes in network
// order; on failure it is left untouched.
bool NwParseInet4(const char *Text, uint8_t Address[4]);

// Up to eight groups of one to four hex digits separated by colons, one "::"
// standing for one or more zero groups, and optionally a dotted-quad IPv4
// address in place of the last two groups. No zone suffix, no brackets. On
// success Address receives the sixteen bytes in network order; on failure it
// is left untouched.
bool NwParseInet6(const char *Text, uint8_t Address[16]);
